#include "support/MemoryStreamPair.hpp"

#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <limits>
#include <mutex>
#include <stdexcept>
#include <utility>

namespace qel::test {

namespace {

constexpr std::size_t kNever = std::numeric_limits<std::size_t>::max();
constexpr std::chrono::milliseconds kPatience{60000};

/// A position and what read() or write() throws there.
struct Failure {
    std::size_t position = kNever;
    std::exception_ptr exception;
};

/// One side: its script, its records and the bytes that have arrived. Guarded by the mutex of the connection.
struct EndState {
    explicit EndState(std::size_t capacity) : arrived(capacity) {}

    // The bytes that have arrived: a ring, so that a transfer does not allocate.
    std::vector<char> arrived;
    std::size_t first = 0;
    std::size_t count = 0;

    bool taken = false;
    bool closed = false;
    bool destroyed = false;
    bool readsStalled = false;
    bool writesStalled = false;
    std::size_t atMost = kNever;
    std::size_t readEnd = kNever;
    Failure readFailure;
    Failure writeFailure;
    std::exception_ptr closeFailure;

    std::size_t bytesRead = 0;
    std::size_t bytesWritten = 0;
    unsigned readersWaiting = 0;
    unsigned writersWaiting = 0;
    unsigned closeCount = 0;
    bool recording = false;
    std::vector<std::size_t> reads;
    std::vector<std::size_t> writes;
    std::string written;
};

void put(EndState& target, const char* buffer, std::size_t length)
{
    for (std::size_t done = 0; done < length;) {
        const std::size_t at = (target.first + target.count) % target.arrived.size();
        const std::size_t piece = std::min(length - done, target.arrived.size() - at);
        std::copy_n(buffer + done, piece, target.arrived.data() + at);
        target.count += piece;
        done += piece;
    }
}

void take(EndState& source, char* buffer, std::size_t length)
{
    for (std::size_t done = 0; done < length;) {
        const std::size_t piece = std::min(length - done, source.arrived.size() - source.first);
        std::copy_n(source.arrived.data() + source.first, piece, buffer + done);
        source.first = (source.first + piece) % source.arrived.size();
        source.count -= piece;
        done += piece;
    }
}

} // namespace

struct MemoryConnection {
    explicit MemoryConnection(std::size_t capacity) : ends{EndState(capacity), EndState(capacity)} {}

    std::mutex mutex;
    std::condition_variable changed;
    EndState ends[2];
};

namespace {

using Lock = std::unique_lock<std::mutex>;

class MemoryStream : public Stream {
public:
    MemoryStream(std::shared_ptr<MemoryConnection> connection, std::size_t index)
        : mConnection(std::move(connection)), mOwn(mConnection->ends[index]), mPeer(mConnection->ends[1 - index])
    {}

    ~MemoryStream() override
    {
        const Lock lock(mConnection->mutex);
        mOwn.closed = true;
        mOwn.destroyed = true;
        mConnection->changed.notify_all();
    }

    void close() override
    {
        const Lock lock(mConnection->mutex);
        mOwn.closed = true;
        ++mOwn.closeCount;
        mConnection->changed.notify_all();
        if (mOwn.closeFailure != nullptr) std::rethrow_exception(mOwn.closeFailure);
    }

    void setReadDeadline(std::chrono::milliseconds timeout) override { mReadDeadline = timeout; }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mWriteDeadline = timeout; }

    std::size_t read(char* buffer, std::size_t length) override
    {
        Lock lock(mConnection->mutex);
        if (mOwn.recording) mOwn.reads.push_back(length);
        pWait(lock, mReadDeadline, mOwn.readersWaiting, [this] { return pReadable(); });
        if (mOwn.bytesRead >= mOwn.readFailure.position) std::rethrow_exception(mOwn.readFailure.exception);
        const std::size_t end = std::min(mOwn.readFailure.position, mOwn.readEnd);
        const std::size_t left = end > mOwn.bytesRead ? end - mOwn.bytesRead : 0;
        const std::size_t count = std::min({length, left, mOwn.count, mOwn.atMost});
        take(mOwn, buffer, count);
        mOwn.bytesRead += count;
        mConnection->changed.notify_all();
        return count;
    }

    void write(const char* buffer, std::size_t length) override
    {
        Lock lock(mConnection->mutex);
        if (mOwn.recording) {
            mOwn.writes.push_back(length);
            mOwn.written.append(buffer, length);
        }
        while (length > 0) {
            pWait(lock, mWriteDeadline, mOwn.writersWaiting, [this] { return pWritable(); });
            const std::size_t count = pWriteSome(buffer, length);
            buffer += count;
            length -= count;
        }
    }

private:
    template <typename Ready>
    void pWait(Lock& lock, StreamDeadline& deadline, unsigned& waiting, const Ready& ready)
    {
        const std::chrono::milliseconds timeout = deadline.getEffectiveTimeout();
        if (ready()) return;
        ++waiting;
        mConnection->changed.notify_all();
        const bool unlimited = timeout == StreamDeadline::Infinite;
        const bool inTime = mConnection->changed.wait_for(lock, unlimited ? kPatience : timeout, ready);
        --waiting;
        if (inTime) return;
        if (unlimited) throw std::runtime_error("memory stream: nothing happens");
        throw StreamIOException("memory stream deadline");
    }

    bool pReadable() const
    {
        if (mOwn.closed) return true;
        if (mOwn.readsStalled) return false;
        return mOwn.count > 0 || mPeer.closed || mOwn.bytesRead >= std::min(mOwn.readFailure.position, mOwn.readEnd);
    }

    bool pWritable() const
    {
        if (mOwn.closed || mPeer.destroyed) return true;
        if (mOwn.writesStalled) return false;
        return mPeer.closed || mPeer.count < mPeer.arrived.size() || mOwn.bytesWritten >= mOwn.writeFailure.position;
    }

    std::size_t pWriteSome(const char* buffer, std::size_t length)
    {
        if (mOwn.closed) throw StreamIOException("memory stream closed");
        if (mOwn.bytesWritten >= mOwn.writeFailure.position) std::rethrow_exception(mOwn.writeFailure.exception);
        if (mPeer.destroyed) throw StreamIOException("memory stream: the peer has gone");
        std::size_t count = std::min(length, mOwn.writeFailure.position - mOwn.bytesWritten);
        if (!mPeer.closed) {
            count = std::min(count, mPeer.arrived.size() - mPeer.count);
            put(mPeer, buffer, count);
        }
        mOwn.bytesWritten += count;
        mConnection->changed.notify_all();
        return count;
    }

    const std::shared_ptr<MemoryConnection> mConnection;
    EndState& mOwn;
    EndState& mPeer;
    StreamDeadline mReadDeadline;
    StreamDeadline mWriteDeadline;
};

std::unique_ptr<Stream> takeStream(const std::shared_ptr<MemoryConnection>& connection, std::size_t index)
{
    const Lock lock(connection->mutex);
    if (connection->ends[index].taken) throw std::logic_error("this end has been taken already");
    connection->ends[index].taken = true;
    return std::make_unique<MemoryStream>(connection, index);
}

/// The state of one side, locked for a statement or block.
class Locked {
public:
    Locked(MemoryConnection& connection, std::size_t index)
        : mLock(connection.mutex), mConnection(connection), mEnd(connection.ends[index])
    {}
    ~Locked() { mConnection.changed.notify_all(); }
    Locked(const Locked&) = delete;
    Locked& operator=(const Locked&) = delete;

    EndState* operator->() { return &mEnd; }
    EndState& operator*() { return mEnd; }

    template <typename Ready>
    void await(const char* what, const Ready& ready)
    {
        if (!mConnection.changed.wait_for(mLock, kPatience, ready)) throw std::runtime_error(what);
    }

private:
    Lock mLock;
    MemoryConnection& mConnection;
    EndState& mEnd;
};

} // namespace

MemoryStreamEnd::MemoryStreamEnd(std::shared_ptr<MemoryConnection> connection, std::size_t index)
    : mConnection(std::move(connection)), mIndex(index)
{}

void MemoryStreamEnd::deliverAtMost(std::size_t bytes)
{
    if (bytes == 0) throw std::logic_error("a read() of no bytes is the end of the stream");
    Locked(*mConnection, mIndex)->atMost = bytes;
}

void MemoryStreamEnd::endReadAt(std::size_t position) { Locked(*mConnection, mIndex)->readEnd = position; }

void MemoryStreamEnd::failReadAt(std::size_t position, std::exception_ptr failure)
{
    Locked(*mConnection, mIndex)->readFailure = {position, std::move(failure)};
}

void MemoryStreamEnd::failWriteAt(std::size_t position, std::exception_ptr failure)
{
    Locked(*mConnection, mIndex)->writeFailure = {position, std::move(failure)};
}

void MemoryStreamEnd::failClose(std::exception_ptr failure)
{
    Locked(*mConnection, mIndex)->closeFailure = std::move(failure);
}

void MemoryStreamEnd::stallReads() { Locked(*mConnection, mIndex)->readsStalled = true; }

void MemoryStreamEnd::stallWrites() { Locked(*mConnection, mIndex)->writesStalled = true; }

void MemoryStreamEnd::resume()
{
    Locked end(*mConnection, mIndex);
    end->readsStalled = false;
    end->writesStalled = false;
}

void MemoryStreamEnd::deliver(const std::string& bytes)
{
    Locked end(*mConnection, mIndex);
    if (bytes.size() > end->arrived.size() - end->count) throw std::logic_error("too much to deliver");
    put(*end, bytes.data(), bytes.size());
}

void MemoryStreamEnd::awaitReader()
{
    Locked end(*mConnection, mIndex);
    end.await("no thread waits in read()", [&end] { return end->readersWaiting > 0; });
}

void MemoryStreamEnd::awaitWriter()
{
    Locked end(*mConnection, mIndex);
    end.await("no thread waits in write()", [&end] { return end->writersWaiting > 0; });
}

std::size_t MemoryStreamEnd::bytesRead() const { return Locked(*mConnection, mIndex)->bytesRead; }

std::size_t MemoryStreamEnd::bytesWritten() const { return Locked(*mConnection, mIndex)->bytesWritten; }

std::size_t MemoryStreamEnd::bytesLeft() const { return Locked(*mConnection, mIndex)->count; }

unsigned MemoryStreamEnd::closeCount() const { return Locked(*mConnection, mIndex)->closeCount; }

bool MemoryStreamEnd::destroyed() const { return Locked(*mConnection, mIndex)->destroyed; }

void MemoryStreamEnd::record() { Locked(*mConnection, mIndex)->recording = true; }

std::vector<std::size_t> MemoryStreamEnd::reads() const { return Locked(*mConnection, mIndex)->reads; }

std::vector<std::size_t> MemoryStreamEnd::writes() const { return Locked(*mConnection, mIndex)->writes; }

std::string MemoryStreamEnd::written() const { return Locked(*mConnection, mIndex)->written; }

MemoryStreamPair::MemoryStreamPair(std::size_t capacity)
    : mConnection(std::make_shared<MemoryConnection>(capacity)), mClient(mConnection, 0), mServer(mConnection, 1)
{}

std::unique_ptr<Stream> MemoryStreamPair::takeClient() { return takeStream(mConnection, 0); }

std::unique_ptr<Stream> MemoryStreamPair::takeServer() { return takeStream(mConnection, 1); }

} // namespace qel::test
