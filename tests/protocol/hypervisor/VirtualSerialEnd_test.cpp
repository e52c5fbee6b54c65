// The end of a partition's command.

#include <qel/common/QelLogger.hpp>
#include <qel/protocol/CommandEnd.hpp>

#include "protocol/hypervisor/VirtualSerialFixture.hpp"
#include "support/SettableClock.hpp"

#include <chrono>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::CommandEnd;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

using VirtualSerialTest = VirtualSerialFixture;

TEST_F(VirtualSerialTest, TheEndOfTheCommandClosesTheSessionWithReadFailure)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->output = {"last words"};
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "last words");
    EXPECT_EQ(peer.link.posted(), 0U);
    hypervisor->serviceSerial(1);
    expectClosed(peer, 1, 4, 0x0100);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_THAT(watched(), IsEmpty());
    sendData(peer, 1, "x");
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored")));

    port1->ended = false;
    openSerial(peer, 1);
    EXPECT_EQ(port1->started, 2U);
}

TEST_F(VirtualSerialTest, TheCloseNoticeFollowsAllOutput)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    peer.link.serialRoom = false;
    port1->output = {"last words"};
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_THAT(watched(), IsEmpty()); // a line that has hung up would be reported without end
    peer.link.serialRoom = true;
    hypervisor->serviceSerial(1);
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "last words");
    expectClosed(peer, 1, 4, 0x0100);
}

TEST_F(VirtualSerialTest, InputForAnEndedCommandIsDroppedAndReadingResumes)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->takes = 0;
    sendData(peer, 1, std::string(60000, 'x'));
    sendData(peer, 1, std::string(60000, 'x'));
    EXPECT_FALSE(hypervisor->mayReceive(peer.id));
    peer.link.serialRoom = false;
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer.link.resumed, 1U);
    EXPECT_THAT(watched(), IsEmpty());
    peer.link.serialRoom = true;
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
}

TEST_F(VirtualSerialTest, ACommandThatEndsWithoutASessionIsTakenDown)
{
    serveWith(waiting());
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    EXPECT_THAT(watched(), ElementsAre(1)); // to notice the end
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->reads, 0U); // but not to read
    EXPECT_EQ(port1->stopped, 0U);
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_THAT(watched(), IsEmpty());
}

TEST_F(VirtualSerialTest, LogAndNoticeSayHowTheCommandEnded)
{
    using Kind = CommandEnd::Kind;
    struct Row {
        CommandEnd end;
        unsigned int statusDetail;
        const char* line;
    };
    const Row rows[] = {
        {{Kind::Exited, 0}, 0x0100, "I: [qel] partition 1: the command exited with status 0"},
        {{Kind::Exited, 3}, 0x0103, "I: [qel] partition 1: the command exited with status 3"},
        {{Kind::Killed, 9}, 0x0209, "I: [qel] partition 1: the command was killed by signal 9 (Killed)"},
        {{Kind::Unknown, 0}, 0, "I: [qel] partition 1: the command ended"},
    };
    serveWith(keeping(0));
    Peer peer;
    openSession(peer, "a");
    QelLogger::get().setLevel(LogLevel::Info);
    port1->ended = true;
    for (const Row& row : rows) {
        SCOPED_TRACE(row.line);
        port1->end = row.end;
        openSerial(peer, 1);
        EXPECT_EQ(setUp(peer, 1), 0U);
        log.clear();
        hypervisor->serviceSerial(1);
        expectClosed(peer, 1, 4, row.statusDetail);
        EXPECT_THAT(log.lines(), ElementsAre(row.line));
    }
}

TEST_F(VirtualSerialTest, TheNoticeWaitsForTheCommandToEnd)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->ended = true;
    port1->end.reset(); // the line ends a moment before the command
    EXPECT_FALSE(awaitsEnd());
    hypervisor->serviceSerial(1);
    EXPECT_TRUE(awaitsEnd());
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_EQ(port1->stopped, 0U);
    EXPECT_THAT(watched(), IsEmpty()); // it would be reported without end
    port1->end = CommandEnd{CommandEnd::Kind::Exited, 3};
    EXPECT_FALSE(awaitsEnd());
    expectClosed(peer, 1, 4, 0x0103);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_FALSE(awaitsEnd());
}

TEST_F(VirtualSerialTest, ACommandThatOnlyClosedItsTerminalIsTakenDownAfterASecond)
{
    SettableClock clock;
    Peer peer;
    setUpSerial(peer, "a", 1);
    QelLogger::get().setLevel(LogLevel::Info);
    log.clear();
    port1->ended = true;
    port1->end.reset();
    hypervisor->serviceSerial(1);
    clock.advance(std::chrono::milliseconds(999));
    EXPECT_TRUE(awaitsEnd());
    EXPECT_EQ(port1->stopped, 0U);
    clock.advance(std::chrono::milliseconds(1));
    EXPECT_FALSE(awaitsEnd());
    EXPECT_EQ(port1->stopped, 1U);
    expectClosed(peer, 1, 4, 0x0300);
    EXPECT_THAT(log.lines(), ElementsAre("I: [qel] partition 1: the command closed its terminal"));
}

TEST_F(VirtualSerialTest, TheEndOfACommandWithoutASessionIsLogged)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    QelLogger::get().setLevel(LogLevel::Info);
    log.clear();
    port1->ended = true;
    port1->end = CommandEnd{CommandEnd::Kind::Killed, 15};
    hypervisor->serviceSerial(1);
    EXPECT_THAT(
        log.lines(),
        ElementsAre("I: [qel] partition 1: the command was killed by signal 15 (Terminated), with no session open"));
}

TEST_F(VirtualSerialTest, OpeningAnEndedLineStartsTheCommandAgain)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    port1->ended = true;
    port1->end.reset();
    hypervisor->serviceSerial(1);
    port1->end = CommandEnd{CommandEnd::Kind::Exited, 3}; // the serial thread has not looked since
    openSerial(other, 1, true);
    expectClosed(holder, 1, 4, 0x0103);
    EXPECT_EQ(port1->started, 2U);
    port1->ended = false;
    EXPECT_FALSE(awaitsEnd());
    EXPECT_EQ(setUp(other, 1), 0U);
    port1->output = {"again"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(other, 1), "\r\n[qel: the command exited with status 3]\r\n");
    EXPECT_EQ(takeData(other, 1), "again");
}

TEST_F(VirtualSerialTest, OpeningAnEndedLineWhoseCommandRunsStartsTheCommandAgain)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    port1->ended = true;
    port1->end.reset();
    hypervisor->serviceSerial(1);
    openSerial(other, 1, true);
    expectClosed(holder, 1, 4, 0x0300);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_EQ(port1->started, 2U);
    port1->ended = false;
    EXPECT_FALSE(awaitsEnd());
    EXPECT_EQ(setUp(other, 1), 0U);
    port1->output = {"again"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(other, 1), "\r\n[qel: the command closed its terminal]\r\n");
    EXPECT_EQ(takeData(other, 1), "again");
}

TEST_F(VirtualSerialTest, ALineThatCannotBeWrittenToEndsTheSession)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->failsToWrite = true;
    sendData(peer, 1, "x");
    expectClosed(peer, 1, 5);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_THAT(log.lines(), ElementsAre("E: [qel] partition 1: write: 5 (Input/output error)"));
    port1->failsToWrite = false;
    openSerial(peer, 1);
    EXPECT_EQ(port1->started, 2U);
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->input, ""); // nothing is left of the old session
}

TEST_F(VirtualSerialTest, ServingALineThatIsDownOrUnknownDoesNothing)
{
    hypervisor->serviceSerial(1);
    hypervisor->serviceSerial(99);
    EXPECT_EQ(port1->reads, 0U);
}

} // namespace

} // namespace qel::test
