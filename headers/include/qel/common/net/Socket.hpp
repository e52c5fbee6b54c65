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

/// A socket of the system, as an object that owns its descriptor.
///
/// A system call that fails throws PosixError with the text "PHRASE: NUMBER (DESCRIPTION)"; the phrases are listed with
/// each operation. A line about it goes to the log at Error first: the same text, or, from listen() and the options,
/// one that also gives the descriptor or the option. accept() throws the code without a phrase and writes no line.
/// read(), write() and shutdown() do not throw: they report as SocketIF says.
///
/// Ownership: closes its descriptor when it is destroyed. Movable, not copyable. A moved-from socket holds no
/// descriptor (-1); it may be assigned to or destroyed.
/// Thread safety: no locks. One thread may read while another writes; shutdown() may be called from any thread while
/// they wait. Everything else belongs to one thread at a time.
class QEL_EXPORT Socket : public SocketIF {
public:
    /// Opens a socket.
    /// @param type      passed to socket(2) unchanged, such as SOCK_STREAM; add SOCK_CLOEXEC for a close-on-exec
    ///                  descriptor
    /// @param protocol  passed unchanged; 0 is the default of the type
    /// @throws PosixError             "Cannot open socket"
    /// @throws std::invalid_argument  "Not an IP address family"
    Socket(IPFamily family, int type, int protocol);

    /// Takes ownership of an open descriptor; a negative number means none.
    explicit Socket(int fd) noexcept;

    /// Takes the descriptor of the other socket.
    Socket(Socket&& other) noexcept;
    /// Closes the own descriptor first, then takes that of the other socket. Self-assignment changes nothing.
    Socket& operator=(Socket&& other) noexcept;
    /// Closes the descriptor.
    ~Socket() override;

    /// Connects, and waits for the result for at most the given time. A wait that a signal interrupts continues with
    /// the time left. On success the descriptor flags (blocking or not) are restored; after a failure the socket is
    /// left non-blocking and is to be destroyed.
    /// @param timeout  measured on TimeProvider::steady(); zero or negative polls once without waiting
    /// @throws PosixError  "socket connect failed" (at once), "socket connect failed: SO_ERROR" (after a wait, with the
    ///                     pending error of the socket), "socket connect timed out" (ETIMEDOUT), "poll() failed", or
    ///                     that of getFlags(), setFlags() or getSocketOption()
    void connect(const IPEndpoint& endpoint, std::chrono::milliseconds timeout);

    /// Binds the socket to an address of this machine (bind(2)).
    /// @param endpoint  port 0 lets the system choose a free port; getSocketName() returns it
    /// @throws PosixError  "socket bind failed"
    void bind(const IPEndpoint& endpoint);

    /// Starts to accept connections (listen(2)).
    /// @param backlog  connections that may wait to be accepted
    /// @throws PosixError  "Failed to listen on socket"; the log line also gives the descriptor
    void listen(int backlog);

    /// Accepts the next connection (accept4(2)); blocks until there is one unless the socket is non-blocking.
    /// @param flags  SOCK_NONBLOCK makes the new socket non-blocking; SOCK_CLOEXEC is always added
    /// @return the connection, owned by the caller; its getPeerName() is the address of the peer
    /// @throws PosixError  the code without a phrase or a log line, since a failed accept is routine: EAGAIN of a
    ///                     non-blocking socket, EINTR after a signal
    Socket accept(int flags = 0);

    /// Sets an option (setsockopt(2)).
    /// @param value   length bytes in the format of the option (socket(7), tcp(7), ipv6(7)); borrowed for the call
    /// @throws PosixError  "Failed to set socket option"; the log line also gives level and option
    void setSocketOption(int level, int name, const void* value, std::size_t length);
    /// The same for an option that is an int.
    void setSocketOption(int level, int name, int value);

    /// Reads an option (getsockopt(2)).
    /// @param value   a buffer of length bytes; borrowed for the call
    /// @param length  the size of value; on return the number of bytes written to it, after a failure unchanged
    /// @throws PosixError  "Failed to get socket option"; the log line also gives level and option
    void getSocketOption(int level, int name, void* value, std::size_t& length) const;

    /// @return the address and port of this side (getsockname(2))
    /// @throws PosixError             "Failed to get socket name"
    /// @throws std::invalid_argument  "Not an IP address family": not an IP socket
    IPEndpoint getSocketName() const;
    /// @return the address and port of the peer (getpeername(2))
    /// @throws PosixError             "Failed to get peer name"
    /// @throws std::invalid_argument  "Not an IP address family": not an IP socket
    IPEndpoint getPeerName() const;

    /// @return the status flags of the descriptor, such as O_NONBLOCK (fcntl(2), F_GETFL)
    /// @throws PosixError  "Failed to get socket fd flags"
    int getFlags() const;
    /// @param flags  replace all status flags of the descriptor (fcntl(2), F_SETFL)
    /// @throws PosixError  "Failed to set socket fd flags"
    void setFlags(int flags);

    /// @return the descriptor, which this object still owns and closes; negative when it holds none
    int getFd() const noexcept { return mFd; }

    PollFd getPollFd(PollEvents events) const override;
    void shutdown() override;
    ssize_t read(char* buffer, std::size_t length) override;
    ssize_t write(const char* buffer, std::size_t length) override;

private:
    void pAwaitConnection(std::chrono::milliseconds timeout) const;
    void pClose() noexcept;

    int mFd; // negative: none; 0 is a descriptor
};

} // namespace qel
