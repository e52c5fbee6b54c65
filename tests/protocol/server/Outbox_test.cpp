#include <qel/common/QelMessageGeneric.hpp>

#include "server/Outbox.hpp"

#include <atomic>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <thread>

namespace qel::test {

namespace {

using protocol::Outbox;
using ::testing::HasSubstr;

/// A frame of the given length, at least 32 bytes, that carries a number.
std::unique_ptr<QelMessage> frame(unsigned int callerId, unsigned int length = 32)
{
    auto message = std::make_unique<QelMessageGeneric>(callerId, 0x6003, 0x0107, MsgResponse);
    const std::string payload(length - 32, 'x');
    message->setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return message;
}

/// The feeder's thread.
class Feeder {
public:
    explicit Feeder(Outbox& outbox) : mOutbox(outbox), mThread([&outbox] { outbox.feed(); }) {}
    ~Feeder()
    {
        mOutbox.abandon();
        if (mThread.joinable()) mThread.join();
    }
    Feeder(const Feeder&) = delete;
    Feeder& operator=(const Feeder&) = delete;

    /// Waits for it to end by itself.
    void join() { mThread.join(); }

private:
    Outbox& mOutbox;
    std::thread mThread;
};

class OutboxTest : public ::testing::Test {
protected:
    explicit OutboxTest(std::size_t limit = 100) : outbox([this] { ++roomCalls; }, limit) {}

    unsigned int take()
    {
        const auto message = outbox.take();
        return message == nullptr ? 0 : message->getCallerId();
    }

    /// @return the caller ids of all messages until take() returns null
    std::vector<unsigned int> takeAll()
    {
        std::vector<unsigned int> ids;
        while (const auto message = outbox.take())
            ids.push_back(message->getCallerId());
        return ids;
    }

    std::string statistics() const
    {
        std::ostringstream text;
        outbox.dumpStatistics(text, Indent(1, ' '));
        return text.str();
    }

    std::atomic<unsigned> roomCalls{0};
    Outbox outbox;
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
    EXPECT_EQ(roomCalls, 0U); // nothing had waited
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
    OddOutboxTest() : OutboxTest(101) {}
};

TEST_F(OddOutboxTest, HalfOfAnOddLimitIsRoundedUp)
{
    outbox.post(frame(1, 50));
    outbox.postSerial(frame(2, 32));
    EXPECT_TRUE(outbox.hasSerialRoom()); // 50 is below 51
    outbox.postSerial(frame(3));
    EXPECT_FALSE(outbox.hasSerialRoom());
}

TEST_F(OutboxTest, WaitingMessagesEnterTheQueueInOrder)
{
    outbox.post(frame(1, 60));
    outbox.postSerial(frame(2, 60)); // waits
    outbox.post(frame(3, 60));       // would find room, and must not overtake
    outbox.post(frame(4, 60));
    outbox.finish();
    const Feeder feeder(outbox);
    EXPECT_THAT(takeAll(), ::testing::ElementsAre(1, 2, 3, 4));
}

TEST_F(OutboxTest, ReportsRoomForEachMessageThatWaited)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2, 100));
    outbox.post(frame(3, 100));
    outbox.finish();
    Feeder feeder(outbox);
    EXPECT_THAT(takeAll(), ::testing::ElementsAre(1, 2, 3));
    feeder.join();
    EXPECT_EQ(roomCalls, 2U);
    EXPECT_TRUE(outbox.hasRoom());
}

TEST_F(OutboxTest, WhenRoomIsReportedThereIsRoom)
{
    std::promise<bool> announced;
    Outbox own([&] { announced.set_value(own.hasRoom() && own.hasSerialRoom()); }, 100);
    own.post(frame(1, 100));
    own.post(frame(2));
    const Feeder feeder(own);
    own.take();
    EXPECT_TRUE(announced.get_future().get());
}

TEST_F(OutboxTest, AnOfferIsAcceptedBelowTheLimitAndDroppedAtIt)
{
    outbox.post(frame(1, 99));
    EXPECT_TRUE(outbox.offer(frame(2)));
    EXPECT_FALSE(outbox.offer(frame(3, 33)));
    EXPECT_THAT(statistics(), HasSubstr(" Dropped:        1 (33 B)\n"));
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
    const Feeder feeder(outbox);
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
    Feeder feeder(outbox);
    EXPECT_THAT(takeAll(), ::testing::ElementsAre(1, 2));
    feeder.join();
    EXPECT_EQ(take(), 0U);
}

TEST_F(OutboxTest, FinishingAnEmptyOutboxEndsIt)
{
    Feeder feeder(outbox);
    outbox.post(frame(1));
    EXPECT_EQ(take(), 1U);
    outbox.finish();
    EXPECT_EQ(take(), 0U);
    feeder.join();
}

TEST_F(OutboxTest, AnAbandonedOutboxReturnsNothingAndBlocksNoCaller)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2));
    outbox.postSerial(frame(3));
    outbox.abandon();
    EXPECT_TRUE(outbox.hasRoom());
    EXPECT_TRUE(outbox.hasSerialRoom());
    outbox.post(frame(4));
    EXPECT_TRUE(outbox.offer(frame(5))); // not reported as dropped
    EXPECT_EQ(take(), 0U);
    Feeder feeder(outbox);
    feeder.join();
}

TEST_F(OutboxTest, AbandoningEndsAFeederThatWaitsForRoom)
{
    outbox.post(frame(1, 100));
    outbox.post(frame(2));
    Feeder feeder(outbox);
    outbox.abandon(); // whether it waits already or not
    feeder.join();
    EXPECT_EQ(roomCalls, 0U);
}

TEST_F(OutboxTest, TheStatisticsAreThoseOfTheQueue)
{
    outbox.post(frame(1));
    outbox.post(frame(2, 40));
    EXPECT_EQ(take(), 1U);
    EXPECT_THAT(statistics(), ::testing::StartsWith(" Limits:         50/100\n"
                                                    " Max Size (HWM): 72 B\n"
                                                    " Pending:        1 (40 B)\n"
                                                    " Dropped:        0 (0 B)\n"
                                                    " Completed:      1 (32 B)\n"));
}

TEST_F(OutboxTest, WaitsForTheWriter)
{
    EXPECT_FALSE(outbox.waitUntilWritten(std::chrono::milliseconds(1)));
    outbox.setWritten();
    EXPECT_TRUE(outbox.waitUntilWritten(std::chrono::milliseconds(0)));
}

TEST_F(OutboxTest, ManyProducersAndOneWriterLoseNothing)
{
    std::atomic<unsigned> sum{0};
    Feeder feeder(outbox);
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
            outbox.postSerial(frame(i));
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
    Feeder feeder(outbox);
    unsigned posted = 0;
    for (unsigned taken = 0; taken < 1000; ++taken) {
        while (posted == taken || (outbox.hasSerialRoom() && posted < taken + 100))
            outbox.postSerial(frame(++posted, 40));
        EXPECT_LE(posted, taken + 4); // two in the queue, one entering it, one that just found room
        EXPECT_TRUE(outbox.hasRoom());
        EXPECT_EQ(take(), taken + 1);
    }
    EXPECT_THAT(statistics(), HasSubstr(" Max Size (HWM): 80 B\n"));
}

} // namespace

} // namespace qel::test
