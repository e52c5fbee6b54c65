// The queue as one thread sees it. What goes on between threads: QelMessageQueueThreads_test.cpp, and every order in
// which it can go on: QelMessageQueueModel_test.cpp.

#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/CountedMessage.hpp"
#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"
#include "support/ThrowingClock.hpp"

#include <chrono>
#include <cstdint>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <memory>
#include <new>
#include <ostream>
#include <sstream>
#include <stdexcept>
#include <streambuf>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

namespace qel {
namespace {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using test::Allocations;
using test::CapturedLog;
using test::CountedMessage;
using test::MessageCensus;
using test::SettableClock;
using test::sized;
using test::ThrowingClock;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;
using testing::StrEq;
using testing::ThrowsMessage;

constexpr MessageQueuingOptions kDefault = MessageQueuingOptions::DEFAULT;
constexpr MessageQueuingOptions kBlocking = MessageQueuingOptions::BLOCKING;
constexpr MessageQueuingOptions kLow = MessageQueuingOptions::LOW_PRIORITY;
constexpr MessageQueuingOptions kBestEffort = MessageQueuingOptions::BEST_EFFORT;

std::string dumpOf(const QelMessageQueue& queue, const Indent& indent = Indent(0, ' '))
{
    std::ostringstream os;
    queue.dumpStatistics(os, indent);
    return os.str();
}

/// The dump's line that begins with the label, without it: "1 (32 B)" for "Pending".
std::string figure(const QelMessageQueue& queue, const std::string& label)
{
    std::istringstream lines(dumpOf(queue));
    for (std::string line; std::getline(lines, line);) {
        if (line.compare(0, label.size(), label) != 0) continue;
        return line.substr(line.find_first_not_of(' ', line.find(':') + 1));
    }
    return "no line " + label;
}

/// The caller id of the message at the head, which is taken; 0 when there is none.
unsigned int take(QelMessageQueue& queue)
{
    const std::unique_ptr<QelMessage> message = queue.waitForMsg(0ms);
    return message == nullptr ? 0 : message->getCallerId();
}

// What programs write.

TEST(MessageQueuingOptions, HaveTheValuesThatProgramsStore)
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

TEST(QelMessageQueue, ReturnCodesHaveTheirValuesAndBothSpellings)
{
    EXPECT_EQ(static_cast<int>(QelMessageQueue::OK), 0);
    EXPECT_EQ(static_cast<int>(QelMessageQueue::ReturnCode::SHUTDOWN), 1);
    EXPECT_EQ(static_cast<int>(QelMessageQueue::DROPPED), 2);
}

TEST(QelMessageQueue, IsNeitherCopiedNorMadeFromANumberByAccident)
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

/// Whether a message that does not wait is admitted with that many bytes in the queue.
bool admits(std::size_t sizeLimit, unsigned int pendingBytes, MessageQueuingOptions options, unsigned int length = 1000)
{
    QelMessageQueue queue(sizeLimit);
    if (pendingBytes != 0) {
        EXPECT_EQ(queue.enqueue(sized(pendingBytes)), QelMessageQueue::OK);
    }
    const auto result = queue.enqueue(sized(length), options);
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

TEST(QelMessageQueue, NormalPriorityIsAdmittedWhileLessThanTheLimitWaits)
{
    EXPECT_TRUE(admits(100, 0, kDefault));
    EXPECT_TRUE(admits(100, 99, kDefault)); // only what waits already counts
    EXPECT_FALSE(admits(100, 100, kDefault));
    EXPECT_FALSE(admits(100, 101, kDefault));
    EXPECT_FALSE(admits(100, 100, kDefault, 32));
}

TEST(QelMessageQueue, LowPriorityIsAdmittedWhileLessThanHalfTheLimitWaits)
{
    EXPECT_TRUE(admits(100, 0, kLow));
    EXPECT_TRUE(admits(100, 49, kLow));
    EXPECT_FALSE(admits(100, 50, kLow));
    EXPECT_TRUE(admits(101, 50, kLow));
    EXPECT_FALSE(admits(101, 51, kLow));
}

TEST(QelMessageQueue, NormalPriorityPassesLowPriorityThatIsOverItsLimit)
{
    QelMessageQueue queue(100);
    EXPECT_EQ(queue.enqueue(sized(60, 1), kLow), QelMessageQueue::OK);
    EXPECT_EQ(queue.enqueue(sized(32, 2), kLow), QelMessageQueue::DROPPED);
    EXPECT_EQ(queue.enqueue(sized(32, 3)), QelMessageQueue::OK);
    EXPECT_EQ(figure(queue, "Pending"), "2 (92 B)");
    EXPECT_EQ(figure(queue, "Dropped"), "1 (32 B)");
}

TEST(QelMessageQueue, BestEffortIsNotLookedAt)
{
    EXPECT_TRUE(admits(100, 99, kBestEffort));
    EXPECT_FALSE(admits(100, 100, kBestEffort));
    EXPECT_TRUE(admits(100, 49, kBestEffort | kLow));
    EXPECT_FALSE(admits(100, 50, kBestEffort | kLow));
}

TEST(QelMessageQueue, BitsWithoutAMeaningAreNotLookedAt)
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

TEST(QelMessageQueue, RoomComesBackWithEachMessageTaken)
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

TEST(QelMessageQueue, MessagesOfBothPrioritiesComeOutInTheOrderTheyWentIn)
{
    QelMessageQueue queue(0);
    queue.enqueue(sized(100, 1), kLow);
    queue.enqueue(sized(100, 2));
    queue.enqueue(sized(100, 3), kBlocking | kLow);
    queue.enqueue(sized(100, 4), kBlocking);
    for (unsigned int callerId = 1; callerId <= 4; ++callerId)
        EXPECT_EQ(take(queue), callerId);
}

TEST(QelMessageQueue, HandsOutTheVeryMessageThatWasPutIn)
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

// The message goes after the lock: its destructor may do what it likes.
TEST(QelMessageQueue, ARefusedMessageMayUseTheQueueAsItGoes)
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

TEST(QelMessageQueue, DestroysWhatWasNotTaken)
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

TEST(QelMessageQueue, ANullMessageIsRefusedBeforeAnythingHappens)
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

// Waiting for a message, as far as one thread can.

TEST(QelMessageQueue, NoTimeMeansNoWait)
{
    QelMessageQueue queue(0);
    for (const milliseconds timeout : {0ms, -1ms, milliseconds::min()}) {
        SCOPED_TRACE(timeout.count());
        EXPECT_EQ(queue.waitForMsg(timeout), nullptr);
        queue.enqueue(sized(32, 5));
        const auto message = queue.waitForMsg(timeout); // what is there is taken
        ASSERT_NE(message, nullptr);
        EXPECT_EQ(message->getCallerId(), 5U);
    }
}

TEST(QelMessageQueue, AnyTimeoutTakesWhatIsThere)
{
    QelMessageQueue queue(0);
    for (const milliseconds timeout :
         {1ms, milliseconds(std::chrono::hours(24 * 365 * 100)), milliseconds::max() - 1ms, milliseconds::max()}) {
        SCOPED_TRACE(timeout.count());
        queue.enqueue(sized(32, 5));
        EXPECT_NE(queue.waitForMsg(timeout), nullptr);
    }
}

TEST(QelMessageQueue, ATimeoutPassesOnTheRealClockWhateverASubstituteSays)
{
    SettableClock clock; // stands still
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

TEST(QelMessageQueue, AfterShutdownNothingIsHandedOutThoughThereAreMessages)
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

TEST(QelMessageQueue, AfterShutdownAFullQueueRefusesWithoutCountingADrop)
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

TEST(QelMessageQueue, AfterShutdownAnEmptyQueueRefusesToo)
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

TEST(QelMessageQueue, LogsNothingAboveDebugAndNothingOfItsDailyWork)
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

// Statistics.

TEST(QelMessageQueue, PrintsItsLimitsAndThenItsStatistics)
{
    SettableClock clock;
    QelMessageQueue queue(1000);
    queue.enqueue(sized(100, 1));
    clock.advance(300ms);
    queue.enqueue(sized(1200, 2), kLow);
    queue.enqueue(sized(50, 3), kLow); // dropped
    take(queue);
    clock.advance(1234567ns);

    EXPECT_EQ(dumpOf(queue, Indent(2, ' ')), "  Limits:         500/1000\n"
                                             "  Max Size (HWM): 1300 B\n"
                                             "  Pending:        1 (1200 B)\n"
                                             "  Dropped:        1 (50 B)\n"
                                             "  Completed:      1 (100 B)\n"
                                             "  Throughput:     3 m/s (333 B/s)\n"
                                             "  Head Wait:      1234 us\n"
                                             "  Latency Buckets:\n"
                                             "                Enqueue      Dequeue      E2E         \n"
                                             "    0-1ms:      2            0            0           \n"
                                             "    1-10ms:     0            0            0           \n"
                                             "    10-100ms:   0            0            0           \n"
                                             "    100-1000ms: 0            1            1           \n"
                                             "    1-10s:      0            0            0           \n"
                                             "    10+s:       0            0            0           \n"
                                             "  Maximum Latency:\n"
                                             "    [CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                                             "  Latency Events:\n"
                                             "    (A) [2024-01-02 03:04:05 - 2024-01-02 03:04:05 UTC]\n"
                                             "        Duration:       000d:00h:00m:00.000s\n"
                                             "        First:          [CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                                             "        Last:           [CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                                             "        Completed:      1 (100 B)\n"
                                             "        Max Latency:    300000 us\n"
                                             "        Avg Latency:    300000 us\n");
}

TEST(QelMessageQueue, ADumpRepeatsWhileTheClockStandsStill)
{
    SettableClock clock;
    QelMessageQueue queue(0);
    queue.enqueue(sized(100, 1));
    const std::string once = dumpOf(queue);
    EXPECT_EQ(dumpOf(queue), once);
    std::ostringstream os;
    os << hexFormat(1U);
    os.str("");
    queue.dumpStatistics(os, Indent(0, ' ')); // and behind a hexadecimal value
    EXPECT_EQ(os.str(), once);
}

TEST(QelMessageQueue, EndToEndLatencyCountsFromTheCall)
{
    SettableClock clock;
    QelMessageQueue queue(0);
    queue.enqueue(sized(100, 1));
    clock.advance(5s);
    queue.enqueue(sized(100, 2));
    clock.advance(5s);
    take(queue); // 10 s in all and at the head
    take(queue); // 5 s in all, none at the head
    const std::string text = dumpOf(queue);
    EXPECT_THAT(text, HasSubstr("0-1ms:      2            1            0           \n"));
    EXPECT_THAT(text, HasSubstr("1-10s:      0            1            2           \n"));
}

/// Time that goes on by one second with each reading of either clock, so that every duration tells which readings it
/// lies between.
class TickingClock : public TimeProvider {
public:
    TickingClock() { pRegister(); }

private:
    std::chrono::system_clock::time_point pSystem() override { return std::chrono::system_clock::time_point(pTick()); }
    std::chrono::steady_clock::time_point pSteady() override { return std::chrono::steady_clock::time_point(pTick()); }
    std::chrono::seconds pTick() { return std::chrono::seconds(mReadings++); }

    int mReadings = 0;
};

TEST(QelMessageQueue, TheClocksAreReadInTheOrderOfWhatTheyTell)
{
    TickingClock clock;
    QelMessageQueue queue(0);
    queue.enqueue(sized(100, 1)); // 0 its call, 1 its admission, 2 it is at the head
    take(queue);                  // 3 its latency, 4 it leaves the head, 5 the event's begin, 6 its time-out
    queue.enqueue(sized(200, 2)); // 7, 8, 9
    EXPECT_EQ(figure(queue, "Head Wait"), "1000000 us"); // 10
    take(queue); // 11 its latency, 12 it leaves the head, 13 the event's time-out, 14 its end

    EXPECT_EQ(dumpOf(queue), "Limits:         0/0\n"
                             "Max Size (HWM): 200 B\n"
                             "Pending:        0 (0 B)\n"
                             "Dropped:        0 (0 B)\n"
                             "Completed:      2 (300 B)\n"
                             "Throughput:     0 m/s (60 B/s)\n" // 2 s and 3 s at the head
                             "Latency Buckets:\n"
                             "              Enqueue      Dequeue      E2E         \n"
                             "  0-1ms:      0            0            0           \n"
                             "  1-10ms:     0            0            0           \n"
                             "  10-100ms:   0            0            0           \n"
                             "  100-1000ms: 2            0            0           \n" // 1 s each
                             "  1-10s:      0            2            2           \n"
                             "  10+s:       0            0            0           \n"
                             "Maximum Latency:\n"
                             "  [CID=0x00000002 FN=0x6003 OP=0x8001 T=4000000us]\n"
                             "Latency Events:\n"
                             "  (A) [1970-01-01 00:00:05 - 1970-01-01 00:00:14 UTC]\n"
                             "      Duration:       000d:00h:00m:09.000s\n"
                             "      First:          [CID=0x00000001 FN=0x6003 OP=0x8001 T=3000000us]\n"
                             "      Last:           [CID=0x00000002 FN=0x6003 OP=0x8001 T=4000000us]\n"
                             "      Completed:      2 (300 B)\n"
                             "      Max Latency:    4000000 us\n"
                             "      Avg Latency:    3500000 us\n");
}

TEST(QelMessageQueue, TheClockIsReadNoMoreThanNeeded)
{
    SettableClock clock;
    QelMessageQueue queue(64);
    EXPECT_EQ(clock.steadyReads(), 0U);

    queue.enqueue(sized(32)); // its call, its admission, and it comes to the head
    EXPECT_EQ(clock.steadyReads(), 3U);
    queue.enqueue(sized(32)); // its call and its admission
    EXPECT_EQ(clock.steadyReads(), 5U);
    queue.enqueue(sized(32)); // its call; dropped
    EXPECT_EQ(clock.steadyReads(), 6U);
    take(queue); // its latency, and the wait at the head
    EXPECT_EQ(clock.steadyReads(), 8U);
    take(queue);
    EXPECT_EQ(clock.steadyReads(), 10U);
    take(queue); // there is none
    EXPECT_EQ(clock.steadyReads(), 10U);
    dumpOf(queue);
    EXPECT_EQ(clock.steadyReads(), 10U);
    EXPECT_EQ(queue.waitForMsg(1ms), nullptr);
    EXPECT_EQ(clock.steadyReads(), 10U);
    queue.shutdown();
    EXPECT_EQ(clock.steadyReads(), 10U);
    queue.enqueue(sized(32)); // its call; refused
    EXPECT_EQ(clock.steadyReads(), 11U);
    take(queue);
    EXPECT_EQ(clock.steadyReads(), 11U);
    EXPECT_EQ(clock.systemReads(), 0U);
}

TEST(QelMessageQueue, AMessageThatPassesThroughCostsNoMemory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    QelMessageQueue queue(1000);
    std::unique_ptr<QelMessage> message = sized(32);
    std::size_t most = 0;
    std::size_t all = 0;
    for (int i = 0; i < 1000; ++i) {
        const Allocations allocations;
        queue.enqueue(std::move(message));
        message = queue.waitForMsg(0ms);
        most = std::max(most, allocations.count());
        all += allocations.count();
    }
    EXPECT_LE(most, 1U); // a new piece of the double-ended queue, now and then
    EXPECT_LE(all, 1000U / 16);
}

// Failures. Nothing has happened then.

TEST(QelMessageQueue, AFailingClockLeavesTheQueueAsItWasWhenAMessageComes)
{
    ThrowingClock clock;
    MessageCensus census;
    QelMessageQueue queue(0);
    const std::string before = dumpOf(queue);
    for (int readings = 0; readings < 3; ++readings) { // of the call, of the admission, of the head
        SCOPED_TRACE(readings);
        clock.failAfter(readings);
        EXPECT_THROW(queue.enqueue(std::make_unique<CountedMessage>(census, 32)), std::runtime_error);
        clock.work();
        EXPECT_EQ(census.living(), 0);
        EXPECT_EQ(dumpOf(queue), before);
        EXPECT_EQ(queue.waitForMsg(0ms), nullptr);
    }
    EXPECT_EQ(queue.enqueue(sized(32, 7)), QelMessageQueue::OK);
    EXPECT_EQ(take(queue), 7U);
}

TEST(QelMessageQueue, AFailingClockLeavesTheMessageInTheQueue)
{
    ThrowingClock clock;
    QelMessageQueue queue(0);
    queue.enqueue(sized(32, 7));
    const std::string before = dumpOf(queue);
    for (int readings = 0; readings < 2; ++readings) { // of the latency, of the head
        SCOPED_TRACE(readings);
        clock.failAfter(readings);
        EXPECT_THROW(queue.waitForMsg(0ms), std::runtime_error);
        clock.work();
        EXPECT_EQ(dumpOf(queue), before);
    }
    EXPECT_EQ(take(queue), 7U);
}

TEST(QelMessageQueue, WithoutMemoryTheQueueIsAsItWas)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    SettableClock clock;
    MessageCensus census;
    QelMessageQueue queue(0);
    int failed = 0;
    int queued = 0;
    while (failed < 3) { // memory is asked for once in many messages
        ASSERT_LT(queued, 1000);
        auto message = std::make_unique<CountedMessage>(census, 32);
        const std::string before = dumpOf(queue);
        bool thrown = false;
        {
            Allocations allocations;
            allocations.failAll();
            try {
                queue.enqueue(std::move(message));
            } catch (const std::bad_alloc&) {
                thrown = true;
            }
        }
        if (thrown) {
            ++failed;
            EXPECT_EQ(dumpOf(queue), before);
            EXPECT_EQ(queue.enqueue(std::make_unique<CountedMessage>(census, 32)), QelMessageQueue::OK);
        }
        ++queued;
        EXPECT_EQ(census.living(), queued);
    }
    while (queued > 0) {
        EXPECT_NE(queue.waitForMsg(0ms), nullptr);
        --queued;
    }
    EXPECT_EQ(queue.waitForMsg(0ms), nullptr);
    EXPECT_EQ(census.living(), 0);
}

TEST(QelMessageQueue, TheLockIsFreeAfterAFailure)
{
    ThrowingClock clock;
    QelMessageQueue queue(0);
    clock.failAfter(1);
    EXPECT_THROW(queue.enqueue(sized(32)), std::runtime_error);
    clock.work();
    EXPECT_THAT(dumpOf(queue), HasSubstr("Pending:        0 (0 B)\n")); // takes the lock
}

TEST(QelMessageQueue, TheLockIsFreeAfterADumpToAStreamThatFails)
{
    struct FullDisk : std::streambuf {}; // takes nothing
    FullDisk disk;
    std::ostream os(&disk);
    os.exceptions(std::ios_base::badbit);
    QelMessageQueue queue(0);
    queue.enqueue(sized(32, 7));
    EXPECT_THROW(queue.dumpStatistics(os, Indent(0, ' ')), std::ios_base::failure);
    EXPECT_EQ(take(queue), 7U);
}

} // namespace
} // namespace qel
