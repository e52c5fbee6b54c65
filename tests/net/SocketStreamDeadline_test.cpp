#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/SocketStream.hpp>

#include "net/SocketStreamKit.hpp"
#include "support/Loopback.hpp"
#include "support/SettableClock.hpp"
#include "support/SignalStorm.hpp"

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;
using test::kernelTimeout;
using test::kReadRetried;
using test::kWriteRetried;
using test::NestsNothing;
using test::NestsPosixError;
using test::throwsDeadline;
using test::throwsReceiveFailure;
using test::throwsSendFailure;
using ::testing::AllOf;
using ::testing::AnyOf;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Property;
using ::testing::StrEq;
using ::testing::Throws;

/// A stream with a clock that the test controls, and a socket whose reads and writes succeed unless a test replaces
/// them.
class SocketStreamDeadline : public test::SocketStreamPair {
protected:
    SocketStreamDeadline()
    {
        mCalls.read = [](int, void* buffer, std::size_t) {
            *static_cast<char*>(buffer) = 'r';
            return ssize_t{1};
        };
        mCalls.send = [](int, const void*, std::size_t length, int) { return static_cast<ssize_t>(length); };
    }

    std::vector<std::string> newOptions()
    {
        const std::vector<std::string> options = mRecorded.options();
        mRecorded.clear();
        return options;
    }

    test::SettableClock mClock;
};

TEST_F(SocketStreamDeadline, WithoutADeadlineNoOptionIsSet)
{
    read();
    write("x");
    read();
    write("x");
    EXPECT_THAT(mRecorded.options(), IsEmpty());
    EXPECT_EQ(mClock.steadyReads(), 0U) << "the clock is not read either";
}

TEST_F(SocketStreamDeadline, ADeadlineSetsNoOptionUntilTheNextTransfer)
{
    mStream.setReadDeadline(seconds(5));
    mStream.setWriteDeadline(seconds(6));
    EXPECT_THAT(newOptions(), IsEmpty());
    read();
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 5s 0us"));
    write("x");
    EXPECT_THAT(newOptions(), ElementsAre("SNDTIMEO 6s 0us"));
}

TEST_F(SocketStreamDeadline, TheSameTimeoutIsSetOnce)
{
    mStream.setReadDeadline(seconds(5));
    read();
    mStream.setReadDeadline(seconds(5));
    read();
    read(); // the clock does not advance: 5 s are left
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 5s 0us"));

    mStream.setWriteDeadline(seconds(5));
    write("x");
    mStream.setWriteDeadline(seconds(5));
    write("x");
    write("x");
    EXPECT_THAT(newOptions(), ElementsAre("SNDTIMEO 5s 0us"));
}

TEST_F(SocketStreamDeadline, EachTransferSetsTheTimeLeft)
{
    mStream.setReadDeadline(milliseconds(1500));
    mStream.setWriteDeadline(milliseconds(1250));
    mClock.advance(seconds(100)); // the time starts with the first transfer
    read();
    write("x");
    mClock.advance(milliseconds(500));
    read();
    write("x");
    mClock.advance(std::chrono::microseconds(999001));
    read(); // less than a millisecond is left: the shortest timeout
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 1s 500000us", "SNDTIMEO 1s 250000us", "RCVTIMEO 1s 0us",
                                          "SNDTIMEO 0s 750000us", "RCVTIMEO 0s 1us"));
}

TEST_F(SocketStreamDeadline, APassedDeadlineThrowsWithoutASystemCall)
{
    mStream.setReadDeadline(milliseconds(100));
    mStream.setWriteDeadline(milliseconds(100));
    read();
    write("x");
    mClock.advance(milliseconds(101));
    mCalls.read = [](int, void*, std::size_t) -> ssize_t {
        ADD_FAILURE() << "reads";
        return 0;
    };
    mCalls.send = [](int, const void*, std::size_t, int) -> ssize_t {
        ADD_FAILURE() << "sends";
        return 0;
    };
    newOptions();
    mLog.clear();
    EXPECT_THAT([this] { read(); }, throwsDeadline());
    EXPECT_THAT([this] { write("x"); }, throwsDeadline());
    EXPECT_THAT(newOptions(), IsEmpty());
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 1 bytes of data"));
}

TEST_F(SocketStreamDeadline, AStreamIsUsableAfterAPassedDeadline)
{
    mStream.setReadDeadline(milliseconds(100));
    read();
    mClock.advance(milliseconds(101));
    EXPECT_THAT([this] { read(); }, throwsDeadline());
    mStream.setReadDeadline(milliseconds(200));
    EXPECT_EQ(read(), "r");
    mStream.clearReadDeadline();
    mClock.advance(seconds(100));
    EXPECT_EQ(read(), "r");
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 0s 100000us", "RCVTIMEO 0s 200000us", "RCVTIMEO 0s 0us"));
}

TEST_F(SocketStreamDeadline, ClearingADeadlineClearsTheTimeout)
{
    mStream.setReadDeadline(seconds(5));
    mStream.setWriteDeadline(seconds(5));
    read();
    write("x");
    newOptions();
    mStream.clearReadDeadline();
    mStream.setWriteDeadline(milliseconds(-5)); // any negative value
    read();
    write("x");
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 0s 0us", "SNDTIMEO 0s 0us"));
}

TEST_F(SocketStreamDeadline, TheDirectionsAreIndependent)
{
    mStream.setReadDeadline(milliseconds(100));
    read();
    mClock.advance(milliseconds(101));
    EXPECT_THAT([this] { read(); }, throwsDeadline());
    write("x");
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 0s 100000us"));

    mStream.clearReadDeadline();
    mStream.setWriteDeadline(milliseconds(100));
    write("x");
    mClock.advance(milliseconds(101));
    EXPECT_THAT([this] { write("x"); }, throwsDeadline());
    read();
}

TEST_F(SocketStreamDeadline, SplitsTheTimeoutIntoSecondsAndMicroseconds)
{
    struct Row {
        milliseconds timeout;
        const char* option;
    };
    const Row rows[] = {
        {milliseconds(0), "RCVTIMEO 0s 1us"}, // zero would mean no timeout
        {milliseconds(1), "RCVTIMEO 0s 1000us"},
        {milliseconds(999), "RCVTIMEO 0s 999000us"},
        {milliseconds(1000), "RCVTIMEO 1s 0us"},
        {milliseconds(1001), "RCVTIMEO 1s 1000us"},
        {milliseconds(61234), "RCVTIMEO 61s 234000us"},
        {std::chrono::hours(24 * 365), "RCVTIMEO 31536000s 0us"},
        // At the end of the range of microseconds, and beyond.
        {milliseconds(9223372036854775), "RCVTIMEO 9223372036854s 775000us"},
        {milliseconds(9223372036854776), "RCVTIMEO 9223372036854s 775807us"},
        {milliseconds::max(), "RCVTIMEO 9223372036854s 775807us"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.timeout.count());
        mStream.clearReadDeadline();
        read();
        newOptions();
        mStream.setReadDeadline(row.timeout);
        EXPECT_EQ(read(), "r");
        EXPECT_THAT(newOptions(), ElementsAre(row.option));
    }
}

TEST_F(SocketStreamDeadline, ARetryAfterASignalSetsTheTimeLeft)
{
    int calls = 0;
    mCalls.read = [&](int, void* buffer, std::size_t) -> ssize_t {
        mClock.advance(milliseconds(100));
        if (++calls == 3) {
            *static_cast<char*>(buffer) = 'r';
            return 1;
        }
        errno = EINTR;
        return -1;
    };
    mCalls.send = [&](int, const void*, std::size_t length, int) -> ssize_t {
        mClock.advance(milliseconds(100));
        if (++calls == 6) return static_cast<ssize_t>(length);
        errno = EINTR;
        return -1;
    };
    mStream.setReadDeadline(milliseconds(300));
    EXPECT_EQ(read(), "r");
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 0s 300000us", "RCVTIMEO 0s 200000us", "RCVTIMEO 0s 100000us"));
    mStream.setWriteDeadline(milliseconds(300));
    write("x");
    EXPECT_THAT(newOptions(), ElementsAre("SNDTIMEO 0s 300000us", "SNDTIMEO 0s 200000us", "SNDTIMEO 0s 100000us"));
    EXPECT_THAT(mLog.lines(), ElementsAre(kReadRetried, kReadRetried, "D: socket stream read 1 bytes of data",
                                          "D: socket stream sending 1 bytes of data", kWriteRetried, kWriteRetried));
}

TEST_F(SocketStreamDeadline, ADeadlineThatPassesDuringASignalEndsTheRetries)
{
    mCalls.read = [&](int, void*, std::size_t) -> ssize_t {
        mClock.advance(milliseconds(101));
        errno = EINTR;
        return -1;
    };
    mStream.setReadDeadline(milliseconds(100));
    EXPECT_THAT([this] { read(); }, throwsDeadline());
    EXPECT_THAT(mLog.lines(), ElementsAre(kReadRetried));
}

TEST_F(SocketStreamDeadline, AWriteInSeveralCallsHasOneDeadline)
{
    mCalls.send = [&](int, const void*, std::size_t, int) -> ssize_t {
        mClock.advance(milliseconds(60));
        return 1;
    };
    mStream.setWriteDeadline(milliseconds(100));
    EXPECT_THAT([this] { write("abc"); }, throwsDeadline());
    EXPECT_THAT(newOptions(), ElementsAre("SNDTIMEO 0s 100000us", "SNDTIMEO 0s 40000us"));
}

TEST_F(SocketStreamDeadline, ATimeoutThatTheKernelRefusesThrowsWithTheErrorNested)
{
    mRecorded.failAt(1);
    mStream.setReadDeadline(seconds(5));
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EPERM, "Failed to set socket option: 1 (Operation not permitted)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: Failed to set socket option 1 20: 1 (Operation not permitted)"));
    // The value counts as set and is not tried again.
    EXPECT_EQ(read(), "r");
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 5s 0us"));

    mLog.clear();
    mStream.setWriteDeadline(seconds(5));
    EXPECT_THAT([this] { write("x"); },
                throwsSendFailure(EPERM, "Failed to set socket option: 1 (Operation not permitted)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 1 bytes of data",
                                          "E: Failed to set socket option 1 21: 1 (Operation not permitted)"));
}

// Deadlines and the real kernel

using SocketStreamKernelDeadline = test::SocketStreamPair;

TEST_F(SocketStreamKernelDeadline, SetsTheTimeoutOfTheKernel)
{
    const Socket observer(::dup(fd()));
    peerSends("ab");
    mStream.setReadDeadline(seconds(5));
    EXPECT_EQ(read(1), "a");
    EXPECT_EQ(kernelTimeout(observer.getFd(), SO_RCVTIMEO).tv_sec, 5);
    mStream.clearReadDeadline();
    EXPECT_EQ(read(1), "b");
    EXPECT_EQ(kernelTimeout(observer.getFd(), SO_RCVTIMEO).tv_sec, 0);
    EXPECT_EQ(kernelTimeout(observer.getFd(), SO_RCVTIMEO).tv_usec, 0);

    mStream.setWriteDeadline(seconds(7));
    write("x");
    EXPECT_EQ(kernelTimeout(observer.getFd(), SO_SNDTIMEO).tv_sec, 7);
    mStream.clearWriteDeadline();
    write("x");
    EXPECT_EQ(kernelTimeout(observer.getFd(), SO_SNDTIMEO).tv_sec, 0);
}

TEST_F(SocketStreamKernelDeadline, TheKernelAcceptsTheLongestTimeout)
{
    peerSends("a");
    mStream.setReadDeadline(milliseconds::max());
    EXPECT_EQ(read(), "a");
    mStream.setWriteDeadline(milliseconds::max());
    write("x");
    EXPECT_EQ(peerReads(1), "x");
}

TEST_F(SocketStreamKernelDeadline, AReadThrowsWhenItsDeadlinePasses)
{
    mStream.setReadDeadline(milliseconds(50));
    const steady_clock::time_point begin = steady_clock::now();
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EAGAIN, "socket stream failed to receive: 11 (Resource temporarily unavailable)"));
    const auto elapsed = steady_clock::now() - begin;
    EXPECT_GE(elapsed, milliseconds(40)); // the kernel counts in ticks
    EXPECT_LT(elapsed, seconds(10));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: socket stream failed to receive: 11 (Resource temporarily unavailable)"));
    // The stream is usable again.
    mStream.clearReadDeadline();
    peerSends("still here");
    EXPECT_EQ(read(), "still here");
}

TEST_F(SocketStreamKernelDeadline, AReadDeadlineOfZeroThrowsWhenNothingHasArrived)
{
    mStream.setReadDeadline(milliseconds(0));
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EAGAIN, "socket stream failed to receive: 11 (Resource temporarily unavailable)"));
    EXPECT_THAT(mRecorded.options(), ElementsAre("RCVTIMEO 0s 1us"));
    EXPECT_THAT([this] { read(); }, throwsDeadline()) << "the clock has advanced";
}

TEST_F(SocketStreamKernelDeadline, AReadDeadlineOfZeroReturnsWhatHasArrived)
{
    peerSends("there");
    EXPECT_TRUE(PollSet(mStream.getSocket().getPollFd(PollEvents::Read)).wait(seconds(10)).anyReady());
    mStream.setReadDeadline(milliseconds(0));
    EXPECT_EQ(read(), "there");
}

TEST_F(SocketStreamKernelDeadline, AWriteThrowsWhenItsDeadlinePasses)
{
    // More than the buffers of both sides hold, and the peer does not read.
    const std::string tooMuch(16 * 1024 * 1024, 'x');
    mStream.setWriteDeadline(milliseconds(50));
    const steady_clock::time_point begin = steady_clock::now();
    // Whether the deadline passes inside a call or between two depends on how the buffers fill.
    EXPECT_THAT(
        [&] { write(tooMuch); },
        Throws<StreamIOException>(AnyOf(
            AllOf(Property(&StreamIOException::what, StrEq("I/O deadline")), NestsNothing()),
            AllOf(Property(&StreamIOException::what, StrEq("socket stream send failure")),
                  NestsPosixError(EAGAIN, "socket stream send failure: 11 (Resource temporarily unavailable)")))));
    const auto elapsed = steady_clock::now() - begin;
    EXPECT_GE(elapsed, milliseconds(40)); // the kernel counts in ticks
    EXPECT_LT(elapsed, seconds(10));
}

TEST_F(SocketStreamKernelDeadline, AWriteDeadlineOfZeroThrowsWhenThereIsNoRoom)
{
    // Fill the buffers until there is no room for a single byte.
    const std::string piece(64 * 1024, 'x');
    while (::send(fd(), piece.data(), piece.size(), MSG_DONTWAIT) > 0) {
    }
    while (::send(fd(), "x", 1, MSG_DONTWAIT) > 0) {
    }
    mStream.setWriteDeadline(milliseconds(0));
    EXPECT_THAT([this] { write("x"); },
                throwsSendFailure(EAGAIN, "socket stream send failure: 11 (Resource temporarily unavailable)"));
    EXPECT_THAT(mRecorded.options(), ElementsAre("SNDTIMEO 0s 1us"));
}

TEST_F(SocketStreamKernelDeadline, SignalsDoNotExtendADeadline)
{
    mStream.setReadDeadline(milliseconds(200)); // long enough for a signal on a busy machine
    const steady_clock::time_point begin = steady_clock::now();
    // With a timeout the kernel does not restart the read, not even with SA_RESTART: the stream does.
    test::callUnderSignals(
        SA_RESTART, [this] { EXPECT_THROW(read(), StreamIOException); }, [] { return true; });
    const auto elapsed = steady_clock::now() - begin;
    EXPECT_GE(elapsed, milliseconds(190)); // the kernel counts in ticks
    EXPECT_LT(elapsed, seconds(10));
    EXPECT_THAT(mLog.lines(), Contains(kReadRetried));
}

} // namespace
} // namespace qel
