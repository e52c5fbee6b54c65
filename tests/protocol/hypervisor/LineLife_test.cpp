// Lines that are brought up without a console: with the server, again after their end, and again when they are lost.

#include <qel/common/QelLogger.hpp>

#include "protocol/hypervisor/LineLifeFixture.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::CommandEnd;
using protocol::PartitionOptions;
using protocol::RestartLine;
using protocol::StartLine;
using std::chrono::milliseconds;
using std::chrono::seconds;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr unsigned int kCmdFailed = 6;
constexpr unsigned int kReadFailure = 4;

using LineLifeTest = LineLifeFixture;
using Kind = CommandEnd::Kind;

TEST_F(LineLifeTest, BootStartsTheCommandWithTheServer)
{
    serveWith(boot());
    EXPECT_EQ(hypervisor->serviceLines().count(), -1);
    EXPECT_EQ(port1->started, 1U);
    EXPECT_EQ(port2->started, 1U);
    EXPECT_THAT(watched(), ElementsAre(1, 2));
    endCommand({Kind::Exited, 1});
    EXPECT_EQ(hypervisor->serviceLines().count(), -1); // it is not started again
}

TEST_F(LineLifeTest, OtherwiseTheFirstOpenStartsIt)
{
    EXPECT_EQ(hypervisor->serviceLines().count(), -1);
    EXPECT_EQ(port1->started, 0U);
}

TEST_F(LineLifeTest, RestartDependsOnHowTheCommandEnded)
{
    struct Row {
        const char* name;
        RestartLine restart;
        CommandEnd end;
        bool again;
    };
    const Row rows[] = {
        {"always, success", RestartLine::Always, {Kind::Exited, 0}, true},
        {"always, failure", RestartLine::Always, {Kind::Exited, 1}, true},
        {"failure, success", RestartLine::OnFailure, {Kind::Exited, 0}, false},
        {"failure, failure", RestartLine::OnFailure, {Kind::Exited, 1}, true},
        {"failure, signal", RestartLine::OnFailure, {Kind::Killed, 9}, true},
        {"failure, unknown", RestartLine::OnFailure, {Kind::Unknown, 0}, true},
        {"never, failure", RestartLine::Never, {Kind::Exited, 1}, false},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        serveWith(boot(row.restart));
        hypervisor->serviceLines();
        endCommand(row.end);
        EXPECT_EQ(hypervisor->serviceLines(), row.again ? milliseconds(1000) : milliseconds(-1));
        clock.advance(seconds(100));
        hypervisor->serviceLines();
        EXPECT_EQ(port1->started, row.again ? 2U : 1U);
    }
}

TEST_F(LineLifeTest, ThePauseDoublesWhileTheCommandEndsSoon)
{
    serveWith(boot(RestartLine::Always));
    hypervisor->serviceLines();
    for (const int pause : {1, 2, 4, 8, 16, 30, 30}) {
        SCOPED_TRACE(pause);
        clock.advance(milliseconds(29999 / 7));
        endCommand({Kind::Exited, 0});
        expectStartAfter(seconds(pause));
    }
    clock.advance(seconds(30)); // it has run for long
    endCommand({Kind::Exited, 0});
    expectStartAfter(seconds(1));
    clock.advance(milliseconds(29999));
    endCommand({Kind::Exited, 0});
    expectStartAfter(seconds(2));
}

TEST_F(LineLifeTest, ACommandThatCannotBeStartedIsTriedAgain)
{
    serveWith(boot(RestartLine::OnFailure));
    port1->failsToStart = true;
    hypervisor->serviceLines();
    EXPECT_THAT(log.lines(), ElementsAre("E: [qel] partition 1: start: 24 (Too many open files)"));
    port1->failsToStart = false;
    expectStartAfter(seconds(1));
}

TEST_F(LineLifeTest, AnOpenDoesNotWaitForThePause)
{
    serveWith(boot(RestartLine::Always));
    hypervisor->serviceLines();
    endCommand({Kind::Exited, 0});
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(port1->started, 2U);
    EXPECT_GE(hypervisor->serviceLines().count(), -1);
    clock.advance(seconds(100));
    hypervisor->serviceLines();
    EXPECT_EQ(port1->started, 2U);
}

TEST_F(LineLifeTest, ARestartEndsTheSessionOfTheOldCommand)
{
    serveWith(boot(RestartLine::Always));
    Peer peer;
    setUpSerial(peer, "a", 1);
    endCommand({Kind::Exited, 3});
    expectClosed(peer, 1, kReadFailure, 0x0103);
    expectStartAfter(seconds(1));
}

TEST_F(LineLifeTest, NothingIsStartedAfterTheShutdown)
{
    serveWith(boot(RestartLine::Always));
    hypervisor->serviceLines();
    endCommand({Kind::Exited, 0});
    hypervisor->shutDown();
    clock.advance(seconds(100));
    EXPECT_EQ(hypervisor->serviceLines().count(), -1);
    EXPECT_EQ(port1->started, 1U);
}

// Lines that come up in steps.

TEST_F(LineLifeTest, ALineIsReadAndWrittenOnlyOnceItIsUp)
{
    Peer peer;
    openSession(peer, "a");
    port1->steps = {"", ""};
    port1->output = {"hello"};
    port1->wantsWriting = true;
    openSerial(peer, 1);
    EXPECT_EQ(setUp(peer, 1), 0U);
    EXPECT_EQ(port1->advanced, 1U);
    sendData(peer, 1, "typed early");
    const short both = POLLIN | POLLOUT | POLLERR | POLLHUP | POLLNVAL;
    EXPECT_THAT(watchedEvents(), ElementsAre(std::make_pair(1, both)));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->reads, 0U);
    EXPECT_EQ(port1->input, "");
    port1->wantsWriting = false;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->advanced, 3U);
    EXPECT_EQ(port1->input, "typed early");
    EXPECT_EQ(takeData(peer, 1), "hello");
}

TEST_F(LineLifeTest, ALineIsCalledWhenItAsksTo)
{
    Peer peer;
    openSession(peer, "a");
    port1->steps = {"", ""};
    openSerial(peer, 1);
    port1->nextAdvance = clock.steady() + seconds(5);
    EXPECT_EQ(hypervisor->serviceLines(), seconds(5));
    clock.advance(seconds(5));
    hypervisor->serviceLines();
    EXPECT_EQ(port1->advanced, 2U);
}

TEST_F(LineLifeTest, ALineThatDoesNotComeUpEndsTheSession)
{
    Peer peer;
    openSession(peer, "a");
    port1->steps = {"", "no carrier"};
    openSerial(peer, 1);
    hypervisor->serviceSerial(1);
    expectClosed(peer, 1, kReadFailure);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_THAT(log.lines(), ElementsAre("E: [qel] partition 1: no carrier"));
}

TEST_F(LineLifeTest, ALineThatFailsAtOnceFailsTheOpen)
{
    Peer peer;
    openSession(peer, "a");
    port1->steps = {"no carrier"};
    EXPECT_EQ(open(peer, 1), kCmdFailed);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_EQ(open(peer, 1), 0U);
}

// Lines that keep their sessions.

TEST_F(LineLifeTest, AConnectionIsMadeWithTheServer)
{
    serveWith(connection());
    hypervisor->serviceLines();
    EXPECT_EQ(port1->started, 1U);
    EXPECT_THAT(watched(), ElementsAre(1, 2));
}

TEST_F(LineLifeTest, WhatIsTypedBeforeAConnectionIsBroughtUpForTheFirstTimeWaitsForIt)
{
    serveWith(connection());
    Peer peer;
    setUpSerial(peer, "a", 1);
    sendData(peer, 1, "typed early");
    EXPECT_EQ(port1->started, 0U);
    hypervisor->serviceLines();
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->input, "typed early");
}

TEST_F(LineLifeTest, ALostConnectionKeepsItsSessionAndIsToldOnce)
{
    serveWith(connection());
    hypervisor->serviceLines();
    Peer peer;
    Peer watcher;
    setUpSerial(peer, "a", 1);
    openSession(watcher, "b");
    ASSERT_EQ(open(watcher, 1, 1), 0U);
    ASSERT_EQ(setUp(watcher, 1, 1), 0U);
    clock.advance(seconds(5));
    port1->ended = true;
    port1->reason = "the peer has closed\x1B the connection";
    hypervisor->serviceSerial(1);
    hypervisor->serviceLines();
    const std::string lost = "\r\n[qel: line lost: the peer has closed? the connection; connecting again]\r\n";
    EXPECT_EQ(received(peer), lost);
    EXPECT_EQ(received(watcher, 1), lost);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_THAT(log.lines(),
                ElementsAre("W: [qel] partition 1: line lost: the peer has closed? the connection; connecting again"));

    port1->ended = false;
    port1->reason.clear();
    port1->steps = {"cannot connect: Connection refused"};
    expectStartAfter(seconds(1));
    port1->steps = {"", "cannot connect: No route to host"};
    expectStartAfter(seconds(2));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(received(peer), "");
    sendData(peer, 1, "into the void");
    expectStartAfter(seconds(4));
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer), "\r\n[qel: the line is down, input is dropped]\r\n\r\n[qel: line is back]\r\n");
    EXPECT_EQ(received(watcher, 1), "\r\n[qel: line is back]\r\n");
    EXPECT_EQ(port1->input, "");
    sendData(peer, 1, "heard");
    EXPECT_EQ(port1->input, "heard");
    port1->output = {"again"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(received(peer), "again");
    EXPECT_EQ(log.lines().size(), 3U); // the two later reasons are new
}

TEST_F(LineLifeTest, AConnectionThatHasNeverBeenUpIsReportedAndRetried)
{
    serve(std::make_unique<protocol::Hypervisor>(), 16, connection());
    port1->steps = {"cannot connect: Connection refused"};
    hypervisor->serviceLines();
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] partition 1: line is down: cannot connect: Connection refused; "
                                         "connecting again"));
    Peer peer;
    setUpSerial(peer, "a", 1); // the session does not wait for the line
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer), "\r\n[qel: line is down: cannot connect: Connection refused; connecting again]\r\n");
    EXPECT_EQ(port1->started, 1U);
    expectStartAfter(seconds(1));
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer), "\r\n[qel: line is back]\r\n");
}

TEST_F(LineLifeTest, ThePauseOfAConnectionStartsOverOnceItHasBeenUpForFiveSeconds)
{
    serveWith(connection());
    hypervisor->serviceLines();
    const auto lose = [&] {
        port1->ended = true;
        hypervisor->serviceSerial(1);
        port1->ended = false;
    };
    clock.advance(milliseconds(4999));
    lose();
    expectStartAfter(seconds(1));
    clock.advance(milliseconds(4999));
    lose();
    expectStartAfter(seconds(2));
    clock.advance(milliseconds(5000));
    lose();
    expectStartAfter(seconds(1));
}

TEST_F(LineLifeTest, AConnectionThatCannotBeWrittenToIsLost)
{
    serveWith(connection());
    hypervisor->serviceLines();
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->failsToWrite = true;
    sendData(peer, 1, "x");
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer), "\r\n[qel: line lost: write: 5 (Input/output error); connecting again]\r\n");
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
}

TEST_F(LineLifeTest, AConsoleIsReadAgainWhenALineThatTookNothingIsLost)
{
    serveWith(connection());
    hypervisor->serviceLines();
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->takes = 0;
    sendData(peer, 1, std::string(60000, 'x'));
    sendData(peer, 1, std::string(60000, 'x'));
    EXPECT_FALSE(hypervisor->mayReceive(peer.id));
    port1->wantsWriting = true;
    port1->steps = {"broken"};
    hypervisor->serviceSerial(1);
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
    EXPECT_EQ(peer.link.resumed, 1U);
}

// Taps.

TEST_F(LineLifeTest, ATapHearsOutputAndEventsInOrderWhoeverLooks)
{
    const auto tap = std::make_shared<RecordingTap>();
    PartitionOptions options = boot();
    options.tap = tap;
    options.replayBytes = 0;
    serveWith(options);
    hypervisor->serviceLines();
    port1->output = {"one", "two"};
    hypervisor->serviceSerial(1);
    hypervisor->serviceSerial(1);
    port2->output = {"other"};
    hypervisor->serviceSerial(2);
    tap->onCall = [&] { EXPECT_TRUE(hypervisor->takesConsoles()); }; // the lock is free
    endCommand({Kind::Exited, 3});
    EXPECT_THAT(tap->calls, ElementsAre("1 output one", "1 output two", "2 output other",
                                        "1 event the command exited with status 3"));
}

TEST_F(LineLifeTest, ATapHearsThatAConnectionIsLostAndBack)
{
    const auto tap = std::make_shared<RecordingTap>();
    PartitionOptions options = connection();
    options.tap = tap;
    serveWith(options);
    hypervisor->serviceLines();
    port1->ended = true;
    hypervisor->serviceSerial(1);
    port1->ended = false;
    clock.advance(seconds(1));
    hypervisor->serviceLines();
    EXPECT_THAT(tap->calls, ElementsAre("1 event line lost: it has ended; connecting again", "1 event line is back"));
}

} // namespace

} // namespace qel::test
