#include <qel/common/QelDebug.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/protocol/LogBackendThrottled.hpp>
#include <qel/protocol/Logging.hpp>

#include "server/LogThrottle.hpp"
#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/RecordingLogBackend.hpp"
#include "support/SettableClock.hpp"

#include <gmock/gmock.h>
#include <stdexcept>
#include <thread>

namespace qel::test {

namespace {

using protocol::LogBackendThrottled;
using protocol::logLine;
using protocol::LogThrottle;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

constexpr unsigned kBurst = LogThrottle::kBurst;

class LogThrottleTest : public ::testing::Test {
protected:
    LogThrottleTest()
    {
        QelDebug::globals().resetLoggers();
        QelLogger::get().setLevel(LogLevel::Debug).addBackend(std::make_shared<LogBackendThrottled>(recorder));
    }
    ~LogThrottleTest() override { QelDebug::globals().resetLoggers(); }

    /// Logs lines that differ in a number.
    static void repeat(unsigned count, const std::string& text = "console 1: ignored")
    {
        for (unsigned number = 0; number < count; ++number)
            logLine(LogLevel::Warn, text, " [CID: 0x", number, "A]");
    }

    /// The lines so far, without the time and the ids; forgets them.
    std::vector<std::string> lines()
    {
        std::vector<std::string> lines;
        for (const std::string& line : recorder->lines())
            lines.push_back(line.substr(line.find("): ") - 1));
        recorder->clear();
        return lines;
    }

    SettableClock clock;
    std::shared_ptr<RecordingLogBackend> recorder = std::make_shared<RecordingLogBackend>();
    unsigned heldBackCalls = 0;
    LogThrottle throttle{[this] { ++heldBackCalls; }};
    const std::string peer = "192.0.2.7";
};

TEST_F(LogThrottleTest, LinesAboutNobodyPass)
{
    repeat(100);
    EXPECT_THAT(lines(), SizeIs(100));
}

TEST_F(LogThrottleTest, TheFirstLinesPassAtOnceAndTheRestIsCounted)
{
    const LogThrottle::Scope scope(throttle, peer);
    repeat(kBurst);
    EXPECT_THAT(lines(), SizeIs(kBurst));
    EXPECT_EQ(throttle.getNextReport(), LogThrottle::TimePoint::max());
    EXPECT_EQ(heldBackCalls, 0U);
    repeat(300);
    EXPECT_THAT(lines(), IsEmpty());
    EXPECT_EQ(throttle.getNextReport(), TimeProvider::steady() + LogThrottle::kPeriod);
    EXPECT_EQ(heldBackCalls, 1U);
}

TEST_F(LogThrottleTest, WhatWasHeldBackIsSummedUpAfterASecond)
{
    {
        const LogThrottle::Scope scope(throttle, peer);
        repeat(kBurst + 20000);
    }
    lines();
    clock.advance(LogThrottle::kPeriod - std::chrono::nanoseconds(1));
    throttle.report();
    EXPECT_THAT(lines(), IsEmpty());
    clock.advance(std::chrono::nanoseconds(1));
    throttle.report();
    EXPECT_THAT(lines(), ElementsAre("W): [qel] 192.0.2.7: 20000 more lines like this one: console 1: ignored [CID: "
                                     "0x20009A]"));
    EXPECT_EQ(throttle.getNextReport(), LogThrottle::TimePoint::max());
    throttle.report();
    EXPECT_THAT(lines(), IsEmpty());
}

TEST_F(LogThrottleTest, APeerThatGoesOnGetsOneLineAndOneSumInASecond)
{
    const LogThrottle::Scope scope(throttle, peer);
    repeat(kBurst + 1);
    lines();
    for (int second = 0; second < 5; ++second) {
        clock.advance(LogThrottle::kPeriod);
        throttle.report();
        EXPECT_THAT(lines(), SizeIs(1));
        repeat(100);
        EXPECT_THAT(lines(), SizeIs(1));
    }
}

TEST_F(LogThrottleTest, APeerThatWasQuietGetsABurstAgain)
{
    const LogThrottle::Scope scope(throttle, peer);
    repeat(kBurst + 1);
    clock.advance(LogThrottle::kPeriod);
    throttle.report();
    lines();
    clock.advance(LogThrottle::kPeriod * (kBurst - 2)); // one was left
    repeat(kBurst);
    EXPECT_THAT(lines(), SizeIs(kBurst - 1));
    clock.advance(LogThrottle::kPeriod);
    throttle.report();
    clock.advance(LogThrottle::kPeriod * (kBurst - 1));
    lines();
    repeat(kBurst);
    EXPECT_THAT(lines(), SizeIs(kBurst));
}

TEST_F(LogThrottleTest, ASumNamesThePartitionsOfItsLines)
{
    const LogThrottle::Scope scope(throttle, peer);
    const auto opened = [](unsigned partition) {
        logLine(LogLevel::Info, "audit: opened name=\"a partition=77\" partition=", partition, " connection=0");
    };
    for (unsigned i = 0; i < kBurst + 3; ++i)
        opened(1);
    opened(2);
    opened(1);
    lines();
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre("I): [qel] 192.0.2.7: 5 more lines like this one (partitions 1, 2): audit: opened "
                                     "name=\"a partition=77\" partition=1 connection=0"));
    clock.advance(LogThrottle::kPeriod);
    for (int i = 0; i < 5; ++i)
        opened(3);
    lines();
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre(HasSubstr(" more lines like this one (partition 3): ")));
}

TEST_F(LogThrottleTest, ASumNamesSoManyPartitionsAndSaysThatThereAreOthers)
{
    const LogThrottle::Scope scope(throttle, peer);
    for (unsigned i = 0; i < kBurst; ++i)
        logLine(LogLevel::Info, "opened partition=1");
    for (unsigned partition = 1; partition <= LogThrottle::kMaxPartitions; ++partition)
        logLine(LogLevel::Info, "opened partition=", partition);
    lines();
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre(HasSubstr(", 255, 256): opened")));
    for (unsigned partition = 1; partition <= LogThrottle::kMaxPartitions + 2; ++partition)
        logLine(LogLevel::Info, "opened partition=", partition);
    lines();
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre(HasSubstr(" and others): opened")));
}

TEST_F(LogThrottleTest, EachKindOfLineCountsByItself)
{
    const LogThrottle::Scope scope(throttle, peer);
    repeat(kBurst + 1, "one kind");
    lines();
    repeat(1, "another kind");
    EXPECT_THAT(lines(), ElementsAre(HasSubstr("another kind")));
    logLine(LogLevel::Error, "one kind [CID: 0x1A]"); // another level
    EXPECT_THAT(lines(), SizeIs(1));
}

TEST_F(LogThrottleTest, EachPeerCountsByItself)
{
    const std::string other = "192.0.2.8";
    {
        const LogThrottle::Scope scope(throttle, peer);
        repeat(kBurst + 1);
    }
    const LogThrottle::Scope scope(throttle, other);
    lines();
    repeat(kBurst);
    EXPECT_THAT(lines(), SizeIs(kBurst));
}

TEST_F(LogThrottleTest, TheInnerScopeCountsAndTheOuterOneAgainAfterIt)
{
    const std::string other = "192.0.2.8";
    const LogThrottle::Scope scope(throttle, peer);
    repeat(kBurst + 1);
    lines();
    {
        const LogThrottle::Scope inner(throttle, other);
        repeat(1);
    }
    EXPECT_THAT(lines(), SizeIs(1));
    repeat(1);
    EXPECT_THAT(lines(), IsEmpty());
}

TEST_F(LogThrottleTest, AScopeIsThatOfItsThread)
{
    const LogThrottle::Scope scope(throttle, peer);
    repeat(kBurst + 1);
    lines();
    std::thread([] { repeat(50); }).join();
    EXPECT_THAT(lines(), SizeIs(50));
}

TEST_F(LogThrottleTest, LinesAtDebugPass)
{
    const LogThrottle::Scope scope(throttle, peer);
    for (int number = 0; number < 100; ++number)
        logLine(LogLevel::Debug, "detail");
    EXPECT_THAT(lines(), SizeIs(100));
}

TEST_F(LogThrottleTest, TheLinesOfTheLibraryBelowCountToo)
{
    const LogThrottle::Scope scope(throttle, peer);
    for (unsigned number = 0; number < kBurst + 5; ++number)
        QelDebugContext(QelLogger::get(), LogLevel::Error) << "invalid message length " << number;
    EXPECT_THAT(lines(), SizeIs(kBurst));
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre("E): [qel] 192.0.2.7: 5 more lines like this one: invalid message length 14"));
}

TEST_F(LogThrottleTest, TooManyKindsCountAsOne)
{
    const LogThrottle::Scope scope(throttle, peer);
    for (char kind = 'a'; kind <= 'z'; ++kind) // one after the other, each below its burst
        repeat(kBurst, std::string("kind ") + kind);
    EXPECT_THAT(lines(), SizeIs((LogThrottle::kMaxKinds + 1) * kBurst));
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre(HasSubstr(": 170 more lines like this one: kind z [CID: 0x9A]")));
}

TEST_F(LogThrottleTest, TooManyPeersCountAsOne)
{
    for (unsigned number = 0; number < LogThrottle::kMaxPeers + 100; ++number) {
        const std::string address = "192.0.2." + std::to_string(number);
        const LogThrottle::Scope scope(throttle, address);
        repeat(1);
    }
    EXPECT_THAT(lines(), SizeIs(LogThrottle::kMaxPeers + kBurst));
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre(StartsWith("W): [qel] other peers: 90 more lines like this one: ")));
}

TEST_F(LogThrottleTest, PeersThatAreQuietMakeRoomForOthers)
{
    for (unsigned round = 0; round < 3; ++round) {
        for (unsigned number = 0; number < LogThrottle::kMaxPeers; ++number) {
            const std::string address = std::to_string(round) + "." + std::to_string(number);
            const LogThrottle::Scope scope(throttle, address);
            repeat(1);
        }
        EXPECT_THAT(lines(), SizeIs(LogThrottle::kMaxPeers)) << round;
        clock.advance(LogThrottle::kPeriod);
    }
}

TEST_F(LogThrottleTest, ALongLineIsCutInTheSum)
{
    const LogThrottle::Scope scope(throttle, peer);
    for (unsigned number = 0; number <= kBurst; ++number)
        logLine(LogLevel::Warn, std::string(5000, 'x'));
    lines();
    throttle.reportAll();
    EXPECT_THAT(lines(), ElementsAre(EndsWith(" like this one: " + std::string(200, 'x'))));
}

TEST_F(LogThrottleTest, WithoutMemoryToCountALineItPasses)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const LogThrottle::Scope scope(throttle, peer);
    const std::string line = "[2026-03-01 17:04:09] (4711:4719) (W): [qel] " + std::string(100, 'x');
    for (unsigned number = 0; number <= kBurst; ++number)
        LogThrottle::admits(LogLevel::Warn, line);
    EXPECT_FALSE(LogThrottle::admits(LogLevel::Warn, line));
    Allocations allocations;
    allocations.failAll();
    EXPECT_TRUE(LogThrottle::admits(LogLevel::Warn, line));
}

TEST(LogBackendThrottled, NeedsABackendBehindIt)
{
    EXPECT_THAT([] { LogBackendThrottled(nullptr); }, ThrowsMessage<std::invalid_argument>(StrEq("to")));
}

} // namespace

} // namespace qel::test
