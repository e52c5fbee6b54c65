// Sessions on the connection numbers 1 to 15, which watch.

#include "protocol/hypervisor/VirtualSerialFixture.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

constexpr unsigned int kInvalidCmdSequence = 4;
constexpr unsigned int kConnectionNotAvailable = 19;
constexpr unsigned int kConnectionClosureFailure = 20;

class VirtualSerialWatchTest : public VirtualSerialFixture {
protected:
    /// All steps until a console watches partition 1.
    void watch(Peer& peer, const std::string& toolId, std::uint16_t number)
    {
        openSession(peer, toolId);
        ASSERT_EQ(open(peer, 1, number), 0U);
        ASSERT_EQ(setUp(peer, 1, number), 0U);
    }

    void putOut(const std::string& text)
    {
        port1->output.push_back(text);
        hypervisor->serviceSerial(1);
    }
};

TEST_F(VirtualSerialWatchTest, AllNumbersSeeTheOutput)
{
    Peer holder;
    setUpSerial(holder, "holder", 1);
    std::array<Peer, 15> watchers;
    for (std::uint16_t number = 1; number <= 15; ++number)
        watch(watchers.at(number - 1U), "watcher " + std::to_string(number), number);
    putOut("for all");
    EXPECT_EQ(takeData(holder, 1), "for all");
    for (std::uint16_t number = 1; number <= 15; ++number)
        EXPECT_EQ(takeData(watchers.at(number - 1U), 1, number), "for all");
    EXPECT_EQ(hypervisor->partitions().at(0).outputMessages, 16U);
    EXPECT_EQ(hypervisor->partitions().at(0).skippedBytes, 0U);
}

TEST_F(VirtualSerialWatchTest, OneConsoleMayHaveSeveralNumbers)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(open(peer, 1, 7), 0U);
    EXPECT_EQ(setUp(peer, 1, 7), 0U);
    putOut("twice");
    EXPECT_EQ(takeData(peer, 1), "twice");
    EXPECT_EQ(takeData(peer, 1, 7), "twice");
    hypervisor->disconnect(peer.id);
    Peer next;
    openSession(next, "b");
    EXPECT_EQ(open(next, 1, 0), 0U);
    EXPECT_EQ(open(next, 1, 7), 0U);
}

TEST_F(VirtualSerialWatchTest, OpeningANumberStartsTheCommand)
{
    Peer peer;
    openSession(peer, "a");
    EXPECT_EQ(open(peer, 1, 15), 0U);
    EXPECT_EQ(port1->started, 1U);
}

TEST_F(VirtualSerialWatchTest, AWatcherGetsTheReplayFirst)
{
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    putOut("before");
    watch(watcher, "b", 1);
    putOut(" after");
    EXPECT_EQ(takeData(watcher, 1, 1), "before");
    EXPECT_EQ(takeData(watcher, 1, 1), " after");
}

TEST_F(VirtualSerialWatchTest, InputOfAWatcherIsDroppedAndAnsweredOnce)
{
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    watch(watcher, "b", 3);
    const QelMessageVirtualSerialDataToOsAsync typed(1, 3, 2, "rm");
    receive(watcher, typed);
    receive(watcher, typed);
    hypervisor->serviceLines();
    EXPECT_EQ(takeData(watcher, 1, 3), "\r\n[qel: watching only, input is not passed on]\r\n");
    receive(watcher, typed);
    hypervisor->serviceLines();
    EXPECT_EQ(watcher.link.posted(), 0U);
    EXPECT_EQ(holder.link.posted(), 0U);
    EXPECT_EQ(port1->input, "");
    EXPECT_EQ(hypervisor->partitions().at(0).inputMessages, 3U);
    EXPECT_EQ(hypervisor->partitions().at(0).droppedBytes, 3U * typed.getSerialDataLength());
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(VirtualSerialWatchTest, InputOnANumberThatIsNotSetUpIsIgnoredWithAWarning)
{
    Peer watcher;
    openSession(watcher, "b");
    EXPECT_EQ(open(watcher, 1, 3), 0U);
    receive(watcher, QelMessageVirtualSerialDataToOsAsync(1, 3, 2, "rm"));
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored")));
}

TEST_F(VirtualSerialWatchTest, InputOfAWatcherNeverStopsItsReading)
{
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    watch(watcher, "b", 1);
    port1->takes = 0;
    sendData(holder, 1, std::string(60000, 'x'));
    sendData(holder, 1, std::string(60000, 'x'));
    EXPECT_FALSE(hypervisor->mayReceive(holder.id));
    EXPECT_TRUE(hypervisor->mayReceive(watcher.id));
}

TEST_F(VirtualSerialWatchTest, ASlowWatcherHoldsNobodyUpAndIsToldWhatItMissed)
{
    serveWith(keeping(8192));
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    watch(watcher, "b", 1);
    putOut("seen by both");
    EXPECT_EQ(takeData(watcher, 1, 1), "seen by both");
    watcher.link.serialRoom = false;
    for (char piece = 'a'; piece <= 'd'; ++piece)
        putOut(std::string(4096, piece));
    EXPECT_EQ(received(holder).size(), 12U + 4U * 4096U);
    EXPECT_EQ(watcher.link.posted(), 0U);
    watcher.link.serialRoom = true;
    hypervisor->serviceLines();
    // Half of what is kept is left to send.
    EXPECT_EQ(received(watcher, 1), "\r\n[qel: 12288 bytes skipped]\r\n" + std::string(4096, 'd'));
    EXPECT_EQ(hypervisor->partitions().at(0).skippedBytes, 12288U);
    putOut("after");
    EXPECT_EQ(takeData(watcher, 1, 1), "after");
    EXPECT_EQ(watcher.link.posted(), 0U);
}

TEST_F(VirtualSerialWatchTest, ALittleDelayOfAWatcherLosesNothing)
{
    serveWith(keeping(8192));
    Peer watcher;
    watch(watcher, "b", 1);
    watcher.link.serialRoom = false;
    putOut(std::string(4096, 'a'));
    putOut(std::string(4096, 'b'));
    watcher.link.serialRoom = true;
    hypervisor->serviceLines();
    EXPECT_EQ(takeData(watcher, 1, 1), std::string(4096, 'a'));
    EXPECT_EQ(takeData(watcher, 1, 1), std::string(4096, 'b'));
}

TEST_F(VirtualSerialWatchTest, TheEndOfTheCommandClosesAllNumbers)
{
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    watch(watcher, "b", 15);
    putOut("last words");
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(holder, 1), "last words");
    expectClosed(holder, 1, 4, 0x0100);
    EXPECT_EQ(takeData(watcher, 1, 15), "last words");
    expectClosed(watcher, 1, 4, 0x0100, 15);
}

TEST_F(VirtualSerialWatchTest, ASlowWatcherIsToldAtTheEndWhatItMissed)
{
    Peer watcher;
    watch(watcher, "b", 1);
    watcher.link.serialRoom = false;
    putOut("12345");
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(watcher, 1, 1), "\r\n[qel: 5 bytes skipped]\r\n");
    expectClosed(watcher, 1, 4, 0x0100, 1);
}

TEST_F(VirtualSerialWatchTest, AWatcherOfAnEndedLineGetsItsLastWordsAndLeavesItsHolderAlone)
{
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    openSession(watcher, "b");
    putOut("last words");
    port1->ended = true;
    port1->end.reset();
    hypervisor->serviceSerial(1);
    EXPECT_EQ(open(watcher, 1, 1), 0U);
    EXPECT_EQ(port1->started, 1U);
    EXPECT_EQ(setUp(watcher, 1, 1), 0U);
    EXPECT_EQ(takeData(holder, 1), "last words");
    EXPECT_EQ(holder.link.posted(), 0U);
    port1->end = protocol::CommandEnd{protocol::CommandEnd::Kind::Exited, 3};
    hypervisor->serviceLines();
    EXPECT_EQ(takeData(watcher, 1, 1), "last words");
    expectClosed(watcher, 1, 4, 0x0103, 1);
    expectClosed(holder, 1, 4, 0x0103);
}

TEST_F(VirtualSerialWatchTest, ForceConcernsTheSameNumberOnly)
{
    Peer holder;
    Peer watcher;
    Peer other;
    setUpSerial(holder, "a", 1);
    watch(watcher, "b", 1);
    openSession(other, "c");
    EXPECT_EQ(open(other, 1, 1), kConnectionNotAvailable);
    EXPECT_EQ(close(other, 1, 1), kConnectionClosureFailure);
    EXPECT_EQ(open(other, 1, 1, true), 0U);
    expectClosed(watcher, 1, 2, 0, 1);
    EXPECT_EQ(setUp(watcher, 1, 1), kInvalidCmdSequence);
    EXPECT_EQ(close(holder, 1, 1, true), 0U);
    expectClosed(other, 1, 2, 0, 1);
    EXPECT_EQ(close(other, 1, 1, true), kConnectionClosureFailure);
    sendData(holder, 1, "x");
    EXPECT_EQ(port1->input, "x");
}

TEST_F(VirtualSerialWatchTest, TheShutdownClosesAllNumbers)
{
    Peer watcher;
    watch(watcher, "b", 2);
    hypervisor->shutDown();
    expectClosed(watcher, 1, 3, 0, 2);
}

TEST_F(VirtualSerialWatchTest, AWaitingLineIsReadForAWatcher)
{
    serveWith(waiting());
    Peer watcher;
    watch(watcher, "b", 1);
    putOut("for the watcher");
    EXPECT_EQ(takeData(watcher, 1, 1), "for the watcher");
    EXPECT_EQ(close(watcher, 1, 1), 0U);
    port1->reads = 0;
    putOut("for nobody");
    EXPECT_EQ(port1->reads, 0U);
}

} // namespace

} // namespace qel::test
