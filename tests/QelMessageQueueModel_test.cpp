// The queue in every order in which its threads can run: messages, room, failures and shutdown.

#include "ModelledQueue.hpp"

#include <algorithm>
#include <chrono>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string>
#include <vector>

namespace qel::test {
namespace {

/// Producers of both priorities, and consumers that together take every message: all threads end.
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
            addConsumer(std::vector<milliseconds>(share, kNoLimit));
    }
    void atRest() override
    {
        QueueProgram::atRest();
        pCheckAllEnded();
        if (!inspect().empty()) Interleavings::fail("messages are left");
    }
};

TEST(QelMessageQueueModel, OneThreadOfEachKindPassesAllMessagesThroughTheSmallestQueue)
{
    expectCorrect<Traffic>({}, 1U, 1U, 0U, Lengths{32, 32, 32});
    expectCorrect<Traffic>({}, 1U, 1U, 1U, Lengths{32, 32});
}

TEST(QelMessageQueueModel, SeveralProducersPassAllMessagesThroughTheSmallestQueue)
{
    expectCorrect<Traffic>({}, 1U, 2U, 1U, Lengths{32});
    expectCorrect<Traffic>({}, 1U, 1U, 2U, Lengths{32});
}

TEST(QelMessageQueueModel, SeveralProducersPassAllMessagesThroughAQueueOfTwo)
{
    expectCorrect<Traffic>({}, 64U, 2U, 1U, Lengths{32}); // low priority has room for one
}

TEST(QelMessageQueueModel, MessagesLargerThanTheLimitPass)
{
    expectCorrect<Traffic>({}, 100U, 1U, 1U, Lengths{1000, 32});
}

TEST(QelMessageQueueModel, SeveralConsumersTakeAllMessages)
{
    expectCorrect<Traffic>({}, 1U, 1U, 1U, Lengths{32}, 2U);
    expectCorrect<Traffic>({}, 0U, 2U, 0U, Lengths{32}, 2U);
}

TEST(QelMessageQueueModel, SpuriousWakeupsAreHarmless)
{
    expectCorrect<Traffic>(spurious(2), 1U, 1U, 1U, Lengths{32});
    expectCorrect<Traffic>(spurious(1), 1U, 1U, 1U, Lengths{32}, 2U);
}

TEST(QelMessageQueueModel, StateSeenBeforeASleepIsNotUsedAfterIt)
{
    expectCorrect<Traffic>(withLongMemory(), 1U, 1U, 1U, Lengths{32});
    expectCorrect<Traffic>(withLongMemory(), 1U, 1U, 1U, Lengths{32}, 2U);
}

TEST(QelMessageQueueModel, TheTrafficModelDetectsLostWakeups)
{
    EXPECT_EQ(failureWith<Traffic>(Fault::NotifyOneDoesNothing, 1U, 1U, 0U, Lengths{32}), kSleepingConsumer);
    EXPECT_EQ(failureWith<Traffic>(Fault::NotifyOneDoesNothing, 1U, 2U, 0U, Lengths{32}), kSleepingProducer);
}

/// Producers that wait, and a consumer that does not.
class BlockedProducers : public QueueProgram {
public:
    BlockedProducers() : QueueProgram(32)
    {
        queue().enqueue(sized(32, kOthers));
        addProducer(kNormal, {32});
        addProducer(kLow, {32});
        pAdd(Role::Consumer, [this] {
            if (queue().waitForMsg(0ms) == nullptr) Interleavings::fail("the first message is missing");
            Interleavings::here(kEnd);
        });
    }
    void atRest() override { pCheckSleepers(); }
};

TEST(QelMessageQueueModel, TakingTheLastMessageWakesABlockedProducer)
{
    expectCorrect<BlockedProducers>({});
    EXPECT_EQ(failureWith<BlockedProducers>(Fault::NotifyOneDoesNothing), kSleepingProducer);
}

/// Shutdown at any moment.
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

TEST(QelMessageQueueModel, ShutdownEndsAllCallsAndNoMessageIsHandedOutAfterIt)
{
    expectCorrect<ShutdownProgram>({}, 2U, 0U, Lengths{32, 32}, kNoLimit);
    expectCorrect<ShutdownProgram>({}, 3U, 0U, Lengths{32}, kNoLimit);
    expectCorrect<ShutdownProgram>({}, 0U, 3U, Lengths{}, kNoLimit);
    expectCorrect<ShutdownProgram>({}, 1U, 1U, Lengths{32, 32}, kNoLimit);
    expectCorrect<ShutdownProgram>({}, 2U, 1U, Lengths{32}, kNoLimit);
    expectCorrect<ShutdownProgram>({}, 1U, 2U, Lengths{32}, kNoLimit);
    expectCorrect<ShutdownProgram>({}, 1U, 2U, Lengths{32}, milliseconds(1h));
    expectCorrect<ShutdownProgram>(spurious(1), 1U, 1U, Lengths{32}, kNoLimit);
}

TEST(QelMessageQueueModel, TheShutdownModelDetectsLostWakeups)
{
    EXPECT_EQ(failureWith<ShutdownProgram>(Fault::NotifyAllDoesNothing, 2U, 0U, Lengths{32}, kNoLimit),
              "a thread sleeps after shutdown");
    EXPECT_EQ(failureWith<ShutdownProgram>(Fault::NotifyAllDoesNothing, 0U, 1U, Lengths{}, kNoLimit),
              "a thread sleeps after shutdown");
}

/// Two threads shut the queue down at the same time.
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
        if (mShutdownsThatWoke != 1) Interleavings::fail("not exactly one of two shutdowns has woken all threads");
    }
};

TEST(QelMessageQueueModel, OfTwoShutdownsOneWakesAllThreadsAndTheOtherDoesNothing) { expectCorrect<TwoShutdowns>({}); }

/// Consumers whose timeout may pass at any moment, also right after a message was queued for them.
class Timeouts : public QueueProgram {
public:
    Timeouts() : QueueProgram(0)
    {
        addProducer(kNormal, {32});
        addProducer(kDefault, {32});
        addConsumer({milliseconds(1h)});
        addConsumerToTheEnd();
    }
};

TEST(QelMessageQueueModel, AConsumerThatTimesOutDoesNotLeaveAMessageToASleepingOne)
{
    expectCorrect<Timeouts>({});
    expectCorrect<Timeouts>(spurious(1));
}

/// Producers that do not wait.
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

TEST(QelMessageQueueModel, DroppedMessagesDoNotStopBlockedProducers) { expectCorrect<Drops>({}); }

/// A thread that fails after it was woken.
class Failures : public QueueProgram {
public:
    Failures(bool producerFails, int failsAfter) : QueueProgram(producerFails ? 32 : 0), mProducerFails(producerFails)
    {
        if (producerFails) {
            queue().enqueue(sized(32, kOthers));
            addProducer(kNormal, {32}, failsAfter);
            addProducer(kNormal, {32});
            pAdd(Role::Consumer, [this] {
                if (queue().waitForMsg(0ms) == nullptr) Interleavings::fail("the first message is missing");
                Interleavings::here(kEnd);
            });
        } else {
            addProducer(kNormal, {32});
            addConsumer({kNoLimit}, failsAfter);
            addConsumerToTheEnd();
        }
    }
    void atRest() override
    {
        pCheckSleepers();
        const std::size_t left =
            mProducerFails ? 1 : 0; // the message of the other producer; the other consumer takes it
        if (inspect().callerIds().size() != left) Interleavings::fail("the other thread was not woken");
    }

private:
    const bool mProducerFails;
};

TEST(QelMessageQueueModel, AThreadThatFailsWakesAnother)
{
    expectCorrect<Failures>({}, true, 1);  // the second reading of the producer: at its admission
    expectCorrect<Failures>({}, false, 0); // the first of the consumer: when it takes the message
    expectCorrect<Failures>({}, false, 1);
}

/// Deliberate: a message taken wakes one producer of each priority, however much room there is.
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

TEST(QelMessageQueueModel, OneOfTwoSleepingProducersIsWokenThoughThereIsRoomForBoth)
{
    std::vector<std::string> outcomes;
    expectCorrect<BigMessageTaken>({}, std::ref(outcomes));
    // Both were admitted, or one was asleep when the other was woken.
    EXPECT_THAT(outcomes, testing::UnorderedElementsAre("ee", "es", "se"));
}

/// Producers are woken only if their own limit admits a message.
class RoomForOneOnly : public QueueProgram {
public:
    RoomForOneOnly() : QueueProgram(100)
    {
        queue().enqueue(sized(60, kOthers));
        queue().enqueue(sized(60, kOthers));
        addProducer(kNormal, {32});
        addProducer(kLow, {32});
        pAdd(Role::Consumer, [this] {
            queue().waitForMsg(0ms); // 60 bytes are left: room for normal priority only
            pCheckNotifications(true);
            for (const void* object : Interleavings::notified()) {
                if (object == inspect().lowProducers()) Interleavings::fail("woken without room");
            }
            Interleavings::here(kEnd);
        });
    }
    void atRest() override
    {
        if (Interleavings::sleeps(0)) Interleavings::fail("normal priority sleeps while it has room");
        if (!Interleavings::sleeps(1)) Interleavings::fail("low priority was admitted");
    }
};

TEST(QelMessageQueueModel, AProducerIsNotWokenWithoutRoom) { expectCorrect<RoomForOneOnly>({}); }

} // namespace
} // namespace qel::test
