#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/stats/QelMessageQueueStatistics.hpp>
#include <qel/common/util/BitmaskEnum.hpp>
#include <qel/common/util/CallsInFlight.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/Waiters.hpp>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <ostream>
#include <queue>

namespace qel {

/// How a message is put into a queue. The values are bits and combine with the operators of util/BitmaskEnum.hpp.
enum class MessageQueuingOptions : int {
    DEFAULT = 0,      ///< normal priority; dropped when the queue is over its limit
    BLOCKING = 1,     ///< wait for room instead of being dropped
    LOW_PRIORITY = 2, ///< admitted only up to half of the limit
    BEST_EFFORT = 4   ///< a remark of the producer's; the queue does not look at it
};

template <>
struct is_bitmask_enum<MessageQueuingOptions> : std::true_type {};

/// A first-in, first-out queue of messages between any number of threads that produce them and any number that take
/// them. It bounds the bytes that wait, and keeps figures about them.
///
/// Priorities decide about admission alone: messages come out in the order in which they went in. A message of normal
/// priority is admitted while fewer bytes wait than the limit, one of low priority while fewer than half of it do. Only
/// what waits already counts: a message larger than the limit is admitted as long as there is room at all, so that at
/// most one byte less than the limit and one whole message wait.
///
/// A producer that waits for room is woken when a message is taken out. Each message taken wakes at most one producer
/// of each priority, and only if its limit then admits a message; further producers are woken by further messages.
///
/// Lifetime: owns the messages in it. Destroy the queue when no thread is inside one of its calls or will make another
/// one. A call whose outcome you have seen counts as over, though it may not have returned in its own thread: whoever
/// has taken the last message may destroy the queue at once, and need not wait for its producer's enqueue() to return;
/// the same holds for a producer that was let in by a waitForMsg(), and for shutdown(). The destructor waits for what
/// such calls still have to do, which is to wake other threads. Nobody may be asleep in the queue any more: shut it
/// down and join those threads first.
/// Thread safety: every operation but destruction from any thread. One lock guards everything. Log lines of a waiting
/// producer and of shutdown() are written, and dumpStatistics() prints, with the lock held: neither a log back-end nor
/// the stream that is printed to may use the queue, and while one of them is slow everybody waits.
///
/// Clock: enqueue() reads TimeProvider::steady() when it is called, once more when the message is admitted, and a third
/// time if the queue was empty; waitForMsg() reads it twice for each message, and more while messages are slow (see
/// QelMessageLatencyEvents). Waiting itself goes by the real clock.
class QEL_EXPORT QelMessageQueue {
public:
    /// What became of a message.
    enum ReturnCode {
        OK = 0,       ///< queued
        SHUTDOWN = 1, ///< not queued: the queue is shut down
        DROPPED = 2   ///< not queued and counted as dropped: the queue is over its limit
    };

    /// @param sizeLimit  bytes of waiting messages from which on none of normal priority is admitted; for those of low
    ///                   priority it is half of that, rounded up. 0: no limit for either.
    /// @throws std::bad_alloc
    explicit QelMessageQueue(std::size_t sizeLimit);

    /// Destroys the messages that were not taken. See above for when it may be called.
    ~QelMessageQueue();

    QelMessageQueue(const QelMessageQueue&) = delete;
    QelMessageQueue& operator=(const QelMessageQueue&) = delete;

    /// Puts a message at the end of the queue.
    /// @param message  not null; destroyed when the result is not OK
    /// @param options  with BLOCKING, waits for room, however long that takes
    /// @throws std::invalid_argument "message": it is null
    /// @throws std::bad_alloc and what a substitute clock throws; the queue is as it was, and the message is destroyed
    ReturnCode enqueue(std::unique_ptr<QelMessage> message,
                       MessageQueuingOptions options = MessageQueuingOptions::DEFAULT);

    /// Takes the message at the head of the queue, and waits for one if need be.
    /// @param timeout  how long to wait for a message; milliseconds::max(), and whatever else is longer than a
    ///                 hundred years, means for ever; zero or less means not at all
    /// @return null when the time has passed without a message, and at once when the queue is shut down, even if there
    ///         are messages in it
    /// @throws what a substitute clock throws; the message stays in the queue
    std::unique_ptr<QelMessage> waitForMsg(const std::chrono::milliseconds& timeout);

    /// Ends the work of this queue for good: producers and consumers that wait return now, later ones at once, and
    /// messages still in it stay there until it is destroyed. Further calls do nothing.
    /// Does not throw.
    void shutdown();

    /// @return whether shutdown() has been called. Takes no lock.
    bool isShutdown() const noexcept { return mShutdown; }

    /// Prints the limits, low priority first, and then the statistics, all as they were at one moment. Print into a
    /// string first where the stream may be slow: producers and consumers wait for it.
    /// @param os  is left in the state that QelMessageQueueStatistics::dump() tells
    /// @param indent  in front of every line
    /// @throws std::bad_alloc, what a substitute clock throws, and what the stream throws if it was told to; part of
    /// the text may have been printed then
    void dumpStatistics(std::ostream& os, const Indent& indent) const;

private:
    struct QueueEntry {
        std::unique_ptr<QelMessage> mMessage;
        std::chrono::steady_clock::time_point mStartTime; // of the call of enqueue()
    };

    /// The messages in their order. A failed enqueue() gives its place at the end back, which std::queue has but does
    /// not offer.
    struct Fifo : std::queue<QueueEntry> {
        void popBack() { c.pop_back(); }
    };

    /// The limit of one priority, and the producers that wait for room below it. Belongs under the queue's lock.
    class RateLimiter {
    public:
        explicit RateLimiter(std::uint64_t sizeLimit) noexcept : mSizeLimit(sizeLimit) {}

        std::uint64_t getSizeLimit() const noexcept { return mSizeLimit; }
        bool canEnqueue(std::uint64_t pendingBytes) const noexcept
        {
            return mSizeLimit == 0 || pendingBytes < mSizeLimit;
        }

        /// Waits once, perhaps without cause, and logs that it does.
        void wait(UniqueMutexLock& lock);

        /// @return whether a producer is to be woken, for which there must be room; if so, call notifyOne()
        bool claimOne(std::uint64_t pendingBytes) noexcept { return canEnqueue(pendingBytes) && mWaiter.claimOne(); }

        // These two may be called without the lock.
        void notifyOne() noexcept { mWaiter.wakeOne(); }
        void notifyAll() noexcept { mWaiter.wakeAll(); }

    private:
        const std::uint64_t mSizeLimit; // bytes; 0: no limit
        Waiters mWaiter;                // for room, producers
    };

    static std::uint64_t pGetLowPrioritySize(std::size_t size) noexcept;

    RateLimiter& pGetRateLimiter(MessageQueuingOptions options) noexcept QEL_REQUIRES(mLock);

    ReturnCode pEnqueueLocked(UniqueMutexLock& lock, RateLimiter& limiter, std::unique_ptr<QelMessage>& message,
                              bool blocking, std::chrono::steady_clock::time_point startTime) QEL_REQUIRES(mLock);
    void pWaitForMsgLocked(UniqueMutexLock& lock, const std::chrono::milliseconds& timeout) QEL_REQUIRES(mLock);
    bool pHasEndedWaitLocked() const QEL_REQUIRES(mLock) { return mShutdown || !mQueue.empty(); }
    std::unique_ptr<QelMessage> pDequeueLocked() QEL_REQUIRES(mLock);

    // Those who were claimed under the lock are woken after it is released. Waking needs no lock, but the analysis
    // knows only that what it is done with is guarded, so it is done here and nowhere else.
    void pWakeConsumer() noexcept QEL_NO_THREAD_SAFETY_ANALYSIS { mDequeueWaiter.wakeOne(); }
    void pWakeProducers(bool normal, bool low) noexcept QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        if (normal) mNormalPriorityLimiter.notifyOne();
        if (low) mLowPriorityLimiter.notifyOne();
    }
    void pWakeEverybody() noexcept QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        mLowPriorityLimiter.notifyAll();
        mNormalPriorityLimiter.notifyAll();
        mDequeueWaiter.wakeAll();
    }

    // The lock guards all that follows.
    mutable Mutex mLock;
    Fifo mQueue QEL_GUARDED_BY(mLock);
    Waiters mDequeueWaiter QEL_GUARDED_BY(mLock); // for a message, consumers
    RateLimiter mNormalPriorityLimiter QEL_GUARDED_BY(mLock);
    RateLimiter mLowPriorityLimiter QEL_GUARDED_BY(mLock);
    std::atomic<bool> mShutdown{false}; // written under the lock, read without it by isShutdown()
    CallsInFlight mWakings;             // calls that wake others after releasing the lock
    QelMessageQueueStatistics mStats QEL_GUARDED_BY(mLock);
};

} // namespace qel
