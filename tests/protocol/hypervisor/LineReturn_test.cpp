// Lines that are lost and come back: what the log says of it, how long the pauses are, and what is left of the time
// before.

#include "protocol/hypervisor/LineLifeFixture.hpp"
#include "support/Allocations.hpp"

#include <gmock/gmock.h>
#include <set>

namespace qel::test {

namespace {

using protocol::RestartPause;
using std::chrono::seconds;
using ::testing::ElementsAre;

class LineReturn : public LineLifeFixture {
protected:
    void lose()
    {
        port1->ended = true;
        hypervisor->serviceSerial(1);
        port1->ended = false;
    }
};

TEST_F(LineReturn, EachNewReasonIsLoggedOnce)
{
    serveWith(connection());
    port2->steps.assign(100, ""); // not of interest
    hypervisor->serviceLines();
    Peer peer;
    setUpSerial(peer, "a", 1);
    clock.advance(seconds(5));
    port1->reason = "reset";
    port1->steps = {"refused", "refused", "no such host", "refused"};
    lose();
    port1->reason.clear();
    for (const int pause : {1, 2, 4, 8}) {
        clock.advance(seconds(pause));
        hypervisor->serviceLines();
    }
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] partition 1: line lost: reset; connecting again",
                                         "W: [qel] partition 1: line is down: refused; connecting again",
                                         "W: [qel] partition 1: line is down: no such host; connecting again",
                                         "W: [qel] partition 1: line is down: refused; connecting again"));
    EXPECT_EQ(received(peer), "\r\n[qel: line lost: reset; connecting again]\r\n"); // the session is told once
}

/// Connecting for ten seconds is not being up for five.
TEST_F(LineReturn, TheTimeOfConnectingDoesNotCountAsUp)
{
    serveWith(connection());
    hypervisor->serviceLines();
    clock.advance(seconds(1));
    lose(); // the next pause is 1 s, and the one after it 2 s
    port1->steps = {"", ""};
    clock.advance(seconds(1));
    hypervisor->serviceLines();
    clock.advance(seconds(10));
    hypervisor->serviceSerial(1); // still not up
    port1->steps.clear();
    hypervisor->serviceSerial(1);
    clock.advance(seconds(1));
    lose();
    expectStartAfter(seconds(2));
}

TEST_F(LineReturn, WhatALineThatHasHungUpIsReadForDoesNotCountForTheNextOne)
{
    PartitionOptions options = connection();
    options.unattended = protocol::WhenUnattended::Wait;
    serveWith(options);
    hypervisor->serviceLines();
    lose(); // nobody looks, so it is read to its end
    clock.advance(seconds(1));
    hypervisor->serviceLines();
    port1->output = {"kept in the line"};
    const unsigned reads = port1->reads;
    hypervisor->serviceSerial(1);
    EXPECT_EQ(port1->reads, reads); // it waits for a console
}

TEST_F(LineReturn, ASessionGetsAllThatItsLinkHasRoomForBeforeItsEnd)
{
    serveWith(keeping(1024 * 1024));
    Peer watcher;
    openSession(watcher, "w");
    ASSERT_EQ(open(watcher, 1, 1), 0U);
    ASSERT_EQ(setUp(watcher, 1, 1), 0U);
    watcher.link.serialRoom = false;
    std::string sent;
    for (int i = 0; i < 40; ++i) { // more than one turn delivers
        const std::string piece(4096, static_cast<char>('a' + i % 26));
        port1->output = {piece};
        sent += piece;
        hypervisor->serviceSerial(1);
    }
    watcher.link.serialRoom = true;
    port1->ended = true;
    hypervisor->serviceSerial(1);
    std::string got;
    while (watcher.link.posted() > 1)
        got += takeData(watcher, 1, 1);
    EXPECT_EQ(got.size(), sent.size());
    EXPECT_TRUE(got == sent);
    expectClosed(watcher, 1, 4, 0x0100, 1);
}

TEST_F(LineReturn, OutputIsReadOnThoughThereIsNoMemoryForALongerHistory)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    PartitionOptions options = boot();
    options.replayBytes = 64 * 1024;
    serveWith(options);
    hypervisor->serviceLines();
    port1->output = {std::string(4096, 'a')};
    hypervisor->serviceSerial(1);
    port1->output = {std::string(4096, 'b')};
    {
        Allocations allocations;
        allocations.failAll();
        hypervisor->serviceSerial(1);
    }
    EXPECT_TRUE(port1->output.empty());
    Peer peer;
    setUpSerial(peer, "a", 1);
    hypervisor->serviceLines();
    EXPECT_EQ(received(peer), std::string(4096, 'b'));
}

TEST_F(LineReturn, AnEndedCommandWaitsForASessionThatIsOpenedMeanwhile)
{
    serveWith(keeping(65536));
    Peer first;
    openSession(first, "a");
    ASSERT_EQ(open(first, 1, 1), 0U); // not set up: the end waits for it, ten seconds long
    port1->ended = true;
    hypervisor->serviceSerial(1);
    clock.advance(seconds(9));
    hypervisor->serviceLines();
    Peer second;
    openSession(second, "b");
    ASSERT_EQ(open(second, 1, 2), 0U);
    clock.advance(seconds(2)); // the ten seconds of the first one are over
    hypervisor->serviceLines();
    EXPECT_EQ(setUp(second, 1, 2), 0U);
    EXPECT_EQ(setUp(first, 1, 1), 0U);
    hypervisor->serviceLines();
    expectClosed(second, 1, 4, 0x0100, 2);
}

/// Otherwise consoles could keep it from starting for ever.
TEST_F(LineReturn, ACommandThatIsToStartAgainWaitsForNobodyWhoIsLate)
{
    PartitionOptions options = keeping(65536);
    options.restart = RestartLine::Always;
    serveWith(options);
    Peer first;
    openSession(first, "a");
    ASSERT_EQ(open(first, 1, 1), 0U);
    port1->ended = true;
    hypervisor->serviceSerial(1);
    clock.advance(seconds(9));
    hypervisor->serviceLines();
    Peer second;
    openSession(second, "b");
    ASSERT_EQ(open(second, 1, 2), 0U);
    clock.advance(seconds(1));
    hypervisor->serviceLines();
    expectClosed(first, 1, 4, 0x0100, 1);
    expectClosed(second, 1, 4, 0x0100, 2);
}

TEST(RestartPause, IsLongerByAShareOfTheSessionsPartition)
{
    EXPECT_EQ(RestartPause::shareOf(1), 0);
    EXPECT_EQ(RestartPause::shareOf(2), 99);
    std::set<std::uint16_t> shares;
    for (std::uint16_t partition = 1; partition <= RestartPause::kShares; ++partition)
        shares.insert(RestartPause::shareOf(partition));
    EXPECT_EQ(shares.size(), RestartPause::kShares);
    EXPECT_LT(*shares.rbegin(), RestartPause::kShares);
    EXPECT_LT(RestartPause::shareOf(65535), RestartPause::kShares);
    RestartPause pause(seconds(5), 128);
    EXPECT_EQ(pause.next({}), std::chrono::milliseconds(1125));
    EXPECT_EQ(pause.next({}), std::chrono::milliseconds(2250));
    for (int i = 0; i < 5; ++i)
        pause.next({});
    EXPECT_EQ(pause.next({}), std::chrono::milliseconds(33750));
}

TEST_F(LineReturn, OtherPartitionsHaveOtherPauses)
{
    serveWith(connection());
    hypervisor->serviceLines();
    port2->ended = true;
    lose();
    hypervisor->serviceSerial(2);
    port2->ended = false;
    clock.advance(seconds(1));
    hypervisor->serviceLines();
    EXPECT_EQ(port1->started, 2U);
    EXPECT_EQ(port2->started, 1U);
    clock.advance(std::chrono::milliseconds(97)); // 99 / 1024 of a second
    hypervisor->serviceLines();
    EXPECT_EQ(port2->started, 2U);
}

} // namespace

} // namespace qel::test
