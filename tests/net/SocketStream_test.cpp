#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/Loopback.hpp"
#include "support/SettableClock.hpp"
#include "support/SignalStorm.hpp"
#include "support/SystemCalls.hpp"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
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
using std::chrono::steady_clock;
using test::CapturedLog;
using test::NestsNothing;
using test::NestsPosixError;
using test::SystemCalls;
using test::ThrowsPosixError;
using ::testing::AllOf;
using ::testing::AnyOf;
using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::Property;
using ::testing::StrEq;
using ::testing::Throws;

static_assert(sizeof(SocketStream) <= 1024, "a program holds many of these");
static_assert(!std::is_copy_constructible<SocketStream>::value && !std::is_copy_assignable<SocketStream>::value, "");
static_assert(std::is_base_of<Stream, SocketStream>::value, "");

const char* const kReadRetried = "W: socket stream read interrupted by signal, retrying I/O";
const char* const kWriteRetried = "W: socket stream write interrupted by signal, retrying I/O";

auto throwsReceiveFailure(int code, const std::string& nested)
{
    return Throws<StreamIOException>(AllOf(Property(&StreamIOException::what, StrEq("socket stream receive failure")),
                                           NestsPosixError(code, nested)));
}

auto throwsSendFailure(int code, const std::string& nested)
{
    return Throws<StreamIOException>(
        AllOf(Property(&StreamIOException::what, StrEq("socket stream send failure")), NestsPosixError(code, nested)));
}

auto throwsDeadline()
{
    return Throws<StreamIOException>(AllOf(Property(&StreamIOException::what, StrEq("I/O deadline")), NestsNothing()));
}

/// The socket options that a stream sets, as texts, in order.
class RecordedOptions {
public:
    explicit RecordedOptions(SystemCalls& calls)
    {
        calls.setsockopt = [this](int fd, int level, int name, const void* value, socklen_t length) {
            mOptions.push_back(pDescribe(level, name, value, length));
            if (mOptions.size() == mFailAt) {
                errno = EPERM;
                return -1;
            }
            return ::setsockopt(fd, level, name, value, length);
        };
    }

    const std::vector<std::string>& options() const { return mOptions; }
    void clear() { mOptions.clear(); }
    /// The nth option fails with EPERM, counted from 1.
    void failAt(std::size_t count) { mFailAt = count; }

private:
    static std::string pDescribe(int level, int name, const void* value, socklen_t length)
    {
        if (level == SOL_SOCKET && (name == SO_RCVTIMEO || name == SO_SNDTIMEO)) {
            EXPECT_EQ(length, sizeof(timeval));
            const timeval* const time = static_cast<const timeval*>(value);
            return std::string(name == SO_RCVTIMEO ? "RCVTIMEO " : "SNDTIMEO ") + std::to_string(time->tv_sec) + "s " +
                   std::to_string(time->tv_usec) + "us";
        }
        EXPECT_EQ(length, sizeof(int));
        return std::to_string(level) + "/" + std::to_string(name) + " = " +
               std::to_string(*static_cast<const int*>(value));
    }

    std::vector<std::string> mOptions;
    std::size_t mFailAt = 0; // never
};

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

timeval kernelTimeout(int fd, int name)
{
    timeval value{-1, -1};
    socklen_t length = sizeof(value);
    EXPECT_EQ(::getsockopt(fd, SOL_SOCKET, name, &value, &length), 0);
    return value;
}

// Construction

class SocketStreamOver : public test::EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(SocketStreamOver);

TEST_P(SocketStreamOver, TunesTheConnection)
{
    test::TcpPair pair = test::makeTcpPair(GetParam());
    // A second descriptor of the same socket shows what the kernel was told.
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

TEST(SocketStream, MakesTheSocketBlockingBeforeItSetsTheOptionsInOrder)
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

TEST(SocketStream, OtherFlagsOfTheDescriptorStay)
{
    test::TcpPair pair = test::makeTcpPair();
    pair.client.setFlags(O_NONBLOCK | O_APPEND);
    const SocketStream stream(std::move(pair.client));
    EXPECT_EQ(stream.getSocket().getFlags() & (O_NONBLOCK | O_APPEND), O_APPEND);
}

TEST(SocketStream, EverySettingThatFailsIsReportedAsItIsAndEndsTheConstruction)
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

TEST(SocketStream, NeedsTcp)
{
    CapturedLog log;
    int fds[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    const Socket other(fds[1]);
    EXPECT_THAT([&] { SocketStream{Socket(fds[0])}; },
                ThrowsPosixError(EOPNOTSUPP, "Failed to set socket option: 95 (Operation not supported)"));
    EXPECT_THAT(log.lines(), ElementsAre("E: Failed to set socket option 6 1: 95 (Operation not supported)"));
}

TEST(SocketStream, NeedsADescriptor)
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

/// A stream, its peer as a plain socket, and everything the stream does to the system and the log.
class SocketStreamPair : public ::testing::Test {
protected:
    explicit SocketStreamPair(IPFamily family = IPFamily::IPv4) : SocketStreamPair(test::makeTcpPair(family)) {}
    explicit SocketStreamPair(test::TcpPair pair)
        : mStream(std::move(pair.client)), mPeer(std::move(pair.server)), mRecorded(mCalls)
    {
        mLog.clear();
    }

    int fd() const { return mStream.getSocket().getFd(); }

    void peerSends(const std::string& text)
    {
        EXPECT_EQ(mPeer.write(text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    void peerCloses() { mPeer = Socket(-1); }
    /// Closes without the usual handshake: what the stream does next is answered with a reset.
    void peerResets()
    {
        mCalls.setsockopt = nullptr; // the peer's option, not one of the stream
        const linger atOnce{1, 0};
        mPeer.setSocketOption(SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce));
        peerCloses();
    }
    std::string peerReads(std::size_t length)
    {
        std::string text(length, '\0');
        std::size_t done = 0;
        while (done < length) {
            const ssize_t count = mPeer.read(&text[done], length - done);
            if (count <= 0) break;
            done += static_cast<std::size_t>(count);
        }
        text.resize(done);
        return text;
    }

    std::string read(std::size_t length = 16)
    {
        std::string text(length, '\0');
        text.resize(mStream.read(&text[0], length));
        return text;
    }
    void write(const std::string& text) { mStream.write(text.data(), text.size()); }

    CapturedLog mLog;
    SocketStream mStream;
    Socket mPeer;
    SystemCalls mCalls;
    RecordedOptions mRecorded;
};

// Reading

TEST_F(SocketStreamPair, ReadsWhatHasArrived)
{
    peerSends("hello");
    EXPECT_EQ(read(16), "hello");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream read 5 bytes of data"));
}

TEST_F(SocketStreamPair, ReadsNoMoreThanAskedFor)
{
    peerSends("hello");
    EXPECT_EQ(read(2), "he");
    EXPECT_EQ(read(3), "llo");
    EXPECT_THAT(mLog.lines(),
                ElementsAre("D: socket stream read 2 bytes of data", "D: socket stream read 3 bytes of data"));
}

TEST_F(SocketStreamPair, TheEndOfTheStreamIsNoFailure)
{
    peerSends("bye");
    peerCloses();
    EXPECT_EQ(read(), "bye");
    mLog.clear();
    EXPECT_EQ(read(), "");
    EXPECT_EQ(read(), "");
    EXPECT_THAT(mLog.lines(), ElementsAre("I: socket stream was closed by partner (EOF)",
                                          "I: socket stream was closed by partner (EOF)"));
}

TEST_F(SocketStreamPair, AReadOfNothingLooksLikeTheEnd)
{
    int reads = 0;
    mCalls.read = [&](int descriptor, void* buffer, std::size_t length) {
        ++reads;
        return ::read(descriptor, buffer, length);
    };
    peerSends("x");
    EXPECT_EQ(mStream.read(nullptr, 0), 0U);
    EXPECT_EQ(reads, 1);
    EXPECT_THAT(mLog.lines(), ElementsAre("I: socket stream was closed by partner (EOF)"));
}

TEST_F(SocketStreamPair, FillReadsOnUntilEverythingHasArrived)
{
    mCalls.read = [](int descriptor, void* buffer, std::size_t length) {
        return ::read(descriptor, buffer, std::min<std::size_t>(length, 3));
    };
    peerSends("abcdefgh");
    std::string text(8, '\0');
    mStream.fill(&text[0], text.size());
    EXPECT_EQ(text, "abcdefgh");
    EXPECT_THAT(mLog.lines(),
                ElementsAre("D: socket stream read 3 bytes of data", "D: socket stream read 3 bytes of data",
                            "D: socket stream read 2 bytes of data"));
    mLog.clear();
    mStream.fill(nullptr, 0);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(SocketStreamPair, FillFailsWhenTheStreamEndsInTheMiddle)
{
    peerSends("abc");
    peerCloses();
    char buffer[8];
    EXPECT_THAT([&] { mStream.fill(buffer, sizeof(buffer)); },
                ::testing::ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

TEST_F(SocketStreamPair, ABrokenConnectionFailsWithTheErrorNested)
{
    peerResets();
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(ECONNRESET, "socket stream failed to receive: 104 (Connection reset by peer)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: socket stream failed to receive: 104 (Connection reset by peer)"));
}

TEST_F(SocketStreamPair, AnyErrorOfTheSystemFailsWithItNested)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    mCalls.read = [](int, void*, std::size_t) -> ssize_t {
        errno = EIO;
        return -1;
    };
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EIO, "socket stream failed to receive: 5 (Input/output error)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: socket stream failed to receive: 5 (Input/output error)"));
}

TEST_F(SocketStreamPair, ASignalDuringAReadIsRetried)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    int signals = 3;
    mCalls.read = [&](int descriptor, void* buffer, std::size_t length) -> ssize_t {
        if (signals-- == 0) return ::read(descriptor, buffer, length);
        errno = EINTR;
        return -1;
    };
    peerSends("on");
    EXPECT_EQ(read(), "on");
    EXPECT_THAT(mLog.lines(),
                ElementsAre(kReadRetried, kReadRetried, kReadRetried, "D: socket stream read 2 bytes of data"));
    EXPECT_THAT(mRecorded.options(), IsEmpty()) << "without a deadline there is nothing to set";
}

// Writing

TEST_F(SocketStreamPair, WritesEverything)
{
    write("hello");
    EXPECT_EQ(peerReads(5), "hello");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 5 bytes of data"));
}

TEST_F(SocketStreamPair, GoesOnAfterShortWrites)
{
    std::vector<std::size_t> lengths;
    mCalls.send = [&](int descriptor, const void* buffer, std::size_t length, int flags) {
        lengths.push_back(length);
        EXPECT_EQ(flags, MSG_NOSIGNAL);
        return ::send(descriptor, buffer, std::min<std::size_t>(length, 4), flags);
    };
    write("abcdefghij");
    EXPECT_EQ(peerReads(10), "abcdefghij");
    EXPECT_THAT(lengths, ElementsAre(10, 6, 2));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 10 bytes of data")) << "once for the whole call";
}

TEST_F(SocketStreamPair, AWriteThatTakesNothingIsTriedAgain)
{
    int calls = 0;
    mCalls.send = [&](int descriptor, const void* buffer, std::size_t length, int flags) -> ssize_t {
        return ++calls == 1 ? 0 : ::send(descriptor, buffer, length, flags);
    };
    write("abc");
    EXPECT_EQ(peerReads(3), "abc");
    EXPECT_EQ(calls, 2);
}

TEST_F(SocketStreamPair, WritingNothingOnlyLogs)
{
    mCalls.send = [](int, const void*, std::size_t, int) -> ssize_t {
        ADD_FAILURE() << "sends";
        return 0;
    };
    mStream.setWriteDeadline(milliseconds(0));
    mStream.write(nullptr, 0);
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 0 bytes of data"));
    EXPECT_THAT(mRecorded.options(), IsEmpty());
}

TEST_F(SocketStreamPair, AWriteToAClosedPeerIsAFailureAndNoSignal)
{
    peerResets();
    // The first write may meet the reset as such; from then on the pipe is broken.
    try {
        write("x");
    } catch (const StreamIOException&) {
    }
    mLog.clear();
    EXPECT_THAT([this] { write("x"); }, throwsSendFailure(EPIPE, "socket stream send failure: 32 (Broken pipe)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 1 bytes of data",
                                          "E: socket stream send failure: 32 (Broken pipe)"));
}

TEST_F(SocketStreamPair, AnErrorAfterAShortWriteFailsWithItNested)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    int calls = 0;
    mCalls.send = [&](int, const void*, std::size_t, int) -> ssize_t {
        if (++calls == 1) return 4;
        errno = ENETUNREACH;
        return -1;
    };
    EXPECT_THAT([this] { write("abcdefgh"); },
                throwsSendFailure(ENETUNREACH, "socket stream send failure: 101 (Network is unreachable)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 8 bytes of data",
                                          "E: socket stream send failure: 101 (Network is unreachable)"));
}

TEST_F(SocketStreamPair, ASignalDuringAWriteIsRetried)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    int calls = 0;
    mCalls.send = [&](int descriptor, const void* buffer, std::size_t length, int flags) -> ssize_t {
        if (++calls % 2 == 0) return ::send(descriptor, buffer, std::min<std::size_t>(length, 2), flags);
        errno = EINTR;
        return -1;
    };
    write("abcd");
    EXPECT_EQ(peerReads(4), "abcd");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 4 bytes of data", kWriteRetried, kWriteRetried));
}

TEST_F(SocketStreamPair, LinesOfDisabledLevelsAreNotWritten)
{
    QelLogger::get().setLevel(LogLevel::Warn);
    write("x");
    EXPECT_EQ(peerReads(1), "x");
    peerSends("y");
    EXPECT_EQ(read(), "y");
    peerCloses();
    EXPECT_EQ(read(), "");
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

// Deadlines

/// The deadlines over a clock that the test controls, and a socket on which reads and writes succeed unless a test says
/// otherwise.
class SocketStreamDeadline : public SocketStreamPair {
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

TEST_F(SocketStreamDeadline, WithoutOneTheKernelIsToldNothing)
{
    read();
    write("x");
    read();
    write("x");
    EXPECT_THAT(mRecorded.options(), IsEmpty());
    EXPECT_EQ(mClock.steadyReads(), 0U) << "nor is the clock read";
}

TEST_F(SocketStreamDeadline, SettingOneTellsTheKernelNothingUntilTheNextTransfer)
{
    mStream.setReadDeadline(seconds(5));
    mStream.setWriteDeadline(seconds(6));
    EXPECT_THAT(newOptions(), IsEmpty());
    read();
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 5s 0us"));
    write("x");
    EXPECT_THAT(newOptions(), ElementsAre("SNDTIMEO 6s 0us"));
}

TEST_F(SocketStreamDeadline, TheSameTimeoutIsGivenToTheKernelOnce)
{
    mStream.setReadDeadline(seconds(5));
    read();
    mStream.setReadDeadline(seconds(5));
    read();
    read(); // the clock stands still: still 5 s left
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 5s 0us"));

    mStream.setWriteDeadline(seconds(5));
    write("x");
    mStream.setWriteDeadline(seconds(5));
    write("x");
    write("x");
    EXPECT_THAT(newOptions(), ElementsAre("SNDTIMEO 5s 0us"));
}

TEST_F(SocketStreamDeadline, EveryTransferGetsTheTimeThatIsLeft)
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
    read(); // less than a millisecond left: as good as nothing
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 1s 500000us", "SNDTIMEO 1s 250000us", "RCVTIMEO 1s 0us",
                                          "SNDTIMEO 0s 750000us", "RCVTIMEO 0s 1us"));
}

TEST_F(SocketStreamDeadline, OneThatHasPassedFailsWithoutAnyCall)
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

TEST_F(SocketStreamDeadline, AfterOneHasPassedTheStreamIsUsableAgain)
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

TEST_F(SocketStreamDeadline, ClearingOneTakesTheTimeoutFromTheKernel)
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

TEST_F(SocketStreamDeadline, TimeoutsInTheFormOfTheKernel)
{
    struct Row {
        milliseconds timeout;
        const char* told;
    };
    const Row rows[] = {
        {milliseconds(0), "RCVTIMEO 0s 1us"}, // a zero would mean no time-out at all
        {milliseconds(1), "RCVTIMEO 0s 1000us"},
        {milliseconds(999), "RCVTIMEO 0s 999000us"},
        {milliseconds(1000), "RCVTIMEO 1s 0us"},
        {milliseconds(1001), "RCVTIMEO 1s 1000us"},
        {milliseconds(61234), "RCVTIMEO 61s 234000us"},
        {std::chrono::hours(24 * 365), "RCVTIMEO 31536000s 0us"},
        // The ends of what microseconds can hold, and what lies beyond.
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
        EXPECT_THAT(newOptions(), ElementsAre(row.told));
    }
}

TEST_F(SocketStreamDeadline, ASignalLeavesTheTimeThatIsLeft)
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

TEST_F(SocketStreamDeadline, OneThatPassesDuringASignalEndsTheRetries)
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

TEST_F(SocketStreamDeadline, AWriteInPiecesHasOneDeadline)
{
    mCalls.send = [&](int, const void*, std::size_t, int) -> ssize_t {
        mClock.advance(milliseconds(60));
        return 1;
    };
    mStream.setWriteDeadline(milliseconds(100));
    EXPECT_THAT([this] { write("abc"); }, throwsDeadline());
    EXPECT_THAT(newOptions(), ElementsAre("SNDTIMEO 0s 100000us", "SNDTIMEO 0s 40000us"));
}

TEST_F(SocketStreamDeadline, ATimeoutThatTheKernelRefusesIsNested)
{
    mRecorded.failAt(1);
    mStream.setReadDeadline(seconds(5));
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EPERM, "Failed to set socket option: 1 (Operation not permitted)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: Failed to set socket option 1 20: 1 (Operation not permitted)"));
    // The value counts as told, so that it is not tried again.
    EXPECT_EQ(read(), "r");
    EXPECT_THAT(newOptions(), ElementsAre("RCVTIMEO 5s 0us"));

    mLog.clear();
    mStream.setWriteDeadline(seconds(5));
    EXPECT_THAT([this] { write("x"); },
                throwsSendFailure(EPERM, "Failed to set socket option: 1 (Operation not permitted)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 1 bytes of data",
                                          "E: Failed to set socket option 1 21: 1 (Operation not permitted)"));
}

// Cost

TEST(SocketStream, TransfersWithoutLogLinesAllocateNothing)
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

// Deadlines that the kernel keeps

TEST_F(SocketStreamPair, TheKernelKnowsTheTimeout)
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

TEST_F(SocketStreamPair, TheKernelTakesTheLongestTimeout)
{
    peerSends("a");
    mStream.setReadDeadline(milliseconds::max());
    EXPECT_EQ(read(), "a");
    mStream.setWriteDeadline(milliseconds::max());
    write("x");
    EXPECT_EQ(peerReads(1), "x");
}

TEST_F(SocketStreamPair, AReadThatOutlastsItsDeadlineFails)
{
    mStream.setReadDeadline(milliseconds(50));
    const steady_clock::time_point begin = steady_clock::now();
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EAGAIN, "socket stream failed to receive: 11 (Resource temporarily unavailable)"));
    const auto elapsed = steady_clock::now() - begin;
    EXPECT_GE(elapsed, milliseconds(40)); // the kernel counts in ticks
    EXPECT_LT(elapsed, seconds(10));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: socket stream failed to receive: 11 (Resource temporarily unavailable)"));
    // The stream goes on.
    mStream.clearReadDeadline();
    peerSends("still here");
    EXPECT_EQ(read(), "still here");
}

TEST_F(SocketStreamPair, AReadDeadlineOfZeroFailsAtOnceWhenNothingHasArrived)
{
    mStream.setReadDeadline(milliseconds(0));
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EAGAIN, "socket stream failed to receive: 11 (Resource temporarily unavailable)"));
    EXPECT_THAT(mRecorded.options(), ElementsAre("RCVTIMEO 0s 1us"));
    EXPECT_THAT([this] { read(); }, throwsDeadline()) << "by now the clock has moved";
}

TEST_F(SocketStreamPair, AReadDeadlineOfZeroTakesWhatHasArrived)
{
    peerSends("there");
    EXPECT_TRUE(PollSet(mStream.getSocket().getPollFd(PollEvents::Read)).wait(seconds(10)).anyReady());
    mStream.setReadDeadline(milliseconds(0));
    EXPECT_EQ(read(), "there");
}

TEST_F(SocketStreamPair, AWriteThatOutlastsItsDeadlineFails)
{
    // More than the buffers of both ends hold, and nobody reads.
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

TEST_F(SocketStreamPair, AWriteDeadlineOfZeroFailsAtOnceWhenThereIsNoRoom)
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

// Real signals

TEST_F(SocketStreamPair, RealSignalsDoNotEndARead)
{
    std::string text;
    const int signals = test::callUnderSignals(
        0, [&] { text = read(); },
        [&] {
            const std::vector<std::string> lines = mLog.lines();
            if (std::count(lines.begin(), lines.end(), kReadRetried) < 2) return true;
            peerSends("at last");
            return false;
        });
    EXPECT_EQ(text, "at last");
    EXPECT_GE(signals, 2);
}

TEST_F(SocketStreamPair, TheSystemResumesAReadItselfWhenThereIsNoDeadline)
{
    int sent = 0;
    std::string text;
    test::callUnderSignals(
        SA_RESTART, [&] { text = read(); },
        [&] {
            if (++sent <= 20) return true;
            peerSends("at last");
            return false;
        });
    EXPECT_EQ(text, "at last");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream read 7 bytes of data"));
}

TEST_F(SocketStreamPair, SignalsDoNotPutOffADeadline)
{
    mStream.setReadDeadline(milliseconds(200)); // long enough for a signal on a busy machine
    const steady_clock::time_point begin = steady_clock::now();
    // With a deadline the system leaves the resuming to the stream, whatever the handler asks for.
    test::callUnderSignals(
        SA_RESTART, [this] { EXPECT_THROW(read(), StreamIOException); }, [] { return true; });
    const auto elapsed = steady_clock::now() - begin;
    EXPECT_GE(elapsed, milliseconds(190)); // the kernel counts in ticks
    EXPECT_LT(elapsed, seconds(10));
    EXPECT_THAT(mLog.lines(), Contains(kReadRetried));
}

TEST_F(SocketStreamPair, RealSignalsDoNotEndAWrite)
{
    const std::string tooMuch(4 * 1024 * 1024, 'x');
    std::future<std::string> received;
    test::callUnderSignals(
        0, [&] { write(tooMuch); },
        [&] {
            const std::vector<std::string> lines = mLog.lines();
            if (std::find(lines.begin(), lines.end(), kWriteRetried) == lines.end()) return true;
            received = std::async(std::launch::async, [&] { return peerReads(tooMuch.size()); });
            return false;
        });
    EXPECT_EQ(received.get(), tooMuch);
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

TEST_F(SocketStreamPair, CloseWakesAReaderThatWaits)
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

    // Gives back what it gets, also from two threads at once.
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

} // namespace
} // namespace qel
