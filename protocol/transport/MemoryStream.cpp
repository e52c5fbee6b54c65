#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include <algorithm>
#include <chrono>
#include <stdexcept>
#include <string>

namespace qel::protocol {

namespace {

using std::chrono::steady_clock;

/// Bytes in one direction.
class Pipe {
public:
    explicit Pipe(std::size_t capacity) : mCapacity(capacity) {}

    /// Ends this direction: the reader gets what is left, the writer fails.
    void close()
    {
        const MutexLock lock(mMutex);
        mClosed = true;
        mChanged.notifyAll();
    }

    std::size_t read(char* buffer, std::size_t length, StreamDeadline& deadline)
    {
        const auto timeout = deadline.getEffectiveTimeout();
        const auto end = steady_clock::now() + timeout;
        UniqueMutexLock lock(mMutex);
        while (length != 0 && mFirst == mBytes.size() && !mClosed)
            pWait(lock, timeout, end);
        const std::size_t count = std::min(length, mBytes.size() - mFirst);
        std::copy_n(mBytes.data() + mFirst, count, buffer);
        mFirst += count;
        if (mFirst == mBytes.size()) {
            mBytes.clear();
            mFirst = 0;
        }
        mChanged.notifyAll();
        return count;
    }

    void write(const char* buffer, std::size_t length, StreamDeadline& deadline)
    {
        const auto timeout = deadline.getEffectiveTimeout();
        const auto end = steady_clock::now() + timeout;
        UniqueMutexLock lock(mMutex);
        while (length != 0) {
            while (!mClosed && mBytes.size() - mFirst >= mCapacity)
                pWait(lock, timeout, end);
            if (mClosed) throw StreamIOException("EOF");
            mBytes.erase(0, mFirst);
            mFirst = 0;
            const std::size_t count = std::min(length, mCapacity - mBytes.size());
            mBytes.append(buffer, count);
            buffer += count;
            length -= count;
            mChanged.notifyAll();
        }
    }

private:
    void pWait(UniqueMutexLock& lock, std::chrono::milliseconds timeout, steady_clock::time_point end)
        QEL_REQUIRES(mMutex)
    {
        if (timeout == StreamDeadline::Infinite) return mChanged.wait(lock);
        if (steady_clock::now() >= end) throw StreamIOException("I/O deadline");
        static_cast<void>(mChanged.waitUntil(lock, end));
    }

    const std::size_t mCapacity;

    Mutex mMutex; // guards the bytes on their way and whether more can come
    ConditionVariable mChanged;
    std::string mBytes QEL_GUARDED_BY(mMutex);
    std::size_t mFirst QEL_GUARDED_BY(mMutex) = 0; // the first byte that was not read
    bool mClosed QEL_GUARDED_BY(mMutex) = false;
};

class MemoryStream final : public Stream {
public:
    MemoryStream(std::shared_ptr<Pipe> in, std::shared_ptr<Pipe> out) : mIn(std::move(in)), mOut(std::move(out)) {}

    ~MemoryStream() override { pClose(); }

    void close() override { pClose(); }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mReadDeadline = timeout; }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mWriteDeadline = timeout; }
    std::size_t read(char* buffer, std::size_t length) override { return mIn->read(buffer, length, mReadDeadline); }
    void write(const char* buffer, std::size_t length) override { mOut->write(buffer, length, mWriteDeadline); }

private:
    void pClose()
    {
        mIn->close();
        mOut->close();
    }

    const std::shared_ptr<Pipe> mIn;
    const std::shared_ptr<Pipe> mOut;
    StreamDeadline mReadDeadline;
    StreamDeadline mWriteDeadline;
};

} // namespace

std::pair<std::unique_ptr<Stream>, std::unique_ptr<Stream>> makeMemoryStreams(std::size_t capacity)
{
    if (capacity == 0) throw std::invalid_argument("capacity");
    const auto there = std::make_shared<Pipe>(capacity);
    const auto back = std::make_shared<Pipe>(capacity);
    return {std::make_unique<MemoryStream>(back, there), std::make_unique<MemoryStream>(there, back)};
}

} // namespace qel::protocol
