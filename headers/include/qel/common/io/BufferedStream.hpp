#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>
#include <memory>

namespace qel {

class SSLStream;

/// The buffers of a BufferedStream, and who flushes.
struct BufferedStreamOptions {
    /// The size of the buffer for reading; 0: each read requests what its caller requests, and nothing is kept.
    std::size_t readAheadBytes = 16384;
    /// The size of the buffer for writing; 0: each write goes on at once.
    std::size_t gatherBytes = 8192;
    /// Whether each read flushes before it goes to the stream below. For programs in which one thread reads and writes:
    /// the reader then also does what the writer may do.
    bool flushBeforeRead = false;
};

/// Carries many small transfers in few large ones: a buffer for each direction in front of another stream.
///
/// Reading: takes from the stream below all that one read gives, up to the size of the buffer, and serves later reads
/// from it. When the buffer is empty, a read as long as the buffer or longer goes directly to the stream below.
///
/// Writing: bytes are gathered until flush(), or until a write does not fit any more. Nothing else sends them: there is
/// no timer, and neither close() nor the destructor flushes. So a thread flushes before it waits for anything that
/// depends on them, such as an answer. A write longer than the buffer goes on unchanged after what was gathered. No
/// write is divided: the stream below gets whole writes of the caller, one or more at a time.
///
/// TLS: put this stream over an SSLStream, not under it. Over an SSLStream it reads ahead only what is already
/// decrypted. An SSLStream that is asked for more discards the peer's last data when the end of TLS, or an invalid
/// record, arrives together with it. This stream sees an SSLStream directly below it only: over a stream of another
/// class that reads from an SSLStream, set readAheadBytes to 0. A connection that begins in the clear and is upgraded
/// must not read ahead before the upgrade: bytes that follow the answer belong to TLS.
///
/// Deadlines belong to the stream below and act on its calls. A read that is served from the buffer, or a write that is
/// gathered, neither starts nor checks one. The write deadline acts in flush() and in writes that do not fit.
///
/// End of stream and errors of the stream below reach the caller unchanged, after all bytes that were read before them.
/// When sending what was gathered fails, these bytes are dropped: it is unknown how many of them were sent, and they
/// are not sent again. They may include several writes that returned successfully, so treat the failure as the end of
/// the connection.
///
/// Allocates its buffers in the constructor, and nothing later.
///
/// Ownership: borrows the stream below, or owns it, depending on the constructor. The destructor drops what was
/// gathered and not flushed, and destroys an owned stream.
/// Thread safety: no locks; one reader thread and one writer thread, also at the same time. The directions share
/// nothing, except with flushBeforeRead, where one thread has both. read(), fill(), setReadDeadline() and hasPending()
/// belong to the reader; write(), flush() and setWriteDeadline() to the writer. close() may be called by any thread if
/// that holds for the stream below.
class QEL_EXPORT BufferedStream final : public Stream {
public:
    using Options = BufferedStreamOptions;

    /// @param stream   the stream below; borrowed, must outlive this object
    /// @throws std::invalid_argument  "stream": it is itself a BufferedStream
    /// @throws std::bad_alloc  no memory for the buffers
    explicit BufferedStream(Stream& stream, const Options& options = Options());

    /// @param stream   the stream below; destroyed if the constructor throws
    /// @throws std::invalid_argument  "stream": it is null, or itself a BufferedStream
    /// @throws std::bad_alloc  no memory for the buffers
    explicit BufferedStream(std::unique_ptr<Stream> stream, const Options& options = Options());

    ~BufferedStream() override;

    /// Sends what was gathered, in one write. Does nothing if there is nothing.
    /// @throws ...  what a write of the stream below throws; the gathered bytes are dropped then
    void flush();

    /// Whether bytes of the peer have been taken from the connection that no read() has returned yet: they are in this
    /// buffer, or in an SSLStream below. Check this before poll(2): the descriptor does not report such bytes.
    /// @return true if there are; over an SSLStream the next read() may have to wait nevertheless, see
    ///         SSLStream::hasPending()
    bool hasPending() const;

    /// Closes the stream below. Bytes that were read ahead can still be read; bytes that were gathered are not sent.
    /// @throws ...  what the stream below throws
    void close() override;

    /// Sets the deadline of the stream below.
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    /// Sets the deadline of the stream below.
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

    /// Delivers what the buffer holds. Only when it is empty, reads from the stream below.
    /// @param buffer  room for length bytes; borrowed for the call
    /// @return the number of bytes read; 0 at the end of the stream below, and for length 0
    /// @throws ...  what a read of the stream below throws; with flushBeforeRead also what flush() throws
    std::size_t read(char* buffer, std::size_t length) override;

    /// Reads exactly `length` bytes, as InputStream::fill().
    /// @param buffer  room for length bytes; borrowed for the call
    /// @throws StreamIOException  "EOF": the stream ended first; and what read() throws
    void fill(char* buffer, std::size_t length) override;

    /// Gathers the bytes. If they do not fit, sends what was gathered before; if they are longer than the buffer, sends
    /// them too.
    /// @param buffer  length bytes; borrowed for the call
    /// @throws ...  what a write of the stream below throws. What was gathered is dropped then, and these bytes are not
    ///              gathered.
    void write(const char* buffer, std::size_t length) override;

private:
    struct Buffer;

    BufferedStream(std::unique_ptr<Stream>&& owned, Stream& stream, const Options& options);

    void pReadAhead(std::size_t needed);

    const std::unique_ptr<Stream> mOwned; // null: borrowed
    Stream& mStream;
    const SSLStream* const mTls; // the stream below, if it is one; otherwise null
    const bool mFlushBeforeRead;
    // Blocks of their own, so that the reader and the writer share no cache line.
    const std::unique_ptr<Buffer> mInbound;
    const std::unique_ptr<Buffer> mOutbound;
};

} // namespace qel
