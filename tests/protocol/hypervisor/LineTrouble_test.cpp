// Connections that break in unusual ways, lines that take nothing, and lines of the program's own that find no memory.

#include <qel/common/QelLogger.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "protocol/hypervisor/LineLifeFixture.hpp"
#include "support/Allocations.hpp"

#include <gmock/gmock.h>
#include <memory>
#include <new>
#include <poll.h>
#include <stdexcept>
#include <sys/socket.h>

namespace qel::test {

namespace {

using std::chrono::seconds;
using ::testing::ElementsAre;

using LineTroubleTest = LineLifeFixture;

TEST_F(LineTroubleTest, AWaitingConnectionThatHasHungUpWithNothingLeftIsMadeAgain)
{
    PartitionOptions options = connection();
    options.unattended = protocol::WhenUnattended::Wait;
    serveWith(options);
    hypervisor->serviceLines();
    clock.advance(seconds(5));
    port1->ended = true;
    port1->whenEnded = protocol::SerialLine::LineState::Idle;
    hypervisor->serviceSerial(1);
    port1->ended = false;
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] partition 1: line lost: it has ended; connecting again"));
    expectStartAfter(seconds(1));
}

TEST_F(LineTroubleTest, AConnectionThatNobodyReadsIsMadeAgainWhenThePeerEndsIt)
{
    PartitionOptions options = connection();
    options.unattended = protocol::WhenUnattended::Wait;
    serveWith(options);
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueFd near(ends[0]);
    const UniqueFd far(ends[1]);
    port1->fd = near.get();
    hypervisor->serviceLines();
    const short onlyItsEnd = POLLERR | POLLHUP | POLLNVAL | POLLRDHUP;
    EXPECT_THAT(watchedEvents(), ElementsAre(std::make_pair(1, onlyItsEnd), std::make_pair(2, onlyItsEnd)));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->reads, 0U);
    ASSERT_EQ(::shutdown(far.get(), SHUT_WR), 0);
    port1->onCall = [](const std::string& called) {
        if (called == "read") throw std::runtime_error("finished");
    };
    hypervisor->serviceSerial(1);
    port1->onCall = nullptr;
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] partition 1: line lost: finished; connecting again"));
    expectStartAfter(seconds(1));
}

TEST_F(LineTroubleTest, WhatIsTypedWhileALineConnectsIsDroppedAndTheSessionIsToldOnceEachTime)
{
    serveWith(connection());
    hypervisor->serviceLines();
    Peer peer;
    setUpSerial(peer, "a", 1);
    for (int outage = 0; outage < 2; ++outage) {
        port1->ended = true;
        hypervisor->serviceSerial(1);
        port1->ended = false;
        hypervisor->serviceLines();
        received(peer);
        port1->steps = {"", ""};
        clock.advance(seconds(10));
        hypervisor->serviceLines();
        sendData(peer, 1, "while ");
        sendData(peer, 1, "connecting");
        hypervisor->serviceSerial(1);
        hypervisor->serviceSerial(1);
        hypervisor->serviceLines();
        EXPECT_EQ(received(peer), "\r\n[qel: the line is down, input is dropped]\r\n\r\n[qel: line is back]\r\n");
        EXPECT_EQ(port1->input, "");
    }
}

TEST_F(LineTroubleTest, LinesOfTheProgramsOwnCostTheSessionThatTypesNoOutput)
{
    PartitionOptions options = connection();
    options.replayBytes = 4096;
    serveWith(options);
    hypervisor->serviceLines();
    port1->output = {std::string(4096, 'a')};
    hypervisor->serviceSerial(1);
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    peer.link.serialRoom = false;
    EXPECT_EQ(setUp(peer, 1), 0U);
    clock.advance(seconds(5));
    port1->wantsWriting = true;
    port1->steps = {"broken"};
    hypervisor->serviceSerial(1);
    port1->wantsWriting = false;
    expectStartAfter(seconds(1));
    PartitionOptions smaller = options;
    smaller.replayBytes = 0;
    EXPECT_TRUE(hypervisor->changePartition(1, smaller));
    peer.link.serialRoom = true;
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer),
              std::string(4096, 'a') + "\r\n[qel: line lost: broken; connecting again]\r\n\r\n[qel: line is back]\r\n");
    port1->output = {std::string(4096, 'b')};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(received(peer), std::string(4096, 'b'));
    EXPECT_EQ(hypervisor->partitions()[0].keptBytes, 4096U); // no more than before
}

TEST_F(LineTroubleTest, ALossThatThereIsNoMemoryForIsToldLater)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const auto tap = std::make_shared<RecordingTap>();
    bool hasFailed = true;
    for (std::size_t allowed = 0; hasFailed; ++allowed) {
        SCOPED_TRACE(allowed);
        ASSERT_LT(allowed, 100U);
        tap->calls.clear();
        PartitionOptions options = connection();
        options.tap = tap;
        serveWith(options);
        hypervisor->serviceLines();
        Peer peer;
        setUpSerial(peer, "a", 1);
        clock.advance(seconds(5));
        port1->ended = true;
        port1->reason = "a reason that is too long for a string without memory";
        QelLogger::get().setLevel(LogLevel::Critical);
        {
            Allocations allocations;
            allocations.failAfter(allowed);
            try {
                hypervisor->serviceSerial(1);
            } catch (const std::bad_alloc&) { // NOLINT(bugprone-empty-catch): the serial thread goes on
            }
            hasFailed = port1->stopped == 0 || tap->calls.empty() || tap->calls[0].find("reason") == std::string::npos;
        }
        hypervisor->serviceSerial(1);
        port1->ended = false;
        hypervisor->serviceLines();
        clock.advance(seconds(1));
        hypervisor->serviceLines();
        hypervisor->serviceLines();
        const std::string text = received(peer);
        EXPECT_EQ(text.rfind("\r\n[qel: line lost", 0), 0U) << text;
        EXPECT_THAT(text, ::testing::EndsWith("]\r\n\r\n[qel: line is back]\r\n"));
        ASSERT_EQ(tap->calls.size(), 2U);
        EXPECT_THAT(tap->calls[0], ::testing::StartsWith("1 event line lost"));
        EXPECT_EQ(tap->calls[1], "1 event line is back");
    }
}

TEST_F(LineTroubleTest, ABreakThatCannotBeSentIsLoggedAndIsNotTheReasonOfALaterEnd)
{
    serveWith(connection());
    hypervisor->serviceLines();
    port1->onCall = [](const std::string& called) {
        if (called == "sendBreak") throw std::runtime_error("no break today");
    };
    EXPECT_FALSE(hypervisor->sendBreak(1));
    EXPECT_THAT(log.lines(), ElementsAre("E: [qel] partition 1: no break today"));
    log.clear();
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] partition 1: line lost: it has ended; connecting again"));
}

TEST_F(LineTroubleTest, AConsoleThatDoesNotReadKeepsACommandFromStartingAgainForTenSeconds)
{
    serveWith(boot(RestartLine::Always));
    hypervisor->serviceLines();
    Peer peer;
    setUpSerial(peer, "a", 1);
    peer.link.serialRoom = false;
    port1->output = {std::string(4096, 'x'), "missed"};
    EXPECT_EQ(hypervisor->serviceLines(), seconds(1)); // nothing else would make the server look
    clock.advance(seconds(100));
    hypervisor->serviceLines();
    EXPECT_EQ(port1->reads, 0U); // it runs, and waits for the console
    port1->ended = true;
    port1->end = CommandEnd{Kind::Exited, 3};
    hypervisor->serviceLines();
    clock.advance(milliseconds(9999));
    hypervisor->serviceLines();
    EXPECT_EQ(port1->stopped, 0U);
    clock.advance(milliseconds(1));
    hypervisor->serviceLines();
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_EQ(takeData(peer, 1), "\r\n[qel: 4102 bytes skipped]\r\n");
    expectClosed(peer, 1, 4, 0x0103);
    port1->ended = false;
    expectStartAfter(seconds(1));
}

TEST_F(LineTroubleTest, AConsoleThatReadsInTimeMissesNothingOfACommandThatStartsAgain)
{
    serveWith(boot(RestartLine::Always));
    hypervisor->serviceLines();
    Peer peer;
    setUpSerial(peer, "a", 1);
    peer.link.serialRoom = false;
    port1->output = {"last words"};
    port1->ended = true;
    hypervisor->serviceLines();
    clock.advance(milliseconds(9999));
    hypervisor->serviceLines();
    peer.link.serialRoom = true;
    hypervisor->serviceSerial(1);
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "last words");
    expectClosed(peer, 1, 4, 0x0100);
}

// Lines whose descriptor is ready although nothing can be moved.

TEST_F(LineTroubleTest, ALineWithWhichNothingMovesIsLeftAloneForAMoment)
{
    constexpr milliseconds kPause = protocol::FruitlessTurns::kPause;
    serveWith(boot());
    hypervisor->serviceLines();
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->takes = 0;
    sendData(peer, 1, "stuck");
    for (int turn = 0; turn < protocol::FruitlessTurns::kMost; ++turn) {
        EXPECT_THAT(watched(), ElementsAre(1, 2)) << turn;
        hypervisor->serviceSerial(1);
    }
    EXPECT_THAT(watched(), ElementsAre(2));
    EXPECT_EQ(hypervisor->serviceLines(), kPause);
    clock.advance(kPause - milliseconds(1));
    EXPECT_EQ(hypervisor->serviceLines(), milliseconds(1));
    EXPECT_THAT(watched(), ElementsAre(2));
    clock.advance(milliseconds(1));
    EXPECT_EQ(hypervisor->serviceLines().count(), -1);
    EXPECT_THAT(watched(), ElementsAre(1, 2));
    port1->takes = 5;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->input, "stuck");
}

TEST_F(LineTroubleTest, ALineWithWhichSomethingMovesNowAndThenIsNotLeftAlone)
{
    serveWith(boot());
    hypervisor->serviceLines();
    for (int round = 0; round < 3; ++round) {
        for (int turn = 1; turn < protocol::FruitlessTurns::kMost; ++turn)
            hypervisor->serviceSerial(1);
        port1->output = {"x"};
        hypervisor->serviceSerial(1);
    }
    EXPECT_THAT(watched(), ElementsAre(1, 2));
}

TEST_F(LineTroubleTest, ALineThatIsLostWhileItIsLeftAloneIsWatchedAgainWhenItIsBack)
{
    serveWith(connection());
    hypervisor->serviceLines();
    for (int turn = 0; turn < protocol::FruitlessTurns::kMost; ++turn)
        hypervisor->serviceSerial(1);
    EXPECT_THAT(watched(), ElementsAre(2));
    port1->ended = true;
    hypervisor->serviceSerial(1);
    port1->ended = false;
    EXPECT_EQ(hypervisor->serviceLines(), seconds(1));
    expectStartAfter(seconds(1));
    EXPECT_THAT(watched(), ElementsAre(1, 2));
}

} // namespace

} // namespace qel::test
