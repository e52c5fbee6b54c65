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

/// A gate at which threads wait.
struct Gate {
    Mutex mutex;
    ConditionVariable condition;
    bool open QEL_GUARDED_BY(mutex) = false;
    int arrived QEL_GUARDED_BY(mutex) = 0; // and asleep, once another thread has the mutex
    int passed QEL_GUARDED_BY(mutex) = 0;

    void pass()
    {
        UniqueMutexLock lock(mutex);
        ++arrived;
        while (!open)
            condition.wait(lock);
        ++passed;
        EXPECT_TRUE(lock.ownsLock());
    }

    void waitForArrivals(int count)
    {
        for (;;) {
            {
                const MutexLock lock(mutex);
                if (arrived == count) return;
            }
            std::this_thread::yield();
        }
    }

    void openUp()
    {
        const MutexLock lock(mutex);
        open = true;
    }
};

TEST(ConditionVariable, WakesOneThread)
{
    Gate gate;
    std::thread waiter([&] { gate.pass(); });
    gate.waitForArrivals(1);
    gate.openUp();
    gate.condition.notifyOne();
    waiter.join();
}

TEST(ConditionVariable, WakesAllThreads)
{
    Gate gate;
    std::vector<std::thread> waiters;
    for (int i = 0; i < 4; ++i)
        waiters.emplace_back([&] { gate.pass(); });
    gate.waitForArrivals(4);
    gate.openUp();
    gate.condition.notifyAll();
    for (std::thread& waiter : waiters)
        waiter.join();
    const MutexLock lock(gate.mutex);
    EXPECT_EQ(gate.passed, 4);
}

TEST(ConditionVariable, MayBeNotifiedWithTheMutexHeld)
{
    Gate gate;
    std::thread waiter([&] { gate.pass(); });
    gate.waitForArrivals(1);
    {
        const MutexLock lock(gate.mutex);
        gate.open = true;
        gate.condition.notifyOne();
    }
    waiter.join();
}

TEST(ConditionVariable, ReportsATimeoutAndHoldsTheMutex)
{
    Mutex mutex;
    ConditionVariable condition;
    UniqueMutexLock lock(mutex);
    const auto deadline = std::chrono::steady_clock::now() + 5ms;
    while (condition.waitUntil(lock, deadline)) { // may wake spuriously
    }
    EXPECT_GE(std::chrono::steady_clock::now(), deadline);
    EXPECT_TRUE(lock.ownsLock());
    bool taken = true;
    std::thread([&] { taken = mutex.try_lock(); }).join();
    EXPECT_FALSE(taken);
}

TEST(ConditionVariable, IsWokenBeforeItsTimeout)
{
    Gate gate;
    std::thread waiter([&] {
        UniqueMutexLock lock(gate.mutex);
        ++gate.arrived;
        const auto deadline = std::chrono::steady_clock::now() + 24h;
        while (!gate.open)
            ASSERT_TRUE(gate.condition.waitUntil(lock, deadline));
    });
    gate.waitForArrivals(1);
    gate.openUp();
    gate.condition.notifyOne();
    waiter.join();
}

TEST(ConditionVariable, NotifyingWithoutWaitingThreadsDoesNothing)
{
    ConditionVariable condition;
    condition.notifyOne();
    condition.notifyAll();
}

TEST(ConditionVariable, IsNotCopied)
{
    EXPECT_FALSE(std::is_copy_constructible<ConditionVariable>::value);
    EXPECT_FALSE(std::is_copy_assignable<ConditionVariable>::value);
}

} // namespace
} // namespace qel
