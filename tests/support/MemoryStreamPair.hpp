#pragma once

#include <qel/common/io/Stream.hpp>

#include <cstddef>
#include <exception>
#include <memory>
#include <string>
#include <vector>

namespace qel::test {

struct MemoryConnection;

/// Controls and observes one side of a MemoryStreamPair while the code under test owns the stream. Positions count the
/// bytes that have passed through this side in that direction, from 0.
/// Thread safety: everything from any thread at any time.
class MemoryStreamEnd {
public:
    MemoryStreamEnd(std::shared_ptr<MemoryConnection> connection, std::size_t index);

    // Control.

    /// Every read() delivers at most so many bytes.
    void deliverAtMost(std::size_t bytes);
    /// read() returns 0 from this position on.
    void endReadAt(std::size_t position);
    /// read() delivers the bytes before the position, then throws.
    void failReadAt(std::size_t position, std::exception_ptr failure);
    /// The write() that contains this byte sends the bytes before it and throws; every later write() throws.
    void failWriteAt(std::size_t position, std::exception_ptr failure);
    /// close() closes and then throws.
    void failClose(std::exception_ptr failure);
    /// read() waits as if nothing had arrived, until resume().
    void stallReads();
    /// write() waits as if there were no room, until resume().
    void stallWrites();
    void resume();

    /// Appends bytes to those that have arrived, as if the peer had written them.
    /// @throws std::logic_error  there is no room for them
    void deliver(const std::string& bytes);

    // Observation.

    /// Waits until a thread waits in read(). @throws std::runtime_error  no thread does for a long time
    void awaitReader();
    /// Waits until a thread waits in write(). @throws std::runtime_error  no thread does for a long time
    void awaitWriter();
    std::size_t bytesRead() const;
    std::size_t bytesWritten() const;
    /// The bytes that have arrived and were not read.
    std::size_t bytesLeft() const;
    unsigned closeCount() const;
    /// @return whether the stream has been destroyed
    bool destroyed() const;

    /// Records all calls of read() and write() from now on.
    void record();
    /// The room that each call of read() offered.
    std::vector<std::size_t> reads() const;
    /// The lengths of the calls of write().
    std::vector<std::size_t> writes() const;
    /// All bytes that were written.
    std::string written() const;

private:
    std::shared_ptr<MemoryConnection> mConnection;
    std::size_t mIndex;
};

/// A connection inside this process: two streams, each of which reads what the other writes. A write waits while the
/// peer has too many unread bytes. Both have deadlines (StreamDeadline); one that passes during a wait throws
/// StreamIOException("memory stream deadline").
///
/// close() works like the shutdown of a socket: this side reads what has already arrived and then 0, and its writes
/// throw StreamIOException("memory stream closed"); the peer reads what has been sent and then 0, and what it writes is
/// lost. Once a stream is destroyed, writes of the peer throw StreamIOException("memory stream: the peer has gone").
///
/// Thread safety of the streams: that of every stream, and close() from any thread.
class MemoryStreamPair {
public:
    /// @param capacity  limit of unread bytes in each direction
    explicit MemoryStreamPair(std::size_t capacity = 65536);

    /// Each stream can be taken once. The connection lives as long as any part of it is held.
    std::unique_ptr<Stream> takeClient();
    std::unique_ptr<Stream> takeServer();

    MemoryStreamEnd& client() { return mClient; }
    MemoryStreamEnd& server() { return mServer; }

private:
    std::shared_ptr<MemoryConnection> mConnection;
    MemoryStreamEnd mClient;
    MemoryStreamEnd mServer;
};

} // namespace qel::test
