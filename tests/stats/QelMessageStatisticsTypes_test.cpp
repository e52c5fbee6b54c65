#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageStatisticsTypes.hpp>

#include "support/SizedMessage.hpp"

#include <chrono>
#include <cstdint>
#include <gtest/gtest.h>
#include <limits>
#include <sstream>

namespace qel {
namespace {

using std::chrono::nanoseconds;
using test::SizedMessage;

QelMessageCount count(std::uint64_t messages, std::uint64_t bytes)
{
    QelMessageCount result;
    result.mCount = messages;
    result.mBytes = bytes;
    return result;
}

TEST(QelMessageCount, StartsAtZero)
{
    const QelMessageCount counted;
    EXPECT_EQ(counted.mCount, 0U);
    EXPECT_EQ(counted.mBytes, 0U);
}

TEST(QelMessageCount, AddingAMessageAddsOneAndItsLength)
{
    QelMessageCount counted;
    EXPECT_EQ(&(counted += SizedMessage(32)), &counted);
    EXPECT_EQ(counted.mCount, 1U);
    EXPECT_EQ(counted.mBytes, 32U);
    counted += SizedMessage(1000);
    EXPECT_EQ(counted.mCount, 2U);
    EXPECT_EQ(counted.mBytes, 1032U);
}

TEST(QelMessageCount, SubtractingAMessageUndoesAddingIt)
{
    QelMessageCount counted = count(3, 1032);
    EXPECT_EQ(&(counted -= SizedMessage(1000)), &counted);
    EXPECT_EQ(counted.mCount, 2U);
    EXPECT_EQ(counted.mBytes, 32U);
}

TEST(QelMessageCount, WrapsBelowZero)
{
    QelMessageCount counted;
    counted -= SizedMessage(32);
    EXPECT_EQ(counted.mCount, std::numeric_limits<std::uint64_t>::max());
    EXPECT_EQ(counted.mBytes, std::numeric_limits<std::uint64_t>::max() - 31);
}

TEST(QelMessageCount, CountsAddUpFieldByField)
{
    QelMessageCount counted = count(2, 100);
    EXPECT_EQ(&(counted += count(40, 5)), &counted);
    EXPECT_EQ(counted.mCount, 42U);
    EXPECT_EQ(counted.mBytes, 105U);
}

TEST(QelMessageCount, PrintsMessagesAndBytes) { EXPECT_EQ(toString(count(12, 3456)), "12 (3456 B)"); }

TEST(QelMessageCount, PrintsAll64Bits)
{
    constexpr auto kMax = std::numeric_limits<std::uint64_t>::max();
    EXPECT_EQ(toString(count(kMax, kMax)), "18446744073709551615 (18446744073709551615 B)");
}

TEST(QelMessageCount, PrintsInDecimalAfterAHexadecimalValue)
{
    std::ostringstream os;
    os << hexFormat(std::uint8_t(0x1F)) << ' ' << count(31, 255);
    EXPECT_EQ(os.str(), "0x1F 31 (255 B)");
}

TEST(QelMessageThroughput, StartsAtZero) { EXPECT_EQ(toString(QelMessageThroughput()), "0 m/s (0 B/s)"); }

TEST(QelMessageThroughput, PrintsBothRates)
{
    QelMessageThroughput throughput;
    throughput.mPerSecond = count(12, 3456);
    EXPECT_EQ(toString(throughput), "12 m/s (3456 B/s)");
}

TEST(QelMessageLatency, StartsAtZeroAndIsNotValid)
{
    const QelMessageLatency latency;
    EXPECT_EQ(latency.mCallerID, 0U);
    EXPECT_EQ(latency.mFunction, 0U);
    EXPECT_EQ(latency.mOperation, 0U);
    EXPECT_EQ(latency.mLatency, nanoseconds(0));
    EXPECT_FALSE(latency.isValid());
}

TEST(QelMessageLatency, TakesTheIdentityOfAMessage)
{
    const QelMessageLatency latency(SizedMessage(32, 0xFEDCBA98, 0xFFFE, 0xFFFD), nanoseconds(-7));
    EXPECT_EQ(latency.mCallerID, 0xFEDCBA98U);
    EXPECT_EQ(latency.mFunction, 0xFFFEU);
    EXPECT_EQ(latency.mOperation, 0xFFFDU);
    EXPECT_EQ(latency.mLatency, nanoseconds(-7));
}

TEST(QelMessageLatency, IsValidOnlyWithFunctionAndOperation)
{
    EXPECT_TRUE(QelMessageLatency(SizedMessage(32, 0, 1, 1), nanoseconds(0)).isValid());
    EXPECT_FALSE(QelMessageLatency(SizedMessage(32, 9, 0, 1), nanoseconds(9)).isValid());
    EXPECT_FALSE(QelMessageLatency(SizedMessage(32, 9, 1, 0), nanoseconds(9)).isValid());
    EXPECT_FALSE(QelMessageLatency(SizedMessage(32, 9, 0, 0), nanoseconds(9)).isValid());
}

TEST(QelMessageLatency, PrintsIdentityAndMicroseconds)
{
    const QelMessageLatency latency(SizedMessage(32, 42), nanoseconds(312004999));
    EXPECT_EQ(toString(latency), "[CID=0x0000002A FN=0x6003 OP=0x8001 T=312004us]");
}

TEST(QelMessageLatency, TruncatesToMicroseconds)
{
    EXPECT_EQ(toString(QelMessageLatency(SizedMessage(32, 1, 2, 3), nanoseconds(999))),
              "[CID=0x00000001 FN=0x0002 OP=0x0003 T=0us]");
    EXPECT_EQ(toString(QelMessageLatency(SizedMessage(32, 1, 2, 3), nanoseconds(-1999))),
              "[CID=0x00000001 FN=0x0002 OP=0x0003 T=-1us]");
}

TEST(QelMessageLatency, PrintsTheLatencyInDecimalTwiceOnOneStream)
{
    const QelMessageLatency latency(SizedMessage(32, 10, 11, 12), nanoseconds(255000));
    std::ostringstream os;
    os << latency << latency;
    EXPECT_EQ(os.str(), "[CID=0x0000000A FN=0x000B OP=0x000C T=255us][CID=0x0000000A FN=0x000B OP=0x000C T=255us]");
}

} // namespace
} // namespace qel
