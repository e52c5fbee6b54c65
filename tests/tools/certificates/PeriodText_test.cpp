#include "certificates/PeriodText.hpp"

#include <gmock/gmock.h>
#include <stdexcept>

namespace qel::test {

namespace {

using std::chrono::hours;
using std::chrono::minutes;
using std::chrono::seconds;
using testing::StrEq;
using testing::ThrowsMessage;
using tool::parsePeriod;

TEST(ParsePeriod, IsANumberAndAUnit)
{
    EXPECT_EQ(parsePeriod("0s"), seconds(0));
    EXPECT_EQ(parsePeriod("90s"), seconds(90));
    EXPECT_EQ(parsePeriod("2m"), minutes(2));
    EXPECT_EQ(parsePeriod("3h"), hours(3));
    EXPECT_EQ(parsePeriod("30d"), hours(30 * 24));
    EXPECT_EQ(parsePeriod("2w"), hours(14 * 24));
    EXPECT_EQ(parsePeriod("007d"), hours(7 * 24));
    EXPECT_EQ(parsePeriod("00000000000000000000000007d"), hours(7 * 24));
}

TEST(ParsePeriod, IsAtMostAHundredYears)
{
    EXPECT_EQ(parsePeriod("36525d"), hours(36525 * 24));
    EXPECT_EQ(parsePeriod("3155760000s"), hours(36525 * 24));
    for (const char* text : {"36526d", "3155760001s", "9999999999w", "10000000000s", "99999999999999999999d"}) {
        SCOPED_TRACE(text);
        EXPECT_THROW(parsePeriod(text), std::invalid_argument);
    }
}

TEST(ParsePeriod, RefusesEverythingElse)
{
    for (const char* text :
         {"", "d", "30", "d30", "30D", "30y", "-1d", "+1d", "1.5d", " 1d", "1 d", "1d ", "1d1h", "0x1d"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT(
            [&] { parsePeriod(text); },
            ThrowsMessage<std::invalid_argument>(
                StrEq("\"" + std::string(text) +
                      "\" is not a length of time: a number with s, m, h, d or w, as in 30d, and at most 100 years")));
    }
}

} // namespace

} // namespace qel::test
