#include "protocol/server/TestOutbox.hpp"
#include "support/Allocations.hpp"
#include "support/SettableClock.hpp"

#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <new>
#include <sstream>
#include <thread>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

class OutboxTest : public ::testing::Test {
protected:
    explicit OutboxTest(std::size_t limit = 100 * kUnit) : outbox(limit) {}

    /// The number of the next message, which is a batch of its own. 0: there will be none
    unsigned int take()
    {
        if (!outbox.sendNext()) return 0;
        EXPECT_EQ(outbox.batches.back().size(), 1U);
        return outbox.batches.back().front();
    }

    /// @return the caller ids of all messages, after finish() or abandon()
    std::vector<unsigned int> takeAll()
    {
        const std::size_t before = outbox.batches.size();
        while (outbox.sendNext())
            continue;
        std::vector<unsigned int> ids;
        for (std::size_t i = before; i < outbox.batches.size(); ++i)
            ids.insert(ids.end(), outbox.batches[i].begin(), outbox.batches[i].end());
        return ids;
    }

    std::string statistics() const
    {
        std::ostringstream text;
        outbox.dumpStatistics(text, Indent(1, ' '));
        return text.str();
    }

    TestOutbox outbox;
};

TEST_F(OutboxTest, MessagesComeOutInOrder)
{
    outbox.post(frame(1));
    outbox.postSerial(frame(2));
    EXPECT_EQ(take(), 1U);
    outbox.post(frame(3));
    EXPECT_EQ(take(), 2U);
    EXPECT_EQ(take(), 3U);
}

TEST_F(OutboxTest, BelowTheLimitNothingWaits)
{
    outbox.post(frame(1, 99));
    outbox.post(frame(2, 1000)); // what is queued counts, not the new message
    EXPECT_TRUE(outbox.hasRoom());
    EXPECT_TRUE(outbox.hasSerialRoom());
    EXPECT_EQ(take(), 1U);
    EXPECT_EQ(take(), 2U);
    EXPECT_EQ(outbox.roomCalls, 0U); // nothing had waited
}

TEST_F(OutboxTest, AtTheLimitAResponseWaits)
{
    outbox.post(frame(1, 100));
    EXPECT_TRUE(outbox.hasRoom());
    outbox.post(frame(2));
    EXPECT_FALSE(outbox.hasRoom());
    EXPECT_FALSE(outbox.hasSerialRoom());
}

TEST_F(OutboxTest, BelowHalfTheLimitSerialDataDoesNotWait)
{
    outbox.post(frame(1, 49));
    outbox.postSerial(frame(2));
    EXPECT_TRUE(outbox.hasSerialRoom());
}

TEST_F(OutboxTest, AtHalfTheLimitSerialDataWaitsAndResponsesDoNot)
{
    outbox.post(frame(1, 50));
    outbox.postSerial(frame(2));
    EXPECT_FALSE(outbox.hasSerialRoom());
    EXPECT_TRUE(outbox.hasRoom());
}

class OddOutboxTest : public OutboxTest {
protected:
    OddOutboxTest() : OutboxTest(101) {} // bytes
};

TEST_F(OddOutboxTest, HalfOfAnOddLimitIsRoundedUp)
{
    outbox.post(frameOf(1, 50));
    outbox.postSerial(frameOf(2, 32));
    EXPECT_TRUE(outbox.hasSerialRoom()); // 50 is below 51
    outbox.postSerial(frameOf(3, 32));
    EXPECT_FALSE(outbox.hasSerialRoom());
}

TEST_F(OutboxTest, WaitingMessagesEnterTheQueueInOrder)
{
    outbox.post(frame(1, 60));
    outbox.postSerial(frame(2, 60)); // waits
    outbox.post(frame(3, 60));       // would find room, and must not overtake
    outbox.post(frame(4, 60));
    outbox.finish();
    EXPECT_THAT(takeAll(), ElementsAre(1, 2, 3, 4));
}

TEST_F(OutboxTest, ReportsRoomForEachMessageThatWaited)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2, 100));
    outbox.post(frame(3, 100));
    outbox.finish();
    EXPECT_THAT(takeAll(), ElementsAre(1, 2, 3));
    EXPECT_EQ(outbox.roomCalls, 2U);
    EXPECT_TRUE(outbox.hasRoom());
}

TEST_F(OutboxTest, WhenRoomIsReportedThereIsRoom)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2));
    outbox.postSerial(frame(3));
    EXPECT_EQ(take(), 1U);
    EXPECT_EQ(outbox.roomCalls, 1U);
    EXPECT_TRUE(outbox.hadRoomWhenTold);
}

TEST_F(OutboxTest, WhatWaitsEntersAsSoonAsItsRoomIsMade)
{
    outbox.post(frame(1, 60));
    outbox.post(frame(2, 60));
    outbox.postSerial(frame(3)); // waits for less than 50 units
    EXPECT_EQ(take(), 1U);       // 60 are left
    EXPECT_FALSE(outbox.hasSerialRoom());
    EXPECT_EQ(outbox.roomCalls, 0U);
    EXPECT_EQ(take(), 2U);
    EXPECT_TRUE(outbox.hasSerialRoom());
    EXPECT_EQ(outbox.roomCalls, 1U);
    EXPECT_EQ(take(), 3U);
}

TEST_F(OutboxTest, OneTakeMovesAllThatFindsRoom)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2, 32));
    outbox.post(frame(3, 32));
    outbox.post(frame(4, 32));
    outbox.post(frame(5, 32)); // 96 units are queued before it
    outbox.post(frame(6, 32));
    EXPECT_EQ(take(), 1U);
    EXPECT_FALSE(outbox.hasRoom());
    EXPECT_EQ(outbox.roomCalls, 1U);
    outbox.finish();
    EXPECT_THAT(takeAll(), ElementsAre(2, 3, 4, 5, 6));
}

TEST_F(OutboxTest, AnOfferIsAcceptedBelowTheLimitAndDroppedAtIt)
{
    outbox.post(frame(1, 99));
    EXPECT_TRUE(outbox.offer(frame(2)));
    EXPECT_FALSE(outbox.offer(frame(3, 33)));
    EXPECT_THAT(statistics(), HasSubstr(" Dropped:        1 (8580 B)\n"));
    EXPECT_EQ(take(), 1U);
    EXPECT_EQ(take(), 2U);
    EXPECT_TRUE(outbox.hasRoom()); // it was dropped, not kept
}

TEST_F(OutboxTest, AnOfferOvertakesWaitingSerialData)
{
    outbox.post(frame(1, 50));
    outbox.postSerial(frame(2));
    EXPECT_TRUE(outbox.offer(frame(3)));
    EXPECT_EQ(take(), 1U);
    EXPECT_EQ(take(), 3U);
    EXPECT_EQ(take(), 2U);
}

TEST_F(OutboxTest, OffersCountAgainstTheLimit)
{
    EXPECT_TRUE(outbox.offer(frame(1, 100)));
    outbox.post(frame(2));
    EXPECT_FALSE(outbox.hasRoom());
}

TEST_F(OutboxTest, AfterFinishQueuedMessagesGoOutAndNewOnesAreDropped)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2)); // waits
    outbox.finish();
    outbox.post(frame(3));
    outbox.postSerial(frame(4));
    EXPECT_THAT(takeAll(), ElementsAre(1, 2));
    EXPECT_EQ(take(), 0U);
}

TEST_F(OutboxTest, FinishingAnEmptyOutboxEndsIt)
{
    outbox.post(frame(1));
    EXPECT_EQ(take(), 1U);
    EXPECT_TRUE(outbox.hasSerialRoom());
    outbox.finish();
    EXPECT_FALSE(outbox.hasSerialRoom());
    EXPECT_EQ(take(), 0U);
}

TEST_F(OutboxTest, AnAbandonedOutboxReturnsNothingAndBlocksNoCaller)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2));
    outbox.postSerial(frame(3));
    outbox.abandon();
    EXPECT_TRUE(outbox.hasRoom());
    EXPECT_FALSE(outbox.hasSerialRoom()); // a partition's output would be read and lost
    outbox.post(frame(4));
    EXPECT_TRUE(outbox.offer(frame(5))); // not reported as dropped
    EXPECT_EQ(take(), 0U);
}

TEST_F(OutboxTest, AbandoningEndsAWriterThatWaitsForAMessage)
{
    auto taken = std::async(std::launch::async, [this] { return take(); });
    outbox.abandon(); // whether it waits already or not
    EXPECT_EQ(taken.get(), 0U);
}

TEST_F(OutboxTest, FinishingEndsAWriterThatWaitsForAMessage)
{
    auto taken = std::async(std::launch::async, [this] { return take(); });
    outbox.finish();
    EXPECT_EQ(taken.get(), 0U);
}

TEST_F(OutboxTest, TheStatisticsAreThoseOfTheQueueAndOfWhatWaitsInFrontOfIt)
{
    outbox.post(frame(1));
    outbox.post(frame(2, 40));
    EXPECT_EQ(take(), 1U);
    EXPECT_THAT(statistics(), ::testing::StartsWith(" In Front:       0 (0 B)\n"
                                                    " Waited:         0, at most 0 us\n"
                                                    " Limits:         13000/26000\n"
                                                    " Max Size (HWM): 18720 B\n"
                                                    " Pending:        1 (10400 B)\n"
                                                    " Dropped:        0 (0 B)\n"
                                                    " Completed:      1 (8320 B)\n"));
}

TEST_F(OutboxTest, TheStatisticsSayHowLongMessagesWaitedInFront)
{
    SettableClock clock;
    outbox.post(frame(1, 100));
    outbox.post(frame(2, 100));
    clock.advance(std::chrono::microseconds(700));
    outbox.post(frame(3, 40));
    EXPECT_THAT(statistics(), ::testing::StartsWith(" In Front:       2 (36400 B)\n"
                                                    " Waited:         0, at most 0 us\n"));
    EXPECT_EQ(take(), 1U);
    EXPECT_THAT(statistics(), ::testing::StartsWith(" In Front:       1 (10400 B)\n"
                                                    " Waited:         1, at most 700 us\n"));
    clock.advance(std::chrono::microseconds(300));
    EXPECT_EQ(take(), 2U);
    EXPECT_THAT(statistics(), ::testing::StartsWith(" In Front:       0 (0 B)\n"
                                                    " Waited:         2, at most 700 us\n"));
}

TEST_F(OutboxTest, AMessageForWhichThereIsNoMemoryIsLostAlone)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    outbox.post(frame(1, 100));
    outbox.post(frame(2, 100));
    // The queue allocates for every few messages. Each attempt either moves the message or loses it.
    for (unsigned number = 3; number < 200; ++number) {
        outbox.post(frame(number, 100));
        Allocations allocations;
        allocations.failAll();
        try {
            static_cast<void>(outbox.sendNext());
        } catch (const std::bad_alloc&) {
            allocations.succeedAgain();
            EXPECT_THAT(statistics(), HasSubstr(" Dropped:        0 (0 B)\n"));
            outbox.abandon(); // as the writer does
            return;
        }
    }
    FAIL() << "no allocation failed";
}

TEST_F(OutboxTest, WaitsForTheWriter)
{
    EXPECT_FALSE(outbox.waitUntilWritten(std::chrono::milliseconds(1)));
    outbox.setWritten();
    EXPECT_TRUE(outbox.waitUntilWritten(std::chrono::milliseconds(0)));
}

TEST_F(OutboxTest, ManyProducersAndOneWriterLoseNothing)
{
    unsigned sum = 0;
    std::thread writer([&] {
        for (const unsigned number : takeAll())
            sum += number;
        outbox.setWritten();
    });
    std::thread first([&] {
        for (unsigned i = 1; i <= 1000; ++i)
            outbox.post(frameOf(i, 100));
    });
    std::thread second([&] {
        for (unsigned i = 1; i <= 1000; ++i)
            outbox.postSerial(frameOf(i, 100));
    });
    first.join();
    second.join();
    outbox.finish();
    EXPECT_TRUE(outbox.waitUntilWritten(std::chrono::seconds(20)));
    writer.join();
    EXPECT_EQ(sum, 1001000U);
}

// Memory stays bounded: a producer that checks for room first never makes more than one message wait, and serial data
// alone never fills more than half of the limit, however slow the writer is.
TEST_F(OutboxTest, AFloodOfSerialDataLeavesHalfOfTheLimit)
{
    unsigned posted = 0;
    for (unsigned taken = 0; taken < 1000; ++taken) {
        while (posted == taken || (outbox.hasSerialRoom() && posted < taken + 100))
            outbox.postSerial(frame(++posted, 40));
        EXPECT_LE(posted, taken + 3); // two in the queue, one in front of it
        EXPECT_TRUE(outbox.hasRoom());
        EXPECT_EQ(take(), taken + 1);
    }
    EXPECT_THAT(statistics(), HasSubstr(" Max Size (HWM): 20800 B\n"));
}

} // namespace

} // namespace qel::test
