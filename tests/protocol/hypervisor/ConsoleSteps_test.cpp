// A console that leaves, stalls or lies after each step of a connection. Another one must not notice.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>

#include "protocol/hypervisor/NamedRequests.hpp"
#include "protocol/hypervisor/VirtualSerialFixture.hpp"
#include "support/RawFrame.hpp"

#include <array>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::ConsoleState;
using ::testing::IsEmpty;

enum class Step { Connected, Identified, SessionOpen, SerialOpen, SetUp };

constexpr std::array<Step, 5> kSteps{Step::Connected, Step::Identified, Step::SessionOpen, Step::SerialOpen,
                                     Step::SetUp};

class ConsoleStepsTest : public VirtualSerialFixture, public ::testing::WithParamInterface<Step> {
protected:
    bool has(Step step) const { return GetParam() >= step; }

    /// Takes the steps up to that of the test; partition 1.
    void begin(Peer& peer)
    {
        connect(peer);
        proceed(peer, Step::Connected, GetParam());
    }

    /// Takes the steps after one, up to another.
    void proceed(Peer& peer, Step from, Step to)
    {
        const auto takes = [&](Step step) { return from < step && step <= to; };
        if (takes(Step::Identified)) {
            ASSERT_EQ(statusOf(peer, versionRequest("tool")), 0U);
        }
        if (takes(Step::SessionOpen)) {
            ASSERT_EQ(statusOf(peer, QelMessageInterfaceCmpOpenKrogSessionReq()), 0U);
        }
        if (takes(Step::SerialOpen)) {
            ASSERT_EQ(open(peer, 1), 0U);
        }
        if (takes(Step::SetUp)) {
            ASSERT_EQ(setUp(peer, 1), 0U);
        }
    }

    /// Data flow in both directions.
    void expectFlow(Peer& peer, FakeSerialLine& line, std::uint16_t partition)
    {
        line.input.clear();
        sendData(peer, partition, "in");
        EXPECT_EQ(line.input, "in");
        line.output = {"out"};
        hypervisor->serviceSerial(partition);
        EXPECT_EQ(takeData(peer, partition), "out");
        EXPECT_EQ(peer.link.posted(), 0U);
    }

    /// The state of the connection after the test's steps.
    ConsoleState state() const { return has(Step::Identified) ? ConsoleState::Identified : ConsoleState::Connected; }
};

std::string nameOf(const ::testing::TestParamInfo<Step>& info)
{
    constexpr std::array<const char*, 5> kNames{"Connected", "Identified", "SessionOpen", "SerialOpen", "SetUp"};
    return kNames.at(static_cast<std::size_t>(info.param));
}

INSTANTIATE_TEST_SUITE_P(Steps, ConsoleStepsTest, ::testing::ValuesIn(kSteps), nameOf);

TEST_P(ConsoleStepsTest, AConsoleThatLeavesMakesRoomForTheNext)
{
    limitConsoles(1);
    Peer gone;
    begin(gone);
    hypervisor->disconnect(gone.id);
    EXPECT_EQ(hypervisor->receive(gone.id, QelMessageGetQelTodReq()).state, ConsoleState::Closing);
    EXPECT_EQ(gone.link.posted(), 0U);

    Peer next;
    connect(next);
    proceed(next, Step::Connected, Step::SetUp); // the same identity, the same partition
    expectFlow(next, *port1, 1);
    EXPECT_EQ(gone.link.posted(), 0U);
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_P(ConsoleStepsTest, AConsoleThatReadsNothingHoldsUpNobody)
{
    serveWith(waiting());
    Peer stalled;
    begin(stalled);
    stalled.link.room = false;
    stalled.link.serialRoom = false;
    EXPECT_FALSE(hypervisor->receive(stalled.id, QelMessageGetQelTodReq()).mayReadNext);
    EXPECT_EQ(stalled.link.posted(), 1U); // the answer waits in the link

    Peer other;
    setUpSerial(other, "other", 2);
    expectFlow(other, *port2, 2);
    EXPECT_EQ(statusOf(other, QelMessageDaxBroadcastReq(0, 1, 0, "", "x")), 0U);
    EXPECT_EQ(stalled.link.posted(), 1U);
    port1->output = {"held back"};
    EXPECT_THAT(watched(), ::testing::Each(2));
    hypervisor->serviceSerial(1);
    EXPECT_EQ(stalled.link.posted(), 1U);

    stalled.link.room = true;
    stalled.link.serialRoom = true;
    EXPECT_TRUE(hypervisor->mayReceive(stalled.id));
    stalled.link.take();
    proceed(stalled, GetParam(), Step::SetUp);
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(stalled, 1), "held back");
}

TEST_P(ConsoleStepsTest, AConsoleThatReadsNothingIsToldTheEnd)
{
    Peer stalled;
    begin(stalled);
    stalled.link.room = false;
    stalled.link.serialRoom = false;
    hypervisor->shutDown();
    if (has(Step::SerialOpen)) expectClosed(stalled, 1, 3);
    if (has(Step::Identified)) {
        EXPECT_NE(stalled.link.take<QelMessageKrogConnectionClosedAsync>(), nullptr);
    }
    EXPECT_EQ(stalled.link.posted(), 0U);
    EXPECT_TRUE(stalled.link.finished);
}

TEST_P(ConsoleStepsTest, RequestsThatDoNotParseOrExistAreRefusedAndChangeNothing)
{
    Peer peer;
    begin(peer);
    std::vector<NamedRequest> lies = unparsableRequests();
    lies.push_back({"version", request(0x6003, 0x0101, "too short")});
    lies.push_back({"unknown function", request(0x1234, 0x0101)});
    lies.push_back({"unknown operation", request(0x6003, 0x7777)});
    lies.push_back({"a notice as a request", request(0x6002, 0x0405)});
    for (const NamedRequest& lie : lies) {
        SCOPED_TRACE(lie.name);
        EXPECT_NE(statusOf(peer, lie.message), 0U);
    }
    EXPECT_FALSE(peer.link.finished);
    proceed(peer, GetParam(), Step::SetUp);
    expectFlow(peer, *port1, 1);
}

TEST_P(ConsoleStepsTest, NoticesAndResponsesOutOfPlaceAreIgnoredWithAWarning)
{
    Peer peer;
    begin(peer);
    const std::vector<std::vector<char>> lies{
        RawFrame::newForm().function(0x6003).operation(0x0107).flags(0x40).bytes(), // a response
        RawFrame::newForm().function(0x6003).operation(0x0107).flags(0xC0).bytes(), // request and response
        RawFrame::newForm().function(0x7000).operation(0x0401).bytes(),             // data to a console
        RawFrame::newForm().function(0x6002).operation(0x0405).bytes(),             // data without a payload
        RawFrame::newForm().function(0x6001).operation(0x0002).bytes(),             // the abort message
    };
    for (const std::vector<char>& lie : lies) {
        log.clear();
        EXPECT_EQ(receive(peer, lie), state());
        EXPECT_EQ(peer.link.posted(), 0U);
        EXPECT_EQ(log.lines().size(), 1U);
    }
    log.clear();
    sendData(peer, 2, "for a partition of nobody's");
    EXPECT_EQ(port2->input, "");
    EXPECT_EQ(log.lines().size(), 1U);
    proceed(peer, GetParam(), Step::SetUp);
    expectFlow(peer, *port1, 1);
}

TEST_P(ConsoleStepsTest, ARequestForTlsEndsTheConnectionAndFreesWhatItHeld)
{
    Peer peer;
    begin(peer);
    EXPECT_EQ(receive(peer, QelMessageUpgradeConnectionAsync()), ConsoleState::Closing);
    EXPECT_EQ(peer.link.take()->getOperation(), QelMessageOpAbortHandshake);
    EXPECT_TRUE(peer.link.finished);
    for (const NamedRequest& ignored : otherRequests())
        EXPECT_EQ(receive(peer, ignored.message), ConsoleState::Closing);
    EXPECT_EQ(peer.link.posted(), 0U);
    hypervisor->disconnect(peer.id);
    Peer next;
    connect(next);
    proceed(next, Step::Connected, Step::SetUp);
    expectFlow(next, *port1, 1);
}

} // namespace

} // namespace qel::test
