#include <qel/common/util/CallsInFlight.hpp>

#include <atomic>
#include <gtest/gtest.h>
#include <memory>
#include <thread>
#include <type_traits>

namespace qel {
namespace {

TEST(CallsInFlight, NobodyIsWaitedForAtFirst)
{
    const CallsInFlight calls;
    calls.wait();
}

TEST(CallsInFlight, NobodyIsWaitedForWhenAllHaveLeft)
{
    CallsInFlight calls;
    calls.enter();
    calls.enter();
    calls.leave();
    calls.leave();
    calls.wait();
}

TEST(CallsInFlight, TheLastCallIsWaitedFor)
{
    CallsInFlight calls;
    calls.enter();
    calls.enter();
    calls.leave();
    int written = 0; // by the call, and read without a lock after the wait
    std::atomic<bool> waiting{false};
    std::thread call([&] {
        while (!waiting)
            std::this_thread::yield();
        written = 1;
        calls.leave();
    });
    waiting = true;
    calls.wait();
    EXPECT_EQ(written, 1);
    call.join();
}

TEST(CallsInFlight, TheObjectMayGoWhenTheWaitIsOver)
{
    for (int round = 0; round < 200; ++round) {
        auto calls = std::make_unique<CallsInFlight>();
        calls->enter();
        std::thread call([calls = calls.get()] { calls->leave(); });
        calls->wait();
        calls.reset();
        call.join();
    }
}

TEST(CallsInFlight, AreNotCopied)
{
    EXPECT_FALSE(std::is_copy_constructible<CallsInFlight>::value);
    EXPECT_FALSE(std::is_copy_assignable<CallsInFlight>::value);
}

} // namespace
} // namespace qel
