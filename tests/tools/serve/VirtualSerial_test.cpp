// The virtual serial sessions, through the hypervisor that keeps them.

#include "tools/serve/HypervisorFixture.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <poll.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using tool::PartitionSet;

constexpr unsigned int kInvalidCmdSequence = 4;
constexpr unsigned int kCmdFailed = 6;
constexpr unsigned int kInvalidConnectionNumber = 16;
constexpr unsigned int kConnectionNotAvailable = 19;
constexpr unsigned int kConnectionClosureFailure = 20;
constexpr unsigned int kInvalidLparId = 21;

using ClosedNotice = QelMessageVirtualSerialSessionClosedAsync;

class VirtualSerialTest : public HypervisorFixture {
protected:
    unsigned int open(Peer& peer, std::uint16_t partition, std::uint16_t number = 0, bool force = false)
    {
        return statusOf(peer, QelMessageVirtualSerialOpenReq(partition, number, force));
    }
    unsigned int close(Peer& peer, std::uint16_t partition, std::uint16_t number = 0, bool force = false)
    {
        return statusOf(peer, QelMessageVirtualSerialCloseReq(partition, number, force));
    }
    unsigned int setUp(Peer& peer, std::uint16_t partition, std::uint16_t number = 0)
    {
        return statusOf(peer, QelMessageVirtualSerialSetupSessionReq(partition, number));
    }
    static void expectClosed(Peer& peer, std::uint16_t partition, unsigned int reason)
    {
        const auto notice = peer.link.take<ClosedNotice>();
        EXPECT_EQ(notice->getLpId(), partition);
        EXPECT_EQ(notice->getVssConnectionNumber(), 0U);
        EXPECT_EQ(notice->getCloseReason(), reason);
    }
    static std::string takeData(Peer& peer, std::uint16_t partition)
    {
        const auto data = peer.link.take<QelMessageVirtualSerialDataToDaxAsync>();
        EXPECT_EQ(data->getLpId(), partition);
        EXPECT_EQ(data->getVssConnectionNumber(), 0U);
        return std::string(data->getSerialData(), data->getSerialDataLength());
    }
};

// Opening.

TEST_F(VirtualSerialTest, OpeningStartsThePartitionAndSaysWhatWasOpened)
{
    Peer peer;
    openSession(peer, "a");
    EXPECT_EQ(port1->started, 0U);
    receive(peer, QelMessageVirtualSerialOpenReq(1, 0, false));
    const auto response = peer.link.take<QelMessageVirtualSerialOpenRsp>();
    EXPECT_EQ(response->getLpId(), 1U);
    EXPECT_EQ(response->getVssConnectionNumber(), 0U);
    EXPECT_EQ(port1->started, 1U);
    EXPECT_EQ(port2->started, 0U);
}

TEST_F(VirtualSerialTest, AnUnknownPartitionIsNamedBeforeAnUnknownConnectionNumber)
{
    Peer peer;
    openSession(peer, "a");
    for (const bool force : {false, true}) {
        SCOPED_TRACE(force);
        EXPECT_EQ(open(peer, 3, 0, force), kInvalidLparId);
        EXPECT_EQ(open(peer, 0, 1, force), kInvalidLparId);
        EXPECT_EQ(open(peer, 1, 1, force), kInvalidConnectionNumber);
        EXPECT_EQ(open(peer, 1, 65535, force), kInvalidConnectionNumber);
        EXPECT_EQ(close(peer, 3, 0, force), kInvalidLparId);
        EXPECT_EQ(close(peer, 3, 1, force), kInvalidLparId);
        EXPECT_EQ(close(peer, 1, 1, force), kInvalidConnectionNumber);
    }
    EXPECT_EQ(setUp(peer, 3), kInvalidLparId);
    EXPECT_EQ(setUp(peer, 3, 1), kInvalidLparId);
    EXPECT_EQ(setUp(peer, 1, 1), kInvalidConnectionNumber);
    EXPECT_EQ(port1->started, 0U);
}

TEST_F(VirtualSerialTest, ASessionThatAnotherConsoleHoldsIsNotAvailable)
{
    Peer holder;
    Peer other;
    openSession(holder, "a");
    openSession(other, "b");
    openSerial(holder, 1);
    EXPECT_EQ(open(other, 1), kConnectionNotAvailable);
    EXPECT_EQ(open(other, 1, 1), kInvalidConnectionNumber);
    EXPECT_EQ(open(holder, 1), kConnectionNotAvailable); // itself too
    EXPECT_EQ(holder.link.posted(), 0U);
    EXPECT_EQ(open(other, 2), 0U);
}

TEST_F(VirtualSerialTest, ForcedOpeningTakesTheSessionAndTellsTheOldHolder)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    EXPECT_EQ(open(other, 1, 0, true), 0U);
    expectClosed(holder, 1, 2);
    EXPECT_EQ(holder.link.resumed, 1U);
    EXPECT_EQ(port1->started, 1U); // it goes on running
    EXPECT_EQ(port1->stopped, 0U);

    sendData(holder, 1, "from the old holder");
    EXPECT_EQ(port1->input, "");
    EXPECT_EQ(setUp(holder, 1), kInvalidCmdSequence);
    EXPECT_EQ(setUp(other, 1), 0U);
    sendData(other, 1, "from the new one");
    EXPECT_EQ(port1->input, "from the new one");
}

TEST_F(VirtualSerialTest, ForcedOpeningOfAFreeSessionOpensIt)
{
    Peer peer;
    openSession(peer, "a");
    EXPECT_EQ(open(peer, 1, 0, true), 0U);
}

TEST_F(VirtualSerialTest, AConsoleThatForcesItsOwnSessionHearsOfItsEndAndHasANewOne)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    receive(peer, QelMessageVirtualSerialOpenReq(1, 0, true));
    expectClosed(peer, 1, 2);
    EXPECT_EQ(peer.link.take<QelMessageVirtualSerialOpenRsp>()->getStatus(), 0U);
    sendData(peer, 1, "not set up");
    EXPECT_EQ(port1->input, "");
}

TEST_F(VirtualSerialTest, APartitionThatCannotBeStartedFailsTheRequest)
{
    Peer peer;
    openSession(peer, "a");
    port1->failsToStart = true;
    EXPECT_EQ(open(peer, 1), kCmdFailed);
    EXPECT_THAT(log.lines(), ElementsAre("E: [qel] partition 1: start: 24 (Too many open files)"));
    port1->failsToStart = false;
    EXPECT_EQ(open(peer, 1), 0U);
}

TEST_F(VirtualSerialTest, AHolderKeepsItsSessionWhenTheForcedOpenFails)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    port1->failsToStart = true;
    EXPECT_EQ(open(other, 1, 0, true), kCmdFailed);
    EXPECT_EQ(holder.link.posted(), 0U);
    sendData(holder, 1, "x");
    EXPECT_EQ(port1->input, "x");
}

// Setting up.

TEST_F(VirtualSerialTest, OnlyTheHolderSetsUp)
{
    Peer holder;
    Peer other;
    openSession(holder, "a");
    openSession(other, "b");
    EXPECT_EQ(setUp(holder, 1), kInvalidCmdSequence);
    openSerial(holder, 1);
    EXPECT_EQ(setUp(other, 1), kInvalidCmdSequence);
    receive(holder, QelMessageVirtualSerialSetupSessionReq(1, 0));
    EXPECT_EQ(holder.link.take<QelMessageVirtualSerialSetupSessionRsp>()->getStatus(), 0U);
    EXPECT_EQ(setUp(holder, 1), 0U);
}

TEST_F(VirtualSerialTest, BeforeTheSetUpNoDataFlows)
{
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    port1->output = {"early"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->reads, 0U);
    EXPECT_THAT(watched(), IsEmpty());
    sendData(peer, 1, "early");
    EXPECT_EQ(port1->input, "");
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored")));

    EXPECT_EQ(setUp(peer, 1), 0U);
    EXPECT_THAT(watched(), ElementsAre(1));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "early"); // nothing was lost
}

// Data.

TEST_F(VirtualSerialTest, DataFlowsBothWays)
{
    const std::string bytes("\0\xFF\r\n", 4);
    Peer peer;
    setUpSerial(peer, "a", 2);
    sendData(peer, 2, bytes);
    EXPECT_EQ(port2->input, bytes);
    port2->output = {bytes};
    hypervisor->serviceSerial(2);
    EXPECT_EQ(takeData(peer, 2), bytes);
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(VirtualSerialTest, DataOfNoLengthIsNothingToWarnAbout)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    sendData(peer, 1, "");
    EXPECT_EQ(port1->input, "");
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(VirtualSerialTest, DataForASessionThatIsNotHeldIsIgnoredWithAWarning)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    const std::vector<std::pair<std::uint16_t, std::uint16_t>> wrong{{1, 0}, {2, 0}, {3, 0}, {1, 1}};
    for (const auto& address : wrong) {
        SCOPED_TRACE(::testing::Message() << address.first << "/" << address.second);
        log.clear();
        receive(other, QelMessageVirtualSerialDataToOsAsync(address.first, address.second, 1, "x"));
        EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 2: ignored")));
    }
    receive(holder, QelMessageVirtualSerialDataToOsAsync(1, 1, 1, "x")); // the holder's, but not connection 0
    EXPECT_EQ(port1->input, "");
    EXPECT_EQ(other.link.posted(), 0U);
}

TEST_F(VirtualSerialTest, DataThatDoesNotParseIsIgnoredWithAWarning)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    QelMessageGeneric message(0, 0x6002, 0x0405, NoFlagSet);
    message.setData("\0\1\0\0\0\5ab", 8); // says five bytes, has two
    receive(peer, message);
    EXPECT_EQ(port1->input, "");
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored")));
}

TEST_F(VirtualSerialTest, OutputIsReadOneChunkAtATime)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->output = {std::string(5000, 'x'), "rest"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), std::string(4096, 'x'));
    EXPECT_EQ(peer.link.posted(), 0U);
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), std::string(904, 'x'));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "rest");
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer.link.posted(), 0U);
}

TEST_F(VirtualSerialTest, OutputIsNotReadWhileTheConsoleHasNoRoom)
{
    Peer slow;
    Peer other;
    setUpSerial(slow, "a", 1);
    setUpSerial(other, "b", 2);
    port1->output = {"one"};
    port2->output = {"two"};
    slow.link.serialRoom = false;
    EXPECT_THAT(watched(), ElementsAre(2));
    hypervisor->serviceSerial(1);
    hypervisor->serviceSerial(2);
    EXPECT_EQ(port1->reads, 0U);
    EXPECT_EQ(takeData(other, 2), "two"); // the other one is not held up

    slow.link.serialRoom = true;
    const unsigned wakes = serialWakes;
    hypervisor->outputDrained();
    EXPECT_GT(serialWakes, wakes);
    EXPECT_THAT(watched(), ElementsAre(1, 2));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(slow, 1), "one");
}

TEST_F(VirtualSerialTest, OnlyWhatTouchesALineWakesTheThreadThatMovesSerialData)
{
    Peer peer;
    Peer other;
    setUpSerial(peer, "a", 1);
    identify(other, "b");
    unsigned wakes = serialWakes;
    receive(peer, QelMessageGetQelTodReq());
    receive(peer, QelMessageDaxBroadcastReq(0, 1, 0, "", "x"));
    receive(other, QelMessageInterfaceCmpOpenKrogSessionReq());
    receive(other, QelMessageInterfaceCmpCloseKrogSessionReq());
    sendData(other, 1, "not the holder");
    EXPECT_EQ(serialWakes, wakes);

    const auto wakesOnce = [&](const char* what, const QelMessage& message) {
        SCOPED_TRACE(what);
        receive(peer, message);
        EXPECT_EQ(serialWakes, wakes + 1);
        wakes = serialWakes;
    };
    wakesOnce("input", QelMessageVirtualSerialDataToOsAsync(1, 0, 1, "x"));
    wakesOnce("close", QelMessageVirtualSerialCloseReq(1, 0, false));
    wakesOnce("open", QelMessageVirtualSerialOpenReq(1, 0, false));
    wakesOnce("set up", QelMessageVirtualSerialSetupSessionReq(1, 0));
    wakesOnce("end of the session", QelMessageInterfaceCmpCloseKrogSessionReq());
    port2->failsToStart = true;
    receive(peer, QelMessageInterfaceCmpOpenKrogSessionReq());
    wakesOnce("a line that cannot be started", QelMessageVirtualSerialOpenReq(2, 0, false));
}

TEST_F(VirtualSerialTest, AConsoleWhoseSerialDataWaitsForRoomIsStillReadFrom)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    peer.link.serialRoom = false;
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
    EXPECT_EQ(statusOf(peer, QelMessageGetQelTodReq()), 0U);
}

TEST_F(VirtualSerialTest, InputThatIsNotTakenIsKeptAndDeliveredInOrder)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->takes = 3;
    sendData(peer, 1, "abcdef");
    sendData(peer, 1, "ghi");
    EXPECT_EQ(port1->input, "abc");
    const auto watches = hypervisor->serialWatches();
    ASSERT_EQ(watches.size(), 1U);
    EXPECT_TRUE((watches[0].fd.mFd.events & POLLOUT) != 0);
    EXPECT_EQ(watches[0].fd.mFd.fd, FakeSerialPort::kDescriptor);
    port1->takes = 1000;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->input, "abcdefghi");
    EXPECT_TRUE((hypervisor->serialWatches()[0].fd.mFd.events & POLLOUT) == 0);
}

TEST_F(VirtualSerialTest, AConsoleIsNotReadFromWhileItsPartitionIsBehindWithInput)
{
    Peer peer;
    Peer other;
    setUpSerial(peer, "a", 1);
    setUpSerial(other, "b", 2);
    port1->takes = 0;
    sendData(peer, 1, std::string(PartitionSet::kInputLimit - 1, 'x'));
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
    sendData(peer, 1, "x");
    EXPECT_FALSE(hypervisor->mayReceive(peer.id));
    EXPECT_TRUE(hypervisor->mayReceive(other.id));

    EXPECT_EQ(peer.link.resumed, 0U);
    port1->takes = 1;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer.link.resumed, 1U);
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
    port1->takes = 1;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer.link.resumed, 1U); // only when it makes a difference
}

TEST_F(VirtualSerialTest, ALostSessionDoesNotKeepItsOldHolderFromBeingRead)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    port1->takes = 0;
    sendData(holder, 1, std::string(60000, 'x'));
    sendData(holder, 1, std::string(60000, 'x'));
    EXPECT_FALSE(hypervisor->mayReceive(holder.id));
    openSerial(other, 1, true);
    EXPECT_TRUE(hypervisor->mayReceive(holder.id));
    EXPECT_EQ(holder.link.resumed, 1U);
}

// The end of the command.

TEST_F(VirtualSerialTest, WhenTheCommandEndsTheHolderHearsOfAReadFailure)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->output = {"last words"};
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "last words");
    EXPECT_EQ(peer.link.posted(), 0U);
    hypervisor->serviceSerial(1);
    expectClosed(peer, 1, 4);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_THAT(watched(), IsEmpty());
    sendData(peer, 1, "x");
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored")));

    port1->ended = false;
    openSerial(peer, 1);
    EXPECT_EQ(port1->started, 2U);
}

TEST_F(VirtualSerialTest, TheEndWaitsUntilTheHolderHasRoomForWhatCameBefore)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    peer.link.serialRoom = false;
    port1->output = {"last words"};
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_THAT(watched(), IsEmpty()); // a line that has hung up would be reported over and over
    peer.link.serialRoom = true;
    hypervisor->serviceSerial(1);
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "last words");
    expectClosed(peer, 1, 4);
}

TEST_F(VirtualSerialTest, InputForACommandThatHasEndedIsDroppedAndHoldsNobodyUp)
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

TEST_F(VirtualSerialTest, ACommandThatEndsWithoutASessionIsTakenDownQuietly)
{
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
    EXPECT_EQ(port1->input, ""); // nothing of the old session comes through
}

TEST_F(VirtualSerialTest, ServingALineThatIsDownOrUnknownDoesNothing)
{
    hypervisor->serviceSerial(1);
    hypervisor->serviceSerial(99);
    EXPECT_EQ(port1->reads, 0U);
}

// Closing.

TEST_F(VirtualSerialTest, TheHolderClosesItsSessionAndThePartitionGoesOn)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    receive(peer, QelMessageVirtualSerialCloseReq(1, 0, false));
    EXPECT_EQ(peer.link.take<QelMessageVirtualSerialCloseRsp>()->getStatus(), 0U);
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_EQ(port1->stopped, 0U);
    EXPECT_EQ(close(peer, 1), kConnectionClosureFailure);
    openSerial(peer, 1);
    EXPECT_EQ(port1->started, 1U);
    port1->output = {"x"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->reads, 0U); // to be set up again
}

TEST_F(VirtualSerialTest, OutputThatCameWithoutASessionWaitsForTheNextOne)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    port1->output = {"meanwhile"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(open(peer, 1), 0U);
    EXPECT_EQ(setUp(peer, 1), 0U);
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "meanwhile");
}

TEST_F(VirtualSerialTest, AnotherConsoleClosesASessionOnlyByForce)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    EXPECT_EQ(close(other, 1), kConnectionClosureFailure);
    EXPECT_EQ(holder.link.posted(), 0U);
    EXPECT_EQ(close(other, 1, 0, true), 0U);
    expectClosed(holder, 1, 2);
    EXPECT_EQ(close(other, 1, 0, true), kConnectionClosureFailure); // nobody holds it now
}

TEST_F(VirtualSerialTest, TheHolderMayForceToo)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1, 0, true), 0U);
    EXPECT_EQ(peer.link.posted(), 0U);
}

TEST_F(VirtualSerialTest, ClosingTheHypervisorSessionReleasesAllSerialSessions)
{
    Peer peer;
    Peer other;
    openSession(peer, "a");
    openSession(other, "b");
    openSerial(peer, 1);
    openSerial(peer, 2);
    EXPECT_EQ(statusOf(peer, QelMessageInterfaceCmpCloseKrogSessionReq()), 0U);
    EXPECT_EQ(peer.link.posted(), 0U); // it asked for it: no notices
    openSerial(other, 1);
    openSerial(other, 2);
}

TEST_F(VirtualSerialTest, AConsoleThatGoesReleasesItsSerialSessions)
{
    Peer peer;
    Peer other;
    openSession(peer, "a");
    openSerial(peer, 1);
    openSession(other, "b");
    hypervisor->disconnect(peer.id);
    EXPECT_EQ(peer.link.posted(), 0U);
    openSerial(other, 1);
    EXPECT_EQ(port1->started, 1U);
}

TEST_F(VirtualSerialTest, TheNextHolderHasToSetTheSessionUpItself)
{
    Peer gone;
    Peer closed;
    Peer next;
    setUpSerial(gone, "a", 1);
    setUpSerial(closed, "b", 2);
    hypervisor->disconnect(gone.id);
    EXPECT_EQ(statusOf(closed, QelMessageInterfaceCmpCloseKrogSessionReq()), 0U);

    openSession(next, "c");
    openSerial(next, 1);
    openSerial(next, 2);
    port1->output = {"early"};
    port2->output = {"early"};
    for (const std::uint16_t partition : std::vector<std::uint16_t>{1, 2}) {
        SCOPED_TRACE(partition);
        hypervisor->serviceSerial(partition);
        EXPECT_EQ(next.link.posted(), 0U);
        sendData(next, partition, "early");
    }
    EXPECT_EQ(port1->input + port2->input, "");
    EXPECT_THAT(watched(), IsEmpty());
}

TEST_F(VirtualSerialTest, WhateverAConsoleDoesTheSerialLinesAreLookedAtAgain)
{
    Peer peer;
    const auto wakes = [this](const std::function<void()>& action) {
        const unsigned before = serialWakes;
        action();
        return serialWakes > before;
    };
    openSession(peer, "a");
    EXPECT_TRUE(wakes([&] { openSerial(peer, 1); }));
    EXPECT_TRUE(wakes([&] { EXPECT_EQ(setUp(peer, 1), 0U); }));
    EXPECT_TRUE(wakes([&] { sendData(peer, 1, "x"); }));
    EXPECT_TRUE(wakes([&] { EXPECT_EQ(close(peer, 1), 0U); }));
    EXPECT_TRUE(wakes([&] { hypervisor->disconnect(peer.id); }));
    EXPECT_TRUE(wakes([&] { hypervisor->shutDown(); }));
}

TEST_F(VirtualSerialTest, InputThatWasAcceptedIsDeliveredAfterItsConsoleHasGone)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->takes = 0;
    sendData(peer, 1, "last wish");
    hypervisor->disconnect(peer.id);
    EXPECT_THAT(watched(), ElementsAre(1));
    port1->takes = 100;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->input, "last wish");
}

// How many.

TEST_F(VirtualSerialTest, TheMaximumIsOneSystemAndItsPartitions)
{
    Peer peer;
    openSession(peer, "a");
    receive(peer, QelMessageVirtualSerialGetMaxSessionsReq());
    const auto response = peer.link.take<QelMessageVirtualSerialGetMaxSessionsRsp>();
    EXPECT_EQ(response->getMaxCec(), 1U);
    EXPECT_EQ(response->getMaxLpar(), 2U);
}

TEST_F(VirtualSerialTest, MorePartitionsThanTheResponseCanSayAreTheMostItCan)
{
    PartitionSet partitions;
    for (std::uint16_t id = 1; id <= 256; ++id)
        partitions.add(id, std::make_unique<FakeSerialPort>());
    hypervisor = std::make_unique<tool::Hypervisor>(tool::HypervisorSettings(), std::move(partitions), [] {});
    Peer peer;
    openSession(peer, "a");
    receive(peer, QelMessageVirtualSerialGetMaxSessionsReq());
    EXPECT_EQ(peer.link.take<QelMessageVirtualSerialGetMaxSessionsRsp>()->getMaxLpar(), 255U);
}

TEST_F(VirtualSerialTest, APartitionIdCannotBeTwice)
{
    PartitionSet partitions;
    partitions.add(1, std::make_unique<FakeSerialPort>());
    EXPECT_THAT([&] { partitions.add(1, std::make_unique<FakeSerialPort>()); },
                ::testing::ThrowsMessage<std::invalid_argument>("partition"));
}

} // namespace

} // namespace qel::test
