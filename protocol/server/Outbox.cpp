#include "server/Outbox.hpp"

#include <qel/common/stats/QelMessageStatisticsTypes.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include <algorithm>
#include <utility>

namespace qel::protocol {

namespace {

constexpr MessageQueuingOptions kNormal = MessageQueuingOptions::DEFAULT;
constexpr MessageQueuingOptions kSerial = MessageQueuingOptions::LOW_PRIORITY;

} // namespace

Outbox::Outbox(std::size_t limitBytes) : mQueue(limitBytes) {}

Outbox::~Outbox() = default;

void Outbox::post(std::unique_ptr<QelMessage> message) { pPost(std::move(message), kNormal); }

void Outbox::postSerial(std::unique_ptr<QelMessage> message) { pPost(std::move(message), kSerial); }

bool Outbox::offer(std::unique_ptr<QelMessage> message)
{
    const MutexLock lock(mMutex);
    const QelMessageQueue::ReturnCode result = mQueue.enqueue(std::move(message), kNormal);
    if (result == QelMessageQueue::OK) ++mQueued;
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
    return mWaiting.empty() && !mFinished;
}

void Outbox::finish()
{
    const MutexLock lock(mMutex);
    mFinished = true;
    pShutDownWhenDoneLocked();
}

void Outbox::abandon()
{
    const MutexLock lock(mMutex);
    mFinished = true;
    mQueue.shutdown();
}

void Outbox::dumpStatistics(std::ostream& os, const Indent& indent) const
{
    {
        const MutexLock lock(mMutex);
        QelMessageCount waiting;
        for (const Waiting& entry : mWaiting)
            waiting += *entry.message;
        os << indent << "In Front:       " << waiting << '\n'
           << indent << "Waited:         " << decFormat(mHaveWaited) << ", at most "
           << decFormat(std::chrono::duration_cast<std::chrono::microseconds>(mLongestWait).count()) << " us\n";
    }
    mQueue.dumpStatistics(os, indent);
}

std::unique_ptr<QelMessage> Outbox::take()
{
    std::unique_ptr<QelMessage> message = mQueue.waitForMsg(std::chrono::milliseconds::max());
    if (message != nullptr && pMoveWaiting()) pOnRoom();
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
    if (mWaiting.empty() && mQueue.hasRoom(priority)) {
        pEnqueueLocked(std::move(message), priority);
    } else {
        mWaiting.push_back({std::move(message), priority, TimeProvider::steady()});
    }
}

/// Only with room in the queue. @post the message is in it, unless the queue was shut down
void Outbox::pEnqueueLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority)
{
    // Not BLOCKING: it would not block here, but nothing may under this lock and those of the callers.
    if (mQueue.enqueue(std::move(message), priority) == QelMessageQueue::OK) ++mQueued;
}

/// The writer has taken a message. @return whether a message that waited has entered
bool Outbox::pMoveWaiting()
{
    const MutexLock lock(mMutex);
    --mQueued;
    bool moved = false;
    while (!mWaiting.empty() && mQueue.hasRoom(mWaiting.front().priority)) {
        Waiting next = std::move(mWaiting.front());
        mWaiting.pop_front();
        mLongestWait = std::max<std::chrono::nanoseconds>(mLongestWait, TimeProvider::steady() - next.since);
        ++mHaveWaited;
        pEnqueueLocked(std::move(next.message), next.priority);
        moved = true;
    }
    pShutDownWhenDoneLocked();
    return moved;
}

/// Only when the queue is empty: after its shutdown it returns no messages.
void Outbox::pShutDownWhenDoneLocked()
{
    if (mFinished && mWaiting.empty() && mQueued == 0) mQueue.shutdown();
}

} // namespace qel::protocol
