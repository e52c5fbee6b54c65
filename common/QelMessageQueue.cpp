#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "LogLine.hpp"
#include "util/Timeout.hpp"

#include <stdexcept>
#include <utility>

// How threads are woken. Each call decides with the lock held which threads to wake, releases the lock, and then wakes
// them: a thread that is woken while the lock is held goes back to sleep at once to wait for it, which doubles the time
// of a hand-over (measured). No wake-up is lost, because a thread counts itself as waiting before it releases the lock.
//
// How threads wait: they sleep at once. Yielding the core first makes a hand-over nearly twice as fast between two
// threads that have a core to themselves, and hundreds of times slower between threads that share it with others
// (measured: milliseconds), because the scheduler prefers a thread that wakes to one that has yielded.

namespace qel {

namespace {

/// A longer wait has no limit. Some condition variables convert the deadline to another clock, so it stays far from the
/// end of the clock's range.
constexpr std::chrono::hours kMaxWait{24 * 365 * 100};

bool isLowPriority(MessageQueuingOptions options) noexcept
{
    return (options & MessageQueuingOptions::LOW_PRIORITY) != MessageQueuingOptions::DEFAULT;
}

} // namespace

QelMessageQueue::QelMessageQueue(std::size_t sizeLimit)
    : mNormalPriorityLimiter(sizeLimit), mLowPriorityLimiter(pGetLowPrioritySize(sizeLimit))
{}

QelMessageQueue::~QelMessageQueue() = default;

std::uint64_t QelMessageQueue::pGetLowPrioritySize(std::size_t size) noexcept
{
    return size / 2 + size % 2; // (size + 1) / 2 is 0, which means no limit, for the largest size
}

QelMessageQueue::RateLimiter& QelMessageQueue::pGetRateLimiter(MessageQueuingOptions options) noexcept
{
    return isLowPriority(options) ? mLowPriorityLimiter : mNormalPriorityLimiter;
}

void QelMessageQueue::RateLimiter::wait(UniqueMutexLock& lock)
{
    logLine(LogLevel::Debug, "Message queue limit of ", decFormat(mSizeLimit), " reached, waiting");
    mWaiter.wait(lock);
    logLine(LogLevel::Debug, "Unblocking message queue rate limiter (limit ", decFormat(mSizeLimit), ")");
}

QelMessageQueue::ReturnCode QelMessageQueue::enqueue(std::unique_ptr<QelMessage> message, MessageQueuingOptions options)
{
    if (message == nullptr) throw std::invalid_argument("message");

    const bool blocking = (options & MessageQueuingOptions::BLOCKING) != MessageQueuingOptions::DEFAULT;
    const auto startTime = TimeProvider::steady();

    UniqueMutexLock lock(mLock);
    RateLimiter& limiter = pGetRateLimiter(options);
    ReturnCode result = OK;
    try {
        result = pEnqueueLocked(lock, limiter, message, blocking, startTime);
    } catch (...) {
        // This thread may have been woken for room that another one can use.
        if (limiter.claimOne(mStats.getPending().mBytes)) limiter.notifyOne();
        throw;
    }
    if (result == OK && mDequeueWaiter.claimOne()) {
        lock.unlock();
        pWakeConsumer();
    }
    return result;
}

QelMessageQueue::ReturnCode QelMessageQueue::pEnqueueLocked(UniqueMutexLock& lock, RateLimiter& limiter,
                                                            std::unique_ptr<QelMessage>& message, bool blocking,
                                                            std::chrono::steady_clock::time_point startTime)
{
    for (;;) {
        if (mShutdown) return SHUTDOWN;
        if (limiter.canEnqueue(mStats.getPending().mBytes)) break;
        if (!blocking) {
            mStats.dropped(*message);
            return DROPPED;
        }
        limiter.wait(lock);
    }

    // What can fail comes first: if the clock or the allocation throws, nothing has changed.
    const auto now = TimeProvider::steady();
    QueueEntry& entry = mQueue.emplace();
    try {
        mStats.enqueued(*message, now - startTime);
    } catch (...) {
        mQueue.popBack();
        throw;
    }
    entry.mMessage = std::move(message);
    entry.mStartTime = startTime;
    return OK;
}

bool QelMessageQueue::hasRoom(MessageQueuingOptions options) const
{
    const MutexLock lock(mLock);
    const RateLimiter& limiter = isLowPriority(options) ? mLowPriorityLimiter : mNormalPriorityLimiter;
    return limiter.canEnqueue(mStats.getPending().mBytes);
}

QelMessageQueueStatistics QelMessageQueue::getStatistics() const
{
    const MutexLock lock(mLock);
    return mStats;
}

std::unique_ptr<QelMessage> QelMessageQueue::waitForMsg(const std::chrono::milliseconds& timeout)
{
    UniqueMutexLock lock(mLock);
    pWaitForMsgLocked(lock, timeout);
    if (mShutdown || mQueue.empty()) return nullptr;

    std::unique_ptr<QelMessage> message;
    try {
        message = pDequeueLocked();
    } catch (...) {
        // This thread may have been woken for the message, which another one can take.
        if (mDequeueWaiter.claimOne()) pWakeConsumer();
        throw;
    }

    const std::uint64_t pendingBytes = mStats.getPending().mBytes;
    const bool wakeNormal = mNormalPriorityLimiter.claimOne(pendingBytes);
    const bool wakeLow = mLowPriorityLimiter.claimOne(pendingBytes);
    if (wakeNormal || wakeLow) {
        lock.unlock();
        pWakeProducers(wakeNormal, wakeLow);
    }
    return message;
}

void QelMessageQueue::pWaitForMsgLocked(UniqueMutexLock& lock, const std::chrono::milliseconds& timeout)
{
    if (pHasEndedWaitLocked() || timeout <= std::chrono::milliseconds::zero()) return;
    if (timeout > kMaxWait) {
        while (!pHasEndedWaitLocked())
            mDequeueWaiter.wait(lock);
        return;
    }
    // Not read through TimeProvider: the thread sleeps in real time, and a substituted clock would wake it at once or
    // never.
    const auto deadline = deadlineAfter(std::chrono::steady_clock::now(), timeout);
    while (!pHasEndedWaitLocked()) {
        if (!mDequeueWaiter.waitUntil(lock, deadline)) return; // the caller checks for a message once more
    }
}

std::unique_ptr<QelMessage> QelMessageQueue::pDequeueLocked()
{
    QueueEntry& entry = mQueue.front();
    mStats.dequeued(*entry.mMessage, TimeProvider::steady() - entry.mStartTime);
    std::unique_ptr<QelMessage> message = std::move(entry.mMessage);
    mQueue.pop();
    return message;
}

void QelMessageQueue::shutdown()
{
    UniqueMutexLock lock(mLock);
    if (mShutdown) return;
    mShutdown = true;
    logLine(LogLevel::Debug, "MQ: Shutdown!");

    lock.unlock();
    pWakeAll();
}

void QelMessageQueue::dumpStatistics(std::ostream& os, const Indent& indent) const
{
    const MutexLock lock(mLock);
    os << indent << "Limits:         " << decFormat(mLowPriorityLimiter.getSizeLimit()) << '/'
       << decFormat(mNormalPriorityLimiter.getSizeLimit()) << '\n';
    mStats.dump(os, indent);
}

} // namespace qel
