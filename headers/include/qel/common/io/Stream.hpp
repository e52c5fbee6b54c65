#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>
#include <cstddef>

namespace qel {

/// The common base of both directions of a byte stream: it can be closed and destroyed.
///
/// A Stream has one StreamBase, inherited virtually; use dynamic_cast to get from a StreamBase to the stream. Streams
/// are not copied.
///
/// Thread safety of every stream, unless its class says otherwise: no locks; one reader thread and one writer thread at
/// a time, each with a deadline of its own.
class QEL_EXPORT StreamBase {
public:
    virtual ~StreamBase();

    /// Ends both directions. The concrete stream documents what later calls do and what close() throws.
    virtual void close() = 0;

    StreamBase(const StreamBase&) = delete;
    StreamBase& operator=(const StreamBase&) = delete;

protected:
    StreamBase() noexcept = default;
};

/// The reading side of a byte stream.
/// Thread safety: one reader thread at a time; see StreamBase.
class QEL_EXPORT InputStream : public virtual StreamBase {
public:
    ~InputStream() override;

    /// Limits the time of all following reads together.
    ///
    /// The time starts at the first read after this call, not at this call, and runs until a timeout is set again or
    /// cleared (see StreamDeadline). Zero polls: the next read does not wait.
    /// @param timeout  negative (StreamDeadline::Infinite): no limit
    /// @throws std::invalid_argument  "Not supported": this stream has no deadlines, as in this base class
    virtual void setReadDeadline(std::chrono::milliseconds timeout);

    /// Waits until at least one byte has arrived, and reads what has.
    /// @param buffer  room for `length` bytes; borrowed for the call
    /// @return the number of bytes read, in [1, length]; 0 at end of stream
    /// @throws StreamIOException  the stream failed, or the read deadline passed
    virtual std::size_t read(char* buffer, std::size_t length) = 0;

    /// Reads exactly `length` bytes, with as many calls of read() as necessary; none for a `length` of 0.
    ///
    /// After an exception `buffer` may hold the first bytes, which the stream does not deliver again.
    /// @param buffer  room for `length` bytes; borrowed for the call
    /// @throws StreamIOException  "EOF": the stream ended first; and what read() throws
    virtual void fill(char* buffer, std::size_t length);

    /// Removes the limit: setReadDeadline(StreamDeadline::Infinite).
    /// @throws std::invalid_argument  as setReadDeadline()
    void clearReadDeadline();

protected:
    InputStream() noexcept = default;
};

/// The writing side of a byte stream.
/// Thread safety: one writer thread at a time; see StreamBase.
class QEL_EXPORT OutputStream : public virtual StreamBase {
public:
    ~OutputStream() override;

    /// Limits the time of all following writes together, by the rules of InputStream::setReadDeadline().
    /// @param timeout  negative (StreamDeadline::Infinite): no limit
    /// @throws std::invalid_argument  "Not supported": this stream has no deadlines, as in this base class
    virtual void setWriteDeadline(std::chrono::milliseconds timeout);

    /// Writes all bytes. After an exception it is unknown how many of them were sent.
    /// @param buffer  `length` bytes; borrowed for the call
    /// @throws StreamIOException  the stream failed, accepts no more bytes ("EOF"), or the write deadline passed
    virtual void write(const char* buffer, std::size_t length) = 0;

    /// Removes the limit: setWriteDeadline(StreamDeadline::Infinite).
    /// @throws std::invalid_argument  as setWriteDeadline()
    void clearWriteDeadline();

protected:
    OutputStream() noexcept = default;
};

/// A byte stream in both directions.
/// Thread safety: see StreamBase.
class QEL_EXPORT Stream : public InputStream, public OutputStream {
public:
    ~Stream() override;

protected:
    Stream() noexcept = default;
};

} // namespace qel
