// The queue in one thread. Between threads: QelMessageQueueThreads_test.cpp; in every order of its threads:
// QelMessageQueueModel_test.cpp.

#include <qel/common/QelMessageQueue.hpp>

#include "QueueKit.hpp"
#include "support/CapturedLog.hpp"
#include "support/CountedMessage.hpp"
#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"

#include <chrono>
#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <utility>

namespace qel {
namespace {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using test::CapturedLog;
using test::CountedMessage;
using test::dumpOf;
using test::figure;
using test::kBestEffort;
using test::kBlocking;
using test::kDefault;
using test::kLow;
using test::MessageCensus;
using test::SettableClock;
using test::sized;
using test::take;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;
using testing::StrEq;
using testing::ThrowsMessage;

// The interface.

TEST(MessageQueuingOptions, HaveFixedValues)
{
    EXPECT_EQ(static_cast<int>(kDefault), 0);
    EXPECT_EQ(static_cast<int>(kBlocking), 1);
    EXPECT_EQ(static_cast<int>(kLow), 2);
    EXPECT_EQ(static_cast<int>(kBestEffort), 4);
    EXPECT_TRUE((std::is_same<std::underlying_type_t<MessageQueuingOptions>, int>::value));
}

TEST(MessageQueuingOptions, CombineAsBits)
{
    EXPECT_EQ(static_cast<int>(kBlocking | kLow), 3);
    EXPECT_EQ((kBlocking | kLow) & kLow, kLow);
    EXPECT_EQ((kBlocking | kLow) ^ kLow, kBlocking);
    MessageQueuingOptions options = kBlocking;
    options |= kBestEffort;
    options &= ~kBlocking;
    EXPECT_EQ(options, kBestEffort);
}

TEST(QelMessageQueue, ReturnCodesHaveFixedValuesAndTwoSpellings)
{
    EXPECT_EQ(static_cast<int>(QelMessageQueue::OK), 0);
    EXPECT_EQ(static_cast<int>(QelMessageQueue::ReturnCode::SHUTDOWN), 1);
    EXPECT_EQ(static_cast<int>(QelMessageQueue::DROPPED), 2);
}

TEST(QelMessageQueue, IsNotCopiedAndNotConvertedFromAnInteger)
{
    EXPECT_FALSE(std::is_copy_constructible<QelMessageQueue>::value);
    EXPECT_FALSE(std::is_copy_assignable<QelMessageQueue>::value);
    EXPECT_FALSE((std::is_convertible<std::size_t, QelMessageQueue>::value));
}

// Limits.

struct Limits {
    const char* name;
    std::size_t sizeLimit;
    const char* printed;
};

class QelMessageQueueLimits : public testing::TestWithParam<Limits> {};

TEST_P(QelMessageQueueLimits, LowPriorityHasHalfRoundedUp)
{
    EXPECT_EQ(figure(QelMessageQueue(GetParam().sizeLimit), "Limits"), GetParam().printed);
}

INSTANTIATE_TEST_SUITE_P(Sizes, QelMessageQueueLimits,
                         testing::Values(Limits{"None", 0, "0/0"}, Limits{"One", 1, "1/1"}, Limits{"Two", 2, "1/2"},
                                         Limits{"Three", 3, "2/3"}, Limits{"Even", 100, "50/100"},
                                         Limits{"Odd", 101, "51/101"},
                                         Limits{"AlmostLargest", std::numeric_limits<std::size_t>::max() - 1,
                                                "9223372036854775807/18446744073709551614"},
                                         Limits{"Largest", std::numeric_limits<std::size_t>::max(),
                                                "9223372036854775808/18446744073709551615"}),
                         [](const auto& test) { return test.param.name; });

/// Whether a message without BLOCKING is admitted while that many bytes are pending.
bool admits(std::size_t sizeLimit, unsigned int pendingBytes, MessageQueuingOptions options, unsigned int length = 1000)
{
    QelMessageQueue queue(sizeLimit);
    if (pendingBytes != 0) {
        EXPECT_EQ(queue.enqueue(sized(pendingBytes)), QelMessageQueue::OK);
    }
    const bool hasRoom = queue.hasRoom(options);
    const auto result = queue.enqueue(sized(length), options);
    EXPECT_EQ(hasRoom, result == QelMessageQueue::OK);
    if (result == QelMessageQueue::OK) {
        EXPECT_EQ(figure(queue, "Dropped"), "0 (0 B)");
        return true;
    }
    EXPECT_EQ(result, QelMessageQueue::DROPPED);
    EXPECT_EQ(figure(queue, "Dropped"), "1 (" + std::to_string(length) + " B)");
    EXPECT_EQ(figure(queue, "Pending"), "1 (" + std::to_string(pendingBytes) + " B)");
    EXPECT_EQ(take(queue), 0U);
    EXPECT_EQ(queue.waitForMsg(0ms), nullptr); // it is gone
    return false;
}

TEST(QelMessageQueue, NormalPriorityIsAdmittedBelowTheLimit)
{
    EXPECT_TRUE(admits(100, 0, kDefault));
    EXPECT_TRUE(admits(100, 99, kDefault)); // only pending bytes count
    EXPECT_FALSE(admits(100, 100, kDefault));
    EXPECT_FALSE(admits(100, 101, kDefault));
    EXPECT_FALSE(admits(100, 100, kDefault, 32));
}

TEST(QelMessageQueue, LowPriorityIsAdmittedBelowHalfOfTheLimit)
{
    EXPECT_TRUE(admits(100, 0, kLow));
    EXPECT_TRUE(admits(100, 49, kLow));
    EXPECT_FALSE(admits(100, 50, kLow));
    EXPECT_TRUE(admits(101, 50, kLow));
    EXPECT_FALSE(admits(101, 51, kLow));
}

TEST(QelMessageQueue, NormalPriorityIsAdmittedWhereLowPriorityIsDropped)
{
    QelMessageQueue queue(100);
    EXPECT_EQ(queue.enqueue(sized(60, 1), kLow), QelMessageQueue::OK);
    EXPECT_EQ(queue.enqueue(sized(32, 2), kLow), QelMessageQueue::DROPPED);
    EXPECT_EQ(queue.enqueue(sized(32, 3)), QelMessageQueue::OK);
    EXPECT_EQ(figure(queue, "Pending"), "2 (92 B)");
    EXPECT_EQ(figure(queue, "Dropped"), "1 (32 B)");
}

TEST(QelMessageQueue, BestEffortIsIgnored)
{
    EXPECT_TRUE(admits(100, 99, kBestEffort));
    EXPECT_FALSE(admits(100, 100, kBestEffort));
    EXPECT_TRUE(admits(100, 49, kBestEffort | kLow));
    EXPECT_FALSE(admits(100, 50, kBestEffort | kLow));
}

TEST(QelMessageQueue, UnknownBitsAreIgnored)
{
    constexpr auto kOthers = static_cast<MessageQueuingOptions>(~7);
    EXPECT_TRUE(admits(100, 99, kOthers));
    EXPECT_FALSE(admits(100, 100, kOthers));
    EXPECT_FALSE(admits(100, 50, kOthers | kLow));
}

TEST(QelMessageQueue, WithoutALimitNothingIsDropped)
{
    EXPECT_TRUE(admits(0, 1000000, kDefault));
    EXPECT_TRUE(admits(0, 1000000, kLow));
    EXPECT_TRUE(admits(0, 1000000, kBlocking));
    EXPECT_TRUE(admits(0, 1000000, kBlocking | kLow));
}

TEST(QelMessageQueue, ABlockingProducerDoesNotWaitWhileThereIsRoom)
{
    EXPECT_TRUE(admits(100, 99, kBlocking));
    EXPECT_TRUE(admits(100, 49, kBlocking | kLow));
}

TEST(QelMessageQueue, TakingAMessageMakesRoom)
{
    QelMessageQueue queue(64);
    EXPECT_EQ(queue.enqueue(sized(32, 1)), QelMessageQueue::OK);
    EXPECT_EQ(queue.enqueue(sized(32, 2)), QelMessageQueue::OK);
    EXPECT_EQ(queue.enqueue(sized(32, 3)), QelMessageQueue::DROPPED);
    EXPECT_EQ(take(queue), 1U);
    EXPECT_EQ(queue.enqueue(sized(32, 4)), QelMessageQueue::OK);
    EXPECT_EQ(take(queue), 2U);
    EXPECT_EQ(take(queue), 4U);
}

// Messages.

TEST(QelMessageQueue, MessagesOfBothPrioritiesKeepTheirOrder)
{
    QelMessageQueue queue(0);
    queue.enqueue(sized(100, 1), kLow);
    queue.enqueue(sized(100, 2));
    queue.enqueue(sized(100, 3), kBlocking | kLow);
    queue.enqueue(sized(100, 4), kBlocking);
    for (unsigned int callerId = 1; callerId <= 4; ++callerId)
        EXPECT_EQ(take(queue), callerId);
}

TEST(QelMessageQueue, ReturnsTheSameObject)
{
    QelMessageQueue queue(0);
    std::unique_ptr<QelMessage> message = sized(100, 1);
    const QelMessage* const address = message.get();
    queue.enqueue(std::move(message));
    EXPECT_EQ(queue.waitForMsg(0ms).get(), address);
}

TEST(QelMessageQueue, ARefusedMessageIsDestroyedWhenTheCallReturns)
{
    MessageCensus census;
    QelMessageQueue queue(32);
    EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32)), QelMessageQueue::OK);
    EXPECT_EQ(census.living(), 1);
    EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32)), QelMessageQueue::DROPPED);
    EXPECT_EQ(census.living(), 1);
    queue.shutdown();
    EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32)), QelMessageQueue::SHUTDOWN);
    EXPECT_EQ(census.living(), 1);
}

// The message is destroyed after the lock is released.
TEST(QelMessageQueue, TheDestructorOfARefusedMessageMayUseTheQueue)
{
    MessageCensus census;
    QelMessageQueue queue(32);
    int called = 0;
    const auto useQueue = [&] {
        EXPECT_THAT(dumpOf(queue), StartsWith("Limits:"));
        ++called;
    };
    queue.enqueue(sized(32));
    EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32, 0, useQueue)), QelMessageQueue::DROPPED);
    EXPECT_EQ(called, 1);
    queue.shutdown();
    EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32, 0, useQueue)), QelMessageQueue::SHUTDOWN);
    EXPECT_EQ(called, 2);
}

TEST(QelMessageQueue, DestroysMessagesThatWereNotTaken)
{
    MessageCensus census;
    {
        QelMessageQueue queue(0);
        for (int i = 0; i < 100; ++i)
            queue.enqueue(std::make_unique<CountedMessage>(census, 32));
        EXPECT_EQ(census.living(), 100);
        EXPECT_NE(queue.waitForMsg(0ms), nullptr);
        EXPECT_EQ(census.living(), 99);
    }
    EXPECT_EQ(census.living(), 0);
}

TEST(QelMessageQueue, RefusesANullMessageWithoutEffect)
{
    SettableClock clock;
    QelMessageQueue queue(32);
    const std::string before = dumpOf(queue);
    for (const MessageQueuingOptions options : {kDefault, kBlocking, kLow, kBestEffort}) {
        EXPECT_THAT([&] { queue.enqueue(nullptr, options); }, ThrowsMessage<std::invalid_argument>(StrEq("message")));
    }
    EXPECT_EQ(clock.steadyReads(), 0U);
    EXPECT_EQ(dumpOf(queue), before);
    EXPECT_EQ(queue.waitForMsg(0ms), nullptr);
    queue.shutdown();
    EXPECT_THAT([&] { queue.enqueue(nullptr); }, ThrowsMessage<std::invalid_argument>(StrEq("message")));
}

// Waiting for a message, in one thread.

TEST(QelMessageQueue, ATimeoutOfZeroOrLessDoesNotWait)
{
    QelMessageQueue queue(0);
    for (const milliseconds timeout : {0ms, -1ms, milliseconds::min()}) {
        SCOPED_TRACE(timeout.count());
        EXPECT_EQ(queue.waitForMsg(timeout), nullptr);
        queue.enqueue(sized(32, 5));
        const auto message = queue.waitForMsg(timeout); // a pending message is taken
        ASSERT_NE(message, nullptr);
        EXPECT_EQ(message->getCallerId(), 5U);
    }
}

TEST(QelMessageQueue, AnyTimeoutTakesAPendingMessage)
{
    QelMessageQueue queue(0);
    for (const milliseconds timeout :
         {1ms, milliseconds(std::chrono::hours(24 * 365 * 100)), milliseconds::max() - 1ms, milliseconds::max()}) {
        SCOPED_TRACE(timeout.count());
        queue.enqueue(sized(32, 5));
        EXPECT_NE(queue.waitForMsg(timeout), nullptr);
    }
}

TEST(QelMessageQueue, ATimeoutIsMeasuredOnTheRealClock)
{
    SettableClock clock; // does not advance
    QelMessageQueue queue(0);
    const auto begin = std::chrono::steady_clock::now();
    EXPECT_EQ(queue.waitForMsg(20ms), nullptr);
    EXPECT_GE(std::chrono::steady_clock::now() - begin, 20ms);
    EXPECT_EQ(clock.steadyReads(), 0U);
}

// Shutdown.

TEST(QelMessageQueue, IsNotShutDownAtFirst)
{
    QelMessageQueue queue(0);
    EXPECT_FALSE(queue.isShutdown());
    queue.shutdown();
    EXPECT_TRUE(queue.isShutdown());
}

TEST(QelMessageQueue, AfterShutdownPendingMessagesAreNotHandedOut)
{
    MessageCensus census;
    {
        QelMessageQueue queue(100);
        queue.enqueue(std::make_unique<CountedMessage>(census, 60));
        queue.enqueue(std::make_unique<CountedMessage>(census, 60));
        queue.shutdown();
        for (const milliseconds timeout : {milliseconds(0), milliseconds(1h), milliseconds::max()}) {
            EXPECT_EQ(queue.waitForMsg(timeout), nullptr);
        }
        EXPECT_EQ(figure(queue, "Pending"), "2 (120 B)");
        EXPECT_EQ(figure(queue, "Completed"), "0 (0 B)");
        EXPECT_EQ(census.living(), 2);
    }
    EXPECT_EQ(census.living(), 0);
}

TEST(QelMessageQueue, AfterShutdownAFullQueueCountsNoDrop)
{
    QelMessageQueue queue(32);
    queue.enqueue(sized(32));
    queue.shutdown();
    for (const MessageQueuingOptions options : {kDefault, kBlocking, kLow, kBlocking | kLow}) {
        EXPECT_EQ(queue.enqueue(sized(32), options), QelMessageQueue::SHUTDOWN);
    }
    EXPECT_EQ(figure(queue, "Dropped"), "0 (0 B)");
    EXPECT_EQ(figure(queue, "Pending"), "1 (32 B)");
}

TEST(QelMessageQueue, AfterShutdownAnEmptyQueueAcceptsNoMessage)
{
    QelMessageQueue queue(0);
    queue.shutdown();
    EXPECT_EQ(queue.enqueue(sized(32)), QelMessageQueue::SHUTDOWN);
    EXPECT_EQ(figure(queue, "Pending"), "0 (0 B)");
}

TEST(QelMessageQueue, LogsItsShutdownOnce)
{
    const CapturedLog log;
    QelMessageQueue queue(0);
    queue.shutdown();
    queue.shutdown();
    EXPECT_THAT(log.lines(), ElementsAre("D: MQ: Shutdown!"));
}

TEST(QelMessageQueue, LogsOnlyAtDebugAndNotForEachMessage)
{
    {
        const CapturedLog log(LogLevel::Info);
        QelMessageQueue queue(0);
        queue.shutdown();
        EXPECT_THAT(log.lines(), IsEmpty());
    }
    const CapturedLog log;
    QelMessageQueue queue(32);
    queue.enqueue(sized(32));
    queue.enqueue(sized(32));
    take(queue);
    take(queue);
    EXPECT_THAT(log.lines(), IsEmpty());
}

} // namespace
} // namespace qel
