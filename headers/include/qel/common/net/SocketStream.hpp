#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/net/Socket.hpp>

#include <chrono>
#include <cstddef>

namespace qel {

/// A byte stream over a connected TCP socket, with a deadline for each direction.
///
/// The kernel detects a dead peer: it probes a connection that has been idle for 30 s (10 probes, 3 s apart) and aborts
/// one whose data stays unacknowledged for 60 s. Deadlines are applied as the kernel's receive and send timeouts, whose
/// resolution is one tick (some milliseconds).
///
/// A transfer that fails throws StreamIOException; std::rethrow_if_nested gives the PosixError with the error code.
/// A deadline is reported in one of two ways: it passes while the call waits (nested PosixError, EAGAIN), or it has
/// passed before the call begins ("I/O deadline", nothing nested). Neither closes the stream. Reading can continue
/// after a new deadline is set; after a failed write it is unknown how much has been sent.
///
/// Ownership: owns the socket. The destructor closes its descriptor; close() does not.
/// Thread safety: no locks. One thread may read while another writes; setReadDeadline() belongs to the reader,
/// setWriteDeadline() to the writer. close() may be called from any thread and wakes both.
class QEL_EXPORT SocketStream : public Stream {
public:
    /// Makes the socket blocking, requests 64 KiB for each of its buffers (SO_RCVBUF, SO_SNDBUF), disables the delay of
    /// small segments (TCP_NODELAY), enables the detection of a dead peer, and clears the kernel's timeouts.
    /// @param socket  connected TCP; consumed even if the constructor throws
    /// @throws PosixError  of the setting that failed, not nested: "Failed to get socket fd flags",
    ///                     "Failed to set socket fd flags" or "Failed to set socket option"
    explicit SocketStream(Socket socket);
    ~SocketStream() override;

    /// Shuts down both directions of the connection: a read that waits returns 0, and later writes fail. The descriptor
    /// stays open. Does not throw.
    void close() override;

    /// @param timeout  how long all following reads may take together, counted from the start of the next one (see
    ///                 StreamDeadline); 0: the next read returns only what has already arrived; negative: no limit
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    /// The same for writes.
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

    /// Waits until at least one byte has arrived. A wait that a signal interrupts continues with the time left.
    /// @param buffer  room for length bytes; borrowed for the call
    /// @return the number of bytes read; 0 when the peer has ended the connection, and for length 0
    /// @throws StreamIOException  "socket stream receive failure" with a nested PosixError: "socket stream failed to
    ///                            receive", or "Failed to set socket option" when the kernel refused the timeout
    /// @throws StreamIOException  "I/O deadline": the read deadline has passed
    std::size_t read(char* buffer, std::size_t length) override;

    /// Writes all bytes. A wait that a signal interrupts continues with the time left.
    /// @param buffer  length bytes; borrowed for the call
    /// @throws StreamIOException  "socket stream send failure" with a nested PosixError: "socket stream send failure"
    ///                            (EPIPE when the peer has closed; no signal is raised), or "Failed to set socket
    ///                            option" when the kernel refused the timeout
    /// @throws StreamIOException  "I/O deadline": the write deadline has passed; part of the bytes may have been sent
    void write(const char* buffer, std::size_t length) override;

    /// @return the socket, owned by the stream: for its names and its descriptor
    const Socket& getSocket() const noexcept { return mSocket; }

private:
    ssize_t pReceive(char* buffer, std::size_t length);
    void pSendAll(const char* buffer, std::size_t length);
    void pApplyDeadline(StreamDeadline& deadline, std::chrono::milliseconds& cachedTimeout, int optionName);
    void pSetTimeout(int optionName, std::chrono::milliseconds timeout);

    Socket mSocket;
    StreamDeadline mReadDeadline;
    StreamDeadline mWriteDeadline;
    // The timeouts last given to the kernel, which is called only when one changes.
    std::chrono::milliseconds mCachedReadTimeout;
    std::chrono::milliseconds mCachedWriteTimeout;
};

} // namespace qel
