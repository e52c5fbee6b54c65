#include <qel/common/net/Listen.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SystemCalls.hpp"

#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <string>
#include <sys/socket.h>

namespace qel {
namespace {

using test::CapturedLog;
using test::ThrowsPosixError;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

int intOption(const Socket& socket, int level, int name)
{
    int value = -1;
    std::size_t length = sizeof(value);
    socket.getSocketOption(level, name, &value, length);
    return value;
}

class ListenOn : public test::EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(ListenOn);

TEST_P(ListenOn, AcceptsConnections)
{
    CapturedLog log(LogLevel::Info);
    Socket listener = listenOn(test::loopback(GetParam()), 4);
    EXPECT_EQ(listener.getSocketName().getAddress(), test::loopback(GetParam()).getAddress());
    EXPECT_NE(listener.getSocketName().getPort(), 0);

    Socket client(GetParam(), SOCK_STREAM | SOCK_CLOEXEC, 0);
    client.connect(listener.getSocketName(), std::chrono::seconds(10));
    Socket server = listener.accept();
    EXPECT_EQ(server.getPeerName(), client.getSocketName());
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_P(ListenOn, IsABlockingCloseOnExecStream)
{
    const Socket listener = listenOn(test::loopback(GetParam()), 4);
    EXPECT_EQ(intOption(listener, SOL_SOCKET, SO_TYPE), SOCK_STREAM);
    EXPECT_EQ(intOption(listener, SOL_SOCKET, SO_ACCEPTCONN), 1);
    EXPECT_EQ(intOption(listener, SOL_SOCKET, SO_REUSEADDR), 1);
    EXPECT_EQ(::fcntl(listener.getFd(), F_GETFD), FD_CLOEXEC);
    EXPECT_EQ(listener.getFlags() & O_NONBLOCK, 0);
}

TEST_P(ListenOn, PassesTheBacklogOn)
{
    EXPECT_EQ(test::backlogOf(listenOn(test::loopback(GetParam()), 3)), 3U);
    EXPECT_EQ(test::backlogOf(listenOn(test::loopback(GetParam()), 8)), 8U);
}

TEST_P(ListenOn, BindsAPortWhoseConnectionsAreInTimeWait)
{
    // Reserves the port between the two listeners.
    Socket holder(GetParam(), SOCK_STREAM | SOCK_CLOEXEC, 0);
    holder.setSocketOption(SOL_SOCKET, SO_REUSEADDR, 1);
    holder.bind(test::loopback(GetParam()));
    const IPEndpoint endpoint = holder.getSocketName();
    {
        Socket listener = listenOn(endpoint, 4);
        Socket client(GetParam(), SOCK_STREAM | SOCK_CLOEXEC, 0);
        client.connect(endpoint, std::chrono::seconds(10));
        Socket server = listener.accept();
        // The side that closes first keeps the port busy for a while.
        server = Socket(-1);
        char byte = 0;
        EXPECT_EQ(client.read(&byte, 1), 0);
    }
    EXPECT_EQ(listenOn(endpoint, 4).getSocketName(), endpoint);
}

TEST_P(ListenOn, RefusesAPortOnWhichAnotherSocketListens)
{
    CapturedLog log;
    const Socket first = listenOn(test::loopback(GetParam()), 4);
    EXPECT_THAT([&] { listenOn(first.getSocketName(), 4); },
                ThrowsPosixError(EADDRINUSE, "socket bind failed: 98 (Address already in use)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: socket bind failed: 98 (Address already in use)"));
}

TEST(ListenOnIPv6, AcceptsOnlyIPv6Connections)
{
    const std::string reason = test::whyNoLoopback(IPFamily::IPv6);
    if (!reason.empty()) GTEST_SKIP() << reason;
    test::SystemCalls calls;
    bool wasSet = false;
    calls.setsockopt = [&](int fd, int level, int name, const void* value, socklen_t length) {
        if (level == IPPROTO_IPV6 && name == IPV6_V6ONLY) wasSet = true;
        return ::setsockopt(fd, level, name, value, length);
    };
    calls.bind = [&](int fd, const sockaddr* address, socklen_t length) {
        EXPECT_TRUE(wasSet) << "the system refuses to change it later";
        return ::bind(fd, address, length);
    };
    const Socket listener = listenOn(IPEndpoint("[::]:0"), 4);
    EXPECT_EQ(intOption(listener, IPPROTO_IPV6, IPV6_V6ONLY), 1);
    EXPECT_TRUE(wasSet);
}

TEST(ListenOnIPv4, SetsNoOptionOfIPv6)
{
    test::SystemCalls calls;
    calls.setsockopt = [](int fd, int level, int name, const void* value, socklen_t length) {
        EXPECT_EQ(level, SOL_SOCKET);
        return ::setsockopt(fd, level, name, value, length);
    };
    listenOn(test::loopback(), 4);
}

TEST(ListenOnFailures, ThrowsWhenNoDescriptorIsLeft)
{
    CapturedLog log;
    test::SystemCalls calls;
    calls.socket = [](int family, int type, int protocol) {
        const test::NoMoreDescriptors exhausted;
        return ::socket(family, type, protocol);
    };
    EXPECT_THAT([] { listenOn(test::loopback(), 4); },
                ThrowsPosixError(EMFILE, "Cannot open socket: 24 (Too many open files)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Cannot open socket: 24 (Too many open files)"));
}

TEST(ListenOnFailures, ThrowsWhenAnOptionFails)
{
    CapturedLog log;
    test::SystemCalls calls;
    calls.setsockopt = [](int, int, int, const void*, socklen_t) {
        errno = ENOPROTOOPT;
        return -1;
    };
    EXPECT_THAT([] { listenOn(test::loopback(), 4); },
                ThrowsPosixError(ENOPROTOOPT, "Failed to set socket option: 92 (Protocol not available)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to set socket option 1 2: 92 (Protocol not available)"));
}

TEST(ListenOnFailures, ThrowsWhenListenFails)
{
    CapturedLog log(LogLevel::Info);
    // Two sockets may be bound to one port with SO_REUSEADDR, but only one of them may listen.
    Socket faster(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
    faster.setSocketOption(SOL_SOCKET, SO_REUSEADDR, 1);
    faster.bind(test::loopback());
    const IPEndpoint endpoint = faster.getSocketName();
    test::SystemCalls calls;
    int failing = -1;
    calls.bind = [&](int fd, const sockaddr* address, socklen_t length) {
        failing = fd;
        const int result = ::bind(fd, address, length);
        faster.listen(4);
        return result;
    };
    EXPECT_THAT([&] { listenOn(endpoint, 4); },
                ThrowsPosixError(EADDRINUSE, "Failed to listen on socket: 98 (Address already in use)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to listen on socket " + std::to_string(failing) +
                                         ": 98 (Address already in use)"));
    EXPECT_EQ(::fcntl(failing, F_GETFD), -1) << "the socket is closed";
}

} // namespace
} // namespace qel
