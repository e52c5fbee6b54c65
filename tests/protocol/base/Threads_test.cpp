#include "base/Threads.hpp"

#include <gtest/gtest.h>

namespace qel::test {

namespace {

sigset_t blockedSignals()
{
    sigset_t blocked;
    ::pthread_sigmask(SIG_SETMASK, nullptr, &blocked);
    return blocked;
}

TEST(Threads, AStartedThreadTakesNoSignals)
{
    sigset_t blocked;
    ::sigemptyset(&blocked);
    protocol::startThread([&] { blocked = blockedSignals(); }).join();
    for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGUSR1, SIGALRM, SIGCHLD})
        EXPECT_EQ(::sigismember(&blocked, signal), 1) << signal;
}

TEST(Threads, TheThreadThatStartsItGoesOnTakingThem)
{
    const sigset_t before = blockedSignals();
    ASSERT_EQ(::sigismember(&before, SIGTERM), 0);
    protocol::startThread([] {}).join();
    const sigset_t after = blockedSignals();
    for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGUSR1, SIGALRM, SIGCHLD})
        EXPECT_EQ(::sigismember(&after, signal), ::sigismember(&before, signal)) << signal;
}

} // namespace

} // namespace qel::test
