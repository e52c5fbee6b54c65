#include <qel/common/io/StreamIOException.hpp>

#include "hypervisor/DeferredWakeUps.hpp"
#include "protocol/server/TestOutbox.hpp"

#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <new>
#include <sstream>
#include <thread>

namespace qel::test {

namespace {

using protocol::DeferredWakeUps;
using protocol::Outbox;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

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

/// A part of a message may have been sent, for example when there was no memory to keep the rest.
TEST_F(OutboxBatches, WhenSendingThrowsOnTheReadersThreadNothingFollows)
{
    read();
    outbox.onSend = [] { throw std::bad_alloc(); };
    outbox.post(frame(1));
    outbox.post(frame(2)); // in the queue then
    EXPECT_THROW(outbox.sendOwn(), std::bad_alloc);
    outbox.onSend = nullptr;
    outbox.post(frame(3));
    outbox.finish();
    EXPECT_FALSE(outbox.sendNext());
    EXPECT_THAT(outbox.batches, ElementsAre(Batch{1}));
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
