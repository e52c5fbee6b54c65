#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "bench/BenchRun.hpp"
#include "support/LoopbackEnds.hpp"
#include "tools/bench/FakeBenchPair.hpp"

#include <array>
#include <atomic>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <sys/socket.h>
#include <thread>
#include <vector>

namespace qel::test {

namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::BenchFigures;
using tool::BenchLoad;
using tool::BenchRun;
using tool::StatusError;

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

TEST_F(BenchRunTest, StoppingMarksTheRunInterrupted)
{
    const auto run = start();
    awaitMessages(*run, 10);
    run->stop();
    const BenchFigures figures = run->finish();
    EXPECT_TRUE(figures.interrupted);
    EXPECT_EQ(figures.latency.count(), run->done());
}

TEST_F(BenchRunTest, StoppingWakesAPairThatWaitsForADueTime)
{
    load.rate = 0.0001;
    const auto run = start();
    awaitMessages(*run, 1);
    run->stop();
    EXPECT_EQ(run->finish().latency.count(), 1U); // the pair whose message was due at once
}

TEST_F(BenchRunTest, TheFailureOfOnePairEndsTheRunAndIsThrown)
{
    FakeHypervisorEnd* const end = fakes[1].first;
    end->onMessage = [end](const QelMessage& message) { end->respond(message, QelMessageStatusCmdFailed); };
    const auto run = start();
    EXPECT_THROW(run->finish(), StatusError);
}

TEST_F(BenchRunTest, AFailureAfterTheEndIsDropped)
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

/// A pair whose hypervisor has stopped after the introduction: it takes what it is sent, and neither answers nor ends a
/// connection.
struct StalledPair {
    StalledPair()
        : pair(std::make_unique<tool::BenchPair>(console(first), console(second), 1, std::chrono::milliseconds(1)))
    {}

    static tool::BenchConsole console(Loopback& loopback)
    {
        std::thread introduction([&far = *loopback.far] {
            LoopbackMessages messages(far);
            const auto request = messages.receive();
            messages.send(QelMessageGetEnclTypeAndInterfaceVersionRsp(request->getCallerId(), 'Q', 1, 0, "", ""));
        });
        protocol::ConsoleOptions options("stalled:1");
        options.plain = true;
        options.identity.toolId = "console";
        protocol::Console console(std::move(loopback.near), options);
        introduction.join();
        return {options.identity, std::move(console)};
    }

    /// Whether a console has said that it will send no more. Takes what it sent before.
    static bool hasLeft(Loopback& loopback)
    {
        std::array<char, 4096> bytes;
        ssize_t count = 0;
        do
            count = ::recv(loopback.far->getSocket().getFd(), bytes.data(), bytes.size(), MSG_DONTWAIT);
        while (count > 0);
        return count == 0;
    }

    Loopback first;
    Loopback second;
    std::unique_ptr<tool::BenchPair> pair;
};

TEST(BenchRunEnd, AllPairsLeaveInParallel)
{
    std::array<StalledPair, 4> stalled;
    std::vector<std::unique_ptr<tool::BenchPair>> pairs;
    for (StalledPair& entry : stalled)
        pairs.push_back(std::move(entry.pair));
    BenchLoad load;
    load.pairs = stalled.size();
    BenchRun run(std::move(pairs), load);
    EXPECT_TRUE(PollSet(run.getPollFd()).wait(std::chrono::seconds(20)).contains(run.getPollFd()));
    for (StalledPair& entry : stalled) {
        EXPECT_TRUE(StalledPair::hasLeft(entry.first));
        EXPECT_TRUE(StalledPair::hasLeft(entry.second));
    }
    EXPECT_THROW(run.finish(), tool::DeadlinePassed);
}

TEST_F(BenchRunTest, StoppingAfterTheEndDoesNotMarkTheRunInterrupted)
{
    load.count = 10;
    const auto run = start();
    EXPECT_TRUE(PollSet(run->getPollFd()).wait(std::chrono::seconds(20)).contains(run->getPollFd()));
    run->stop();
    EXPECT_FALSE(run->finish().interrupted);
}

TEST_F(BenchRunTest, ARunThatIsNotFinishedEndsOnDestruction)
{
    const auto run = start();
    awaitMessages(*run, 10);
}

} // namespace

} // namespace qel::test
