#include <qel/common/util/Mutex.hpp>

#include <gtest/gtest.h>
#include <stdexcept>
#include <thread>
#include <type_traits>
#include <vector>

namespace qel {
namespace {

/// @return whether another thread could take the mutex just now; it is free again afterwards
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

TEST(Mutex, KeepsOtherThreadsOutWhileHeld)
{
    Mutex mutex;
    EXPECT_TRUE(anotherThreadCanTake(mutex));
    mutex.lock();
    EXPECT_FALSE(anotherThreadCanTake(mutex));
    mutex.unlock();
    EXPECT_TRUE(anotherThreadCanTake(mutex));
}

TEST(Mutex, TryLockHoldsTheMutexWhenItSucceeds)
{
    Mutex mutex;
    if (mutex.try_lock()) {
        EXPECT_FALSE(anotherThreadCanTake(mutex));
        mutex.unlock();
    } else {
        ADD_FAILURE() << "nobody holds it";
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

TEST(MutexLock, GivesTheMutexBackWhenAnExceptionLeavesTheBlock)
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

TEST(Mutex, NeitherIsCopied)
{
    EXPECT_FALSE(std::is_copy_constructible<Mutex>::value);
    EXPECT_FALSE(std::is_copy_assignable<Mutex>::value);
    EXPECT_FALSE(std::is_copy_constructible<MutexLock>::value);
    EXPECT_FALSE(std::is_copy_assignable<MutexLock>::value);
}

} // namespace
} // namespace qel
