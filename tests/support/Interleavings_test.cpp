// Interleavings runs every order, and finds the failures of small programs that are known to fail.

#include "support/Interleavings.hpp"
#include "support/ModelledSync.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <new>
#include <set>
#include <stdexcept>
#include <string>
#include <type_traits>

namespace qel {
namespace {

using test::Interleavings;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;

using Lock = modelled::UniqueMutexLock;

/// Threads that each append their letter several times.
class Writers : public Interleavings::Program {
public:
    explicit Writers(std::set<std::string>& texts, std::size_t count, std::size_t letters) : mTexts(texts)
    {
        for (std::size_t number = 0; number < count; ++number) {
            threads.push_back([this, number, letters] {
                for (std::size_t i = 0; i < letters; ++i) {
                    if (i != 0) Interleavings::step();
                    mText += static_cast<char>('a' + number);
                }
            });
        }
    }
    void describe(std::string& state) const override { state += mText; }
    void atRest() override { mTexts.insert(mText); }
    void giveUp() override {}

private:
    std::set<std::string>& mTexts;
    std::string mText;
};

TEST(Interleavings, RunsEveryOrder)
{
    std::set<std::string> texts;
    Interleavings::Options options;
    const auto result = Interleavings::explore<Writers>(options, std::ref(texts), 2U, 4U);
    EXPECT_THAT(result.failure, IsEmpty());
    EXPECT_EQ(texts.size(), 70U); // 8! / (4! * 4!)
    EXPECT_EQ(texts.count("aaaabbbb"), 1U);
    EXPECT_EQ(texts.count("abababab"), 1U);
    EXPECT_EQ(texts.count("bbbbaaaa"), 1U);
    EXPECT_EQ(result.runs, 70U);
    EXPECT_EQ(result.rests, 70U);

    texts.clear();
    Interleavings::explore<Writers>(options, std::ref(texts), 3U, 3U);
    EXPECT_EQ(texts.size(), 1680U); // 9! / (3! * 3! * 3!)
}

/// Threads that each increment a sum.
class Adders : public Interleavings::Program {
public:
    explicit Adders(std::size_t count)
    {
        for (std::size_t number = 0; number < count; ++number) {
            threads.push_back([this] {
                for (unsigned int i = 0; i < 3; ++i) {
                    Interleavings::here(i);
                    Interleavings::step();
                    ++mSum;
                }
                Interleavings::here(3);
            });
        }
    }
    void describe(std::string& state) const override { state += std::to_string(mSum); }
    void atRest() override
    {
        if (mSum != 3 * threads.size()) Interleavings::fail("wrong sum");
    }
    void giveUp() override {}

private:
    std::size_t mSum = 0;
};

TEST(Interleavings, ContinuesOnceFromEqualStates)
{
    Interleavings::Options options;
    const auto merged = Interleavings::explore<Adders>(options, 3U);
    EXPECT_THAT(merged.failure, IsEmpty());
    EXPECT_EQ(merged.states, 5U * 5U * 5U - 1U); // five places each, without the last state, in which all have ended
    options.merge = false;
    const auto all = Interleavings::explore<Adders>(options, 3U);
    EXPECT_EQ(all.states, merged.states);
    EXPECT_EQ(all.rests, 34650U); // 12! / (4! * 4! * 4!)
    EXPECT_LT(merged.runs, 1000U);
}

/// Two threads increment a number in two steps: read, then write.
class TornIncrement : public Interleavings::Program {
public:
    explicit TornIncrement(bool locked)
    {
        for (int i = 0; i < 2; ++i) {
            threads.push_back([this, locked] {
                std::unique_ptr<Lock> lock;
                if (locked) lock = std::make_unique<Lock>(mMutex);
                const int read = mNumber;
                Interleavings::step();
                mNumber = read + 1;
            });
        }
    }
    void describe(std::string& state) const override { state += std::to_string(mNumber); }
    void atRest() override
    {
        if (mNumber != 2) Interleavings::fail("an increment is lost");
    }
    void giveUp() override {}

private:
    modelled::Mutex mMutex;
    int mNumber = 0;
};

TEST(Interleavings, FindsALostUpdateAndReportsItsSteps)
{
    const auto result = Interleavings::explore<TornIncrement>({}, false);
    EXPECT_EQ(result.failure, "an increment is lost");
    EXPECT_THAT(result.story, testing::ElementsAre("thread 0 goes on (0)", "thread 1 goes on (0)",
                                                   "thread 0 goes on (0)", "thread 1 goes on (0)"));
}

TEST(Interleavings, AMutexExcludesOtherThreads)
{
    const auto result = Interleavings::explore<TornIncrement>({}, true);
    EXPECT_THAT(result.failure, IsEmpty());
    EXPECT_GE(result.rests, 1U);
}

/// Two threads take two mutexes, in one order or in opposite orders.
class TwoMutexes : public Interleavings::Program {
public:
    explicit TwoMutexes(bool inOneOrder)
    {
        threads.push_back([this] {
            const Lock first(mFirst);
            const Lock second(mSecond);
        });
        threads.push_back([this, inOneOrder] {
            const Lock first(inOneOrder ? mFirst : mSecond);
            const Lock second(inOneOrder ? mSecond : mFirst);
        });
    }
    void describe(std::string&) const override {}
    void atRest() override {}
    void giveUp() override {}

private:
    modelled::Mutex mFirst;
    modelled::Mutex mSecond;
};

TEST(Interleavings, FindsADeadlock)
{
    EXPECT_EQ(Interleavings::explore<TwoMutexes>({}, false).failure, "a thread waits for a mutex for ever");
    EXPECT_THAT(Interleavings::explore<TwoMutexes>({}, true).failure, IsEmpty());
}

/// One thread waits until another one opens a gate.
class Gate : public Interleavings::Program {
public:
    enum Style { Right, LooksWithoutTheMutex, WaitsWithoutALoop, Timed };

    explicit Gate(Style style)
    {
        threads.push_back([this, style] {
            if (style == LooksWithoutTheMutex) {
                const bool open = mOpen;
                Lock lock(mMutex);
                if (!open) mCondition.wait(lock);
                return;
            }
            Lock lock(mMutex);
            if (style == WaitsWithoutALoop) {
                if (!mOpen) mCondition.wait(lock);
                if (!mOpen) Interleavings::fail("passed the gate before it was open");
                return;
            }
            while (!mOpen) {
                if (style == Right) {
                    mCondition.wait(lock);
                } else if (!mCondition.waitUntil(lock, std::chrono::steady_clock::time_point())) {
                    break;
                }
            }
            mPassed = mOpen;
        });
        threads.push_back([this] {
            {
                const Lock lock(mMutex);
                mOpen = true;
            }
            mCondition.notifyOne();
        });
    }
    void describe(std::string& state) const override { state += mOpen ? 'o' : 'c'; }
    void atRest() override
    {
        if (Interleavings::sleeps(0)) Interleavings::fail("sleeps for ever");
        if (!Interleavings::hasEnded(1)) Interleavings::fail("the other thread has not ended");
    }
    void giveUp() override { mOpen = true; }

private:
    modelled::Mutex mMutex;
    modelled::ConditionVariable mCondition;
    bool mOpen = false;
    bool mPassed = false;
};

TEST(Interleavings, FindsALostWakeup)
{
    EXPECT_THAT(Interleavings::explore<Gate>({}, Gate::Right).failure, IsEmpty());
    EXPECT_EQ(Interleavings::explore<Gate>({}, Gate::LooksWithoutTheMutex).failure, "sleeps for ever");
}

TEST(Interleavings, FindsADeliberateFault)
{
    Interleavings::Options options;
    options.fault = Interleavings::Fault::NotifyOneDoesNothing;
    EXPECT_EQ(Interleavings::explore<Gate>(options, Gate::Right).failure, "sleeps for ever");
    EXPECT_THAT(Interleavings::explore<Gate>(options, Gate::Timed).failure, IsEmpty()); // its timeout ends the wait
}

TEST(Interleavings, FindsAWaitWithoutALoopByASpuriousWakeup)
{
    EXPECT_THAT(Interleavings::explore<Gate>({}, Gate::WaitsWithoutALoop).failure, IsEmpty());
    Interleavings::Options options;
    options.spuriousWakeups = 1;
    EXPECT_EQ(Interleavings::explore<Gate>(options, Gate::WaitsWithoutALoop).failure,
              "passed the gate before it was open");
    EXPECT_THAT(Interleavings::explore<Gate>(options, Gate::Right).failure, IsEmpty());
}

/// Two threads sleep, and a third wakes some of them.
class Sleepers : public Interleavings::Program {
public:
    explicit Sleepers(std::set<std::string>& outcomes, bool all) : mOutcomes(outcomes)
    {
        for (int i = 0; i < 2; ++i) {
            threads.push_back([this] {
                Lock lock(mMutex);
                ++mAsleep;
                mCondition.wait(lock);
            });
        }
        threads.push_back([this, all] {
            {
                const Lock lock(mMutex);
                if (mAsleep < 2) return;
            }
            all ? mCondition.notifyAll() : mCondition.notifyOne();
            if (Interleavings::notified().size() != (all ? 0U : 1U)) Interleavings::fail("not counted");
            if (Interleavings::notifiedAll().size() != (all ? 1U : 0U)) Interleavings::fail("not all counted");
        });
    }
    void describe(std::string& state) const override { state += std::to_string(mAsleep); }
    void atRest() override
    {
        std::string outcome;
        for (std::size_t i = 0; i < 2; ++i)
            outcome += Interleavings::sleeps(i) ? 's' : 'e';
        mOutcomes.insert(outcome);
    }
    void giveUp() override {}

private:
    std::set<std::string>& mOutcomes;
    modelled::Mutex mMutex;
    modelled::ConditionVariable mCondition;
    int mAsleep = 0;
};

TEST(Interleavings, ANotificationWakesAnyThreadOrAll)
{
    std::set<std::string> outcomes;
    EXPECT_THAT(Interleavings::explore<Sleepers>({}, std::ref(outcomes), false).failure, IsEmpty());
    EXPECT_THAT(outcomes, testing::ElementsAre("es", "se", "ss")); // "ss": the third thread ran first
    outcomes.clear();
    EXPECT_THAT(Interleavings::explore<Sleepers>({}, std::ref(outcomes), true).failure, IsEmpty());
    EXPECT_THAT(outcomes, testing::ElementsAre("ee", "ss"));
}

/// An object that the woken thread destroys.
class Destruction : public Interleavings::Program {
public:
    explicit Destruction(bool notifiesWithTheMutex)
    {
        new (&mStorage) Shared;
        threads.push_back([this, notifiesWithTheMutex] {
            Shared& shared = pShared();
            Lock lock(shared.mutex);
            shared.open = true;
            if (notifiesWithTheMutex) return shared.condition.notifyOne();
            lock.unlock();
            shared.condition.notifyOne();
        });
        threads.push_back([this] {
            Shared& shared = pShared();
            {
                Lock lock(shared.mutex);
                while (!shared.open)
                    shared.condition.wait(lock);
            }
            pDestroy();
        });
    }
    ~Destruction() override
    {
        if (mAlive) pDestroy();
    }
    void describe(std::string& state) const override { state += mAlive ? 'a' : 'd'; }
    void atRest() override
    {
        if (mAlive) Interleavings::fail("not destroyed");
    }
    void giveUp() override
    {
        if (mAlive) pShared().open = true;
    }

private:
    struct Shared {
        modelled::Mutex mutex;
        modelled::ConditionVariable condition;
        bool open = false;
    };
    Shared& pShared() { return *std::launder(reinterpret_cast<Shared*>(&mStorage)); }
    void pDestroy()
    {
        mAlive = false;
        pShared().~Shared();
    }

    std::aligned_storage_t<sizeof(Shared), alignof(Shared)> mStorage; // outlives the object
    bool mAlive = true;
};

TEST(Interleavings, FindsAnObjectThatIsDestroyedTooEarly)
{
    EXPECT_THAT(Interleavings::explore<Destruction>({}, true).failure, IsEmpty());
    EXPECT_THAT(Interleavings::explore<Destruction>({}, false).failure, HasSubstr("is destroyed while"));
}

/// Two threads handle an exception at the same time and rethrow it.
class Exceptions : public Interleavings::Program {
public:
    Exceptions()
    {
        for (const char* const text : {"one", "two"}) {
            threads.push_back([text] {
                try {
                    try {
                        throw std::runtime_error(text);
                    } catch (...) {
                        Interleavings::step();
                        throw;
                    }
                } catch (const std::runtime_error& error) {
                    if (std::string(error.what()) != text) Interleavings::fail("the exception of another thread");
                }
            });
        }
    }
    void describe(std::string&) const override {}
    void atRest() override {}
    void giveUp() override {}
};

TEST(Interleavings, AnExceptionBelongsToItsThread)
{
    const auto result = Interleavings::explore<Exceptions>({});
    EXPECT_THAT(result.failure, IsEmpty());
    EXPECT_GE(result.rests, 1U);
}

TEST(Interleavings, MoreRunsThanAllowedAreAFailure)
{
    std::set<std::string> texts;
    Interleavings::Options options;
    options.maxRuns = 10;
    EXPECT_EQ(Interleavings::explore<Writers>(options, std::ref(texts), 2U, 4U).failure, "more runs than were allowed");
}

} // namespace
} // namespace qel
