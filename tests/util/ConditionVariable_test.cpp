#include <qel/common/util/ConditionVariable.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <gtest/gtest.h>
#include <thread>
#include <type_traits>
#include <vector>

namespace qel {
namespace {

using namespace std::chrono_literals;

/// A gate that threads wait at, and what guards it.
struct Gate {
    Mutex mutex;
    ConditionVariable condition;
    bool open QEL_GUARDED_BY(mutex) = false;
    int passed QEL_GUARDED_BY(mutex) = 0;

    void pass()
    {
        UniqueMutexLock lock(mutex);
        while (!open)
            condition.wait(lock);
        ++passed;
        EXPECT_TRUE(lock.ownsLock());
    }

    bool hasWaiters()
    {
        const MutexLock lock(mutex);
        return condition.hasWaiters();
    }

    void waitForWaiters()
    {
        while (!hasWaiters())
            std::this_thread::yield();
    }
};

TEST(ConditionVariable, WakesOneThread)
{
    Gate gate;
    std::thread waiter([&] { gate.pass(); });
    gate.waitForWaiters();
    {
        const MutexLock lock(gate.mutex);
        gate.open = true;
    }
    gate.condition.notifyOne();
    waiter.join();
    EXPECT_FALSE(gate.hasWaiters());
}

TEST(ConditionVariable, WakesAllThreads)
{
    Gate gate;
    std::vector<std::thread> waiters;
    for (int i = 0; i < 4; ++i)
        waiters.emplace_back([&] { gate.pass(); });
    gate.waitForWaiters();
    {
        const MutexLock lock(gate.mutex);
        gate.open = true;
    }
    gate.condition.notifyAll();
    for (std::thread& waiter : waiters)
        waiter.join();
    const MutexLock lock(gate.mutex);
    EXPECT_EQ(gate.passed, 4);
    EXPECT_FALSE(gate.condition.hasWaiters());
}

TEST(ConditionVariable, GivesTheMutexBackWhileItWaits)
{
    Gate gate;
    std::thread waiter([&] { gate.pass(); });
    gate.waitForWaiters(); // takes the mutex
    {
        const MutexLock lock(gate.mutex);
        gate.open = true;
        gate.condition.notifyOne(); // with the mutex held does as well
    }
    waiter.join();
}

TEST(ConditionVariable, TellsThatATimeHasPassedAndHoldsTheMutexThen)
{
    Mutex mutex;
    ConditionVariable condition;
    UniqueMutexLock lock(mutex);
    const auto deadline = std::chrono::steady_clock::now() + 5ms;
    while (condition.waitUntil(lock, deadline)) { // may wake without cause
    }
    EXPECT_GE(std::chrono::steady_clock::now(), deadline);
    EXPECT_TRUE(lock.ownsLock());
    EXPECT_FALSE(condition.hasWaiters());
    bool taken = true;
    std::thread([&] { taken = mutex.try_lock(); }).join();
    EXPECT_FALSE(taken);
}

TEST(ConditionVariable, IsWokenBeforeATimeHasPassed)
{
    Gate gate;
    std::thread waiter([&] {
        UniqueMutexLock lock(gate.mutex);
        const auto deadline = std::chrono::steady_clock::now() + 24h;
        while (!gate.open)
            ASSERT_TRUE(gate.condition.waitUntil(lock, deadline));
    });
    gate.waitForWaiters();
    {
        const MutexLock lock(gate.mutex);
        gate.open = true;
    }
    gate.condition.notifyOne();
    waiter.join();
}

TEST(ConditionVariable, WakingNobodyDoesNothing)
{
    ConditionVariable condition;
    condition.notifyOne();
    condition.notifyAll();
    Mutex mutex;
    const MutexLock lock(mutex);
    EXPECT_FALSE(condition.hasWaiters());
}

TEST(ConditionVariable, IsNotCopied)
{
    EXPECT_FALSE(std::is_copy_constructible<ConditionVariable>::value);
    EXPECT_FALSE(std::is_copy_assignable<ConditionVariable>::value);
}

} // namespace
} // namespace qel
