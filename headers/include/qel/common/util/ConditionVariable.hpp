#pragma once

#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <mutex>

namespace qel {

/// Where threads wait for other threads to change what a Mutex guards: a std::condition_variable that works with
/// UniqueMutexLock, and that knows whether anybody waits. So whoever has nobody to wake can leave it out, and whoever
/// has can decide it under the mutex and do it after giving the mutex back.
///
/// Waits may end without cause, as those of the standard do: wait in a loop that looks at the condition again.
/// Lifetime: must outlive every wait and every notify call.
/// Thread safety: waits and hasWaiters() need the one mutex that goes with this object; the notify calls need none.
class ConditionVariable {
public:
    ConditionVariable() = default;
    ConditionVariable(const ConditionVariable&) = delete;
    ConditionVariable& operator=(const ConditionVariable&) = delete;

    /// Gives the mutex back, sleeps until woken, and takes the mutex again.
    /// @param lock  held; the same mutex in every wait
    void wait(UniqueMutexLock& lock)
    {
        Wait wait(*this, lock);
        mCondition.wait(wait.mStdLock);
    }

    /// As wait(), but no longer than until the given time.
    /// @return false when the time has passed
    template <typename Clock, typename Duration>
    bool waitUntil(UniqueMutexLock& lock, const std::chrono::time_point<Clock, Duration>& deadline)
    {
        Wait wait(*this, lock);
        return mCondition.wait_until(wait.mStdLock, deadline) == std::cv_status::no_timeout;
    }

    /// @return whether any thread is inside a wait, those included that have been woken and do not hold the mutex yet.
    /// Call it with the mutex held.
    bool hasWaiters() const noexcept { return mWaiters != 0; }

    /// Wakes one of the threads that wait, if there is one.
    void notifyOne() noexcept { mCondition.notify_one(); }
    /// Wakes all threads that wait.
    void notifyAll() noexcept { mCondition.notify_all(); }

private:
    /// Counts one wait, and lends the mutex to the standard's condition variable for its length.
    struct Wait {
        Wait(ConditionVariable& condition, UniqueMutexLock& lock)
            : mWaiters(condition.mWaiters), mStdLock(lock.mLock.mutex()->mMutex, std::adopt_lock)
        {
            ++mWaiters;
        }
        ~Wait()
        {
            --mWaiters;
            mStdLock.release(); // still locked, and `lock` goes on holding it
        }
        Wait(const Wait&) = delete;
        Wait& operator=(const Wait&) = delete;

        std::size_t& mWaiters;
        std::unique_lock<std::mutex> mStdLock;
    };

    std::condition_variable mCondition;
    std::size_t mWaiters = 0; // guarded by the mutex that the waits are given
};

} // namespace qel
