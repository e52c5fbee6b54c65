#include <qel/common/util/TimeProvider.hpp>

#include "support/SettableClock.hpp"
#include "support/VirtualSlot.hpp"

#include <chrono>
#include <cstdlib>
#include <gtest/gtest.h>
#include <memory>
#include <type_traits>
#include <utility>

namespace qel {
namespace {

using std::chrono::hours;
using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::steady_clock;
using std::chrono::system_clock;
using test::SettableClock;

constexpr system_clock::time_point kSystemTime{hours(1)};
constexpr steady_clock::time_point kSteadyTime{hours(2)};

/// A provider whose own destructor does nothing, and that registers only when told.
class FixedClock : public TimeProvider {
public:
    explicit FixedClock(int number) : mNumber(number) {}
    using TimeProvider::pRegister;
    using TimeProvider::pUnregister;

    /// @return the slots of the two readings
    static std::pair<std::size_t, std::size_t> slots()
    {
        return {test::virtualSlot(&FixedClock::pSystem), test::virtualSlot(&FixedClock::pSteady)};
    }

private:
    system_clock::time_point pSystem() override { return kSystemTime + milliseconds(mNumber); }
    steady_clock::time_point pSteady() override { return kSteadyTime + milliseconds(mNumber); }

    int mNumber;
};

/// @return the number of the FixedClock that is in force
long long numberInForce()
{
    return std::chrono::duration_cast<milliseconds>(TimeProvider::steady() - kSteadyTime).count();
}

/// @return whether the provider's reading lies between two readings of the standard clock
template <typename Clock>
bool readsAsTheStandard(typename Clock::time_point (*read)())
{
    const auto before = Clock::now();
    const auto between = read();
    const auto after = Clock::now();
    return before <= between && between <= after;
}

void expectStandardClocks()
{
    EXPECT_TRUE(readsAsTheStandard<steady_clock>(&TimeProvider::steady));
    // The system's clock may be set back between two readings, but hardly three times in a row.
    const auto system = [] { return readsAsTheStandard<system_clock>(&TimeProvider::system); };
    EXPECT_TRUE(system() || system() || system());
}

// Read while the static objects of this program are made.
const steady_clock::time_point sReadAtStart = TimeProvider::steady();

TEST(TimeProvider, ReadsTheStandardClocksByDefault) { expectStandardClocks(); }

TEST(TimeProvider, WorksDuringStaticInitialisation)
{
    EXPECT_GT(sReadAtStart, steady_clock::time_point());
    EXPECT_LE(sReadAtStart, TimeProvider::steady());
}

void readAtExit()
{
    const bool good = TimeProvider::steady() > sReadAtStart && TimeProvider::system() > system_clock::time_point();
    if (!good) std::_Exit(2);
}

[[noreturn]] void exitReadingTheTime()
{
    if (std::atexit(readAtExit) != 0) std::_Exit(3);
    std::exit(0);
}

TEST(TimeProviderDeathTest, WorksWhileTheProcessEnds)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe"); // starts anew instead of forking this process
    EXPECT_EXIT(exitReadingTheTime(), testing::ExitedWithCode(0), "");
}

TEST(TimeProvider, ARegisteredProviderAnswersBothClocks)
{
    FixedClock clock(7);
    expectStandardClocks();
    clock.pRegister();
    EXPECT_EQ(TimeProvider::system(), kSystemTime + milliseconds(7));
    EXPECT_EQ(TimeProvider::steady(), kSteadyTime + milliseconds(7));
}

TEST(TimeProvider, TheDestructorPutsTheStandardClocksBack)
{
    {
        FixedClock clock(7);
        clock.pRegister();
        EXPECT_EQ(numberInForce(), 7);
    }
    expectStandardClocks();
}

TEST(TimeProvider, UnregisteringPutsTheStandardClocksBack)
{
    FixedClock clock(7);
    clock.pRegister();
    clock.pUnregister();
    expectStandardClocks();
    clock.pUnregister(); // no longer current: nothing happens
    expectStandardClocks();
    clock.pRegister();
    EXPECT_EQ(numberInForce(), 7);
}

TEST(TimeProvider, TheLastRegisteredProviderIsCurrent)
{
    FixedClock first(1);
    FixedClock second(2);
    first.pRegister();
    second.pRegister();
    EXPECT_EQ(numberInForce(), 2);
    first.pRegister();
    EXPECT_EQ(numberInForce(), 1);
}

TEST(TimeProvider, UnregisteringOneThatIsNotCurrentChangesNothing)
{
    auto first = std::make_unique<FixedClock>(1);
    FixedClock second(2);
    first->pRegister();
    second.pRegister();
    first->pUnregister();
    EXPECT_EQ(numberInForce(), 2);
    first.reset();
    EXPECT_EQ(numberInForce(), 2);
}

TEST(TimeProvider, ProvidersDoNotStack)
{
    FixedClock first(1);
    first.pRegister();
    {
        FixedClock second(2);
        second.pRegister();
        EXPECT_EQ(numberInForce(), 2);
    }
    expectStandardClocks(); // and not the first one again
}

TEST(TimeProvider, AnotherDefaultProviderChangesNothing)
{
    {
        const DefaultTimeProvider another;
        expectStandardClocks();
    }
    expectStandardClocks();
}

TEST(TimeProvider, CannotBeCopied)
{
    EXPECT_FALSE(std::is_copy_constructible<DefaultTimeProvider>::value);
    EXPECT_FALSE(std::is_copy_assignable<DefaultTimeProvider>::value);
    EXPECT_TRUE(std::has_virtual_destructor<TimeProvider>::value);
    EXPECT_TRUE(std::is_abstract<TimeProvider>::value);
}

TEST(TimeProvider, VirtualOperationsKeepTheirSlots)
{
    EXPECT_EQ(FixedClock::slots(), std::make_pair(std::size_t(2), std::size_t(3))) << "after the destructor";
}

TEST(SettableClock, IsInForceForItsLifetime)
{
    {
        const SettableClock clock;
        EXPECT_EQ(system_clock::to_time_t(TimeProvider::system()), 1704164645); // 2024-01-02 03:04:05 UTC
        EXPECT_EQ(TimeProvider::steady().time_since_epoch(), std::chrono::seconds(1000));
    }
    expectStandardClocks();
}

TEST(SettableClock, StandsStillUntilItIsMoved)
{
    SettableClock clock;
    const system_clock::time_point system = TimeProvider::system();
    const steady_clock::time_point steady = TimeProvider::steady();
    EXPECT_EQ(TimeProvider::system(), system);
    EXPECT_EQ(TimeProvider::steady(), steady);
    clock.advance(nanoseconds(3));
    EXPECT_EQ(TimeProvider::system() - system, nanoseconds(3));
    EXPECT_EQ(TimeProvider::steady() - steady, nanoseconds(3));
    clock.advance(nanoseconds(-5));
    EXPECT_EQ(TimeProvider::steady() - steady, nanoseconds(-2));
}

TEST(SettableClock, SetsEachClockAlone)
{
    SettableClock clock;
    const steady_clock::time_point steady = TimeProvider::steady();
    clock.setSystem(kSystemTime);
    EXPECT_EQ(TimeProvider::system(), kSystemTime);
    EXPECT_EQ(TimeProvider::steady(), steady);
    clock.setSteady(kSteadyTime);
    EXPECT_EQ(TimeProvider::system(), kSystemTime);
    EXPECT_EQ(TimeProvider::steady(), kSteadyTime);
}

TEST(SettableClock, CountsTheReadingsOfEachClock)
{
    const SettableClock clock;
    EXPECT_EQ(clock.steadyReads(), 0U);
    EXPECT_EQ(clock.systemReads(), 0U);
    TimeProvider::steady();
    TimeProvider::system();
    TimeProvider::steady();
    EXPECT_EQ(clock.steadyReads(), 2U);
    EXPECT_EQ(clock.systemReads(), 1U);
}

} // namespace
} // namespace qel
