#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SignalStorm.hpp"
#include "support/SystemCalls.hpp"

#include <cerrno>
#include <chrono>
#include <climits>
#include <cstdint>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iomanip>
#include <memory>
#include <poll.h>
#include <sstream>
#include <string>
#include <sys/eventfd.h>
#include <thread>
#include <type_traits>
#include <unistd.h>
#include <vector>

namespace qel {
namespace {

using std::chrono::hours;
using std::chrono::microseconds;
using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using test::CapturedLog;
using test::NoMoreDescriptors;
using test::SystemCalls;
using test::ThrowsPosixError;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StrEq;
using time_point = PollDeadline::time_point;

static_assert(std::is_same<std::underlying_type<PollEvents>::type, std::int16_t>::value, "the type of pollfd's fields");
static_assert(!std::is_copy_constructible<PollInterrupt>::value && !std::is_copy_assignable<PollInterrupt>::value, "");

template <typename Value>
std::string print(const Value& value)
{
    std::ostringstream os;
    os << value;
    return os.str();
}

std::string number(int value) { return std::to_string(value); }

/// Both ends of a pipe, closed at the end.
class Pipe {
public:
    Pipe() { EXPECT_EQ(::pipe2(mFds, O_CLOEXEC), 0); }
    ~Pipe()
    {
        closeReader();
        closeWriter();
    }
    Pipe(const Pipe&) = delete;
    Pipe& operator=(const Pipe&) = delete;

    int reader() const { return mFds[0]; }
    int writer() const { return mFds[1]; }
    void fill() const { EXPECT_EQ(::write(mFds[1], "x", 1), 1); }
    void closeReader() { pClose(mFds[0]); }
    void closeWriter() { pClose(mFds[1]); }

private:
    static void pClose(int& fd)
    {
        if (fd >= 0) ::close(fd);
        fd = -1;
    }

    int mFds[2] = {-1, -1};
};

PollFd seen(int fd, PollEvents events, int revents)
{
    PollFd entry(fd, events);
    entry.mFd.revents = static_cast<short>(revents);
    return entry;
}

// Events and entries

TEST(PollEvents, EveryMaskHoldsErrorsAndHangUps)
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

TEST(PollFd, IgnoreIsAnEntryThatPollSkips)
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

TEST(PollFd, PrintingLeavesTheFlagsOfTheStreamAsTheyWere)
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

TEST(PollFd, PrintingLeavesTheFillCharacterOfTheHexadecimalForm)
{
    std::ostringstream os;
    os << std::setfill('*') << PollFd(10, PollEvents::Read);
    EXPECT_EQ(os.fill(), '0') << "only the flags are put back";
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

TEST(PollDeadline, APointBeforeTheEpochIsDisabled)
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

TEST(PollDeadline, OtherPointsAreKept)
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

TEST(PollDeadline, IsExpiredFromItsVeryMomentOn)
{
    const PollDeadline deadline(time_point(seconds(5)));
    EXPECT_FALSE(deadline.isExpired(time_point(seconds(5) - nanoseconds(1))));
    EXPECT_TRUE(deadline.isExpired(time_point(seconds(5))));
    EXPECT_TRUE(deadline.isExpired(time_point(seconds(5) + nanoseconds(1))));
    EXPECT_TRUE(PollDeadline(time_point()).isExpired(time_point()));
}

TEST(PollDeadline, ADisabledOneNeverExpires)
{
    EXPECT_FALSE(PollDeadline().isExpired(time_point()));
    EXPECT_FALSE(PollDeadline().isExpired(PollDeadline::Disabled));
    EXPECT_FALSE(PollDeadline().isExpired(time_point::max()));
}

TEST(PollDeadline, TimeoutIsTheTimeLeftInWholeMilliseconds)
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

TEST(PollDeadline, TimeoutAtTheEndsOfTheClockDoesNotOverflow)
{
    const PollDeadline last(time_point::max());
    EXPECT_EQ(last.getTimeout(time_point()), milliseconds(9223372036854));
    EXPECT_EQ(last.getTimeout(time_point(nanoseconds(-1))), milliseconds(9223372036854));
    EXPECT_EQ(last.getTimeout(time_point::min()), milliseconds(9223372036854));
    EXPECT_EQ(PollDeadline(time_point()).getTimeout(time_point(milliseconds(-3))), milliseconds(3));
    EXPECT_EQ(PollDeadline().getTimeout(time_point::min()), milliseconds(-1));
}

TEST(PollDeadline, OrderIsByTimeWithTheDisabledOneLast)
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

// Sets

const PollFd kThree(3, PollEvents::Read);
const PollFd kFour(4, PollEvents::Write);
const PollFd kFive(5, PollEvents::Error);
const char* const kThreeText = "(fd=3, mask=0x0039, results=0x0000)";
const char* const kFourText = "(fd=4, mask=0x003C, results=0x0000)";
const char* const kFiveText = "(fd=5, mask=0x0038, results=0x0000)";

std::string listed(std::initializer_list<const char*> entries)
{
    std::string text = "[";
    for (const char* entry : entries)
        text += (text.size() > 1 ? ", " : "") + std::string(entry);
    return text + "]";
}

TEST(PollSet, PrintsItsEntriesInBrackets)
{
    EXPECT_EQ(print(PollSet()), "[]");
    EXPECT_EQ(print(PollSet(kThree)), "[(fd=3, mask=0x0039, results=0x0000)]");
    EXPECT_EQ(print(PollSet{kThree, kFour}),
              "[(fd=3, mask=0x0039, results=0x0000), (fd=4, mask=0x003C, results=0x0000)]");
}

TEST(PollSet, KeepsOrderAndDuplicates)
{
    EXPECT_EQ(print(PollSet{kFour, kThree, kFour}), listed({kFourText, kThreeText, kFourText}));
}

TEST(PollSet, AppendsAnEntry)
{
    PollSet set;
    EXPECT_EQ(&(set += kThree), &set);
    set += kFour;
    EXPECT_EQ(print(set), listed({kThreeText, kFourText}));
}

TEST(PollSet, AppendsAnotherSetInItsOrder)
{
    PollSet set(kThree);
    EXPECT_EQ(&(set += PollSet{kFive, kFour}), &set);
    EXPECT_EQ(print(set), listed({kThreeText, kFiveText, kFourText}));
    set += PollSet();
    EXPECT_EQ(print(set), listed({kThreeText, kFiveText, kFourText}));
}

TEST(PollSet, AppendsItself)
{
    PollSet set{kThree, kFour, kFive};
    const PollSet& same = set; // through another name: the compilers warn about the plain form
    set += same;
    EXPECT_EQ(print(set), listed({kThreeText, kFourText, kFiveText, kThreeText, kFourText, kFiveText}));
}

TEST(PollSet, SumsLeaveBothSidesAlone)
{
    const PollSet set(kThree);
    const PollSet other{kFour, kFive};
    EXPECT_EQ(print(set + kFour), listed({kThreeText, kFourText}));
    EXPECT_EQ(print(set + other), listed({kThreeText, kFourText, kFiveText}));
    EXPECT_EQ(print(set + set), listed({kThreeText, kThreeText}));
    EXPECT_EQ(print(set), listed({kThreeText}));
    EXPECT_EQ(print(other), listed({kFourText, kFiveText}));
}

TEST(PollSet, ClearEmptiesIt)
{
    PollSet set{kThree, kFour};
    set.clear();
    EXPECT_EQ(print(set), "[]");
    set += kFive;
    EXPECT_EQ(print(set), listed({kFiveText}));
}

// Waiting

TEST(PollSet, AnEmptySetReturnsAtOnceWithoutPolling)
{
    CapturedLog log;
    SystemCalls calls;
    int polls = 0;
    calls.poll = [&](pollfd*, nfds_t, int) { return ++polls; };
    EXPECT_THAT(PollSet().wait().getResults(), IsEmpty());
    EXPECT_THAT(PollSet().wait(PollSet::TIMEOUT_INFINITE).getResults(), IsEmpty());
    EXPECT_THAT(PollSet().wait(hours(1)).getResults(), IsEmpty());
    EXPECT_THAT(PollSet().poll().getResults(), IsEmpty());
    EXPECT_EQ(polls, 0);
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(PollSet, InfiniteTimeoutIsMinusOneMillisecond) { EXPECT_EQ(PollSet::TIMEOUT_INFINITE, milliseconds(-1)); }

TEST(PollSet, HandsItsEntriesToPollUnchanged)
{
    SystemCalls calls;
    std::string entries;
    int errorBefore = -1;
    calls.poll = [&](pollfd* fds, nfds_t count, int) {
        errorBefore = errno;
        for (nfds_t i = 0; i < count; ++i) {
            entries += number(fds[i].fd) + "/" + number(fds[i].events) + "/" + number(fds[i].revents) + " ";
        }
        return 0;
    };
    errno = ENOTTY;
    PollSet{kFour, kThree, PollFd::Ignore, kThree}.wait(milliseconds(5));
    EXPECT_EQ(entries, "4/60/0 3/57/0 -1/61/0 3/57/0 ");
    EXPECT_EQ(errorBefore, 0) << "errno is cleared before the call";
}

TEST(PollSet, TheMillisecondCountIsNarrowedToAnInt)
{
    struct Row {
        milliseconds timeout;
        int passed;
    };
    const Row rows[] = {
        {milliseconds(-1), -1},
        {milliseconds(0), 0},
        {milliseconds(1), 1},
        {seconds(100), 100000},
        {milliseconds(INT_MAX), INT_MAX},
        {milliseconds(INT_MAX) + milliseconds(1), INT_MIN}, // negative: waits without limit
        {milliseconds(std::int64_t{1} << 32), 0},           // does not wait at all
        {milliseconds::max(), -1},
    };
    SystemCalls calls;
    int passed = 0;
    calls.poll = [&](pollfd*, nfds_t, int timeout) {
        passed = timeout;
        return 0;
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.timeout.count());
        passed = 12345;
        PollSet(kThree).wait(row.timeout);
        EXPECT_EQ(passed, row.passed);
    }
    PollSet(kThree).wait();
    EXPECT_EQ(passed, -1);
    PollSet(kThree).poll();
    EXPECT_EQ(passed, 0);
}

TEST(PollSet, ATimeoutLeavesEveryEntryInTheResultWithNothingSeen)
{
    CapturedLog log;
    const Pipe pipe;
    const PollSet set{PollFd(pipe.reader(), PollEvents::Read), PollFd::Ignore};
    const PollResult result = set.wait(milliseconds(1));
    EXPECT_FALSE(result.anyReady());
    const std::string entries =
        "[(fd=" + number(pipe.reader()) + ", mask=0x0039, results=0x0000), (fd=-1, mask=0x003D, results=0x0000)]";
    EXPECT_EQ(print(result), entries);
    EXPECT_THAT(log.lines(), ElementsAre("D: Starting poll wait with timeout of 1 ms " + entries,
                                         "D: Completed poll wait " + entries));
}

TEST(PollSet, ReportsWhatIsReady)
{
    CapturedLog log;
    const Pipe empty;
    const Pipe filled;
    filled.fill();
    const PollFd silent(empty.reader(), PollEvents::Read);
    const PollFd readable(filled.reader(), PollEvents::Read);
    const PollFd writable(filled.writer(), PollEvents::Write);
    const PollSet set{silent, readable, writable};

    const PollResult result = set.wait();
    EXPECT_TRUE(result.contains(readable));
    EXPECT_TRUE(result.contains(writable));
    EXPECT_FALSE(result.contains(silent));
    EXPECT_TRUE(result.anyReady());
    const std::string a = "[(fd=" + number(empty.reader()) + ", mask=0x0039, results=0x0000), ";
    const std::string b = "(fd=" + number(filled.reader()) + ", mask=0x0039, results=";
    const std::string c = "), (fd=" + number(filled.writer()) + ", mask=0x003C, results=";
    EXPECT_EQ(print(result), a + b + "0x0001" + c + "0x0004)]");
    EXPECT_EQ(print(set), a + b + "0x0000" + c + "0x0000)]") << "the set stays as it was";
    EXPECT_THAT(log.lines(),
                ElementsAre("D: Starting poll wait with timeout of -1 ms " + a + b + "0x0000" + c + "0x0000)]",
                            "D: Completed poll wait " + a + b + "0x0001" + c + "0x0004)]"));
}

TEST(PollSet, ASetMayBeWaitedOnAgain)
{
    const Pipe pipe;
    const PollSet set(PollFd(pipe.reader(), PollEvents::Read));
    EXPECT_FALSE(set.poll().anyReady());
    pipe.fill();
    EXPECT_TRUE(set.poll().anyReady());
    EXPECT_TRUE(set.wait().anyReady());
}

TEST(PollSet, AHangUpCountsForEveryMask)
{
    Pipe pipe;
    pipe.closeWriter();
    const PollResult result = PollSet(PollFd(pipe.reader(), PollEvents::Error)).wait();
    EXPECT_EQ(result.getResults().at(0).mFd.revents, POLLHUP);
    for (const PollEvents events : {PollEvents::Error, PollEvents::Read, PollEvents::Write, PollEvents::All}) {
        EXPECT_TRUE(result.contains(PollFd(pipe.reader(), events)));
    }
}

TEST(PollSet, ADescriptorThatIsNotOpenIsAnErrorEvent)
{
    Pipe pipe;
    const int fd = pipe.reader();
    pipe.closeReader();
    const PollResult result = PollSet(PollFd(fd, PollEvents::Read)).wait();
    EXPECT_EQ(result.getResults().at(0).mFd.revents, 0x20);
    EXPECT_TRUE(result.contains(PollFd(fd, PollEvents::Read)));
    EXPECT_TRUE(result.contains(PollFd(fd, PollEvents::Error)));
}

TEST(PollSet, ASignalGivesAnEmptyResult)
{
    CapturedLog log;
    SystemCalls calls;
    calls.poll = [](pollfd* fds, nfds_t, int) {
        fds[0].revents = POLLIN; // shows in a result, not in the set that the line prints
        errno = EINTR;
        return -1;
    };
    const PollResult result = PollSet{kThree, kFour}.wait(milliseconds(250));
    EXPECT_THAT(result.getResults(), IsEmpty());
    EXPECT_FALSE(result.anyReady());
    const std::string entries = listed({kThreeText, kFourText});
    EXPECT_THAT(log.lines(), ElementsAre("D: Starting poll wait with timeout of 250 ms " + entries,
                                         "D: Poll wait for events " + entries + " interrupted"));
}

TEST(PollSet, ARealSignalEndsTheWaitWhateverItsHandlerAsksFor)
{
    for (const int flags : {0, SA_RESTART}) {
        SCOPED_TRACE(flags);
        const Pipe pipe;
        PollResult result(std::vector<PollFd>{kThree});
        const int signals = test::callUnderSignals(
            flags, [&] { result = PollSet(PollFd(pipe.reader(), PollEvents::Read)).wait(); }, [] { return true; });
        EXPECT_THAT(result.getResults(), IsEmpty());
        EXPECT_GE(signals, 1);
    }
}

TEST(PollSet, AFailedPollThrows)
{
    CapturedLog log;
    SystemCalls calls;
    calls.poll = [](pollfd* fds, nfds_t, int) {
        fds[0].revents = POLLIN;
        errno = ENOMEM;
        return -1;
    };
    EXPECT_THAT([] { PollSet{kThree}.wait(milliseconds(7)); },
                ThrowsPosixError(ENOMEM, "poll() failed: 12 (Cannot allocate memory)"));
    EXPECT_THAT(log.lines(), ElementsAre("D: Starting poll wait with timeout of 7 ms [" + std::string(kThreeText) + "]",
                                         "E: Poll wait for events [" + std::string(kThreeText) +
                                             "] failed: 12 (Cannot allocate memory)"));
}

TEST(PollSet, MoreEntriesThanDescriptorsAreAllowedFailsInTheSystem)
{
    CapturedLog log(LogLevel::Error);
    SystemCalls calls;
    calls.poll = [](pollfd* fds, nfds_t count, int timeout) {
        const NoMoreDescriptors exhausted;
        return ::poll(fds, count, timeout);
    };
    EXPECT_THAT([] { PollSet{kThree}.poll(); }, ThrowsPosixError(EINVAL, "poll() failed: 22 (Invalid argument)"));
    EXPECT_THAT(log.lines(),
                ElementsAre("E: Poll wait for events [" + std::string(kThreeText) + "] failed: 22 (Invalid argument)"));
}

TEST(PollSet, TheErrorIsTakenBeforeAnythingIsLogged)
{
    CapturedLog log;
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    SystemCalls calls;
    int error = 0;
    calls.poll = [&](pollfd*, nfds_t, int) {
        errno = error;
        return -1;
    };
    error = EINVAL;
    EXPECT_THAT([] { PollSet{kThree}.poll(); }, ThrowsPosixError(EINVAL, "poll() failed: 22 (Invalid argument)"));
    error = EINTR;
    EXPECT_THAT(PollSet{kThree}.poll().getResults(), IsEmpty());
}

TEST(PollSet, LinesOfDisabledLevelsAreNotWritten)
{
    CapturedLog log(LogLevel::Info);
    const Pipe pipe;
    PollSet(PollFd(pipe.reader(), PollEvents::Read)).poll();
    SystemCalls calls;
    calls.poll = [](pollfd*, nfds_t, int) {
        errno = EINTR;
        return -1;
    };
    PollSet{kThree}.poll();
    QelLogger::get().setLevel(LogLevel::Critical);
    calls.poll = [](pollfd*, nfds_t, int) {
        errno = EINVAL;
        return -1;
    };
    EXPECT_THROW(PollSet{kThree}.poll(), PosixError);
    EXPECT_THAT(log.lines(), IsEmpty());
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

TEST(PollResult, ContainsLooksAtTheEventsThatAreAskedFor)
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

TEST(PollResult, ContainsGoesByTheQuestionNotByWhatWasWanted)
{
    const PollResult result({seen(3, PollEvents::Write, POLLIN)});
    EXPECT_TRUE(result.contains(PollFd(3, PollEvents::Read)));
    EXPECT_FALSE(result.contains(PollFd(3, PollEvents::Write)));
    // What the question itself has seen does not matter.
    EXPECT_FALSE(result.contains(seen(3, PollEvents::Write, POLLIN)));
}

TEST(PollResult, ContainsLooksAtEveryEntryOfADescriptor)
{
    const PollResult result({seen(3, PollEvents::Write, 0), kFour, seen(3, PollEvents::Read, POLLIN)});
    EXPECT_TRUE(result.contains(PollFd(3, PollEvents::Read)));
    EXPECT_FALSE(result.contains(PollFd(3, PollEvents::Write)));
}

TEST(PollResult, TheHighestBitAloneDoesNotCount)
{
    PollFd question = kThree;
    question.mFd.events = SHRT_MIN;
    EXPECT_FALSE(PollResult({seen(3, PollEvents::Read, SHRT_MIN)}).contains(question));
    // It makes the common events negative, and only values above zero count.
    question.mFd.events = static_cast<short>(SHRT_MIN | POLLIN);
    EXPECT_FALSE(PollResult({seen(3, PollEvents::Read, SHRT_MIN | POLLIN)}).contains(question));
    EXPECT_TRUE(PollResult({seen(3, PollEvents::Read, POLLIN)}).contains(question));
}

TEST(PollResult, ContainsAnyOfNeedsOneEntry)
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

TEST(PollResult, OneReadyEntryOfManyIsEnoughForAnyReady)
{
    EXPECT_FALSE(PollResult({kThree, kFour}).anyReady());
    EXPECT_TRUE(PollResult({kThree, seen(4, PollEvents::Write, POLLERR)}).anyReady());
    EXPECT_TRUE(PollResult({seen(4, PollEvents::Write, POLLPRI)}).anyReady());
}

// Interrupts

bool isPending(const PollInterrupt& interrupt)
{
    return PollSet(interrupt.getPollFd()).poll().contains(interrupt.getPollFd());
}

TEST(PollInterrupt, IsIdleAtFirst)
{
    const PollInterrupt interrupt;
    EXPECT_GE(interrupt.getPollFd().mFd.fd, 0);
    EXPECT_EQ(interrupt.getPollFd().mFd.events, 0x39);
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, IsPendingFromInterruptToEoi)
{
    PollInterrupt interrupt;
    interrupt.interrupt();
    EXPECT_TRUE(isPending(interrupt));
    EXPECT_TRUE(isPending(interrupt)) << "looking does not consume it";
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
    interrupt.interrupt();
    EXPECT_TRUE(isPending(interrupt));
}

TEST(PollInterrupt, OneEoiConsumesAnyNumberOfInterrupts)
{
    PollInterrupt interrupt;
    interrupt.interrupt();
    interrupt.interrupt();
    interrupt.interrupt();
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, EoiWithNothingPendingDoesNothing)
{
    CapturedLog log(LogLevel::Info);
    PollInterrupt interrupt;
    interrupt.eoi();
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(PollInterrupt, AFullCounterIsIgnored)
{
    CapturedLog log(LogLevel::Info);
    PollInterrupt interrupt;
    ASSERT_EQ(::eventfd_write(interrupt.getPollFd().mFd.fd, 0xFFFFFFFFFFFFFFFE), 0);
    interrupt.interrupt();
    EXPECT_TRUE(isPending(interrupt));
    EXPECT_THAT(log.lines(), IsEmpty());
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, WakesAThreadThatWaits)
{
    const Pipe pipe;
    PollInterrupt interrupt;
    std::thread waker([&] { interrupt.interrupt(); });
    const PollResult result = (PollSet(PollFd(pipe.reader(), PollEvents::Read)) + interrupt.getPollFd()).wait();
    waker.join();
    EXPECT_TRUE(result.contains(interrupt.getPollFd()));
    EXPECT_FALSE(result.contains(PollFd(pipe.reader(), PollEvents::Read)));
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, MayBeInterruptedByManyThreadsAtOnce)
{
    PollInterrupt interrupt;
    std::vector<std::thread> wakers;
    for (int i = 0; i < 4; ++i) {
        wakers.emplace_back([&] {
            for (int n = 0; n < 100; ++n)
                interrupt.interrupt();
        });
    }
    EXPECT_TRUE(PollSet(interrupt.getPollFd()).wait().contains(interrupt.getPollFd()));
    for (std::thread& waker : wakers)
        waker.join();
    interrupt.eoi();
    EXPECT_FALSE(isPending(interrupt));
}

TEST(PollInterrupt, ItsDescriptorNeverBlocksAndDoesNotSurviveAnExec)
{
    const PollInterrupt interrupt;
    const int fd = interrupt.getPollFd().mFd.fd;
    EXPECT_NE(::fcntl(fd, F_GETFL) & O_NONBLOCK, 0);
    EXPECT_EQ(::fcntl(fd, F_GETFD), FD_CLOEXEC);
}

TEST(PollInterrupt, ClosesItsDescriptor)
{
    int fd = -1;
    {
        const PollInterrupt interrupt;
        fd = interrupt.getPollFd().mFd.fd;
        ASSERT_NE(::fcntl(fd, F_GETFD), -1);
    }
    EXPECT_EQ(::fcntl(fd, F_GETFD), -1);
    EXPECT_EQ(errno, EBADF);
}

TEST(PollInterrupt, WithoutADescriptorItIsMadeAndFailsWhenUsed)
{
    CapturedLog log(LogLevel::Info);
    std::unique_ptr<PollInterrupt> interrupt;
    {
        SystemCalls calls;
        calls.eventfd = [](unsigned int count, int flags) {
            const NoMoreDescriptors exhausted;
            return ::eventfd(count, flags);
        };
        interrupt = std::make_unique<PollInterrupt>();
    }
    EXPECT_THAT(log.lines(), IsEmpty());
    EXPECT_EQ(print(interrupt->getPollFd()), "(fd=-1, mask=0x0039, results=0x0000)");
    EXPECT_FALSE(isPending(*interrupt)) << "poll skips it";
    EXPECT_THAT([&] { interrupt->interrupt(); },
                ThrowsPosixError(EBADF, "eventfd write failed: 9 (Bad file descriptor)"));
    EXPECT_THAT([&] { interrupt->eoi(); }, ThrowsPosixError(EBADF, "eventfd read failed: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: eventfd write failed: 9 (Bad file descriptor)",
                                         "E: eventfd read failed: 9 (Bad file descriptor)"));
}

TEST(PollInterrupt, ADescriptorBelowMinusOneIsAnError)
{
    CapturedLog log;
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    SystemCalls calls;
    calls.eventfd = [](unsigned int count, int flags) {
        EXPECT_EQ(count, 0U);
        EXPECT_EQ(flags, EFD_NONBLOCK | EFD_CLOEXEC);
        errno = EMFILE;
        return -2;
    };
    EXPECT_THAT([] { PollInterrupt(); }, ThrowsPosixError(EMFILE, "Failed to open eventfd: 24 (Too many open files)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to open eventfd: 24 (Too many open files)"));
}

} // namespace
} // namespace qel
