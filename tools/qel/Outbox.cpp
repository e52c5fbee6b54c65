#include "Outbox.hpp"

#include <utility>

namespace qel::tool {

Outbox::Outbox(std::function<void()> onRoom, std::size_t limitBytes)
    : mOnRoom(std::move(onRoom)), mLimitBytes(limitBytes)
{}

void Outbox::post(std::unique_ptr<QelMessage> message)
{
    const MutexLock lock(mMutex);
    if (mFinished) return;
    mBytes += message->msgLength();
    mMessages.push_back(std::move(message));
    mChanged.notify_all();
}

bool Outbox::hasRoom() const
{
    const MutexLock lock(mMutex);
    return mBytes < mLimitBytes;
}

void Outbox::finish()
{
    const MutexLock lock(mMutex);
    mFinished = true;
    mChanged.notify_all();
}

std::unique_ptr<QelMessage> Outbox::take()
{
    bool hasRoomAgain = false;
    {
        const MutexLock lock(mMutex);
        const bool wasFull = mBytes >= mLimitBytes;
        mBytes -= mWritingBytes;
        mWritingBytes = 0;
        hasRoomAgain = wasFull && mBytes < mLimitBytes;
    }
    if (hasRoomAgain) mOnRoom();

    const MutexLock lock(mMutex);
    while (mMessages.empty() && !mFinished)
        mChanged.wait(mMutex);
    if (mMessages.empty()) return nullptr;
    std::unique_ptr<QelMessage> message = std::move(mMessages.front());
    mMessages.pop_front();
    mWritingBytes = message->msgLength();
    return message;
}

void Outbox::abandon()
{
    const MutexLock lock(mMutex);
    mFinished = true;
    mMessages.clear();
    mBytes = 0;
    mWritingBytes = 0;
    mChanged.notify_all();
}

void Outbox::setWritten()
{
    const MutexLock lock(mMutex);
    mWritten = true;
    mChanged.notify_all();
}

bool Outbox::waitUntilWritten(std::chrono::milliseconds timeout) const
{
    const auto end = std::chrono::steady_clock::now() + timeout;
    const MutexLock lock(mMutex);
    while (!mWritten) {
        if (mChanged.wait_until(mMutex, end) == std::cv_status::timeout) return mWritten;
    }
    return true;
}

} // namespace qel::tool
