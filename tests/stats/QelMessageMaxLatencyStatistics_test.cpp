#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageMaxLatencyStatistics.hpp>

#include "support/SizedMessage.hpp"

#include <chrono>
#include <gtest/gtest.h>
#include <sstream>
#include <string>

namespace qel {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using test::SizedMessage;

class QelMessageMaxLatencyStatisticsTest : public testing::Test {
protected:
    /// One message with operation 1.
    void trace(unsigned int callerId, unsigned short function, nanoseconds latency)
    {
        mList.trace(SizedMessage(32, callerId, function, 1), latency);
    }

    /// Function, caller id and milliseconds of each entry that is printed: "F1#5=300 F2#6=250".
    std::string shortForm() const
    {
        std::istringstream lines(printed());
        std::string result;
        for (std::string line; std::getline(lines, line);) {
            unsigned int callerId = 0;
            unsigned int function = 0;
            unsigned int operation = 0;
            long long microseconds = 0;
            EXPECT_EQ(std::sscanf(line.c_str(), "[CID=0x%x FN=0x%x OP=0x%x T=%lldus]", &callerId, &function, &operation,
                                  &microseconds),
                      4)
                << line;
            if (!result.empty()) result += ' ';
            result += "F" + std::to_string(function) + "#" + std::to_string(callerId) + "=" +
                      std::to_string(microseconds / 1000);
        }
        return result;
    }

    std::string printed(const Indent& indent = Indent(0, ' ')) const
    {
        std::ostringstream os;
        mList.dump(os, indent);
        return os.str();
    }

    /// Eight kinds, functions 8 (800 ms) down to 1 (100 ms more each; the least slow has 300 ms).
    void fill()
    {
        for (unsigned short function = 1; function <= 8; ++function) {
            trace(function, function, milliseconds(200 + 100 * function));
        }
        ASSERT_EQ(shortForm(), kFull);
    }

    static constexpr const char* kFull = "F8#8=1000 F7#7=900 F6#6=800 F5#5=700 F4#4=600 F3#3=500 F2#2=400 F1#1=300";

    QelMessageMaxLatencyStatistics mList;
};

TEST_F(QelMessageMaxLatencyStatisticsTest, IsEmptyAtFirst)
{
    EXPECT_TRUE(mList.empty());
    EXPECT_EQ(printed(), "");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, TheThresholdIsAQuarterOfASecond)
{
    EXPECT_EQ(QelMessageMaxLatencyStatistics::THRESHOLD, nanoseconds(250000000));
}

TEST_F(QelMessageMaxLatencyStatisticsTest, JustBelowTheThresholdDoesNotEnter)
{
    trace(1, 1, nanoseconds(249999999));
    trace(1, 1, nanoseconds(-1));
    trace(1, 1, nanoseconds::min());
    EXPECT_TRUE(mList.empty());
}

TEST_F(QelMessageMaxLatencyStatisticsTest, ExactlyTheThresholdEnters)
{
    trace(1, 1, nanoseconds(250000000));
    EXPECT_FALSE(mList.empty());
    EXPECT_EQ(shortForm(), "F1#1=250");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, PrintsALineForEachEntryAfterTheIndent)
{
    mList.trace(SizedMessage(32, 42, 0x6003, 0x8001), nanoseconds(312004000));
    mList.trace(SizedMessage(32, 43, 0x6002, 0x0405), nanoseconds(312005999));
    EXPECT_EQ(printed(Indent(3, '.')), "...[CID=0x0000002B FN=0x6002 OP=0x0405 T=312005us]\n"
                                       "...[CID=0x0000002A FN=0x6003 OP=0x8001 T=312004us]\n");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, KeepsTheEightWorstOfNineRisingKindsWorstFirst)
{
    for (unsigned short function = 1; function <= 9; ++function) {
        trace(function, function, milliseconds(200 + 100 * function));
    }
    EXPECT_EQ(shortForm(), "F9#9=1100 F8#8=1000 F7#7=900 F6#6=800 F5#5=700 F4#4=600 F3#3=500 F2#2=400");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, DropsTheNinthOfNineFallingKinds)
{
    for (unsigned short function = 1; function <= 9; ++function) {
        trace(function, function, milliseconds(2000 - 100 * function));
    }
    EXPECT_EQ(shortForm(), "F1#1=1900 F2#2=1800 F3#3=1700 F4#4=1600 F5#5=1500 F6#6=1400 F7#7=1300 F8#8=1200");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, AFullListAcceptsANewKindOnlyAboveItsLastEntry)
{
    fill();
    trace(9, 9, milliseconds(300));
    EXPECT_EQ(shortForm(), kFull);
    trace(9, 9, milliseconds(300) + nanoseconds(1000000));
    EXPECT_EQ(shortForm(), "F8#8=1000 F7#7=900 F6#6=800 F5#5=700 F4#4=600 F3#3=500 F2#2=400 F9#9=301");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, ANewKindReplacesTheLastEntryAndMovesUp)
{
    fill();
    trace(9, 9, milliseconds(750));
    EXPECT_EQ(shortForm(), "F8#8=1000 F7#7=900 F6#6=800 F9#9=750 F5#5=700 F4#4=600 F3#3=500 F2#2=400");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, ASmallerLatencyOfAListedKindChangesNothing)
{
    fill();
    trace(99, 5, milliseconds(699));
    EXPECT_EQ(shortForm(), kFull);
}

TEST_F(QelMessageMaxLatencyStatisticsTest, AnEqualLatencyOfAListedKindUpdatesTheCallerId)
{
    fill();
    trace(99, 5, milliseconds(700));
    EXPECT_EQ(shortForm(), "F8#8=1000 F7#7=900 F6#6=800 F5#99=700 F4#4=600 F3#3=500 F2#2=400 F1#1=300");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, AnEqualLatencyOfTheLastEntryOfAFullListChangesNothing)
{
    fill();
    trace(99, 1, milliseconds(300)); // not above the last entry, so it is not looked up
    EXPECT_EQ(shortForm(), kFull);
}

TEST_F(QelMessageMaxLatencyStatisticsTest, ALargerLatencyOfAListedKindMovesItUp)
{
    fill();
    trace(99, 2, milliseconds(850));
    EXPECT_EQ(shortForm(), "F8#8=1000 F7#7=900 F2#99=850 F6#6=800 F5#5=700 F4#4=600 F3#3=500 F1#1=300");
    trace(100, 1, milliseconds(5000));
    EXPECT_EQ(shortForm(), "F1#100=5000 F8#8=1000 F7#7=900 F2#99=850 F6#6=800 F5#5=700 F4#4=600 F3#3=500");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, OfEqualLatenciesTheOlderComesFirst)
{
    trace(1, 1, milliseconds(500));
    trace(2, 2, milliseconds(500));
    trace(3, 3, milliseconds(600));
    trace(4, 4, milliseconds(500));
    EXPECT_EQ(shortForm(), "F3#3=600 F1#1=500 F2#2=500 F4#4=500");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, AKindThatMovesUpComesAfterEqualOnes)
{
    trace(1, 1, milliseconds(500));
    trace(2, 2, milliseconds(500));
    trace(3, 3, milliseconds(300));
    trace(4, 3, milliseconds(500));
    EXPECT_EQ(shortForm(), "F1#1=500 F2#2=500 F3#4=500");
    trace(5, 1, milliseconds(500)); // stays where it is, too
    EXPECT_EQ(shortForm(), "F1#5=500 F2#2=500 F3#4=500");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, KindsDifferByFunctionAndByOperation)
{
    mList.trace(SizedMessage(32, 1, 5, 6), milliseconds(500));
    mList.trace(SizedMessage(32, 2, 5, 7), milliseconds(400));
    mList.trace(SizedMessage(32, 3, 6, 6), milliseconds(300));
    EXPECT_EQ(printed(), "[CID=0x00000001 FN=0x0005 OP=0x0006 T=500000us]\n"
                         "[CID=0x00000002 FN=0x0005 OP=0x0007 T=400000us]\n"
                         "[CID=0x00000003 FN=0x0006 OP=0x0006 T=300000us]\n");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, ARequestAndItsResponseAreOfOneKind)
{
    mList.trace(QelMessage(1, 5, 6, MsgResponseExpected), milliseconds(500));
    mList.trace(QelMessage(2, 5, 6, MsgResponse), milliseconds(501));
    EXPECT_EQ(printed(), "[CID=0x00000002 FN=0x0005 OP=0x0006 T=501000us]\n");
}

// Deliberate: printing stops at an entry that is not valid.

TEST_F(QelMessageMaxLatencyStatisticsTest, AFirstEntryWithoutOperationHidesTheWholeList)
{
    trace(1, 1, milliseconds(500));
    mList.trace(SizedMessage(32, 2, 7, 0), milliseconds(1000));
    EXPECT_TRUE(mList.empty());
    EXPECT_EQ(printed(), "");
    trace(3, 3, milliseconds(2000)); // until something slower comes
    EXPECT_FALSE(mList.empty());
    EXPECT_EQ(shortForm(), "F3#3=2000");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, AnEntryWithoutFunctionHidesTheEntriesAfterIt)
{
    trace(1, 1, milliseconds(500));
    trace(2, 2, milliseconds(300));
    mList.trace(SizedMessage(32, 2, 0, 7), milliseconds(400));
    EXPECT_EQ(shortForm(), "F1#1=500");
}

TEST_F(QelMessageMaxLatencyStatisticsTest, AKindWithoutFunctionAndOperationUsesTheFirstFreeSlot)
{
    trace(1, 1, milliseconds(500));
    mList.trace(SizedMessage(32, 2, 0, 0), milliseconds(400));
    trace(3, 3, milliseconds(300));
    EXPECT_EQ(shortForm(), "F1#1=500");
    mList.trace(SizedMessage(32, 2, 0, 0), milliseconds(600)); // the entry is found and moves up
    EXPECT_TRUE(mList.empty());
    trace(4, 3, milliseconds(700));
    trace(5, 1, milliseconds(650));
    EXPECT_EQ(shortForm(), "F3#4=700 F1#5=650");
}

} // namespace
} // namespace qel
