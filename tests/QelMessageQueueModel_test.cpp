// Every order in which the threads of a queue can run, for a number of small programs. It is the queue's own source
// text that runs here, compiled against modelled mutexes and condition variables: what is checked is the code, not a
// drawing of it.

// Whatever that text includes comes first, and as it is.
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageQueueStatistics.hpp>
#include <qel/common/util/BitmaskEnum.hpp>
#include <qel/common/util/CallsInFlight.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "LogLine.hpp"
#include "support/Interleavings.hpp"
#include "support/ModelledSync.hpp"
#include "support/SizedMessage.hpp"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <new>
#include <ostream>
#include <queue>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#define QelMessageQueue ModelledMessageQueue
#define Mutex ModelledMutex
#define MutexLock ModelledMutexLock
#define UniqueMutexLock ModelledUniqueMutexLock
#define ConditionVariable ModelledConditionVariable
#define CallsInFlight ModelledCallsInFlight
#define Waiters ModelledWaiters
#if defined(__clang__)
#pragma clang diagnostic ignored "-Wkeyword-macro"
#endif
#define private public // the state of a queue is what tells one situation from another
#include <qel/common/QelMessageQueue.hpp>

#include "QelMessageQueue.cpp"
#undef QelMessageQueue
#undef Mutex
#undef MutexLock
#undef UniqueMutexLock
#undef ConditionVariable
#undef CallsInFlight
#undef Waiters
#undef private

namespace qel {
namespace {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using test::Interleavings;
using test::sized;
using testing::HasSubstr;
using testing::IsEmpty;
using Queue = ModelledMessageQueue;
using Fault = Interleavings::Fault;

constexpr MessageQueuingOptions kDefault = MessageQueuingOptions::DEFAULT;
constexpr MessageQueuingOptions kNormal = MessageQueuingOptions::BLOCKING;
constexpr MessageQueuingOptions kLow = MessageQueuingOptions::BLOCKING | MessageQueuingOptions::LOW_PRIORITY;
constexpr milliseconds kNoEnd = milliseconds::max();

/// Time stands still, and a thread can be made to fail at its next reading but so many.
class StandingClock : public TimeProvider {
public:
    StandingClock() { pRegister(); }
    void failAfter(int readings)
    {
        mThread = Interleavings::thread();
        mLeft = readings;
    }

private:
    std::chrono::system_clock::time_point pSystem() override { return {}; }
    std::chrono::steady_clock::time_point pSteady() override
    {
        if (mLeft >= 0 && Interleavings::thread() == mThread && mLeft-- == 0) throw std::runtime_error("clock");
        return {};
    }

    std::size_t mThread = 0;
    int mLeft = -1;
};

/// A queue with threads around it, and what must hold whatever they do.
class QueueProgram : public Interleavings::Program {
public:
    explicit QueueProgram(std::size_t sizeLimit) { new (&mStorage) Queue(sizeLimit); }
    ~QueueProgram() override
    {
        if (mAlive) queue().~Queue();
    }

    void describe(std::string& state) const override
    {
        describeWhatThreadsSee(state);
        state += mShutdownReturned ? 's' : 'r';
        for (const std::vector<unsigned int>& received : mReceived) {
            state += '|';
            for (const unsigned int numbers : received)
                state += std::to_string(numbers) + ',';
        }
        state += '|';
        for (const unsigned int numbers : mAccepted)
            state += std::to_string(numbers) + ',';
        state += std::to_string(mFailures) + '|' + std::to_string(mShutdownsThatWoke);
    }

    void describeWhatThreadsSee(std::string& state) const override
    {
        if (!mAlive) return;
        state += queue().mShutdown ? 'S' : 'R';
        for (const Queue::QueueEntry& entry : pEntries()) {
            state += std::to_string(entry.mMessage->getCallerId()) + ',';
        }
        for (const ModelledWaiters* waiters :
             {&queue().mDequeueWaiter, &queue().mNormalPriorityLimiter.mWaiter, &queue().mLowPriorityLimiter.mWaiter}) {
            state += ' ' + std::to_string(waiters->mWaiting) + '-' + std::to_string(waiters->mClaimed);
        }
    }

    void atRest() override
    {
        if (!mAlive) return;
        pCheckSleepers();
        pCheckMessages();
    }

    void giveUp() override
    {
        if (mAlive) queue().shutdown();
    }

protected:
    enum class Role { Producer, Consumer, Other };
    using Woken = std::vector<const void*>; // condition variables at which threads were woken, in order

    static constexpr unsigned int kMostNumbers = 32; // messages of a producer
    static constexpr unsigned int kOthers = 0xFFFF;  // the caller id of messages that are not counted
    static constexpr std::uint64_t kEnd = 1000;      // the place of a thread that has done its work

    Queue& queue() { return *std::launder(reinterpret_cast<Queue*>(&mStorage)); }
    const Queue& queue() const { return *std::launder(reinterpret_cast<const Queue*>(&mStorage)); }

    /// Puts messages of the given lengths in. Their caller ids tell thread and number.
    void addProducer(MessageQueuingOptions options, const std::vector<unsigned int>& lengths, int failsAfter = -1)
    {
        const auto mine = static_cast<unsigned int>(threads.size());
        pAdd(Role::Producer, [this, mine, options, lengths, failsAfter] {
            const Woken consumer = {&queue().mDequeueWaiter.mCondition};
            for (unsigned int i = 0; i < lengths.size(); ++i) {
                const bool over = mShutdownReturned;
                Interleavings::here(2 * i + over);
                if (failsAfter >= 0) mClock.failAfter(failsAfter);
                try {
                    const auto result = queue().enqueue(sized(lengths[i], mine * kMostNumbers + i), options);
                    pCheckWoken(result == Queue::OK, consumer);
                    if (over && result != Queue::SHUTDOWN) Interleavings::fail("a message was taken in after shutdown");
                    if (result == Queue::SHUTDOWN) break;
                    if (result == Queue::OK) mAccepted[mine] |= 1U << i;
                } catch (const std::runtime_error&) {
                    ++mFailures;
                }
            }
            Interleavings::here(kEnd);
        });
    }

    /// Takes a message for each of the timeouts. Ends early when there is none.
    void addConsumer(const std::vector<milliseconds>& timeouts, int failsAfter = -1)
    {
        const auto mine = static_cast<unsigned int>(threads.size());
        pAdd(Role::Consumer, [this, mine, timeouts, failsAfter] {
            for (unsigned int i = 0; i < timeouts.size(); ++i) {
                if (failsAfter >= 0) mClock.failAfter(failsAfter);
                try {
                    if (!pReceive(mine, i, timeouts[i])) break;
                } catch (const std::runtime_error&) {
                    ++mFailures;
                }
            }
            Interleavings::here(kEnd);
        });
    }

    /// Takes messages until there is none.
    void addConsumerToTheEnd(const milliseconds& timeout = kNoEnd)
    {
        const auto mine = static_cast<unsigned int>(threads.size());
        pAdd(Role::Consumer, [this, mine, timeout] {
            while (pReceive(mine, 0, timeout)) {
            }
            Interleavings::here(kEnd);
        });
    }

    void addShutdown()
    {
        pAdd(Role::Other, [this] {
            // Producers of low priority first, then those of normal priority, then consumers.
            const Woken everybody = {&queue().mLowPriorityLimiter.mWaiter.mCondition,
                                     &queue().mNormalPriorityLimiter.mWaiter.mCondition,
                                     &queue().mDequeueWaiter.mCondition};
            queue().shutdown();
            mShutdownReturned = true;
            if (!Interleavings::notified().empty()) Interleavings::fail("shutdown has woken a single thread");
            const Woken& woken = Interleavings::notifiedAll();
            if (!woken.empty() && woken != everybody) Interleavings::fail("shutdown has woken others, or in disorder");
            if (!woken.empty()) ++mShutdownsThatWoke;
            Interleavings::here(kEnd);
        });
    }

    bool pReceive(unsigned int mine, unsigned int place, const milliseconds& timeout)
    {
        const bool over = mShutdownReturned;
        Interleavings::here(2 * place + over);
        const auto message = queue().waitForMsg(timeout);
        pCheckNotifications(message != nullptr);
        if (message == nullptr) {
            const bool inTime = timeout == 0ms || Interleavings::timedOut() || queue().isShutdown();
            if (!inTime) Interleavings::fail("a consumer has come back before its time");
            return false;
        }
        if (over) Interleavings::fail("a message was handed out after shutdown");
        const unsigned int number = 1U << message->getCallerId() % kMostNumbers;
        unsigned int& received = mReceived[mine][message->getCallerId() / kMostNumbers];
        if (received >= number) Interleavings::fail("messages of one producer have changed their order");
        received |= number;
        return true;
    }

    void pAdd(Role role, std::function<void()> work)
    {
        mRoles.push_back(role);
        threads.push_back(std::move(work));
        mAccepted.resize(threads.size());
        mReceived.assign(threads.size(), std::vector<unsigned int>(threads.size()));
    }

    void pDestroyQueue()
    {
        mAlive = false; // the threads that come after giveUp() leave it alone
        queue().~Queue();
    }

    const std::deque<Queue::QueueEntry>& pEntries() const QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        struct Opened : Queue::Fifo {
            static const std::deque<Queue::QueueEntry>& of(const Queue::Fifo& fifo) { return fifo.*(&Opened::c); }
        };
        return Opened::of(queue().mQueue);
    }

    /// A message put in wakes at most one consumer; one that was refused wakes nobody.
    static void pCheckWoken(bool queued, const Woken& consumer)
    {
        const Woken& woken = Interleavings::notified();
        if (!Interleavings::notifiedAll().empty()) Interleavings::fail("a message has woken a crowd");
        if (!woken.empty() && !queued) Interleavings::fail("a refused message has woken somebody");
        if (!woken.empty() && woken != consumer) Interleavings::fail("a message has woken more than one consumer");
    }

    /// Each message taken wakes at most one producer of normal priority, and then one of low; otherwise nobody is
    /// woken.
    void pCheckNotifications(bool taken)
    {
        if (!Interleavings::notifiedAll().empty()) Interleavings::fail("a crowd was woken for one message");
        const void* const normal = &queue().mNormalPriorityLimiter.mWaiter.mCondition;
        const void* const low = &queue().mLowPriorityLimiter.mWaiter.mCondition;
        Woken notified = Interleavings::notified();
        if (!taken && !notified.empty()) Interleavings::fail("producers were woken for nothing");
        if (!notified.empty() && notified.front() == normal) notified.erase(notified.begin());
        if (!notified.empty() && notified.front() == low) notified.erase(notified.begin());
        if (!notified.empty()) Interleavings::fail("too many producers were woken, or in another order");
    }

    /// Nobody sleeps while there is something for them to do.
    void pCheckSleepers() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        for (std::size_t i = 0; i < threads.size(); ++i) {
            if (!Interleavings::sleeps(i)) continue;
            if (queue().mShutdown) Interleavings::fail("somebody sleeps after shutdown");
            const bool empty = queue().mQueue.empty();
            if (mRoles[i] == Role::Consumer && !empty) Interleavings::fail("a consumer sleeps beside a message");
            if (mRoles[i] != Role::Producer) continue;
            // While messages wait, the next one that is taken wakes it.
            if (empty) Interleavings::fail("a producer sleeps though there is room and nobody left to wake it");
        }
    }

    /// What was taken in is still there or was handed out, and once.
    void pCheckMessages() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        std::vector<unsigned int> seen(threads.size());
        const auto see = [&seen](std::size_t producer, unsigned int numbers) {
            if ((seen[producer] & numbers) != 0) Interleavings::fail("a message was handed out twice");
            seen[producer] |= numbers;
        };
        for (const std::vector<unsigned int>& received : mReceived) {
            for (std::size_t producer = 0; producer < threads.size(); ++producer)
                see(producer, received[producer]);
        }
        for (const Queue::QueueEntry& entry : pEntries()) {
            const unsigned int callerId = entry.mMessage->getCallerId();
            see(callerId / kMostNumbers, 1U << callerId % kMostNumbers);
        }
        if (seen != mAccepted) Interleavings::fail("a message was lost");
        if (queue().mStats.getPending().mCount != pEntries().size()) Interleavings::fail("pending is miscounted");
    }

    /// For programs that must come to their end by themselves.
    void pCheckAllEnded()
    {
        for (std::size_t i = 0; i < threads.size(); ++i) {
            if (!Interleavings::hasEnded(i)) Interleavings::fail("a thread has not come to its end");
        }
    }

    StandingClock mClock;
    std::aligned_storage_t<sizeof(Queue), alignof(Queue)> mStorage; // stays when the queue goes
    bool mAlive = true;
    bool mShutdownReturned = false;
    std::vector<Role> mRoles;
    std::vector<unsigned int> mAccepted;              // by producer: bits of the numbers that were taken in
    std::vector<std::vector<unsigned int>> mReceived; // the same, as received, by consumer and producer
    unsigned int mFailures = 0;                       // exceptions
    unsigned int mShutdownsThatWoke = 0;
};

/// How a program is tried.
struct Trial {
    unsigned int spuriousWakeups = 0;
    bool sleepersForget = true; // the loops of the queue look at everything again; false tries many more states
    Fault fault = Fault::None;
};

template <typename P, typename... Arguments>
Interleavings::Result tryOut(const Trial& trial, const Arguments&... arguments)
{
    Interleavings::Options options;
    options.spuriousWakeups = trial.spuriousWakeups;
    options.sleepersForget = trial.sleepersForget;
    options.fault = trial.fault;
    return Interleavings::explore<P>(options, arguments...);
}

/// Runs the program in every order and expects it to be right, and to have come to an end at all.
template <typename P, typename... Arguments>
void expectRight(const Trial& trial, const Arguments&... arguments)
{
    const auto result = tryOut<P>(trial, arguments...);
    EXPECT_THAT(result.failure, IsEmpty()) << testing::PrintToString(result.story);
    EXPECT_GE(result.rests, 1U);
}

/// The same program must be found wrong when the modelled primitives are.
template <typename P, typename... Arguments>
std::string failureWith(Fault fault, const Arguments&... arguments)
{
    Trial trial;
    trial.fault = fault;
    return tryOut<P>(trial, arguments...).failure;
}

Trial spurious(unsigned int wakeups)
{
    Trial trial;
    trial.spuriousWakeups = wakeups;
    return trial;
}

Trial withLongMemory()
{
    Trial trial;
    trial.sleepersForget = false;
    return trial;
}

using Lengths = std::vector<unsigned int>;

constexpr const char* kSleepingProducer = "a producer sleeps though there is room and nobody left to wake it";
constexpr const char* kSleepingConsumer = "a consumer sleeps beside a message";

// Producers of both priorities, and consumers that take all of it together: everybody comes to the end.
class Traffic : public QueueProgram {
public:
    Traffic(std::size_t sizeLimit, unsigned int normal, unsigned int low, const Lengths& lengths,
            unsigned int consumers = 1)
        : QueueProgram(sizeLimit)
    {
        for (unsigned int i = 0; i < normal; ++i)
            addProducer(kNormal, lengths);
        for (unsigned int i = 0; i < low; ++i)
            addProducer(kLow, lengths);
        const std::size_t share = (normal + low) * lengths.size() / consumers;
        for (unsigned int i = 0; i < consumers; ++i)
            addConsumer(std::vector<milliseconds>(share, kNoEnd));
    }
    void atRest() override
    {
        QueueProgram::atRest();
        pCheckAllEnded();
        if (!pEntries().empty()) Interleavings::fail("messages are left");
    }
};

TEST(QelMessageQueueModel, OneOfEachGetsEverythingThroughTheSmallestQueue)
{
    expectRight<Traffic>({}, 1U, 1U, 0U, Lengths{32, 32, 32});
    expectRight<Traffic>({}, 1U, 1U, 1U, Lengths{32, 32});
}

TEST(QelMessageQueueModel, SeveralProducersGetEverythingThroughTheSmallestQueue)
{
    expectRight<Traffic>({}, 1U, 2U, 1U, Lengths{32});
    expectRight<Traffic>({}, 1U, 1U, 2U, Lengths{32});
}

TEST(QelMessageQueueModel, SeveralProducersGetEverythingThroughAQueueOfTwoMessages)
{
    expectRight<Traffic>({}, 64U, 2U, 1U, Lengths{32}); // low priority has room for one
}

TEST(QelMessageQueueModel, MessagesLongerThanTheLimitGetThrough)
{
    expectRight<Traffic>({}, 100U, 1U, 1U, Lengths{1000, 32});
}

TEST(QelMessageQueueModel, SeveralConsumersGetTheirShare)
{
    expectRight<Traffic>({}, 1U, 1U, 1U, Lengths{32}, 2U);
    expectRight<Traffic>({}, 0U, 2U, 0U, Lengths{32}, 2U);
}

TEST(QelMessageQueueModel, SleepsThatEndWithoutCauseDoNoHarm)
{
    expectRight<Traffic>(spurious(2), 1U, 1U, 1U, Lengths{32});
    expectRight<Traffic>(spurious(1), 1U, 1U, 1U, Lengths{32}, 2U);
}

TEST(QelMessageQueueModel, WhatAThreadSawBeforeItSleptDoesNotMatter)
{
    expectRight<Traffic>(withLongMemory(), 1U, 1U, 1U, Lengths{32});
    expectRight<Traffic>(withLongMemory(), 1U, 1U, 1U, Lengths{32}, 2U);
}

TEST(QelMessageQueueModel, TrafficWouldShowLostWakeups)
{
    EXPECT_EQ(failureWith<Traffic>(Fault::NotifyOneDoesNothing, 1U, 1U, 0U, Lengths{32}), kSleepingConsumer);
    EXPECT_EQ(failureWith<Traffic>(Fault::NotifyOneDoesNothing, 1U, 2U, 0U, Lengths{32}), kSleepingProducer);
}

// Producers that wait, and a consumer that never does.
class PatientProducers : public QueueProgram {
public:
    PatientProducers() : QueueProgram(32)
    {
        queue().enqueue(sized(32, kOthers));
        addProducer(kNormal, {32});
        addProducer(kLow, {32});
        pAdd(Role::Consumer, [this] {
            if (queue().waitForMsg(0ms) == nullptr) Interleavings::fail("the first message is gone");
            Interleavings::here(kEnd);
        });
    }
    void atRest() override { pCheckSleepers(); }
};

TEST(QelMessageQueueModel, AProducerIsWokenWhenTheQueueIsEmptied)
{
    expectRight<PatientProducers>({});
    EXPECT_EQ(failureWith<PatientProducers>(Fault::NotifyOneDoesNothing), kSleepingProducer);
}

// Shutdown at any moment.
class ShutdownProgram : public QueueProgram {
public:
    ShutdownProgram(unsigned int producers, unsigned int consumers, const Lengths& lengths, milliseconds timeout)
        : QueueProgram(32)
    {
        for (unsigned int i = 0; i < producers; ++i)
            addProducer(i % 2 == 0 ? kNormal : kLow, lengths);
        for (unsigned int i = 0; i < consumers; ++i)
            addConsumerToTheEnd(timeout);
        addShutdown();
    }
    void atRest() override
    {
        QueueProgram::atRest();
        pCheckAllEnded();
    }
};

TEST(QelMessageQueueModel, ShutdownSendsEverybodyHomeAndNothingIsHandedOutAfterIt)
{
    expectRight<ShutdownProgram>({}, 2U, 0U, Lengths{32, 32}, kNoEnd);
    expectRight<ShutdownProgram>({}, 3U, 0U, Lengths{32}, kNoEnd);
    expectRight<ShutdownProgram>({}, 0U, 3U, Lengths{}, kNoEnd);
    expectRight<ShutdownProgram>({}, 1U, 1U, Lengths{32, 32}, kNoEnd);
    expectRight<ShutdownProgram>({}, 2U, 1U, Lengths{32}, kNoEnd);
    expectRight<ShutdownProgram>({}, 1U, 2U, Lengths{32}, kNoEnd);
    expectRight<ShutdownProgram>({}, 1U, 2U, Lengths{32}, milliseconds(1h));
    expectRight<ShutdownProgram>(spurious(1), 1U, 1U, Lengths{32}, kNoEnd);
}

TEST(QelMessageQueueModel, ShutdownWouldShowLostWakeups)
{
    EXPECT_EQ(failureWith<ShutdownProgram>(Fault::NotifyAllDoesNothing, 2U, 0U, Lengths{32}, kNoEnd),
              "somebody sleeps after shutdown");
    EXPECT_EQ(failureWith<ShutdownProgram>(Fault::NotifyAllDoesNothing, 0U, 1U, Lengths{}, kNoEnd),
              "somebody sleeps after shutdown");
}

// Two threads shut the queue down at once.
class TwoShutdowns : public QueueProgram {
public:
    TwoShutdowns() : QueueProgram(32)
    {
        addConsumerToTheEnd();
        addShutdown();
        addShutdown();
    }
    void atRest() override
    {
        pCheckAllEnded();
        if (mShutdownsThatWoke != 1) Interleavings::fail("not one of two shutdowns has woken everybody");
    }
};

TEST(QelMessageQueueModel, OfTwoShutdownsOneWakesEverybodyAndTheOtherDoesNothing) { expectRight<TwoShutdowns>({}); }

// Consumers whose time may pass at any moment: also when a message has just been put in for them.
class Impatience : public QueueProgram {
public:
    Impatience() : QueueProgram(0)
    {
        addProducer(kNormal, {32});
        addProducer(kDefault, {32});
        addConsumer({milliseconds(1h)});
        addConsumerToTheEnd();
    }
};

TEST(QelMessageQueueModel, AConsumerThatGivesUpLeavesNoMessageBehindForASleepingOne)
{
    expectRight<Impatience>({});
    expectRight<Impatience>(spurious(1));
}

// Producers that do not wait.
class Drops : public QueueProgram {
public:
    Drops() : QueueProgram(32)
    {
        addProducer(kDefault, {32, 32});
        addProducer(kDefault | MessageQueuingOptions::LOW_PRIORITY, {32});
        addProducer(kNormal, {32});
        addConsumerToTheEnd();
    }
};

TEST(QelMessageQueueModel, ProducersThatDoNotWaitDoNoHarmToThoseThatDo) { expectRight<Drops>({}); }

// A thread that fails when it was woken.
class Failures : public QueueProgram {
public:
    Failures(bool producerFails, int failsAfter) : QueueProgram(producerFails ? 32 : 0), mProducerFails(producerFails)
    {
        if (producerFails) {
            queue().enqueue(sized(32, kOthers));
            addProducer(kNormal, {32}, failsAfter);
            addProducer(kNormal, {32});
            pAdd(Role::Consumer, [this] {
                if (queue().waitForMsg(0ms) == nullptr) Interleavings::fail("the first message is gone");
                Interleavings::here(kEnd);
            });
        } else {
            addProducer(kNormal, {32});
            addConsumer({kNoEnd}, failsAfter);
            addConsumerToTheEnd();
        }
    }
    void atRest() override
    {
        pCheckSleepers();
        const std::size_t left = mProducerFails ? 1 : 0; // the other producer's message; the other consumer takes it
        if (pEntries().size() != left) Interleavings::fail("the other one was not woken");
    }

private:
    const bool mProducerFails;
};

TEST(QelMessageQueueModel, AThreadThatFailsPassesItsWakeUpOn)
{
    expectRight<Failures>({}, true, 1);  // the producer's second reading: when it is admitted
    expectRight<Failures>({}, false, 0); // the consumer's first: when it takes the message
    expectRight<Failures>({}, false, 1);
}

// Deliberate: a message taken wakes one producer of each priority, however much room it leaves.
class BigMessageTaken : public QueueProgram {
public:
    explicit BigMessageTaken(std::vector<std::string>& outcomes) : QueueProgram(100), mOutcomes(outcomes)
    {
        queue().enqueue(sized(1000, kOthers));
        addProducer(kNormal, {32});
        addProducer(kNormal, {32});
        pAdd(Role::Consumer, [this] {
            queue().waitForMsg(0ms);
            Interleavings::here(kEnd);
        });
    }
    void atRest() override
    {
        pCheckSleepers();
        std::string outcome;
        for (std::size_t i = 0; i < 2; ++i)
            outcome += Interleavings::sleeps(i) ? 's' : 'e';
        if (std::find(mOutcomes.begin(), mOutcomes.end(), outcome) == mOutcomes.end()) mOutcomes.push_back(outcome);
    }

private:
    std::vector<std::string>& mOutcomes;
};

TEST(QelMessageQueueModel, OfTwoProducersThatSleepOneIsWokenThoughThereIsRoomForBoth)
{
    std::vector<std::string> outcomes;
    expectRight<BigMessageTaken>({}, std::ref(outcomes));
    // Both got in, or either was asleep when the other one was woken.
    EXPECT_THAT(outcomes, testing::UnorderedElementsAre("ee", "es", "se"));
}

// Producers are woken only if their own limit admits a message.
class RoomForOneOnly : public QueueProgram {
public:
    RoomForOneOnly() : QueueProgram(100)
    {
        queue().enqueue(sized(60, kOthers));
        queue().enqueue(sized(60, kOthers));
        addProducer(kNormal, {32});
        addProducer(kLow, {32});
        pAdd(Role::Consumer, [this] {
            queue().waitForMsg(0ms); // 60 bytes are left: room for normal priority, and none for low
            pCheckNotifications(true);
            for (const void* object : Interleavings::notified()) {
                if (object == &queue().mLowPriorityLimiter.mWaiter.mCondition)
                    Interleavings::fail("woken without room");
            }
            Interleavings::here(kEnd);
        });
    }
    void atRest() override
    {
        if (Interleavings::sleeps(0)) Interleavings::fail("normal priority sleeps though it has room");
        if (!Interleavings::sleeps(1)) Interleavings::fail("low priority is through");
    }
};

TEST(QelMessageQueueModel, NobodyIsWokenWithoutRoom) { expectRight<RoomForOneOnly>({}); }

// The queue is destroyed by a thread that was woken. It is the last one here: see giveUp().
class Destruction : public QueueProgram {
public:
    enum By { Consumer, ConsumerOfTwo, Producer, ConsumerAtShutdown, Observer };

    explicit Destruction(By by) : QueueProgram(by == Producer ? 32 : 0)
    {
        switch (by) {
        case Consumer:
            addProducer(kDefault, {32});
            pAdd(Role::Other, [this] {
                if (queue().waitForMsg(kNoEnd) != nullptr) pDestroyQueue();
            });
            break;
        case ConsumerOfTwo:
            addProducer(kDefault, {32});
            addProducer(kDefault, {32});
            pAdd(Role::Other, [this] {
                if (queue().waitForMsg(kNoEnd) == nullptr) return;
                Interleavings::here(1);
                if (queue().waitForMsg(kNoEnd) != nullptr) pDestroyQueue();
            });
            break;
        case Producer:
            queue().enqueue(sized(32, kOthers));
            pAdd(Role::Consumer, [this] { queue().waitForMsg(kNoEnd); });
            pAdd(Role::Other, [this] {
                if (queue().enqueue(sized(32, kOthers), kNormal) == Queue::OK) pDestroyQueue();
            });
            break;
        case ConsumerAtShutdown:
            addShutdown();
            pAdd(Role::Other, [this] {
                queue().waitForMsg(kNoEnd);
                pDestroyQueue();
            });
            break;
        case Observer:
            addShutdown();
            pAdd(Role::Other, [this] {
                while (!queue().isShutdown()) {
                    Interleavings::here(1);
                    Interleavings::step();
                }
                pDestroyQueue();
            });
            break;
        }
    }
    void atRest() override
    {
        if (mAlive) Interleavings::fail("the queue was not destroyed");
        pCheckAllEnded();
    }
};

class QelMessageQueueDestructionModel : public testing::TestWithParam<Destruction::By> {};

TEST_P(QelMessageQueueDestructionModel, NobodyTouchesTheQueueAfterItsEnd)
{
    expectRight<Destruction>({}, GetParam());
    expectRight<Destruction>(spurious(1), GetParam());
}

TEST_P(QelMessageQueueDestructionModel, WouldShowADestructorThatDoesNotWait)
{
    EXPECT_THAT(failureWith<Destruction>(Fault::WaitZeroDoesNotWait, GetParam()), HasSubstr("is destroyed while"));
}

INSTANTIATE_TEST_SUITE_P(Who, QelMessageQueueDestructionModel,
                         testing::Values(Destruction::Consumer, Destruction::ConsumerOfTwo, Destruction::Producer,
                                         Destruction::ConsumerAtShutdown, Destruction::Observer),
                         [](const auto& test) -> std::string {
                             switch (test.param) {
                             case Destruction::Consumer:
                                 return "TheConsumerOfTheLastMessage";
                             case Destruction::ConsumerOfTwo:
                                 return "TheConsumerOfTwoProducersMessages";
                             case Destruction::Producer:
                                 return "TheProducerThatWasLetIn";
                             case Destruction::ConsumerAtShutdown:
                                 return "TheConsumerThatShutdownSentHome";
                             case Destruction::Observer:
                                 return "WhoeverSeesThatItIsShutDown";
                             }
                             return "";
                         });

} // namespace
} // namespace qel
