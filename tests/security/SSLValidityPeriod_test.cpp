#include <chrono>
#include <ctime>

// Some C headers define these macros; the header must work with them.
#define min(a, b) ((a) < (b) ? (a) : (b))
#define max(a, b) ((a) > (b) ? (a) : (b))
#include <qel/common/security/SSLValidityPeriod.hpp>
#undef min
#undef max

#include "support/CalendarTime.hpp"
#include "support/SettableClock.hpp"

#include <gtest/gtest.h>
#include <limits>
#include <ratio>
#include <type_traits>

namespace qel {
namespace {

using std::chrono::hours;
using std::chrono::seconds;
using std::chrono::system_clock;
using test::CalendarTime;
using test::SettableClock;
using Clock = SSLValidityPeriod::Clock;

static_assert(std::is_same<Clock::duration, seconds>::value, "whole seconds");
static_assert(std::is_same<Clock::rep, seconds::rep>::value, "");
static_assert(std::is_same<Clock::period, std::ratio<1>>::value, "");
static_assert(std::is_same<Clock::time_point, std::chrono::time_point<Clock, seconds>>::value, "");
static_assert(!Clock::is_steady, "a calendar can be set");
static_assert(Clock::to_time_t(Clock::from_time_t(1234567890)) == 1234567890, "");
static_assert((Clock::min)() == (Clock::time_point::min)() && (Clock::max)() == (Clock::time_point::max)(), "");
static_assert(std::is_convertible<seconds, SSLValidityPeriod>::value, "a number of days will do for a period");
static_assert(std::is_same<decltype(SSLValidityPeriod::days(1)), seconds>::value, "");
static_assert(
    std::is_nothrow_constructible<SSLValidityPeriod, const Clock::time_point&, const Clock::time_point&>::value, "");
static_assert(sizeof(SSLValidityPeriod) == 2 * sizeof(Clock::time_point), "");

constexpr std::time_t kNow = 2000000000; // 2033-05-18 03:33:20 UTC
constexpr std::time_t kDay = 86400;

std::time_t beginOf(const SSLValidityPeriod& period) { return Clock::to_time_t(period.getNotBefore()); }
std::time_t endOf(const SSLValidityPeriod& period) { return Clock::to_time_t(period.getNotAfter()); }

TEST(SSLValidityPeriodClock, IsTheCalendarOfTheSystem)
{
    const std::time_t before = std::time(nullptr);
    const std::time_t now = Clock::to_time_t(Clock::now());
    const std::time_t after = std::time(nullptr);
    EXPECT_LE(before, now);
    EXPECT_LE(now, after);
    EXPECT_GT(now, 1700000000);
}

TEST(SSLValidityPeriodClock, ReadsOnlyTheSystemTime)
{
    CalendarTime calendar(kNow);
    SettableClock substituted;
    substituted.setSystem(system_clock::time_point(hours(24)));
    EXPECT_EQ(Clock::to_time_t(Clock::now()), kNow);
    EXPECT_EQ(calendar.reads(), 1U);
}

TEST(SSLValidityPeriodClock, ConvertsExactly)
{
    for (const std::time_t time : {std::time_t(0), std::time_t(1), std::time_t(-1), kNow, std::time_t(253402300799),
                                   std::numeric_limits<std::time_t>::min(), std::numeric_limits<std::time_t>::max()}) {
        SCOPED_TRACE(time);
        EXPECT_EQ(Clock::to_time_t(Clock::from_time_t(time)), time);
        EXPECT_EQ(Clock::from_time_t(time).time_since_epoch().count(), time);
    }
}

TEST(SSLValidityPeriod, OfADurationBeginsADayAgo)
{
    const CalendarTime calendar(kNow);
    const SSLValidityPeriod period(seconds(10));
    EXPECT_EQ(beginOf(period), kNow - kDay);
    EXPECT_EQ(endOf(period), kNow + 10);
}

TEST(SSLValidityPeriod, OfDaysIsLongerByTheDayBefore)
{
    const CalendarTime calendar(kNow);
    const SSLValidityPeriod period(SSLValidityPeriod::days(365));
    EXPECT_EQ(period.getNotAfter() - period.getNotBefore(), seconds(366 * kDay));
    EXPECT_EQ(beginOf(period), kNow - kDay);
    EXPECT_EQ(endOf(period), kNow + 365 * kDay);
}

TEST(SSLValidityPeriod, ReadsTheTimeOnce)
{
    CalendarTime calendar(kNow);
    calendar.advanceByEachRead(1000);
    const SSLValidityPeriod period(seconds(10));
    EXPECT_EQ(calendar.reads(), 1U);
    EXPECT_EQ(period.getNotAfter() - period.getNotBefore(), seconds(kDay + 10));
}

TEST(SSLValidityPeriod, DoesNotFollowASubstitutedClock)
{
    CalendarTime calendar(kNow);
    SettableClock substituted;
    substituted.setSystem(system_clock::time_point(hours(24)));
    const SSLValidityPeriod first(seconds(10));
    substituted.advance(hours(1));
    const SSLValidityPeriod second(seconds(10));
    EXPECT_EQ(beginOf(first), kNow - kDay);
    EXPECT_EQ(beginOf(second), kNow - kDay);
}

TEST(SSLValidityPeriod, AcceptsAnEmptyAndAPastPeriod)
{
    const CalendarTime calendar(kNow);
    const SSLValidityPeriod none(seconds(0));
    EXPECT_EQ(beginOf(none), kNow - kDay);
    EXPECT_EQ(endOf(none), kNow);

    const SSLValidityPeriod passed(seconds(-100000));
    EXPECT_EQ(beginOf(passed), kNow - kDay);
    EXPECT_EQ(endOf(passed), kNow - 100000);

    const SSLValidityPeriod longPassed((seconds::min)());
    EXPECT_EQ(endOf(longPassed), kNow + (seconds::min)().count());
}

TEST(SSLValidityPeriod, EndsWithTheCalendar)
{
    const CalendarTime calendar(kNow);
    const seconds rest = (Clock::max)() - Clock::from_time_t(kNow);
    EXPECT_EQ(SSLValidityPeriod(rest - seconds(1)).getNotAfter(), (Clock::max)() - seconds(1));
    EXPECT_EQ(SSLValidityPeriod(rest).getNotAfter(), (Clock::max)());
    EXPECT_EQ(SSLValidityPeriod(rest + seconds(1)).getNotAfter(), (Clock::max)());
    EXPECT_EQ(SSLValidityPeriod((seconds::max)()).getNotAfter(), (Clock::max)());
    EXPECT_EQ(beginOf(SSLValidityPeriod((seconds::max)())), kNow - kDay);
}

TEST(SSLValidityPeriod, DaysHaveTwentyFourHours)
{
    EXPECT_EQ(SSLValidityPeriod::days(0), seconds(0));
    EXPECT_EQ(SSLValidityPeriod::days(1), hours(24));
    EXPECT_EQ(SSLValidityPeriod::days(365), hours(8760));
    EXPECT_EQ(SSLValidityPeriod::days(3650000), hours(87600000));
}

TEST(SSLValidityPeriod, DaysAreClampedToTheirType)
{
    const auto most = static_cast<unsigned long>((seconds::max)().count() / kDay);
    EXPECT_EQ(SSLValidityPeriod::days(most).count(), static_cast<seconds::rep>(most) * kDay);
    EXPECT_EQ(SSLValidityPeriod::days(most - 1), SSLValidityPeriod::days(most) - hours(24));
    EXPECT_EQ(SSLValidityPeriod::days(most + 1), SSLValidityPeriod::days(most));
    EXPECT_EQ(SSLValidityPeriod::days(std::numeric_limits<unsigned long>::max()), SSLValidityPeriod::days(most));
}

TEST(SSLValidityPeriod, KeepsTwoTimePointsUnchanged)
{
    const SSLValidityPeriod period(Clock::from_time_t(kNow), Clock::from_time_t(5));
    EXPECT_EQ(beginOf(period), kNow);
    EXPECT_EQ(endOf(period), 5);
}

TEST(SSLValidityPeriod, InfiniteSpansTheWholeClock)
{
    EXPECT_EQ(SSLValidityPeriod::Infinite.getNotBefore(), (Clock::min)());
    EXPECT_EQ(SSLValidityPeriod::Infinite.getNotAfter(), (Clock::max)());
}

} // namespace
} // namespace qel
