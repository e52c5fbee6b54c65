#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>

#include "hypervisor/ConsoleLink.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <ostream>

namespace qel::protocol {

/// The messages on their way to one console: a message queue, and a list of messages that wait for room in it.
///
/// The queue can make its producers wait for room. The threads that post must not wait: they hold locks and serve other
/// consoles. So a message without room is kept here. Only the writer makes room, so the writer moves what waits into
/// the queue whenever it has taken a message out. Responses, notices and serial data keep their order. Serial data has
/// low priority: it enters while less than half of the limit is queued, so that the other half is left for everything
/// else.
///
/// The list is not bounded here: the threads that post stop when hasRoom() or hasSerialRoom() is false.
///
/// Thread safety: any number of threads that post, one writer. No thread waits for a message with the lock held; under
/// it only the queue is called, and never in a way that blocks.
class Outbox : public ConsoleLink {
public:
    /// The default limit of the queue, in bytes of frames.
    static constexpr std::size_t kDefaultLimit = 256 * 1024;

    /// Takes a response or a notice, even without room. Drops it after finish() or abandon().
    void post(std::unique_ptr<QelMessage> message) final;

    /// Takes serial data, even without room. Drops it after finish() or abandon().
    void postSerial(std::unique_ptr<QelMessage> message) final;

    /// Takes a message only while less than the limit is queued. It may overtake messages that wait for room.
    /// @return false: it is dropped, and counted as dropped in the statistics
    bool offer(std::unique_ptr<QelMessage> message) final;

    /// False while a response or a notice waits for room.
    bool hasRoom() const final;

    /// False while any message waits for room.
    bool hasSerialRoom() const final;

    /// Says that nothing more will be posted. Messages already here still go out.
    void finish() final;

    /// Drops all messages, when nothing can be written any more. take() returns null.
    void abandon();

    /// Prints what waits for room and has waited for it, and the limits and the statistics of the queue.
    /// @param indent  at the start of every line
    void dumpStatistics(std::ostream& os, const Indent& indent) const;

    // The writer's side.

    /// Waits for the next message, and moves those that waited for its room into the queue. @return null: there will be
    /// no more
    std::unique_ptr<QelMessage> take();

    /// Says that the writer has ended.
    void setWritten();

    /// Waits for the writer to end. @return false: timeout
    bool waitUntilWritten(std::chrono::milliseconds timeout) const;

protected:
    /// @param limitBytes  more than 0
    explicit Outbox(std::size_t limitBytes);
    ~Outbox() override;

private:
    using TimePoint = std::chrono::steady_clock::time_point;

    struct Waiting {
        std::unique_ptr<QelMessage> message;
        MessageQueuingOptions priority;
        TimePoint since;
    };

    /// At least one message that waited has entered the queue. Called without the lock, on the writer's thread.
    virtual void pOnRoom() = 0;

    void pPost(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority);
    void pEnqueueLocked(std::unique_ptr<QelMessage> message, MessageQueuingOptions priority) QEL_REQUIRES(mMutex);
    bool pMoveWaiting();
    void pShutDownWhenDoneLocked() QEL_REQUIRES(mMutex);

    QelMessageQueue mQueue; // locks itself

    mutable Mutex mMutex;
    mutable ConditionVariable mChanged;
    std::deque<Waiting> mWaiting QEL_GUARDED_BY(mMutex); // for room, in order; empty if the queue is empty
    // Messages in the queue, and in the hands of a writer that has not yet moved what waits.
    std::size_t mQueued QEL_GUARDED_BY(mMutex) = 0;
    std::uint64_t mHaveWaited QEL_GUARDED_BY(mMutex) = 0; // messages that have entered after a wait
    std::chrono::nanoseconds mLongestWait QEL_GUARDED_BY(mMutex){0};
    bool mFinished QEL_GUARDED_BY(mMutex) = false;
    bool mWritten QEL_GUARDED_BY(mMutex) = false;
};

} // namespace qel::protocol
