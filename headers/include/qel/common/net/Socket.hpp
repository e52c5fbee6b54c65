#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/IPFamily.hpp>
#include <qel/common/net/SocketIF.hpp>
#include <qel/common/util/Poll.hpp>

#include <chrono>
#include <cstddef>
#include <sys/types.h>

namespace qel {

/// A socket of the system. Every call goes straight to the system call of the same name; its errors come as PosixError
/// with a text "WHAT FAILED: NUMBER (DESCRIPTION)", written to the log at Error before the throw except by accept().
/// read(), write() and shutdown() throw nothing: they do as SocketIF says.
/// Ownership: owns its descriptor and closes it; movable, not copyable. A moved-from socket holds none (-1) and may be
/// assigned to or destroyed.
/// Thread safety: takes no lock. One reader and one writer at a time; shutdown() may be called while they wait.
class QEL_EXPORT Socket : public SocketIF {
public:
    /// Opens a socket. The numbers are passed on unchanged: add SOCK_CLOEXEC to the type where the descriptor shall not
    /// survive an exec.
    /// @param type      SOCK_STREAM and the like, with the flags of socket(2)
    /// @param protocol  0 for the usual one of the type
    /// @throws PosixError             "Cannot open socket"
    /// @throws std::invalid_argument  "Not an IP address family"
    Socket(IPFamily family, int type, int protocol);

    /// Takes over an open descriptor, or none when it is negative.
    explicit Socket(int fd) noexcept;

    Socket(Socket&& other) noexcept;
    /// Closes the descriptor held so far, then takes the other's; assigning an object to itself changes nothing.
    Socket& operator=(Socket&& other) noexcept;
    ~Socket() override;

    /// Connects, waiting for at most the given time. Waits cut short by signals go on with the time left.
    /// The descriptor flags (blocking or not) are afterwards what they were. After a failure the socket is left
    /// non-blocking and is of no further use.
    /// @param timeout  measured on TimeProvider::steady(); a negative one looks once without waiting
    /// @throws PosixError  "socket connect failed" (at once), "socket connect failed: SO_ERROR" (later, with the code
    ///                     of the pending error), "socket connect timed out" (ETIMEDOUT), or that of a call on the way
    void connect(const IPEndpoint& endpoint, std::chrono::milliseconds timeout);

    /// @param endpoint  port 0 lets the system choose a free one; getSocketName() tells which
    /// @throws PosixError  "socket bind failed"
    void bind(const IPEndpoint& endpoint);

    /// @param backlog  connections that may wait to be accepted (listen(2))
    /// @throws PosixError  "Failed to listen on socket"; the log line names the descriptor as well
    void listen(int backlog);

    /// Takes the next connection that waits; blocks until there is one unless the socket is non-blocking.
    /// The new descriptor does not survive an exec. getPeerName() of the new socket tells who it is.
    /// @param flags  SOCK_NONBLOCK makes the new socket non-blocking (accept4(2))
    /// @throws PosixError  the error code alone, without a log line: a failed accept, such as EAGAIN of a non-blocking
    ///                     socket or EINTR after a signal, is routine
    Socket accept(int flags = 0);

    /// @param value   length bytes, in the form that the option wants (socket(7), tcp(7), ipv6(7))
    /// @throws PosixError  "Failed to set socket option"; the log line names level and option as well
    void setSocketOption(int level, int name, const void* value, std::size_t length);
    /// The same for an option that is an int.
    void setSocketOption(int level, int name, int value);

    /// @param value   takes up to length bytes
    /// @param length  the room in value; on return the bytes that the system has put there
    /// @throws PosixError  "Failed to get socket option"; the log line names level and option as well
    void getSocketOption(int level, int name, void* value, std::size_t& length) const;

    /// @return the address and port of this end
    /// @throws PosixError             "Failed to get socket name"
    /// @throws std::invalid_argument  "Not an IP address family": not an IP socket
    IPEndpoint getSocketName() const;
    /// @return the address and port of the other end
    /// @throws PosixError             "Failed to get peer name"
    /// @throws std::invalid_argument  "Not an IP address family": not an IP socket
    IPEndpoint getPeerName() const;

    /// @return the status flags of the descriptor, such as O_NONBLOCK (fcntl(2), F_GETFL)
    /// @throws PosixError  "Failed to get socket fd flags"
    int getFlags() const;
    /// @param flags  all status flags that it shall have (fcntl(2), F_SETFL)
    /// @throws PosixError  "Failed to set socket fd flags"
    void setFlags(int flags);

    /// @return the descriptor, still owned by this object; -1 when it holds none
    int getFd() const noexcept { return mFd; }

    PollFd getPollFd(PollEvents events) const override;
    void shutdown() override;
    ssize_t read(char* buffer, std::size_t length) override;
    ssize_t write(const char* buffer, std::size_t length) override;

private:
    void pAwaitConnection(std::chrono::milliseconds timeout) const;
    void pClose() noexcept;

    int mFd; // -1: none
};

} // namespace qel
