#include <qel/common/StreamFormatters.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/PosixError.hpp>

#include "LogLine.hpp"
#include "LoggedError.hpp"

#include <cerrno>
#include <exception>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <utility>

namespace qel {

namespace {

constexpr int kBufferBytes = 65536;
constexpr int kKeepAliveProbes = 10;
constexpr int kKeepAliveIdleSeconds = 30;
constexpr int kKeepAliveIntervalSeconds = 3;
constexpr int kUserTimeoutMilliseconds = 60000;

} // namespace

SocketStream::SocketStream(Socket socket)
    : mSocket(std::move(socket)), mCachedReadTimeout(StreamDeadline::Infinite),
      mCachedWriteTimeout(StreamDeadline::Infinite)
{
    mSocket.setFlags(mSocket.getFlags() & ~O_NONBLOCK);
    mSocket.setSocketOption(SOL_SOCKET, SO_RCVBUF, kBufferBytes);
    mSocket.setSocketOption(SOL_SOCKET, SO_SNDBUF, kBufferBytes);
    mSocket.setSocketOption(IPPROTO_TCP, TCP_NODELAY, 1);
    mSocket.setSocketOption(SOL_SOCKET, SO_KEEPALIVE, 1);
    mSocket.setSocketOption(IPPROTO_TCP, TCP_KEEPCNT, kKeepAliveProbes);
    mSocket.setSocketOption(IPPROTO_TCP, TCP_KEEPIDLE, kKeepAliveIdleSeconds);
    mSocket.setSocketOption(IPPROTO_TCP, TCP_KEEPINTVL, kKeepAliveIntervalSeconds);
    mSocket.setSocketOption(IPPROTO_TCP, TCP_USER_TIMEOUT, kUserTimeoutMilliseconds);
    // An adopted socket may have timeouts already.
    pSetTimeout(SO_RCVTIMEO, StreamDeadline::Infinite);
    pSetTimeout(SO_SNDTIMEO, StreamDeadline::Infinite);
}

SocketStream::~SocketStream() = default;

void SocketStream::close() { mSocket.shutdown(); }

void SocketStream::setReadDeadline(std::chrono::milliseconds timeout) { mReadDeadline = timeout; }

void SocketStream::setWriteDeadline(std::chrono::milliseconds timeout) { mWriteDeadline = timeout; }

std::size_t SocketStream::read(char* buffer, std::size_t length)
{
    ssize_t count = 0;
    try {
        count = pReceive(buffer, length);
    } catch (const PosixError&) {
        std::throw_with_nested(StreamIOException("socket stream receive failure"));
    }
    if (count == 0) {
        logLine(LogLevel::Info, "socket stream was closed by partner (EOF)");
        return 0;
    }
    logLine(LogLevel::Debug, "socket stream read ", decFormat(count), " bytes of data");
    return static_cast<std::size_t>(count);
}

void SocketStream::write(const char* buffer, std::size_t length)
{
    logLine(LogLevel::Debug, "socket stream sending ", decFormat(length), " bytes of data");
    try {
        pSendAll(buffer, length);
    } catch (const PosixError&) {
        std::throw_with_nested(StreamIOException("socket stream send failure"));
    }
}

ssize_t SocketStream::pReceive(char* buffer, std::size_t length)
{
    for (;;) {
        pApplyDeadline(mReadDeadline, mCachedReadTimeout, SO_RCVTIMEO);
        const ssize_t count = mSocket.read(buffer, length);
        if (count >= 0) return count;
        const PosixErrorCode code(errno);
        if (code != EINTR) throwLogged(code, "socket stream failed to receive");
        logLine(LogLevel::Warn, "socket stream read interrupted by signal, retrying I/O");
    }
}

void SocketStream::pSendAll(const char* buffer, std::size_t length)
{
    while (length > 0) {
        pApplyDeadline(mWriteDeadline, mCachedWriteTimeout, SO_SNDTIMEO);
        const ssize_t count = mSocket.write(buffer, length);
        if (count >= 0) {
            buffer += count;
            length -= static_cast<std::size_t>(count);
            continue;
        }
        const PosixErrorCode code(errno);
        if (code != EINTR) throwLogged(code, "socket stream send failure");
        logLine(LogLevel::Warn, "socket stream write interrupted by signal, retrying I/O");
    }
}

/// Sets the kernel timeout to the time that the deadline leaves, unless it has that value already.
void SocketStream::pApplyDeadline(StreamDeadline& deadline, std::chrono::milliseconds& cachedTimeout, int optionName)
{
    const std::chrono::milliseconds timeout = deadline.getEffectiveTimeout();
    if (timeout == cachedTimeout) return;
    cachedTimeout = timeout;
    pSetTimeout(optionName, timeout);
}

void SocketStream::pSetTimeout(int optionName, std::chrono::milliseconds timeout)
{
    using std::chrono::microseconds;
    using std::chrono::milliseconds;

    constexpr microseconds::rep kMicrosecondsPerSecond = 1000000;
    constexpr milliseconds kMax = std::chrono::duration_cast<milliseconds>(microseconds::max());

    // The kernel takes zero for "no timeout": so an infinite timeout becomes zero, and a zero timeout the shortest one.
    microseconds wait(0);
    if (timeout == milliseconds(0)) {
        wait = microseconds(1);
    } else if (timeout > kMax) {
        wait = microseconds::max();
    } else if (timeout > milliseconds(0)) {
        wait = timeout;
    }
    timeval value{};
    value.tv_sec = static_cast<time_t>(wait.count() / kMicrosecondsPerSecond);
    value.tv_usec = static_cast<suseconds_t>(wait.count() % kMicrosecondsPerSecond);
    mSocket.setSocketOption(SOL_SOCKET, optionName, &value, sizeof(value));
}

} // namespace qel
