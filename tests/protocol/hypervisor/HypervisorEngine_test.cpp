#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>

#include "hypervisor/HypervisorEngine.hpp"
#include "protocol/hypervisor/HypervisorFixture.hpp"
#include "protocol/hypervisor/NamedRequests.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::ConsoleState;
using protocol::Hypervisor;
using protocol::MachineInfo;
using protocol::Received;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

using HypervisorTest = HypervisorFixture;

constexpr unsigned int kInvalidOperation = 1;
constexpr unsigned int kInvalidData = 3;
constexpr unsigned int kInvalidCmdSequence = 4;
constexpr unsigned int kInvalidFunction = 15;
constexpr unsigned int kTooManyConnections = 18;
constexpr unsigned int kSessionAlreadyOpen = 23;
constexpr unsigned int kAlreadyConnected = 37;

// The version request.

TEST_F(HypervisorTest, TheVersionResponseSaysWhatTheMachineIs)
{
    serve(std::make_unique<Hypervisor>(MachineInfo{'Z', 4, 5, "0123456789abcdef", "serial"}));
    Peer peer;
    connect(peer);
    const auto asked = versionRequest("a");
    EXPECT_EQ(receive(peer, asked), ConsoleState::Identified);
    const auto response = peer.link.take<QelMessageGetEnclTypeAndInterfaceVersionRsp>();
    EXPECT_EQ(response->getCallerId(), asked.getCallerId());
    EXPECT_EQ(response->getStatus(), 0U);
    EXPECT_EQ(response->getInterfaceVersionFamily(), 'Z');
    EXPECT_EQ(response->getEnclosureType(), 2U);
    EXPECT_EQ(response->getMajorVersion(), 4U);
    EXPECT_EQ(response->getMinorVersion(), 5U);
    EXPECT_EQ(response->getSystemMachineType(), "0123456789abcdef");
    EXPECT_EQ(response->getSystemSerialNum(), "serial");
}

TEST_F(HypervisorTest, BeforeTheVersionRequestEveryOtherRequestIsOutOfSequence)
{
    std::vector<NamedRequest> requests = otherRequests();
    for (const NamedRequest& unparsable : unparsableRequests())
        requests.push_back(unparsable);
    requests.push_back({"unknown function", request(0x1234, 0x0101)});
    requests.push_back({"unknown operation", request(0x6003, 0x7777)});
    Peer peer;
    connect(peer);
    for (const NamedRequest& entry : requests) {
        SCOPED_TRACE(entry.name);
        EXPECT_EQ(statusOf(peer, entry.message), kInvalidCmdSequence);
    }
    EXPECT_EQ(statusOf(peer, versionRequest("a")), 0U);
}

TEST_F(HypervisorTest, AnUnparsableVersionRequestIsInvalidDataAndMayBeRepeated)
{
    Peer peer;
    connect(peer);
    EXPECT_EQ(receive(peer, request(0x6003, 0x0101, "too short")), ConsoleState::Connected);
    EXPECT_EQ(peer.link.take()->getStatus(), kInvalidData);
    EXPECT_EQ(statusOf(peer, versionRequest("a")), 0U);
}

TEST_F(HypervisorTest, ASecondVersionRequestIsOutOfSequence)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(statusOf(peer, versionRequest("a")), kInvalidCmdSequence);
    EXPECT_EQ(statusOf(peer, versionRequest("b")), kInvalidCmdSequence);
    EXPECT_EQ(statusOf(peer, request(0x6003, 0x0101, "too short")), kInvalidCmdSequence);
}

TEST_F(HypervisorTest, ASecondConsoleWithTheSameIdentityIsAlreadyConnected)
{
    Peer first;
    Peer second;
    identify(first, "a", 7);
    connect(second);
    EXPECT_EQ(receive(second, versionRequest("a", 7)), ConsoleState::Connected);
    EXPECT_EQ(second.link.take()->getStatus(), kAlreadyConnected);
    EXPECT_FALSE(second.link.finished);
    EXPECT_EQ(statusOf(second, QelMessageGetInterfaceLimitsReq()), kInvalidCmdSequence);
    EXPECT_EQ(statusOf(second, versionRequest("b", 7)), 0U);
}

TEST_F(HypervisorTest, TypeAndIdTogetherAreTheIdentity)
{
    Peer first;
    Peer second;
    identify(first, "a", 7);
    identify(second, "a", 8);
}

TEST_F(HypervisorTest, AnEmptyToolIdIsAnIdentityLikeAnyOther)
{
    Peer first;
    Peer second;
    identify(first, "", 7);
    connect(second);
    EXPECT_EQ(statusOf(second, versionRequest("", 7)), kAlreadyConnected);
}

TEST_F(HypervisorTest, AnIdentityOfZerosIsFreeAtFirst)
{
    Peer silent;
    Peer peer;
    connect(silent);
    connect(peer);
    EXPECT_EQ(statusOf(peer, versionRequest("", 0)), 0U);
}

TEST_F(HypervisorTest, AConsoleBeingClosedFreesItsIdentityAndPlaceAtOnce)
{
    limitConsoles(1);
    Peer first;
    Peer second;
    identify(first, "a");
    EXPECT_EQ(receive(first, QelMessageUpgradeConnectionAsync()), ConsoleState::Closing);
    connect(second);
    EXPECT_EQ(statusOf(second, versionRequest("a")), 0U);
}

TEST_F(HypervisorTest, AConsoleAboveTheMaximumIsRefusedAndClosed)
{
    limitConsoles(2);
    Peer first;
    Peer second;
    Peer third;
    identify(first, "a");
    identify(second, "b");
    connect(third);
    EXPECT_EQ(receive(third, versionRequest("c")), ConsoleState::Closing);
    EXPECT_EQ(third.link.take()->getStatus(), kTooManyConnections);
    EXPECT_TRUE(third.link.finished);
}

TEST_F(HypervisorTest, TheDefaultMaximumIsSixteenConsoles)
{
    std::vector<std::unique_ptr<Peer>> peers;
    for (int i = 0; i < 16; ++i) {
        SCOPED_TRACE(i);
        EXPECT_TRUE(hypervisor->takesConsoles());
        peers.push_back(std::make_unique<Peer>());
        identify(*peers.back(), "console " + std::to_string(i));
    }
    EXPECT_FALSE(hypervisor->takesConsoles());
    Peer tooMany;
    connect(tooMany);
    EXPECT_EQ(statusOf(tooMany, versionRequest("console 16")), kTooManyConnections);
}

TEST_F(HypervisorTest, IgnoresWhatARefusedConsoleSends)
{
    limitConsoles(1);
    Peer first;
    Peer second;
    identify(first, "a");
    connect(second);
    receive(second, versionRequest("b"));
    second.link.take();
    hypervisor->disconnect(first.id); // a place is free now
    EXPECT_EQ(receive(second, versionRequest("b")), ConsoleState::Closing);
    EXPECT_EQ(receive(second, QelMessageGetInterfaceLimitsReq()), ConsoleState::Closing);
    EXPECT_EQ(second.link.posted(), 0U);
}

TEST_F(HypervisorTest, AnUnidentifiedConnectionDoesNotCount)
{
    limitConsoles(2);
    Peer silent;
    Peer first;
    Peer second;
    connect(silent);
    identify(first, "a");
    identify(second, "b");
}

TEST_F(HypervisorTest, ADuplicateIdentityIsReportedBeforeTheMaximum)
{
    limitConsoles(2);
    Peer first;
    Peer second;
    Peer third;
    identify(first, "a");
    identify(second, "b");
    connect(third);
    EXPECT_EQ(statusOf(third, versionRequest("a")), kAlreadyConnected);
    EXPECT_FALSE(third.link.finished);
}

TEST_F(HypervisorTest, ADisconnectedConsoleFreesItsIdentityAndPlace)
{
    limitConsoles(2);
    Peer first;
    Peer second;
    Peer third;
    identify(first, "a");
    identify(second, "b");
    hypervisor->disconnect(first.id);
    identify(third, "a");
}

// Unknown and malformed messages.

TEST_F(HypervisorTest, AnUnknownFunctionIsInvalid)
{
    Peer peer;
    identify(peer, "a");
    for (const unsigned short function :
         std::vector<unsigned short>{0x0000, 0x6001, 0x6004, 0x7000, 0x8000, 0x800A, 0xFFFF}) {
        SCOPED_TRACE(function);
        EXPECT_EQ(statusOf(peer, request(function, 0x0101)), kInvalidFunction);
    }
}

TEST_F(HypervisorTest, AnUnknownOperationIsInvalid)
{
    Peer peer;
    identify(peer, "a");
    const std::vector<std::pair<unsigned short, unsigned short>> unknown{
        {0x6003, 0x0000}, {0x6003, 0x0100}, {0x6003, 0x010C}, {0x6003, 0x0402}, // of another function
        {0x6002, 0x0401}, {0x6002, 0x0405},                                     // a notice, not a request
        {0x6002, 0x0407}, {0x6002, 0x0101},
    };
    for (const auto& identity : unknown) {
        SCOPED_TRACE(::testing::Message() << std::hex << identity.first << "/" << identity.second);
        EXPECT_EQ(statusOf(peer, request(identity.first, identity.second)), kInvalidOperation);
    }
}

TEST_F(HypervisorTest, ARequestThatDoesNotParseIsInvalidData)
{
    Peer peer;
    openSession(peer, "a");
    for (const NamedRequest& entry : unparsableRequests()) {
        SCOPED_TRACE(entry.name);
        EXPECT_EQ(statusOf(peer, entry.message), kInvalidData);
    }
}

TEST_F(HypervisorTest, TheSequenceIsCheckedBeforeTheData)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(statusOf(peer, request(0x6002, 0x0402, "abc")), kInvalidCmdSequence);
}

TEST_F(HypervisorTest, ARefusalCarriesNoPayload)
{
    Peer peer;
    connect(peer);
    const auto response = ask(peer, QelMessageGetInterfaceLimitsReq());
    EXPECT_EQ(response->dataLength(), 0U);
    EXPECT_EQ(response->getFlags(), MsgResponse);
}

TEST_F(HypervisorTest, ARequestWithAnOldHeaderIsAnswered)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, RawFrame::oldForm().callerId(0xABCD).function(0x6003).operation(0x0107).flags(0x80).bytes());
    const auto response = peer.link.take();
    EXPECT_EQ(response->getCallerId(), 0xABCDU);
    EXPECT_EQ(response->getStatus(), 0U);
    EXPECT_EQ(response->dataLength(), 8U);
}

TEST_F(HypervisorTest, ARequestWithPaddingIsAnswered)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, RawFrame::newForm().callerId(5).function(0x6003).operation(0x0105).flags(0x80).pad(8).bytes());
    EXPECT_EQ(peer.link.take()->getStatus(), 0U);
}

TEST_F(HypervisorTest, MeaninglessFlagsAreIgnored)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, RawFrame::newForm().callerId(5).function(0x6003).operation(0x0107).flags(0xBF).bytes());
    EXPECT_EQ(peer.link.take()->getStatus(), 0U);
}

TEST_F(HypervisorTest, ResponsesAndMessagesWithBothFlagsAreIgnoredWithAWarning)
{
    Peer peer;
    identify(peer, "a");
    for (const unsigned int flags : {0x40U, 0xC0U}) {
        SCOPED_TRACE(flags);
        log.clear();
        receive(peer, RawFrame::newForm().callerId(5).function(0x6003).operation(0x0107).flags(flags).bytes());
        EXPECT_EQ(peer.link.posted(), 0U);
        EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored [CID: 0x00000005, FN: 0x6003")));
    }
}

TEST_F(HypervisorTest, UnknownNoticesAreIgnoredWithAWarning)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, RawFrame::newForm().function(0x7000).operation(0x1234).bytes());
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored [CID: 0x00000000, FN: 0x7000")));
}

TEST_F(HypervisorTest, NoticesForConsolesAreIgnoredWithAWarning)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored")));
}

TEST_F(HypervisorTest, MessagesOfAnUnknownConnectionAreIgnored)
{
    const Received received = hypervisor->receive(99, QelMessageGetQelTodReq());
    EXPECT_EQ(received.state, ConsoleState::Closing);
    EXPECT_TRUE(received.mayReadNext);
    EXPECT_TRUE(hypervisor->mayReceive(99));
    hypervisor->disconnect(99);
}

// The hypervisor session.

TEST_F(HypervisorTest, ASecondOpenOfTheSessionIsRefused)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, QelMessageInterfaceCmpOpenKrogSessionReq());
    EXPECT_EQ(peer.link.take<QelMessageInterfaceCmpOpenKrogSessionRsp>()->getStatus(), 0U);
    EXPECT_EQ(statusOf(peer, QelMessageInterfaceCmpOpenKrogSessionReq()), kSessionAlreadyOpen);
}

TEST_F(HypervisorTest, EachConsoleHasASessionOfItsOwn)
{
    Peer first;
    Peer second;
    openSession(first, "a");
    openSession(second, "b");
}

TEST_F(HypervisorTest, ClosingASessionThatIsNotOpenIsOutOfSequence)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(statusOf(peer, QelMessageInterfaceCmpCloseKrogSessionReq()), kInvalidCmdSequence);
}

TEST_F(HypervisorTest, ASessionCanBeOpenedAgainAfterClosing)
{
    Peer peer;
    openSession(peer, "a");
    receive(peer, QelMessageInterfaceCmpCloseKrogSessionReq());
    EXPECT_EQ(peer.link.take<QelMessageInterfaceCmpCloseKrogSessionRsp>()->getStatus(), 0U);
    EXPECT_EQ(statusOf(peer, QelMessageInterfaceCmpOpenKrogSessionReq()), 0U);
}

TEST_F(HypervisorTest, VirtualSerialRequestsNeedTheSession)
{
    Peer peer;
    identify(peer, "a");
    const auto expectAllRefused = [&] {
        EXPECT_EQ(statusOf(peer, QelMessageVirtualSerialOpenReq(1, 0, false)), kInvalidCmdSequence);
        EXPECT_EQ(statusOf(peer, QelMessageVirtualSerialCloseReq(1, 0, false)), kInvalidCmdSequence);
        EXPECT_EQ(statusOf(peer, QelMessageVirtualSerialGetMaxSessionsReq()), kInvalidCmdSequence);
        EXPECT_EQ(statusOf(peer, QelMessageVirtualSerialSetupSessionReq(1, 0)), kInvalidCmdSequence);
    };
    expectAllRefused();
    EXPECT_EQ(statusOf(peer, QelMessageInterfaceCmpOpenKrogSessionReq()), 0U);
    EXPECT_EQ(statusOf(peer, QelMessageVirtualSerialGetMaxSessionsReq()), 0U);
    EXPECT_EQ(statusOf(peer, QelMessageInterfaceCmpCloseKrogSessionReq()), 0U);
    expectAllRefused();
}

// Holding back.

TEST_F(HypervisorTest, AConsoleWithoutRoomIsNotReadFrom)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
    peer.link.room = false;
    EXPECT_FALSE(hypervisor->mayReceive(peer.id));
}

TEST_F(HypervisorTest, TheReaderIsToldWithEachMessageWhetherToReadTheNext)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_TRUE(hypervisor->receive(peer.id, QelMessageGetInterfaceLimitsReq()).mayReadNext);
    peer.link.room = false;
    EXPECT_FALSE(hypervisor->receive(peer.id, QelMessageGetInterfaceLimitsReq()).mayReadNext);
    hypervisor->shutDown();
    EXPECT_FALSE(hypervisor->receive(peer.id, QelMessageGetInterfaceLimitsReq()).mayReadNext);
}

TEST_F(HypervisorTest, ConnectionsAreNumberedInTheOrderOfConnecting)
{
    FakeConsole first;
    FakeConsole second;
    protocol::Peer from;
    from.id = 17; // the numbers are the hypervisor's
    EXPECT_EQ(hypervisor->connect(first, from), 1U);
    EXPECT_EQ(hypervisor->connect(second, from), 2U);
}

// The end.

TEST_F(HypervisorTest, OnShutdownEveryConsoleGetsANoticeAndIsClosed)
{
    Peer introduced;
    Peer silent;
    identify(introduced, "a");
    connect(silent);
    hypervisor->shutDown();
    EXPECT_NE(introduced.link.take<QelMessageKrogConnectionClosedAsync>(), nullptr);
    EXPECT_EQ(introduced.link.posted(), 0U);
    EXPECT_TRUE(introduced.link.finished);
    EXPECT_EQ(silent.link.posted(), 0U);
    EXPECT_TRUE(silent.link.finished);
}

TEST_F(HypervisorTest, OnShutdownSerialSessionsAreClosedBeforeTheConnection)
{
    Peer peer;
    openSession(peer, "a");
    openSerial(peer, 1);
    openSerial(peer, 2);
    hypervisor->shutDown();
    for (const std::uint16_t partition : std::vector<std::uint16_t>{1, 2}) {
        const auto notice = peer.link.take<QelMessageVirtualSerialSessionClosedAsync>();
        EXPECT_EQ(notice->getLpId(), partition);
        EXPECT_EQ(notice->getVssConnectionNumber(), 0U);
        EXPECT_EQ(notice->getCloseReason(), 3U);
    }
    EXPECT_NE(peer.link.take<QelMessageKrogConnectionClosedAsync>(), nullptr);
    EXPECT_TRUE(peer.link.finished);
    EXPECT_EQ(port1->stopped, 1U);
    EXPECT_EQ(port2->stopped, 1U);
}

TEST_F(HypervisorTest, ConnectionsAfterShutdownAreClosed)
{
    hypervisor->shutDown();
    Peer late;
    connect(late);
    EXPECT_TRUE(late.link.finished);
    EXPECT_EQ(receive(late, versionRequest("a")), ConsoleState::Closing);
    EXPECT_EQ(late.link.posted(), 0U);
}

TEST_F(HypervisorTest, ASecondShutdownChangesNothing)
{
    Peer peer;
    identify(peer, "a");
    hypervisor->shutDown();
    hypervisor->shutDown();
    EXPECT_EQ(peer.link.posted(), 1U);
}

// Messages of the steps before TLS.

TEST_F(HypervisorTest, TakesConsolesUpToTheMaximum)
{
    limitConsoles(2);
    Peer first;
    Peer second;
    Peer unknown;
    EXPECT_TRUE(hypervisor->takesConsoles());
    identify(first, "first");
    connect(unknown);
    EXPECT_TRUE(hypervisor->takesConsoles());
    identify(second, "second");
    EXPECT_FALSE(hypervisor->takesConsoles());
    hypervisor->disconnect(first.id);
    EXPECT_TRUE(hypervisor->takesConsoles());
}

TEST_F(HypervisorTest, TakesNoConsolesAfterShutdown)
{
    hypervisor->shutDown();
    EXPECT_FALSE(hypervisor->takesConsoles());
}

TEST_F(HypervisorTest, ATlsRequestToAPlainServerIsAnsweredWithAbortAndClosed)
{
    Peer peer;
    connect(peer);
    EXPECT_EQ(receive(peer, QelMessageUpgradeConnectionAsync()), ConsoleState::Closing);
    const auto answer = peer.link.take();
    EXPECT_EQ(answer->getFunction(), QelMessageFunctionQel);
    EXPECT_EQ(answer->getOperation(), QelMessageOpAbortHandshake);
    EXPECT_EQ(answer->getClassification(), QelMessageClassification::Async);
    EXPECT_TRUE(peer.link.finished);
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] console 1: closed, it asked for TLS, which is not done here"));
}

TEST_F(HypervisorTest, IgnoresTheAbortMessage)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(receive(peer, QelMessageAbortHandshakeAsync()), ConsoleState::Identified);
    EXPECT_EQ(peer.link.posted(), 0U);
}

} // namespace

} // namespace qel::test
