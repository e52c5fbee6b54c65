#include <qel/common/util/Mutex.hpp>

#include <gtest/gtest.h>
#include <stdexcept>
#include <system_error>
#include <thread>
#include <type_traits>
#include <vector>

namespace qel {
namespace {

/// @return whether another thread can lock the mutex now; it is unlocked again afterwards
bool anotherThreadCanTake(Mutex& mutex)
{
    bool taken = false;
    std::thread other([&] {
        if (mutex.try_lock()) {
            taken = true;
            mutex.unlock();
        }
    });
    other.join();
    return taken;
}

struct Counter {
    Mutex mutex;
    long value QEL_GUARDED_BY(mutex) = 0;
};

TEST(Mutex, ExcludesOtherThreadsWhileHeld)
{
    Mutex mutex;
    EXPECT_TRUE(anotherThreadCanTake(mutex));
    mutex.lock();
    EXPECT_FALSE(anotherThreadCanTake(mutex));
    mutex.unlock();
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

TEST(Mutex, TryLockHoldsTheMutexOnSuccess)
{
    Mutex mutex;
    if (mutex.try_lock()) {
        EXPECT_FALSE(anotherThreadCanTake(mutex));
        mutex.unlock();
    } else {
        ADD_FAILURE() << "the mutex is free";
    }
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

TEST(MutexLock, HoldsTheMutexForTheLengthOfABlock)
{
    Mutex mutex;
    {
        const MutexLock lock(mutex);
        EXPECT_FALSE(anotherThreadCanTake(mutex));
    }
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

TEST(MutexLock, ReleasesTheMutexWhenAnExceptionLeavesTheBlock)
{
    Mutex mutex;
    EXPECT_THROW(
        {
            const MutexLock lock(mutex);
            throw std::runtime_error("leave");
        },
        std::runtime_error);
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

TEST(MutexLock, OnlyOneThreadAtATimeIsInside)
{
    constexpr long kThreads = 4;
    constexpr long kRounds = 1000;
    Counter counter;
    std::vector<std::thread> threads;
    for (long i = 0; i < kThreads; ++i) {
        threads.emplace_back([&counter] {
            for (long round = 0; round < kRounds; ++round) {
                const MutexLock lock(counter.mutex);
                ++counter.value;
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    const MutexLock lock(counter.mutex);
    EXPECT_EQ(counter.value, kThreads * kRounds);
}

TEST(UniqueMutexLock, HoldsTheMutexForTheLengthOfABlock)
{
    Mutex mutex;
    {
        const UniqueMutexLock lock(mutex);
        EXPECT_TRUE(lock.ownsLock());
        EXPECT_FALSE(anotherThreadCanTake(mutex));
    }
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

TEST(UniqueMutexLock, ReleasesTheMutexAndAcquiresItAgain)
{
    Mutex mutex;
    {
        UniqueMutexLock lock(mutex);
        lock.unlock();
        EXPECT_FALSE(lock.ownsLock());
        EXPECT_TRUE(anotherThreadCanTake(mutex));
        lock.lock();
        EXPECT_TRUE(lock.ownsLock());
        EXPECT_FALSE(anotherThreadCanTake(mutex));
    }
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

TEST(UniqueMutexLock, MayEndWithoutTheMutex)
{
    Mutex mutex;
    {
        UniqueMutexLock lock(mutex);
        lock.unlock();
    }
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

#if !defined(__clang__) // clang's analysis refuses to compile both
TEST(UniqueMutexLock, RefusesToLockTwiceAndToUnlockTwice)
{
    Mutex mutex;
    UniqueMutexLock lock(mutex);
    EXPECT_THROW(lock.lock(), std::system_error);
    lock.unlock();
    EXPECT_THROW(lock.unlock(), std::system_error);
}
#endif

TEST(Mutex, NoClassIsCopyable)
{
    EXPECT_FALSE(std::is_copy_constructible<Mutex>::value);
    EXPECT_FALSE(std::is_copy_assignable<Mutex>::value);
    EXPECT_FALSE(std::is_copy_constructible<MutexLock>::value);
    EXPECT_FALSE(std::is_copy_assignable<MutexLock>::value);
    EXPECT_FALSE(std::is_copy_constructible<UniqueMutexLock>::value);
    EXPECT_FALSE(std::is_copy_assignable<UniqueMutexLock>::value);
}

} // namespace
} // namespace qel
