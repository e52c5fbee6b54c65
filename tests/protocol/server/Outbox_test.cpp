#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "hypervisor/DeferredWakeUps.hpp"
#include "server/Outbox.hpp"
#include "support/Allocations.hpp"
#include "support/SettableClock.hpp"

#include <functional>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <new>
#include <sstream>
#include <thread>
#include <utility>

namespace qel::test {

namespace {

using protocol::DeferredWakeUps;
using protocol::Outbox;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

/// Lengths and limits are in this unit. So two messages, of at least 32 units each, do not fit one batch.
constexpr unsigned kUnit = 260;
static_assert(2 * 32 * kUnit > Outbox::kBatchBytes, "see above");

/// A frame of the given length in bytes, at least 32, that carries a number.
std::unique_ptr<QelMessage> frameOf(unsigned int callerId, std::size_t bytes)
{
    auto message = std::make_unique<QelMessageGeneric>(callerId, 0x6003, 0x0107, MsgResponse);
    const std::string payload(bytes - 32, 'x');
    message->setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return message;
}

/// The same, of a length in units.
std::unique_ptr<QelMessage> frame(unsigned int callerId, unsigned int units = 32)
{
    return frameOf(callerId, units * kUnit);
}

/// Keeps the numbers of what was sent, batch by batch, and counts how often room was reported.
class TestOutbox final : public Outbox {
public:
    using Batch = std::vector<unsigned int>;

    explicit TestOutbox(std::size_t limit) : Outbox(limit) {}
    ~TestOutbox() override { retire(); }

    void resumeReading() override {}

    bool needsNoWait = true;
    std::size_t room = ~std::size_t{0}; // messages that go out without waiting
    std::function<void()> onSend;       // called when a batch is sent; may throw

    // Of the thread that sends.
    std::vector<Batch> batches;
    std::vector<bool> mayWait; // for each batch
    Batch rest;                // what found no room
    unsigned failures = 0;
    unsigned roomCalls = 0;
    bool hadRoomWhenTold = true; // each time

private:
    bool pNeedsNoWait() const override { return needsNoWait; }
    void pBeginBatch(bool canWait) override
    {
        if (canWait) rest.clear();
        mayWait.push_back(canWait);
        batches.emplace_back();
    }
    void pGather(const QelMessage& message) override { batches.back().push_back(message.getCallerId()); }
    bool pSendBatch() override
    {
        if (onSend) onSend();
        if (mayWait.back() || batches.back().size() <= room) return true;
        rest.assign(batches.back().begin() + static_cast<std::ptrdiff_t>(room), batches.back().end());
        return false;
    }
    void pOnRoom() override
    {
        ++roomCalls;
        hadRoomWhenTold = hadRoomWhenTold && hasRoom();
    }
    void pOnSendFailure() noexcept override
    {
        ++failures;
        abandon();
    }
};

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

/// Short messages, of which several fit a batch.
class OutboxBatches : public ::testing::Test {
protected:
    using Batch = TestOutbox::Batch;

    /// Plays the reader of the console on this thread.
    void read() { outbox.startReading(); }

    TestOutbox outbox{256 * 1024};
};

TEST_F(OutboxBatches, AllThatIsQueuedGoesOutTogether)
{
    outbox.post(frameOf(1, 80));
    outbox.postSerial(frameOf(2, 4140));
    EXPECT_TRUE(outbox.offer(frameOf(3, 100)));
    outbox.post(frameOf(4, 32));
    EXPECT_TRUE(outbox.sendNext());
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2, 3, 4}));
}

TEST_F(OutboxBatches, ABatchIsNoLongerThanItsLimit)
{
    constexpr std::size_t kHalf = Outbox::kBatchBytes / 2;
    outbox.post(frameOf(1, kHalf));
    outbox.post(frameOf(2, kHalf)); // just fits
    outbox.post(frameOf(3, kHalf));
    outbox.post(frameOf(4, kHalf + 1)); // just does not
    outbox.post(frameOf(5, Outbox::kBatchBytes));
    outbox.post(frameOf(6, Outbox::kBatchBytes + 1)); // alone
    outbox.post(frameOf(7, 32));
    outbox.finish();
    while (outbox.sendNext())
        continue;
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2}, Batch{3}, Batch{4}, Batch{5}, Batch{6}, Batch{7}));
}

TEST_F(OutboxBatches, WhatIsNotInTheBatchStaysInTheQueue)
{
    for (unsigned i = 1; i <= 5; ++i)
        outbox.post(frameOf(i, 8000));
    EXPECT_TRUE(outbox.sendNext());
    std::ostringstream text;
    outbox.dumpStatistics(text, Indent(0, ' '));
    EXPECT_THAT(text.str(), HasSubstr("Pending:        3 (24000 B)\n"));
    EXPECT_THAT(text.str(), HasSubstr("Completed:      2 (16000 B)\n"));
}

TEST_F(OutboxBatches, RoomIsReportedOnceForABatch)
{
    TestOutbox small(100);
    small.post(frameOf(1, 100));
    for (unsigned i = 2; i <= 6; ++i)
        small.post(frameOf(i, 40));
    EXPECT_FALSE(small.hasRoom());
    EXPECT_TRUE(small.sendNext());
    EXPECT_THAT(small.batches, ElementsAre(Batch{1, 2, 3, 4, 5, 6}));
    EXPECT_EQ(small.roomCalls, 1U);
    EXPECT_TRUE(small.hadRoomWhenTold);
}

TEST_F(OutboxBatches, TheReaderSendsWhatItHasPosted)
{
    read();
    outbox.sendOwn();
    EXPECT_THAT(outbox.batches, IsEmpty());
    outbox.post(frameOf(1, 32));
    outbox.post(frameOf(2, 32));
    outbox.sendOwn();
    outbox.sendOwn();
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2}));
    EXPECT_THAT(outbox.mayWait, ElementsAre(false));
}

TEST_F(OutboxBatches, TheReaderSendsWhatOthersHavePostedBefore)
{
    read();
    std::thread([this] { outbox.postSerial(frameOf(1, 32)); }).join();
    outbox.post(frameOf(2, 32));
    outbox.sendOwn();
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2}));
}

TEST_F(OutboxBatches, WhatOthersHavePostedIsLeftToTheWriter)
{
    read();
    std::thread([this] { outbox.postSerial(frameOf(1, 32)); }).join();
    outbox.sendOwn();
    EXPECT_THAT(outbox.batches, IsEmpty());
    EXPECT_TRUE(outbox.sendNext());
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1}));
}

TEST_F(OutboxBatches, TheReaderSendsOneBatchAndTheWriterTheNext)
{
    read();
    for (unsigned i = 1; i <= 3; ++i)
        outbox.post(frameOf(i, 8000));
    outbox.sendOwn();
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2}));
    EXPECT_TRUE(outbox.sendNext());
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2}, Batch{3}));
}

TEST_F(OutboxBatches, WhatFindsNoRoomIsSentByTheWriterBeforeAllElse)
{
    read();
    outbox.room = 1;
    for (unsigned i = 1; i <= 3; ++i)
        outbox.post(frameOf(i, 32));
    outbox.sendOwn();
    EXPECT_THAT(outbox.rest, ElementsAre(2, 3));
    outbox.post(frameOf(4, 32));
    outbox.sendOwn(); // not its turn
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2, 3}));
    EXPECT_TRUE(outbox.sendNext());
    EXPECT_THAT(outbox.rest, IsEmpty());
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1, 2, 3}, Batch{4}));
    EXPECT_THAT(outbox.mayWait, ElementsAre(false, true));
}

TEST_F(OutboxBatches, AfterFinishWhatFoundNoRoomStillGoesOut)
{
    read();
    outbox.room = 0;
    outbox.post(frameOf(1, 32));
    outbox.sendOwn();
    outbox.finish();
    EXPECT_TRUE(outbox.sendNext());
    EXPECT_THAT(outbox.rest, IsEmpty());
    EXPECT_FALSE(outbox.sendNext());
}

TEST_F(OutboxBatches, WithoutASocketTheReaderLeavesAllToTheWriter)
{
    outbox.needsNoWait = false;
    read();
    outbox.post(frameOf(1, 32));
    outbox.sendOwn();
    EXPECT_THAT(outbox.batches, IsEmpty());
    EXPECT_TRUE(outbox.sendNext());
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1}));
}

TEST_F(OutboxBatches, WhenSendingThrowsOnTheReadersThreadTheTurnEnds)
{
    read();
    outbox.onSend = [] { throw StreamIOException("broken"); };
    outbox.post(frameOf(1, 32));
    EXPECT_THROW(outbox.sendOwn(), StreamIOException);
    outbox.onSend = nullptr;
    outbox.post(frameOf(2, 32));
    EXPECT_TRUE(outbox.sendNext()); // does not wait for the reader's turn
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1}, Batch{2}));
}

TEST_F(OutboxBatches, TheWriterEndsAfterTheReadersTurn)
{
    read();
    std::promise<void> ended;
    std::thread writer;
    outbox.onSend = [&] {
        outbox.finish();
        writer = std::thread([&] {
            EXPECT_FALSE(outbox.sendNext());
            ended.set_value();
        });
        EXPECT_EQ(ended.get_future().wait_for(std::chrono::milliseconds(20)), std::future_status::timeout);
    };
    outbox.post(frameOf(1, 32));
    outbox.sendOwn();
    writer.join();
}

TEST_F(OutboxBatches, TheReaderDoesNotWaitForTheWriter)
{
    std::promise<void> sending;
    std::promise<void> goOn;
    bool isFirst = true;
    outbox.onSend = [&] {
        if (!std::exchange(isFirst, false)) return;
        sending.set_value();
        goOn.get_future().wait();
    };
    outbox.post(frameOf(1, 32));
    std::thread writer([&] {
        EXPECT_TRUE(outbox.sendNext());
        EXPECT_TRUE(outbox.sendNext());
    });
    sending.get_future().wait();
    read();
    outbox.post(frameOf(2, 32));
    outbox.sendOwn(); // returns
    goOn.set_value();
    writer.join();
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1}, Batch{2}));
}

/// What a console sends to another one, without locks in between.
class OutboxOfAnother : public OutboxBatches {
protected:
    void postAndSend(unsigned int number)
    {
        const DeferredWakeUps wakeUps(DeferredWakeUps::How::SendForOne);
        outbox.post(frameOf(number, 32));
        EXPECT_THAT(outbox.batches, IsEmpty()); // not under the locks
    }
};

TEST_F(OutboxOfAnother, AnotherReaderSendsWithoutWaiting)
{
    postAndSend(1);
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1}));
    EXPECT_THAT(outbox.mayWait, ElementsAre(false));
}

TEST_F(OutboxOfAnother, WhatFindsNoRoomIsLeftToTheWriter)
{
    outbox.room = 0;
    postAndSend(1);
    EXPECT_THAT(outbox.rest, ElementsAre(1));
    EXPECT_TRUE(outbox.sendNext());
    EXPECT_THAT(outbox.rest, IsEmpty());
}

TEST_F(OutboxOfAnother, WithoutASocketTheWriterSends)
{
    outbox.needsNoWait = false;
    postAndSend(1);
    EXPECT_THAT(outbox.batches, IsEmpty());
    EXPECT_TRUE(outbox.sendNext());
}

TEST_F(OutboxOfAnother, AFailureEndsTheConnectionOfTheAddressee)
{
    outbox.onSend = [] { throw StreamIOException("broken"); };
    postAndSend(1);
    EXPECT_EQ(outbox.failures, 1U);
    EXPECT_FALSE(outbox.sendNext());
}

TEST_F(OutboxOfAnother, ForSeveralItWakesTheWriters)
{
    TestOutbox second{1000};
    {
        const DeferredWakeUps wakeUps(DeferredWakeUps::How::SendForOne);
        outbox.post(frameOf(1, 32));
        second.post(frameOf(2, 32));
    }
    EXPECT_THAT(outbox.batches, IsEmpty());
    EXPECT_THAT(second.batches, IsEmpty());
}

TEST_F(OutboxOfAnother, MayBeGoneByThen)
{
    const DeferredWakeUps wakeUps(DeferredWakeUps::How::SendForOne);
    {
        TestOutbox other{1000};
        other.post(frameOf(1, 32));
    }
}

TEST_F(OutboxOfAnother, IsNotDestroyedWhileAnotherReaderSends)
{
    auto other = std::make_unique<TestOutbox>(1000);
    std::promise<void> sending;
    std::promise<void> goOn;
    other->onSend = [&] {
        sending.set_value();
        goOn.get_future().wait();
    };
    std::thread sender([&] {
        const DeferredWakeUps wakeUps(DeferredWakeUps::How::SendForOne);
        other->post(frameOf(1, 32));
    });
    sending.get_future().wait();
    auto destroyed = std::async(std::launch::async, [&] {
        other->abandon();
        other.reset();
    });
    EXPECT_EQ(destroyed.wait_for(std::chrono::milliseconds(20)), std::future_status::timeout);
    goOn.set_value();
    EXPECT_EQ(destroyed.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    sender.join();
}

TEST_F(OutboxBatches, ManyWhoPostAndManyWhoSendLoseNothingAndKeepTheOrder)
{
    constexpr unsigned kEach = 3000;
    std::thread writer([&] {
        while (outbox.sendNext())
            continue;
    });
    const auto post = [this](unsigned first) {
        for (unsigned i = 0; i < kEach; ++i) {
            const DeferredWakeUps wakeUps(i % 2 == 0 ? DeferredWakeUps::How::SendForOne : DeferredWakeUps::How::Wake);
            outbox.post(frameOf(first + i, 32 + i % 500));
        }
    };
    std::thread reader([&] {
        read();
        for (unsigned i = 0; i < kEach; ++i) {
            outbox.post(frameOf(1 + i, 32 + i % 3000));
            if (i % 3 == 0) outbox.sendOwn();
        }
        outbox.sendOwn();
    });
    std::thread second(post, 1 + kEach);
    std::thread third(post, 1 + 2 * kEach);
    reader.join();
    second.join();
    third.join();
    outbox.finish();
    writer.join();
    std::vector<unsigned> next{1, 1 + kEach, 1 + 2 * kEach};
    for (const Batch& batch : outbox.batches) {
        for (const unsigned number : batch)
            ASSERT_EQ(number, next[(number - 1) / kEach]++);
    }
    EXPECT_THAT(next, ElementsAre(1 + kEach, 1 + 2 * kEach, 1 + 3 * kEach));
}

} // namespace

} // namespace qel::test
