#include <qel/common/QelMessageGeneric.hpp>

#include "Outbox.hpp"

#include <atomic>
#include <gtest/gtest.h>
#include <thread>

namespace qel::test {

namespace {

using tool::Outbox;

/// A frame of the given length, at least 32 bytes, that carries a number.
std::unique_ptr<QelMessage> frame(unsigned int callerId, unsigned int length = 32)
{
    auto message = std::make_unique<QelMessageGeneric>(callerId, 0x6003, 0x0107, MsgResponse);
    const std::string payload(length - 32, 'x');
    message->setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return message;
}

class OutboxTest : public ::testing::Test {
protected:
    unsigned roomCalls = 0;
    Outbox outbox{[this] { ++roomCalls; }, 100};
};

TEST_F(OutboxTest, MessagesComeOutInOrder)
{
    outbox.post(frame(1));
    outbox.post(frame(2));
    EXPECT_EQ(outbox.take()->getCallerId(), 1U);
    outbox.post(frame(3));
    EXPECT_EQ(outbox.take()->getCallerId(), 2U);
    EXPECT_EQ(outbox.take()->getCallerId(), 3U);
}

TEST_F(OutboxTest, ThereIsRoomBelowTheLimit)
{
    EXPECT_TRUE(outbox.hasRoom());
    outbox.post(frame(1, 99));
    EXPECT_TRUE(outbox.hasRoom());
    outbox.post(frame(2));
    EXPECT_FALSE(outbox.hasRoom());
}

TEST_F(OutboxTest, ExactlyTheLimitIsFull)
{
    outbox.post(frame(1, 100));
    EXPECT_FALSE(outbox.hasRoom());
}

TEST_F(OutboxTest, AFullOutboxStillTakesMessages)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2, 100));
    outbox.take();
    EXPECT_EQ(outbox.take()->getCallerId(), 2U);
}

TEST_F(OutboxTest, AMessageCountsUntilItIsWritten)
{
    outbox.post(frame(1, 100));
    outbox.finish();
    EXPECT_NE(outbox.take(), nullptr);
    EXPECT_FALSE(outbox.hasRoom()); // it is being written
    EXPECT_EQ(outbox.take(), nullptr);
    EXPECT_TRUE(outbox.hasRoom());
}

TEST_F(OutboxTest, RoomIsAnnouncedWhenThereWasNoneAndIsAgain)
{
    outbox.post(frame(1, 60));
    outbox.post(frame(2, 60));
    outbox.post(frame(3, 60)); // 180
    outbox.finish();
    outbox.take();
    EXPECT_EQ(roomCalls, 0U);
    outbox.take(); // 120 left
    EXPECT_EQ(roomCalls, 0U);
    outbox.take(); // 60 left
    EXPECT_EQ(roomCalls, 1U);
    outbox.take(); // none left: there was room before
    EXPECT_EQ(roomCalls, 1U);
}

TEST_F(OutboxTest, AfterFinishWhatIsQueuedGoesOutAndNothingElseComesIn)
{
    outbox.post(frame(1));
    outbox.finish();
    outbox.post(frame(2));
    EXPECT_EQ(outbox.take()->getCallerId(), 1U);
    EXPECT_EQ(outbox.take(), nullptr);
    EXPECT_EQ(outbox.take(), nullptr);
}

TEST_F(OutboxTest, AnAbandonedOutboxIsEmpty)
{
    outbox.post(frame(1, 100));
    outbox.abandon();
    EXPECT_TRUE(outbox.hasRoom());
    outbox.post(frame(2));
    EXPECT_EQ(outbox.take(), nullptr);
}

TEST_F(OutboxTest, AbandoningWhileAMessageIsWrittenKeepsTheCountRight)
{
    outbox.post(frame(1, 100));
    outbox.take();
    outbox.abandon();
    EXPECT_EQ(outbox.take(), nullptr);
    EXPECT_TRUE(outbox.hasRoom());
    EXPECT_EQ(roomCalls, 0U);
}

TEST_F(OutboxTest, TheWriterIsWaitedFor)
{
    EXPECT_FALSE(outbox.waitUntilWritten(std::chrono::milliseconds(1)));
    outbox.setWritten();
    EXPECT_TRUE(outbox.waitUntilWritten(std::chrono::milliseconds(0)));
}

TEST(Outbox, TheWriterSleepsUntilThereIsSomething)
{
    Outbox outbox([] {});
    std::atomic<unsigned> sum{0};
    std::thread writer([&] {
        while (const auto message = outbox.take())
            sum += message->getCallerId();
        outbox.setWritten();
    });
    std::thread first([&] {
        for (unsigned i = 1; i <= 1000; ++i)
            outbox.post(frame(i));
    });
    std::thread second([&] {
        for (unsigned i = 1; i <= 1000; ++i)
            outbox.post(frame(i));
    });
    first.join();
    second.join();
    outbox.finish();
    EXPECT_TRUE(outbox.waitUntilWritten(std::chrono::seconds(20)));
    writer.join();
    EXPECT_EQ(sum, 1001000U);
}

} // namespace

} // namespace qel::test
