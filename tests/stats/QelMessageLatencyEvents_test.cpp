#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageLatencyEvents.hpp>

#include "support/SettableClock.hpp"
#include "support/SizedMessage.hpp"

#include <chrono>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <sstream>
#include <string>

namespace qel {
namespace {

using namespace std::chrono_literals;
using std::chrono::nanoseconds;
using std::chrono::system_clock;
using test::SettableClock;
using test::SizedMessage;
using testing::HasSubstr;
using testing::StartsWith;

class QelMessageLatencyEventsTest : public testing::Test {
protected:
    /// One message of 100 bytes whose caller id is that number.
    void trace(unsigned int number, nanoseconds latency) { mEvents.trace(SizedMessage(100, number), latency); }

    std::string printed(const Indent& indent = Indent(0, ' ')) const
    {
        std::ostringstream os;
        mEvents.dump(os, indent);
        return os.str();
    }

    /// State, first and last caller id, and number of messages of each event that is printed: "A1-3x5 C7-7x1".
    std::string shortForm() const
    {
        std::istringstream lines(printed());
        std::string result;
        for (std::string line; std::getline(lines, line);) {
            unsigned int number = 0;
            if (line[0] == '(') {
                if (!result.empty()) result += ' ';
                result += line[1];
            } else if (std::sscanf(line.c_str(), "    First:          [CID=0x%x", &number) == 1) {
                result += std::to_string(number) + "-";
            } else if (std::sscanf(line.c_str(), "    Last:           [CID=0x%x", &number) == 1) {
                result += std::to_string(number);
            } else if (std::sscanf(line.c_str(), "    Completed:      %u ", &number) == 1) {
                result += "x" + std::to_string(number);
            }
        }
        return result;
    }

    SettableClock mClock;
    QelMessageLatencyEvents mEvents;
};

TEST_F(QelMessageLatencyEventsTest, IsEmptyAtFirst)
{
    EXPECT_TRUE(mEvents.empty());
    EXPECT_EQ(printed(), "");
}

TEST_F(QelMessageLatencyEventsTest, SlowIsAQuarterOfASecondAndTenSecondsCloseAnEvent)
{
    EXPECT_EQ(QelMessageLatencyEvents::THRESHOLD, nanoseconds(250000000));
    EXPECT_EQ(QelMessageLatencyEvents::ESCAPE_INTERVAL, nanoseconds(10000000000));
}

TEST_F(QelMessageLatencyEventsTest, FastMessagesOpenNoEvent)
{
    trace(1, 249999999ns);
    trace(2, 0ns);
    trace(3, -1ns);
    EXPECT_TRUE(mEvents.empty());
    EXPECT_EQ(mClock.steadyReads(), 0U);
    EXPECT_EQ(mClock.systemReads(), 0U);
}

TEST_F(QelMessageLatencyEventsTest, AMessageAtTheThresholdOpensAnEvent)
{
    trace(42, 250000000ns);
    EXPECT_FALSE(mEvents.empty());
    EXPECT_EQ(printed(), "(A) [2024-01-02 03:04:05 - 2024-01-02 03:04:05 UTC]\n"
                         "    Duration:       000d:00h:00m:00.000s\n"
                         "    First:          [CID=0x0000002A FN=0x6003 OP=0x8001 T=250000us]\n"
                         "    Last:           [CID=0x0000002A FN=0x6003 OP=0x8001 T=250000us]\n"
                         "    Completed:      1 (100 B)\n"
                         "    Max Latency:    250000 us\n"
                         "    Avg Latency:    250000 us\n");
}

TEST_F(QelMessageLatencyEventsTest, LinesOfFiguresAreIndentedByFourMore)
{
    trace(1, 300ms);
    const std::string text = printed(Indent(2, '.'));
    EXPECT_THAT(text, StartsWith("..(A) [2024-01-02 03:04:05 - 2024-01-02 03:04:05 UTC]\n......Duration:       000d"));
    EXPECT_THAT(text, HasSubstr("\n......First:          [CID=0x00000001 "));
    EXPECT_THAT(text, HasSubstr("\n......Last:           [CID=0x00000001 "));
    EXPECT_THAT(text, HasSubstr("\n......Completed:      1 (100 B)\n"));
    EXPECT_THAT(text, HasSubstr("\n......Max Latency:    300000 us\n"));
    EXPECT_THAT(text, HasSubstr("\n......Avg Latency:    300000 us\n"));
}

TEST_F(QelMessageLatencyEventsTest, AnotherSlowMessageExtendsTheEvent)
{
    trace(1, 300ms);
    mClock.advance(24h + 2h + 3min + 4s + 567ms);
    trace(2, 400ms + 2us);
    mClock.advance(1s);
    trace(3, 251ms);
    EXPECT_EQ(printed(), "(A) [2024-01-02 03:04:05 - 2024-01-03 05:07:10 UTC]\n"
                         "    Duration:       001d:02h:03m:05.567s\n"
                         "    First:          [CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                         "    Last:           [CID=0x00000003 FN=0x6003 OP=0x8001 T=251000us]\n"
                         "    Completed:      3 (300 B)\n"
                         "    Max Latency:    400002 us\n"
                         "    Avg Latency:    317000 us\n");
}

TEST_F(QelMessageLatencyEventsTest, AMessageAtTheThresholdExtendsAnEventAndOneBelowIsPending)
{
    trace(1, 300ms);
    trace(2, 249999999ns);
    EXPECT_EQ(shortForm(), "A1-1x1");
    trace(3, 250000000ns);
    EXPECT_EQ(shortForm(), "A1-3x3");
    mClock.advance(10s);
    trace(4, 250000000ns); // slow, so it closes nothing
    EXPECT_EQ(shortForm(), "A1-4x4");
    mClock.advance(10s);
    trace(5, 249999999ns);
    EXPECT_EQ(shortForm(), "C1-4x4");
}

TEST_F(QelMessageLatencyEventsTest, FastMessagesCountWhenASlowOneFollows)
{
    trace(1, 300ms);
    trace(2, 100ms);
    trace(3, 249999999ns);
    EXPECT_EQ(shortForm(), "A1-1x1");
    trace(4, 350ms + 1ns);
    EXPECT_EQ(shortForm(), "A1-4x4");
    EXPECT_THAT(printed(), HasSubstr("Completed:      4 (400 B)\n    Max Latency:    350000 us\n"
                                     "    Avg Latency:    250000 us\n")); // (300 + 100 + 250 + 350) / 4
    trace(5, 260ms);
    EXPECT_EQ(shortForm(), "A1-5x5"); // they are counted once
}

TEST_F(QelMessageLatencyEventsTest, TheFirstFastMessageAfterTenSecondsClosesTheEvent)
{
    trace(1, 300ms);
    mClock.advance(10s - 1ns);
    trace(2, 1ms);
    EXPECT_EQ(shortForm(), "A1-1x1");
    mClock.advance(1ns);
    trace(3, 1ms);
    EXPECT_EQ(shortForm(), "C1-1x1"); // neither of the two fast ones is counted
    EXPECT_THAT(printed(), StartsWith("(C) [2024-01-02 03:04:05 - 2024-01-02 03:04:05 UTC]\n")); // nor moves its end
}

TEST_F(QelMessageLatencyEventsTest, EverySlowMessageRestartsTheTenSeconds)
{
    trace(1, 300ms);
    mClock.advance(9s);
    trace(2, 300ms);
    mClock.advance(9s);
    trace(3, 1ms);
    EXPECT_EQ(shortForm(), "A1-2x2");
    mClock.advance(1s);
    trace(4, 1ms);
    EXPECT_EQ(shortForm(), "C1-2x2");
    EXPECT_THAT(printed(), StartsWith("(C) [2024-01-02 03:04:05 - 2024-01-02 03:04:14 UTC]\n"));
}

TEST_F(QelMessageLatencyEventsTest, ASlowMessageAfterTenSecondsExtendsAnOpenEvent)
{
    trace(1, 300ms);
    mClock.advance(1h);
    trace(2, 300ms);
    EXPECT_EQ(shortForm(), "A1-2x2");
}

TEST_F(QelMessageLatencyEventsTest, FastMessagesAfterTheLastSlowOneAreDropped)
{
    trace(1, 300ms);
    trace(2, 200ms);
    mClock.advance(10s);
    trace(3, 1ms); // closes
    trace(4, 200ms);
    trace(5, 300ms); // opens another
    EXPECT_EQ(shortForm(), "A5-5x1 C1-1x1");
    trace(6, 300ms);
    EXPECT_EQ(shortForm(), "A5-6x2 C1-1x1");
}

TEST_F(QelMessageLatencyEventsTest, FastMessagesOutsideAnEventAreNotCounted)
{
    trace(1, 300ms);
    mClock.advance(10s);
    trace(2, 1ms); // closes
    trace(3, 1ms);
    mClock.advance(10s);
    trace(4, 1ms);
    EXPECT_EQ(shortForm(), "C1-1x1");
}

TEST_F(QelMessageLatencyEventsTest, TheLastFiveArePrintedNewestFirst)
{
    for (unsigned int number = 1; number <= 6; ++number) {
        trace(number, 300ms);
        mClock.advance(10s);
        trace(100, 1ms);
    }
    EXPECT_EQ(shortForm(), "C6-6x1 C5-5x1 C4-4x1 C3-3x1 C2-2x1");
    trace(7, 300ms);
    EXPECT_EQ(shortForm(), "A7-7x1 C6-6x1 C5-5x1 C4-4x1 C3-3x1");
}

TEST_F(QelMessageLatencyEventsTest, TimesAreRoundedDownToSecondsButNotTheDuration)
{
    mClock.setSystem(system_clock::time_point(std::chrono::duration_cast<system_clock::duration>(999999999ns)));
    trace(1, 300ms);
    mClock.advance(1ms);
    trace(2, 300ms);
    EXPECT_THAT(printed(), StartsWith("(A) [1970-01-01 00:00:00 - 1970-01-01 00:00:01 UTC]\n"
                                      "    Duration:       000d:00h:00m:00.001s\n"));
}

TEST_F(QelMessageLatencyEventsTest, TheDurationIsTruncatedToMilliseconds)
{
    trace(1, 300ms);
    mClock.advance(1999999ns);
    trace(2, 300ms);
    EXPECT_THAT(printed(), HasSubstr("Duration:       000d:00h:00m:00.001s\n"));
}

TEST_F(QelMessageLatencyEventsTest, LatenciesAreTruncatedToMicroseconds)
{
    trace(1, 300000999ns);
    trace(2, 300001000ns);
    const std::string text = printed(); // the average of 300000.9995 us is truncated to nanoseconds first
    EXPECT_THAT(text, HasSubstr("Max Latency:    300001 us\n    Avg Latency:    300000 us\n"));
}

TEST_F(QelMessageLatencyEventsTest, NegativeLatenciesAreAdded)
{
    trace(1, 300ms);
    trace(2, -900ms);
    trace(3, 300ms);
    EXPECT_THAT(printed(), HasSubstr("Max Latency:    300000 us\n    Avg Latency:    -100000 us\n"));
}

TEST_F(QelMessageLatencyEventsTest, ReadsTheClocksNoMoreThanNeeded)
{
    trace(1, 300ms); // opens: one reading of each
    EXPECT_EQ(mClock.steadyReads(), 1U);
    EXPECT_EQ(mClock.systemReads(), 1U);
    trace(2, 1ms); // fast: checks the timeout
    EXPECT_EQ(mClock.steadyReads(), 2U);
    EXPECT_EQ(mClock.systemReads(), 1U);
    trace(3, 300ms); // extends
    EXPECT_EQ(mClock.steadyReads(), 3U);
    EXPECT_EQ(mClock.systemReads(), 2U);
    mClock.advance(10s);
    trace(4, 1ms); // closes
    EXPECT_EQ(mClock.steadyReads(), 4U);
    EXPECT_EQ(mClock.systemReads(), 2U);
    trace(5, 1ms); // no event is open
    EXPECT_EQ(mClock.steadyReads(), 4U);
    printed();
    EXPECT_EQ(mClock.steadyReads(), 4U);
    EXPECT_EQ(mClock.systemReads(), 2U);
}

TEST_F(QelMessageLatencyEventsTest, PrintsTheSameTwiceOnOneStream)
{
    trace(0xABC, 300ms);
    std::ostringstream os;
    mEvents.dump(os, Indent(2, ' '));
    const std::string once = os.str();
    mEvents.dump(os, Indent(2, ' '));
    EXPECT_EQ(os.str(), once + once);
}

// A single event.

using Entry = QelMessageLatencyEvents::Entry;

TEST(QelMessageLatencyEventsEntry, ExtendingAddsThePendingMessages)
{
    const system_clock::time_point begin(0s);
    Entry entry(SizedMessage(40, 1), 300ms, begin);
    QelMessageLatencyEvents::PendingData pending;
    pending.mCompleted.mCount = 3;
    pending.mCompleted.mBytes = 200;
    pending.mTotalLatency = 100ms;
    entry.extendEvent(SizedMessage(60, 2), 400ms, pending, begin + 5s);
    EXPECT_EQ(pending.mCompleted.mCount, 0U);
    EXPECT_EQ(pending.mCompleted.mBytes, 0U);
    EXPECT_EQ(pending.mTotalLatency, 0ns);

    std::ostringstream os;
    entry.dump(os, Indent(0, ' '));
    EXPECT_EQ(os.str(), "(A) [1970-01-01 00:00:00 - 1970-01-01 00:00:05 UTC]\n"
                        "    Duration:       000d:00h:00m:05.000s\n"
                        "    First:          [CID=0x00000001 FN=0x6003 OP=0x8001 T=300000us]\n"
                        "    Last:           [CID=0x00000002 FN=0x6003 OP=0x8001 T=400000us]\n"
                        "    Completed:      5 (300 B)\n"
                        "    Max Latency:    400000 us\n"
                        "    Avg Latency:    160000 us\n");
}

TEST(QelMessageLatencyEventsEntry, EndsOnce)
{
    Entry entry(SizedMessage(40, 1), 300ms, system_clock::time_point());
    EXPECT_TRUE(entry.isActive());
    entry.endEvent();
    EXPECT_FALSE(entry.isActive());
    std::ostringstream os;
    entry.dump(os, Indent(0, ' '));
    EXPECT_THAT(os.str(), StartsWith("(C) "));
}

TEST(QelMessageLatencyEventsEntry, TheAverageOfNoMessagesIsZero)
{
    Entry entry(SizedMessage(40, 1), 300ms, system_clock::time_point());
    QelMessageLatencyEvents::PendingData pending;
    pending.mCompleted.mCount = std::numeric_limits<std::uint64_t>::max() - 1; // with two more it wraps to zero
    entry.extendEvent(SizedMessage(40, 1), 300ms, pending, system_clock::time_point());
    std::ostringstream os;
    entry.dump(os, Indent(0, ' '));
    EXPECT_THAT(os.str(), HasSubstr("Completed:      0 (80 B)\n    Max Latency:    300000 us\n"
                                    "    Avg Latency:    0 us\n"));
}

} // namespace
} // namespace qel
