#pragma once

#include <qel/common/util/TimeProvider.hpp>

#include <atomic>
#include <chrono>
#include <limits>
#include <stdexcept>

namespace qel::test {

/// A clock that stands still, at the epoch, and can be made to throw. In force from construction to destruction.
/// Thread safety: as SettableClock.
class ThrowingClock : public TimeProvider {
public:
    ThrowingClock() { pRegister(); }

    /// Lets that many readings succeed and makes all later ones throw std::runtime_error "clock".
    void failAfter(int readings) { pSet(readings, false, false); }
    /// Lets that many readings succeed, makes the next one throw, and works again after it.
    void failOnceAfter(int readings) { pSet(readings, true, false); }
    /// The same, but counts and fails readings of the steady clock only. Log lines read the system clock.
    void failSteadyOnceAfter(int readings) { pSet(readings, true, true); }
    /// Lets all readings succeed.
    void work() { pSet(std::numeric_limits<int>::max(), false, false); }

private:
    std::chrono::system_clock::time_point pSystem() override
    {
        if (!mSteadyOnly) pCount();
        return {};
    }
    std::chrono::steady_clock::time_point pSteady() override
    {
        pCount();
        return {};
    }
    void pSet(int readings, bool once, bool steadyOnly)
    {
        mOnce = once;
        mSteadyOnly = steadyOnly;
        mLeft = readings;
    }
    void pCount()
    {
        const int left = mLeft--;
        if (left == 0 || (left < 0 && !mOnce)) throw std::runtime_error("clock");
    }

    std::atomic<bool> mSteadyOnly{false};
    std::atomic<bool> mOnce{false};
    std::atomic<int> mLeft{std::numeric_limits<int>::max()};
};

} // namespace qel::test
