// What a server says about itself: who is connected, what has passed, and who was refused.

#include "protocol/server/ServerFixture.hpp"
#include "server/RefusalCounts.hpp"
#include "support/ComesTrue.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <numeric>
#include <set>
#include <string>

namespace qel::test {

namespace {

using protocol::ConnectedConsole;
using protocol::ConnectionRefusal;
using protocol::ServerState;
using ::testing::SizeIs;

class ServerStateTest : public ServerFixture {
protected:
    std::uint64_t refused(ConnectionRefusal reason) const
    {
        return server->state().refused.at(static_cast<std::size_t>(reason));
    }
    bool becomesRefused(ConnectionRefusal reason) const
    {
        return comesTrue([&] { return refused(reason) == 1; });
    }
    std::uint64_t allRefused() const
    {
        const auto refused = server->state().refused;
        return std::accumulate(refused.begin(), refused.end(), std::uint64_t{0});
    }
};

TEST_F(ServerStateTest, OfAServerWithoutConsolesIsEmpty)
{
    make(plainOptions());
    const ServerState state = server->state();
    EXPECT_THAT(state.consoles, SizeIs(0));
    EXPECT_EQ(state.accepted, 0U);
    EXPECT_EQ(state.received.mCount, 0U);
    EXPECT_EQ(state.queues.sent.mCount, 0U);
    EXPECT_EQ(allRefused(), 0U);
}

TEST_F(ServerStateTest, NamesAConsoleAndCountsWhatItSentAndGot)
{
    make(plainOptions());
    const auto console = connectInMemory("the first");
    ASSERT_EQ(introduce(*console, "console-1"), 0U);
    ASSERT_TRUE(comesTrue([&] { return server->state().queues.sent.mCount == 1; }));
    const ServerState state = server->state();
    ASSERT_THAT(state.consoles, SizeIs(1));
    const ConnectedConsole& found = state.consoles.front();
    EXPECT_EQ(found.peer.id, 1U);
    EXPECT_EQ(found.peer.address, "the first");
    EXPECT_EQ(found.peer.toolType, 7U);
    EXPECT_EQ(found.peer.toolId, "console-1");
    EXPECT_FALSE(found.peer.isProtected);
    EXPECT_TRUE(found.isIdentified);
    EXPECT_GE(found.since, state.since);
    const std::size_t request = QelMessageGetEnclTypeAndInterfaceVersionReq(1, 7, 2, 3, "console-1").msgLength();
    EXPECT_EQ(found.received.mCount, 1U);
    EXPECT_EQ(found.received.mBytes, request);
    EXPECT_EQ(found.queue.sent.mCount, 1U);
    EXPECT_GT(found.queue.sent.mBytes, 0U);
    EXPECT_EQ(found.queue.mostBytes, found.queue.sent.mBytes);
    EXPECT_EQ(found.queue.pending.mCount, 0U);
    const auto& classes = found.queue.latency.getCounts();
    EXPECT_EQ(std::accumulate(classes.begin(), classes.end(), std::uint64_t{0}),
              1U); // in which one, the machine decides
    EXPECT_EQ(state.accepted, 1U);
    EXPECT_EQ(state.received.mBytes, request);
}

TEST_F(ServerStateTest, SaysThatAConnectionHasNotIntroducedItself)
{
    make(plainOptions());
    const auto console = connectInMemory("quiet");
    const ServerState state = server->state();
    ASSERT_THAT(state.consoles, SizeIs(1));
    EXPECT_FALSE(state.consoles.front().isIdentified);
    EXPECT_EQ(state.consoles.front().peer.id, 1U);
    EXPECT_EQ(allRefused(), 0U);
}

TEST_F(ServerStateTest, KnowsOnlyTheAddressDuringTheTlsHandshake)
{
    make(tlsOptions());
    const auto console = connectInMemory("quiet");
    const ServerState state = server->state();
    ASSERT_THAT(state.consoles, SizeIs(1));
    EXPECT_EQ(state.consoles.front().peer.id, 0U);
    EXPECT_EQ(state.consoles.front().peer.address, "quiet");
}

TEST_F(ServerStateTest, KeepsTheSumsOfConsolesThatHaveLeft)
{
    make(plainOptions());
    for (const char* name : {"a", "b", "c"}) {
        ASSERT_EQ(introduce(*connectInMemory(name), name), 0U);
        ASSERT_TRUE(comesTrue([&] { return server->state().consoles.empty(); }));
    }
    const auto last = connectInMemory("d");
    ASSERT_EQ(introduce(*last, "d"), 0U);
    ASSERT_TRUE(comesTrue([&] { return server->state().queues.sent.mCount == 4; }));
    const ServerState state = server->state();
    EXPECT_THAT(state.consoles, SizeIs(1));
    EXPECT_EQ(state.accepted, 4U);
    EXPECT_EQ(state.received.mCount, 4U);
    const auto& counts = state.queues.latency.getCounts();
    EXPECT_EQ(std::accumulate(counts.begin(), counts.end(), std::uint64_t{0}), 4U);
    EXPECT_EQ(allRefused(), 0U); // they left after they had been connected
}

TEST_F(ServerStateTest, CountsAConnectionThatLeavesBeforeItIsAConsole)
{
    make(plainOptions());
    connectInMemory("gone").reset();
    EXPECT_TRUE(becomesRefused(ConnectionRefusal::Left));
    EXPECT_EQ(allRefused(), 1U);
}

TEST_F(ServerStateTest, CountsAMalformedFrameOnce)
{
    make(plainOptions());
    const auto console = connectInMemory("rubbish");
    console->write(std::string(64, '\xFF').data(), 64);
    EXPECT_TRUE(isClosed(*console, true));
    EXPECT_TRUE(becomesRefused(ConnectionRefusal::Malformed));
    EXPECT_EQ(allRefused(), 1U);
}

TEST_F(ServerStateTest, CountsAHandshakeThatIsNotDoneInTime)
{
    protocol::ServerOptions options = plainOptions();
    options.handshakeTimeout = std::chrono::milliseconds(1);
    make(options);
    const auto console = connectInMemory("slow");
    EXPECT_TRUE(isClosed(*console));
    EXPECT_TRUE(becomesRefused(ConnectionRefusal::NotInTime));
    EXPECT_EQ(allRefused(), 1U);
}

TEST_F(ServerStateTest, CountsAVersionRequestThatIsRefused)
{
    protocol::ServerOptions options = plainOptions();
    options.maxConsoles = 1;
    make(options);
    const auto first = connectInMemory("first");
    ASSERT_EQ(introduce(*first, "first"), 0U);
    const auto second = connectInMemory("second");
    EXPECT_EQ(introduce(*second, "second"), 18U);
    EXPECT_TRUE(isClosed(*second));
    EXPECT_TRUE(becomesRefused(ConnectionRefusal::RequestRefused));
    EXPECT_EQ(allRefused(), 1U);
}

TEST_F(ServerStateTest, CountsAConsoleThatFindsNoPlaceBeforeTls)
{
    protocol::ServerOptions options = tlsOptions();
    options.maxConsoles = 1;
    make(options);
    run();
    const auto first = connectTls();
    ASSERT_EQ(introduce(*first, "first"), 0U);
    const auto second = connect();
    QelMessageStream(*second, QelInternalMessageRegistry::getInstance()).write(QelMessageUpgradeConnectionAsync());
    expect<QelMessageAbortHandshakeAsync>(*second);
    EXPECT_TRUE(becomesRefused(ConnectionRefusal::TooManyConsoles));
    const ServerState state = server->state();
    EXPECT_EQ(state.accepted, 2U);
    ASSERT_FALSE(state.consoles.empty());
    EXPECT_TRUE(state.consoles.front().peer.isProtected);
    EXPECT_EQ(state.consoles.front().peer.fingerprint.size(), 95U);
}

TEST_F(ServerStateTest, CountsACertificateThatIsNotPinned)
{
    protocol::ServerOptions options = tlsOptions();
    options.pins.names = {"somebody else"};
    make(options);
    run();
    const auto console = connectTls();
    EXPECT_TRUE(becomesRefused(ConnectionRefusal::NotPinned));
    EXPECT_EQ(allRefused(), 1U);
}

TEST_F(ServerStateTest, CountsConnectionsThatFindNoPlaceForTheirHandshake)
{
    protocol::ServerOptions options = plainOptions();
    options.maxHandshakes = 2;
    options.maxHandshakesPerAddress = 1;
    make(options);
    run();
    const auto first = connect();
    ASSERT_TRUE(comesTrue([&] { return server->state().consoles.size() == 1; }));
    EXPECT_TRUE(isClosed(*connect()));
    EXPECT_TRUE(becomesRefused(ConnectionRefusal::TooManyFromAddress));
    EXPECT_EQ(allRefused(), 1U);
    EXPECT_EQ(server->state().accepted, 2U);
}

TEST(RefusalCounts, HasAWordOfItsOwnForEachReason)
{
    std::set<std::string> words;
    for (std::size_t i = 0; i < protocol::kConnectionRefusals; ++i)
        words.insert(protocol::refusalWord(static_cast<ConnectionRefusal>(i)));
    EXPECT_EQ(words.size(), protocol::kConnectionRefusals);
    EXPECT_EQ(words.count("certificate"), 1U);
}

} // namespace

} // namespace qel::test
