#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>

#include "serve/Hypervisor.hpp"
#include "support/RawFrame.hpp"
#include "support/SettableClock.hpp"
#include "tools/serve/HypervisorFixture.hpp"

#include <chrono>
#include <functional>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using tool::ConsoleState;
using tool::HypervisorSettings;

using HypervisorTest = HypervisorFixture;

constexpr unsigned int kInvalidOperation = 1;
constexpr unsigned int kInvalidData = 3;
constexpr unsigned int kInvalidCmdSequence = 4;
constexpr unsigned int kCmdFailed = 6;
constexpr unsigned int kInvalidFunction = 15;
constexpr unsigned int kTooManyConnections = 18;
constexpr unsigned int kConnectionNotAvailable = 19;
constexpr unsigned int kSessionAlreadyOpen = 23;
constexpr unsigned int kAlreadyConnected = 37;

QelMessageGeneric request(unsigned short function, unsigned short operation, const std::string& payload = {})
{
    QelMessageGeneric message(4711, function, operation, MsgResponseExpected);
    message.setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return message;
}

struct NamedRequest {
    const char* name;
    QelMessageGeneric message;
};

/// One well-formed request of each kind but the version request.
std::vector<NamedRequest> otherRequests()
{
    return {
        {"open session", QelMessageInterfaceCmpOpenKrogSessionReq()},
        {"close session", QelMessageInterfaceCmpCloseKrogSessionReq()},
        {"capabilities", QelMessageExchIntCapabilitiesReq(QelCapabilities("1"))},
        {"limits", QelMessageGetInterfaceLimitsReq()},
        {"broadcast", QelMessageDaxBroadcastReq(0, 1, 0, "", "x")},
        {"time", QelMessageGetQelTodReq()},
        {"set mode", QelMessageSetGlobalModeAttributeReq(1, "m")},
        {"get mode", QelMessageGetGlobalModeAttributeReq()},
        {"set metadata", QelMessageSetGlobalSaveAreaMetadataReq("m")},
        {"get metadata", QelMessageGetGlobalSaveAreaMetadataReq()},
        {"open serial", QelMessageVirtualSerialOpenReq(1, 0, false)},
        {"close serial", QelMessageVirtualSerialCloseReq(1, 0, false)},
        {"max sessions", QelMessageVirtualSerialGetMaxSessionsReq()},
        {"set up serial", QelMessageVirtualSerialSetupSessionReq(1, 0)},
    };
}

/// The requests that have a payload, with one that is too short.
std::vector<NamedRequest> unparsableRequests()
{
    return {
        {"capabilities", request(0x6003, 0x0104, "abc")},  {"broadcast", request(0x6003, 0x0106, "abc")},
        {"set mode", request(0x6003, 0x0108, "abc")},      {"set metadata", request(0x6003, 0x010A, "a")},
        {"open serial", request(0x6002, 0x0402, "abc")},   {"close serial", request(0x6002, 0x0403, "abc")},
        {"set up serial", request(0x6002, 0x0406, "abc")},
    };
}

// The version request.

TEST_F(HypervisorTest, TheVersionResponseCarriesTheSettings)
{
    HypervisorSettings settings;
    settings.interfaceFamily = 'Z';
    settings.majorVersion = 4;
    settings.minorVersion = 5;
    settings.machineType = "0123456789abcdef";
    settings.serialNumber = "serial";
    makeHypervisor(settings);
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

TEST_F(HypervisorTest, AnIdentityOfNothingButZerosIsTakenByNobodyAtFirst)
{
    Peer silent;
    Peer peer;
    connect(silent);
    connect(peer);
    EXPECT_EQ(statusOf(peer, versionRequest("", 0)), 0U);
}

TEST_F(HypervisorTest, AConsoleThatIsSentAwayGivesItsIdentityAndItsPlaceUpAtOnce)
{
    HypervisorSettings settings;
    settings.maxConsoles = 1;
    makeHypervisor(settings);
    Peer first;
    Peer second;
    identify(first, "a");
    EXPECT_EQ(receive(first, QelMessageUpgradeConnectionAsync()), ConsoleState::Closing);
    connect(second);
    EXPECT_EQ(statusOf(second, versionRequest("a")), 0U);
}

TEST_F(HypervisorTest, OneConsoleMoreThanAllowedIsTurnedAwayAndClosed)
{
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

TEST_F(HypervisorTest, WhatAConsoleSendsAfterItWasTurnedAwayIsNotLookedAt)
{
    HypervisorSettings settings;
    settings.maxConsoles = 1;
    makeHypervisor(settings);
    Peer first;
    Peer second;
    identify(first, "a");
    connect(second);
    receive(second, versionRequest("b"));
    second.link.take();
    hypervisor->disconnect(first.id); // now there would be room
    EXPECT_EQ(receive(second, versionRequest("b")), ConsoleState::Closing);
    EXPECT_EQ(receive(second, QelMessageGetInterfaceLimitsReq()), ConsoleState::Closing);
    EXPECT_EQ(second.link.posted(), 0U);
}

TEST_F(HypervisorTest, AConnectionThatHasNotIntroducedItselfTakesNoPlace)
{
    Peer silent;
    Peer first;
    Peer second;
    connect(silent);
    identify(first, "a");
    identify(second, "b");
}

TEST_F(HypervisorTest, TheSameIdentityIsNamedBeforeTheNumberOfConsoles)
{
    Peer first;
    Peer second;
    Peer third;
    identify(first, "a");
    identify(second, "b");
    connect(third);
    EXPECT_EQ(statusOf(third, versionRequest("a")), kAlreadyConnected);
    EXPECT_FALSE(third.link.finished);
}

TEST_F(HypervisorTest, ADisconnectedConsoleMakesRoomForItsIdentityAndItsPlace)
{
    Peer first;
    Peer second;
    Peer third;
    identify(first, "a");
    identify(second, "b");
    hypervisor->disconnect(first.id);
    identify(third, "a");
}

// What is not known, or not understood.

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

TEST_F(HypervisorTest, TheSequenceIsLookedAtBeforeTheData)
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

TEST_F(HypervisorTest, FlagsWithoutMeaningDoNotMatter)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, RawFrame::newForm().callerId(5).function(0x6003).operation(0x0107).flags(0xBF).bytes());
    EXPECT_EQ(peer.link.take()->getStatus(), 0U);
}

TEST_F(HypervisorTest, ResponsesAndMessagesOfNoKindAreIgnoredWithAWarning)
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

TEST_F(HypervisorTest, NoticesThatGoTheOtherWayAreIgnoredWithAWarning)
{
    Peer peer;
    identify(peer, "a");
    receive(peer, QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(peer.link.posted(), 0U);
    EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("W: [qel] console 1: ignored")));
}

TEST_F(HypervisorTest, MessagesOfAnUnknownConnectionAreIgnored)
{
    EXPECT_EQ(hypervisor->receive(99, QelMessageGetQelTodReq()), ConsoleState::Closing);
    EXPECT_TRUE(hypervisor->mayReceive(99));
    hypervisor->disconnect(99);
}

// Requests that need no session.

TEST_F(HypervisorTest, CapabilitiesAreTheIntersection)
{
    HypervisorSettings settings;
    settings.capabilities = QelCapabilities("0110");
    makeHypervisor(settings);
    Peer peer;
    identify(peer, "a");
    receive(peer, QelMessageExchIntCapabilitiesReq(QelCapabilities("1100")));
    const auto response = peer.link.take<QelMessageExchIntCapabilitiesRsp>();
    EXPECT_EQ(response->getCapabilityLen(), 4U);
    EXPECT_EQ(response->getCapabilities(), QelCapabilities("0100"));
}

TEST_F(HypervisorTest, CapabilitiesMayBeOfferedInAnyLength)
{
    HypervisorSettings settings;
    settings.capabilities = QelCapabilities(std::string(32, '1'));
    makeHypervisor(settings);
    Peer peer;
    identify(peer, "a");
    receive(peer, request(0x6003, 0x0104, std::string("\0\0\0\0", 4)));
    EXPECT_EQ(peer.link.take<QelMessageExchIntCapabilitiesRsp>()->getCapabilities(), QelCapabilities());
    receive(peer, request(0x6003, 0x0104, std::string("\0\0\0\x08\x40\0\0\0\xFF\xFF\xFF\xFF", 12)));
    EXPECT_EQ(peer.link.take<QelMessageExchIntCapabilitiesRsp>()->getCapabilities(), QelCapabilities("01"));
}

TEST_F(HypervisorTest, LimitsAreThoseOfTheProtocol)
{
    Peer peer;
    identify(peer, "a");
    const auto response = ask(peer, QelMessageGetInterfaceLimitsReq());
    EXPECT_EQ(std::string(response->getData(), response->dataLength()),
              std::string("\x40\0\x10\0\x3F\xB2\0\0\x02\0\0\0\0\0\0\0", 16));
}

TEST_F(HypervisorTest, LimitsSayHowManyConsolesAreReallyServed)
{
    HypervisorSettings settings;
    settings.maxConsoles = 255;
    makeHypervisor(settings);
    Peer peer;
    identify(peer, "a");
    const auto response = ask(peer, QelMessageGetInterfaceLimitsReq());
    EXPECT_EQ(std::string(response->getData(), response->dataLength()),
              std::string("\x40\0\x10\0\x3F\xB2\0\0\xFF\0\0\0\0\0\0\0", 16));
}

TEST_F(HypervisorTest, TheTimeOfDayIsThatOfTheClock)
{
    SettableClock clock;
    clock.setSystem(std::chrono::system_clock::from_time_t(1709618828)); // 2024-03-05 06:07:08
    Peer peer;
    identify(peer, "a");
    const auto response = ask(peer, QelMessageGetQelTodReq());
    EXPECT_EQ(std::string(response->getData(), response->dataLength()),
              std::string("\x20\x24\x03\x05\x06\x07\x08\0", 8));
}

TEST_F(HypervisorTest, TheModeIsWhatWasSetLast)
{
    Peer setter;
    Peer getter;
    identify(setter, "a");
    identify(getter, "b");
    receive(getter, QelMessageGetGlobalModeAttributeReq());
    const auto before = getter.link.take<QelMessageGetGlobalModeAttributeRsp>();
    EXPECT_EQ(before->getMode(), 0U);
    EXPECT_EQ(before->getMTMS(), "");

    EXPECT_EQ(statusOf(setter, QelMessageSetGlobalModeAttributeReq(9, "type*serial")), 0U);
    receive(getter, QelMessageGetGlobalModeAttributeReq());
    const auto after = getter.link.take<QelMessageGetGlobalModeAttributeRsp>();
    EXPECT_EQ(after->getMode(), 9U);
    EXPECT_EQ(after->getMTMS(), "type*serial");
}

TEST_F(HypervisorTest, SettingTheModeIsAnsweredWithABareResponse)
{
    Peer peer;
    identify(peer, "a");
    const auto response = ask(peer, QelMessageSetGlobalModeAttributeReq(9, "m"));
    EXPECT_EQ(response->getStatus(), 0U);
    EXPECT_EQ(response->dataLength(), 0U);
}

TEST_F(HypervisorTest, TheMetadataAreWhatWasSetLast)
{
    const std::string metadata("a\0b\xFF", 4);
    Peer peer;
    identify(peer, "a");
    receive(peer, QelMessageGetGlobalSaveAreaMetadataReq());
    EXPECT_EQ(peer.link.take<QelMessageGetGlobalSaveAreaMetadataRsp>()->getMetadata(), "");
    receive(peer, QelMessageSetGlobalSaveAreaMetadataReq(metadata));
    EXPECT_EQ(peer.link.take<QelMessageSetGlobalSaveAreaMetadataRsp>()->getStatus(), 0U);
    receive(peer, QelMessageGetGlobalSaveAreaMetadataReq());
    EXPECT_EQ(peer.link.take<QelMessageGetGlobalSaveAreaMetadataRsp>()->getMetadata(), metadata);
}

TEST_F(HypervisorTest, TheLongestMetadataThatCanBeSetCanBeGot)
{
    const std::string metadata(16384 - 32 - 2, 'm');
    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(statusOf(peer, QelMessageSetGlobalSaveAreaMetadataReq(metadata)), 0U);
    EXPECT_EQ(ask(peer, QelMessageGetGlobalSaveAreaMetadataReq())->msgLength(), 16384U);
}

// A frame with the old header has room for eight bytes more than one with the new header, which all answers have.

/// A request with the old header, whose payload is the fixed fields and so many more bytes.
std::vector<char> oldRequest(unsigned int operation, std::vector<char> fixed, std::size_t textLength)
{
    fixed.resize(fixed.size() + textLength, 'x');
    return RawFrame::oldForm().function(0x6003).operation(operation).flags(0x80).payload(std::move(fixed)).bytes();
}

char high(std::size_t length) { return static_cast<char>(static_cast<unsigned char>(length >> 8)); }
char low(std::size_t length) { return static_cast<char>(static_cast<unsigned char>(length)); }

TEST_F(HypervisorTest, MetadataThatNoAnswerCouldCarryAreRefusedAndChangeNothing)
{
    const auto metadata = [](std::size_t length) { return oldRequest(0x010A, {high(length), low(length)}, length); };
    Peer peer;
    identify(peer, "a");
    receive(peer, metadata(16350));
    EXPECT_EQ(peer.link.take()->getStatus(), 0U);
    for (const std::size_t length : {16351U, 16358U}) {
        SCOPED_TRACE(length);
        ASSERT_LE(metadata(length).size(), 16384U);
        receive(peer, metadata(length));
        EXPECT_EQ(peer.link.take()->getStatus(), kInvalidData);
    }
    EXPECT_EQ(ask(peer, QelMessageGetGlobalSaveAreaMetadataReq())->msgLength(), 16384U);
}

TEST_F(HypervisorTest, AModeWithATextThatNoAnswerCouldCarryIsRefusedAndChangesNothing)
{
    const auto mode = [](char number, std::size_t length) {
        return oldRequest(0x0108, {number, '\0', high(length), low(length)}, length);
    };
    Peer peer;
    identify(peer, "a");
    receive(peer, mode(1, 16348));
    EXPECT_EQ(peer.link.take()->getStatus(), 0U);
    for (const std::size_t length : {16349U, 16356U}) {
        SCOPED_TRACE(length);
        ASSERT_LE(mode(2, length).size(), 16384U);
        receive(peer, mode(2, length));
        EXPECT_EQ(peer.link.take()->getStatus(), kInvalidData);
    }
    const auto answer = ask(peer, QelMessageGetGlobalModeAttributeReq());
    EXPECT_EQ(answer->msgLength(), 16384U);
    EXPECT_EQ(dynamic_cast<const QelMessageGetGlobalModeAttributeRsp&>(*answer).getMode(), 1U);
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

// Broadcasts.

TEST_F(HypervisorTest, ABroadcastGoesToTheOtherConsolesWithTheSendersIdentity)
{
    HypervisorSettings settings;
    settings.maxConsoles = 3;
    makeHypervisor(settings);
    Peer sender;
    Peer first;
    Peer second;
    Peer silent;
    identify(sender, "sender", 0x01020304);
    identify(first, "a");
    identify(second, "b");
    connect(silent);
    receive(sender, QelMessageDaxBroadcastReq(0, 5, 99, "ignored", "hel\0o"));
    EXPECT_EQ(sender.link.take<QelMessageDaxBroadcastRsp>()->getStatus(), 0U);
    EXPECT_EQ(sender.link.posted(), 0U);
    EXPECT_EQ(silent.link.posted(), 0U);
    for (Peer* other : {&first, &second}) {
        const auto notice = other->link.take<QelMessageDaxBroadcastOutboundAsync>();
        EXPECT_EQ(notice->getSenderToolType(), 0x01020304U);
        EXPECT_EQ(notice->getSenderToolId(), "sender");
        EXPECT_EQ(std::string(notice->getDaxPacket(), notice->getBroadcastMsgLen()), std::string("hel\0o", 5));
        EXPECT_EQ(other->link.posted(), 0U);
    }
}

TEST_F(HypervisorTest, EveryTypeButOneGoesToAll)
{
    Peer sender;
    Peer other;
    identify(sender, "a");
    identify(other, "b");
    for (const std::uint8_t type : std::vector<std::uint8_t>{0, 2, 255}) {
        SCOPED_TRACE(static_cast<int>(type));
        EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(type, 1, 7, "nobody", "x")), 0U);
        EXPECT_NE(other.link.take<QelMessageDaxBroadcastOutboundAsync>(), nullptr);
    }
}

TEST_F(HypervisorTest, ABroadcastWithoutOtherConsolesIsDone)
{
    Peer sender;
    identify(sender, "a");
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(0, 1, 0, "", "x")), 0U);
}

TEST_F(HypervisorTest, TypeOneGoesToTheAddressedToolAlone)
{
    HypervisorSettings settings;
    settings.maxConsoles = 3;
    makeHypervisor(settings);
    Peer sender;
    Peer addressed;
    Peer other;
    identify(sender, "a", 1);
    identify(addressed, "b", 2);
    identify(other, "b", 3);
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(1, 1, 2, "b", "x")), 0U);
    EXPECT_NE(addressed.link.take<QelMessageDaxBroadcastOutboundAsync>(), nullptr);
    EXPECT_EQ(other.link.posted(), 0U);
}

TEST_F(HypervisorTest, TypeOneToAToolThatIsNotThereIsRefused)
{
    Peer sender;
    Peer other;
    identify(sender, "a", 1);
    identify(other, "b", 2);
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(1, 1, 3, "b", "x")), kConnectionNotAvailable);
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(1, 1, 2, "c", "x")), kConnectionNotAvailable);
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(1, 1, 1, "a", "x")), kConnectionNotAvailable); // itself
    EXPECT_EQ(other.link.posted(), 0U);
}

TEST_F(HypervisorTest, AConsoleWithoutRoomMissesBroadcasts)
{
    Peer sender;
    Peer slow;
    identify(sender, "a", 1);
    identify(slow, "b", 2);
    slow.link.room = false;
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(0, 1, 0, "", "x")), 0U);
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(1, 1, 2, "b", "x")), kCmdFailed);
    EXPECT_EQ(slow.link.posted(), 0U);
    EXPECT_THAT(log.lines(), ElementsAre("W: [qel] console 2: too slow for a broadcast of console 1",
                                         "W: [qel] console 2: too slow for a broadcast of console 1"));
}

TEST_F(HypervisorTest, TheLongestBroadcastThatComesInFitsAFrameGoingOut)
{
    const std::string text(16306, 'x');
    Peer sender;
    Peer other;
    identify(sender, std::string(32, 'a'));
    identify(other, "b");
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(0, 16306, 0, "", text.data())), 0U);
    EXPECT_EQ(other.link.take()->msgLength(), 16380U);
}

TEST_F(HypervisorTest, ABroadcastLongerThanTheLimitsSayIsRefusedAndGoesToNobody)
{
    const auto broadcast = [](std::size_t length) {
        std::vector<char> fixed(46, '\0');
        fixed[1] = 46;
        fixed[4] = high(length);
        fixed[5] = low(length);
        return oldRequest(0x0106, std::move(fixed), length);
    };
    Peer sender;
    Peer other;
    identify(sender, "a");
    identify(other, "b");
    for (const std::size_t length : {16307U, 16314U}) {
        SCOPED_TRACE(length);
        ASSERT_LE(broadcast(length).size(), 16384U);
        receive(sender, broadcast(length));
        EXPECT_EQ(sender.link.take()->getStatus(), kInvalidData);
        EXPECT_EQ(other.link.posted(), 0U);
    }
    receive(sender, broadcast(16306));
    EXPECT_EQ(sender.link.take()->getStatus(), 0U);
    EXPECT_EQ(other.link.take()->msgLength(), 16380U);
}

// Reading on.

TEST_F(HypervisorTest, AConsoleWithoutRoomIsNotReadFrom)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_TRUE(hypervisor->mayReceive(peer.id));
    peer.link.room = false;
    EXPECT_FALSE(hypervisor->mayReceive(peer.id));
}

// The end.

TEST_F(HypervisorTest, OnShutdownEveryConsoleIsToldAndClosed)
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

TEST_F(HypervisorTest, ConnectionsThatComeAfterShutdownAreClosed)
{
    hypervisor->shutDown();
    Peer late;
    connect(late);
    EXPECT_TRUE(late.link.finished);
    EXPECT_EQ(receive(late, versionRequest("a")), ConsoleState::Closing);
    EXPECT_EQ(late.link.posted(), 0U);
}

TEST_F(HypervisorTest, ShuttingDownTwiceIsShuttingDownOnce)
{
    Peer peer;
    identify(peer, "a");
    hypervisor->shutDown();
    hypervisor->shutDown();
    EXPECT_EQ(peer.link.posted(), 1U);
}

// Before TLS.

TEST_F(HypervisorTest, ConsolesAreTakenUntilThereAreAsManyAsAllowed)
{
    tool::HypervisorSettings settings;
    settings.maxConsoles = 2;
    makeHypervisor(settings);
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

TEST_F(HypervisorTest, AfterShutdownNoConsolesAreTaken)
{
    hypervisor->shutDown();
    EXPECT_FALSE(hypervisor->takesConsoles());
}

TEST_F(HypervisorTest, AConsoleThatAsksForTlsWhereThereIsNoneIsTurnedAway)
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

TEST_F(HypervisorTest, TheAbortMessageMeansNothingToTheHypervisor)
{
    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(receive(peer, QelMessageAbortHandshakeAsync()), ConsoleState::Identified);
    EXPECT_EQ(peer.link.posted(), 0U);
}

} // namespace

} // namespace qel::test
