// Consoles that say nothing are let go, and the machine is told why a console has left.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "protocol/hypervisor/ScriptedMachine.hpp"
#include "protocol/hypervisor/VirtualSerialFixture.hpp"
#include "support/SettableClock.hpp"

#include <chrono>
#include <gmock/gmock.h>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using protocol::DisconnectReason;
using std::chrono::milliseconds;
using std::chrono::seconds;
using ::testing::ElementsAre;

constexpr seconds kTimeout(600);
constexpr seconds kLinger(2);

class IdleConsoles : public ScriptedMachineFixture {
protected:
    IdleConsoles() { limit({kTimeout, kLinger}); }

    void limit(protocol::IdleLimits limits)
    {
        hypervisor.reset();
        hypervisor = std::make_unique<protocol::HypervisorEngine>(
            *machine, protocol::HypervisorEngine::kDefaultMaxConsoles, [this] { ++serialWakes; }, limits);
    }

    /// What the serial thread does when it wakes up.
    milliseconds pass(milliseconds time)
    {
        clock.advance(time);
        return hypervisor->serviceLines();
    }

    void expectLetGo()
    {
        EXPECT_NO_THROW(peer.link.take<QelMessageKrogConnectionClosedAsync>());
        EXPECT_EQ(peer.link.posted(), 0U);
        EXPECT_TRUE(peer.link.finished);
    }

    SettableClock clock;
    Peer peer;
};

const std::string kSilence = "\r\n[qel: nothing has come from this console for 600 s]\r\n";

TEST_F(IdleConsoles, OneThatSaysNothingIsLetGo)
{
    setUpSerial(peer, "a", 1);
    EXPECT_EQ(pass(kTimeout - milliseconds(1)), milliseconds(1));
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_FALSE(peer.link.finished);
    EXPECT_EQ(pass(milliseconds(1)), kLinger);
    EXPECT_EQ(takeData(peer, 1), kSilence);
    expectClosed(peer, 1, 2);
    expectLetGo();
    Peer other;
    openSession(other, "b");
    EXPECT_EQ(open(other, 1), 0U); // the session is free
}

TEST_F(IdleConsoles, AllSessionsOfOneThatIsLetGoEnd)
{
    setUpSerial(peer, "a", 1);
    ASSERT_EQ(open(peer, 1, 3), 0U); // watches, and has not set up
    ASSERT_EQ(open(peer, 2, 1), 0U);
    ASSERT_EQ(setUp(peer, 2, 1), 0U);
    Peer other;
    openSession(other, "b");
    ASSERT_EQ(open(other, 1, 4), 0U);
    clock.advance(milliseconds(1));
    ASSERT_EQ(setUp(other, 1, 4), 0U);
    pass(kTimeout - milliseconds(1));
    EXPECT_EQ(takeData(peer, 1), kSilence);
    expectClosed(peer, 1, 2);
    expectClosed(peer, 1, 2, 0, 3);
    EXPECT_EQ(takeData(peer, 2, 1), kSilence);
    expectClosed(peer, 2, 2, 0, 1);
    expectLetGo();
    EXPECT_EQ(other.link.posted(), 0U);
    EXPECT_EQ(open(other, 1, 4), 19U); // still its own
}

TEST_F(IdleConsoles, OutputThatHasFoundNoRoomIsSkippedWithANote)
{
    openSession(peer, "a");
    ASSERT_EQ(open(peer, 1, 1), 0U);
    ASSERT_EQ(setUp(peer, 1, 1), 0U);
    peer.link.serialRoom = false;
    port1->output = {"12345"};
    hypervisor->serviceSerial(1);
    pass(kTimeout);
    EXPECT_EQ(takeData(peer, 1, 1), "\r\n[qel: 5 bytes skipped]\r\n");
    EXPECT_EQ(takeData(peer, 1, 1), kSilence);
    expectClosed(peer, 1, 2, 0, 1);
    expectLetGo();
}

TEST_F(IdleConsoles, WhateverItSaysCounts)
{
    setUpSerial(peer, "a", 1);
    const std::vector<std::function<void()>> says{
        [this] { sendData(peer, 1, "x"); },
        [this] { EXPECT_EQ(statusOf(peer, QelMessageGetInterfaceLimitsReq()), 0U); },
        [this] { EXPECT_EQ(statusOf(peer, QelMessageVirtualSerialOpenReq(1, 0, false)), 19U); }, // refused
        [this] { EXPECT_EQ(statusOf(peer, request(0x6003, 0x01FF)), 1U); },                      // unknown
        [this] { receive(peer, QelMessageVirtualSerialDataToOsAsync(7, 0, 1, "x")); }};          // ignored
    for (std::size_t i = 0; i < says.size(); ++i) {
        SCOPED_TRACE(i);
        pass(kTimeout - milliseconds(1));
        says[i]();
        ASSERT_FALSE(peer.link.finished);
    }
    pass(kTimeout - milliseconds(1));
    EXPECT_FALSE(peer.link.finished);
    pass(milliseconds(1));
    EXPECT_TRUE(peer.link.finished);
}

TEST_F(IdleConsoles, TheTimeRequestSaysNothing)
{
    setUpSerial(peer, "a", 1);
    pass(kTimeout - milliseconds(1));
    EXPECT_EQ(statusOf(peer, QelMessageGetQelTodReq()), 0U);
    pass(milliseconds(1));
    EXPECT_TRUE(peer.link.finished);
}

TEST_F(IdleConsoles, WhatAConsoleIsToldSaysNothingEither)
{
    setUpSerial(peer, "a", 1);
    pass(kTimeout - milliseconds(1));
    port1->output = {"output"};
    hypervisor->serviceSerial(1);
    EXPECT_EQ(takeData(peer, 1), "output");
    pass(milliseconds(1));
    EXPECT_TRUE(peer.link.finished);
}

TEST_F(IdleConsoles, NoTimePassesWhileNothingIsReadFromIt)
{
    setUpSerial(peer, "a", 1);
    port1->takes = 0;
    sendData(peer, 1, std::string(16 * 1024, 'x'));
    for (int i = 0; i < 4; ++i)
        sendData(peer, 1, std::string(16 * 1024, 'x'));
    ASSERT_FALSE(hypervisor->mayReceive(peer.id));
    pass(kTimeout);
    EXPECT_FALSE(peer.link.finished);
    port1->takes = 1000000;
    hypervisor->serviceSerial(1);
    ASSERT_TRUE(hypervisor->mayReceive(peer.id));
    pass(kTimeout - milliseconds(1));
    EXPECT_FALSE(peer.link.finished);
    pass(milliseconds(1));
    EXPECT_TRUE(peer.link.finished);
}

TEST_F(IdleConsoles, ConnectionsWithoutAnIdentityAreNotItsBusiness)
{
    connect(peer);
    EXPECT_LT(pass(kTimeout * 2), milliseconds(0)); // nothing to wait for
    EXPECT_FALSE(peer.link.finished);
    EXPECT_EQ(statusOf(peer, versionRequest("a")), 0U);
    EXPECT_EQ(pass(milliseconds(0)), kTimeout);
}

TEST_F(IdleConsoles, TheSerialThreadLearnsOfTheFirstConsole)
{
    connect(peer);
    hypervisor->serviceLines(); // of the new partitions it knows
    const unsigned before = serialWakes;
    receive(peer, versionRequest("a"));
    EXPECT_EQ(serialWakes, before + 1);
    receive(peer, QelMessageGetInterfaceLimitsReq()); // what comes later only moves the time on
    EXPECT_EQ(serialWakes, before + 1);
}

TEST_F(IdleConsoles, WithoutALimitNobodyIsLetGo)
{
    limit({});
    setUpSerial(peer, "a", 1);
    EXPECT_LT(pass(std::chrono::hours(1000)), milliseconds(0));
    EXPECT_FALSE(peer.link.finished);
}

TEST_F(IdleConsoles, OneThatDoesNotTakeWhatIsQueuedIsCut)
{
    identify(peer, "a");
    pass(kTimeout);
    EXPECT_EQ(pass(kLinger - milliseconds(1)), milliseconds(1));
    EXPECT_FALSE(peer.link.isCut);
    EXPECT_LT(pass(milliseconds(1)), milliseconds(0));
    EXPECT_TRUE(peer.link.isCut);
}

TEST_F(IdleConsoles, EachHasItsOwnTime)
{
    Peer second;
    identify(peer, "a");
    pass(seconds(100));
    identify(second, "b");
    EXPECT_EQ(pass(kTimeout - seconds(100)), kLinger);
    EXPECT_TRUE(peer.link.finished);
    hypervisor->disconnect(peer.id);
    EXPECT_EQ(pass(kLinger), seconds(98));
    EXPECT_FALSE(second.link.finished);
    pass(seconds(98));
    EXPECT_TRUE(second.link.finished);
}

TEST_F(IdleConsoles, TheMachineIsToldWhyAConsoleHasLeft)
{
    const auto leaves = [this](const std::function<void(Peer&)>& how, DisconnectReason known) {
        Peer console;
        identify(console, "a");
        how(console);
        hypervisor->disconnect(console.id, known);
        return std::exchange(user->reasons, {});
    };
    const auto silently = [](Peer&) {};
    EXPECT_THAT(leaves(silently, DisconnectReason::Closed), ElementsAre(DisconnectReason::Closed));
    EXPECT_THAT(leaves(silently, DisconnectReason::Timeout), ElementsAre(DisconnectReason::Timeout));
    EXPECT_THAT(leaves([this](Peer&) { pass(kTimeout); }, DisconnectReason::Lost), ElementsAre(DisconnectReason::Idle));
    EXPECT_THAT(leaves([this](Peer& console) { receive(console, QelMessageUpgradeConnectionAsync()); },
                       DisconnectReason::Closed),
                ElementsAre(DisconnectReason::Protocol));
    EXPECT_THAT(leaves([this](Peer&) { hypervisor->shutDown(); }, DisconnectReason::Lost),
                ElementsAre(DisconnectReason::Shutdown));
}

} // namespace

} // namespace qel::test
