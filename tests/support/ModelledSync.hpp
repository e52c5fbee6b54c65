#pragma once

#include <qel/common/util/Mutex.hpp>

#include "support/Interleavings.hpp"

#include <chrono>

/// @file
/// Replacements for the library's mutex, locks and condition variable, under the same names and with the same
/// operations, for code that Interleavings runs. See tests/ModelledQueue.hpp for how code comes to use them.

namespace qel::modelled {

class QEL_CAPABILITY("mutex") Mutex {
public:
    Mutex() { test::Interleavings::create(this, "mutex"); }
    ~Mutex() { test::Interleavings::destroy(this); }
    Mutex(const Mutex&) = delete;
    Mutex& operator=(const Mutex&) = delete;

    void lock() QEL_ACQUIRE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        test::Interleavings::perform(test::Interleavings::Operation::Lock, this);
    }
    void unlock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        test::Interleavings::perform(test::Interleavings::Operation::Unlock, this);
    }
};

class QEL_SCOPED_CAPABILITY MutexLock {
public:
    explicit MutexLock(Mutex& mutex) QEL_ACQUIRE(mutex) : mMutex(mutex) { mMutex.lock(); }
    ~MutexLock() QEL_RELEASE() { mMutex.unlock(); }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

private:
    Mutex& mMutex;
};

class QEL_SCOPED_CAPABILITY UniqueMutexLock {
public:
    explicit UniqueMutexLock(Mutex& mutex) QEL_ACQUIRE(mutex) QEL_NO_THREAD_SAFETY_ANALYSIS : mMutex(mutex) { lock(); }
    ~UniqueMutexLock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        if (mOwns) unlock();
    }
    UniqueMutexLock(const UniqueMutexLock&) = delete;
    UniqueMutexLock& operator=(const UniqueMutexLock&) = delete;

    void lock() QEL_ACQUIRE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        mMutex.lock();
        mOwns = true;
    }
    void unlock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        mOwns = false;
        mMutex.unlock();
    }
    bool ownsLock() const noexcept { return mOwns; }

private:
    friend class ConditionVariable;

    Mutex& mMutex;
    bool mOwns = false;
};

class ConditionVariable {
public:
    ConditionVariable() { test::Interleavings::create(this, "condition variable"); }
    ~ConditionVariable() { test::Interleavings::destroy(this); }
    ConditionVariable(const ConditionVariable&) = delete;
    ConditionVariable& operator=(const ConditionVariable&) = delete;

    void wait(UniqueMutexLock& lock) { test::Interleavings::sleep(this, &lock.mMutex, false); }

    template <typename Clock, typename Duration>
    bool waitUntil(UniqueMutexLock& lock, const std::chrono::time_point<Clock, Duration>&)
    {
        return test::Interleavings::sleep(this, &lock.mMutex, true);
    }

    void notifyOne() { test::Interleavings::perform(test::Interleavings::Operation::NotifyOne, this); }
    void notifyAll() { test::Interleavings::perform(test::Interleavings::Operation::NotifyAll, this); }
};

} // namespace qel::modelled
