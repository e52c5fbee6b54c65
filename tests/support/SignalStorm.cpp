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
            // Usually the next one comes after this one was handled, so that the receiver gets on between them. Not
            // always: the thread sanitizer keeps a signal back that comes just before a call that blocks, and only the
            // next one brings it out.
            for (int i = 0; i < 10000 && !returned && sHandled == handled; ++i)
                std::this_thread::yield();
        }
    });
    // A call with a short deadline must not be over before the sender has come to run at all.
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
