#pragma once

#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>
#include <deque>
#include <limits>
#include <string>
#include <vector>

namespace qel::test {

/// A stream that does what the test wrote into its script, and remembers what was asked of it.
///
/// Input: read() plays the steps in the order in which they were added. One read() never goes beyond one delivered
/// chunk, so a chunk is a short read; what a read() leaves of a chunk is there for the next one.
///
///     ScriptedStream stream;
///     stream.deliver(first3Bytes).deliver(theRest).end();
///
/// A read() beyond the script is a mistake of the test or of the code under test and throws std::logic_error: a real
/// stream would hang there.
///
/// Output: write() records whole calls; failWriteAt() makes it break after a number of bytes.
///
/// Not for several threads at once.
class ScriptedStream : public Stream {
public:
    using Bytes = std::vector<char>;

    ScriptedStream();
    ~ScriptedStream() override;

    // The script of the input side. Each returns *this.

    /// Adds one chunk; an empty one would read as the end of the stream and is refused with std::logic_error.
    ScriptedStream& deliver(Bytes chunk);
    /// Adds the bytes as chunks of one byte each.
    ScriptedStream& deliverOneByOne(const Bytes& bytes);
    /// From here on every read() returns 0.
    ScriptedStream& end();
    /// One read() throws StreamIOException(text); the script goes on behind it.
    ScriptedStream& fail(std::string text);

    // The output side.

    /// The write() that would carry byte number `position` (from 0, over all writes) records the bytes before it and
    /// throws StreamIOException(text), and so does every later one; an empty write() carries no byte and goes through.
    /// A position that has been passed already is refused with std::logic_error.
    ScriptedStream& failWriteAt(std::size_t position, std::string text);

    // What was asked.

    /// The lengths that the calls of read() asked for, in order.
    const std::vector<std::size_t>& reads() const { return mReads; }
    /// The lengths that the calls of fill() asked for, in order.
    const std::vector<std::size_t>& fills() const { return mFills; }
    /// The bytes that read() has handed out so far.
    std::size_t bytesRead() const { return mBytesRead; }
    /// The delivered bytes that nobody has read yet.
    std::size_t bytesLeft() const;
    /// What each call of write() brought through, in order; a call that failed stands with the part that went out.
    const std::vector<Bytes>& writes() const { return mWrites; }
    /// All bytes that were written, in one piece.
    Bytes written() const;
    const std::vector<std::chrono::milliseconds>& readDeadlines() const { return mReadDeadlines; }
    const std::vector<std::chrono::milliseconds>& writeDeadlines() const { return mWriteDeadlines; }
    /// How often close() was called.
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
