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

/// The type is a capability, such as a mutex, that a thread can hold.
#define QEL_CAPABILITY(name) QEL_THREAD_ANNOTATION(capability(name))
/// An object of the type holds a mutex from construction to destruction.
#define QEL_SCOPED_CAPABILITY QEL_THREAD_ANNOTATION(scoped_lockable)
/// The member may be accessed only while the mutex is held.
#define QEL_GUARDED_BY(mutex) QEL_THREAD_ANNOTATION(guarded_by(mutex))
/// The object that the member points to may be accessed only while the mutex is held.
#define QEL_PT_GUARDED_BY(mutex) QEL_THREAD_ANNOTATION(pt_guarded_by(mutex))
/// The caller must hold the mutex.
#define QEL_REQUIRES(...) QEL_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
/// The caller must not hold the mutex.
#define QEL_EXCLUDES(...) QEL_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
/// The function acquires the mutex and returns holding it.
#define QEL_ACQUIRE(...) QEL_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
/// The function releases the mutex.
#define QEL_RELEASE(...) QEL_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
/// The function has acquired the mutex if it returns the given value.
#define QEL_TRY_ACQUIRE(...) QEL_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
/// The function is exempt from the analysis; a comment beside it says why.
#define QEL_NO_THREAD_SAFETY_ANALYSIS QEL_THREAD_ANNOTATION(no_thread_safety_analysis)

namespace qel {

/// A std::mutex that the thread-safety analysis knows.
/// Lifetime: must outlive every thread that waits for it or holds it.
/// Thread safety: any thread may call every operation. Not recursive: a thread that holds it must not lock it again.
class QEL_CAPABILITY("mutex") Mutex {
public:
    Mutex() = default;
    Mutex(const Mutex&) = delete;
    Mutex& operator=(const Mutex&) = delete;

    /// Blocks until the calling thread holds the mutex.
    /// @throws std::system_error  as std::mutex::lock does
    void lock() QEL_ACQUIRE() { mMutex.lock(); }
    /// Releases the mutex; the calling thread must hold it.
    void unlock() QEL_RELEASE() { mMutex.unlock(); }
    /// Never blocks.
    /// @return true if the calling thread now holds the mutex
    bool try_lock() QEL_TRY_ACQUIRE(true) { return mMutex.try_lock(); }

private:
    friend class ConditionVariable;

    std::mutex mMutex;
};

/// Holds a Mutex for the length of a block.
/// Lifetime: borrows the mutex, which must outlive it.
/// Thread safety: belongs to the thread that made it.
class QEL_SCOPED_CAPABILITY MutexLock {
public:
    /// Blocks until the calling thread holds the mutex.
    /// @throws std::system_error  as std::mutex::lock does
    explicit MutexLock(Mutex& mutex) QEL_ACQUIRE(mutex) : mMutex(mutex) { mMutex.lock(); }
    ~MutexLock() QEL_RELEASE() { mMutex.unlock(); }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

private:
    Mutex& mMutex;
};

/// Holds a Mutex for the length of a block and can release it for a while, for example around a wait for the network.
/// Lifetime: borrows the mutex, which must outlive it.
/// Thread safety: belongs to the thread that made it.
class QEL_SCOPED_CAPABILITY UniqueMutexLock {
public:
    // The analysis does not know std::unique_lock, so the bodies are exempt from it; the callers are checked.

    /// Blocks until the calling thread holds the mutex.
    explicit UniqueMutexLock(Mutex& mutex) QEL_ACQUIRE(mutex) QEL_NO_THREAD_SAFETY_ANALYSIS : mLock(mutex) {}
    /// Releases the mutex if it is held.
    ~UniqueMutexLock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS {} // NOLINT(modernize-use-equals-default)
    UniqueMutexLock(const UniqueMutexLock&) = delete;
    UniqueMutexLock& operator=(const UniqueMutexLock&) = delete;

    /// Acquires the mutex again.
    /// @throws std::system_error  it is already held through this object
    void lock() QEL_ACQUIRE() QEL_NO_THREAD_SAFETY_ANALYSIS { mLock.lock(); }
    /// Releases the mutex early.
    /// @throws std::system_error  it is not held through this object
    void unlock() QEL_RELEASE() QEL_NO_THREAD_SAFETY_ANALYSIS { mLock.unlock(); }
    /// @return whether the mutex is held through this object
    bool ownsLock() const noexcept { return mLock.owns_lock(); }

private:
    friend class ConditionVariable;

    std::unique_lock<Mutex> mLock;
};

} // namespace qel
