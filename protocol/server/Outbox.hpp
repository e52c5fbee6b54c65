#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/ServerState.hpp>

#include "hypervisor/ConsoleLink.hpp"
#include "hypervisor/DeferredWakeUps.hpp"

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <ostream>
#include <thread>

namespace qel::protocol {

/// The messages on their way to one console: a message queue, and a list of messages that wait for room in it.
///
/// The queue can make its producers wait for room. The threads that post must not wait: they hold locks and serve other
/// consoles. So a message without room is kept here. Only who sends makes room, so who sends moves what waits into the
/// queue whenever it has taken a message out. Responses, notices and serial data keep their order. Serial data has
/// low priority: it enters while less than half of the limit is queued, so that the other half is left for everything
/// else.
///
/// Messages are sent in batches: all that is queued, at most kBatchBytes, is taken out, and sent with one write. The
/// writer's thread sends. So may the reader's: what the reader has posted goes out with sendOwn() on its own thread,
/// unless it is too much, and no other thread has to be woken for it. So may the reader of another console that has
/// sent this one a message. These two send as much as there is room for, and leave the rest to the writer. One thread
/// at a time has the turn to send, so the order is that of the queue.
///
/// The list is not bounded here: the threads that post stop when hasRoom() or hasSerialRoom() is false.
///
/// Thread safety: any number of threads that post, one writer, one reader. No thread waits for a message with the lock
/// held; under it only the queue is called, and never in a way that blocks. Writers are woken without it.
class Outbox : public ConsoleLink {
public:
    /// The default limit of the queue, in bytes of frames.
    static constexpr std::size_t kDefaultLimit = 256 * 1024;
    /// What is taken out of the queue at a time, in bytes of frames; a longer message is a batch of its own.
    static constexpr std::size_t kBatchBytes = 16 * 1024;

    /// Takes a response or a notice, even without room. Drops it after finish() or abandon().
    void post(std::unique_ptr<QelMessage> message) final;

    /// Takes serial data, even without room. Drops it after finish() or abandon().
    void postSerial(std::unique_ptr<QelMessage> message) final;

    /// Takes a message only while less than the limit is queued. It may overtake messages that wait for room.
    /// @return false: it is dropped, and counted as dropped in the statistics
    bool offer(std::unique_ptr<QelMessage> message) final;

    /// False while a response or a notice waits for room. Takes no lock.
    bool hasRoom() const final { return mHasRoom; }

    /// False while any message waits for room, and after finish() and abandon(). Takes no lock.
    bool hasSerialRoom() const final { return mHasSerialRoom; }

    /// Says that nothing more will be posted. Messages already here still go out.
    void finish() final;

    /// Drops all messages, when nothing can be written any more.
    void abandon();

    /// Prints what waits for room and has waited for it, and the limits and the statistics of the queue.
    /// @param indent  at the start of every line
    void dumpStatistics(std::ostream& os, const Indent& indent) const;

    /// What is on its way, and what has passed.
    QueueState queueState() const;

    // The reader's side.

    /// From here on what this thread posts wakes no writer, unless it is a whole batch: the thread calls sendOwn().
    void startReading();

    /// Sends what is queued, if this thread has posted anything since the last call, and no other thread is sending. At
    /// most one batch, and no more than goes out without waiting; the writer gets the rest.
    /// @throws ...  what sending throws; the outbox is abandoned then
    void sendOwn();

    // The writer's side.

    /// Waits for messages, and sends a batch of them.
    /// @return false: there will be no more, and nothing was sent
    /// @throws ...  what sending throws; the outbox is abandoned then
    bool sendNext();

    /// Says that the writer has ended.
    void setWritten();

    /// Waits for the writer to end. @return false: timeout
    bool waitUntilWritten(std::chrono::milliseconds timeout) const;

protected:
    /// @param limitBytes  more than 0
    explicit Outbox(std::size_t limitBytes);
    ~Outbox() override;

    /// To be called before what sends is destroyed: waits until the thread of another console that is sending has ended
    /// its turn. No other will begin one.
    void retire();

private:
    using TimePoint = std::chrono::steady_clock::time_point;

    struct Waiting {
        std::unique_ptr<QelMessage> message;
        MessageQueuingOptions priority;
        TimePoint since;
    };

    /// Outlives the outbox while another thread is about to call it.
    class Writer final : public LinkWriter {
    public:
        explicit Writer(Outbox& outbox) : mOutbox(&outbox) {}

        void wake() noexcept override { mAwake.notifyOne(); }
        void send() noexcept override;

        /// The writer's thread waits to be woken. @param lock  of the outbox
        void sleep(UniqueMutexLock& lock) { mAwake.wait(lock); }
        /// From here on send() does not begin any more.
        void leave();

    private:
        ConditionVariable mAwake; // the writer's thread: some of its reasons to sleep may have gone

        Mutex mMutex;                           // comes before that of the outbox
        Outbox* mOutbox QEL_GUARDED_BY(mMutex); // null: it may be gone
    };

    class Turn;

    // These are called without the lock, by the thread that has the turn.

    /// Whether a thread may send that must not wait for the console.
    virtual bool pNeedsNoWait() const = 0;
    /// Begins a batch, with what is left of the last one. @param mayWait  whether sending may wait for the console
    virtual void pBeginBatch(bool mayWait) = 0;
    virtual void pGather(const QelMessage& message) = 0;
    /// @return false: something is left, because it found no room and must not wait
    virtual bool pSendBatch() = 0;
    /// At least one message that waited has entered the queue.
    virtual void pOnRoom() = 0;
    /// Sending has thrown on the thread of another console. Called in the handler; ends the connection.
    virtual void pOnSendFailure() noexcept = 0;

    void pPost(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority);
    void pPostLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority) QEL_REQUIRES(mMutex);
    bool pMustWakeLocked() QEL_REQUIRES(mMutex);
    QelMessageQueue::ReturnCode pEnqueueLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority)
        QEL_REQUIRES(mMutex);
    bool pAwaitTurn();
    bool pTakeTurn();
    void pEndTurn(bool isAllSent) noexcept;
    void pSendForAnother() noexcept;
    bool pSend(bool mayWait);
    std::unique_ptr<QelMessage> pTake(std::size_t& room, bool& isRoomMade);
    bool pMoveWaitingLocked() QEL_REQUIRES(mMutex);
    void pUpdateRoomLocked() QEL_REQUIRES(mMutex);
    void pShutDownWhenDoneLocked() QEL_REQUIRES(mMutex);

    QelMessageQueue mQueue; // locks itself; nobody waits in it
    const std::shared_ptr<Writer> mWriter = std::make_shared<Writer>(*this);

    mutable Mutex mMutex;
    mutable ConditionVariable mChanged;
    std::deque<Waiting> mWaiting QEL_GUARDED_BY(mMutex);     // for room, in order; empty if the queue is empty
    std::deque<std::size_t> mLengths QEL_GUARDED_BY(mMutex); // of the messages in the queue, in bytes of frames
    std::size_t mQueuedBytes QEL_GUARDED_BY(mMutex) = 0;     // their sum
    bool mIsSending QEL_GUARDED_BY(mMutex) = false;          // a thread has the turn
    bool mHasRest QEL_GUARDED_BY(mMutex) = false;            // of a batch that a reader began, for the writer
    std::uint64_t mHaveWaited QEL_GUARDED_BY(mMutex) = 0;    // messages that have entered after a wait
    std::chrono::nanoseconds mLongestWait QEL_GUARDED_BY(mMutex){0};
    bool mFinished QEL_GUARDED_BY(mMutex) = false;
    bool mAbandoned QEL_GUARDED_BY(mMutex) = false;
    bool mWritten QEL_GUARDED_BY(mMutex) = false;
    std::thread::id mReader QEL_GUARDED_BY(mMutex); // none: there is no reader yet
    // Written with the lock held. The reader asks before each message, so the answer takes no lock.
    std::atomic<bool> mHasRoom{true};
    std::atomic<bool> mHasSerialRoom{true};

    bool mHasOwn = false; // of the reader: it has posted something that no writer knows of
};

} // namespace qel::protocol
