// The data of virtual serial sessions, in both directions.

#include "protocol/hypervisor/VirtualSerialFixture.hpp"

#include <gmock/gmock.h>
#include <poll.h>

namespace qel::test {

namespace {

using protocol::Partition;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

using VirtualSerialTest = VirtualSerialFixture;

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

TEST_F(VirtualSerialTest, TheSerialThreadSendsShortOutputItselfAndWakesTheWriterForMore)
{
    struct Writer : protocol::LinkWriter {
        void wake() noexcept override { calls += 'w'; }
        void send() noexcept override { calls += 's'; }
        std::string calls;
    };
    const auto writer = std::make_shared<Writer>();
    Peer peer;
    setUpSerial(peer, "a", 1);
    peer.link.writer = writer;
    port1->output = {std::string(256, 'x'), std::string(257, 'y')};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(writer->calls, "s");
    hypervisor->serviceSerial(1);
    EXPECT_EQ(writer->calls, "sw");
}

TEST_F(VirtualSerialTest, EmptyDataIsAcceptedWithoutAWarning)
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
    EXPECT_EQ(takeData(other, 2), "two"); // the other partition is not delayed

    slow.link.serialRoom = true;
    const unsigned wakes = serialWakes;
    hypervisor->outputDrained();
    EXPECT_GT(serialWakes, wakes);
    EXPECT_THAT(watched(), ElementsAre(1, 2));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(slow, 1), "one");
}

TEST_F(VirtualSerialTest, OnlyChangesToALineWakeTheSerialThread)
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
    receive(peer, QelMessageVirtualSerialDataToOsAsync(1, 0, 1, "x"));
    EXPECT_EQ(serialWakes, wakes); // the line takes it at once
    port1->takes = 0;
    wakesOnce("input that the line does not take", QelMessageVirtualSerialDataToOsAsync(1, 0, 1, "y"));
    receive(peer, QelMessageVirtualSerialDataToOsAsync(1, 0, 1, "z"));
    EXPECT_EQ(serialWakes, wakes); // the serial thread waits already
    wakesOnce("close", QelMessageVirtualSerialCloseReq(1, 0, false));
    wakesOnce("open", QelMessageVirtualSerialOpenReq(1, 0, false));
    wakesOnce("set up", QelMessageVirtualSerialSetupSessionReq(1, 0));
    wakesOnce("end of the session", QelMessageInterfaceCmpCloseKrogSessionReq());
    port2->failsToStart = true;
    receive(peer, QelMessageInterfaceCmpOpenKrogSessionReq());
    wakesOnce("a line that cannot be started", QelMessageVirtualSerialOpenReq(2, 0, false));
}

TEST_F(VirtualSerialTest, AConsoleWithoutRoomForSerialDataIsStillRead)
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
    EXPECT_EQ(watches[0].fd.mFd.fd, FakeSerialLine::kDescriptor);
    port1->takes = 1000;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->input, "abcdefghi");
    EXPECT_TRUE((hypervisor->serialWatches()[0].fd.mFd.events & POLLOUT) == 0);
}

TEST_F(VirtualSerialTest, AConsoleIsNotReadWhileTooMuchOfItsInputWaits)
{
    Peer peer;
    Peer other;
    setUpSerial(peer, "a", 1);
    setUpSerial(other, "b", 2);
    port1->takes = 0;
    sendData(peer, 1, std::string(Partition::kInputLimit - 1, 'x'));
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
    EXPECT_EQ(peer.link.resumed, 1U); // only when mayReceive() changes
}

TEST_F(VirtualSerialTest, TheOldHolderOfATakenSessionIsReadAgain)
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

TEST_F(VirtualSerialTest, ANewHolderOfAFullPartitionIsReadUntilItIsSetUp)
{
    Peer before;
    Peer holder;
    setUpSerial(before, "a", 1);
    openSession(holder, "b");
    port1->takes = 0;
    sendData(before, 1, std::string(60000, 'x'));
    sendData(before, 1, std::string(60000, 'x'));
    openSerial(holder, 1, true);
    EXPECT_TRUE(hypervisor->mayReceive(holder.id));
    EXPECT_EQ(statusOf(holder, QelMessageVirtualSerialSetupSessionReq(1, 0)), 0U);
    EXPECT_FALSE(hypervisor->mayReceive(holder.id)); // from here on it could add to what waits
    port1->output = {"still here"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(holder, 1), "still here");
    port1->takes = 1000 * 1000;
    hypervisor->serviceSerial(1);
    EXPECT_TRUE(hypervisor->mayReceive(holder.id));
    EXPECT_EQ(holder.link.resumed, 1U);
}

} // namespace

} // namespace qel::test
