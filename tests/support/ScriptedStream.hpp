#pragma once

#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>
#include <deque>
#include <limits>
#include <string>
#include <vector>

namespace qel::test {

/// A stream that follows a script of the test and records its calls.
///
/// Input: read() performs the steps in the order in which they were added. One read() returns bytes of one chunk only,
/// so a chunk is a short read; the next read() continues with the rest of the chunk.
///
///     ScriptedStream stream;
///     stream.deliver(first3Bytes).deliver(theRest).end();
///
/// A read() beyond the script is a mistake of the test or of the code under test and throws std::logic_error: a real
/// stream would hang there.
///
/// Output: write() records each call; failWriteAt() makes it fail after a number of bytes.
///
/// Thread safety: one thread at a time.
class ScriptedStream : public Stream {
public:
    using Bytes = std::vector<char>;

    ScriptedStream();
    ~ScriptedStream() override;

    // The script of the input side. Each returns *this.

    /// Adds a chunk. @throws std::logic_error  it is empty, which would read as end of stream
    ScriptedStream& deliver(Bytes chunk);
    /// Adds the bytes as chunks of one byte each.
    ScriptedStream& deliverOneByOne(const Bytes& bytes);
    /// From here on every read() returns 0.
    ScriptedStream& end();
    /// One read() throws StreamIOException(text); the script continues after it.
    ScriptedStream& fail(std::string text);

    // The output side.

    /// The write() that contains byte number `position` (from 0, over all writes) records the bytes before it and
    /// throws StreamIOException(text); every later write() throws, unless it is empty.
    /// @throws std::logic_error  that byte was already written
    ScriptedStream& failWriteAt(std::size_t position, std::string text);

    // The record.

    /// The lengths of the calls of read(), in order.
    const std::vector<std::size_t>& reads() const { return mReads; }
    /// The lengths of the calls of fill(), in order.
    const std::vector<std::size_t>& fills() const { return mFills; }
    /// The number of bytes that read() has returned.
    std::size_t bytesRead() const { return mBytesRead; }
    /// The number of bytes of the script not read yet.
    std::size_t bytesLeft() const;
    /// The bytes that each call of write() wrote, in order; of a call that failed, those before the failure.
    const std::vector<Bytes>& writes() const { return mWrites; }
    /// All bytes written.
    Bytes written() const;
    const std::vector<std::chrono::milliseconds>& readDeadlines() const { return mReadDeadlines; }
    const std::vector<std::chrono::milliseconds>& writeDeadlines() const { return mWriteDeadlines; }
    /// The number of calls of close().
    unsigned closeCount() const { return mCloseCount; }

    // The stream itself. After close() reading and writing throw StreamIOException("closed").

    void close() override;
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    std::size_t read(char* buffer, std::size_t length) override;
    void fill(char* buffer, std::size_t length) override;
    void setWriteDeadline(std::chrono::milliseconds timeout) override;
    void write(const char* buffer, std::size_t length) override;

private:
    struct Step {
        enum Kind { Chunk, End, Failure };
        Kind kind;
        Bytes bytes;      // Chunk
        std::string text; // Failure
    };

    void pThrowIfClosed() const;

    std::deque<Step> mScript;
    std::size_t mBytesRead = 0;
    std::size_t mBytesWritten = 0;
    std::size_t mWriteLimit = std::numeric_limits<std::size_t>::max();
    std::string mWriteFailure;
    std::vector<std::size_t> mReads;
    std::vector<std::size_t> mFills;
    std::vector<Bytes> mWrites;
    std::vector<std::chrono::milliseconds> mReadDeadlines;
    std::vector<std::chrono::milliseconds> mWriteDeadlines;
    unsigned mCloseCount = 0;
};

} // namespace qel::test
