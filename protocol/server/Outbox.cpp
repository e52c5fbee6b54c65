#include "server/Outbox.hpp"

#include <algorithm>
#include <utility>

namespace qel::protocol {

namespace {

constexpr MessageQueuingOptions kNormal = MessageQueuingOptions::DEFAULT;
constexpr MessageQueuingOptions kSerial = MessageQueuingOptions::LOW_PRIORITY;

} // namespace

Outbox::Outbox(std::function<void()> onRoom, std::size_t limitBytes)
    : mOnRoom(std::move(onRoom)), mLimitBytes(limitBytes), mQueue(limitBytes)
{}

void Outbox::post(std::unique_ptr<QelMessage> message) { pPost(std::move(message), kNormal); }

void Outbox::postSerial(std::unique_ptr<QelMessage> message) { pPost(std::move(message), kSerial); }

bool Outbox::offer(std::unique_ptr<QelMessage> message)
{
    QelMessageCount offered;
    offered += *message;
    const MutexLock lock(mMutex);
    const QelMessageQueue::ReturnCode result = mQueue.enqueue(std::move(message), kNormal);
    if (result == QelMessageQueue::OK) mQueued += offered;
    return result != QelMessageQueue::DROPPED;
}

bool Outbox::hasRoom() const
{
    const MutexLock lock(mMutex);
    if (mQueue.isShutdown()) return true; // messages are dropped
    return std::none_of(mWaiting.begin(), mWaiting.end(),
                        [](const Waiting& waiting) { return waiting.priority == kNormal; });
}

bool Outbox::hasSerialRoom() const
{
    const MutexLock lock(mMutex);
    return mWaiting.empty() || mQueue.isShutdown();
}

void Outbox::finish()
{
    const MutexLock lock(mMutex);
    mFinished = true;
    pShutDownWhenDoneLocked();
    mChanged.notifyAll();
}

void Outbox::abandon()
{
    const MutexLock lock(mMutex);
    mFinished = true;
    mQueue.shutdown();
    mChanged.notifyAll();
}

void Outbox::dumpStatistics(std::ostream& os, const Indent& indent) const { mQueue.dumpStatistics(os, indent); }

void Outbox::feed()
{
    UniqueMutexLock lock(mMutex);
    while (pAwaitWaitingLocked(lock)) {
        // Its entry stays in the list until it is in the queue, so that nothing posted meanwhile overtakes it.
        Waiting& next = mWaiting.front();
        const MessageQueuingOptions priority = next.priority;
        std::unique_ptr<QelMessage> message = std::move(next.message);
        mQueued += *message;
        lock.unlock();
        const auto result = mQueue.enqueue(std::move(message), priority | MessageQueuingOptions::BLOCKING);
        if (result != QelMessageQueue::OK) return; // abandoned
        lock.lock();
        mWaiting.pop_front();
        pShutDownWhenDoneLocked();
        lock.unlock();
        mOnRoom();
        lock.lock();
    }
}

std::unique_ptr<QelMessage> Outbox::take()
{
    std::unique_ptr<QelMessage> message = mQueue.waitForMsg(std::chrono::milliseconds::max());
    if (message == nullptr) return nullptr;
    const MutexLock lock(mMutex);
    mQueued -= *message;
    pShutDownWhenDoneLocked();
    return message;
}

void Outbox::setWritten()
{
    const MutexLock lock(mMutex);
    mWritten = true;
    mChanged.notifyAll();
}

bool Outbox::waitUntilWritten(std::chrono::milliseconds timeout) const
{
    const auto end = std::chrono::steady_clock::now() + timeout;
    UniqueMutexLock lock(mMutex);
    while (!mWritten) {
        if (!mChanged.waitUntil(lock, end)) return mWritten;
    }
    return true;
}

void Outbox::pPost(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority)
{
    const MutexLock lock(mMutex);
    if (mFinished) return;
    if (pFindsRoomLocked(priority)) {
        pEnqueueLocked(std::move(message), priority);
    } else {
        mWaiting.push_back({std::move(message), priority});
        mChanged.notifyAll();
    }
}

/// The queue's own rule, applied to a count that is never below the queue's: the queue will admit the message.
bool Outbox::pFindsRoomLocked(MessageQueuingOptions priority) const
{
    const std::size_t limit = priority == kSerial ? mLimitBytes - mLimitBytes / 2 : mLimitBytes;
    return mWaiting.empty() && mQueued.mBytes < limit;
}

void Outbox::pEnqueueLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority)
{
    QelMessageCount added;
    added += *message;
    // Not BLOCKING: it would not block here, but nothing may under this lock and those of the callers.
    static_cast<void>(mQueue.enqueue(std::move(message), priority));
    mQueued += added;
}

/// Waits for a message without room. @return false: there will be no more
bool Outbox::pAwaitWaitingLocked(UniqueMutexLock& lock)
{
    while (mWaiting.empty() && !mFinished)
        mChanged.wait(lock);
    return !mWaiting.empty() && !mQueue.isShutdown();
}

/// Only when the queue is empty: after its shutdown it returns no messages.
void Outbox::pShutDownWhenDoneLocked()
{
    if (mFinished && mWaiting.empty() && mQueued.mCount == 0) mQueue.shutdown();
}

} // namespace qel::protocol
