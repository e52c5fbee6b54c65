#pragma once

// Every header that the queue includes comes first, outside of the namespace.
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageQueuingOptions.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageQueueStatistics.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "support/Interleavings.hpp"
#include "support/ModelledSync.hpp"
#include "support/SizedMessage.hpp"

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

/// @file
/// The message queue over modelled mutexes and condition variables, and programs around it for Interleavings. It is the
/// queue's own source text: what is checked is the code, not a copy of it.
///
/// The text is included inside of qel::modelled, where `Mutex` and the other names of ModelledSync.hpp hide those of
/// the library. Everything else in it means what it means in the library.

namespace qel::modelled {

#include <qel/common/QelMessageQueue.hpp> // and QelMessageQueue.cpp in ModelledQueue.cpp

namespace qel {

/// The state of a queue. Call it while no thread of the program runs.
class QelMessageQueueInspector {
public:
    explicit QelMessageQueueInspector(const QelMessageQueue& queue) : mQueue(queue) {}

    /// The caller ids of the messages in the queue, in order.
    std::vector<unsigned int> callerIds() const QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        struct Opened : QelMessageQueue::Fifo {
            static const std::deque<QelMessageQueue::QueueEntry>& of(const QelMessageQueue::Fifo& fifo)
            {
                return fifo.*(&Opened::c);
            }
        };
        std::vector<unsigned int> ids;
        for (const QelMessageQueue::QueueEntry& entry : Opened::of(mQueue.mQueue))
            ids.push_back(entry.mMessage->getCallerId());
        return ids;
    }
    bool empty() const QEL_NO_THREAD_SAFETY_ANALYSIS { return mQueue.mQueue.empty(); }
    std::uint64_t pendingCount() const QEL_NO_THREAD_SAFETY_ANALYSIS { return mQueue.mStats.getPending().mCount; }

    /// The counts of waiting and claimed threads, as text.
    std::string waiters() const QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        std::string text;
        for (const QelMessageQueue::Waiters* waiters :
             {&mQueue.mDequeueWaiter, &mQueue.mNormalPriorityLimiter.mWaiter, &mQueue.mLowPriorityLimiter.mWaiter}) {
            text += ' ' + std::to_string(waiters->mWaiting) + '-' + std::to_string(waiters->mClaimed);
        }
        return text;
    }

    // The condition variables, by which notifications are told apart.
    const void* consumers() const QEL_NO_THREAD_SAFETY_ANALYSIS { return &mQueue.mDequeueWaiter.mCondition; }
    const void* normalProducers() const QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        return &mQueue.mNormalPriorityLimiter.mWaiter.mCondition;
    }
    const void* lowProducers() const QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        return &mQueue.mLowPriorityLimiter.mWaiter.mCondition;
    }

private:
    const QelMessageQueue& mQueue;
};

} // namespace qel

} // namespace qel::modelled

namespace qel::test {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using Queue = modelled::qel::QelMessageQueue;
using Inspector = modelled::qel::QelMessageQueueInspector;
using Fault = Interleavings::Fault;
using Lengths = std::vector<unsigned int>;

constexpr MessageQueuingOptions kDefault = MessageQueuingOptions::DEFAULT;
constexpr MessageQueuingOptions kNormal = MessageQueuingOptions::BLOCKING;
constexpr MessageQueuingOptions kLow = MessageQueuingOptions::BLOCKING | MessageQueuingOptions::LOW_PRIORITY;
constexpr milliseconds kNoLimit = milliseconds::max();

/// Time stands still. One thread can be made to fail at a reading of the clock.
class StandingClock : public TimeProvider {
public:
    StandingClock() { pRegister(); }
    /// Lets the calling thread read that many times, and then fails once.
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

/// A queue, threads that use it, and the invariants.
class QueueProgram : public Interleavings::Program {
public:
    explicit QueueProgram(std::size_t sizeLimit) : mQueue(sizeLimit) {}

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
        state += queue().isShutdown() ? 'S' : 'R';
        for (const unsigned int callerId : inspect().callerIds())
            state += std::to_string(callerId) + ',';
        state += inspect().waiters();
    }

    void atRest() override
    {
        pCheckSleepers();
        pCheckMessages();
    }

    void giveUp() override { queue().shutdown(); }

protected:
    enum class Role { Producer, Consumer, Other };
    using Woken = std::vector<const void*>; // the condition variables notified, in order

    static constexpr unsigned int kMaxMessages = 32; // of a producer
    static constexpr unsigned int kOthers = 0xFFFF;  // the caller id of messages that are not checked
    static constexpr std::uint64_t kEnd = 1000;      // the place of a thread that has ended

    Queue& queue() { return mQueue; }
    const Queue& queue() const { return mQueue; }
    Inspector inspect() const { return Inspector(queue()); }

    /// Enqueues messages of the given lengths. Their caller ids hold thread and number.
    void addProducer(MessageQueuingOptions options, const std::vector<unsigned int>& lengths, int failsAfter = -1)
    {
        const auto mine = static_cast<unsigned int>(threads.size());
        pAdd(Role::Producer, [this, mine, options, lengths, failsAfter] {
            const Woken consumer = {inspect().consumers()};
            for (unsigned int i = 0; i < lengths.size(); ++i) {
                const bool over = mShutdownReturned;
                Interleavings::here(2 * i + over);
                if (failsAfter >= 0) mClock.failAfter(failsAfter);
                try {
                    const auto result = queue().enqueue(sized(lengths[i], mine * kMaxMessages + i), options);
                    pCheckWoken(result == Queue::OK, consumer);
                    if (over && result != Queue::SHUTDOWN) Interleavings::fail("a message was queued after shutdown");
                    if (result == Queue::SHUTDOWN) break;
                    if (result == Queue::OK) mAccepted[mine] |= 1U << i;
                } catch (const std::runtime_error&) {
                    ++mFailures;
                }
            }
            Interleavings::here(kEnd);
        });
    }

    /// Takes one message for each timeout. Ends early when there is none.
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

    /// Takes messages until a call returns none.
    void addConsumerToTheEnd(const milliseconds& timeout = kNoLimit)
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
            const Woken all = {inspect().lowProducers(), inspect().normalProducers(), inspect().consumers()};
            queue().shutdown();
            mShutdownReturned = true;
            if (!Interleavings::notified().empty()) Interleavings::fail("shutdown has woken a single thread");
            const Woken& woken = Interleavings::notifiedAll();
            if (!woken.empty() && woken != all)
                Interleavings::fail("shutdown has woken other threads, or in another order");
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
            if (!inTime) Interleavings::fail("a consumer has returned too early");
            return false;
        }
        if (over) Interleavings::fail("a message was handed out after shutdown");
        const unsigned int number = 1U << message->getCallerId() % kMaxMessages;
        unsigned int& received = mReceived[mine][message->getCallerId() / kMaxMessages];
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

    /// A queued message wakes at most one consumer, a refused one none.
    static void pCheckWoken(bool queued, const Woken& consumer)
    {
        const Woken& woken = Interleavings::notified();
        if (!Interleavings::notifiedAll().empty()) Interleavings::fail("a message has woken all threads");
        if (!woken.empty() && !queued) Interleavings::fail("a refused message has woken a thread");
        if (!woken.empty() && woken != consumer) Interleavings::fail("a message has woken more than one consumer");
    }

    /// A message taken wakes at most one producer of normal priority, and then one of low. No message wakes none.
    void pCheckNotifications(bool taken)
    {
        if (!Interleavings::notifiedAll().empty()) Interleavings::fail("all threads were woken for one message");
        const void* const normal = inspect().normalProducers();
        const void* const low = inspect().lowProducers();
        Woken notified = Interleavings::notified();
        if (!taken && !notified.empty()) Interleavings::fail("producers were woken for nothing");
        if (!notified.empty() && notified.front() == normal) notified.erase(notified.begin());
        if (!notified.empty() && notified.front() == low) notified.erase(notified.begin());
        if (!notified.empty()) Interleavings::fail("too many producers were woken, or in another order");
    }

    /// No thread sleeps while it has something to do.
    void pCheckSleepers()
    {
        for (std::size_t i = 0; i < threads.size(); ++i) {
            if (!Interleavings::sleeps(i)) continue;
            if (queue().isShutdown()) Interleavings::fail("a thread sleeps after shutdown");
            const bool empty = inspect().empty();
            if (mRoles[i] == Role::Consumer && !empty)
                Interleavings::fail("a consumer sleeps while a message is pending");
            if (mRoles[i] != Role::Producer) continue;
            // While a message is pending, taking it wakes the producer.
            if (empty) Interleavings::fail("a producer sleeps beside an empty queue");
        }
    }

    /// Every accepted message is in the queue or was handed out, once.
    void pCheckMessages()
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
        const std::vector<unsigned int> pending = inspect().callerIds();
        for (const unsigned int callerId : pending) {
            see(callerId / kMaxMessages, 1U << callerId % kMaxMessages);
        }
        if (seen != mAccepted) Interleavings::fail("a message was lost");
        if (inspect().pendingCount() != pending.size()) Interleavings::fail("pending is miscounted");
    }

    /// For programs whose threads must all end.
    void pCheckAllEnded()
    {
        for (std::size_t i = 0; i < threads.size(); ++i) {
            if (!Interleavings::hasEnded(i)) Interleavings::fail("a thread has not ended");
        }
    }

    StandingClock mClock;
    Queue mQueue;
    bool mShutdownReturned = false;
    std::vector<Role> mRoles;
    std::vector<unsigned int> mAccepted;              // by producer: a bit for each message that was queued
    std::vector<std::vector<unsigned int>> mReceived; // the same for messages received, by consumer and producer
    unsigned int mFailures = 0;                       // exceptions
    unsigned int mShutdownsThatWoke = 0;
};

/// How a program is run.
struct Trial {
    unsigned int spuriousWakeups = 0;
    bool sleepersForget = true; // the loops of the queue check everything again; false visits many more states
    Fault fault = Fault::None;
};

template <typename P, typename... Arguments>
Interleavings::Result explore(const Trial& trial, const Arguments&... arguments)
{
    Interleavings::Options options;
    options.spuriousWakeups = trial.spuriousWakeups;
    options.sleepersForget = trial.sleepersForget;
    options.fault = trial.fault;
    return Interleavings::explore<P>(options, arguments...);
}

/// Runs the program in every order. Expects that none fails and that at least one comes to rest.
template <typename P, typename... Arguments>
void expectCorrect(const Trial& trial, const Arguments&... arguments)
{
    const auto result = explore<P>(trial, arguments...);
    EXPECT_THAT(result.failure, ::testing::IsEmpty()) << testing::PrintToString(result.story);
    EXPECT_GE(result.rests, 1U);
}

/// @return what goes wrong when the modelled primitives have a fault
template <typename P, typename... Arguments>
std::string failureWith(Fault fault, const Arguments&... arguments)
{
    Trial trial;
    trial.fault = fault;
    return explore<P>(trial, arguments...).failure;
}

inline Trial spurious(unsigned int wakeups)
{
    Trial trial;
    trial.spuriousWakeups = wakeups;
    return trial;
}

inline Trial withLongMemory()
{
    Trial trial;
    trial.sleepersForget = false;
    return trial;
}

constexpr const char* kSleepingProducer = "a producer sleeps beside an empty queue";
constexpr const char* kSleepingConsumer = "a consumer sleeps while a message is pending";

} // namespace qel::test
