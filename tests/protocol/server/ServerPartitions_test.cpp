// Partitions that change while a server serves them, with real lines and the server's own thread for them.

#include <qel/protocol/CommandLine.hpp>
#include <qel/protocol/Server.hpp>

#include "support/ComesTrue.hpp"

#include <atomic>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <thread>

namespace qel::test {

namespace {

using protocol::PartitionOptions;
using protocol::PartitionState;
using protocol::Server;
using ::testing::SizeIs;
using ::testing::ThrowsMessage;

class ServerPartitionsTest : public ::testing::Test {
protected:
    static protocol::ServerOptions options()
    {
        protocol::ServerOptions options;
        options.listen.clear();
        options.plain = true;
        return options;
    }
    static PartitionOptions boot()
    {
        PartitionOptions options;
        options.start = protocol::StartLine::Boot;
        return options;
    }

    protocol::Hypervisor machine;
    Server server{machine, options()};
};

TEST_F(ServerPartitionsTest, AnAddedCommandIsStartedAndReadAndARemovedOneIsGone)
{
    server.addPartition(7, protocol::commandLine("echo ready; exec cat"), boot());
    ASSERT_TRUE(comesTrue([&] { return server.partitions().at(0).outputBytes == 7; })); // "ready\r\n"
    EXPECT_EQ(server.partitions().at(0).line, PartitionState::Line::Up);
    PartitionOptions named = boot();
    named.name = "web1";
    EXPECT_TRUE(server.changePartition(7, named));
    EXPECT_EQ(server.partitions().at(0).name, "web1");
    EXPECT_FALSE(server.sendBreak(7)); // a pseudo-terminal has none
    EXPECT_FALSE(server.closeSession(7, 0));
    EXPECT_TRUE(server.removePartition(7));
    EXPECT_THAT(server.partitions(), SizeIs(0));
    EXPECT_FALSE(server.removePartition(7));
    server.finish();
    EXPECT_THAT([&] { server.addPartition(8, protocol::commandLine("cat")); },
                ThrowsMessage<std::logic_error>("the server has finished"));
}

/// Blocks the thread that calls it, until it may go on.
class BlockingTap : public protocol::SerialTap {
public:
    void onOutput(std::uint16_t, const char*, std::size_t) noexcept override
    {
        isBlocked = true;
        while (isBlocked)
            std::this_thread::yield();
    }
    void onEvent(std::uint16_t, const std::string&) noexcept override {}

    std::atomic<bool> isBlocked{false};
};

TEST_F(ServerPartitionsTest, HasNoPulseWhileATapBlocksTheThreadOfTheLines)
{
    EXPECT_TRUE(server.hasPulse() || comesTrue([this] { return server.hasPulse(); })); // it may just have begun
    EXPECT_TRUE(comesTrue([this] { return server.hasPulse(); }));                      // without anything to do
    const auto tap = std::make_shared<BlockingTap>();
    PartitionOptions tapped = boot();
    tapped.tap = tap;
    server.addPartition(1, protocol::commandLine("echo x; exec cat"), tapped);
    ASSERT_TRUE(comesTrue([&] { return tap->isBlocked.load(); }));
    server.hasPulse(); // of the turns before
    EXPECT_FALSE(server.hasPulse());
    EXPECT_FALSE(server.hasPulse());
    tap->isBlocked = false;
    EXPECT_TRUE(comesTrue([this] { return server.hasPulse(); }));
}

TEST_F(ServerPartitionsTest, SeveralThreadsMayChangePartitions)
{
    const auto change = [this](std::uint16_t id) {
        for (int round = 0; round < 50; ++round) {
            server.addPartition(id, protocol::commandLine("exec cat"), boot());
            static_cast<void>(server.partitions());
            EXPECT_TRUE(server.changePartition(id, boot()));
            EXPECT_TRUE(server.removePartition(id));
        }
    };
    std::thread other(change, static_cast<std::uint16_t>(1));
    change(2);
    other.join();
    EXPECT_THAT(server.partitions(), SizeIs(0));
}

} // namespace

} // namespace qel::test
