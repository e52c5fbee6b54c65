#include "console/KeepAlive.hpp"
#include "protocol/console/FakeHypervisorEnd.hpp"
#include "support/SettableClock.hpp"

#include <gtest/gtest.h>

namespace qel::test {

namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using tool::KeepAlive;
using Event = KeepAlive::Event;

constexpr seconds kInterval{15};
constexpr milliseconds kHalf{7500};

class KeepAliveTest : public ::testing::Test {
protected:
    KeepAliveTest()
    {
        end->onMessage = [](const QelMessage&) {}; // the server says nothing
        keepAlive.watch(console, start);
    }

    /// As the loop does: what has been asked goes out before it waits.
    Event check(PollDeadline::time_point now)
    {
        const Event event = keepAlive.check(now);
        if (console.hasPending()) static_cast<void>(console.process());
        return event;
    }

    /// The number of times that the time of day was asked for, which is all that may be asked.
    std::size_t questions() const
    {
        for (const auto& message : end->received)
            EXPECT_NE(dynamic_cast<const QelMessageGetQelTodReq*>(message.get()), nullptr);
        return end->received.size();
    }

    FakeHypervisorEnd* end = nullptr; // owned by the console
    protocol::Console console = FakeHypervisorEnd::makeConsole(end, FakeHypervisorEnd::plainOptions(), true);
    const PollDeadline::time_point start{seconds(1000)};
    KeepAlive keepAlive{kInterval};
};

TEST_F(KeepAliveTest, AsksOnceAfterHalfOfTheInterval)
{
    EXPECT_EQ(keepAlive.deadline(), PollDeadline(start + kHalf));
    EXPECT_EQ(check(start + kHalf - milliseconds(1)), Event::None);
    EXPECT_EQ(questions(), 0U);
    EXPECT_EQ(check(start + kHalf), Event::None);
    EXPECT_EQ(questions(), 1U);
    EXPECT_EQ(keepAlive.deadline(), PollDeadline(start + kInterval));
    EXPECT_EQ(check(start + kInterval - milliseconds(1)), Event::None);
    EXPECT_EQ(questions(), 1U);
}

TEST_F(KeepAliveTest, ReportsSilenceOnceAfterTheInterval)
{
    check(start + kHalf);
    EXPECT_EQ(check(start + kInterval), Event::Silent);
    EXPECT_EQ(check(start + 2 * kInterval), Event::None);
    EXPECT_TRUE(keepAlive.deadline().isDisabled());
    EXPECT_EQ(keepAlive.silence(start + 2 * kInterval), 2 * kInterval);
}

TEST_F(KeepAliveTest, AnAnswerEndsTheSilence)
{
    check(start + kHalf);
    ASSERT_EQ(check(start + kInterval), Event::Silent);
    end->respond(*end->received.back(), QelMessageStatusCmdFailed); // a refusal is an answer as well
    ASSERT_TRUE(console.process());
    EXPECT_EQ(keepAlive.noteHeard(start + seconds(20)), Event::Back);
    EXPECT_EQ(keepAlive.roundTrip(), std::chrono::microseconds(12500000));
    EXPECT_EQ(keepAlive.deadline(), PollDeadline(start + seconds(20) + kHalf));
    check(start + seconds(20) + kHalf);
    EXPECT_EQ(questions(), 2U);
}

TEST_F(KeepAliveTest, AnyMessageCountsAsASignOfLife)
{
    EXPECT_EQ(keepAlive.noteHeard(start + seconds(7)), Event::None);
    EXPECT_EQ(check(start + seconds(14)), Event::None);
    EXPECT_EQ(questions(), 0U);
}

TEST_F(KeepAliveTest, AsksNoSecondQuestionWhileTheFirstIsUnderWay)
{
    check(start + kHalf);
    keepAlive.noteHeard(start + seconds(8)); // output of the partition
    check(start + seconds(8) + kHalf);
    EXPECT_EQ(questions(), 1U);
}

TEST_F(KeepAliveTest, AConnectionThatTakesNothingIsNotAskedAndIsSilentAllTheSame)
{
    end->stopTaking();
    EXPECT_EQ(check(start + kHalf), Event::None);
    EXPECT_EQ(questions(), 0U);
    EXPECT_EQ(check(start + kInterval), Event::Silent);
}

TEST_F(KeepAliveTest, TimeInWhichNothingCouldBeReceivedDoesNotCount)
{
    keepAlive.postpone(start + seconds(10));
    EXPECT_EQ(check(start + kInterval), Event::None);
    EXPECT_EQ(check(start + seconds(10) + kInterval), Event::Silent);
    keepAlive.postpone(start + seconds(60));
    EXPECT_EQ(keepAlive.silence(start + seconds(60)), seconds(50)) << "only a message ends the silence";
}

TEST_F(KeepAliveTest, AnIntervalOfZeroTurnsItOff)
{
    KeepAlive off{milliseconds(0)};
    off.watch(console, start);
    EXPECT_TRUE(off.deadline().isDisabled());
    EXPECT_EQ(off.check(start + std::chrono::hours(1)), Event::None);
    EXPECT_EQ(questions(), 0U);
}

} // namespace

} // namespace qel::test
