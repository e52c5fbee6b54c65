#include "bench/LatencyHistogram.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>

namespace qel::test {

namespace {

using std::chrono::microseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using tool::LatencyHistogram;

std::vector<std::pair<long long, unsigned long>> rowsOf(const LatencyHistogram& histogram)
{
    std::vector<std::pair<long long, unsigned long>> rows;
    for (const auto& row : histogram.rows())
        rows.emplace_back(row.upTo.count(), row.count);
    return rows;
}

using Rows = std::vector<std::pair<long long, unsigned long>>;

TEST(LatencyHistogram, AnEmptyHistogramHasZeros)
{
    const LatencyHistogram histogram;
    EXPECT_EQ(histogram.count(), 0U);
    EXPECT_EQ(histogram.longest(), nanoseconds(0));
    EXPECT_EQ(histogram.percentile(500), nanoseconds(0));
    EXPECT_TRUE(histogram.rows().empty());
}

TEST(LatencyHistogram, UpTo127NanosecondsPercentilesAreExact)
{
    LatencyHistogram histogram;
    for (int i = 1; i <= 100; ++i)
        histogram.record(nanoseconds(i));
    EXPECT_EQ(histogram.percentile(1), nanoseconds(1));
    EXPECT_EQ(histogram.percentile(10), nanoseconds(1));
    EXPECT_EQ(histogram.percentile(11), nanoseconds(2));
    EXPECT_EQ(histogram.percentile(500), nanoseconds(50));
    EXPECT_EQ(histogram.percentile(900), nanoseconds(90));
    EXPECT_EQ(histogram.percentile(990), nanoseconds(99));
    EXPECT_EQ(histogram.percentile(999), nanoseconds(100));
    EXPECT_EQ(histogram.percentile(1000), nanoseconds(100));
}

TEST(LatencyHistogram, APercentileIsNeverTooShortAndAtMostA64thTooLong)
{
    for (std::int64_t value = 1; value > 0 && value < std::numeric_limits<std::int64_t>::max() / 3;
         value = value * 3 + 1) {
        SCOPED_TRACE(value);
        LatencyHistogram histogram;
        histogram.record(nanoseconds(value));
        histogram.record(nanoseconds::max()); // so that the longest does not hide the class
        EXPECT_GE(histogram.percentile(500).count(), value);
        EXPECT_LE(histogram.percentile(500).count() - value, value / 64);
    }
}

TEST(LatencyHistogram, BothEndsOfAClass)
{
    LatencyHistogram histogram;
    histogram.record(nanoseconds(128)); // 128 and 129 are one class, 130 is the next
    histogram.record(nanoseconds(130));
    EXPECT_EQ(histogram.percentile(500), nanoseconds(129));
    EXPECT_EQ(histogram.percentile(1000), nanoseconds(130)); // and not 131, which never was
}

TEST(LatencyHistogram, TheLongestDurationIsCounted)
{
    LatencyHistogram histogram;
    histogram.record(nanoseconds::max());
    EXPECT_EQ(histogram.longest(), nanoseconds::max());
    EXPECT_EQ(histogram.percentile(1000), nanoseconds::max());
    EXPECT_EQ(rowsOf(histogram), (Rows{{nanoseconds::max().count(), 1}}));
}

TEST(LatencyHistogram, ANegativeLatencyCountsAsZero)
{
    LatencyHistogram histogram;
    histogram.record(nanoseconds(-5));
    EXPECT_EQ(histogram.count(), 1U);
    EXPECT_EQ(histogram.percentile(1000), nanoseconds(0));
    EXPECT_EQ(rowsOf(histogram), (Rows{{1000, 1}}));
}

TEST(LatencyHistogram, RowsHaveExactLimits)
{
    LatencyHistogram histogram;
    histogram.record(microseconds(5)); // to 5 us, inclusively
    histogram.record(microseconds(5) + nanoseconds(1));
    histogram.record(microseconds(21));
    histogram.record(microseconds(50));
    EXPECT_EQ(rowsOf(histogram), (Rows{{5000, 1}, {10000, 1}, {20000, 0}, {50000, 2}}));
}

TEST(LatencyHistogram, TheLastRowHasNoLimit)
{
    LatencyHistogram histogram;
    histogram.record(seconds(10));
    histogram.record(seconds(10) + nanoseconds(1));
    EXPECT_EQ(rowsOf(histogram), (Rows{{10000000000, 1}, {nanoseconds::max().count(), 1}}));
}

TEST(LatencyHistogram, HistogramsAreAdded)
{
    LatencyHistogram first;
    LatencyHistogram second;
    first.record(nanoseconds(10));
    second.record(nanoseconds(20));
    second.record(microseconds(3));
    first.add(second);
    EXPECT_EQ(first.count(), 3U);
    EXPECT_EQ(first.percentile(500), nanoseconds(20));
    EXPECT_EQ(first.longest(), microseconds(3));
    EXPECT_EQ(rowsOf(first), (Rows{{1000, 2}, {2000, 0}, {5000, 1}}));
}

} // namespace

} // namespace qel::test
