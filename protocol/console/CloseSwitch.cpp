#include "console/CloseSwitch.hpp"

#include "base/Guard.hpp"

namespace qel::protocol {

void CloseSwitch::close() noexcept
{
    const MutexLock lock(mMutex);
    mClosed = true;
    pCloseLocked();
    mChanged.notifyAll();
}

bool CloseSwitch::isClosed() const
{
    const MutexLock lock(mMutex);
    return mClosed;
}

void CloseSwitch::watch(StreamBase* stream) noexcept
{
    const MutexLock lock(mMutex);
    mStream = stream;
    if (mClosed) pCloseLocked();
}

bool CloseSwitch::sleepUntil(std::chrono::steady_clock::time_point time)
{
    UniqueMutexLock lock(mMutex);
    while (!mClosed) {
        if (!mChanged.waitUntil(lock, time)) break;
    }
    return !mClosed;
}

void CloseSwitch::pCloseLocked() noexcept
{
    if (mStream == nullptr) return;
    try {
        mStream->close();
    } catch (...) {
        logCurrentAt(LogLevel::Debug, "while closing");
    }
}

} // namespace qel::protocol
