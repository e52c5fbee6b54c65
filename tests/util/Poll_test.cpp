#include <qel/common/util/Poll.hpp>

#include "util/PollKit.hpp"

#include <chrono>
#include <climits>
#include <cstdint>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iomanip>
#include <ios>
#include <poll.h>
#include <sstream>
#include <string>
#include <type_traits>
#include <vector>

namespace qel {
namespace {

using std::chrono::hours;
using std::chrono::microseconds;
using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using test::kFive;
using test::kFour;
using test::kThree;
using test::print;
using test::seen;
using ::testing::IsEmpty;
using time_point = PollDeadline::time_point;

static_assert(std::is_same<std::underlying_type<PollEvents>::type, std::int16_t>::value, "the type of pollfd's fields");

// Events and entries

TEST(PollEvents, EveryMaskIncludesErrorsAndHangUps)
{
    EXPECT_EQ(static_cast<int>(PollEvents::Error), 0x38);
    EXPECT_EQ(static_cast<int>(PollEvents::Read), 0x39);
    EXPECT_EQ(static_cast<int>(PollEvents::Write), 0x3C);
    EXPECT_EQ(static_cast<int>(PollEvents::All), 0x3D);
    EXPECT_EQ(static_cast<int>(PollEvents::Error), POLLERR + POLLHUP + POLLNVAL);
}

TEST(PollFd, HoldsTheDescriptorAndTheEventsWanted)
{
    const PollFd entry(7, PollEvents::Write);
    EXPECT_EQ(entry.mFd.fd, 7);
    EXPECT_EQ(entry.mFd.events, 0x3C);
    EXPECT_EQ(entry.mFd.revents, 0);
}

TEST(PollFd, PollSkipsIgnore)
{
    EXPECT_EQ(PollFd::Ignore.mFd.fd, -1);
    EXPECT_EQ(PollFd::Ignore.mFd.events, 0x3D);
    EXPECT_EQ(PollFd::Ignore.mFd.revents, 0);
    EXPECT_FALSE(PollSet(PollFd::Ignore).poll().anyReady());
}

TEST(PollFd, PrintsDescriptorInDecimalAndMasksInHexadecimal)
{
    EXPECT_EQ(print(PollFd(3, PollEvents::Read)), "(fd=3, mask=0x0039, results=0x0000)");
    EXPECT_EQ(print(seen(-1, PollEvents::All, POLLHUP)), "(fd=-1, mask=0x003D, results=0x0010)");
    EXPECT_EQ(print(seen(2147483647, PollEvents::Error, -1)), "(fd=2147483647, mask=0x0038, results=0xFFFF)");
}

TEST(PollFd, PrintingRestoresTheFlagsOfTheStream)
{
    std::ostringstream os;
    os << std::hex << std::showpos;
    const std::ios_base::fmtflags before = os.flags();
    os << PollFd(10, PollEvents::Read);
    EXPECT_EQ(os.flags(), before);

    std::ostringstream plain;
    plain << PollFd(10, PollEvents::Read) << ' ' << 255;
    EXPECT_EQ(plain.str(), "(fd=10, mask=0x0039, results=0x0000) 255");
}

TEST(PollFd, PrintingChangesTheFillCharacterOfTheStream)
{
    std::ostringstream os;
    os << std::setfill('*') << PollFd(10, PollEvents::Read);
    EXPECT_EQ(os.fill(), '0') << "only the flags are restored";
}

TEST(PollFd, PrintsTheDescriptorInDecimalOnAHexadecimalStream)
{
    std::ostringstream os;
    os << std::hex << PollFd(255, PollEvents::Read) << ' ' << 255;
    EXPECT_EQ(os.str(), "(fd=255, mask=0x0039, results=0x0000) ff");
}

// Deadlines

TEST(PollDeadline, DefaultIsDisabled)
{
    const PollDeadline deadline;
    EXPECT_TRUE(deadline.isDisabled());
    EXPECT_EQ(time_point(deadline), PollDeadline::Disabled);
    EXPECT_EQ(PollDeadline::Disabled.time_since_epoch(), nanoseconds(-1));
}

TEST(PollDeadline, ATimeBeforeTheEpochIsDisabled)
{
    for (const time_point point :
         {time_point(nanoseconds(-1)), time_point(nanoseconds(-2)), time_point(hours(-1)), time_point::min()}) {
        SCOPED_TRACE(point.time_since_epoch().count());
        EXPECT_TRUE(PollDeadline(point).isDisabled());
        EXPECT_EQ(PollDeadline(point), PollDeadline());
        PollDeadline assigned(time_point(seconds(5)));
        EXPECT_EQ(&(assigned = point), &assigned);
        EXPECT_EQ(time_point(assigned), PollDeadline::Disabled);
    }
}

TEST(PollDeadline, ATimeFromTheEpochOnIsKept)
{
    for (const time_point point : {time_point(), time_point(nanoseconds(1)), time_point(hours(5)), time_point::max()}) {
        SCOPED_TRACE(point.time_since_epoch().count());
        EXPECT_FALSE(PollDeadline(point).isDisabled());
        EXPECT_EQ(time_point(PollDeadline(point)), point);
        PollDeadline assigned;
        assigned = point;
        EXPECT_EQ(time_point(assigned), point);
    }
}

TEST(PollDeadline, IsExpiredFromItsTimeOn)
{
    const PollDeadline deadline(time_point(seconds(5)));
    EXPECT_FALSE(deadline.isExpired(time_point(seconds(5) - nanoseconds(1))));
    EXPECT_TRUE(deadline.isExpired(time_point(seconds(5))));
    EXPECT_TRUE(deadline.isExpired(time_point(seconds(5) + nanoseconds(1))));
    EXPECT_TRUE(PollDeadline(time_point()).isExpired(time_point()));
}

TEST(PollDeadline, ADisabledDeadlineNeverExpires)
{
    EXPECT_FALSE(PollDeadline().isExpired(time_point()));
    EXPECT_FALSE(PollDeadline().isExpired(PollDeadline::Disabled));
    EXPECT_FALSE(PollDeadline().isExpired(time_point::max()));
}

TEST(PollDeadline, TimeoutIsTheTimeLeftRoundedDownToMilliseconds)
{
    const time_point now(seconds(1000));
    EXPECT_EQ(PollDeadline().getTimeout(now), milliseconds(-1));
    struct Row {
        nanoseconds ahead;
        milliseconds timeout;
    };
    const Row rows[] = {
        {seconds(-5), milliseconds(0)},          {nanoseconds(-1), milliseconds(0)},
        {nanoseconds(0), milliseconds(0)},       {nanoseconds(1), milliseconds(0)},
        {nanoseconds(999999), milliseconds(0)},  {milliseconds(1), milliseconds(1)},
        {microseconds(1900), milliseconds(1)},   {milliseconds(2), milliseconds(2)},
        {hours(1000), milliseconds(3600000000)},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.ahead.count());
        EXPECT_EQ(PollDeadline(now + row.ahead).getTimeout(now), row.timeout);
    }
}

TEST(PollDeadline, TimeoutDoesNotOverflowAtTheEndsOfTheClock)
{
    const PollDeadline last(time_point::max());
    EXPECT_EQ(last.getTimeout(time_point()), milliseconds(9223372036854));
    EXPECT_EQ(last.getTimeout(time_point(nanoseconds(-1))), milliseconds(9223372036854));
    EXPECT_EQ(last.getTimeout(time_point::min()), milliseconds(18446744073709));
    EXPECT_EQ(PollDeadline(time_point()).getTimeout(time_point(milliseconds(-3))), milliseconds(3));
    EXPECT_EQ(PollDeadline().getTimeout(time_point::min()), milliseconds(-1));
}

TEST(PollDeadline, OrdersByTimeWithTheDisabledDeadlineLast)
{
    const PollDeadline deadlines[] = {PollDeadline(time_point()), PollDeadline(time_point(nanoseconds(1))),
                                      PollDeadline(time_point(seconds(5))), PollDeadline(time_point::max()),
                                      PollDeadline()};
    const std::size_t count = sizeof(deadlines) / sizeof(deadlines[0]);
    for (std::size_t i = 0; i < count; ++i) {
        for (std::size_t j = 0; j < count; ++j) {
            const PollDeadline& a = deadlines[i];
            const PollDeadline& b = deadlines[j];
            SCOPED_TRACE(std::to_string(i) + " and " + std::to_string(j));
            EXPECT_EQ(a.compare(b), i < j ? -1 : (i > j ? 1 : 0));
            EXPECT_EQ(a == b, i == j);
            EXPECT_EQ(a != b, i != j);
            EXPECT_EQ(a < b, i < j);
            EXPECT_EQ(a > b, i > j);
            EXPECT_EQ(a <= b, i <= j);
            EXPECT_EQ(a >= b, i >= j);
        }
    }
}

TEST(PollDeadline, ComparesWithTimePoints)
{
    const time_point now(seconds(5));
    const PollDeadline deadline(time_point(seconds(6)));
    EXPECT_TRUE(now < deadline);
    EXPECT_TRUE(deadline > now);
    EXPECT_TRUE(deadline >= now);
    EXPECT_TRUE(now <= deadline);
    EXPECT_TRUE(deadline != now);
    EXPECT_TRUE(deadline == time_point(seconds(6)));
    EXPECT_TRUE(time_point::max() < PollDeadline());
}

// Results

TEST(PollResult, DefaultIsEmpty)
{
    const PollResult result;
    EXPECT_THAT(result.getResults(), IsEmpty());
    EXPECT_FALSE(result.anyReady());
    EXPECT_FALSE(result.contains(kThree));
    EXPECT_EQ(print(result), "[]");
}

TEST(PollResult, CopiesItsEntries)
{
    std::vector<PollFd> entries{seen(3, PollEvents::Read, POLLIN), kFour};
    const PollResult result(entries);
    entries.clear();
    EXPECT_EQ(print(result), "[(fd=3, mask=0x0039, results=0x0001), (fd=4, mask=0x003C, results=0x0000)]");
    ASSERT_EQ(result.getResults().size(), 2U);
    EXPECT_EQ(result.getResults()[0].mFd.revents, POLLIN);
    EXPECT_EQ(result.getResults()[1].mFd.fd, 4);
}

TEST(PollResult, ContainsChecksTheEventsInTheQuery)
{
    struct Row {
        int revents;
        bool error, read, write, all;
    };
    const Row rows[] = {
        {0, false, false, false, false},     {POLLIN, false, true, false, true},
        {POLLOUT, false, false, true, true}, {POLLIN | POLLOUT, false, true, true, true},
        {POLLERR, true, true, true, true},   {POLLHUP, true, true, true, true},
        {POLLNVAL, true, true, true, true},  {POLLPRI, false, false, false, false},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.revents);
        const PollResult result({seen(3, PollEvents::All, row.revents)});
        EXPECT_EQ(result.contains(PollFd(3, PollEvents::Error)), row.error);
        EXPECT_EQ(result.contains(PollFd(3, PollEvents::Read)), row.read);
        EXPECT_EQ(result.contains(PollFd(3, PollEvents::Write)), row.write);
        EXPECT_EQ(result.contains(PollFd(3, PollEvents::All)), row.all);
        EXPECT_FALSE(result.contains(PollFd(4, PollEvents::All))) << "another descriptor";
        EXPECT_EQ(result.anyReady(), row.revents != 0);
    }
}

TEST(PollResult, ContainsUsesTheMaskOfTheQueryNotThatOfTheEntry)
{
    const PollResult result({seen(3, PollEvents::Write, POLLIN)});
    EXPECT_TRUE(result.contains(PollFd(3, PollEvents::Read)));
    EXPECT_FALSE(result.contains(PollFd(3, PollEvents::Write)));
    // The events seen in the query are ignored.
    EXPECT_FALSE(result.contains(seen(3, PollEvents::Write, POLLIN)));
}

TEST(PollResult, ContainsChecksEveryEntryOfADescriptor)
{
    const PollResult result({seen(3, PollEvents::Write, 0), kFour, seen(3, PollEvents::Read, POLLIN)});
    EXPECT_TRUE(result.contains(PollFd(3, PollEvents::Read)));
    EXPECT_FALSE(result.contains(PollFd(3, PollEvents::Write)));
}

TEST(PollResult, ANegativeMaskOfCommonEventsIsNotReady)
{
    PollFd query = kThree;
    query.mFd.events = SHRT_MIN;
    EXPECT_FALSE(PollResult({seen(3, PollEvents::Read, SHRT_MIN)}).contains(query));
    // The highest bit makes the common events negative; only a value above zero counts.
    query.mFd.events = static_cast<short>(SHRT_MIN | POLLIN);
    EXPECT_FALSE(PollResult({seen(3, PollEvents::Read, SHRT_MIN | POLLIN)}).contains(query));
    EXPECT_TRUE(PollResult({seen(3, PollEvents::Read, POLLIN)}).contains(query));
}

TEST(PollResult, ContainsAnyOfIsTrueForOneReadyEntry)
{
    const PollResult result({seen(3, PollEvents::Read, 0), seen(4, PollEvents::Write, POLLOUT)});
    EXPECT_TRUE(result.containsAnyOf(PollSet{kThree, kFour}));
    EXPECT_TRUE(result.containsAnyOf(PollSet{kFour, kThree}));
    EXPECT_TRUE(result.containsAnyOf(kFour));
    EXPECT_FALSE(result.containsAnyOf(PollSet{kThree, kFive}));
    EXPECT_FALSE(result.containsAnyOf(kThree));
}

TEST(PollResult, ContainsAnyOfAnEmptySetIsTrue)
{
    EXPECT_TRUE(PollResult().containsAnyOf(PollSet()));
    EXPECT_TRUE(PollResult({kThree}).containsAnyOf(PollSet()));
    EXPECT_TRUE(PollSet().wait().containsAnyOf(PollSet()));
}

TEST(PollResult, AnyReadyIsTrueForOneReadyEntry)
{
    EXPECT_FALSE(PollResult({kThree, kFour}).anyReady());
    EXPECT_TRUE(PollResult({kThree, seen(4, PollEvents::Write, POLLERR)}).anyReady());
    EXPECT_TRUE(PollResult({seen(4, PollEvents::Write, POLLPRI)}).anyReady());
}

} // namespace
} // namespace qel
