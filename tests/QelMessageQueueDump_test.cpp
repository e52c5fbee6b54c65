// What the queue prints about itself, and what that costs: readings of the clock and memory.

#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "QueueKit.hpp"
#include "support/Allocations.hpp"
#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <sstream>
#include <string>
#include <utility>

namespace qel {
namespace {

using namespace std::chrono_literals;
using test::Allocations;
using test::dumpOf;
using test::figure;
using test::kLow;
using test::SettableClock;
using test::sized;
using test::take;
using testing::HasSubstr;

TEST(QelMessageQueue, PrintsLimitsAndStatistics)
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

TEST(QelMessageQueue, PrintsTheSameTextTwiceInAnyStateOfTheStream)
{
    SettableClock clock;
    QelMessageQueue queue(0);
    queue.enqueue(sized(100, 1));
    const std::string once = dumpOf(queue);
    EXPECT_EQ(dumpOf(queue), once);
    std::ostringstream os;
    os << hexFormat(1U);
    os.str("");
    queue.dumpStatistics(os, Indent(0, ' ')); // after a hexadecimal value
    EXPECT_EQ(os.str(), once);
}

TEST(QelMessageQueue, EndToEndLatencyStartsWithTheCallOfEnqueue)
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

/// Time that advances by one second with each reading of either clock, so that every duration shows between which
/// readings it was measured.
class TickingClock : public TimeProvider {
public:
    TickingClock() { pRegister(); }

private:
    std::chrono::system_clock::time_point pSystem() override { return std::chrono::system_clock::time_point(pTick()); }
    std::chrono::steady_clock::time_point pSteady() override { return std::chrono::steady_clock::time_point(pTick()); }
    std::chrono::seconds pTick() { return std::chrono::seconds(mReadings++); }

    int mReadings = 0;
};

TEST(QelMessageQueue, ReadsTheClocksInAFixedOrder)
{
    TickingClock clock;
    QelMessageQueue queue(0);
    queue.enqueue(sized(100, 1)); // 0 its call, 1 its admission, 2 it is at the head
    take(queue);                  // 3 its latency, 4 it leaves the head, 5 the start of the event, 6 its timeout
    queue.enqueue(sized(200, 2)); // 7, 8, 9
    EXPECT_EQ(figure(queue, "Head Wait"), "1000000 us"); // 10
    take(queue); // 11 its latency, 12 it leaves the head, 13 the timeout of the event, 14 its end

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

TEST(QelMessageQueue, ReadsTheClockNoMoreThanNeeded)
{
    SettableClock clock;
    QelMessageQueue queue(64);
    EXPECT_EQ(clock.steadyReads(), 0U);

    queue.enqueue(sized(32)); // its call, its admission, its arrival at the head
    EXPECT_EQ(clock.steadyReads(), 3U);
    queue.enqueue(sized(32)); // its call and its admission
    EXPECT_EQ(clock.steadyReads(), 5U);
    queue.enqueue(sized(32)); // its call; dropped
    EXPECT_EQ(clock.steadyReads(), 6U);
    take(queue); // its latency, and the wait at the head
    EXPECT_EQ(clock.steadyReads(), 8U);
    take(queue);
    EXPECT_EQ(clock.steadyReads(), 10U);
    take(queue); // the queue is empty
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

TEST(QelMessageQueue, PassingAMessageThroughAllocatesAlmostNothing)
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
    EXPECT_LE(most, 1U); // now and then a new block of the double-ended queue
    EXPECT_LE(all, 1000U / 16);
}

} // namespace
} // namespace qel
