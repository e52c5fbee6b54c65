#include <qel/common/StreamFormatters.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "LogLine.hpp"
#include "LoggedError.hpp"
#include "util/Timeout.hpp"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

namespace qel {

namespace {

const sockaddr* asSockaddr(const sockaddr_storage& address) { return reinterpret_cast<const sockaddr*>(&address); }

sockaddr* asSockaddr(sockaddr_storage& address) { return reinterpret_cast<sockaddr*>(&address); }

} // namespace

Socket::Socket(IPFamily family, int type, int protocol)
    : mFd(::socket(IPFamilyUtils::toUNIXAddressFamily(family), type, protocol))
{
    if (mFd < 0) throwLogged(errno, "Cannot open socket");
}

Socket::Socket(int fd) noexcept : mFd(fd) {}

Socket::Socket(Socket&& other) noexcept : mFd(other.mFd) { other.mFd = -1; }

Socket& Socket::operator=(Socket&& other) noexcept
{
    if (this == &other) return *this;
    pClose();
    mFd = other.mFd;
    other.mFd = -1;
    return *this;
}

Socket::~Socket() { pClose(); }

void Socket::connect(const IPEndpoint& endpoint, std::chrono::milliseconds timeout)
{
    const int flags = getFlags();
    setFlags(flags | O_NONBLOCK);

    const sockaddr_storage address = endpoint.getSockaddr();
    if (::connect(mFd, asSockaddr(address), sizeof(address)) != 0) {
        const PosixErrorCode code(errno);
        if (code != EINPROGRESS) throwLogged(code, "socket connect failed");
        pAwaitConnection(timeout);
    }
    setFlags(flags);
}

/// Waits until a connect in progress has succeeded or failed.
void Socket::pAwaitConnection(std::chrono::milliseconds timeout) const
{
    const PollFd writable = getPollFd(PollEvents::Write);
    const PollSet set(writable);
    // Not before the epoch of the clock, where a PollDeadline would be disabled.
    using time_point = PollDeadline::time_point;
    const PollDeadline deadline(std::max(deadlineAfter(TimeProvider::steady(), timeout), time_point()));

    // A signal gives an empty result; the loop then waits again for the time left.
    while (!set.wait(deadline.getTimeout(TimeProvider::steady())).contains(writable)) {
        if (deadline.isExpired(TimeProvider::steady())) throwLogged(ETIMEDOUT, "socket connect timed out");
    }

    int error = -1;
    std::size_t length = sizeof(error);
    getSocketOption(SOL_SOCKET, SO_ERROR, &error, length);
    if (error != 0) throwLogged(error, "socket connect failed: SO_ERROR");
}

void Socket::bind(const IPEndpoint& endpoint)
{
    const sockaddr_storage address = endpoint.getSockaddr();
    if (::bind(mFd, asSockaddr(address), sizeof(address)) != 0) throwLogged(errno, "socket bind failed");
}

void Socket::listen(int backlog)
{
    if (::listen(mFd, backlog) == 0) return;
    const PosixErrorCode code(errno);
    logLine(LogLevel::Error, "Failed to listen on socket ", decFormat(mFd), ": ", code);
    throw PosixError(code, "Failed to listen on socket");
}

Socket Socket::accept(int flags)
{
    const int fd = ::accept4(mFd, nullptr, nullptr, flags | SOCK_CLOEXEC);
    if (fd < 0) throw PosixError(errno);
    return Socket(fd);
}

void Socket::setSocketOption(int level, int name, const void* value, std::size_t length)
{
    if (::setsockopt(mFd, level, name, value, static_cast<socklen_t>(length)) == 0) return;
    const PosixErrorCode code(errno);
    logLine(LogLevel::Error, "Failed to set socket option ", decFormat(level), ' ', decFormat(name), ": ", code);
    throw PosixError(code, "Failed to set socket option");
}

void Socket::setSocketOption(int level, int name, int value) { setSocketOption(level, name, &value, sizeof(value)); }

void Socket::getSocketOption(int level, int name, void* value, std::size_t& length) const
{
    socklen_t systemLength = static_cast<socklen_t>(length);
    if (::getsockopt(mFd, level, name, value, &systemLength) != 0) {
        const PosixErrorCode code(errno);
        logLine(LogLevel::Error, "Failed to get socket option ", decFormat(level), ' ', decFormat(name), ": ", code);
        throw PosixError(code, "Failed to get socket option");
    }
    length = systemLength;
}

IPEndpoint Socket::getSocketName() const
{
    sockaddr_storage address{};
    socklen_t length = sizeof(address);
    if (::getsockname(mFd, asSockaddr(address), &length) != 0) throwLogged(errno, "Failed to get socket name");
    return IPEndpoint(address);
}

IPEndpoint Socket::getPeerName() const
{
    sockaddr_storage address{};
    socklen_t length = sizeof(address);
    if (::getpeername(mFd, asSockaddr(address), &length) != 0) throwLogged(errno, "Failed to get peer name");
    return IPEndpoint(address);
}

int Socket::getFlags() const
{
    const int flags = ::fcntl(mFd, F_GETFL);
    if (flags == -1) throwLogged(errno, "Failed to get socket fd flags");
    return flags;
}

void Socket::setFlags(int flags)
{
    if (::fcntl(mFd, F_SETFL, flags) == -1) throwLogged(errno, "Failed to set socket fd flags");
}

PollFd Socket::getPollFd(PollEvents events) const { return PollFd(mFd, events); }

void Socket::shutdown() { ::shutdown(mFd, SHUT_RDWR); }

ssize_t Socket::read(char* buffer, std::size_t length) { return ::read(mFd, buffer, length); }

ssize_t Socket::write(const char* buffer, std::size_t length) { return ::send(mFd, buffer, length, MSG_NOSIGNAL); }

void Socket::pClose() noexcept
{
    if (mFd >= 0) ::close(mFd);
}

} // namespace qel
