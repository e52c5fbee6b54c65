#pragma once

#include <qel/common/util/Mutex.hpp>

#include "support/Interleavings.hpp"

#include <chrono>

/// @file
/// Stand-ins for the library's mutex, its locks, its condition variable and its count of calls, with the same
/// operations, for code that is run by Interleavings.

namespace qel {

class QEL_CAPABILITY("mutex") ModelledMutex {
public:
    ModelledMutex() { test::Interleavings::create(this, "mutex"); }
    ~ModelledMutex() { test::Interleavings::destroy(this); }
    ModelledMutex(const ModelledMutex&) = delete;
    ModelledMutex& operator=(const ModelledMutex&) = delete;

    void lock() QEL_ACQUIRE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        test::Interleavings::perform(test::Interleavings::Operation::Lock, this);
    }
    void unlock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        test::Interleavings::perform(test::Interleavings::Operation::Unlock, this);
    }
};

class QEL_SCOPED_CAPABILITY ModelledMutexLock {
public:
    explicit ModelledMutexLock(ModelledMutex& mutex) QEL_ACQUIRE(mutex) : mMutex(mutex) { mMutex.lock(); }
    ~ModelledMutexLock() QEL_RELEASE() { mMutex.unlock(); }
    ModelledMutexLock(const ModelledMutexLock&) = delete;
    ModelledMutexLock& operator=(const ModelledMutexLock&) = delete;

private:
    ModelledMutex& mMutex;
};

class QEL_SCOPED_CAPABILITY ModelledUniqueMutexLock {
public:
    explicit ModelledUniqueMutexLock(ModelledMutex& mutex) QEL_ACQUIRE(mutex) QEL_NO_THREAD_SAFETY_ANALYSIS
        : mMutex(mutex)
    {
        lock();
    }
    ~ModelledUniqueMutexLock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        if (mOwns) unlock();
    }
    ModelledUniqueMutexLock(const ModelledUniqueMutexLock&) = delete;
    ModelledUniqueMutexLock& operator=(const ModelledUniqueMutexLock&) = delete;

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
    friend class ModelledConditionVariable;

    ModelledMutex& mMutex;
    bool mOwns = false;
};

class ModelledConditionVariable {
public:
    ModelledConditionVariable() { test::Interleavings::create(this, "condition variable"); }
    ~ModelledConditionVariable() { test::Interleavings::destroy(this); }
    ModelledConditionVariable(const ModelledConditionVariable&) = delete;
    ModelledConditionVariable& operator=(const ModelledConditionVariable&) = delete;

    void wait(ModelledUniqueMutexLock& lock) { test::Interleavings::sleep(this, &lock.mMutex, false); }

    template <typename Clock, typename Duration>
    bool waitUntil(ModelledUniqueMutexLock& lock, const std::chrono::time_point<Clock, Duration>&)
    {
        return test::Interleavings::sleep(this, &lock.mMutex, true);
    }

    void notifyOne() { test::Interleavings::perform(test::Interleavings::Operation::NotifyOne, this); }
    void notifyAll() { test::Interleavings::perform(test::Interleavings::Operation::NotifyAll, this); }
};

class ModelledCallsInFlight {
public:
    ModelledCallsInFlight() { test::Interleavings::create(this, "count of calls"); }
    ~ModelledCallsInFlight() { test::Interleavings::destroy(this); }
    ModelledCallsInFlight(const ModelledCallsInFlight&) = delete;
    ModelledCallsInFlight& operator=(const ModelledCallsInFlight&) = delete;

    void enter() { test::Interleavings::perform(test::Interleavings::Operation::Enter, this); }
    void leave() { test::Interleavings::perform(test::Interleavings::Operation::Leave, this); }
    void wait() const { test::Interleavings::perform(test::Interleavings::Operation::WaitZero, this); }
};

} // namespace qel
