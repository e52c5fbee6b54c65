#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "base/Failures.hpp"
#include "bench/BenchPair.hpp"
#include "support/Errors.hpp"
#include "support/SettableClock.hpp"
#include "tools/bench/FakeBenchPair.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace qel::test {

namespace {

using ::testing::Each;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::ClosedByPeer;
using tool::CommandFailure;
using tool::DeadlinePassed;
using tool::StatusError;

class BenchPairTest : public ::testing::Test, protected FakeBenchPair {
protected:
    const QelMessageDaxBroadcastReq& request(const FakeHypervisorEnd& end, std::size_t number) const
    {
        return dynamic_cast<const QelMessageDaxBroadcastReq&>(*end.received.at(number));
    }
};

TEST_F(BenchPairTest, ConsolesSendAlternately)
{
    for (int i = 0; i < 3; ++i)
        pair->exchange();
    ASSERT_EQ(first->received.size(), 2U);
    ASSERT_EQ(second->received.size(), 1U);
    EXPECT_EQ(request(*first, 0).getToolId(), "two");
    EXPECT_EQ(request(*second, 0).getToolId(), "one");
    EXPECT_NE(request(*first, 0).getCallerId(), request(*first, 1).getCallerId());
}

TEST_F(BenchPairTest, AMessageIsABroadcastToTheOtherOneAlone)
{
    pair->exchange();
    const QelMessageDaxBroadcastReq& sent = request(*first, 0);
    EXPECT_EQ(sent.getBroadcastMode(), 1U);
    EXPECT_EQ(sent.getToolType(), 9U);
    EXPECT_EQ(sent.getBroadcastMsgLen(), 300U);
}

TEST_F(BenchPairTest, TheTimeoutAppliesToBothConsoles)
{
    const SettableClock clock;
    pair->exchange();
    for (const FakeHypervisorEnd* end : {first, second}) {
        ASSERT_FALSE(end->readDeadlines.empty());
        EXPECT_EQ(end->readDeadlines.front(), std::chrono::milliseconds(1234));
    }
    EXPECT_THAT(first->writeDeadlines, Each(std::chrono::milliseconds(1234)));
}

TEST_F(BenchPairTest, BroadcastsOfOtherConsolesAreSkipped)
{
    second->push(QelMessageDaxBroadcastOutboundAsync(1, 9, "three", "x"));
    second->push(QelMessageDaxBroadcastOutboundAsync(1, 8, "one", "x"));
    first->push(QelMessageDaxBroadcastOutboundAsync(1, 9, "three", "x"));
    EXPECT_NO_THROW(pair->exchange());
}

TEST_F(BenchPairTest, AMissingMessageIsAwaited)
{
    first->onMessage = [this](const QelMessage& message) { first->grant(message); };
    EXPECT_THAT([this] { pair->exchange(); },
                failsWith<DeadlinePassed>("the peer did not answer in time: a message has not arrived"));
}

TEST_F(BenchPairTest, AChangedMessageBreaksTheProtocol)
{
    first->onMessage = [this](const QelMessage& message) {
        first->grant(message);
        second->push(QelMessageDaxBroadcastOutboundAsync(300, 9, "one", std::string(300, 'x').data()));
    };
    EXPECT_THAT([this] { pair->exchange(); },
                ThrowsMessage<CommandFailure>(StrEq("the server broke the protocol: a message arrived changed")));
}

TEST_F(BenchPairTest, AShortMessageBreaksTheProtocol)
{
    first->onMessage = [this](const QelMessage& message) {
        first->grant(message);
        second->push(QelMessageDaxBroadcastOutboundAsync(299, 9, "one", request(*first, 0).getDaxPacket()));
    };
    EXPECT_THAT([this] { pair->exchange(); },
                ThrowsMessage<CommandFailure>(StrEq("the server broke the protocol: a message arrived changed")));
}

TEST_F(BenchPairTest, ARefusalEndsTheExchange)
{
    first->onMessage = [this](const QelMessage& message) { first->respond(message, QelMessageStatusCmdFailed); };
    try {
        pair->exchange();
        ADD_FAILURE() << "granted";
    } catch (const StatusError& error) {
        EXPECT_EQ(error.getStatus(), QelMessageStatusCmdFailed);
    }
}

TEST_F(BenchPairTest, TheConnectionClosedNoticeIsSeenByTheAddressee)
{
    second->push(QelMessageKrogConnectionClosedAsync());
    EXPECT_THAT([this] { pair->exchange(); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

TEST_F(BenchPairTest, TheConnectionClosedNoticeIsSeenByTheSender)
{
    first->push(QelMessageKrogConnectionClosedAsync());
    EXPECT_THAT([this] { pair->exchange(); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

} // namespace

} // namespace qel::test
