#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SettableClock.hpp"
#include "support/SignalStorm.hpp"
#include "support/SystemCalls.hpp"

#include <cerrno>
#include <chrono>
#include <cstddef>
#include <cstring>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <type_traits>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel {
namespace {

using std::chrono::hours;
using std::chrono::microseconds;
using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;
using test::CapturedLog;
using test::SystemCalls;
using test::ThrowsPosixError;
using ::testing::AllOf;
using ::testing::AnyOf;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

static_assert(!std::is_copy_constructible<Socket>::value && !std::is_copy_assignable<Socket>::value, "one owner");
static_assert(std::is_nothrow_move_constructible<Socket>::value && std::is_nothrow_move_assignable<Socket>::value, "");
static_assert(!std::is_convertible<int, Socket>::value, "a number is a socket only when asked");
static_assert(std::is_base_of<SocketIF, Socket>::value && std::is_abstract<SocketIF>::value, "");

constexpr seconds kLong(10); // a limit that is never reached when all is well

bool isOpen(int fd) { return ::fcntl(fd, F_GETFD) != -1; }

bool isNonBlocking(int fd) { return (::fcntl(fd, F_GETFL) & O_NONBLOCK) != 0; }

int intOption(const Socket& socket, int level, int name)
{
    int value = -1;
    std::size_t length = sizeof(value);
    socket.getSocketOption(level, name, &value, length);
    EXPECT_EQ(length, sizeof(value));
    return value;
}

Socket tcpSocket(IPFamily family = IPFamily::IPv4) { return Socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0); }

// The place of a virtual operation in its table, counted in pointers: under the C++ ABI of our platforms a pointer to a
// virtual member function begins with the byte offset in the table (plus one on some of them).
template <typename Member>
std::size_t slotOf(Member member)
{
    std::ptrdiff_t offset = 0;
    std::memcpy(&offset, &member, sizeof(offset));
    return static_cast<std::size_t>(offset) / sizeof(void*);
}

class SocketOver : public test::EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(SocketOver);

TEST(SocketIF, OperationsKeepTheirOrder)
{
    // The destructor takes the first two places: one form destroys, the other one releases the memory as well.
    EXPECT_EQ(slotOf(&SocketIF::getPollFd), 2U);
    EXPECT_EQ(slotOf(&SocketIF::shutdown), 3U);
    EXPECT_EQ(slotOf(&SocketIF::read), 4U);
    EXPECT_EQ(slotOf(&SocketIF::write), 5U);
}

// Opening, owning, moving

TEST_P(SocketOver, OpensASocketOfTheFamily)
{
    const Socket stream(GetParam(), SOCK_STREAM, 0);
    EXPECT_TRUE(isOpen(stream.getFd()));
    EXPECT_EQ(intOption(stream, SOL_SOCKET, SO_DOMAIN), IPFamilyUtils::toUNIXAddressFamily(GetParam()));
    EXPECT_EQ(intOption(stream, SOL_SOCKET, SO_TYPE), SOCK_STREAM);
    EXPECT_EQ(intOption(stream, SOL_SOCKET, SO_PROTOCOL), IPPROTO_TCP);
    const Socket datagram(GetParam(), SOCK_DGRAM, IPPROTO_UDP);
    EXPECT_EQ(intOption(datagram, SOL_SOCKET, SO_TYPE), SOCK_DGRAM);
    EXPECT_EQ(intOption(datagram, SOL_SOCKET, SO_PROTOCOL), IPPROTO_UDP);
}

TEST(Socket, TheTypeIsPassedOnUnchanged)
{
    EXPECT_EQ(::fcntl(Socket(IPFamily::IPv4, SOCK_STREAM, 0).getFd(), F_GETFD), 0) << "no close-on-exec of its own";
    EXPECT_EQ(::fcntl(Socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0).getFd(), F_GETFD), FD_CLOEXEC);
    EXPECT_TRUE(isNonBlocking(Socket(IPFamily::IPv4, SOCK_STREAM | SOCK_NONBLOCK, 0).getFd()));
}

TEST(Socket, CannotBeOpenedWithoutADescriptor)
{
    CapturedLog log;
    SystemCalls calls;
    calls.socket = [](int family, int type, int protocol) {
        const test::NoMoreDescriptors exhausted;
        return ::socket(family, type, protocol);
    };
    EXPECT_THAT([] { tcpSocket(); }, ThrowsPosixError(EMFILE, "Cannot open socket: 24 (Too many open files)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Cannot open socket: 24 (Too many open files)"));
}

TEST(Socket, CannotBeOpenedWithAProtocolOfAnotherType)
{
    CapturedLog log;
    EXPECT_THAT([] { Socket(IPFamily::IPv4, SOCK_STREAM, IPPROTO_UDP); },
                ThrowsPosixError(EPROTONOSUPPORT, "Cannot open socket: 93 (Protocol not supported)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Cannot open socket: 93 (Protocol not supported)"));
}

TEST(Socket, CannotBeOpenedForAnotherFamily)
{
    EXPECT_THAT([] { Socket(static_cast<IPFamily>(5), SOCK_STREAM, 0); },
                ThrowsMessage<std::invalid_argument>(StrEq("Not an IP address family")));
}

TEST(Socket, AdoptsADescriptorAndClosesIt)
{
    const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    {
        const Socket socket(fd);
        EXPECT_EQ(socket.getFd(), fd);
        EXPECT_TRUE(isOpen(fd));
    }
    EXPECT_FALSE(isOpen(fd));
}

TEST(Socket, IsClosedThroughItsInterface)
{
    std::unique_ptr<SocketIF> socket = std::make_unique<Socket>(tcpSocket());
    const int fd = socket->getPollFd(PollEvents::Read).mFd.fd;
    EXPECT_TRUE(isOpen(fd));
    socket.reset();
    EXPECT_FALSE(isOpen(fd));
}

TEST(Socket, WithoutADescriptorNothingIsClosed)
{
    SystemCalls calls;
    calls.close = [](int fd) {
        ADD_FAILURE() << "closes " << fd;
        return 0;
    };
    const Socket none(-1);
    EXPECT_EQ(none.getFd(), -1);
    const Socket lower(-5);
}

TEST(Socket, ADescriptorZeroIsOneToo)
{
    SystemCalls calls;
    std::vector<int> closed;
    calls.close = [&](int fd) {
        closed.push_back(fd);
        return 0;
    };
    {
        const Socket zero(0);
    }
    EXPECT_THAT(closed, ElementsAre(0));
}

TEST(Socket, MovingLeavesTheSourceWithoutADescriptor)
{
    auto source = std::make_unique<Socket>(tcpSocket());
    const int fd = source->getFd();
    const Socket target(std::move(*source));
    EXPECT_EQ(target.getFd(), fd);
    EXPECT_EQ(source->getFd(), -1);

    SystemCalls calls;
    calls.close = [](int closed) {
        ADD_FAILURE() << "closes " << closed;
        return 0;
    };
    source.reset();
    calls.close = nullptr;
    EXPECT_TRUE(isOpen(fd));
}

TEST(Socket, MoveAssignmentClosesTheOldDescriptorFirst)
{
    Socket source = tcpSocket();
    Socket target = tcpSocket();
    const int fd = source.getFd();
    const int old = target.getFd();
    EXPECT_EQ(&(target = std::move(source)), &target);
    EXPECT_EQ(target.getFd(), fd);
    EXPECT_EQ(source.getFd(), -1);
    EXPECT_TRUE(isOpen(fd));
    EXPECT_FALSE(isOpen(old));
}

TEST(Socket, MoveAssignmentOfNothingCloses)
{
    Socket socket = tcpSocket();
    const int fd = socket.getFd();
    socket = Socket(-1);
    EXPECT_EQ(socket.getFd(), -1);
    EXPECT_FALSE(isOpen(fd));
    socket = tcpSocket();
    EXPECT_TRUE(isOpen(socket.getFd()));
}

TEST(Socket, AssignedToItselfItKeepsItsDescriptor)
{
    Socket socket = tcpSocket();
    const int fd = socket.getFd();
    Socket& same = socket; // through another name: the compilers warn about the plain form
    socket = std::move(same);
    EXPECT_EQ(socket.getFd(), fd);
    EXPECT_TRUE(isOpen(fd));
}

TEST(Socket, GivesAnEntryForAPollSet)
{
    const Socket socket = tcpSocket();
    const PollFd entry = socket.getPollFd(PollEvents::Write);
    EXPECT_EQ(entry.mFd.fd, socket.getFd());
    EXPECT_EQ(entry.mFd.events, 0x3C);
    EXPECT_EQ(entry.mFd.revents, 0);
    EXPECT_EQ(socket.getPollFd(PollEvents::Read).mFd.events, 0x39);
}

// Connecting

TEST_P(SocketOver, ConnectsAndRestoresTheFlags)
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

TEST_P(SocketOver, HandsAWholeSocketAddressToConnectOnANonBlockingSocket)
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

TEST(Socket, AConnectLeavesTheOtherFlagsOfTheDescriptorAlone)
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

TEST(Socket, AConnectThatIsDoneAtOnceNeedsNoWaiting)
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

TEST_P(SocketOver, ARefusedConnectThrows)
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

TEST_P(SocketOver, AConnectIsRefusedLaterWhenTheListenerHasGone)
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

TEST(Socket, ThePendingErrorOfAConnectIsRead)
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

TEST(Socket, AConnectToALinkLocalAddressFailsAtOnceForWantOfAScope)
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

TEST(Socket, AConnectToAnotherFamilyFailsAtOnce)
{
    Socket socket = tcpSocket(IPFamily::IPv4);
    EXPECT_THAT([&] { socket.connect(IPEndpoint("[::1]:80"), kLong); },
                ThrowsPosixError(EAFNOSUPPORT, "socket connect failed: 97 (Address family not supported by protocol)"));
}

TEST(Socket, AConnectWithoutADescriptorFails)
{
    CapturedLog log;
    EXPECT_THAT([] { Socket(-1).connect(test::loopback(), kLong); },
                ThrowsPosixError(EBADF, "Failed to get socket fd flags: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket fd flags: 9 (Bad file descriptor)"));
}

TEST_P(SocketOver, AConnectThatIsNeverAnsweredTimesOut)
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

TEST(Socket, SignalsDoNotMakeAConnectTimeOutSoonerOrLater)
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

/// A connect that stays on its way, over a clock and a poll that the test controls.
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

TEST_F(PendingConnect, WaitsOnWithTheTimeLeftAfterSignals)
{
    EXPECT_THAT([this] { connect(milliseconds(300)); }, timesOut());
    EXPECT_THAT(mTimeouts, ElementsAre(300, 200, 100));
}

TEST_F(PendingConnect, WaitsOnWhenPollReturnsTooSoon)
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

TEST_F(PendingConnect, AConnectionThatIsReadyIsNotTooLate)
{
    mReadyAtPoll = 1;
    connect(milliseconds(100)); // the deadline passes during the very poll that finds it ready
    EXPECT_THAT(mTimeouts, ElementsAre(100));
}

TEST_F(PendingConnect, AZeroTimeoutLooksOnce)
{
    EXPECT_THAT([this] { connect(milliseconds(0)); }, timesOut());
    EXPECT_THAT(mTimeouts, ElementsAre(0));
}

TEST_F(PendingConnect, ANegativeTimeoutLooksOnceWhateverTheClockShows)
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

TEST_F(PendingConnect, LessThanAMillisecondLeftIsWaitedForByLooking)
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

TEST_F(PendingConnect, AFailedPollThrows)
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

TEST_F(PendingConnect, APendingErrorThatCannotBeReadThrows)
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

// Binding, listening, accepting

TEST_P(SocketOver, BindsToAFreePort)
{
    Socket socket = tcpSocket(GetParam());
    SystemCalls calls;
    calls.bind = [](int fd, const sockaddr* address, socklen_t length) {
        EXPECT_EQ(length, 128U);
        return ::bind(fd, address, length);
    };
    socket.bind(test::loopback(GetParam()));
    EXPECT_EQ(socket.getSocketName().getAddress(), test::loopback(GetParam()).getAddress());
    EXPECT_NE(socket.getSocketName().getPort(), 0);
}

TEST_P(SocketOver, CannotBindToAPortInUse)
{
    CapturedLog log;
    const Socket holder = test::makeRefusingSocket(GetParam());
    Socket socket = tcpSocket(GetParam());
    EXPECT_THAT([&] { socket.bind(holder.getSocketName()); },
                ThrowsPosixError(EADDRINUSE, "socket bind failed: 98 (Address already in use)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: socket bind failed: 98 (Address already in use)"));
}

TEST(Socket, ListensAndAccepts)
{
    Socket listener = tcpSocket();
    listener.bind(test::loopback());
    EXPECT_EQ(intOption(listener, SOL_SOCKET, SO_ACCEPTCONN), 0);
    listener.listen(1);
    EXPECT_EQ(intOption(listener, SOL_SOCKET, SO_ACCEPTCONN), 1);
    Socket client = tcpSocket();
    client.connect(listener.getSocketName(), kLong);
    const Socket server = listener.accept();
    EXPECT_EQ(server.getPeerName(), client.getSocketName());
    EXPECT_EQ(server.getSocketName(), client.getPeerName());
}

TEST(Socket, TheBacklogIsPassedOnUnchanged)
{
    for (const int backlog : {1, 7}) {
        Socket listener = tcpSocket();
        listener.bind(test::loopback());
        listener.listen(backlog);
        EXPECT_EQ(test::backlogOf(listener), static_cast<unsigned int>(backlog));
    }
}

TEST(Socket, OnlyStreamsListen)
{
    CapturedLog log;
    Socket datagram(IPFamily::IPv4, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    EXPECT_THAT([&] { datagram.listen(1); },
                ThrowsPosixError(EOPNOTSUPP, "Failed to listen on socket: 95 (Operation not supported)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to listen on socket " + std::to_string(datagram.getFd()) +
                                         ": 95 (Operation not supported)"));
}

TEST(Socket, AcceptedSocketsDoNotSurviveAnExecAndTakeFurtherFlags)
{
    Socket listener = test::makeListener();
    Socket first = tcpSocket();
    Socket second = tcpSocket();
    first.connect(listener.getSocketName(), kLong);
    second.connect(listener.getSocketName(), kLong);

    SystemCalls calls;
    int expectedFlags = SOCK_CLOEXEC;
    calls.accept4 = [&](int fd, sockaddr* address, socklen_t* length, int flags) {
        EXPECT_EQ(fd, listener.getFd());
        EXPECT_EQ(address, nullptr);
        EXPECT_EQ(length, nullptr);
        EXPECT_EQ(flags, expectedFlags);
        return ::accept4(fd, address, length, flags);
    };
    const Socket plain = listener.accept(0);
    EXPECT_EQ(::fcntl(plain.getFd(), F_GETFD), FD_CLOEXEC);
    EXPECT_FALSE(isNonBlocking(plain.getFd()));
    expectedFlags = SOCK_CLOEXEC | SOCK_NONBLOCK;
    const Socket nonBlocking = listener.accept(SOCK_NONBLOCK);
    EXPECT_EQ(::fcntl(nonBlocking.getFd(), F_GETFD), FD_CLOEXEC);
    EXPECT_TRUE(isNonBlocking(nonBlocking.getFd()));
}

TEST(Socket, AFailedAcceptIsRoutineAndNotLogged)
{
    CapturedLog log;
    Socket listener = test::makeListener();
    listener.setFlags(listener.getFlags() | O_NONBLOCK);
    EXPECT_THAT([&] { listener.accept(); }, ThrowsPosixError(EAGAIN, "11 (Resource temporarily unavailable)"));
    EXPECT_THAT([] { Socket(-1).accept(); }, ThrowsPosixError(EBADF, "9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Socket, AnAcceptThatASignalCutsShortIsNotRetried)
{
    CapturedLog log;
    Socket listener = test::makeListener();
    test::callUnderSignals(
        0, [&] { EXPECT_THAT([&] { listener.accept(); }, ThrowsPosixError(EINTR, "4 (Interrupted system call)")); },
        [] { return true; });
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Socket, AConnectionThatFoundNoDescriptorIsAcceptedLater)
{
    CapturedLog log(LogLevel::Info);
    Socket listener = test::makeListener();
    Socket client = tcpSocket();
    client.connect(listener.getSocketName(), kLong);
    SystemCalls calls;
    calls.accept4 = [](int fd, sockaddr* address, socklen_t* length, int flags) {
        const test::NoMoreDescriptors exhausted;
        return ::accept4(fd, address, length, flags);
    };
    EXPECT_THAT([&] { listener.accept(); }, ThrowsPosixError(EMFILE, "24 (Too many open files)"));
    calls.accept4 = nullptr;
    EXPECT_EQ(listener.accept().getPeerName(), client.getSocketName());
    EXPECT_THAT(log.lines(), IsEmpty());
}

// Options, names, flags

TEST(Socket, SetsAndGetsOptions)
{
    Socket socket = tcpSocket();
    socket.setSocketOption(IPPROTO_TCP, TCP_KEEPCNT, 7);
    EXPECT_EQ(intOption(socket, IPPROTO_TCP, TCP_KEEPCNT), 7);

    const timeval timeout{3, 500000};
    socket.setSocketOption(SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof(timeout));
    timeval read{};
    std::size_t length = sizeof(read);
    socket.getSocketOption(SOL_SOCKET, SO_RCVTIMEO, &read, length);
    EXPECT_EQ(length, sizeof(read));
    EXPECT_EQ(read.tv_sec, 3);
    EXPECT_EQ(read.tv_usec, 500000);
}

TEST(Socket, TheShorthandPassesAnIntOfFourBytes)
{
    SystemCalls calls;
    int sets = 0;
    calls.setsockopt = [&](int, int level, int name, const void* value, socklen_t length) {
        ++sets;
        EXPECT_EQ(level, IPPROTO_TCP);
        EXPECT_EQ(name, TCP_NODELAY);
        EXPECT_EQ(*static_cast<const int*>(value), 1);
        EXPECT_EQ(length, 4U);
        return 0;
    };
    tcpSocket().setSocketOption(IPPROTO_TCP, TCP_NODELAY, 1);
    EXPECT_EQ(sets, 1);
}

TEST(Socket, GettingAnOptionTellsItsLength)
{
    const Socket socket = tcpSocket();
    int values[8] = {-1, -1, -1, -1, -1, -1, -1, -1};
    std::size_t length = sizeof(values);
    socket.getSocketOption(SOL_SOCKET, SO_TYPE, values, length);
    EXPECT_EQ(length, 4U);
    EXPECT_EQ(values[0], SOCK_STREAM);
    EXPECT_EQ(values[1], -1);
}

TEST(Socket, AnUnknownOptionCannotBeSet)
{
    CapturedLog log;
    Socket socket = tcpSocket();
    EXPECT_THAT([&] { socket.setSocketOption(IPPROTO_TCP, 9999, 1); },
                ThrowsPosixError(ENOPROTOOPT, "Failed to set socket option: 92 (Protocol not available)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to set socket option 6 9999: 92 (Protocol not available)"));
}

TEST(Socket, AnUnknownOptionCannotBeGotAndLeavesTheLengthAlone)
{
    CapturedLog log;
    const Socket socket = tcpSocket();
    int value = 5;
    std::size_t length = sizeof(value);
    EXPECT_THAT([&] { socket.getSocketOption(IPPROTO_TCP, 9999, &value, length); },
                ThrowsPosixError(ENOPROTOOPT, "Failed to get socket option: 92 (Protocol not available)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket option 6 9999: 92 (Protocol not available)"));
    EXPECT_EQ(length, sizeof(value));
    EXPECT_EQ(value, 5);
}

TEST_P(SocketOver, KnowsBothNames)
{
    const test::TcpPair pair = test::makeTcpPair(GetParam());
    EXPECT_EQ(pair.client.getPeerName(), pair.server.getSocketName());
    EXPECT_EQ(pair.server.getPeerName(), pair.client.getSocketName());
    EXPECT_NE(pair.client.getSocketName(), pair.server.getSocketName());
    EXPECT_EQ(pair.client.getSocketName().getAddress(), test::loopback(GetParam()).getAddress());
}

TEST(Socket, NamesOfABadDescriptorFail)
{
    CapturedLog log;
    EXPECT_THAT([] { Socket(-1).getSocketName(); },
                ThrowsPosixError(EBADF, "Failed to get socket name: 9 (Bad file descriptor)"));
    EXPECT_THAT([] { Socket(-1).getPeerName(); },
                ThrowsPosixError(EBADF, "Failed to get peer name: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket name: 9 (Bad file descriptor)",
                                         "E: Failed to get peer name: 9 (Bad file descriptor)"));
}

TEST(Socket, AnUnconnectedSocketHasNoPeer)
{
    CapturedLog log;
    EXPECT_THAT([] { tcpSocket().getPeerName(); },
                ThrowsPosixError(ENOTCONN, "Failed to get peer name: 107 (Transport endpoint is not connected)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get peer name: 107 (Transport endpoint is not connected)"));
}

TEST(Socket, NamesOfOtherFamiliesAreRefused)
{
    int fds[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    const Socket socket(fds[0]);
    const Socket other(fds[1]);
    const auto refused = ThrowsMessage<std::invalid_argument>(StrEq("Not an IP address family"));
    EXPECT_THAT([&] { socket.getSocketName(); }, refused);
    EXPECT_THAT([&] { socket.getPeerName(); }, refused);
}

TEST(Socket, GetsAndSetsTheFlagsOfTheDescriptor)
{
    Socket socket = tcpSocket();
    EXPECT_EQ(socket.getFlags(), ::fcntl(socket.getFd(), F_GETFL));
    socket.setFlags(socket.getFlags() | O_NONBLOCK);
    EXPECT_TRUE(isNonBlocking(socket.getFd()));
    socket.setFlags(socket.getFlags() & ~O_NONBLOCK);
    EXPECT_FALSE(isNonBlocking(socket.getFd()));
}

TEST(Socket, FlagsOfABadDescriptorFail)
{
    CapturedLog log;
    EXPECT_THAT([] { Socket(-1).getFlags(); },
                ThrowsPosixError(EBADF, "Failed to get socket fd flags: 9 (Bad file descriptor)"));
    EXPECT_THAT([] { Socket(-1).setFlags(0); },
                ThrowsPosixError(EBADF, "Failed to set socket fd flags: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket fd flags: 9 (Bad file descriptor)",
                                         "E: Failed to set socket fd flags: 9 (Bad file descriptor)"));
}

// Transfers

TEST_P(SocketOver, TransfersBytes)
{
    CapturedLog log;
    test::TcpPair pair = test::makeTcpPair(GetParam());
    log.clear();
    EXPECT_EQ(pair.client.write("hello", 5), 5);
    char buffer[8] = {};
    EXPECT_EQ(pair.server.read(buffer, 3), 3);
    EXPECT_EQ(pair.server.read(buffer + 3, 5), 2);
    EXPECT_STREQ(buffer, "hello");
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Socket, TransfersReturnWhatTheSystemReturns)
{
    CapturedLog log;
    char byte = 'x';
    errno = 0;
    EXPECT_EQ(Socket(-1).read(&byte, 1), -1);
    EXPECT_EQ(errno, EBADF);
    errno = 0;
    EXPECT_EQ(Socket(-1).write(&byte, 1), -1);
    EXPECT_EQ(errno, EBADF);
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Socket, ReadsZeroAtTheEndOfTheStream)
{
    test::TcpPair pair = test::makeTcpPair();
    pair.client = Socket(-1);
    char byte = 'x';
    EXPECT_EQ(pair.server.read(&byte, 1), 0);
}

TEST(Socket, WritingToAClosedPeerIsAnErrorAndNoSignal)
{
    SystemCalls calls;
    calls.send = [](int fd, const void* buffer, std::size_t length, int flags) {
        EXPECT_EQ(flags, MSG_NOSIGNAL);
        return ::send(fd, buffer, length, flags);
    };
    test::TcpPair pair = test::makeTcpPair();
    pair.client.shutdown();
    // An unhandled SIGPIPE would end the program here.
    errno = 0;
    EXPECT_EQ(pair.client.write("x", 1), -1);
    EXPECT_EQ(errno, EPIPE);
}

TEST(Socket, ShutdownEndsBothDirectionsAndKeepsTheDescriptor)
{
    test::TcpPair pair = test::makeTcpPair();
    pair.client.shutdown();
    EXPECT_TRUE(isOpen(pair.client.getFd()));
    char byte = 'x';
    EXPECT_EQ(pair.client.read(&byte, 1), 0);
    EXPECT_EQ(pair.server.read(&byte, 1), 0);
}

TEST(Socket, ShutdownNeverFails)
{
    CapturedLog log;
    Socket unconnected = tcpSocket();
    unconnected.shutdown();
    Socket(-1).shutdown();
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Socket, ErrorsAreTakenBeforeAnythingIsLogged)
{
    CapturedLog log;
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    Socket none(-1);
    int value = 0;
    std::size_t length = sizeof(value);
    const auto badDescriptor = [](const std::string& context) {
        return ThrowsPosixError(EBADF, context + ": 9 (Bad file descriptor)");
    };
    EXPECT_THAT([&] { none.bind(test::loopback()); }, badDescriptor("socket bind failed"));
    EXPECT_THAT([&] { none.listen(1); }, badDescriptor("Failed to listen on socket"));
    EXPECT_THAT([&] { none.setSocketOption(1, 2, 3); }, badDescriptor("Failed to set socket option"));
    EXPECT_THAT([&] { none.getSocketOption(1, 2, &value, length); }, badDescriptor("Failed to get socket option"));
    EXPECT_THAT([&] { none.getSocketName(); }, badDescriptor("Failed to get socket name"));
    EXPECT_THAT([&] { none.getPeerName(); }, badDescriptor("Failed to get peer name"));
    EXPECT_THAT([&] { none.getFlags(); }, badDescriptor("Failed to get socket fd flags"));
    EXPECT_THAT([&] { none.setFlags(0); }, badDescriptor("Failed to set socket fd flags"));
    EXPECT_THAT([] { Socket(IPFamily::IPv4, SOCK_STREAM, IPPROTO_UDP); },
                ThrowsPosixError(EPROTONOSUPPORT, "Cannot open socket: 93 (Protocol not supported)"));
    EXPECT_THAT([] { tcpSocket(IPFamily::IPv4).connect(IPEndpoint("[::1]:80"), kLong); },
                ThrowsPosixError(EAFNOSUPPORT, "socket connect failed: 97 (Address family not supported by protocol)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: socket bind failed: 9 (Bad file descriptor)",
                                         "E: Failed to listen on socket -1: 9 (Bad file descriptor)",
                                         "E: Failed to set socket option 1 2: 9 (Bad file descriptor)",
                                         "E: Failed to get socket option 1 2: 9 (Bad file descriptor)",
                                         "E: Failed to get socket name: 9 (Bad file descriptor)",
                                         "E: Failed to get peer name: 9 (Bad file descriptor)",
                                         "E: Failed to get socket fd flags: 9 (Bad file descriptor)",
                                         "E: Failed to set socket fd flags: 9 (Bad file descriptor)",
                                         "E: Cannot open socket: 93 (Protocol not supported)",
                                         "E: socket connect failed: 97 (Address family not supported by protocol)"));
}

} // namespace
} // namespace qel
