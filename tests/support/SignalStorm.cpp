#include "support/SignalStorm.hpp"

#include <atomic>
#include <exception>
#include <future>
#include <gtest/gtest.h>
#include <thread>

namespace qel::test {

namespace {

std::atomic<int> sHandled{0};

void countSignal(int) { ++sHandled; }

} // namespace

int callUnderSignals(int flags, const std::function<void()>& call, const std::function<bool()>& until)
{
    struct sigaction action {};
    struct sigaction before {};
    action.sa_handler = countSignal;
    action.sa_flags = flags;
    EXPECT_EQ(::sigaction(SIGUSR1, &action, &before), 0);
    sHandled = 0;

    const pthread_t receiver = ::pthread_self();
    std::atomic<bool> returned{false};
    std::promise<void> ready;
    std::thread sender([&] {
        ready.set_value();
        while (!returned && until()) {
            const int handled = sHandled;
            EXPECT_EQ(::pthread_kill(receiver, SIGUSR1), 0);
            // Usually waits until the signal is handled, so that the receiver makes progress between two of them. Not
            // for ever: the thread sanitizer holds back a signal that comes just before a call that blocks, until the
            // next one comes.
            for (int i = 0; i < 10000 && !returned && sHandled == handled; ++i)
                std::this_thread::yield();
        }
    });
    // The sender must run before a call with a short deadline returns.
    ready.get_future().wait();
    try {
        call();
    } catch (const std::exception& error) {
        ADD_FAILURE() << error.what();
    }
    returned = true;
    sender.join();
    EXPECT_EQ(::sigaction(SIGUSR1, &before, nullptr), 0);
    return sHandled;
}

} // namespace qel::test
