#pragma once

#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <condition_variable>
#include <mutex>

namespace qel {

/// Where threads wait for other threads to change what a Mutex guards: a std::condition_variable that works with
/// UniqueMutexLock.
///
/// Waits may end without cause, as those of the standard do: wait in a loop that looks at the condition again.
/// Lifetime: must outlive every wait and every notify call.
/// Thread safety: all waits of one time need one and the same mutex; the notify calls need none.
class ConditionVariable {
public:
    ConditionVariable() = default;
    ConditionVariable(const ConditionVariable&) = delete;
    ConditionVariable& operator=(const ConditionVariable&) = delete;

    /// Gives the mutex back, sleeps until woken, and takes the mutex again.
    /// @param lock  holds its mutex
    void wait(UniqueMutexLock& lock)
    {
        const Loan loan(lock);
        mCondition.wait(*loan);
    }

    /// As wait(), but no longer than until the given time.
    /// @return false when the time has passed
    template <typename Clock, typename Duration>
    bool waitUntil(UniqueMutexLock& lock, const std::chrono::time_point<Clock, Duration>& deadline)
    {
        const Loan loan(lock);
        return mCondition.wait_until(*loan, deadline) == std::cv_status::no_timeout;
    }

    /// Wakes one of the threads that wait, if there is one.
    void notifyOne() noexcept { mCondition.notify_one(); }
    /// Wakes all threads that wait.
    void notifyAll() noexcept { mCondition.notify_all(); }

private:
    /// Lends the mutex that a lock holds to the standard's condition variable, and takes it back still locked.
    class Loan {
    public:
        explicit Loan(UniqueMutexLock& lock) : mLock(lock.mLock.mutex()->mMutex, std::adopt_lock) {}
        ~Loan() { mLock.release(); }
        Loan(const Loan&) = delete;
        Loan& operator=(const Loan&) = delete;
        std::unique_lock<std::mutex>& operator*() const { return mLock; }

    private:
        mutable std::unique_lock<std::mutex> mLock;
    };

    std::condition_variable mCondition;
};

} // namespace qel
