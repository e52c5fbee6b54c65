#include "server/KeepAlive.hpp"
#include "support/LoopbackEnds.hpp"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <netinet/tcp.h>

namespace qel::test {

namespace {

using protocol::setKeepAlive;
using std::chrono::seconds;

int option(const Socket& socket, int level, int name)
{
    int value = -1;
    socklen_t length = sizeof(value);
    EXPECT_EQ(::getsockopt(socket.getFd(), level, name, &value, &length), 0);
    return value;
}

TEST(KeepAlive, HalfOfTheTimeIsIdleAndTenProbesShareTheOtherHalf)
{
    const Loopback ends;
    const Socket& socket = ends.far->getSocket();
    setKeepAlive(socket, seconds(60));
    EXPECT_EQ(option(socket, SOL_SOCKET, SO_KEEPALIVE), 1);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPIDLE), 30);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPINTVL), 3);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPCNT), 10);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_USER_TIMEOUT), 60000);
}

TEST(KeepAlive, TcpTakesTheShortestAndTheLongestTime)
{
    const Loopback ends;
    const Socket& socket = ends.far->getSocket();
    setKeepAlive(socket, seconds(1));
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPIDLE), 1);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPINTVL), 1);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_USER_TIMEOUT), 1000);
    setKeepAlive(socket, seconds(32767));
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPIDLE), 16383);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPINTVL), 1638);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_USER_TIMEOUT), 32767000);
}

} // namespace

} // namespace qel::test
