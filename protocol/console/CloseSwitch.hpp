#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>

namespace qel::protocol {

/// What Console::close() reaches from another thread: the stream in use, and the wait between two attempts to connect.
/// Once closed it stays closed.
/// Thread safety: close() and isClosed() from any thread; the rest from the thread of the console.
class CloseSwitch {
public:
    CloseSwitch() = default;
    CloseSwitch(const CloseSwitch&) = delete;
    CloseSwitch& operator=(const CloseSwitch&) = delete;

    /// Closes the watched stream and wakes sleepUntil().
    void close() noexcept;

    bool isClosed() const;

    /// Sets the stream that close() closes; closes it at once if close() has been called.
    /// @param stream  borrowed until the next call; null: none
    void watch(StreamBase* stream) noexcept;

    /// @return false: close() has been called, before or meanwhile
    bool sleepUntil(std::chrono::steady_clock::time_point time);

private:
    void pCloseLocked() noexcept QEL_REQUIRES(mMutex);

    mutable Mutex mMutex;
    ConditionVariable mChanged;
    StreamBase* mStream QEL_GUARDED_BY(mMutex) = nullptr;
    bool mClosed QEL_GUARDED_BY(mMutex) = false;
};

} // namespace qel::protocol
