// The waiting threads of a queue. That no wake-up is lost in any order: QelMessageQueueModel_test.cpp.

#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/util/Mutex.hpp>

#include <chrono>
#include <gtest/gtest.h>
#include <thread>
#include <type_traits>
#include <vector>

namespace qel {

/// Gives access to the private class.
class QelMessageQueueInspector {
public:
    using Waiters = QelMessageQueue::Waiters;
};

namespace {

using Waiters = QelMessageQueueInspector::Waiters;

using namespace std::chrono_literals;

class QelMessageQueueWaiters : public testing::Test {
protected:
    ~QelMessageQueueWaiters() override
    {
        for (std::thread& thread : mThreads)
            thread.join();
    }

    /// Starts threads that each wait for a ticket, and returns when all of them sleep.
    void startThreads(int count)
    {
        for (int i = 0; i < count; ++i) {
            mThreads.emplace_back([this] {
                UniqueMutexLock lock(mMutex);
                ++mArrived;
                while (mTickets == 0)
                    mWaiters.wait(lock);
                --mTickets;
            });
        }
        waitUntil([this]() QEL_REQUIRES(mMutex) { return mArrived == static_cast<int>(mThreads.size()); });
    }

    template <typename Condition>
    void waitUntil(const Condition& condition) QEL_NO_THREAD_SAFETY_ANALYSIS
    {
        for (;;) {
            mMutex.lock();
            const bool met = condition();
            mMutex.unlock();
            if (met) return;
            std::this_thread::yield();
        }
    }

    bool claimOne()
    {
        const MutexLock lock(mMutex);
        return mWaiters.claimOne();
    }

    void giveTickets(int number)
    {
        const MutexLock lock(mMutex);
        mTickets += number;
    }

    Mutex mMutex;
    Waiters mWaiters;
    int mTickets QEL_GUARDED_BY(mMutex) = 0;
    int mArrived QEL_GUARDED_BY(mMutex) = 0;
    std::vector<std::thread> mThreads;
};

TEST_F(QelMessageQueueWaiters, WithoutWaitingThreadsThereIsNothingToClaim)
{
    EXPECT_FALSE(claimOne());
    mWaiters.wakeOne(); // does nothing
    mWaiters.wakeAll();
}

TEST_F(QelMessageQueueWaiters, EachThreadIsClaimedOnce)
{
    startThreads(2);
    EXPECT_TRUE(claimOne());
    EXPECT_TRUE(claimOne());
    EXPECT_FALSE(claimOne());
    giveTickets(2);
    mWaiters.wakeOne();
    mWaiters.wakeOne();
}

TEST_F(QelMessageQueueWaiters, AThreadThatGoesBackToSleepIsClaimedAgain)
{
    startThreads(1);
    EXPECT_TRUE(claimOne());
    mWaiters.wakeOne(); // there is no ticket
    waitUntil([this]() QEL_NO_THREAD_SAFETY_ANALYSIS { return mWaiters.claimOne(); });
    giveTickets(1);
    mWaiters.wakeOne();
}

TEST_F(QelMessageQueueWaiters, WakeAllWakesClaimedAndUnclaimedThreads)
{
    startThreads(3);
    EXPECT_TRUE(claimOne());
    giveTickets(3);
    mWaiters.wakeAll();
    for (std::thread& thread : mThreads)
        thread.join();
    mThreads.clear();
    EXPECT_FALSE(claimOne());
}

TEST_F(QelMessageQueueWaiters, AThreadThatTimedOutIsNotClaimed)
{
    UniqueMutexLock lock(mMutex);
    const auto deadline = std::chrono::steady_clock::now() + 5ms;
    while (mWaiters.waitUntil(lock, deadline)) { // may wake spuriously
    }
    EXPECT_GE(std::chrono::steady_clock::now(), deadline);
    EXPECT_FALSE(mWaiters.claimOne());
}

TEST_F(QelMessageQueueWaiters, ATimedWaitIsClaimed)
{
    mThreads.emplace_back([this] {
        UniqueMutexLock lock(mMutex);
        const auto deadline = std::chrono::steady_clock::now() + 24h;
        while (mTickets == 0)
            ASSERT_TRUE(mWaiters.waitUntil(lock, deadline));
        --mTickets;
    });
    waitUntil([this]() QEL_NO_THREAD_SAFETY_ANALYSIS {
        if (!mWaiters.claimOne()) return false;
        ++mTickets;
        return true;
    });
    mWaiters.wakeOne();
}

TEST_F(QelMessageQueueWaiters, AreNotCopied)
{
    EXPECT_FALSE(std::is_copy_constructible<Waiters>::value);
    EXPECT_FALSE(std::is_copy_assignable<Waiters>::value);
}

} // namespace
} // namespace qel
