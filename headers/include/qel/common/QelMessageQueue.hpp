#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageQueuingOptions.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageQueueStatistics.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <ostream>
#include <queue>

namespace qel {

/// A first-in, first-out queue of messages between any number of producer and consumer threads. It limits the bytes
/// that are pending and keeps statistics.
///
/// Priority affects admission only; messages leave in the order in which they came. A message of normal priority is
/// admitted while the pending bytes are below the limit, one of low priority while they are below half of it. The size
/// of the new message does not count: a message larger than the limit is admitted while there is any room. So at most
/// one byte less than the limit plus one message is pending.
///
/// A message taken out wakes at most one blocked producer of each priority, and only if the limit of that priority then
/// admits a message. Further producers are woken by further messages.
///
/// Lifetime: owns the messages in it, and destroys those that were not taken. Destroy the queue after every call of its
/// operations has returned: shut it down and join the threads that use it.
/// Thread safety: any thread may call any operation but the destructor. One lock guards everything. The log lines of a
/// blocked producer and of shutdown(), and the output of dumpStatistics(), are written with the lock held: neither a
/// log back-end nor the output stream may use the queue, and all threads wait while one of them is slow.
///
/// Clock: enqueue() reads TimeProvider::steady() when it is called, when the message is admitted, and a third time if
/// the queue was empty. waitForMsg() reads it twice for each message, and more often while messages are slow (see
/// QelMessageLatencyEvents). The timeout of waitForMsg() is measured on the real clock.
class QEL_EXPORT QelMessageQueue {
public:
    /// The result of enqueue().
    enum ReturnCode {
        OK = 0,       ///< queued
        SHUTDOWN = 1, ///< not queued: the queue is shut down
        DROPPED = 2   ///< not queued and counted as dropped: the queue is over its limit
    };

    /// @param sizeLimit  the limit of normal priority in pending bytes; that of low priority is half of it, rounded up.
    ///                   0: no limits
    /// @throws std::bad_alloc
    explicit QelMessageQueue(std::size_t sizeLimit);

    /// Destroys the messages that were not taken. No thread may be in a call of this object.
    ~QelMessageQueue();

    QelMessageQueue(const QelMessageQueue&) = delete;
    QelMessageQueue& operator=(const QelMessageQueue&) = delete;

    /// Appends a message.
    /// @param message  not null; destroyed if the result is not OK
    /// @param options  with BLOCKING the call waits for room without limit
    /// @throws std::invalid_argument  "message": it is null
    /// @throws std::bad_alloc and what a substituted clock throws; the queue is unchanged and the message destroyed
    ReturnCode enqueue(std::unique_ptr<QelMessage> message,
                       MessageQueuingOptions options = MessageQueuingOptions::DEFAULT);

    /// @param options  BLOCKING changes nothing here
    /// @return whether enqueue() would admit a message of this priority now, of whatever length. The answer stays true
    ///         until a message is added, and stays false until one is taken
    bool hasRoom(MessageQueuingOptions options = MessageQueuingOptions::DEFAULT) const;

    /// Takes the first message, and waits for one if the queue is empty.
    /// @param timeout  how long to wait; zero or less: does not wait; milliseconds::max(), and any timeout of more than
    ///                 a hundred years: no limit
    /// @return the message, owned by the caller; null when the time has passed without one, and at once when the queue
    ///         is shut down, even if it holds messages
    /// @throws what a substituted clock throws; the message stays in the queue
    std::unique_ptr<QelMessage> waitForMsg(const std::chrono::milliseconds& timeout);

    /// Shuts the queue down for good. Waiting producers and consumers return now, later calls return at once, and the
    /// messages in the queue stay there until it is destroyed. Further calls have no effect.
    /// Does not throw.
    void shutdown();

    /// @return whether shutdown() has been called; takes no lock
    bool isShutdown() const noexcept { return mShutdown; }

    /// @return the statistics of this moment: a copy, which takes the lock for a moment
    QelMessageQueueStatistics getStatistics() const;

    /// Prints the limits, low priority first, and then the statistics, all of the same moment. Producers and consumers
    /// wait meanwhile: if the stream may be slow, print into a string first.
    /// @param os      borrowed for the call; left in the state that QelMessageQueueStatistics::dump() describes
    /// @param indent  printed before every line
    /// @throws std::bad_alloc, what a substituted clock throws, and what the stream throws if its exceptions() are set;
    /// part of the text may have been printed
    void dumpStatistics(std::ostream& os, const Indent& indent) const;

private:
    /// A program that checks the queue between the steps of its threads; see docs/threading.md.
    friend class QelMessageQueueInspector;

    struct QueueEntry {
        std::unique_ptr<QelMessage> mMessage;
        std::chrono::steady_clock::time_point mStartTime; // of the call of enqueue()
    };

    /// The messages in order. A failed enqueue() removes the last entry, which std::queue does not offer.
    struct Fifo : std::queue<QueueEntry> {
        void popBack() { c.pop_back(); }
    };

    /// Threads that wait for one condition, and how many of them have been claimed: chosen with the lock held, to be
    /// woken after it is released. Without waiting threads nothing is notified, because a notification costs more than
    /// the rest of a short critical section (measured).
    ///
    /// As many threads as are claimed are about to check their condition, or will be after the wakeOne() that follows
    /// each claim. A thread that returns from a wait without a wakeOne() counts as one of them, so at worst one thread
    /// too many is woken.
    ///
    /// A wait may end spuriously. Everything but wakeOne() and wakeAll() needs the queue's lock.
    class Waiters {
    public:
        /// Releases the lock, sleeps until woken, and takes the lock again.
        void wait(UniqueMutexLock& lock)
        {
            ++mWaiting;
            mCondition.wait(lock);
            pLeave();
        }

        /// As wait(), but not beyond the given time. @return false when the time has passed
        bool waitUntil(UniqueMutexLock& lock, std::chrono::steady_clock::time_point deadline)
        {
            ++mWaiting;
            const bool inTime = mCondition.waitUntil(lock, deadline);
            pLeave();
            return inTime;
        }

        /// @return whether a thread is to be woken; if so, the caller must call wakeOne(), with or without the lock
        bool claimOne() noexcept
        {
            if (mWaiting == mClaimed) return false;
            ++mClaimed;
            return true;
        }

        /// Wakes the claimed thread, or another one in its place.
        void wakeOne() noexcept { mCondition.notifyOne(); }

        /// Wakes all waiting threads, claimed or not.
        void wakeAll() noexcept { mCondition.notifyAll(); }

    private:
        friend class QelMessageQueueInspector;

        void pLeave() noexcept
        {
            --mWaiting;
            if (mClaimed != 0) --mClaimed;
        }

        ConditionVariable mCondition;
        std::size_t mWaiting = 0; // threads in a wait
        std::size_t mClaimed = 0; // never more than mWaiting
    };

    /// The limit of one priority, and the producers that wait for room. Guarded by the queue's lock.
    class RateLimiter {
    public:
        explicit RateLimiter(std::uint64_t sizeLimit) noexcept : mSizeLimit(sizeLimit) {}

        std::uint64_t getSizeLimit() const noexcept { return mSizeLimit; }
        bool canEnqueue(std::uint64_t pendingBytes) const noexcept
        {
            return mSizeLimit == 0 || pendingBytes < mSizeLimit;
        }

        /// Waits once, possibly spuriously, and logs before and after.
        void wait(UniqueMutexLock& lock);

        /// @return whether a producer is to be woken, for which there is room; if so, call notifyOne()
        bool claimOne(std::uint64_t pendingBytes) noexcept { return canEnqueue(pendingBytes) && mWaiter.claimOne(); }

        // These two need no lock.
        void notifyOne() noexcept { mWaiter.wakeOne(); }
        void notifyAll() noexcept { mWaiter.wakeAll(); }

    private:
        friend class QelMessageQueueInspector;

        const std::uint64_t mSizeLimit; // bytes; 0: no limit
        Waiters mWaiter;                // producers, for room
    };

    static std::uint64_t pGetLowPrioritySize(std::size_t size) noexcept;

    RateLimiter& pGetRateLimiter(MessageQueuingOptions options) noexcept QEL_REQUIRES(mLock);

    ReturnCode pEnqueueLocked(UniqueMutexLock& lock, RateLimiter& limiter, std::unique_ptr<QelMessage>& message,
                              bool blocking, std::chrono::steady_clock::time_point startTime) QEL_REQUIRES(mLock);
    void pWaitForMsgLocked(UniqueMutexLock& lock, const std::chrono::milliseconds& timeout) QEL_REQUIRES(mLock);
    bool pHasEndedWaitLocked() const QEL_REQUIRES(mLock) { return mShutdown || !mQueue.empty(); }
    std::unique_ptr<QelMessage> pDequeueLocked() QEL_REQUIRES(mLock);

    // Waking needs no lock, but the analysis sees only that these members are guarded. So threads are woken in these
    // functions alone.
    void pWakeConsumer() noexcept QEL_NO_THREAD_SAFETY_ANALYSIS { mDequeueWaiter.wakeOne(); }
    void pWakeProducers(bool normal, bool low) noexcept QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        if (normal) mNormalPriorityLimiter.notifyOne();
        if (low) mLowPriorityLimiter.notifyOne();
    }
    void pWakeAll() noexcept QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        mLowPriorityLimiter.notifyAll();
        mNormalPriorityLimiter.notifyAll();
        mDequeueWaiter.wakeAll();
    }

    // The lock guards everything below.
    mutable Mutex mLock;
    Fifo mQueue QEL_GUARDED_BY(mLock);
    Waiters mDequeueWaiter QEL_GUARDED_BY(mLock); // consumers, for a message
    RateLimiter mNormalPriorityLimiter QEL_GUARDED_BY(mLock);
    RateLimiter mLowPriorityLimiter QEL_GUARDED_BY(mLock);
    std::atomic<bool> mShutdown{false}; // written with the lock held; isShutdown() reads it without
    QelMessageQueueStatistics mStats QEL_GUARDED_BY(mLock);
};

} // namespace qel
