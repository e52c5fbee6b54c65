#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/Poll.hpp>

#include "server/KeepAlive.hpp"
#include "support/LoopbackEnds.hpp"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <string>

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
}

TEST(KeepAlive, TcpTakesTheShortestAndTheLongestTime)
{
    const Loopback ends;
    const Socket& socket = ends.far->getSocket();
    setKeepAlive(socket, seconds(1));
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPIDLE), 1);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPINTVL), 1);
    setKeepAlive(socket, seconds(32767));
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPIDLE), 16383);
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_KEEPINTVL), 1638);
}

TEST(KeepAlive, DataThatIsNotTakenDoesNotCountAgainstThePeer)
{
    const Loopback ends;
    const Socket& socket = ends.far->getSocket();
    EXPECT_NE(option(socket, IPPROTO_TCP, TCP_USER_TIMEOUT), 0); // of the stream
    setKeepAlive(socket, seconds(1));
    EXPECT_EQ(option(socket, IPPROTO_TCP, TCP_USER_TIMEOUT), 0);
}

TEST(KeepAlive, APeerThatIsAliveAndDoesNotReadKeepsItsConnection)
{
    const Loopback ends;
    const Socket& socket = ends.far->getSocket();
    setKeepAlive(socket, seconds(1));
    ends.far->setWriteDeadline(std::chrono::milliseconds(100));
    const std::string data(1024 * 1024, 'x');
    EXPECT_THROW(for (;;) ends.far->write(data.data(), data.size()), StreamIOException);
    PollFd broken(socket.getFd(), PollEvents::Error);
    EXPECT_FALSE(PollSet(broken).wait(seconds(3)).anyReady()); // more than the time and a probe of the window
    EXPECT_EQ(option(socket, SOL_SOCKET, SO_ERROR), 0);
}

} // namespace

} // namespace qel::test
