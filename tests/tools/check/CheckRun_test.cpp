// Running cases: which run at the same time, what ends a run, and what a case comes to. The cases here need no peer.

#include "check/CheckRun.hpp"

#include <atomic>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <mutex>
#include <new>
#include <thread>

namespace qel::test {

namespace {

using namespace tool::check;
using testing::ElementsAre;
using testing::HasSubstr;

Target nowhere() { return Target(protocol::ServerAddress::parse("127.0.0.1:1")); }

Case caseOf(std::string id, std::function<void(Trial&)> run, unsigned int needs = kNothing)
{
    return {std::move(id), "It holds.", "wire-format.md#header", Level::Wire, needs, std::move(run)};
}

Outcome outcomeOf(std::function<void(Trial&)> run)
{
    static const Target target = nowhere();
    static Case aCase;
    aCase = caseOf("a/case", std::move(run));
    return runCase(aCase, target, 1);
}

TEST(CheckCase, HoldsWhenItReturns)
{
    const Outcome outcome = outcomeOf([](Trial&) {});
    EXPECT_EQ(outcome.result, Result::Holds);
    EXPECT_GE(outcome.time.count(), 0);
}

TEST(CheckCase, FailsWithWhatWasExpectedAndSeen)
{
    const Outcome outcome = outcomeOf([](Trial&) { throw Failure("a response", "nothing"); });
    EXPECT_EQ(outcome.result, Result::Fails);
    EXPECT_EQ(outcome.expected, "a response");
    EXPECT_EQ(outcome.seen, "nothing");
}

TEST(CheckCase, IsSkippedWithAReason)
{
    const Outcome outcome = outcomeOf([](Trial&) { throw Skip("the peer takes one console only"); });
    EXPECT_EQ(outcome.result, Result::Skipped);
    EXPECT_EQ(outcome.seen, "the peer takes one console only");
}

TEST(CheckCase, FailsWhenSomethingElseIsThrown)
{
    const Outcome outcome = outcomeOf([](Trial&) { throw std::runtime_error("no descriptor is left"); });
    EXPECT_EQ(outcome.result, Result::Fails);
    EXPECT_EQ(outcome.seen, "no descriptor is left");
}

TEST(CheckCase, PassesAWantOfMemoryOn)
{
    EXPECT_THROW(outcomeOf([](Trial&) { throw std::bad_alloc(); }), std::bad_alloc);
}

TEST(CheckCase, FailsWhenThePeerIsGone)
{
    const Outcome outcome = outcomeOf([](Trial& trial) { trial.connectTcp(); });
    EXPECT_EQ(outcome.result, Result::Fails);
    EXPECT_EQ(outcome.expected, "a connection");
    EXPECT_THAT(outcome.seen, HasSubstr("cannot connect to 127.0.0.1:1"));
}

TEST(CheckCase, PutsBackTheNewestChangeFirst)
{
    std::string order;
    const Outcome outcome = outcomeOf([&](Trial& trial) {
        trial.atEnd([&] { order += "first"; });
        trial.atEnd([&] { order += "second "; });
        throw Failure("a", "b");
    });
    EXPECT_EQ(order, "second first");
    EXPECT_EQ(outcome.seen, "b");
}

TEST(CheckCase, FailsWhenAChangeCannotBePutBack)
{
    const Outcome outcome = outcomeOf([](Trial& trial) { trial.atEnd([] { throw Failure("status 0", "status 3"); }); });
    EXPECT_EQ(outcome.result, Result::Fails);
    EXPECT_EQ(outcome.expected, "what the case has changed to be put back");
    EXPECT_EQ(outcome.seen, "expected status 0, seen status 3");
}

TEST(CheckCase, EveryNeedThatIsNotMetIsNamed)
{
    const Target target = nowhere();
    const auto missing = [&](unsigned int needs) { return missingFor(caseOf("a", {}, needs), target); };
    EXPECT_EQ(missing(kNothing), "");
    EXPECT_EQ(missing(kPlain | kShared | kAlone), "");
    EXPECT_EQ(missing(kTls), "needs TLS");
    EXPECT_EQ(missing(kPartition), "needs --partition");
    EXPECT_EQ(missing(kEchoPartition), "needs --echo-partition");
    EXPECT_EQ(missing(kEndingPartition), "needs --ending-partition");
    EXPECT_EQ(missing(kDeadline), "needs --peer-deadline");
}

TEST(CheckCase, NeedsThatAreMetAreNot)
{
    Target target = nowhere();
    target.partition = 0;
    target.echoPartition = 1;
    target.endingPartition = 2;
    target.deadline = std::chrono::milliseconds(1);
    EXPECT_EQ(missingFor(caseOf("a", {}, kPartition | kEchoPartition | kEndingPartition | kDeadline), target), "");
    target.context = std::make_shared<SSLClientContext>();
    EXPECT_EQ(missingFor(caseOf("a", {}, kTls), target), "");
    EXPECT_EQ(missingFor(caseOf("a", {}, kPlain), target), "needs --plain");
}

TEST(CheckCase, IsNotRunWhenItsNeedsAreNotMet)
{
    const Target target = nowhere();
    const Case aCase = caseOf(
        "a", [](Trial&) { ADD_FAILURE(); }, kTls);
    const Outcome outcome = runCase(aCase, target, 1);
    EXPECT_EQ(outcome.result, Result::Skipped);
    EXPECT_EQ(outcome.seen, "needs TLS");
}

/// Runs cases that only say when they begin and end.
class Watched {
public:
    explicit Watched(std::vector<unsigned int> needs)
    {
        for (std::size_t i = 0; i < needs.size(); ++i)
            mCases.push_back(caseOf(std::to_string(i), {}, needs[i]));
    }

    std::vector<Outcome> run(unsigned int parallel)
    {
        CheckRun run(mCases, parallel, [this](const Case& aCase, unsigned int number) {
            EXPECT_EQ(std::to_string(number - 1), aCase.id);
            const unsigned int now = ++running;
            most = std::max<unsigned int>(most, now);
            const bool shares = (aCase.needs & (kShared | kPartition)) != 0;
            if (shares) {
                EXPECT_EQ(++sharing, 1U);
            }
            if ((aCase.needs & kAlone) != 0) {
                EXPECT_EQ(now, 1U);
            }
            {
                const std::lock_guard<std::mutex> lock(mutex);
                order += aCase.id;
            }
            std::this_thread::yield();
            if (shares) --sharing;
            --running;
            Outcome outcome;
            outcome.test = &aCase;
            return outcome;
        });
        return run.run([this](const Outcome&, std::size_t done) { return done < stopAfter; });
    }

    std::atomic<unsigned int> running{0};
    std::atomic<unsigned int> sharing{0};
    std::atomic<unsigned int> most{0};
    std::size_t stopAfter = 1000;
    std::mutex mutex;
    std::string order;

private:
    Cases mCases;
};

TEST(CheckRun, OneThreadRunsTheCasesInTheirOrder)
{
    Watched watched({kNothing, kShared, kNothing, kPartition, kNothing});
    const auto outcomes = watched.run(1);
    EXPECT_EQ(watched.order, "01234");
    EXPECT_EQ(outcomes.size(), 5U);
    EXPECT_EQ(watched.most, 1U);
}

TEST(CheckRun, CasesThatWantToBeAloneAreLast)
{
    Watched watched({kAlone, kNothing, kAlone | kShared, kNothing});
    watched.run(1);
    EXPECT_EQ(watched.order, "1302");
}

TEST(CheckRun, CasesThatShareStateRunOneAfterTheOther)
{
    Watched watched(std::vector<unsigned int>(200, kShared));
    EXPECT_EQ(watched.run(4).size(), 200U);
    EXPECT_EQ(watched.most, 1U);
}

TEST(CheckRun, RunsEveryCaseOnceOnSeveralThreads)
{
    std::vector<unsigned int> needs;
    for (unsigned int i = 0; i < 300; ++i)
        needs.push_back(i % 3 == 0 ? kShared : i % 7 == 0 ? kAlone : kNothing);
    Watched watched(needs);
    const auto outcomes = watched.run(4);
    ASSERT_EQ(outcomes.size(), 300U);
    for (std::size_t i = 0; i < outcomes.size(); ++i) {
        EXPECT_EQ(outcomes[i].test->id, std::to_string(i));
        EXPECT_EQ(outcomes[i].result, Result::Holds);
    }
}

TEST(CheckRun, StopsWhenItIsTold)
{
    Watched watched({kNothing, kNothing, kNothing, kAlone});
    watched.stopAfter = 2;
    const auto outcomes = watched.run(1);
    EXPECT_EQ(watched.order, "01");
    EXPECT_EQ(outcomes[1].result, Result::Holds);
    EXPECT_EQ(outcomes[2].result, Result::Skipped);
    EXPECT_EQ(outcomes[3].seen, "interrupted");
}

TEST(CheckRun, PassesAnExceptionOnWhenAllThreadsHaveEnded)
{
    const Cases cases{caseOf("a", {}), caseOf("b", {})};
    CheckRun run(cases, 2, [](const Case&, unsigned int) -> Outcome { throw std::bad_alloc(); });
    EXPECT_THROW(run.run([](const Outcome&, std::size_t) { return true; }), std::bad_alloc);
}

} // namespace

} // namespace qel::test
