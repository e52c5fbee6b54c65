#include <qel/common/QelLogger.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/util/PosixError.hpp>

#include "net/SocketKit.hpp"
#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SystemCalls.hpp"

#include <cerrno>
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
#include <sys/time.h>
#include <type_traits>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::CapturedLog;
using test::intOption;
using test::isNonBlocking;
using test::isOpen;
using test::kLong;
using test::SystemCalls;
using test::tcpSocket;
using test::ThrowsPosixError;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

static_assert(!std::is_copy_constructible<Socket>::value && !std::is_copy_assignable<Socket>::value, "one owner");
static_assert(std::is_nothrow_move_constructible<Socket>::value && std::is_nothrow_move_assignable<Socket>::value, "");
static_assert(!std::is_convertible<int, Socket>::value, "a number is a socket only when asked");
static_assert(std::is_base_of<SocketIF, Socket>::value && std::is_abstract<SocketIF>::value, "");

/// The slot of a virtual operation. Under the C++ ABI of our platforms a pointer to a virtual member function begins
/// with the byte offset in the table (plus one on some platforms).
template <typename Member>
std::size_t slotOf(Member member)
{
    std::ptrdiff_t offset = 0;
    std::memcpy(&offset, &member, sizeof(offset));
    return static_cast<std::size_t>(offset) / sizeof(void*);
}

class SocketOver : public test::EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(SocketOver);

TEST(SocketIF, KeepsTheOrderOfItsVirtualOperations)
{
    // The destructor has the first two slots: one form destroys, the other also releases the memory.
    EXPECT_EQ(slotOf(&SocketIF::getPollFd), 2U);
    EXPECT_EQ(slotOf(&SocketIF::shutdown), 3U);
    EXPECT_EQ(slotOf(&SocketIF::read), 4U);
    EXPECT_EQ(slotOf(&SocketIF::write), 5U);
}

// Opening, ownership, moving

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

TEST(Socket, PassesTheTypeOnUnchanged)
{
    EXPECT_EQ(::fcntl(Socket(IPFamily::IPv4, SOCK_STREAM, 0).getFd(), F_GETFD), 0) << "no close-on-exec is added";
    EXPECT_EQ(::fcntl(Socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0).getFd(), F_GETFD), FD_CLOEXEC);
    EXPECT_TRUE(isNonBlocking(Socket(IPFamily::IPv4, SOCK_STREAM | SOCK_NONBLOCK, 0).getFd()));
}

TEST(Socket, ThrowsWhenNoDescriptorIsLeft)
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

TEST(Socket, RefusesAProtocolOfAnotherType)
{
    CapturedLog log;
    EXPECT_THAT([] { Socket(IPFamily::IPv4, SOCK_STREAM, IPPROTO_UDP); },
                ThrowsPosixError(EPROTONOSUPPORT, "Cannot open socket: 93 (Protocol not supported)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Cannot open socket: 93 (Protocol not supported)"));
}

TEST(Socket, RefusesAnotherFamily)
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

TEST(Socket, IsDestroyedThroughItsInterface)
{
    std::unique_ptr<SocketIF> socket = std::make_unique<Socket>(tcpSocket());
    const int fd = socket->getPollFd(PollEvents::Read).mFd.fd;
    EXPECT_TRUE(isOpen(fd));
    socket.reset();
    EXPECT_FALSE(isOpen(fd));
}

TEST(Socket, ClosesNothingWithoutADescriptor)
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

TEST(Socket, ClosesDescriptorZero)
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

TEST(Socket, OpensAsDescriptorZero)
{
    CapturedLog log;
    SystemCalls calls;
    calls.socket = [](int, int, int) { return 0; };
    calls.close = [](int) { return 0; };
    EXPECT_EQ(tcpSocket().getFd(), 0);
    EXPECT_THAT(log.lines(), IsEmpty());
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

TEST(Socket, MoveAssignmentClosesTheOwnDescriptorBeforeItTakesTheOther)
{
    Socket source = tcpSocket();
    Socket target = tcpSocket();
    const int fd = source.getFd();
    const int old = target.getFd();
    SystemCalls calls;
    int closed = -1;
    calls.close = [&](int closing) {
        closed = closing;
        EXPECT_EQ(target.getFd(), old);
        EXPECT_EQ(source.getFd(), fd);
        return ::close(closing);
    };
    target = std::move(source);
    EXPECT_EQ(closed, old);
    calls.close = nullptr;
    EXPECT_EQ(target.getFd(), fd);
}

TEST(Socket, MoveAssignmentClosesTheOldDescriptor)
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

TEST(Socket, MoveAssignmentOfASocketWithoutADescriptorCloses)
{
    Socket socket = tcpSocket();
    const int fd = socket.getFd();
    socket = Socket(-1);
    EXPECT_EQ(socket.getFd(), -1);
    EXPECT_FALSE(isOpen(fd));
    socket = tcpSocket();
    EXPECT_TRUE(isOpen(socket.getFd()));
}

TEST(Socket, SelfAssignmentKeepsTheDescriptor)
{
    Socket socket = tcpSocket();
    const int fd = socket.getFd();
    Socket& same = socket; // through another name: the compilers warn about the plain form
    socket = std::move(same);
    EXPECT_EQ(socket.getFd(), fd);
    EXPECT_TRUE(isOpen(fd));
}

TEST(Socket, ReturnsAnEntryForAPollSet)
{
    const Socket socket = tcpSocket();
    const PollFd entry = socket.getPollFd(PollEvents::Write);
    EXPECT_EQ(entry.mFd.fd, socket.getFd());
    EXPECT_EQ(entry.mFd.events, 0x3C);
    EXPECT_EQ(entry.mFd.revents, 0);
    EXPECT_EQ(socket.getPollFd(PollEvents::Read).mFd.events, 0x39);
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

TEST(Socket, TheShorthandPassesAnInt)
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

TEST(Socket, ReturnsTheLengthOfAnOption)
{
    const Socket socket = tcpSocket();
    int values[8] = {-1, -1, -1, -1, -1, -1, -1, -1};
    std::size_t length = sizeof(values);
    socket.getSocketOption(SOL_SOCKET, SO_TYPE, values, length);
    EXPECT_EQ(length, 4U);
    EXPECT_EQ(values[0], SOCK_STREAM);
    EXPECT_EQ(values[1], -1);
}

TEST(Socket, RefusesToSetAnUnknownOption)
{
    CapturedLog log;
    Socket socket = tcpSocket();
    EXPECT_THAT([&] { socket.setSocketOption(IPPROTO_TCP, 9999, 1); },
                ThrowsPosixError(ENOPROTOOPT, "Failed to set socket option: 92 (Protocol not available)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to set socket option 6 9999: 92 (Protocol not available)"));
}

TEST(Socket, RefusesToGetAnUnknownOptionAndKeepsTheLength)
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

TEST_P(SocketOver, ReturnsItsNameAndThatOfThePeer)
{
    const test::TcpPair pair = test::makeTcpPair(GetParam());
    EXPECT_EQ(pair.client.getPeerName(), pair.server.getSocketName());
    EXPECT_EQ(pair.server.getPeerName(), pair.client.getSocketName());
    EXPECT_NE(pair.client.getSocketName(), pair.server.getSocketName());
    EXPECT_EQ(pair.client.getSocketName().getAddress(), test::loopback(GetParam()).getAddress());
}

TEST(Socket, PassesABufferOf128BytesForNames)
{
    const test::TcpPair pair = test::makeTcpPair();
    SystemCalls calls;
    std::vector<socklen_t> lengths;
    calls.getsockname = [&](int fd, sockaddr* address, socklen_t* length) {
        lengths.push_back(*length);
        return ::getsockname(fd, address, length);
    };
    calls.getpeername = [&](int fd, sockaddr* address, socklen_t* length) {
        lengths.push_back(*length);
        return ::getpeername(fd, address, length);
    };
    EXPECT_EQ(pair.client.getSocketName(), pair.server.getPeerName());
    EXPECT_THAT(lengths, ElementsAre(128, 128));
}

TEST(Socket, ThrowsForTheNamesOfABadDescriptor)
{
    CapturedLog log;
    EXPECT_THAT([] { Socket(-1).getSocketName(); },
                ThrowsPosixError(EBADF, "Failed to get socket name: 9 (Bad file descriptor)"));
    EXPECT_THAT([] { Socket(-1).getPeerName(); },
                ThrowsPosixError(EBADF, "Failed to get peer name: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket name: 9 (Bad file descriptor)",
                                         "E: Failed to get peer name: 9 (Bad file descriptor)"));
}

TEST(Socket, ThrowsForThePeerOfAnUnconnectedSocket)
{
    CapturedLog log;
    EXPECT_THAT([] { tcpSocket().getPeerName(); },
                ThrowsPosixError(ENOTCONN, "Failed to get peer name: 107 (Transport endpoint is not connected)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get peer name: 107 (Transport endpoint is not connected)"));
}

TEST(Socket, RefusesNamesOfOtherFamilies)
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

TEST(Socket, ThrowsForTheFlagsOfABadDescriptor)
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

TEST(Socket, ReadAndWriteReturnTheResultOfTheSystem)
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

TEST(Socket, ReadReturnsZeroAtEndOfStream)
{
    test::TcpPair pair = test::makeTcpPair();
    pair.client = Socket(-1);
    char byte = 'x';
    EXPECT_EQ(pair.server.read(&byte, 1), 0);
}

TEST(Socket, WritingToAClosedPeerFailsWithoutASignal)
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

TEST(Socket, ShutdownIgnoresErrors)
{
    CapturedLog log;
    Socket unconnected = tcpSocket();
    unconnected.shutdown();
    Socket(-1).shutdown();
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(Socket, SavesErrnoBeforeItLogs)
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
