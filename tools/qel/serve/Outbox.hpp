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

namespace qel::tool {

/// What stands between those who have something to say to one console and the one thread that writes to it: a message
/// queue, and in front of it a place to wait for those messages that find no room.
///
/// The queue makes its producers wait until there is room. Those who post must not wait: they hold locks, and have
/// other consoles to serve. So what finds no room at once is put down here, and one thread, the feeder, takes it into
/// the queue in their stead and does the waiting. Responses, notices and serial data keep their order. Serial data is
/// of low priority: it gets in while less than half of the limit is queued, so that the other half stays for the rest.
///
/// How much waits is up to those who post: hasRoom() and hasSerialRoom() tell them when to stop.
///
/// Thread safety: any number of threads that post, one feeder, one writer. Its lock is held for moments, and never
/// while anybody waits for room or for a message; with it held nothing but the queue is called, and never in a way that
/// waits.
class Outbox {
public:
    /// Bytes of frames that fill the queue, unless said otherwise.
    static constexpr std::size_t kDefaultLimit = 256 * 1024;

    /// @param onRoom  called without the lock, on the feeder's thread, whenever something that waited has got in
    /// @param limitBytes  more than 0
    explicit Outbox(std::function<void()> onRoom, std::size_t limitBytes = kDefaultLimit);

    /// Takes a response or a notice, even without room. After finish() or abandon() it is dropped.
    void post(std::unique_ptr<QelMessage> message);

    /// Takes serial data, even without room. After finish() or abandon() it is dropped.
    void postSerial(std::unique_ptr<QelMessage> message);

    /// Takes a message only while less than the limit is queued. It may pass those that wait for room.
    /// @return false: it is dropped, and counted so in the statistics
    bool offer(std::unique_ptr<QelMessage> message);

    /// False while a response or a notice waits for room.
    bool hasRoom() const;

    /// False while anything waits for room.
    bool hasSerialRoom() const;

    /// Nothing more will be posted; what is here still goes out.
    void finish();

    /// Drops what is here: nothing can be written any more. Feeder and writer come to their ends.
    void abandon();

    /// Prints the limits and the statistics of the queue. What waits in front of it is not in them yet.
    /// @param indent  in front of every line
    void dumpStatistics(std::ostream& os, const Indent& indent) const;

    // The feeder's side.

    /// Takes into the queue what waits for room, until all of it is in and nothing more will be posted.
    void feed();

    // The writer's side.

    /// Waits for the next message. @return null: there will be none
    std::unique_ptr<QelMessage> take();

    /// The writer has ended.
    void setWritten();

    /// Waits for the writer to end. @return false: it has not within the time
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
    // What is in the queue: counted before it is in, and until after it is out, so that the queue never holds more.
    QelMessageCount mQueued QEL_GUARDED_BY(mMutex);
    bool mFinished QEL_GUARDED_BY(mMutex) = false;
    bool mWritten QEL_GUARDED_BY(mMutex) = false;
};

} // namespace qel::tool
