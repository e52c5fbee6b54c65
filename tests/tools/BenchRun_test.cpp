#include "BenchRun.hpp"
#include "Failures.hpp"
#include "tools/FakeBenchPair.hpp"

#include <array>
#include <atomic>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <thread>
#include <vector>

namespace qel::test {

namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::BenchFigures;
using tool::BenchLoad;
using tool::BenchRun;
using tool::RequestRefused;

/// Three pairs, flat out, without end unless the test says so.
class BenchRunTest : public ::testing::Test {
protected:
    BenchRunTest() { load.pairs = 3; }

    std::unique_ptr<BenchRun> start()
    {
        std::vector<std::unique_ptr<tool::BenchPair>> pairs;
        for (FakeBenchPair& fake : fakes)
            pairs.push_back(std::move(fake.pair));
        return std::make_unique<BenchRun>(std::move(pairs), load);
    }

    static void awaitMessages(const BenchRun& run, std::uint64_t count)
    {
        while (run.done() < count)
            std::this_thread::yield();
    }

    std::array<FakeBenchPair, 3> fakes;
    BenchLoad load;
};

TEST_F(BenchRunTest, TheFiguresOfAllPairsAreAddedUp)
{
    load.count = 100;
    const auto run = start();
    EXPECT_TRUE(PollSet(run->getPollFd()).wait(std::chrono::seconds(20)).contains(run->getPollFd()));
    EXPECT_EQ(run->done(), 100U);
    const auto longest = run->elapsed();
    const BenchFigures figures = run->finish();
    EXPECT_EQ(figures.latency.count(), 100U);
    EXPECT_GT(figures.elapsed, std::chrono::nanoseconds(0));
    EXPECT_LE(figures.elapsed, longest);
    EXPECT_FALSE(figures.interrupted);
}

TEST_F(BenchRunTest, ToldToStopItStopsAndSaysSo)
{
    const auto run = start();
    awaitMessages(*run, 10);
    run->stop();
    const BenchFigures figures = run->finish();
    EXPECT_TRUE(figures.interrupted);
    EXPECT_EQ(figures.latency.count(), run->done());
}

TEST_F(BenchRunTest, WhoeverWaitsForTheTimeOfAMessageIsWoken)
{
    load.rate = 0.0001;
    const auto run = start();
    awaitMessages(*run, 1);
    run->stop();
    EXPECT_EQ(run->finish().latency.count(), 1U); // the pair whose message was due at once
}

TEST_F(BenchRunTest, TheFailureOfOnePairEndsAllAndIsTold)
{
    FakeHypervisorEnd* const end = fakes[1].first;
    end->onMessage = [end](const QelMessage& message) { end->respond(message, QelMessageStatusCmdFailed); };
    const auto run = start();
    EXPECT_THAT([&] { run->finish(); },
                ThrowsMessage<RequestRefused>(StrEq("broadcast refused: 0x00000006 (QelMessageStatusCmdFailed)")));
}

TEST_F(BenchRunTest, AFailureAfterTheEndIsNone)
{
    std::atomic<bool> stopped{false};
    FakeHypervisorEnd* const end = fakes[1].first;
    end->onMessage = [end, &stopped](const QelMessage& message) {
        while (!stopped)
            std::this_thread::yield();
        end->respond(message, QelMessageStatusCmdFailed);
    };
    const auto run = start();
    run->stop();
    stopped = true;
    EXPECT_TRUE(run->finish().interrupted);
}

TEST_F(BenchRunTest, ARunThatNobodyWaitsForEnds)
{
    const auto run = start();
    awaitMessages(*run, 10);
}

} // namespace

} // namespace qel::test
