#include <qel/protocol/CertificateState.hpp>

#include <gtest/gtest.h>
#include <vector>

namespace qel::test {

namespace {

using protocol::CertificateState;
using protocol::isoTime;
using protocol::stateAt;
using std::chrono::seconds;
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

TEST(IsoTime, IsUtc)
{
    EXPECT_EQ(isoTime(at(0)), "1970-01-01T00:00:00Z");
    EXPECT_EQ(isoTime(at(951782399)), "2000-02-28T23:59:59Z");
    EXPECT_EQ(isoTime(at(-1)), "1969-12-31T23:59:59Z");
    EXPECT_EQ(isoTime((Clock::max)()), "beyond the calendar");
}

} // namespace

} // namespace qel::test
