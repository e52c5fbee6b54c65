#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <thread>

namespace qel {

/// Counts the calls that still have something to do with an object after they have given back its mutex, such as waking
/// another thread, so that its destructor can wait for the last of them.
///
/// The other thread may be the one that destroys the object. Waking it with the mutex held would be safe and slow: it
/// would at once have to wait for that mutex. So a call counts itself with the mutex held, gives the mutex back, wakes,
/// and counts itself out as the last thing it does with the object. The destructor first takes the mutex once, so that
/// whoever holds it just then has counted itself, and then waits here.
///
/// Thread safety: enter() and leave() from any thread; wait() from the one that destroys the object.
class CallsInFlight {
public:
    CallsInFlight() = default;
    CallsInFlight(const CallsInFlight&) = delete;
    CallsInFlight& operator=(const CallsInFlight&) = delete;

    /// Call it with the object's mutex held.
    void enter() noexcept { mCount.fetch_add(1, std::memory_order_relaxed); }

    /// Nothing of the object may be touched after this.
    void leave() noexcept { mCount.fetch_sub(1, std::memory_order_release); }

    /// Returns when nobody is in flight any more. It may look again several times, with a short sleep in between: the
    /// calls it waits for have only a few instructions left. It sleeps rather than spins so that a thread of lower
    /// priority comes to its end too.
    void wait() const
    {
        while (mCount.load(std::memory_order_acquire) != 0)
            std::this_thread::sleep_for(kPause);
    }

private:
    static constexpr std::chrono::microseconds kPause{50};

    std::atomic<std::size_t> mCount{0};
};

} // namespace qel
