#include "support/SettableClock.hpp"

namespace qel::test {

namespace {

using SystemClock = std::chrono::system_clock;
using SteadyClock = std::chrono::steady_clock;

constexpr std::chrono::seconds kSystemStart{1704164645}; // 2024-01-02 03:04:05 UTC
constexpr std::chrono::seconds kSteadyStart{1000};

} // namespace

SettableClock::SettableClock()
    : mSystem(std::chrono::duration_cast<SystemClock::duration>(kSystemStart).count()),
      mSteady(std::chrono::duration_cast<SteadyClock::duration>(kSteadyStart).count())
{
    pRegister();
}

SettableClock::~SettableClock() = default;

void SettableClock::setSystem(SystemClock::time_point now) { mSystem = now.time_since_epoch().count(); }

void SettableClock::setSteady(SteadyClock::time_point now) { mSteady = now.time_since_epoch().count(); }

void SettableClock::advance(std::chrono::nanoseconds duration)
{
    mSystem += std::chrono::duration_cast<SystemClock::duration>(duration).count();
    mSteady += std::chrono::duration_cast<SteadyClock::duration>(duration).count();
}

unsigned SettableClock::systemReads() const { return mSystemReads; }

unsigned SettableClock::steadyReads() const { return mSteadyReads; }

SystemClock::time_point SettableClock::pSystem()
{
    const SystemClock::rep now = mSystem;
    ++mSystemReads;
    return SystemClock::time_point(SystemClock::duration(now));
}

SteadyClock::time_point SettableClock::pSteady()
{
    const SteadyClock::rep now = mSteady;
    ++mSteadyReads;
    return SteadyClock::time_point(SteadyClock::duration(now));
}

} // namespace qel::test
