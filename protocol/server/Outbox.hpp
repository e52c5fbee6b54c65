#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <ostream>

namespace qel::protocol {

/// The messages on their way to one console: a message queue, and a list of messages that wait for room in it.
///
/// The queue makes its producers wait for room. The threads that post must not wait: they hold locks and serve other
/// consoles. So a message without room is kept here, and one thread, the feeder, waits and moves it into the queue.
/// Responses, notices and serial data keep their order. Serial data has low priority: it enters while less than half of
/// the limit is queued, so that the other half is left for everything else.
///
/// The list is not bounded here: the threads that post stop when hasRoom() or hasSerialRoom() is false.
///
/// Thread safety: any number of threads that post, one feeder, one writer. No thread waits for room or for a message
/// with the lock held; under it only the queue is called, and never in a way that blocks.
class Outbox {
public:
    /// The default limit of the queue, in bytes of frames.
    static constexpr std::size_t kDefaultLimit = 256 * 1024;

    /// @param onRoom  called without the lock, on the feeder's thread, whenever a message that waited has entered
    /// @param limitBytes  more than 0
    explicit Outbox(std::function<void()> onRoom, std::size_t limitBytes = kDefaultLimit);

    /// Takes a response or a notice, even without room. Drops it after finish() or abandon().
    void post(std::unique_ptr<QelMessage> message);

    /// Takes serial data, even without room. Drops it after finish() or abandon().
    void postSerial(std::unique_ptr<QelMessage> message);

    /// Takes a message only while less than the limit is queued. It may overtake messages that wait for room.
    /// @return false: it is dropped, and counted as dropped in the statistics
    bool offer(std::unique_ptr<QelMessage> message);

    /// False while a response or a notice waits for room.
    bool hasRoom() const;

    /// False while any message waits for room.
    bool hasSerialRoom() const;

    /// Says that nothing more will be posted. Messages already here still go out.
    void finish();

    /// Drops all messages, when nothing can be written any more. feed() and take() return.
    void abandon();

    /// Prints the limits and the statistics of the queue, without the messages that wait for room.
    /// @param indent  at the start of every line
    void dumpStatistics(std::ostream& os, const Indent& indent) const;

    // The feeder's side.

    /// Moves waiting messages into the queue, until none is left and nothing more will be posted.
    void feed();

    // The writer's side.

    /// Waits for the next message. @return null: there will be no more
    std::unique_ptr<QelMessage> take();

    /// Says that the writer has ended.
    void setWritten();

    /// Waits for the writer to end. @return false: timeout
    bool waitUntilWritten(std::chrono::milliseconds timeout) const;

private:
    struct Waiting {
        std::unique_ptr<QelMessage> message; ///< null while the feeder waits with it in the queue
        MessageQueuingOptions priority;
    };

    void pPost(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority);
    bool pFindsRoomLocked(MessageQueuingOptions priority) const QEL_REQUIRES(mMutex);
    void pEnqueueLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority) QEL_REQUIRES(mMutex);
    bool pAwaitWaitingLocked(UniqueMutexLock& lock) QEL_REQUIRES(mMutex);
    void pShutDownWhenDoneLocked() QEL_REQUIRES(mMutex);

    const std::function<void()> mOnRoom;
    const std::size_t mLimitBytes;
    QelMessageQueue mQueue; // locks itself

    mutable Mutex mMutex;
    mutable ConditionVariable mChanged;
    std::deque<Waiting> mWaiting QEL_GUARDED_BY(mMutex); // for room, in order
    // What is in the queue. Counts a message before it enters and until after it leaves: never less than the queue has.
    QelMessageCount mQueued QEL_GUARDED_BY(mMutex);
    bool mFinished QEL_GUARDED_BY(mMutex) = false;
    bool mWritten QEL_GUARDED_BY(mMutex) = false;
};

} // namespace qel::protocol
