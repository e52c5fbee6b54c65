#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/PosixError.hpp>

#include "net/SocketStreamKit.hpp"
#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SystemCalls.hpp"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstddef>
#include <fcntl.h>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <string>
#include <sys/socket.h>
#include <sys/time.h>
#include <thread>
#include <type_traits>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using test::CapturedLog;
using test::kernelTimeout;
using test::RecordedOptions;
using test::SocketStreamPair;
using test::SystemCalls;
using test::ThrowsPosixError;
using test::throwsSendFailure;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

static_assert(sizeof(SocketStream) <= 1024, "a program holds many of these");
static_assert(!std::is_copy_constructible<SocketStream>::value && !std::is_copy_assignable<SocketStream>::value, "");
static_assert(std::is_base_of<Stream, SocketStream>::value, "");

std::string option(int level, int name, int value)
{
    return std::to_string(level) + "/" + std::to_string(name) + " = " + std::to_string(value);
}

/// What the constructor sets, in order.
std::vector<std::string> constructorOptions()
{
    return {option(SOL_SOCKET, SO_RCVBUF, 65536),
            option(SOL_SOCKET, SO_SNDBUF, 65536),
            option(IPPROTO_TCP, TCP_NODELAY, 1),
            option(SOL_SOCKET, SO_KEEPALIVE, 1),
            option(IPPROTO_TCP, TCP_KEEPCNT, 10),
            option(IPPROTO_TCP, TCP_KEEPIDLE, 30),
            option(IPPROTO_TCP, TCP_KEEPINTVL, 3),
            option(IPPROTO_TCP, TCP_USER_TIMEOUT, 60000),
            "RCVTIMEO 0s 0us",
            "SNDTIMEO 0s 0us"};
}

int intOption(int fd, int level, int name)
{
    int value = -1;
    socklen_t length = sizeof(value);
    EXPECT_EQ(::getsockopt(fd, level, name, &value, &length), 0);
    return value;
}

// Construction

class SocketStreamOver : public test::EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(SocketStreamOver);

TEST_P(SocketStreamOver, SetsTheOptionsOfTheConnection)
{
    test::TcpPair pair = test::makeTcpPair(GetParam());
    // A second descriptor of the same socket shows the options.
    const Socket observer(::dup(pair.client.getFd()));
    pair.client.setFlags(pair.client.getFlags() | O_NONBLOCK);
    const timeval leftOver{7, 0};
    pair.client.setSocketOption(SOL_SOCKET, SO_RCVTIMEO, &leftOver, sizeof(leftOver));
    pair.client.setSocketOption(SOL_SOCKET, SO_SNDTIMEO, &leftOver, sizeof(leftOver));

    CapturedLog log;
    const SocketStream stream(std::move(pair.client));
    const int fd = observer.getFd();
    EXPECT_EQ(::fcntl(fd, F_GETFL) & O_NONBLOCK, 0);
    EXPECT_EQ(intOption(fd, IPPROTO_TCP, TCP_NODELAY), 1);
    EXPECT_EQ(intOption(fd, SOL_SOCKET, SO_KEEPALIVE), 1);
    EXPECT_EQ(intOption(fd, IPPROTO_TCP, TCP_KEEPCNT), 10);
    EXPECT_EQ(intOption(fd, IPPROTO_TCP, TCP_KEEPIDLE), 30);
    EXPECT_EQ(intOption(fd, IPPROTO_TCP, TCP_KEEPINTVL), 3);
    EXPECT_EQ(intOption(fd, IPPROTO_TCP, TCP_USER_TIMEOUT), 60000);
    for (const int name : {SO_RCVTIMEO, SO_SNDTIMEO}) {
        EXPECT_EQ(kernelTimeout(fd, name).tv_sec, 0);
        EXPECT_EQ(kernelTimeout(fd, name).tv_usec, 0);
    }
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(SocketStream, MakesTheSocketBlockingAndThenSetsTheOptionsInOrder)
{
    test::TcpPair pair = test::makeTcpPair();
    pair.client.setFlags(pair.client.getFlags() | O_NONBLOCK);
    SystemCalls calls;
    RecordedOptions recorded(calls);
    const auto record = calls.setsockopt;
    calls.setsockopt = [&](int fd, int level, int name, const void* value, socklen_t length) {
        EXPECT_EQ(::fcntl(fd, F_GETFL) & O_NONBLOCK, 0);
        return record(fd, level, name, value, length);
    };
    const SocketStream stream(std::move(pair.client));
    EXPECT_EQ(recorded.options(), constructorOptions());
}

TEST(SocketStream, KeepsTheOtherFlagsOfTheDescriptor)
{
    test::TcpPair pair = test::makeTcpPair();
    pair.client.setFlags(O_NONBLOCK | O_APPEND);
    const SocketStream stream(std::move(pair.client));
    EXPECT_EQ(stream.getSocket().getFlags() & (O_NONBLOCK | O_APPEND), O_APPEND);
}

TEST(SocketStream, ThrowsThePosixErrorOfTheOptionThatFailsAndClosesTheSocket)
{
    const std::vector<std::string> all = constructorOptions();
    for (std::size_t failing = 1; failing <= all.size(); ++failing) {
        SCOPED_TRACE(all[failing - 1]);
        CapturedLog log(LogLevel::Info);
        test::TcpPair pair = test::makeTcpPair();
        const int fd = pair.client.getFd();
        SystemCalls calls;
        RecordedOptions recorded(calls);
        recorded.failAt(failing);
        EXPECT_THAT([&] { SocketStream(std::move(pair.client)); },
                    ThrowsPosixError(EPERM, "Failed to set socket option: 1 (Operation not permitted)"));
        EXPECT_THAT(recorded.options(),
                    ::testing::ElementsAreArray(all.data(), static_cast<std::ptrdiff_t>(failing) + all.data()));
        EXPECT_EQ(log.lines().size(), 1U);
        EXPECT_EQ(::fcntl(fd, F_GETFD), -1) << "the socket is consumed and closed";
    }
}

TEST(SocketStream, RefusesASocketOtherThanTcp)
{
    CapturedLog log;
    int fds[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    const Socket other(fds[1]);
    EXPECT_THAT([&] { SocketStream{Socket(fds[0])}; },
                ThrowsPosixError(EOPNOTSUPP, "Failed to set socket option: 95 (Operation not supported)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to set socket option 6 1: 95 (Operation not supported)"));
}

TEST(SocketStream, RefusesASocketWithoutADescriptor)
{
    CapturedLog log;
    EXPECT_THAT([] { SocketStream{Socket(-1)}; },
                ThrowsPosixError(EBADF, "Failed to get socket fd flags: 9 (Bad file descriptor)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to get socket fd flags: 9 (Bad file descriptor)"));
}

TEST(SocketStream, OwnsItsSocket)
{
    test::TcpPair pair = test::makeTcpPair();
    const int fd = pair.client.getFd();
    const IPEndpoint name = pair.client.getSocketName();
    {
        const SocketStream stream(std::move(pair.client));
        EXPECT_EQ(pair.client.getFd(), -1);
        EXPECT_EQ(stream.getSocket().getFd(), fd);
        EXPECT_EQ(stream.getSocket().getSocketName(), name);
        EXPECT_EQ(stream.getSocket().getPeerName(), pair.server.getSocketName());
    }
    EXPECT_EQ(::fcntl(fd, F_GETFD), -1);
    EXPECT_EQ(errno, EBADF);
}

// Closing, threads

TEST_F(SocketStreamPair, CloseEndsBothDirectionsAndKeepsTheDescriptor)
{
    mStream.close();
    EXPECT_NE(::fcntl(fd(), F_GETFD), -1);
    EXPECT_THAT(mLog.lines(), IsEmpty());
    EXPECT_EQ(read(), "");
    EXPECT_EQ(peerReads(1), "");
    EXPECT_THAT([this] { write("x"); }, throwsSendFailure(EPIPE, "socket stream send failure: 32 (Broken pipe)"));
    mStream.close();
}

TEST_F(SocketStreamPair, CloseWakesAWaitingReader)
{
    std::promise<void> reading;
    std::future<std::size_t> count = std::async(std::launch::async, [&] {
        SystemCalls calls;
        calls.read = [&](int descriptor, void* buffer, std::size_t length) {
            reading.set_value();
            return ::read(descriptor, buffer, length);
        };
        char byte;
        return mStream.read(&byte, 1);
    });
    reading.get_future().wait();
    mStream.close();
    EXPECT_EQ(count.get(), 0U);
}

TEST_P(SocketStreamOver, IsAStream)
{
    test::TcpPair pair = test::makeTcpPair(GetParam());
    const std::unique_ptr<Stream> near = std::make_unique<SocketStream>(std::move(pair.client));
    const std::unique_ptr<Stream> far = std::make_unique<SocketStream>(std::move(pair.server));
    near->setWriteDeadline(seconds(10));
    far->setReadDeadline(seconds(10));
    near->write("question", 8);
    char text[8];
    far->fill(text, sizeof(text));
    EXPECT_EQ(std::string(text, 8), "question");
    StreamBase& base = *near;
    base.close();
    EXPECT_EQ(far->read(text, sizeof(text)), 0U);
}

TEST_P(SocketStreamOver, OneThreadReadsWhileAnotherWrites)
{
    constexpr std::size_t kBytes = 2 * 1024 * 1024;
    test::TcpPair pair = test::makeTcpPair(GetParam());
    SocketStream stream(std::move(pair.client));
    SocketStream peer(std::move(pair.server));

    // Echoes what it receives, with a thread for each direction.
    std::string kept(kBytes, '\0');
    std::atomic<std::size_t> keptBytes{0};
    std::future<void> peerReader = std::async(std::launch::async, [&] {
        for (std::size_t done = 0; done < kBytes; keptBytes = done) {
            peer.setReadDeadline(seconds(30));
            done += peer.read(&kept[done], std::min<std::size_t>(kBytes - done, 16384));
        }
    });
    std::future<void> peerWriter = std::async(std::launch::async, [&] {
        for (std::size_t done = 0; done < kBytes;) {
            const std::size_t ready = keptBytes - done;
            if (ready == 0) {
                std::this_thread::yield();
                continue;
            }
            peer.setWriteDeadline(seconds(30));
            peer.write(&kept[done], ready);
            done += ready;
        }
    });

    std::string sent(kBytes, '\0');
    for (std::size_t i = 0; i < kBytes; ++i)
        sent[i] = static_cast<char>(i * 31 + (i >> 8));
    std::string received(kBytes, '\0');
    std::future<void> writer = std::async(std::launch::async, [&] {
        for (std::size_t done = 0; done < kBytes; done += 16384) {
            stream.setWriteDeadline(milliseconds(30000 + done % 7));
            stream.write(&sent[done], 16384);
        }
    });
    for (std::size_t done = 0; done < kBytes;) {
        stream.setReadDeadline(milliseconds(30000 + done % 5));
        done += stream.read(&received[done], kBytes - done);
    }
    writer.get();
    peerReader.get();
    peerWriter.get();
    EXPECT_TRUE(received == sent);
}

// Cost

TEST(SocketStream, TransfersWithoutLogLinesDoNotAllocate)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const CapturedLog log(LogLevel::Warn);
    test::TcpPair pair = test::makeTcpPair();
    SocketStream near(std::move(pair.client));
    SocketStream far(std::move(pair.server));
    char buffer[16];
    const test::Allocations allocations;
    for (int i = 0; i < 3; ++i) {
        near.setWriteDeadline(seconds(10 + i));
        far.setReadDeadline(seconds(10 + i));
        near.write("frame", 5);
        far.fill(buffer, 5);
    }
    EXPECT_EQ(allocations.count(), 0U);
}

} // namespace
} // namespace qel
