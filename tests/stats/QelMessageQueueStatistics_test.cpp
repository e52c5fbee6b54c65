#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageQueueStatistics.hpp>

#include "support/Allocations.hpp"
#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"
#include "support/ThrowingClock.hpp"

#include <chrono>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <string>

namespace qel {
namespace {

using namespace std::chrono_literals;
using std::chrono::nanoseconds;
using test::Allocations;
using test::SettableClock;
using test::SizedMessage;
using test::ThrowingClock;
using testing::HasSubstr;
using testing::Not;
using testing::StartsWith;

std::string dumpOf(const QelMessageQueueStatistics& statistics, const Indent& indent = Indent(0, ' '))
{
    std::ostringstream os;
    statistics.dump(os, indent);
    return os.str();
}

class QelMessageQueueStatisticsTest : public testing::Test {
protected:
    std::string dump(const Indent& indent = Indent(0, ' ')) const { return dumpOf(mStatistics, indent); }

    SettableClock mClock;
    QelMessageQueueStatistics mStatistics;
};

constexpr const char* kNothingYet = "Max Size (HWM): 0 B\n"
                                    "Pending:        0 (0 B)\n"
                                    "Dropped:        0 (0 B)\n"
                                    "Completed:      0 (0 B)\n"
                                    "Throughput:     0 m/s (0 B/s)\n"
                                    "Latency Buckets:\n"
                                    "              Enqueue      Dequeue      E2E         \n"
                                    "  0-1ms:      0            0            0           \n"
                                    "  1-10ms:     0            0            0           \n"
                                    "  10-100ms:   0            0            0           \n"
                                    "  100-1000ms: 0            0            0           \n"
                                    "  1-10s:      0            0            0           \n"
                                    "  10+s:       0            0            0           \n";

TEST_F(QelMessageQueueStatisticsTest, AreAllZeroAtFirst) { EXPECT_EQ(dump(), kNothingYet); }

TEST_F(QelMessageQueueStatisticsTest, EveryLineIsIndentedAndNestedPartsByTwoMore)
{
    mStatistics.enqueued(SizedMessage(32, 1), 0ns);
    mStatistics.dequeued(SizedMessage(32, 1), 300ms);
    mStatistics.enqueued(SizedMessage(32, 1), 0ns);
    EXPECT_EQ(dump(Indent(2, '.')), "..Max Size (HWM): 32 B\n"
                                    "..Pending:        1 (32 B)\n"
                                    "..Dropped:        0 (0 B)\n"
                                    "..Completed:      1 (32 B)\n"
                                    "..Throughput:     0 m/s (0 B/s)\n"
                                    "..Head Wait:      0 us\n"
                                    "..Latency Buckets:\n"
                                    "....            Enqueue      Dequeue      E2E         \n"
                                    "....0-1ms:      2            1            0           \n"
                                    "....1-10ms:     0            0            0           \n"
                                    "....10-100ms:   0            0            0           \n"
                                    "....100-1000ms: 0            0            1           \n"
                                    "....1-10s:      0            0            0           \n"
                                    "....10+s:       0            0            0           \n"
                                    "..Maximum Latency:\n"
                                    "....[CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                                    "..Latency Events:\n"
                                    "....(A) [2024-01-02 03:04:05 - 2024-01-02 03:04:05 UTC]\n"
                                    "........Duration:       000d:00h:00m:00.000s\n"
                                    "........First:          [CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                                    "........Last:           [CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                                    "........Completed:      1 (32 B)\n"
                                    "........Max Latency:    300000 us\n"
                                    "........Avg Latency:    300000 us\n");
}

// The complete output of a queue.
TEST_F(QelMessageQueueStatisticsTest, PrintEverything)
{
    const SizedMessage first(100, 1, 0x6001, 0x0001);
    const SizedMessage second(200, 2, 0x6002, 0x8405);
    const SizedMessage third(300, 3, 0x6003, 0x8001);

    mStatistics.enqueued(first, 0ns); // the first is at the head from here on
    mClock.advance(5ms);
    mStatistics.enqueued(second, 2ms);
    mStatistics.dropped(third);
    mStatistics.dropped(third);
    mClock.advance(495ms);
    mStatistics.dequeued(first, 500ms); // 500 ms at the head, and in all
    mStatistics.enqueued(third, 50ms);
    mClock.advance(1s);
    mStatistics.dequeued(second, 1495ms); // 1 s at the head, three times as long in all
    mClock.advance(1234567ns);

    EXPECT_EQ(dump(), "Max Size (HWM): 500 B\n"
                      "Pending:        1 (300 B)\n"
                      "Dropped:        2 (600 B)\n"
                      "Completed:      2 (300 B)\n"
                      "Throughput:     1 m/s (200 B/s)\n"
                      "Head Wait:      1234 us\n"
                      "Latency Buckets:\n"
                      "              Enqueue      Dequeue      E2E         \n"
                      "  0-1ms:      1            0            0           \n"
                      "  1-10ms:     1            0            0           \n"
                      "  10-100ms:   1            0            0           \n"
                      "  100-1000ms: 0            2            1           \n"
                      "  1-10s:      0            0            1           \n"
                      "  10+s:       0            0            0           \n"
                      "Maximum Latency:\n"
                      "  [CID=0x00000002 FN=0x6002 OP=0x8405 T=1495000us]\n"
                      "  [CID=0x00000001 FN=0x6001 OP=0x0001 T=500000us]\n"
                      "Latency Events:\n"
                      "  (A) [2024-01-02 03:04:05 - 2024-01-02 03:04:06 UTC]\n"
                      "      Duration:       000d:00h:00m:01.000s\n"
                      "      First:          [CID=0x00000001 FN=0x6001 OP=0x0001 T=500000us]\n"
                      "      Last:           [CID=0x00000002 FN=0x6002 OP=0x8405 T=1495000us]\n"
                      "      Completed:      2 (300 B)\n"
                      "      Max Latency:    1495000 us\n"
                      "      Avg Latency:    997500 us\n");
}

TEST_F(QelMessageQueueStatisticsTest, GiveTheirFiguresToPrograms)
{
    const SizedMessage small(100);
    const SizedMessage large(200);
    mStatistics.enqueued(small, nanoseconds(0));
    mStatistics.enqueued(large, nanoseconds(0));
    mStatistics.dropped(large);
    mStatistics.dequeued(small, 2ms);
    EXPECT_EQ(mStatistics.getMaxPendingBytes(), 300U);
    EXPECT_EQ(mStatistics.getCompleted().mCount, 1U);
    EXPECT_EQ(mStatistics.getCompleted().mBytes, 100U);
    EXPECT_EQ(mStatistics.getDropped().mCount, 1U);
    EXPECT_EQ(mStatistics.getDropped().mBytes, 200U);
    EXPECT_THAT(mStatistics.getE2ELatency().getCounts(), testing::ElementsAre(0, 1, 0, 0, 0, 0));
}

TEST_F(QelMessageQueueStatisticsTest, PendingCountsMessagesInTheQueue)
{
    EXPECT_EQ(mStatistics.getPending().mCount, 0U);
    EXPECT_EQ(mStatistics.getPending().mBytes, 0U);
    mStatistics.enqueued(SizedMessage(100), 0ns);
    mStatistics.enqueued(SizedMessage(50), 0ns);
    EXPECT_EQ(mStatistics.getPending().mCount, 2U);
    EXPECT_EQ(mStatistics.getPending().mBytes, 150U);
    mStatistics.dequeued(SizedMessage(100), 0ns);
    EXPECT_EQ(mStatistics.getPending().mCount, 1U);
    EXPECT_EQ(mStatistics.getPending().mBytes, 50U);
}

TEST_F(QelMessageQueueStatisticsTest, TheHighWaterMarkDoesNotFall)
{
    mStatistics.enqueued(SizedMessage(100), 0ns);
    mStatistics.enqueued(SizedMessage(50), 0ns);
    mStatistics.dequeued(SizedMessage(100), 0ns);
    EXPECT_THAT(dump(), StartsWith("Max Size (HWM): 150 B\n"));
    mStatistics.enqueued(SizedMessage(100), 0ns);
    EXPECT_THAT(dump(), StartsWith("Max Size (HWM): 150 B\n"));
    mStatistics.enqueued(SizedMessage(32), 0ns);
    EXPECT_THAT(dump(), StartsWith("Max Size (HWM): 182 B\n"));
}

TEST_F(QelMessageQueueStatisticsTest, ADropChangesNothingElse)
{
    mStatistics.dropped(SizedMessage(100));
    std::string expected = kNothingYet;
    expected.replace(expected.find("Dropped:        0 (0 B)"), 23, "Dropped:        1 (100 B)");
    EXPECT_EQ(dump(), expected);
    EXPECT_EQ(mClock.steadyReads(), 0U);
}

TEST_F(QelMessageQueueStatisticsTest, TheHeadWaitStartsWhenThePreviousMessageLeaves)
{
    mStatistics.enqueued(SizedMessage(32), 0ns);
    mStatistics.enqueued(SizedMessage(32), 0ns);
    mClock.advance(20s);
    mStatistics.dequeued(SizedMessage(32), 20s);
    mClock.advance(1ms);
    mStatistics.dequeued(SizedMessage(32), 20s); // 20 s in the queue, but at its head only 1 ms
    EXPECT_THAT(dump(), HasSubstr("  0-1ms:      2            1            0           \n"));
    EXPECT_THAT(dump(), HasSubstr("  10+s:       0            1            2           \n"));
}

TEST_F(QelMessageQueueStatisticsTest, TheHeadWaitRestartsAfterTheQueueWasEmpty)
{
    mStatistics.enqueued(SizedMessage(32), 0ns);
    mStatistics.dequeued(SizedMessage(32), 0ns);
    mClock.advance(1h);
    mStatistics.enqueued(SizedMessage(32), 0ns);
    mClock.advance(7us);
    EXPECT_THAT(dump(), HasSubstr("\nHead Wait:      7 us\n"));
    mStatistics.dequeued(SizedMessage(32), 0ns);
    EXPECT_THAT(dump(), HasSubstr("  0-1ms:      2            2            2           \n"));
}

TEST_F(QelMessageQueueStatisticsTest, ALaterMessageDoesNotBecomeTheHead)
{
    mStatistics.enqueued(SizedMessage(32), 0ns);
    mClock.advance(5us);
    mStatistics.enqueued(SizedMessage(32), 0ns);
    mClock.advance(2us);
    EXPECT_THAT(dump(), HasSubstr("\nHead Wait:      7 us\n"));
}

TEST_F(QelMessageQueueStatisticsTest, TheHeadWaitIsOmittedForAnEmptyQueue)
{
    EXPECT_THAT(dump(), Not(HasSubstr("Head Wait")));
    mStatistics.enqueued(SizedMessage(32), 0ns);
    EXPECT_THAT(dump(), HasSubstr("Throughput:     0 m/s (0 B/s)\nHead Wait:      0 us\nLatency Buckets:\n"));
    mStatistics.dequeued(SizedMessage(32), 0ns);
    EXPECT_THAT(dump(), Not(HasSubstr("Head Wait")));
}

TEST_F(QelMessageQueueStatisticsTest, TheHeadWaitIsMeasuredAtTheDump)
{
    mStatistics.enqueued(SizedMessage(32), 0ns);
    mClock.advance(1234567ns);
    EXPECT_THAT(dump(), HasSubstr("\nHead Wait:      1234 us\n"));
    mClock.advance(1ms);
    EXPECT_THAT(dump(), HasSubstr("\nHead Wait:      2234 us\n"));
}

TEST_F(QelMessageQueueStatisticsTest, ThroughputIsPerSecondOfANonEmptyQueue)
{
    mStatistics.enqueued(SizedMessage(100), 0ns);
    mClock.advance(2ms);
    mStatistics.dequeued(SizedMessage(100), 2ms);
    mClock.advance(1h); // the queue is empty
    mStatistics.enqueued(SizedMessage(50), 0ns);
    mClock.advance(1ms);
    mStatistics.dequeued(SizedMessage(50), 1ms);
    const QelMessageThroughput throughput = mStatistics.getThroughput();
    EXPECT_EQ(throughput.mPerSecond.mCount, 666U); // 2 in 3 ms, rounded down
    EXPECT_EQ(throughput.mPerSecond.mBytes, 50000U);
    EXPECT_THAT(dump(), HasSubstr("\nThroughput:     666 m/s (50000 B/s)\n"));
}

TEST_F(QelMessageQueueStatisticsTest, ThroughputIsZeroBeforeAnyTimeHasPassed)
{
    mStatistics.enqueued(SizedMessage(100), 0ns);
    mStatistics.dequeued(SizedMessage(100), 0ns);
    EXPECT_EQ(toString(mStatistics.getThroughput()), "0 m/s (0 B/s)");
}

// The product exceeds 2^64 from 18446744073 bytes on. A hundred frames with a length field of 200 MB reach that.
TEST_F(QelMessageQueueStatisticsTest, TheProductOfBytesAndNanosecondsWraps)
{
    class Huge : public QelMessage {
    public:
        Huge() { pGetHeader()->mMsgLength = 200000000; }
    };
    const Huge huge;
    for (int i = 0; i < 100; ++i) {
        mStatistics.enqueued(huge, 0ns);
        mClock.advance(1s);
        mStatistics.dequeued(huge, 0ns);
    }
    // (100 * 200000000 * 10^9 mod 2^64) / (100 * 10^9)
    EXPECT_EQ(toString(mStatistics.getThroughput()), "1 m/s (15532559 B/s)");
}

TEST_F(QelMessageQueueStatisticsTest, AFullHistoryOfKindsAndEventsIsPrinted)
{
    for (unsigned short kind = 1; kind <= 9; ++kind) {
        mStatistics.enqueued(SizedMessage(32, kind, kind, kind), 0ns);
        mStatistics.dequeued(SizedMessage(32, kind, kind, kind), 250ms * kind);
        mClock.advance(10s);
        mStatistics.enqueued(SizedMessage(32), 0ns);
        mStatistics.dequeued(SizedMessage(32), 0ns);
    }
    const std::string text = dump();
    EXPECT_THAT(text, HasSubstr("Maximum Latency:\n  [CID=0x00000009 FN=0x0009 OP=0x0009 T=2250000us]\n"));
    EXPECT_THAT(text, HasSubstr("T=500000us]\nLatency Events:\n  (C) [2024-01-02 03:05:25 - "));
}

// Deliberate: the first entry is not valid, so the list is omitted; the event is printed.
TEST_F(QelMessageQueueStatisticsTest, ASlowMessageWithoutOperationHidesTheListOfTheSlowest)
{
    mStatistics.enqueued(SizedMessage(32, 1, 0x6003, 0), 0ns);
    mStatistics.dequeued(SizedMessage(32, 1, 0x6003, 0), 1s);
    EXPECT_THAT(dump(), Not(HasSubstr("Maximum Latency")));
    EXPECT_THAT(dump(), HasSubstr("\nLatency Events:\n  (A) "));
}

TEST_F(QelMessageQueueStatisticsTest, PrintTheSameTwiceOnOneStreamAndAfterAHexadecimalValue)
{
    mStatistics.enqueued(SizedMessage(100, 0xABC), 0ns);
    mStatistics.dequeued(SizedMessage(100, 0xABC), 300ms);
    const std::string once = dump();
    std::ostringstream os;
    os << hexFormat(0xABU);
    os.str("");
    mStatistics.dump(os, Indent(0, ' '));
    mStatistics.dump(os, Indent(0, ' '));
    EXPECT_EQ(os.str(), once + once);
    os.str("");
    os << hexFormat(0x2AU);
    EXPECT_EQ(os.str(), "0x0000002A");
}

TEST_F(QelMessageQueueStatisticsTest, ReadTheClocksNoMoreThanNeeded)
{
    mStatistics.enqueued(SizedMessage(32), 0ns); // becomes the head
    EXPECT_EQ(mClock.steadyReads(), 1U);
    mStatistics.enqueued(SizedMessage(32), 0ns); // does not
    EXPECT_EQ(mClock.steadyReads(), 1U);
    mStatistics.dequeued(SizedMessage(32), 0ns);
    EXPECT_EQ(mClock.steadyReads(), 2U);
    EXPECT_EQ(mClock.systemReads(), 0U);
    mStatistics.dequeued(SizedMessage(32), 300ms); // begins an event
    EXPECT_EQ(mClock.steadyReads(), 4U);
    EXPECT_EQ(mClock.systemReads(), 1U);
    dump(); // the queue is empty
    EXPECT_EQ(mClock.steadyReads(), 4U);
    mStatistics.enqueued(SizedMessage(32), 0ns);
    dump();
    EXPECT_EQ(mClock.steadyReads(), 6U);
    EXPECT_EQ(mClock.systemReads(), 1U);
}

TEST_F(QelMessageQueueStatisticsTest, UpdatesDoNotAllocate)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const SizedMessage message(100, 1);
    const SizedMessage other(100, 1, 1, 2);
    std::size_t count = std::numeric_limits<std::size_t>::max();
    {
        const Allocations allocations;
        for (int i = 0; i < 12; ++i) { // more events than are kept
            mStatistics.enqueued(message, 1ms * i);
            mStatistics.enqueued(other, 1s * i);
            mStatistics.dropped(message);
            mStatistics.dequeued(message, 300ms); // opens an event or extends it
            mStatistics.dequeued(other, 200ms);   // joins it
            mClock.advance(10s);
            mStatistics.enqueued(message, 0ns);
            mStatistics.dequeued(message, 0ns); // closes it
        }
        count = allocations.count();
    }
    EXPECT_EQ(count, 0U);
    EXPECT_THAT(dump(), HasSubstr("Completed:      36 (3600 B)"));
}

// Whichever reading of the clocks fails, nothing is counted.

TEST(QelMessageQueueStatisticsFailure, AClockThatFailsInEnqueuedChangesNothing)
{
    ThrowingClock clock;
    QelMessageQueueStatistics statistics;
    clock.failAfter(0);
    EXPECT_THROW(statistics.enqueued(SizedMessage(32), 1s), std::runtime_error);
    EXPECT_EQ(dumpOf(statistics), kNothingYet);
}

TEST(QelMessageQueueStatisticsFailure, AClockThatFailsInDequeuedChangesNothing)
{
    ThrowingClock clock;
    QelMessageQueueStatistics statistics;
    statistics.enqueued(SizedMessage(32), 0ns);
    const std::string before = dumpOf(statistics);
    for (int readings = 0; readings < 3; ++readings) { // the head's, and the two of a new event
        clock.failAfter(readings);
        EXPECT_THROW(statistics.dequeued(SizedMessage(32), 300ms), std::runtime_error);
        clock.work();
        EXPECT_EQ(dumpOf(statistics), before) << readings;
    }
    statistics.dequeued(SizedMessage(32), 300ms);
    EXPECT_EQ(statistics.getPending().mCount, 0U);

    statistics.enqueued(SizedMessage(32), 0ns);
    const std::string open = dumpOf(statistics);
    for (int readings = 0; readings < 3; ++readings) { // the head's, and the two of an open event
        clock.failAfter(readings);
        EXPECT_THROW(statistics.dequeued(SizedMessage(32), 300ms), std::runtime_error);
        clock.work();
        EXPECT_EQ(dumpOf(statistics), open) << readings;
    }
}

} // namespace
} // namespace qel
