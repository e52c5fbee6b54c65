#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "LogLine.hpp"

#include <stdexcept>
#include <utility>

// How threads are woken. Each call decides under the lock whom it has to wake, releases the lock, and wakes them then:
// a thread that is woken while the lock is held has to go back to sleep at once to wait for it, which doubles the time
// of a hand-over (measured). Deciding under the lock loses nobody, because a thread counts itself among the waiting
// before it releases the lock. The thread that is woken may destroy the queue before the one that woke it is done with
// it; mWakings holds the destructor back for that long.
//
// How threads wait: asleep, from the first moment. To yield the core once before would make a hand-over between two
// threads that have a core to themselves nearly twice as fast, and one between threads that share it with others
// hundreds of times slower (measured: milliseconds), because the scheduler prefers a thread that wakes to one that has
// yielded.

namespace qel {

namespace {

/// Longer waits are without end. Far below the range of the clocks, to which the wait's deadline has to be added.
constexpr std::chrono::hours kForEver{24 * 365 * 100};

} // namespace

QelMessageQueue::QelMessageQueue(std::size_t sizeLimit)
    : mNormalPriorityLimiter(sizeLimit), mLowPriorityLimiter(pGetLowPrioritySize(sizeLimit))
{}

QelMessageQueue::~QelMessageQueue()
{
    {
        const MutexLock lock(mLock); // lets go of it whoever holds it yet: a shutdown() whose flag this thread has seen
    }
    mWakings.wait();
}

std::uint64_t QelMessageQueue::pGetLowPrioritySize(std::size_t size) noexcept
{
    return size / 2 + size % 2; // (size + 1) / 2 would be 0, no limit at all, for the largest size
}

QelMessageQueue::RateLimiter& QelMessageQueue::pGetRateLimiter(MessageQueuingOptions options) noexcept
{
    const bool lowPriority = (options & MessageQueuingOptions::LOW_PRIORITY) != MessageQueuingOptions::DEFAULT;
    return lowPriority ? mLowPriorityLimiter : mNormalPriorityLimiter;
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
        // This thread may have been woken to fill room that is still there.
        if (limiter.claimOne(mStats.getPending().mBytes)) limiter.notifyOne();
        throw;
    }
    if (result != OK || !mDequeueWaiter.claimOne()) return result;

    mWakings.enter();
    lock.unlock();
    pWakeConsumer();
    mWakings.leave();
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

    // Memory first, and the clocks before any figure: if one of them fails, nothing has changed.
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

std::unique_ptr<QelMessage> QelMessageQueue::waitForMsg(const std::chrono::milliseconds& timeout)
{
    UniqueMutexLock lock(mLock);
    pWaitForMsgLocked(lock, timeout);
    if (mShutdown || mQueue.empty()) return nullptr;

    std::unique_ptr<QelMessage> message;
    try {
        message = pDequeueLocked();
    } catch (...) {
        // This thread may have been woken for the message that is still there.
        if (mDequeueWaiter.claimOne()) pWakeConsumer();
        throw;
    }

    const std::uint64_t pendingBytes = mStats.getPending().mBytes;
    const bool wakeNormal = mNormalPriorityLimiter.claimOne(pendingBytes);
    const bool wakeLow = mLowPriorityLimiter.claimOne(pendingBytes);
    if (!wakeNormal && !wakeLow) return message;
    mWakings.enter();
    lock.unlock();
    pWakeProducers(wakeNormal, wakeLow);
    mWakings.leave();
    return message;
}

void QelMessageQueue::pWaitForMsgLocked(UniqueMutexLock& lock, const std::chrono::milliseconds& timeout)
{
    if (pHasEndedWaitLocked() || timeout <= std::chrono::milliseconds::zero()) return;
    if (timeout > kForEver) {
        while (!pHasEndedWaitLocked())
            mDequeueWaiter.wait(lock);
        return;
    }
    // The one clock here that is not read through TimeProvider: the thread sleeps in real time, so its deadline must be
    // of real time as well. By a substitute that stands still, or runs elsewhere, it would wake at once or never.
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!pHasEndedWaitLocked()) {
        if (!mDequeueWaiter.waitUntil(lock, deadline)) return; // a message may have come at the last moment
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

    mWakings.enter();
    lock.unlock();
    pWakeEverybody();
    mWakings.leave();
}

void QelMessageQueue::dumpStatistics(std::ostream& os, const Indent& indent) const
{
    const MutexLock lock(mLock);
    os << indent << "Limits:         " << decFormat(mLowPriorityLimiter.getSizeLimit()) << '/'
       << decFormat(mNormalPriorityLimiter.getSizeLimit()) << '\n';
    mStats.dump(os, indent);
}

} // namespace qel
