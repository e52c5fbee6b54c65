#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>

namespace qel::tool {

/// What stands between those who have something to say to one console and the one thread that writes to it: a queue
/// that never makes its producers wait, and tells them when it is full.
///
/// Thread safety: any number of producers, one writer. Its lock is a leaf: nothing is called with it held.
class Outbox {
public:
    /// Bytes of frames that make the outbox full, unless said otherwise.
    static constexpr std::size_t kDefaultLimit = 256 * 1024;

    /// @param onRoom  called without the lock, on the writer's thread, when the outbox was full and has room again
    /// @param limitBytes  more than 0
    explicit Outbox(std::function<void()> onRoom, std::size_t limitBytes = kDefaultLimit);

    /// Queues a message, even beyond the limit. After finish() or abandon() it is dropped.
    void post(std::unique_ptr<QelMessage> message);

    /// True while less than the limit is queued or being written.
    bool hasRoom() const;

    /// Nothing more will be posted; what is queued still goes out.
    void finish();

    // The writer's side.

    /// Waits for the next message. The one taken before counts as written from now on.
    /// @return null: there will be none
    std::unique_ptr<QelMessage> take();

    /// Drops what is queued: nothing can be written any more.
    void abandon();

    /// The writer has ended.
    void setWritten();

    /// Waits for the writer to end. @return false: it has not within the time
    bool waitUntilWritten(std::chrono::milliseconds timeout) const;

private:
    const std::function<void()> mOnRoom;
    const std::size_t mLimitBytes;

    mutable Mutex mMutex;
    mutable std::condition_variable_any mChanged;
    std::deque<std::unique_ptr<QelMessage>> mMessages QEL_GUARDED_BY(mMutex);
    std::size_t mBytes QEL_GUARDED_BY(mMutex) = 0;        // frame lengths of mMessages and of the one being written
    std::size_t mWritingBytes QEL_GUARDED_BY(mMutex) = 0; // frame length of the one being written
    bool mFinished QEL_GUARDED_BY(mMutex) = false;
    bool mWritten QEL_GUARDED_BY(mMutex) = false;
};

} // namespace qel::tool
