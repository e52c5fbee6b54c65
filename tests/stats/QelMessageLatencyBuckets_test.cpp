#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageLatencyBuckets.hpp>

#include <chrono>
#include <cstdint>
#include <cstring>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iomanip>
#include <iterator>
#include <limits>
#include <sstream>
#include <string>
#include <vector>

namespace qel {
namespace {

using std::chrono::nanoseconds;
using testing::ElementsAre;
using Buckets = QelMessageLatencyBuckets;

/// The six counts, taken from the printed table.
std::vector<std::uint64_t> countsOf(const Buckets& buckets)
{
    Buckets::Table table;
    table.addColumn({"", buckets});
    std::ostringstream os;
    table.dump(os, Indent(0, ' '));
    std::istringstream lines(os.str());
    std::string line;
    std::getline(lines, line);
    std::vector<std::uint64_t> counts;
    while (std::getline(lines, line))
        counts.push_back(std::stoull(line.substr(Buckets::LABEL_WIDTH)));
    return counts;
}

TEST(QelMessageLatencyBuckets, LimitsArePowersOfTenFromOneMillisecondToTenSeconds)
{
    EXPECT_THAT(Buckets::LIMITS, ElementsAre(nanoseconds(1000000), nanoseconds(10000000), nanoseconds(100000000),
                                             nanoseconds(1000000000), nanoseconds(10000000000)));
}

TEST(QelMessageLatencyBuckets, LabelsHaveTheSameWidth)
{
    EXPECT_EQ(Buckets::LABEL_WIDTH, 11U);
    EXPECT_EQ(std::size(Buckets::BUCKET_LABELS), 6U);
    for (const char* label : Buckets::BUCKET_LABELS)
        EXPECT_EQ(std::strlen(label), Buckets::LABEL_WIDTH) << label;
}

TEST(QelMessageLatencyBuckets, GivesItsCountsToPrograms)
{
    Buckets buckets;
    EXPECT_THAT(buckets.getCounts(), ElementsAre(0, 0, 0, 0, 0, 0));
    buckets.increment(std::chrono::milliseconds(1), 2);
    buckets.increment(std::chrono::seconds(11), 3);
    EXPECT_THAT(buckets.getCounts(), ElementsAre(2, 0, 0, 0, 0, 3));
}

TEST(QelMessageLatencyBuckets, StartAtZero) { EXPECT_THAT(countsOf(Buckets()), ElementsAre(0, 0, 0, 0, 0, 0)); }

struct Choice {
    const char* name;
    nanoseconds latency;
    std::size_t bucket;
};

class QelMessageLatencyBucketChoice : public testing::TestWithParam<Choice> {};

TEST_P(QelMessageLatencyBucketChoice, CountsInTheFirstBucketWhoseLimitIsNotExceeded)
{
    Buckets buckets;
    buckets.increment(GetParam().latency, 1);
    std::vector<std::uint64_t> expected(6, 0);
    expected[GetParam().bucket] = 1;
    EXPECT_EQ(countsOf(buckets), expected);
}

INSTANTIATE_TEST_SUITE_P(Limits, QelMessageLatencyBucketChoice,
                         testing::Values(Choice{"Lowest", nanoseconds::min(), 0},
                                         Choice{"Negative", nanoseconds(-1), 0}, Choice{"Zero", nanoseconds(0), 0},
                                         Choice{"OneMillisecond", nanoseconds(1000000), 0},
                                         Choice{"AboveOneMillisecond", nanoseconds(1000001), 1},
                                         Choice{"TenMilliseconds", nanoseconds(10000000), 1},
                                         Choice{"AboveTenMilliseconds", nanoseconds(10000001), 2},
                                         Choice{"HundredMilliseconds", nanoseconds(100000000), 2},
                                         Choice{"AboveHundredMilliseconds", nanoseconds(100000001), 3},
                                         Choice{"OneSecond", nanoseconds(1000000000), 3},
                                         Choice{"AboveOneSecond", nanoseconds(1000000001), 4},
                                         Choice{"TenSeconds", nanoseconds(10000000000), 4},
                                         Choice{"AboveTenSeconds", nanoseconds(10000000001), 5},
                                         Choice{"Highest", nanoseconds::max(), 5}),
                         [](const auto& test) { return test.param.name; });

TEST(QelMessageLatencyBuckets, CountsSeveralAtOnceAndAddsUp)
{
    Buckets buckets;
    buckets.increment(nanoseconds(5), 3);
    buckets.increment(nanoseconds(5), 0);
    buckets.increment(nanoseconds(6), 4);
    buckets.increment(nanoseconds::max(), std::numeric_limits<std::uint64_t>::max());
    EXPECT_THAT(countsOf(buckets), ElementsAre(7, 0, 0, 0, 0, std::numeric_limits<std::uint64_t>::max()));
}

TEST(QelMessageLatencyBucketsTable, PrintsColumnsSideBySideInTheOrderTheyWereAdded)
{
    Buckets first;
    Buckets second;
    first.increment(nanoseconds(1), 1);
    second.increment(nanoseconds(1), 123456789012);
    first.increment(std::chrono::seconds(11), 1234567890123);
    second.increment(std::chrono::seconds(11), 2);

    Buckets::Table table;
    table.addColumn({"One", first});
    table.addColumn({"Another title that is long", second});
    std::ostringstream os;
    table.dump(os, Indent(2, ' '));
    EXPECT_EQ(os.str(), "              One          Another title that is long\n"
                        "  0-1ms:      1            123456789012\n"
                        "  1-10ms:     0            0           \n"
                        "  10-100ms:   0            0           \n"
                        "  100-1000ms: 0            0           \n"
                        "  1-10s:      0            0           \n"
                        "  10+s:       1234567890123 2           \n");
}

TEST(QelMessageLatencyBucketsTable, WithoutColumnsPrintsLabelsOnly)
{
    std::ostringstream os;
    Buckets::Table().dump(os, Indent(1, '\t'));
    EXPECT_EQ(os.str(), "\t           \n"
                        "\t0-1ms:     \n"
                        "\t1-10ms:    \n"
                        "\t10-100ms:  \n"
                        "\t100-1000ms:\n"
                        "\t1-10s:     \n"
                        "\t10+s:      \n");
}

TEST(QelMessageLatencyBucketsTable, ShowsLaterChangesOfItsHistograms)
{
    Buckets buckets;
    Buckets::Table table;
    table.addColumn({"T", buckets});
    buckets.increment(nanoseconds(1), 9);
    std::ostringstream os;
    table.dump(os, Indent(0, ' '));
    EXPECT_THAT(os.str(), testing::HasSubstr("\n0-1ms:      9           \n"));
}

// Hexadecimal formatters leave the fill character '0', upper case and the base.
TEST(QelMessageLatencyBucketsTable, IsPaddedWithBlanksAfterAHexadecimalValue)
{
    Buckets buckets;
    buckets.increment(nanoseconds(1), 31);
    Buckets::Table table;
    table.addColumn({"T", buckets});
    std::ostringstream fresh;
    table.dump(fresh, Indent(0, ' '));

    std::ostringstream os;
    os << hexFormat(std::uint16_t(1));
    os.str("");
    table.dump(os, Indent(0, ' '));
    EXPECT_EQ(os.str(), fresh.str());
    EXPECT_THAT(os.str(), testing::HasSubstr("            T           \n0-1ms:      31          \n"));
}

TEST(QelMessageLatencyBucketsTable, RestoresTheFlagsOfTheStream)
{
    const Buckets buckets;
    Buckets::Table table;
    table.addColumn({"T", buckets});

    std::ostringstream os;
    os << std::hex << std::right << std::showbase;
    const auto flags = os.flags();
    table.dump(os, Indent(0, ' '));
    EXPECT_EQ(os.flags(), flags);
    EXPECT_EQ(os.width(), 0);

    os << std::noshowbase;
    os.str("");
    os << hexFormat(42U);
    EXPECT_EQ(os.str(), "0x0000002A"); // left-aligned it would be 0x2A000000
}

} // namespace
} // namespace qel
