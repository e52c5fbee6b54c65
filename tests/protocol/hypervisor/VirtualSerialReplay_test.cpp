// Output that nobody takes: it is read all the time, and the newest of it comes first when a session is set up.

#include <qel/common/QelLogger.hpp>

#include "protocol/hypervisor/VirtualSerialFixture.hpp"
#include "support/Allocations.hpp"
#include "support/SettableClock.hpp"

#include <gmock/gmock.h>
#include <new>

namespace qel::test {

namespace {

using protocol::CommandEnd;
using protocol::WhenUnattended;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr unsigned int kReadFailure = 4;

class VirtualSerialReplayTest : public VirtualSerialFixture {
protected:
    /// Lets the line put out pieces, one after the other.
    void putOut(std::deque<std::string> pieces)
    {
        port1->output = std::move(pieces);
        while (!port1->output.empty())
            hypervisor->serviceSerial(1);
    }

    /// Opens and sets up, and does what the serial thread does next.
    void attach(Peer& peer)
    {
        openSerial(peer, 1);
        ASSERT_EQ(setUp(peer, 1), 0U);
        hypervisor->serviceLines();
    }
};

TEST_F(VirtualSerialReplayTest, ALineWithoutASessionIsReadAllTheTime)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    EXPECT_THAT(watchedEvents(), ElementsAre(std::make_pair(1, static_cast<short>(PollEvents::Read))));
    putOut({"nobody ", "looks"});
    EXPECT_EQ(port1->reads, 2U);
    EXPECT_EQ(peer.link.posted(), 0U);
    attach(peer);
    EXPECT_EQ(received(peer), "nobody looks");
    putOut({", somebody does"});
    EXPECT_EQ(received(peer), ", somebody does");
}

TEST_F(VirtualSerialReplayTest, ALineIsReadBeforeTheSetUpToo)
{
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    putOut({"early"});
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_EQ(setUp(peer, 1), 0U); // takes one message: no data come before the response
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer), "early");
}

TEST_F(VirtualSerialReplayTest, TheNewestBytesComeFirst)
{
    for (const std::size_t replay : {0U, 1U, 4095U, 4096U, 4097U, 65536U}) {
        SCOPED_TRACE(replay);
        serveWith(keeping(replay));
        Peer peer;
        openSession(peer, "a");
        openSerial(peer, 1);
        EXPECT_EQ(close(peer, 1), 0U);
        std::string all;
        for (char piece = 'a'; piece <= 'z'; ++piece) {
            putOut({std::string(4096, piece)});
            all += std::string(4096, piece);
        }
        attach(peer);
        EXPECT_EQ(received(peer), all.substr(all.size() - replay));
    }
}

TEST_F(VirtualSerialReplayTest, TheReplayFollowsWhatTheConsoleHasRoomFor)
{
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    putOut({"first"});
    peer.link.serialRoom = false;
    EXPECT_EQ(setUp(peer, 1), 0U);
    port1->output = {" second"};
    EXPECT_LT(hypervisor->serviceLines().count(), 0); // room comes with a wake-up
    hypervisor->serviceSerial(1);
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_THAT(watched(), IsEmpty()); // from the set-up on, the line waits for its console
    EXPECT_EQ(port1->reads, 1U);
    peer.link.serialRoom = true;
    hypervisor->serviceLines();
    EXPECT_THAT(watched(), ElementsAre(1));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(received(peer), "first second");
}

TEST_F(VirtualSerialReplayTest, ALongReplayGoesOutInTurns)
{
    serveWith(keeping(1024 * 1024));
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    for (int piece = 0; piece < 40; ++piece)
        putOut({std::string(4096, 'x')});
    EXPECT_EQ(setUp(peer, 1), 0U);
    EXPECT_EQ(hypervisor->serviceLines().count(), 0); // to be called again at once
    EXPECT_EQ(peer.link.posted(), 32U);
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer).size(), 40U * 4096U);
}

TEST_F(VirtualSerialReplayTest, AConsoleThatTakesTheSessionByForceGetsTheReplayToo)
{
    Peer holder;
    Peer other;
    setUpSerial(holder, "a", 1);
    openSession(other, "b");
    putOut({"seen"});
    EXPECT_EQ(received(holder), "seen");
    EXPECT_EQ(open(other, 1, 0, true), 0U);
    EXPECT_EQ(setUp(other, 1), 0U);
    hypervisor->serviceLines();
    EXPECT_EQ(received(other), "seen");
}

TEST_F(VirtualSerialReplayTest, ASecondSetUpRepeatsNothing)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    putOut({"once"});
    EXPECT_EQ(received(peer), "once");
    EXPECT_EQ(setUp(peer, 1), 0U);
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer), "");
}

TEST_F(VirtualSerialReplayTest, TheLastWordsAndTheEndOfACommandAreReplayed)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    port1->ended = true;
    port1->end = CommandEnd{CommandEnd::Kind::Exited, 3};
    putOut({"last words"});
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_THAT(watched(), IsEmpty());
    port1->ended = false;
    attach(peer);
    EXPECT_EQ(port1->started, 2U);
    EXPECT_EQ(received(peer), "last words\r\n[qel: the command exited with status 3]\r\n");
}

TEST_F(VirtualSerialReplayTest, AConsoleThatSeesTheEndReadsItInTheNoticeAlone)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->ended = true;
    hypervisor->serviceSerial(1);
    expectClosed(peer, 1, kReadFailure, 0x0100);
    EXPECT_EQ(peer.link.posted(), 0U);
}

TEST_F(VirtualSerialReplayTest, TheEndOfAShortCommandWaitsForTheSetUp)
{
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    port1->ended = true;
    putOut({"short"});
    hypervisor->serviceSerial(1);
    EXPECT_FALSE(awaitsEnd());
    EXPECT_EQ(port1->stopped, 0U);
    EXPECT_THAT(watched(), IsEmpty());
    EXPECT_EQ(setUp(peer, 1), 0U);
    hypervisor->serviceLines();
    EXPECT_EQ(takeData(peer, 1), "short");
    expectClosed(peer, 1, kReadFailure, 0x0100);
}

TEST_F(VirtualSerialReplayTest, TheEndOfAShortCommandWaitsTenSecondsForTheSetUp)
{
    SettableClock clock;
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    port1->ended = true;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(hypervisor->serviceLines(), std::chrono::seconds(10));
    clock.advance(std::chrono::milliseconds(9999));
    EXPECT_EQ(hypervisor->serviceLines(), std::chrono::milliseconds(1));
    EXPECT_EQ(port1->stopped, 0U);
    clock.advance(std::chrono::milliseconds(1));
    EXPECT_LT(hypervisor->serviceLines().count(), 0);
    EXPECT_EQ(port1->stopped, 1U);
    expectClosed(peer, 1, kReadFailure, 0x0100);
}

TEST_F(VirtualSerialReplayTest, WhatACommandLeavesIsReadBeforeItIsStartedAgain)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    port1->output = {"last ", "words"};
    port1->ended = true; // the serial thread has not looked since
    attach(peer);
    EXPECT_EQ(port1->started, 2U);
    EXPECT_EQ(received(peer), "last words\r\n[qel: the command exited with status 0]\r\n");
}

TEST_F(VirtualSerialReplayTest, AWaitingLineIsReadToItsEndWhenItsCommandHasEnded)
{
    protocol::PartitionOptions options = waiting();
    options.replayBytes = 100;
    serveWith(options);
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    port1->output = {"last ", "words"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->reads, 0U);
    port1->ended = true;
    for (int call = 0; call < 3; ++call)
        hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->stopped, 1U);
    attach(peer);
    EXPECT_EQ(received(peer), "last words\r\n[qel: the command exited with status 0]\r\n");
}

TEST_F(VirtualSerialReplayTest, AWaitingLineThatHasHungUpAndHasNothingToReadHasEnded)
{
    serveWith(waiting());
    Peer peer;
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(close(peer, 1), 0U);
    port1->ended = true;
    port1->whenEnded = protocol::SerialLine::LineState::Idle;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->stopped, 1U);
}

// Without memory.

TEST_F(VirtualSerialReplayTest, OutputIsNotLostForWantOfMemory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    for (std::size_t succeeding = 0;; ++succeeding) {
        SCOPED_TRACE(succeeding);
        serveWith(keeping(0));
        Peer peer;
        setUpSerial(peer, "a", 1);
        port1->output = {"kept"};
        bool failed = false;
        {
            Allocations allocations;
            allocations.failAfter(succeeding);
            try {
                hypervisor->serviceSerial(1);
            } catch (const std::bad_alloc&) {
                failed = true;
            }
        }
        hypervisor->serviceLines();
        hypervisor->serviceSerial(1);
        ASSERT_EQ(received(peer), "kept");
        if (!failed) break;
    }
}

TEST_F(VirtualSerialReplayTest, TheNoticeOfTheEndIsNotLostForWantOfMemory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    for (std::size_t succeeding = 0;; ++succeeding) {
        SCOPED_TRACE(succeeding);
        serveWith(keeping(0));
        Peer peer;
        setUpSerial(peer, "a", 1);
        port1->ended = true;
        bool failed = false;
        {
            Allocations allocations;
            allocations.failAfter(succeeding);
            try {
                hypervisor->serviceSerial(1);
            } catch (const std::bad_alloc&) {
                failed = true;
            }
        }
        hypervisor->serviceLines();
        hypervisor->serviceSerial(1);
        hypervisor->serviceLines();
        expectClosed(peer, 1, kReadFailure, 0x0100);
        ASSERT_EQ(peer.link.posted(), 0U);
        if (!failed) break;
    }
}

TEST_F(VirtualSerialReplayTest, ASessionIsNotTakenByForceWithoutMemoryForItsNotice)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    bool anyFailed = false;
    for (std::size_t succeeding = 0; succeeding < 100; ++succeeding) {
        SCOPED_TRACE(succeeding);
        serveWith(keeping(0));
        Peer holder;
        Peer other;
        setUpSerial(holder, "a", 1);
        openSession(other, "b");
        const QelMessageVirtualSerialOpenReq force(1, 0, true);
        QelLogger::get().setLevel(LogLevel::Critical); // the kit's log takes memory
        try {
            Allocations allocations;
            allocations.failAfter(succeeding);
            hypervisor->receive(other.id, force);
        } catch (const std::bad_alloc&) { // for the response
            anyFailed = true;
        }
        sendData(holder, 1, "x");
        // The holder has its session, or has been told that it has lost it.
        ASSERT_EQ(holder.link.posted(), port1->input == "x" ? 0U : 1U);
        if (holder.link.posted() != 0) expectClosed(holder, 1, 2);
        log.clear();
    }
    EXPECT_TRUE(anyFailed);
}

} // namespace

} // namespace qel::test
