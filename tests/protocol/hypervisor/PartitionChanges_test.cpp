// Partitions that are added, changed and removed while consoles are served, and what an operator does to them.

#include "protocol/hypervisor/VirtualSerialFixture.hpp"

#include <gmock/gmock.h>
#include <stdexcept>

namespace qel::test {

namespace {

using protocol::PartitionOptions;
using protocol::PartitionState;
using ::testing::ElementsAre;
using ::testing::SizeIs;
using ::testing::ThrowsMessage;

constexpr unsigned int kInvalidLparId = 21;
constexpr unsigned int kInvalidCmdSequence = 4;

/// Says when it is destroyed.
class MortalLine : public FakeSerialLine {
public:
    explicit MortalLine(bool& isDead) : mIsDead(isDead) {}
    ~MortalLine() override { mIsDead = true; }

private:
    bool& mIsDead;
};

class PartitionChangesTest : public VirtualSerialFixture {
protected:
    FakeSerialLine* add(std::uint16_t id, const PartitionOptions& options = {})
    {
        auto line = std::make_unique<FakeSerialLine>();
        FakeSerialLine* const borrowed = line.get();
        hypervisor->addPartition(id, std::move(line), options);
        return borrowed;
    }
};

TEST_F(PartitionChangesTest, AnAddedPartitionIsServedAtOnce)
{
    Peer peer;
    openSession(peer, "a");
    EXPECT_EQ(open(peer, 3), kInvalidLparId);
    const unsigned wakes = serialWakes;
    PartitionOptions options;
    options.start = protocol::StartLine::Boot;
    FakeSerialLine* const line = add(3, options);
    EXPECT_GT(serialWakes, wakes);
    hypervisor->serviceLines();
    EXPECT_EQ(line->started, 1U);
    EXPECT_EQ(open(peer, 3), 0U);
    EXPECT_EQ(setUp(peer, 3), 0U);
    line->output = {"new"};
    hypervisor->serviceSerial(3);
    EXPECT_EQ(takeData(peer, 3), "new");
    receive(peer, QelMessageVirtualSerialGetMaxSessionsReq());
    EXPECT_EQ(peer.link.take<QelMessageVirtualSerialGetMaxSessionsRsp>()->getMaxLpar(), 3U);
}

TEST_F(PartitionChangesTest, WhatIsWrongIsRefused)
{
    EXPECT_THAT([&] { add(1); }, ThrowsMessage<std::invalid_argument>("partition"));
    EXPECT_THAT([&] { hypervisor->addPartition(3, nullptr, {}); }, ThrowsMessage<std::invalid_argument>("line"));
    PartitionOptions options;
    options.replayBytes = PartitionOptions::kMaxReplayBytes + 1;
    EXPECT_THAT([&] { add(3, options); }, ThrowsMessage<std::invalid_argument>("replayBytes"));
    EXPECT_THAT([&] { hypervisor->changePartition(1, options); }, ThrowsMessage<std::invalid_argument>("replayBytes"));
    EXPECT_THAT(hypervisor->partitions(), SizeIs(2));
    hypervisor->shutDown();
    EXPECT_THAT([&] { add(3); }, ThrowsMessage<std::logic_error>("the server has finished"));
}

TEST_F(PartitionChangesTest, ARemovedPartitionTellsItsConsolesAndIsGone)
{
    bool isDead = false;
    hypervisor->addPartition(3, std::make_unique<MortalLine>(isDead), {});
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 3);
    openSession(watcher, "b");
    ASSERT_EQ(open(watcher, 3, 1), 0U);
    ASSERT_EQ(setUp(watcher, 3, 1), 0U);
    watcher.link.serialRoom = false;
    EXPECT_TRUE(hypervisor->removePartition(3));
    EXPECT_TRUE(isDead);
    EXPECT_EQ(takeData(holder, 3), "\r\n[qel: the partition has been removed]\r\n");
    expectClosed(holder, 3, 3);
    expectClosed(watcher, 3, 3, 0, 1);
    EXPECT_EQ(open(holder, 3), kInvalidLparId);
    EXPECT_FALSE(hypervisor->removePartition(3));
    hypervisor->serviceSerial(3);
    EXPECT_THAT(watched(), ElementsAre());
    EXPECT_EQ(open(holder, 1), 0U); // the others are served on
    add(3);
    EXPECT_EQ(open(holder, 3), 0U);
}

TEST_F(PartitionChangesTest, AChangeKeepsTheSessionAndTheNewestOutput)
{
    Peer peer;
    setUpSerial(peer, "a", 1);
    port1->output = {"0123456789"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "0123456789");
    PartitionOptions options;
    options.name = "web1";
    options.replayBytes = 4;
    EXPECT_TRUE(hypervisor->changePartition(1, options));
    EXPECT_FALSE(hypervisor->changePartition(3, options));
    port1->output = {"ab"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "ab");
    EXPECT_EQ(port1->stopped, 0U);
    EXPECT_EQ(open(peer, 1, 1), 0U);
    EXPECT_EQ(setUp(peer, 1, 1), 0U);
    hypervisor->serviceLines();
    EXPECT_EQ(takeData(peer, 1, 1), "89ab");
    EXPECT_EQ(hypervisor->partitions().at(0).name, "web1");
}

TEST_F(PartitionChangesTest, TheStateSaysWhatThePartitionsDo)
{
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    openSession(watcher, "b");
    ASSERT_EQ(open(watcher, 1, 7), 0U);
    port1->output = {"12345"};
    port1->takes = 2;
    hypervisor->serviceSerial(1);
    sendData(holder, 1, "abc");
    PartitionOptions options;
    options.description = "the web server";
    hypervisor->changePartition(2, options);

    const auto states = hypervisor->partitions();
    ASSERT_THAT(states, SizeIs(2));
    EXPECT_EQ(states[0].id, 1U);
    EXPECT_EQ(states[0].line, PartitionState::Line::Up);
    EXPECT_EQ(states[0].outputBytes, 5U);
    EXPECT_EQ(states[0].inputBytes, 2U);
    EXPECT_EQ(states[0].starts, 1U);
    EXPECT_EQ(states[0].keptBytes, 5U);
    EXPECT_EQ(states[0].waitingBytes, 1U);
    ASSERT_THAT(states[0].sessions, SizeIs(2));
    EXPECT_EQ(states[0].sessions[0].number, 0U);
    EXPECT_EQ(states[0].sessions[0].console, holder.id);
    EXPECT_TRUE(states[0].sessions[0].isSetUp);
    EXPECT_EQ(states[0].sessions[1].number, 7U);
    EXPECT_EQ(states[0].sessions[1].console, watcher.id);
    EXPECT_FALSE(states[0].sessions[1].isSetUp);
    EXPECT_EQ(states[1].line, PartitionState::Line::Down);
    EXPECT_EQ(states[1].description, "the web server");
    EXPECT_THAT(states[1].sessions, SizeIs(0));
}

TEST_F(PartitionChangesTest, AnOperatorClosesOneSession)
{
    Peer holder;
    Peer watcher;
    setUpSerial(holder, "a", 1);
    openSession(watcher, "b");
    ASSERT_EQ(open(watcher, 1, 1), 0U);
    EXPECT_TRUE(hypervisor->closeSession(1, 0));
    expectClosed(holder, 1, 2);
    EXPECT_EQ(setUp(holder, 1), kInvalidCmdSequence);
    EXPECT_EQ(setUp(watcher, 1, 1), 0U);
    EXPECT_FALSE(hypervisor->closeSession(1, 0));
    EXPECT_FALSE(hypervisor->closeSession(3, 0));
    EXPECT_EQ(port1->stopped, 0U);
}

TEST_F(PartitionChangesTest, ABreakIsSentWhereTheLineCan)
{
    Peer peer;
    openSession(peer, "a");
    port1->hasBreak = true;
    EXPECT_FALSE(hypervisor->sendBreak(1)); // it is down
    ASSERT_EQ(open(peer, 1), 0U);
    ASSERT_EQ(open(peer, 2), 0U);
    EXPECT_TRUE(hypervisor->sendBreak(1));
    EXPECT_EQ(port1->breaks, 1U);
    EXPECT_FALSE(hypervisor->sendBreak(2));
    EXPECT_FALSE(hypervisor->sendBreak(3));
    EXPECT_EQ(port1->input, "");
}

} // namespace

} // namespace qel::test
