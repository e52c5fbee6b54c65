#pragma once

#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <condition_variable>
#include <mutex>

namespace qel {

/// A std::condition_variable that works with UniqueMutexLock.
///
/// A wait may end spuriously: call it in a loop that checks the condition.
/// Lifetime: must outlive every wait and every notify call.
/// Thread safety: any thread may call the notify functions, with or without the mutex; all threads that wait at the
/// same time must use the same mutex.
class ConditionVariable {
public:
    ConditionVariable() = default;
    ConditionVariable(const ConditionVariable&) = delete;
    ConditionVariable& operator=(const ConditionVariable&) = delete;

    /// Releases the mutex, sleeps until woken, and takes the mutex again.
    /// @param lock  holds its mutex, before and after
    void wait(UniqueMutexLock& lock)
    {
        const Loan loan(lock);
        mCondition.wait(*loan);
    }

    /// As wait(), but not beyond the given time.
    /// @return false when the time has passed
    template <typename Clock, typename Duration>
    bool waitUntil(UniqueMutexLock& lock, const std::chrono::time_point<Clock, Duration>& deadline)
    {
        const Loan loan(lock);
        return mCondition.wait_until(*loan, deadline) == std::cv_status::no_timeout;
    }

    /// Wakes one of the waiting threads, if there is one.
    void notifyOne() noexcept { mCondition.notify_one(); }
    /// Wakes all waiting threads.
    void notifyAll() noexcept { mCondition.notify_all(); }

private:
    /// Presents the mutex that a lock holds as a std::unique_lock, and leaves it locked at the end.
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
