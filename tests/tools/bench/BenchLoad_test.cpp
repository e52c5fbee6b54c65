#include "bench/BenchLoad.hpp"
#include "support/SettableClock.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <vector>

namespace qel::test {

namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using ::testing::ElementsAre;
using tool::BenchFigures;
using tool::BenchLoad;
using tool::BenchShare;

/// A run on a clock that moves only while a message is under way or is waited for.
class BenchShareTest : public ::testing::Test {
protected:
    BenchFigures run(unsigned int pair = 0)
    {
        BenchFigures figures;
        run(figures, pair);
        return figures;
    }
    void run(BenchFigures& figures, unsigned int pair = 0)
    {
        const BenchShare share(load, pair, start);
        share.run([this] { exchange(); }, [this](BenchShare::TimePoint time) { return waitUntil(time); }, figures,
                  done);
    }

    void exchange()
    {
        sentAt.push_back(std::chrono::duration_cast<milliseconds>(TimeProvider::steady() - start).count());
        const std::size_t number = sentAt.size() - 1;
        clock.advance(number < takes.size() ? takes[number] : milliseconds(1));
        if (sentAt.size() == failsAt) throw std::runtime_error("failed");
    }

    bool waitUntil(BenchShare::TimePoint time)
    {
        if (sentAt.size() == stopsAfter) return false;
        if (TimeProvider::steady() < time) clock.setSteady(time);
        return true;
    }

    SettableClock clock;
    const BenchShare::TimePoint start = TimeProvider::steady();
    BenchLoad load;
    std::vector<milliseconds> takes; // that the messages take; a millisecond each when not said
    std::size_t stopsAfter = 1000000;
    std::size_t failsAt = 1000000;

    std::vector<long> sentAt; // milliseconds from the start
    std::atomic<std::uint64_t> done{0};
};

TEST_F(BenchShareTest, WithoutARateMessagesFollowEachOther)
{
    load.count = 3;
    takes = {milliseconds(5), milliseconds(1), milliseconds(2)};
    const BenchFigures figures = run();
    EXPECT_THAT(sentAt, ElementsAre(0, 5, 6));
    EXPECT_EQ(figures.latency.count(), 3U);
    EXPECT_EQ(figures.latency.longest(), milliseconds(5));
    EXPECT_EQ(figures.elapsed, milliseconds(8));
    EXPECT_EQ(figures.unsent, 0U);
    EXPECT_FALSE(figures.interrupted);
    EXPECT_EQ(done, 3U);
}

TEST_F(BenchShareTest, WithARateEachMessageHasADueTime)
{
    load.count = 3;
    load.rate = 100;
    const BenchFigures figures = run();
    EXPECT_THAT(sentAt, ElementsAre(0, 10, 20));
    EXPECT_EQ(figures.elapsed, milliseconds(21));
    EXPECT_EQ(figures.latency.longest(), milliseconds(1));
}

TEST_F(BenchShareTest, LatencyCountsFromTheDueTime)
{
    load.count = 4;
    load.rate = 100;
    takes = {milliseconds(25), milliseconds(1), milliseconds(1), milliseconds(1)};
    const BenchFigures figures = run();
    EXPECT_THAT(sentAt, ElementsAre(0, 25, 26, 30));
    // 25, 16 (due at 10, done at 26), 7 (due at 20, done at 27) and 1. Only one message took long; three were late.
    EXPECT_EQ(figures.latency.longest(), milliseconds(25));
    std::vector<long long> rows;
    for (const auto& row : figures.latency.rows())
        rows.push_back(row.upTo.count() / 1000000 * (row.count > 0 ? 1 : 0));
    EXPECT_THAT(rows, ElementsAre(1, 0, 0, 10, 20, 50));
}

TEST_F(BenchShareTest, MessagesAreDistributedRoundRobin)
{
    load.pairs = 3;
    load.rate = 100;
    load.count = 8;
    EXPECT_EQ(run(0).latency.count(), 3U);
    EXPECT_THAT(sentAt, ElementsAre(0, 30, 60));
    clock.setSteady(start);
    sentAt.clear();
    EXPECT_EQ(run(1).latency.count(), 3U);
    EXPECT_THAT(sentAt, ElementsAre(10, 40, 70));
    clock.setSteady(start);
    sentAt.clear();
    EXPECT_EQ(run(2).latency.count(), 2U);
    EXPECT_THAT(sentAt, ElementsAre(20, 50));
}

TEST_F(BenchShareTest, WithFewerMessagesThanPairsSomePairsHaveNone)
{
    load.pairs = 3;
    load.count = 1;
    EXPECT_EQ(run(0).latency.count(), 1U);
    EXPECT_EQ(run(1).latency.count(), 0U);
    EXPECT_EQ(run(2).latency.count(), 0U);
}

TEST_F(BenchShareTest, WithoutARateTheRunEndsAfterTheCurrentMessage)
{
    load.time = milliseconds(10);
    takes = {milliseconds(9), milliseconds(9)};
    const BenchFigures figures = run();
    EXPECT_THAT(sentAt, ElementsAre(0, 9));
    EXPECT_EQ(figures.elapsed, milliseconds(18));
}

TEST_F(BenchShareTest, AMessageThatCompletesAtTheEndIsTheLast)
{
    load.time = milliseconds(10);
    takes = {milliseconds(5), milliseconds(5)};
    EXPECT_EQ(run().latency.count(), 2U);
}

TEST_F(BenchShareTest, AMessageThatIsDueAtTheEndIsNotSent)
{
    load.time = milliseconds(20);
    load.rate = 100;
    const BenchFigures figures = run();
    EXPECT_THAT(sentAt, ElementsAre(0, 10));
    EXPECT_EQ(figures.unsent, 0U);
}

TEST_F(BenchShareTest, MessagesThatWereDueAndNotSentAreCounted)
{
    load.time = milliseconds(100);
    load.rate = 100;
    takes = {milliseconds(45), milliseconds(200)};
    const BenchFigures figures = run();
    EXPECT_THAT(sentAt, ElementsAre(0, 45));
    EXPECT_EQ(figures.latency.count(), 2U);
    EXPECT_EQ(figures.unsent, 8U); // ten in a tenth of a second
}

// One after the other they would take longer to count than anybody waits.
TEST_F(BenchShareTest, AnyNumberOfUnsentMessagesIsCounted)
{
    constexpr std::chrono::hours kWeek(7 * 24);
    load.time = kWeek;
    load.rate = 1000000;
    takes = {kWeek + seconds(1)};
    EXPECT_EQ(run().unsent, 604799999999U);
    load.pairs = 127;
    load.count = 1000000000000;
    clock.setSteady(start);
    sentAt.clear();
    EXPECT_EQ(run(126).unsent, 604800000000U / 127 - 1);
}

TEST_F(BenchShareTest, CountLimitsTheUnsentMessages)
{
    load.time = milliseconds(100);
    load.count = 5;
    load.rate = 100;
    takes = {milliseconds(200)};
    EXPECT_EQ(run().unsent, 4U);
}

TEST_F(BenchShareTest, StoppingCountsTheMessagesDueByThen)
{
    load.rate = 100;
    stopsAfter = 2;
    takes = {milliseconds(1), milliseconds(35)};
    const BenchFigures figures = run();
    EXPECT_THAT(sentAt, ElementsAre(0, 10));
    EXPECT_EQ(figures.latency.count(), 2U);
    EXPECT_EQ(figures.unsent, 3U); // due at 20, 30 and 40 of 45 milliseconds
}

TEST_F(BenchShareTest, AFailureKeepsTheFiguresSoFar)
{
    load.count = 5;
    failsAt = 3;
    BenchFigures figures;
    EXPECT_THROW(run(figures), std::runtime_error);
    EXPECT_EQ(figures.latency.count(), 2U);
    EXPECT_EQ(figures.elapsed, milliseconds(2));
    EXPECT_EQ(done, 2U);
}

TEST_F(BenchShareTest, AFailureCountsTheMessagesDueByThen)
{
    load.rate = 100;
    failsAt = 3;
    takes = {milliseconds(1), milliseconds(1), milliseconds(35)};
    BenchFigures figures;
    EXPECT_THROW(run(figures), std::runtime_error);
    EXPECT_THAT(sentAt, ElementsAre(0, 10, 20));
    EXPECT_EQ(figures.latency.count(), 2U);
    EXPECT_EQ(figures.unsent, 3U); // due at 30, 40 and 50 of 55 milliseconds; the one in hand was sent
}

TEST_F(BenchShareTest, TheClockIsReadOnceForEachMessageAndTwiceWithoutARate)
{
    load.count = 1;
    const BenchShare share(load, 0, start);
    const unsigned before = clock.steadyReads();
    BenchFigures figures;
    const auto nothing = [] {};
    const auto goOn = [](BenchShare::TimePoint) { return true; };
    share.run(nothing, goOn, figures, done);
    EXPECT_EQ(clock.steadyReads() - before, 2U);
    load.rate = 1;
    const BenchShare paced(load, 0, start);
    paced.run(nothing, goOn, figures, done);
    EXPECT_EQ(clock.steadyReads() - before, 4U); // one more at the end, for what was due by then
}

} // namespace

} // namespace qel::test
