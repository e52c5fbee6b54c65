#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>
#include <cstddef>

namespace qel {

/// What both directions of a byte stream share: it can be closed and destroyed.
///
/// A Stream has exactly one StreamBase, inherited virtually; going from a StreamBase back to the stream takes a
/// dynamic_cast. Streams have an identity and are not copied.
///
/// Thread safety of every stream, unless a class says otherwise: no locks; one reader thread and one writer thread at a
/// time, each with its own deadline.
class QEL_EXPORT StreamBase {
public:
    virtual ~StreamBase();

    /// Ends both directions. What a later call does, and what close() itself may throw, is the concrete stream's to
    /// say.
    virtual void close() = 0;

    StreamBase(const StreamBase&) = delete;
    StreamBase& operator=(const StreamBase&) = delete;

protected:
    StreamBase() noexcept = default;
};

/// The side of a stream that bytes come from.
class QEL_EXPORT InputStream : public virtual StreamBase {
public:
    ~InputStream() override;

    /// Limits the time that reading may take.
    ///
    /// The time starts to run at the first read after this call, not at this call, and covers all reads that follow
    /// until it is set anew or cleared (see StreamDeadline). Zero polls: the next read does not wait.
    /// @param timeout  relative, in milliseconds; negative (StreamDeadline::Infinite) waits without limit
    /// @throws std::invalid_argument  "Not supported": this stream has no deadlines, which is what the base class says
    virtual void setReadDeadline(std::chrono::milliseconds timeout);

    /// Reads what is there, at least one byte, waiting for it if need be.
    /// @param buffer  takes at most `length` bytes; borrowed for the call
    /// @param length  the room in `buffer`, in bytes
    /// @return the number of bytes read, 1 to `length`; 0 is the end of the stream
    /// @throws StreamIOException  the stream failed, or the read deadline passed
    virtual std::size_t read(char* buffer, std::size_t length) = 0;

    /// Reads exactly `length` bytes, by as many calls of read() as it takes.
    ///
    /// After an exception the first bytes may have arrived in `buffer` and are gone from the stream. No read() at all
    /// is made for a `length` of 0.
    /// @param buffer  has room for `length` bytes; borrowed for the call
    /// @throws StreamIOException  "EOF": the stream ended first; and whatever read() throws
    virtual void fill(char* buffer, std::size_t length);

    /// Lets reads wait without limit again: setReadDeadline(StreamDeadline::Infinite).
    /// @throws std::invalid_argument  as setReadDeadline()
    void clearReadDeadline();

protected:
    InputStream() noexcept = default;
};

/// The side of a stream that bytes go to.
class QEL_EXPORT OutputStream : public virtual StreamBase {
public:
    ~OutputStream() override;

    /// Limits the time that writing may take; the rules are those of InputStream::setReadDeadline().
    /// @param timeout  relative, in milliseconds; negative (StreamDeadline::Infinite) waits without limit
    /// @throws std::invalid_argument  "Not supported": this stream has no deadlines, which is what the base class says
    virtual void setWriteDeadline(std::chrono::milliseconds timeout);

    /// Writes all of `length` bytes, or throws; after an exception nobody can say how many of them went out.
    /// @param buffer  borrowed for the call
    /// @throws StreamIOException  the stream failed, takes no more bytes ("EOF"), or the write deadline passed
    virtual void write(const char* buffer, std::size_t length) = 0;

    /// Lets writes wait without limit again: setWriteDeadline(StreamDeadline::Infinite).
    /// @throws std::invalid_argument  as setWriteDeadline()
    void clearWriteDeadline();

protected:
    OutputStream() noexcept = default;
};

/// A byte stream in both directions.
class QEL_EXPORT Stream : public InputStream, public OutputStream {
public:
    ~Stream() override;

protected:
    Stream() noexcept = default;
};

} // namespace qel
