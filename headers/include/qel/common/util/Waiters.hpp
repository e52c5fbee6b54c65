#pragma once

#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <cstddef>

namespace qel {

/// The threads that wait for one thing, with a count of those that nobody has woken yet. So a thread that has nobody to
/// wake does without the waking, which costs more than all the rest of a short critical section even when it finds
/// nobody (measured); and one that has decides it with the mutex held and does it after giving the mutex back:
/// @code
/// const bool wake = mReaders.claimOne(); // the mutex is held
/// lock.unlock();
/// if (wake) mReaders.wakeOne();
/// @endcode
/// That a claim is not repeated loses nobody: as many threads as were claimed are on their way to look again, or will
/// be as soon as their wakeOne() is called. A thread that comes back on its own, since its time has passed or without
/// cause, counts as one of them; at worst one is woken too many.
///
/// Waits may end without cause: wait in a loop that looks at the condition again.
/// Lifetime: must outlive every wait and every call of wakeOne() and wakeAll().
/// Thread safety: everything but wakeOne() and wakeAll() needs the one mutex that goes with this object.
class Waiters {
public:
    Waiters() = default;
    Waiters(const Waiters&) = delete;
    Waiters& operator=(const Waiters&) = delete;

    /// Gives the mutex back, sleeps until woken, and takes the mutex again.
    void wait(UniqueMutexLock& lock)
    {
        ++mWaiting;
        mCondition.wait(lock);
        pComeBack();
    }

    /// As wait(), but no longer than until the given time. @return false when the time has passed
    template <typename Clock, typename Duration>
    bool waitUntil(UniqueMutexLock& lock, const std::chrono::time_point<Clock, Duration>& deadline)
    {
        ++mWaiting;
        const bool inTime = mCondition.waitUntil(lock, deadline);
        pComeBack();
        return inTime;
    }

    /// @return whether there is a thread to be woken; if so, the caller must call wakeOne(), with or without the mutex
    bool claimOne() noexcept
    {
        if (mWaiting == mClaimed) return false;
        ++mClaimed;
        return true;
    }

    /// Wakes the thread that was claimed, or another one in its place.
    void wakeOne() noexcept { mCondition.notifyOne(); }

    /// Wakes all threads that wait. Needs no claim.
    void wakeAll() noexcept { mCondition.notifyAll(); }

private:
    void pComeBack() noexcept
    {
        --mWaiting;
        if (mClaimed != 0) --mClaimed;
    }

    ConditionVariable mCondition;
    std::size_t mWaiting = 0; // threads inside a wait
    std::size_t mClaimed = 0; // of those, how many have been claimed; never more than wait
};

} // namespace qel
