#include <qel/common/LogLevel.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/util/PosixError.hpp>

#include "net/SocketKit.hpp"
#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SettableClock.hpp"
#include "support/SignalStorm.hpp"
#include "support/SystemCalls.hpp"

#include <cerrno>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string>
#include <sys/socket.h>
#include <vector>

namespace qel {
namespace {

using std::chrono::hours;
using std::chrono::microseconds;
using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;
using test::CapturedLog;
using test::isNonBlocking;
using test::kLong;
using test::SystemCalls;
using test::tcpSocket;
using test::ThrowsPosixError;
using ::testing::AnyOf;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

class SocketConnectOver : public test::EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(SocketConnectOver);

TEST_P(SocketConnectOver, RestoresTheFlagsAfterSuccess)
{
    CapturedLog log(LogLevel::Info);
    const Socket listener = test::makeListener(GetParam());
    Socket blocking = tcpSocket(GetParam());
    const int before = blocking.getFlags();
    blocking.connect(listener.getSocketName(), kLong);
    EXPECT_EQ(blocking.getFlags(), before);
    EXPECT_FALSE(isNonBlocking(blocking.getFd()));
    EXPECT_EQ(blocking.getPeerName(), listener.getSocketName());

    Socket nonBlocking(GetParam(), SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    nonBlocking.connect(listener.getSocketName(), kLong);
    EXPECT_TRUE(isNonBlocking(nonBlocking.getFd()));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_P(SocketConnectOver, PassesAnAddressOf128BytesOnANonBlockingSocket)
{
    const Socket listener = test::makeListener(GetParam());
    const IPEndpoint endpoint = listener.getSocketName();
    SystemCalls calls;
    int connects = 0;
    calls.connect = [&](int fd, const sockaddr* address, socklen_t length) {
        ++connects;
        EXPECT_EQ(length, 128U);
        EXPECT_EQ(IPEndpoint(*reinterpret_cast<const sockaddr_storage*>(address)), endpoint);
        EXPECT_TRUE(isNonBlocking(fd));
        return ::connect(fd, address, length);
    };
    Socket socket = tcpSocket(GetParam());
    socket.connect(endpoint, kLong);
    EXPECT_EQ(connects, 1);
}

TEST(SocketConnect, KeepsTheOtherFlagsOfTheDescriptor)
{
    const Socket listener = test::makeListener();
    Socket socket = tcpSocket();
    socket.setFlags(socket.getFlags() | O_APPEND);
    const int before = socket.getFlags();
    SystemCalls calls;
    int during = -1;
    calls.connect = [&](int fd, const sockaddr* address, socklen_t length) {
        during = ::fcntl(fd, F_GETFL);
        return ::connect(fd, address, length);
    };
    socket.connect(listener.getSocketName(), kLong);
    EXPECT_EQ(during, before | O_NONBLOCK);
    EXPECT_EQ(socket.getFlags(), before);
}

TEST(SocketConnect, DoesNotWaitWhenItSucceedsAtOnce)
{
    SystemCalls calls;
    calls.connect = [](int, const sockaddr*, socklen_t) { return 0; };
    calls.poll = [](pollfd*, nfds_t, int) {
        ADD_FAILURE() << "waits";
        return 0;
    };
    Socket socket = tcpSocket();
    socket.connect(test::loopback(), kLong);
    EXPECT_FALSE(isNonBlocking(socket.getFd()));
}

TEST_P(SocketConnectOver, ThrowsWhenThePeerRefuses)
{
    CapturedLog log(LogLevel::Info);
    const Socket refusing = test::makeRefusingSocket(GetParam());
    Socket socket = tcpSocket(GetParam());
    // Whether the refusal comes at once or later is up to the system.
    const std::string atOnce = "socket connect failed: 111 (Connection refused)";
    const std::string later = "socket connect failed: SO_ERROR: 111 (Connection refused)";
    EXPECT_THAT([&] { socket.connect(refusing.getSocketName(), kLong); },
                ThrowsMessage<PosixError>(AnyOf(StrEq(atOnce), StrEq(later))));
    EXPECT_THAT(log.lines(), ElementsAre(AnyOf("E: " + atOnce, "E: " + later)));
    EXPECT_TRUE(isNonBlocking(socket.getFd())) << "the flags are restored only after success";
}

TEST_P(SocketConnectOver, ThrowsWhenThePeerRefusesLater)
{
    CapturedLog log(LogLevel::Info);
    test::SilentEndpoint silent(GetParam());
    SystemCalls calls;
    calls.poll = [&](pollfd* fds, nfds_t count, int timeout) {
        silent.closeListener(); // refuses the next attempt, which the system makes after about a second
        return ::poll(fds, count, timeout);
    };
    Socket socket = tcpSocket(GetParam());
    EXPECT_THAT([&] { socket.connect(silent.endpoint(), kLong); },
                ThrowsPosixError(ECONNREFUSED, "socket connect failed: SO_ERROR: 111 (Connection refused)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: socket connect failed: SO_ERROR: 111 (Connection refused)"));
    EXPECT_TRUE(isNonBlocking(socket.getFd()));
}

TEST(SocketConnect, ThrowsThePendingErrorOfTheSocket)
{
    CapturedLog log(LogLevel::Info);
    SystemCalls calls;
    calls.connect = [](int, const sockaddr*, socklen_t) {
        errno = EINPROGRESS;
        return -1;
    };
    calls.poll = [](pollfd* fds, nfds_t count, int) {
        EXPECT_EQ(count, 1U);
        EXPECT_EQ(fds[0].events, 0x3C);
        fds[0].revents = POLLERR | POLLHUP;
        return 1;
    };
    calls.getsockopt = [](int, int level, int name, void* value, socklen_t* length) {
        EXPECT_EQ(level, SOL_SOCKET);
        EXPECT_EQ(name, SO_ERROR);
        EXPECT_EQ(*length, 4U);
        EXPECT_EQ(*static_cast<int*>(value), -1);
        *static_cast<int*>(value) = EHOSTUNREACH;
        return 0;
    };
    Socket socket = tcpSocket();
    EXPECT_THAT([&] { socket.connect(test::loopback(), kLong); },
                ThrowsPosixError(EHOSTUNREACH, "socket connect failed: SO_ERROR: 113 (No route to host)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: socket connect failed: SO_ERROR: 113 (No route to host)"));
    EXPECT_TRUE(isNonBlocking(socket.getFd()));
}

TEST(SocketConnect, RefusesALinkLocalAddressBecauseItHasNoScope)
{
    const std::string reason = test::whyNoLoopback(IPFamily::IPv6);
    if (!reason.empty()) GTEST_SKIP() << reason;
    CapturedLog log(LogLevel::Info);
    Socket socket = tcpSocket(IPFamily::IPv6);
    EXPECT_THAT([&] { socket.connect(IPEndpoint("[fe80::1]:80"), kLong); },
                ThrowsPosixError(EINVAL, "socket connect failed: 22 (Invalid argument)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: socket connect failed: 22 (Invalid argument)"));
    EXPECT_TRUE(isNonBlocking(socket.getFd()));
}

TEST(SocketConnect, RefusesAnotherFamilyAtOnce)
{
    Socket socket = tcpSocket(IPFamily::IPv4);
    EXPECT_THAT([&] { socket.connect(IPEndpoint("[::1]:80"), kLong); },
                ThrowsPosixError(EAFNOSUPPORT, "socket connect failed: 97 (Address family not supported by protocol)"));
}

TEST(SocketConnect, ThrowsWithoutADescriptor)
{
    CapturedLog log;
    EXPECT_THAT([] { Socket(-1).connect(test::loopback(), kLong); },
                ThrowsPosixError(EBADF, "Failed to get socket fd flags: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket fd flags: 9 (Bad file descriptor)"));
}

TEST_P(SocketConnectOver, TimesOutWithoutAnAnswer)
{
    CapturedLog log(LogLevel::Info);
    const test::SilentEndpoint silent(GetParam());
    Socket socket = tcpSocket(GetParam());
    const steady_clock::time_point begin = steady_clock::now();
    EXPECT_THAT([&] { socket.connect(silent.endpoint(), milliseconds(100)); },
                ThrowsPosixError(ETIMEDOUT, "socket connect timed out: 110 (Connection timed out)"));
    const auto elapsed = steady_clock::now() - begin;
    EXPECT_GE(elapsed, milliseconds(100));
    EXPECT_LT(elapsed, kLong);
    EXPECT_THAT(log.lines(), ElementsAre("E: socket connect timed out: 110 (Connection timed out)"));
    EXPECT_TRUE(isNonBlocking(socket.getFd()));
}

TEST(SocketConnect, SignalsDoNotChangeTheTimeout)
{
    const test::SilentEndpoint silent;
    Socket socket = tcpSocket();
    const steady_clock::time_point begin = steady_clock::now();
    const int signals = test::callUnderSignals(
        0,
        [&] {
            // Long enough for a signal on a busy machine.
            EXPECT_THAT([&] { socket.connect(silent.endpoint(), milliseconds(200)); },
                        ThrowsPosixError(ETIMEDOUT, "socket connect timed out: 110 (Connection timed out)"));
        },
        [] { return true; });
    EXPECT_GE(steady_clock::now() - begin, milliseconds(200));
    EXPECT_LT(steady_clock::now() - begin, kLong);
    EXPECT_GE(signals, 1);
}

/// A connect that stays in progress, with a clock and a poll that the test controls.
class PendingConnect : public ::testing::Test {
protected:
    PendingConnect()
    {
        mCalls.connect = [](int, const sockaddr*, socklen_t) {
            errno = EINPROGRESS;
            return -1;
        };
        mCalls.poll = [this](pollfd* fds, nfds_t, int timeout) {
            mTimeouts.push_back(timeout);
            mClock.advance(mEachPollTakes);
            if (mTimeouts.size() == mReadyAtPoll) {
                fds[0].revents = POLLOUT;
                return 1;
            }
            if (!mInterrupted) return 0;
            errno = EINTR;
            return -1;
        };
        mCalls.getsockopt = [](int, int, int, void* value, socklen_t*) {
            *static_cast<int*>(value) = 0;
            return 0;
        };
    }

    void connect(milliseconds timeout) { mSocket.connect(test::loopback(), timeout); }

    auto timesOut() const
    {
        return ThrowsPosixError(ETIMEDOUT, "socket connect timed out: 110 (Connection timed out)");
    }

    test::SettableClock mClock;
    SystemCalls mCalls;
    Socket mSocket = tcpSocket();
    std::vector<int> mTimeouts; // given to poll
    std::size_t mReadyAtPoll = 0;
    milliseconds mEachPollTakes{100};
    bool mInterrupted = true;
};

TEST_F(PendingConnect, WaitsForTheTimeLeftAfterSignals)
{
    EXPECT_THAT([this] { connect(milliseconds(300)); }, timesOut());
    EXPECT_THAT(mTimeouts, ElementsAre(300, 200, 100));
}

TEST_F(PendingConnect, WaitsForTheTimeLeftWhenPollReturnsTooEarly)
{
    mInterrupted = false;
    EXPECT_THAT([this] { connect(milliseconds(250)); }, timesOut());
    EXPECT_THAT(mTimeouts, ElementsAre(250, 150, 50));
}

TEST_F(PendingConnect, SucceedsAfterSignals)
{
    mReadyAtPoll = 3;
    connect(milliseconds(300));
    EXPECT_THAT(mTimeouts, ElementsAre(300, 200, 100));
    EXPECT_FALSE(isNonBlocking(mSocket.getFd()));
}

TEST_F(PendingConnect, SucceedsWhenItIsReadyAtTheDeadline)
{
    mReadyAtPoll = 1;
    connect(milliseconds(100)); // the deadline passes during the very poll that finds it ready
    EXPECT_THAT(mTimeouts, ElementsAre(100));
}

TEST_F(PendingConnect, AZeroTimeoutPollsOnce)
{
    EXPECT_THAT([this] { connect(milliseconds(0)); }, timesOut());
    EXPECT_THAT(mTimeouts, ElementsAre(0));
}

TEST_F(PendingConnect, ANegativeTimeoutPollsOnceAtAnyTime)
{
    for (const steady_clock::duration sinceStart :
         {steady_clock::duration(0), steady_clock::duration(1), steady_clock::duration(seconds(1800)),
          steady_clock::duration::max() - seconds(10)}) {
        for (const milliseconds timeout : {milliseconds(-1), milliseconds(-5000), milliseconds(hours(-1)),
                                           milliseconds::min() + milliseconds(1), milliseconds::min()}) {
            SCOPED_TRACE(std::to_string(sinceStart.count()) + " and " + std::to_string(timeout.count()));
            mClock.setSteady(steady_clock::time_point(sinceStart));
            mTimeouts.clear();
            EXPECT_THAT([&] { connect(timeout); }, timesOut());
            EXPECT_THAT(mTimeouts, ElementsAre(0));
        }
    }
}

TEST_F(PendingConnect, TheLongestTimeoutsDoNotOverflow)
{
    mReadyAtPoll = 3;
    for (const steady_clock::time_point now :
         {steady_clock::time_point(), steady_clock::time_point(hours(1)), steady_clock::time_point(seconds(-1))}) {
        for (const milliseconds timeout : {milliseconds::max(), milliseconds(std::int64_t{1} << 53)}) {
            SCOPED_TRACE(std::to_string(now.time_since_epoch().count()) + " and " + std::to_string(timeout.count()));
            mClock.setSteady(now);
            mTimeouts.clear();
            connect(timeout);
            EXPECT_EQ(mTimeouts.size(), 3U);
        }
    }
}

TEST_F(PendingConnect, TheDeadlineStaysWithinTheRangeOfTheClock)
{
    // Beyond the last time point it is that point.
    mReadyAtPoll = 2;
    mClock.setSteady(steady_clock::time_point::max() - milliseconds(1000));
    connect(milliseconds(5000));
    EXPECT_THAT(mTimeouts, ElementsAre(1000, 900));
    // A deadline before the epoch would be disabled, and the wait without limit: it is the epoch.
    mTimeouts.clear();
    mClock.setSteady(steady_clock::time_point(milliseconds(-1000)));
    connect(milliseconds(300));
    EXPECT_THAT(mTimeouts, ElementsAre(1000, 900));
}

TEST_F(PendingConnect, PollsWithoutWaitingWhenLessThanAMillisecondIsLeft)
{
    mEachPollTakes = milliseconds(0);
    mCalls.poll = [this](pollfd*, nfds_t, int timeout) {
        mTimeouts.push_back(timeout);
        mClock.advance(microseconds(500));
        return 0;
    };
    EXPECT_THAT([this] { connect(milliseconds(2)); }, timesOut());
    EXPECT_THAT(mTimeouts, ElementsAre(2, 1, 1, 0));
}

TEST_F(PendingConnect, ThrowsWhenPollFails)
{
    CapturedLog log(LogLevel::Info);
    mCalls.poll = [](pollfd*, nfds_t, int) {
        errno = ENOMEM;
        return -1;
    };
    EXPECT_THAT([this] { connect(milliseconds(100)); },
                ThrowsPosixError(ENOMEM, "poll() failed: 12 (Cannot allocate memory)"));
    EXPECT_TRUE(isNonBlocking(mSocket.getFd()));
}

TEST_F(PendingConnect, ThrowsWhenThePendingErrorCannotBeRead)
{
    CapturedLog log(LogLevel::Info);
    mReadyAtPoll = 1;
    mCalls.getsockopt = [](int, int, int, void*, socklen_t*) {
        errno = ENOBUFS;
        return -1;
    };
    EXPECT_THAT([this] { connect(milliseconds(100)); },
                ThrowsPosixError(ENOBUFS, "Failed to get socket option: 105 (No buffer space available)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket option 1 4: 105 (No buffer space available)"));
    EXPECT_TRUE(isNonBlocking(mSocket.getFd()));
}

} // namespace
} // namespace qel
