// What the hypervisor answers to the requests that need no session, and what it does with broadcasts.

#include <qel/common/QelMessageDax.hpp>

#include "protocol/hypervisor/HypervisorFixture.hpp"
#include "support/RawFrame.hpp"
#include "support/SettableClock.hpp"

#include <chrono>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::Hypervisor;
using protocol::MachineInfo;
using ::testing::ElementsAre;

using HypervisorTest = HypervisorFixture;

constexpr unsigned int kInvalidData = 3;
constexpr unsigned int kCmdFailed = 6;
constexpr unsigned int kConnectionNotAvailable = 19;

TEST_F(HypervisorTest, CapabilitiesAreTheIntersection)
{
    serve(std::make_unique<Hypervisor>(MachineInfo(), QelCapabilities("0110")));
    Peer peer;
    identify(peer, "a");
    receive(peer, QelMessageExchIntCapabilitiesReq(QelCapabilities("1100")));
    const auto response = peer.link.take<QelMessageExchIntCapabilitiesRsp>();
    EXPECT_EQ(response->getCapabilityLen(), 4U);
    EXPECT_EQ(response->getCapabilities(), QelCapabilities("0100"));
}

TEST_F(HypervisorTest, CapabilitiesMayBeOfferedInAnyLength)
{
    serve(std::make_unique<Hypervisor>(MachineInfo(), QelCapabilities(std::string(32, '1'))));
    Peer peer;
    identify(peer, "a");
    receive(peer, request(0x6003, 0x0104, std::string("\0\0\0\0", 4)));
    EXPECT_EQ(peer.link.take<QelMessageExchIntCapabilitiesRsp>()->getCapabilities(), QelCapabilities());
    receive(peer, request(0x6003, 0x0104, std::string("\0\0\0\x08\x40\0\0\0\xFF\xFF\xFF\xFF", 12)));
    EXPECT_EQ(peer.link.take<QelMessageExchIntCapabilitiesRsp>()->getCapabilities(), QelCapabilities("01"));
}

TEST_F(HypervisorTest, LimitsReportTheDefaults)
{
    Peer peer;
    identify(peer, "a");
    const auto response = ask(peer, QelMessageGetInterfaceLimitsReq());
    EXPECT_EQ(std::string(response->getData(), response->dataLength()),
              std::string("\x40\0\x10\0\x3F\xB2\0\0\x10\0\0\0\0\0\0\0", 16));
}

TEST_F(HypervisorTest, LimitsReportTheConfiguredMaximumOfConsoles)
{
    for (const std::uint8_t consoles : std::vector<std::uint8_t>{1, 2, 255}) {
        SCOPED_TRACE(static_cast<int>(consoles));
        limitConsoles(consoles);
        Peer peer;
        identify(peer, "a");
        const auto response = ask(peer, QelMessageGetInterfaceLimitsReq());
        ASSERT_EQ(response->dataLength(), 16U);
        EXPECT_EQ(std::string(response->getData(), 16),
                  std::string("\x40\0\x10\0\x3F\xB2\0\0", 8) + static_cast<char>(consoles) + std::string(7, '\0'));
    }
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

TEST_F(HypervisorTest, TheLongestMetadataAcceptedCanBeReadBack)
{
    const std::string metadata(16384 - 32 - 2, 'm');
    Peer peer;
    identify(peer, "a");
    EXPECT_EQ(statusOf(peer, QelMessageSetGlobalSaveAreaMetadataReq(metadata)), 0U);
    EXPECT_EQ(ask(peer, QelMessageGetGlobalSaveAreaMetadataReq())->msgLength(), 16384U);
}

// A frame with the old header has room for eight bytes more than one with the new header, which all responses have.

/// A request with the old header. Its payload is the fixed fields and `textLength` bytes of text.
std::vector<char> oldRequest(unsigned int operation, std::vector<char> fixed, std::size_t textLength)
{
    fixed.resize(fixed.size() + textLength, 'x');
    return RawFrame::oldForm().function(0x6003).operation(operation).flags(0x80).payload(std::move(fixed)).bytes();
}

char high(std::size_t length) { return static_cast<char>(static_cast<unsigned char>(length >> 8)); }
char low(std::size_t length) { return static_cast<char>(static_cast<unsigned char>(length)); }

TEST_F(HypervisorTest, MetadataTooLongForAResponseAreRefusedAndChangeNothing)
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

TEST_F(HypervisorTest, AModeTextTooLongForAResponseIsRefusedAndChangesNothing)
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

// Broadcasts.

TEST_F(HypervisorTest, ABroadcastGoesToTheOtherConsolesWithTheSendersIdentity)
{
    limitConsoles(3);
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

TEST_F(HypervisorTest, EveryBroadcastTypeButOneGoesToAll)
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

TEST_F(HypervisorTest, ABroadcastWithoutOtherConsolesSucceeds)
{
    Peer sender;
    identify(sender, "a");
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(0, 1, 0, "", "x")), 0U);
}

TEST_F(HypervisorTest, ABroadcastOfTypeOneGoesOnlyToTheAddressee)
{
    limitConsoles(3);
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

TEST_F(HypervisorTest, ABroadcastOfTypeOneToAnAbsentToolIsRefused)
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

TEST_F(HypervisorTest, TheLongestAcceptedBroadcastFitsAnOutgoingFrame)
{
    const std::string text(16306, 'x');
    Peer sender;
    Peer other;
    identify(sender, std::string(32, 'a'));
    identify(other, "b");
    EXPECT_EQ(statusOf(sender, QelMessageDaxBroadcastReq(0, 16306, 0, "", text.data())), 0U);
    EXPECT_EQ(other.link.take()->msgLength(), 16380U);
}

TEST_F(HypervisorTest, ABroadcastAboveTheLimitIsRefusedAndNotSent)
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

} // namespace

} // namespace qel::test
