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
/// A peer that vanishes is noticed: an idle connection is probed after 30 s (10 probes, 3 s apart), and data that stays
/// unacknowledged for 60 s ends it. Deadlines are kept by the kernel's receive and send time-outs, whose resolution is
/// one tick (some milliseconds).
///
/// A transfer that fails throws StreamIOException; std::rethrow_if_nested gives the PosixError with the error code.
/// A deadline shows in one of two ways: it passes while the call waits (nested PosixError, EAGAIN), or it has already
/// passed when the call begins ("I/O deadline", nothing nested). Neither closes the stream: reading can go on after a
/// new deadline is set; after a failed write it is unknown how much has been sent.
///
/// Ownership: owns the socket; its descriptor is closed when the stream is destroyed, not by close().
/// Thread safety: takes no lock. One thread may read while another writes, and setReadDeadline() belongs to the reader,
/// setWriteDeadline() to the writer. close() may be called from any thread to wake both.
class QEL_EXPORT SocketStream : public Stream {
public:
    /// Makes the socket blocking, sets 64 KiB for each of its buffers, switches the delay of small segments off and the
    /// watching of the peer on, and clears the kernel's time-outs.
    /// @param socket  connected TCP; consumed even if the constructor throws
    /// @throws PosixError  that of the setting that failed, not nested: "Failed to get socket fd flags",
    ///                     "Failed to set socket fd flags" or "Failed to set socket option"
    explicit SocketStream(Socket socket);
    ~SocketStream() override;

    /// Shuts both directions of the connection down: a read that waits returns 0, a later write fails. The descriptor
    /// stays open.
    void close() override;

    /// @param timeout  how long the reads from the next one on may take all together; negative: no limit. The time runs
    ///                 from the beginning of the next read; see StreamDeadline. With 0 a read takes only what has
    ///                 already arrived.
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    /// The same for writes.
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

    /// Waits until at least one byte has arrived. A wait that a signal cuts short goes on with the time that is left.
    /// @param buffer  takes up to length bytes
    /// @return the bytes read; 0 when the peer has ended the connection, or for length 0
    /// @throws StreamIOException  "socket stream receive failure" with a nested PosixError "socket stream failed to
    ///                            receive", or "I/O deadline"
    std::size_t read(char* buffer, std::size_t length) override;

    /// Writes all bytes. A wait that a signal cuts short goes on with the time that is left.
    /// @param buffer  length bytes; borrowed for the call
    /// @throws StreamIOException  "socket stream send failure" with a nested PosixError of the same text (EPIPE when
    ///                            the peer has closed; never a signal), or "I/O deadline"
    void write(const char* buffer, std::size_t length) override;

    /// @return the socket, for its names and its descriptor; owned by the stream
    const Socket& getSocket() const noexcept { return mSocket; }

private:
    ssize_t pReceive(char* buffer, std::size_t length);
    void pSendAll(const char* buffer, std::size_t length);
    void pApplyDeadline(StreamDeadline& deadline, std::chrono::milliseconds& cachedTimeout, int optionName);
    void pSetTimeout(int optionName, std::chrono::milliseconds timeout);

    Socket mSocket;
    StreamDeadline mReadDeadline;
    StreamDeadline mWriteDeadline;
    // The time-outs that the kernel was last given, so that it is called only when one changes.
    std::chrono::milliseconds mCachedReadTimeout;
    std::chrono::milliseconds mCachedWriteTimeout;
};

} // namespace qel
