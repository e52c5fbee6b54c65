#include "certificates/CertificateState.hpp"

#include <gmock/gmock.h>
#include <stdexcept>

namespace qel::test {

namespace {

using std::chrono::hours;
using std::chrono::minutes;
using std::chrono::seconds;
using testing::StrEq;
using testing::ThrowsMessage;
using tool::CertificateState;
using tool::isoTime;
using tool::parsePeriod;
using tool::stateAt;
using Clock = SSLValidityPeriod::Clock;

Clock::time_point at(long long count) { return Clock::time_point(seconds(count)); }

TEST(CertificateState, ChangesAtTheSecond)
{
    const SSLValidityPeriod validity(at(1000), at(2000));
    struct Row {
        long long now;
        CertificateState state;
        const char* name;
    };
    const std::vector<Row> rows{
        {0, CertificateState::NotYetValid, "not yet valid"},
        {999, CertificateState::NotYetValid, "not yet valid"},
        {1000, CertificateState::Fine, "fine"},
        {1899, CertificateState::Fine, "fine"},
        {1900, CertificateState::Due, "due"},
        {2000, CertificateState::Due, "due"},
        {2001, CertificateState::Expired, "expired"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.now);
        EXPECT_EQ(stateAt(validity, at(row.now), seconds(100)), row.state);
        EXPECT_STREQ(stateName(row.state), row.name);
    }
}

TEST(CertificateState, WithinZeroIsDueOnlyInTheLastSecond)
{
    const SSLValidityPeriod validity(at(1000), at(2000));
    EXPECT_EQ(stateAt(validity, at(1999), seconds(0)), CertificateState::Fine);
    EXPECT_EQ(stateAt(validity, at(2000), seconds(0)), CertificateState::Due);
}

TEST(CertificateState, AReversedPeriodIsExpiredAfterItsEnd)
{
    const SSLValidityPeriod validity(at(2000), at(1000));
    EXPECT_EQ(stateAt(validity, at(1000), seconds(0)), CertificateState::NotYetValid);
    EXPECT_EQ(stateAt(validity, at(1001), seconds(0)), CertificateState::Expired);
}

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

TEST(IsoTime, IsUtc)
{
    EXPECT_EQ(isoTime(at(0)), "1970-01-01T00:00:00Z");
    EXPECT_EQ(isoTime(at(951782399)), "2000-02-28T23:59:59Z");
    EXPECT_EQ(isoTime(at(-1)), "1969-12-31T23:59:59Z");
    EXPECT_EQ(isoTime((Clock::max)()), "beyond the calendar");
}

} // namespace

} // namespace qel::test
