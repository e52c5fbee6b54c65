#include <qel/common/LogLevel.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/util/PosixError.hpp>

#include "net/SocketKit.hpp"
#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SignalStorm.hpp"
#include "support/SystemCalls.hpp"

#include <cerrno>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string>
#include <sys/socket.h>

namespace qel {
namespace {

using test::CapturedLog;
using test::intOption;
using test::isNonBlocking;
using test::kLong;
using test::SystemCalls;
using test::tcpSocket;
using test::ThrowsPosixError;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class SocketListenOver : public test::EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(SocketListenOver);

TEST_P(SocketListenOver, BindsToAFreePort)
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

TEST_P(SocketListenOver, RefusesToBindToAPortInUse)
{
    CapturedLog log;
    const Socket holder = test::makeRefusingSocket(GetParam());
    Socket socket = tcpSocket(GetParam());
    EXPECT_THAT([&] { socket.bind(holder.getSocketName()); },
                ThrowsPosixError(EADDRINUSE, "socket bind failed: 98 (Address already in use)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: socket bind failed: 98 (Address already in use)"));
}

TEST(SocketListen, ListensAndAccepts)
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

TEST(SocketListen, PassesTheBacklogOnUnchanged)
{
    for (const int backlog : {1, 7}) {
        Socket listener = tcpSocket();
        listener.bind(test::loopback());
        listener.listen(backlog);
        EXPECT_EQ(test::backlogOf(listener), static_cast<unsigned int>(backlog));
    }
}

TEST(SocketListen, RefusesToListenOnADatagramSocket)
{
    CapturedLog log;
    Socket datagram(IPFamily::IPv4, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    EXPECT_THAT([&] { datagram.listen(1); },
                ThrowsPosixError(EOPNOTSUPP, "Failed to listen on socket: 95 (Operation not supported)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to listen on socket " + std::to_string(datagram.getFd()) +
                                         ": 95 (Operation not supported)"));
}

TEST(SocketListen, AcceptAddsCloseOnExecToTheFlags)
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

TEST(SocketListen, AcceptsAsDescriptorZero)
{
    CapturedLog log;
    SystemCalls calls;
    calls.accept4 = [](int, sockaddr*, socklen_t*, int) { return 0; };
    calls.close = [](int) { return 0; };
    EXPECT_EQ(Socket(-1).accept().getFd(), 0);
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(SocketListen, AFailedAcceptThrowsTheCodeAndIsNotLogged)
{
    CapturedLog log;
    Socket listener = test::makeListener();
    listener.setFlags(listener.getFlags() | O_NONBLOCK);
    EXPECT_THAT([&] { listener.accept(); }, ThrowsPosixError(EAGAIN, "11 (Resource temporarily unavailable)"));
    EXPECT_THAT([] { Socket(-1).accept(); }, ThrowsPosixError(EBADF, "9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(SocketListen, AnInterruptedAcceptIsNotRetried)
{
    CapturedLog log;
    Socket listener = test::makeListener();
    test::callUnderSignals(
        0, [&] { EXPECT_THAT([&] { listener.accept(); }, ThrowsPosixError(EINTR, "4 (Interrupted system call)")); },
        [] { return true; });
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(SocketListen, AConnectionWithoutAFreeDescriptorIsAcceptedLater)
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

} // namespace
} // namespace qel
