#include "base/SignalWatch.hpp"

#include <csignal>
#include <gtest/gtest.h>
#include <unistd.h>

namespace qel::test {

namespace {

using tool::SignalWatch;

bool isBlocked(int number)
{
    sigset_t set;
    ::pthread_sigmask(SIG_BLOCK, nullptr, &set);
    return ::sigismember(&set, number) == 1;
}

TEST(SignalWatch, ASignalBecomesReadable)
{
    SignalWatch watch({SIGUSR1, SIGUSR2});
    EXPECT_FALSE(PollSet(watch.getPollFd()).poll().anyReady());
    EXPECT_EQ(watch.take(), 0);
    ::pthread_kill(::pthread_self(), SIGUSR2);
    EXPECT_TRUE(PollSet(watch.getPollFd()).wait(std::chrono::seconds(10)).contains(watch.getPollFd()));
    EXPECT_EQ(watch.take(), SIGUSR2);
    EXPECT_EQ(watch.take(), 0);
}

TEST(SignalWatch, SignalsAreBlockedUntilDestruction)
{
    ASSERT_FALSE(isBlocked(SIGUSR1));
    {
        SignalWatch watch({SIGUSR1});
        EXPECT_TRUE(isBlocked(SIGUSR1));
        EXPECT_FALSE(isBlocked(SIGUSR2));
    }
    EXPECT_FALSE(isBlocked(SIGUSR1));
}

} // namespace

} // namespace qel::test
