#pragma once

#include <qel/common/util/TimeProvider.hpp>

#include <atomic>
#include <chrono>
#include <limits>
#include <stdexcept>

namespace qel::test {

/// A clock that stands still and breaks down when told. In force from its construction to its destruction.
/// Thread safety: as SettableClock.
class ThrowingClock : public TimeProvider {
public:
    ThrowingClock() { pRegister(); }

    /// Lets that many readings succeed, and all after them fail with std::runtime_error "clock".
    void failAfter(int readings) { pSet(readings, false, false); }
    /// Lets that many readings succeed, and then one fail.
    void failOnceAfter(int readings) { pSet(readings, true, false); }
    /// The same, counting and failing readings of the steady clock alone. Log lines read the other one.
    void failSteadyOnceAfter(int readings) { pSet(readings, true, true); }
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
