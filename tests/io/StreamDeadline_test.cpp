#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "support/SettableClock.hpp"

#include <chrono>
#include <cstdint>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <type_traits>

using namespace std::chrono_literals;
using qel::StreamDeadline;
using qel::StreamIOException;
using qel::test::SettableClock;
using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using steady_point = std::chrono::steady_clock::time_point;
using testing::StrEq;
using testing::ThrowsMessage;

namespace {

class StreamDeadlineTest : public testing::Test {
protected:
    void SetUp() override { mClock.setSteady(mStart); }

    // What the next I/O call would wait for, in milliseconds.
    static milliseconds::rep timeout(StreamDeadline& deadline) { return deadline.getEffectiveTimeout().count(); }

    static void expectExpired(StreamDeadline& deadline)
    {
        EXPECT_THAT([&] { deadline.getEffectiveTimeout(); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
    }

    const steady_point mStart{5000s};
    SettableClock mClock;
};

TEST_F(StreamDeadlineTest, ConstantsHaveTheirValues)
{
    EXPECT_EQ(StreamDeadline::Infinite.count(), -1);
    EXPECT_EQ(StreamDeadline::NoDeadline.time_since_epoch(), nanoseconds(std::numeric_limits<std::int64_t>::max()));
    EXPECT_EQ(StreamDeadline::NoDeadline, steady_point::max());
}

TEST_F(StreamDeadlineTest, IsAssignedFromMillisecondsButNotConverted)
{
    EXPECT_TRUE(std::is_copy_constructible<StreamDeadline>::value);
    EXPECT_TRUE(std::is_copy_assignable<StreamDeadline>::value);
    EXPECT_TRUE(std::is_nothrow_default_constructible<StreamDeadline>::value);
    EXPECT_TRUE((std::is_nothrow_constructible<StreamDeadline, milliseconds>::value));
    EXPECT_TRUE((std::is_nothrow_assignable<StreamDeadline&, milliseconds>::value));
    EXPECT_FALSE((std::is_convertible<milliseconds, StreamDeadline>::value));
}

TEST_F(StreamDeadlineTest, WithoutTimeoutWaitsWithoutLimitAndDoesNotReadTheClock)
{
    StreamDeadline deadline;
    EXPECT_EQ(timeout(deadline), -1);
    mClock.advance(24h);
    EXPECT_EQ(timeout(deadline), -1);
    EXPECT_EQ(mClock.steadyReads(), 0U);
}

TEST_F(StreamDeadlineTest, ConstructedWithATimeoutHasItPending)
{
    StreamDeadline deadline(100ms);
    mClock.advance(1h);
    EXPECT_EQ(timeout(deadline), 100);
    mClock.advance(30ms);
    EXPECT_EQ(timeout(deadline), 70);
}

TEST_F(StreamDeadlineTest, TimeStartsAtTheFirstCallNotWhenItWasSet)
{
    StreamDeadline deadline;
    deadline.setDeadline(100ms);
    mClock.advance(10min);
    EXPECT_EQ(timeout(deadline), 100);
}

TEST_F(StreamDeadlineTest, LaterCallsReturnTheTimeLeftUntilTheDeadlineHasPassed)
{
    StreamDeadline deadline;
    deadline.setDeadline(100ms);
    EXPECT_EQ(timeout(deadline), 100);
    mClock.advance(20ms);
    EXPECT_EQ(timeout(deadline), 80);
    mClock.advance(30ms);
    EXPECT_EQ(timeout(deadline), 50);
    mClock.advance(50ms); // exactly at the deadline it has not passed
    EXPECT_EQ(timeout(deadline), 0);
    EXPECT_EQ(timeout(deadline), 0);
    mClock.advance(1ns);
    expectExpired(deadline);
    expectExpired(deadline);
    mClock.advance(1h);
    expectExpired(deadline);
}

TEST_F(StreamDeadlineTest, EachCallThatHasATimeoutReadsTheClockOnce)
{
    StreamDeadline deadline(100ms);
    EXPECT_EQ(mClock.steadyReads(), 0U);
    deadline.getEffectiveTimeout();
    EXPECT_EQ(mClock.steadyReads(), 1U);
    deadline.getEffectiveTimeout();
    EXPECT_EQ(mClock.steadyReads(), 2U);
}

TEST_F(StreamDeadlineTest, TimeLeftIsRoundedDownToMilliseconds)
{
    struct Row {
        nanoseconds passed;
        milliseconds::rep left;
    };
    const Row rows[] = {{0ns, 10},      {1ns, 9}, {1ms - 1ns, 9}, {1ms, 9},        {1ms + 1ns, 8},
                        {9ms - 1ns, 1}, {9ms, 1}, {9ms + 1ns, 0}, {10ms - 1ns, 0}, {10ms, 0}};
    for (const Row& row : rows) {
        SCOPED_TRACE(row.passed.count());
        mClock.setSteady(mStart);
        StreamDeadline deadline(10ms);
        deadline.getEffectiveTimeout();
        mClock.advance(row.passed);
        EXPECT_EQ(timeout(deadline), row.left);
    }
}

TEST_F(StreamDeadlineTest, NegativeTimeoutClearsAPendingOne)
{
    StreamDeadline deadline(100ms);
    deadline.setDeadline(-5ms);
    EXPECT_EQ(timeout(deadline), -1);
    EXPECT_EQ(mClock.steadyReads(), 0U);
}

TEST_F(StreamDeadlineTest, NegativeTimeoutClearsADeadlineInForce)
{
    for (const milliseconds negative : {-1ms, -5ms, milliseconds::min()}) {
        SCOPED_TRACE(negative.count());
        StreamDeadline deadline(100ms);
        deadline.getEffectiveTimeout();
        deadline.setDeadline(50ms);
        deadline.setDeadline(negative);
        mClock.advance(1h);
        EXPECT_EQ(timeout(deadline), -1);
        EXPECT_EQ(timeout(deadline), -1);
    }
}

TEST_F(StreamDeadlineTest, NegativeTimeoutClearsADeadlineThatHasPassed)
{
    StreamDeadline deadline(1ms);
    deadline.getEffectiveTimeout();
    mClock.advance(1s);
    expectExpired(deadline);
    deadline.setDeadline(StreamDeadline::Infinite);
    EXPECT_EQ(timeout(deadline), -1);
}

TEST_F(StreamDeadlineTest, ZeroPollsOnceAndThrowsWhenTheClockHasAdvanced)
{
    StreamDeadline deadline;
    deadline.setDeadline(0ms);
    EXPECT_EQ(timeout(deadline), 0);
    EXPECT_EQ(timeout(deadline), 0); // the clock does not advance
    mClock.advance(1ns);
    expectExpired(deadline);
}

TEST_F(StreamDeadlineTest, ANewTimeoutAppliesAfterTheOldDeadlineHasPassed)
{
    StreamDeadline deadline(100ms);
    deadline.getEffectiveTimeout();
    mClock.advance(1s);
    expectExpired(deadline);
    deadline.setDeadline(50ms);
    EXPECT_EQ(timeout(deadline), 50);
    mClock.advance(20ms);
    EXPECT_EQ(timeout(deadline), 30);
}

TEST_F(StreamDeadlineTest, LastTimeoutSetIsTheOneThatStarts)
{
    StreamDeadline deadline;
    deadline.setDeadline(100ms);
    deadline.setDeadline(40ms);
    EXPECT_EQ(timeout(deadline), 40);
    mClock.advance(41ms);
    expectExpired(deadline);
}

TEST_F(StreamDeadlineTest, AssigningMillisecondsSetsTheDeadline)
{
    StreamDeadline deadline;
    EXPECT_EQ(&(deadline = 100ms), &deadline);
    mClock.advance(1h);
    EXPECT_EQ(timeout(deadline), 100);
    deadline = 0ms;
    EXPECT_EQ(timeout(deadline), 0);
    mClock.advance(1ms);
    expectExpired(deadline);
    deadline = -5ms; // cleared, not stored
    EXPECT_EQ(timeout(deadline), -1);
}

TEST_F(StreamDeadlineTest, CopiesPendingTimeoutAndDeadline)
{
    StreamDeadline original(100ms);
    StreamDeadline pendingCopy(original);
    original.getEffectiveTimeout();
    StreamDeadline startedCopy;
    startedCopy = original;
    mClock.advance(60ms);
    EXPECT_EQ(timeout(pendingCopy), 100);
    EXPECT_EQ(timeout(startedCopy), 40);
}

TEST_F(StreamDeadlineTest, ConstructorStoresANegativeTimeoutUnchanged)
{
    StreamDeadline deadline(-5ms);
    EXPECT_EQ(timeout(deadline), -5);
    EXPECT_EQ(mClock.steadyReads(), 1U);
    expectExpired(deadline);
}

TEST_F(StreamDeadlineTest, ConstructedWithInfiniteWaitsWithoutLimit)
{
    StreamDeadline deadline(StreamDeadline::Infinite);
    EXPECT_EQ(timeout(deadline), -1);
    EXPECT_EQ(mClock.steadyReads(), 0U);
}

TEST_F(StreamDeadlineTest, TimeoutBeyondTheClockIsReturnedOnceAndSetsNoDeadline)
{
    StreamDeadline deadline;
    deadline.setDeadline(milliseconds::max());
    EXPECT_EQ(timeout(deadline), milliseconds::max().count());
    mClock.setSteady(steady_point::max());
    EXPECT_EQ(timeout(deadline), -1);
}

TEST_F(StreamDeadlineTest, TimeoutBeyondTheClockSetsNoDeadlineAtTheEpochEither)
{
    mClock.setSteady(steady_point());
    StreamDeadline deadline(milliseconds::max());
    EXPECT_EQ(timeout(deadline), milliseconds::max().count());
    EXPECT_EQ(timeout(deadline), -1);
}

TEST_F(StreamDeadlineTest, TimeoutThatEndsAtTheLastTimePointSetsNoDeadline)
{
    mClock.setSteady(steady_point::max() - 1ms);
    StreamDeadline deadline(1ms);
    EXPECT_EQ(timeout(deadline), 1);
    EXPECT_EQ(timeout(deadline), -1);
}

TEST_F(StreamDeadlineTest, TimeoutThatEndsBeforeTheLastTimePointSetsADeadline)
{
    mClock.setSteady(steady_point::max() - 1ms - 1ns);
    StreamDeadline deadline(1ms);
    EXPECT_EQ(timeout(deadline), 1);
    EXPECT_EQ(timeout(deadline), 1);
    mClock.advance(1ms);
    EXPECT_EQ(timeout(deadline), 0);
    mClock.advance(1ns);
    expectExpired(deadline);
}

TEST_F(StreamDeadlineTest, TimeoutThatEndsAfterTheLastTimePointSetsNoDeadline)
{
    mClock.setSteady(steady_point::max() - 1ms + 1ns);
    StreamDeadline deadline(1ms);
    EXPECT_EQ(timeout(deadline), 1);
    EXPECT_EQ(timeout(deadline), -1);
}

TEST_F(StreamDeadlineTest, LongestTimeoutUnderAClockBelowZeroDoesNotOverflow)
{
    mClock.setSteady(steady_point::min());
    StreamDeadline deadline;
    deadline.setDeadline(milliseconds::max());
    EXPECT_EQ(timeout(deadline), milliseconds::max().count());
    // The timeout counts as the longest one in nanoseconds; from the lowest time point it ends 1 ns below zero.
    EXPECT_EQ(timeout(deadline), 9223372036854);
}

TEST_F(StreamDeadlineTest, TimeLeftAcrossTheWholeClockDoesNotOverflow)
{
    mClock.setSteady(steady_point::max() - 2ms);
    StreamDeadline deadline(1ms);
    deadline.getEffectiveTimeout();
    mClock.setSteady(steady_point::min()); // a substituted clock may jump: 2^64 - 1 - 1000000 ns remain
    EXPECT_EQ(timeout(deadline), 18446744073708);
}

TEST_F(StreamDeadlineTest, LowestConstructedTimeoutDoesNotOverflow)
{
    StreamDeadline deadline(milliseconds::min());
    EXPECT_EQ(timeout(deadline), milliseconds::min().count());
    expectExpired(deadline);

    mClock.setSteady(steady_point::min());
    StreamDeadline atTheLowestPoint(-5ms);
    EXPECT_EQ(timeout(atTheLowestPoint), -5);
    EXPECT_EQ(timeout(atTheLowestPoint), 0); // the deadline is the lowest time point, which is now
    mClock.advance(1ns);
    expectExpired(atTheLowestPoint);
}

} // namespace
