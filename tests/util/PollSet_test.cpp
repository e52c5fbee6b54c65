#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SignalStorm.hpp"
#include "support/SystemCalls.hpp"
#include "util/PollKit.hpp"

#include <cerrno>
#include <chrono>
#include <climits>
#include <cstdint>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <initializer_list>
#include <memory>
#include <poll.h>
#include <string>
#include <vector>

namespace qel {
namespace {

using std::chrono::hours;
using std::chrono::milliseconds;
using std::chrono::seconds;
using test::CapturedLog;
using test::kFive;
using test::kFiveText;
using test::kFour;
using test::kFourText;
using test::kThree;
using test::kThreeText;
using test::NoMoreDescriptors;
using test::Pipe;
using test::print;
using test::SystemCalls;
using test::ThrowsPosixError;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

std::string number(int value) { return std::to_string(value); }

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

TEST(PollSet, SumsDoNotChangeTheirOperands)
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

TEST(PollSet, AnEmptySetReturnsAtOnceWithoutCallingPoll)
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

TEST(PollSet, PassesItsEntriesToPollUnchanged)
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

TEST(PollSet, NarrowsTheMillisecondCountToAnInt)
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
        {milliseconds(INT_MAX) + milliseconds(1), INT_MIN}, // negative: no limit
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

TEST(PollSet, ATimeoutReturnsEveryEntryWithNoEventsSeen)
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

TEST(PollSet, ReturnsTheEventsSeen)
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
    EXPECT_EQ(print(set), a + b + "0x0000" + c + "0x0000)]") << "the set is unchanged";
    EXPECT_THAT(log.lines(),
                ElementsAre("D: Starting poll wait with timeout of -1 ms " + a + b + "0x0000" + c + "0x0000)]",
                            "D: Completed poll wait " + a + b + "0x0001" + c + "0x0004)]"));
}

TEST(PollSet, CanBeWaitedOnAgain)
{
    const Pipe pipe;
    const PollSet set(PollFd(pipe.reader(), PollEvents::Read));
    EXPECT_FALSE(set.poll().anyReady());
    pipe.fill();
    EXPECT_TRUE(set.poll().anyReady());
    EXPECT_TRUE(set.wait().anyReady());
}

TEST(PollSet, AHangUpMatchesEveryMask)
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

TEST(PollSet, AnInterruptedWaitReturnsAnEmptyResult)
{
    CapturedLog log;
    SystemCalls calls;
    calls.poll = [](pollfd* fds, nfds_t, int) {
        fds[0].revents = POLLIN; // would show in the result, not in the set that is logged
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

TEST(PollSet, ASignalEndsTheWaitWithAndWithoutRestart)
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

TEST(PollSet, ThrowsWhenPollFails)
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

TEST(PollSet, ThrowsForMoreEntriesThanDescriptorsAreAllowed)
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

TEST(PollSet, SavesErrnoBeforeItLogs)
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

TEST(PollSet, WritesNoLinesOfDisabledLevels)
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

} // namespace
} // namespace qel
