#pragma once

#include <mutex>

/// @file
/// A mutex that clang's thread-safety analysis understands, and the annotations that go with it. The annotations cost
/// nothing at run time and are empty for other compilers.
/// See https://clang.llvm.org/docs/ThreadSafetyAnalysis.html for what each one promises.

#if defined(__clang__)
#define QEL_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define QEL_THREAD_ANNOTATION(x)
#endif

/// The type can be held, such as a mutex.
#define QEL_CAPABILITY(name) QEL_THREAD_ANNOTATION(capability(name))
/// The type holds a mutex from its construction to its destruction.
#define QEL_SCOPED_CAPABILITY QEL_THREAD_ANNOTATION(scoped_lockable)
/// The member may be touched only while the mutex is held.
#define QEL_GUARDED_BY(mutex) QEL_THREAD_ANNOTATION(guarded_by(mutex))
/// What the member points to may be touched only while the mutex is held.
#define QEL_PT_GUARDED_BY(mutex) QEL_THREAD_ANNOTATION(pt_guarded_by(mutex))
/// The caller must hold the mutex.
#define QEL_REQUIRES(...) QEL_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
/// The caller must not hold the mutex.
#define QEL_EXCLUDES(...) QEL_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
/// The function takes the mutex and returns holding it.
#define QEL_ACQUIRE(...) QEL_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
/// The function gives the mutex back.
#define QEL_RELEASE(...) QEL_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
/// The function takes the mutex when it returns the given value.
#define QEL_TRY_ACQUIRE(...) QEL_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
/// The function is exempt from the analysis; a comment beside it says why.
#define QEL_NO_THREAD_SAFETY_ANALYSIS QEL_THREAD_ANNOTATION(no_thread_safety_analysis)

namespace qel {

/// A std::mutex under a name that the thread-safety analysis knows.
/// Thread safety: that is its purpose. Not recursive: a thread that holds it must not take it again.
class QEL_CAPABILITY("mutex") Mutex {
public:
    Mutex() = default;
    Mutex(const Mutex&) = delete;
    Mutex& operator=(const Mutex&) = delete;

    /// Blocks until the calling thread holds the mutex. @throws std::system_error as std::mutex::lock does
    void lock() QEL_ACQUIRE() { mMutex.lock(); }
    /// Gives the mutex back; the calling thread must hold it.
    void unlock() QEL_RELEASE() { mMutex.unlock(); }
    /// @return true when the calling thread now holds the mutex; never blocks
    bool try_lock() QEL_TRY_ACQUIRE(true) { return mMutex.try_lock(); }

private:
    friend class ConditionVariable;

    std::mutex mMutex;
};

/// Holds a Mutex for the length of a block.
/// Lifetime: borrows the mutex, which must outlive it.
class QEL_SCOPED_CAPABILITY MutexLock {
public:
    explicit MutexLock(Mutex& mutex) QEL_ACQUIRE(mutex) : mMutex(mutex) { mMutex.lock(); }
    ~MutexLock() QEL_RELEASE() { mMutex.unlock(); }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

private:
    Mutex& mMutex;
};

/// Holds a Mutex for the length of a block, and can give it back meanwhile: around a wait for the network, say.
/// Lifetime: borrows the mutex, which must outlive it.
/// Thread safety: belongs to the thread that made it.
class QEL_SCOPED_CAPABILITY UniqueMutexLock {
public:
    // The bodies are exempt from the analysis, which does not know std::unique_lock; the callers are not.

    /// Blocks until the calling thread holds the mutex.
    explicit UniqueMutexLock(Mutex& mutex) QEL_ACQUIRE(mutex) QEL_NO_THREAD_SAFETY_ANALYSIS : mLock(mutex) {}
    /// Gives the mutex back, if it is held just then.
    ~UniqueMutexLock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS {}
    UniqueMutexLock(const UniqueMutexLock&) = delete;
    UniqueMutexLock& operator=(const UniqueMutexLock&) = delete;

    /// Takes the mutex again. @throws std::system_error  it is held already
    void lock() QEL_ACQUIRE() QEL_NO_THREAD_SAFETY_ANALYSIS { mLock.lock(); }
    /// Gives the mutex back early. @throws std::system_error  it is not held
    void unlock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS { mLock.unlock(); }
    /// @return whether the mutex is held through this object
    bool ownsLock() const noexcept { return mLock.owns_lock(); }

private:
    friend class ConditionVariable;

    std::unique_lock<Mutex> mLock;
};

} // namespace qel
