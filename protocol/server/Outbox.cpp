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

/// The turn to send, from its taking to its end.
class Outbox::Turn {
public:
    explicit Turn(Outbox& outbox) noexcept : mOutbox(outbox) {}
    ~Turn() { mOutbox.pEndTurn(mIsAllSent); }
    Turn(const Turn&) = delete;
    Turn& operator=(const Turn&) = delete;

    /// After a failure nothing follows: a part of a message may have been sent.
    void send(bool mayWait)
    {
        try {
            mIsAllSent = mOutbox.pSend(mayWait);
        } catch (...) {
            mOutbox.abandon();
            throw;
        }
    }

private:
    Outbox& mOutbox;
    bool mIsAllSent = true; // after a failure too: nothing is sent any more
};

void Outbox::Writer::send() noexcept
{
    Outbox* outbox = nullptr;
    {
        const MutexLock lock(mMutex);
        if (mOutbox == nullptr) return;
        if (mOutbox->pNeedsNoWait() && mOutbox->pTakeTurn()) outbox = mOutbox; // it stays until the turn ends
    }
    if (outbox == nullptr) return wake();
    outbox->pSendForAnother();
}

void Outbox::Writer::leave()
{
    const MutexLock lock(mMutex);
    mOutbox = nullptr;
}

Outbox::Outbox(std::size_t limitBytes) : mQueue(limitBytes) {}

Outbox::~Outbox() = default;

void Outbox::post(std::unique_ptr<QelMessage> message) { pPost(std::move(message), kNormal); }

void Outbox::postSerial(std::unique_ptr<QelMessage> message) { pPost(std::move(message), kSerial); }

bool Outbox::offer(std::unique_ptr<QelMessage> message)
{
    bool mustWake = false;
    {
        const MutexLock lock(mMutex);
        const QelMessageQueue::ReturnCode result = pEnqueueLocked(std::move(message), kNormal);
        if (result != QelMessageQueue::OK) return result != QelMessageQueue::DROPPED;
        mustWake = pMustWakeLocked();
    }
    if (mustWake) DeferredWakeUps::wake(mWriter);
    return true;
}

void Outbox::finish()
{
    {
        const MutexLock lock(mMutex);
        mFinished = true;
        pUpdateRoomLocked();
        pShutDownWhenDoneLocked();
    }
    mWriter->wake();
}

void Outbox::abandon()
{
    {
        const MutexLock lock(mMutex);
        mFinished = true;
        mAbandoned = true;
        mQueue.shutdown();
        pUpdateRoomLocked();
    }
    mWriter->wake();
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

QueueState Outbox::queueState() const
{
    QueueState state;
    {
        const MutexLock lock(mMutex);
        for (const Waiting& entry : mWaiting)
            state.pending += *entry.message;
    }
    const QelMessageQueueStatistics statistics = mQueue.getStatistics();
    state.pending += statistics.getPending();
    state.sent = statistics.getCompleted();
    state.dropped = statistics.getDropped();
    state.mostBytes = statistics.getMaxPendingBytes();
    state.latency = statistics.getE2ELatency();
    return state;
}

void Outbox::startReading()
{
    const MutexLock lock(mMutex);
    mReader = std::this_thread::get_id();
}

void Outbox::sendOwn()
{
    if (!std::exchange(mHasOwn, false)) return;
    if (!pNeedsNoWait()) return mWriter->wake();
    if (pTakeTurn()) Turn(*this).send(false);
}

bool Outbox::sendNext()
{
    if (!pAwaitTurn()) return false;
    Turn(*this).send(true);
    return true;
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

void Outbox::retire()
{
    mWriter->leave();
    UniqueMutexLock lock(mMutex);
    while (mIsSending)
        mChanged.wait(lock);
}

void Outbox::pPost(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority)
{
    bool mustWake = false;
    {
        const MutexLock lock(mMutex);
        if (mFinished) return;
        pPostLocked(std::move(message), priority);
        mustWake = pMustWakeLocked();
    }
    if (mustWake) DeferredWakeUps::wake(mWriter);
}

void Outbox::pPostLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority)
{
    if (mWaiting.empty() && mQueue.hasRoom(priority)) {
        pEnqueueLocked(std::move(message), priority);
    } else {
        mWaiting.push_back({std::move(message), priority, TimeProvider::steady()});
        pUpdateRoomLocked();
    }
}

/// A message was posted. @return whether the writer has to be woken: not while somebody sends, who looks for more
bool Outbox::pMustWakeLocked()
{
    if (mIsSending) return false;
    if (mReader != std::this_thread::get_id() || mQueuedBytes >= kBatchBytes) return true;
    mHasOwn = true;
    return false;
}

/// @post with OK the message is in the queue. For messages that were posted only with room in the queue.
QelMessageQueue::ReturnCode Outbox::pEnqueueLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority)
{
    const std::size_t length = message->msgLength();
    mLengths.push_back(length);
    try {
        // Not BLOCKING: it would not block here, but nothing may under this lock and those of the callers.
        const QelMessageQueue::ReturnCode result = mQueue.enqueue(std::move(message), priority);
        if (result == QelMessageQueue::OK) {
            mQueuedBytes += length;
        } else {
            mLengths.pop_back();
        }
        return result;
    } catch (...) {
        mLengths.pop_back();
        throw;
    }
}

/// Waits for something to send and for the turn. @return false: there will be nothing more to send
bool Outbox::pAwaitTurn()
{
    UniqueMutexLock lock(mMutex);
    for (;;) {
        if (!mIsSending) {
            if (mAbandoned) return false;
            if (!mLengths.empty() || mHasRest) break;
            if (mFinished) return false;
        }
        mWriter->sleep(lock);
    }
    mHasRest = false;
    mIsSending = true;
    return true;
}

/// @return false: another thread sends or has to, or there is nothing to send
bool Outbox::pTakeTurn()
{
    const MutexLock lock(mMutex);
    if (mIsSending || mHasRest || mAbandoned || mLengths.empty()) return false;
    mIsSending = true;
    return true;
}

/// The outbox may be gone right after it.
void Outbox::pEndTurn(bool isAllSent) noexcept
{
    std::shared_ptr<Writer> toWake;
    {
        const MutexLock lock(mMutex);
        mIsSending = false;
        mHasRest = !isAllSent;
        if (mHasRest || !mLengths.empty() || mFinished) toWake = mWriter;
        if (mFinished) mChanged.notifyAll(); // for retire()
    }
    if (toWake != nullptr) toWake->wake();
}

/// In a turn.
void Outbox::pSendForAnother() noexcept
{
    Turn turn(*this);
    try {
        turn.send(false);
    } catch (...) {
        pOnSendFailure();
    }
}

/// Sends one batch, in a turn. @return whether all of it went out
bool Outbox::pSend(bool mayWait)
{
    pBeginBatch(mayWait);
    std::size_t room = kBatchBytes;
    bool isRoomMade = false;
    while (const std::unique_ptr<QelMessage> message = pTake(room, isRoomMade))
        pGather(*message);
    if (isRoomMade) pOnRoom();
    return pSendBatch();
}

/// Takes the next message of a batch out, and moves those that waited for its room into the queue.
/// @param room  of the batch, in bytes; becomes less
/// @param isRoomMade  becomes true when a message that waited has entered the queue
/// @return null: there is none, or it does not fit
std::unique_ptr<QelMessage> Outbox::pTake(std::size_t& room, bool& isRoomMade)
{
    const MutexLock lock(mMutex);
    if (mAbandoned || mLengths.empty()) return nullptr;
    const std::size_t length = mLengths.front();
    if (length > room && room < kBatchBytes) return nullptr;
    std::unique_ptr<QelMessage> message = mQueue.waitForMsg(std::chrono::milliseconds::zero());
    mLengths.pop_front();
    mQueuedBytes -= length;
    room -= std::min(room, length);
    if (pMoveWaitingLocked()) isRoomMade = true;
    pShutDownWhenDoneLocked();
    return message;
}

/// A message was taken. @return whether one that waited has entered
bool Outbox::pMoveWaitingLocked()
{
    if (mWaiting.empty() || !mQueue.hasRoom(mWaiting.front().priority)) return false;
    do {
        Waiting next = std::move(mWaiting.front());
        mWaiting.pop_front();
        mLongestWait = std::max<std::chrono::nanoseconds>(mLongestWait, TimeProvider::steady() - next.since);
        ++mHaveWaited;
        pEnqueueLocked(std::move(next.message), next.priority);
    } while (!mWaiting.empty() && mQueue.hasRoom(mWaiting.front().priority));
    pUpdateRoomLocked();
    return true;
}

void Outbox::pUpdateRoomLocked()
{
    // Once the queue is shut down, messages are dropped.
    mHasRoom = mQueue.isShutdown() || std::none_of(mWaiting.begin(), mWaiting.end(),
                                                   [](const Waiting& waiting) { return waiting.priority == kNormal; });
    mHasSerialRoom = mWaiting.empty() && !mFinished;
}

/// Only when the queue is empty: after its shutdown it returns no messages.
void Outbox::pShutDownWhenDoneLocked()
{
    if (mFinished && mWaiting.empty() && mLengths.empty()) mQueue.shutdown();
}

} // namespace qel::protocol
