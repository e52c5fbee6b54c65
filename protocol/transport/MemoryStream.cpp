#include <qel/common/QelMessage.hpp>
#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include "transport/Readiness.hpp"

#include <algorithm>
#include <array>
#include <chrono>
#include <stdexcept>
#include <string>

namespace qel::protocol {

namespace {

using std::chrono::steady_clock;

/// @param timeout  any; so long that nobody sees the end of it is cut to what the clock can hold
steady_clock::time_point endOf(std::chrono::milliseconds timeout)
{
    constexpr std::chrono::milliseconds kLongest = std::chrono::hours(24 * 365 * 100);
    return steady_clock::now() + std::min(timeout, kLongest);
}

/// A console sends a message at once when there is room for it, with what TLS adds.
constexpr std::size_t kWholeMessage = QelMessage::MtuMax + 1024;

/// The bytes on their way between two ends, 0 and 1. Each direction has the number of the end that reads from it.
class Link {
public:
    explicit Link(std::size_t capacity) : mCapacity(capacity) {}

    /// Ends both directions: the readers get what is left, the writers fail.
    void close()
    {
        const MutexLock lock(mMutex);
        mClosed = true;
        mChanged.notifyAll();
    }

    /// Ends the direction in which this end writes.
    void endOutput(std::size_t self)
    {
        const MutexLock lock(mMutex);
        mBytes[1 - self].hasEnded = true;
        mChanged.notifyAll();
    }

    std::size_t read(std::size_t self, char* buffer, std::size_t length, StreamDeadline& deadline)
    {
        const auto timeout = deadline.getEffectiveTimeout();
        const auto end = endOf(timeout);
        UniqueMutexLock lock(mMutex);
        Bytes& bytes = mBytes[self];
        while (length != 0 && bytes.size() == 0 && !bytes.hasEnded && !mClosed)
            pWait(lock, timeout, end);
        const std::size_t count = std::min(length, bytes.size());
        std::copy_n(bytes.text.data() + bytes.first, count, buffer);
        bytes.first += count;
        if (bytes.size() == 0) {
            bytes.text.clear();
            bytes.first = 0;
        }
        mChanged.notifyAll();
        return count;
    }

    void write(std::size_t self, const char* buffer, std::size_t length, StreamDeadline& deadline)
    {
        const auto timeout = deadline.getEffectiveTimeout();
        const auto end = endOf(timeout);
        UniqueMutexLock lock(mMutex);
        Bytes& bytes = mBytes[1 - self];
        while (length != 0) {
            while (!mClosed && !bytes.hasEnded && bytes.size() >= mCapacity)
                pWait(lock, timeout, end);
            if (mClosed || bytes.hasEnded) throw StreamIOException("EOF");
            bytes.text.erase(0, bytes.first);
            bytes.first = 0;
            const std::size_t count = std::min(length, mCapacity - bytes.text.size());
            bytes.text.append(buffer, count);
            buffer += count;
            length -= count;
            mChanged.notifyAll();
        }
    }

    /// As Readiness.
    Ready awaitReady(std::size_t self, bool wantsToReceive, std::chrono::milliseconds timeout)
    {
        const bool isLimited = timeout >= std::chrono::milliseconds::zero();
        const auto end = endOf(timeout);
        UniqueMutexLock lock(mMutex);
        for (;;) {
            const std::size_t room = mCapacity - mBytes[1 - self].size();
            const Ready ready{mClosed || room >= std::min(mCapacity, kWholeMessage),
                              wantsToReceive && (mClosed || mBytes[self].hasEnded || mBytes[self].size() != 0)};
            if (ready.send || ready.receive) return ready;
            if (!isLimited) {
                mChanged.wait(lock);
            } else if (steady_clock::now() >= end) {
                return ready;
            } else {
                static_cast<void>(mChanged.waitUntil(lock, end));
            }
        }
    }

private:
    struct Bytes {
        std::size_t size() const { return text.size() - first; }

        std::string text;
        std::size_t first = 0; // the first byte that was not read
        bool hasEnded = false; // no more will be written
    };

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
    std::array<Bytes, 2> mBytes QEL_GUARDED_BY(mMutex);
    bool mClosed QEL_GUARDED_BY(mMutex) = false;
};

class MemoryStream final : public Stream, public Readiness {
public:
    MemoryStream(std::shared_ptr<Link> link, std::size_t self) : mLink(std::move(link)), mSelf(self) {}

    ~MemoryStream() override { mLink->close(); }

    void close() override { mLink->close(); }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mReadDeadline = timeout; }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mWriteDeadline = timeout; }
    std::size_t read(char* buffer, std::size_t length) override
    {
        return mLink->read(mSelf, buffer, length, mReadDeadline);
    }
    void write(const char* buffer, std::size_t length) override { mLink->write(mSelf, buffer, length, mWriteDeadline); }
    Ready awaitReady(bool wantsToReceive, std::chrono::milliseconds timeout) override
    {
        return mLink->awaitReady(mSelf, wantsToReceive, timeout);
    }
    void endOutput() noexcept override { mLink->endOutput(mSelf); }

private:
    const std::shared_ptr<Link> mLink;
    const std::size_t mSelf; // 0 or 1
    StreamDeadline mReadDeadline;
    StreamDeadline mWriteDeadline;
};

} // namespace

std::pair<std::unique_ptr<Stream>, std::unique_ptr<Stream>> makeMemoryStreams(std::size_t capacity)
{
    if (capacity == 0) throw std::invalid_argument("capacity");
    const auto link = std::make_shared<Link>(capacity);
    return {std::make_unique<MemoryStream>(link, 0), std::make_unique<MemoryStream>(link, 1)};
}

} // namespace qel::protocol
