#pragma once

#include <qel/common/util/TimeProvider.hpp>

#include <atomic>
#include <chrono>

namespace qel::test {

/// A clock that a test moves. In force from construction to destruction.
/// Starts at 2024-01-02 03:04:05 UTC on the system clock and 1000 s after the epoch of the steady clock.
/// Thread safety: several threads may set and read the time; make and destroy the clock while no other thread reads the
/// time.
class SettableClock : public TimeProvider {
public:
    SettableClock();
    ~SettableClock() override;

    void setSystem(std::chrono::system_clock::time_point now);
    void setSteady(std::chrono::steady_clock::time_point now);

    /// Moves both clocks, forwards or, with a negative duration, backwards.
    void advance(std::chrono::nanoseconds duration);

    /// @return how often each clock has been read; moving the clock does not change a reading that is already counted
    unsigned systemReads() const;
    unsigned steadyReads() const;

private:
    std::chrono::system_clock::time_point pSystem() override;
    std::chrono::steady_clock::time_point pSteady() override;

    std::atomic<std::chrono::system_clock::rep> mSystem; // ticks since the epoch
    std::atomic<std::chrono::steady_clock::rep> mSteady; // ticks since the epoch
    std::atomic<unsigned> mSystemReads{0};
    std::atomic<unsigned> mSteadyReads{0};
};

} // namespace qel::test
