// Opening, setting up and closing virtual serial sessions.

#include "protocol/hypervisor/VirtualSerialFixture.hpp"

#include <functional>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

using VirtualSerialTest = VirtualSerialFixture;

constexpr unsigned int kInvalidCmdSequence = 4;
constexpr unsigned int kCmdFailed = 6;
constexpr unsigned int kInvalidConnectionNumber = 16;
constexpr unsigned int kConnectionNotAvailable = 19;
constexpr unsigned int kConnectionClosureFailure = 20;
constexpr unsigned int kInvalidLparId = 21;

// Opening.

TEST_F(VirtualSerialTest, OpeningStartsTheCommandAndReturnsTheAddress)
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

TEST_F(VirtualSerialTest, AnUnknownPartitionIsReportedBeforeAnUnknownConnectionNumber)
{
    Peer peer;
    openSession(peer, "a");
    for (const bool force : {false, true}) {
        SCOPED_TRACE(force);
        EXPECT_EQ(open(peer, 3, 0, force), kInvalidLparId);
        EXPECT_EQ(open(peer, 0, 16, force), kInvalidLparId);
        EXPECT_EQ(open(peer, 1, 16, force), kInvalidConnectionNumber);
        EXPECT_EQ(open(peer, 1, 65535, force), kInvalidConnectionNumber);
        EXPECT_EQ(close(peer, 3, 0, force), kInvalidLparId);
        EXPECT_EQ(close(peer, 3, 16, force), kInvalidLparId);
        EXPECT_EQ(close(peer, 1, 16, force), kInvalidConnectionNumber);
    }
    EXPECT_EQ(setUp(peer, 3), kInvalidLparId);
    EXPECT_EQ(setUp(peer, 3, 16), kInvalidLparId);
    EXPECT_EQ(setUp(peer, 1, 16), kInvalidConnectionNumber);
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
    EXPECT_EQ(open(other, 1, 16), kInvalidConnectionNumber);
    EXPECT_EQ(open(holder, 1), kConnectionNotAvailable); // itself too
    EXPECT_EQ(holder.link.posted(), 0U);
    EXPECT_EQ(open(other, 2), 0U);
}

TEST_F(VirtualSerialTest, ForcedOpenTakesTheSessionAndNotifiesTheOldHolder)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    EXPECT_EQ(open(other, 1, 0, true), 0U);
    expectClosed(holder, 1, 2);
    EXPECT_EQ(holder.link.resumed, 1U);
    EXPECT_EQ(port1->started, 1U); // it is still running
    EXPECT_EQ(port1->stopped, 0U);

    sendData(holder, 1, "from the old holder");
    EXPECT_EQ(port1->input, "");
    EXPECT_EQ(setUp(holder, 1), kInvalidCmdSequence);
    EXPECT_EQ(setUp(other, 1), 0U);
    sendData(other, 1, "from the new one");
    EXPECT_EQ(port1->input, "from the new one");
}

TEST_F(VirtualSerialTest, ForcedOpenOfAFreeSessionOpensIt)
{
    Peer peer;
    openSession(peer, "a");
    EXPECT_EQ(open(peer, 1, 0, true), 0U);
}

TEST_F(VirtualSerialTest, ForcedOpenOfItsOwnSessionClosesAndReopensIt)
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
    serveWith(waiting());
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

// Closing.

TEST_F(VirtualSerialTest, ClosingTheSessionKeepsTheCommandRunning)
{
    serveWith(waiting());
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

TEST_F(VirtualSerialTest, OutputWithoutASessionWaitsForTheNextOne)
{
    serveWith(waiting());
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
    EXPECT_EQ(close(other, 1, 0, true), kConnectionClosureFailure); // it is free now
}

TEST_F(VirtualSerialTest, TheHolderMayCloseWithForce)
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
    EXPECT_EQ(peer.link.posted(), 0U); // no notices to the console that asked
    openSerial(other, 1);
    openSerial(other, 2);
}

TEST_F(VirtualSerialTest, ADisconnectedConsoleReleasesItsSerialSessions)
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

TEST_F(VirtualSerialTest, TheNextHolderMustSetTheSessionUp)
{
    serveWith(waiting());
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

TEST_F(VirtualSerialTest, EveryChangeOfASessionWakesTheSerialThread)
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
    EXPECT_TRUE(wakes([&] { EXPECT_EQ(close(peer, 1), 0U); }));
    EXPECT_TRUE(wakes([&] { hypervisor->disconnect(peer.id); }));
    EXPECT_TRUE(wakes([&] { hypervisor->shutDown(); }));
}

TEST_F(VirtualSerialTest, AcceptedInputIsDeliveredAfterItsConsoleDisconnects)
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

// The number of sessions.

TEST_F(VirtualSerialTest, TheMaximumIsOneSystemAndItsPartitions)
{
    Peer peer;
    openSession(peer, "a");
    receive(peer, QelMessageVirtualSerialGetMaxSessionsReq());
    const auto response = peer.link.take<QelMessageVirtualSerialGetMaxSessionsRsp>();
    EXPECT_EQ(response->getMaxCec(), 1U);
    EXPECT_EQ(response->getMaxLpar(), 2U);
}

TEST_F(VirtualSerialTest, TheMaximumIsCappedAt255Partitions)
{
    auto large = std::make_unique<protocol::Hypervisor>();
    for (std::uint16_t id = 3; id <= 256; ++id) // 1 and 2 are added below
        large->addPartition(id, std::make_unique<FakeSerialLine>());
    serve(std::move(large));
    Peer peer;
    openSession(peer, "a");
    receive(peer, QelMessageVirtualSerialGetMaxSessionsReq());
    EXPECT_EQ(peer.link.take<QelMessageVirtualSerialGetMaxSessionsRsp>()->getMaxLpar(), 255U);
}

} // namespace

} // namespace qel::test
