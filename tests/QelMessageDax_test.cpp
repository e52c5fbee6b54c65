#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/CatalogFrames.hpp"
#include "support/MessageProbe.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <string>

namespace qel {
namespace {

using test::bytes;
using test::CallerIdScope;
using test::detailsOf;
using test::frameOf;
using test::newFrame;
using test::oldFrame;
using test::Payload;
using test::payloadOf;
using test::received;
using test::verdict;
using testing::StrEq;
using testing::ThrowsMessage;

using Outbound = QelMessageDaxBroadcastOutboundAsync;
using BroadcastReq = QelMessageDaxBroadcastReq;

const char* const kTooShort = "dataLength smaller than minimum acceptable size";
const char* const kBadOffset = "message offset less than minimum acceptable size";
const char* const kMessageTooLong = "message greater than maximum acceptable size";
const char* const kToolIdTooLong = "toolIdLen greater than maximum acceptable size";

std::string zeros(std::size_t count) { return std::string(2 * count, '0'); }

auto refused(const char* phrase) { return ThrowsMessage<QelMessageValidationException>(StrEq(phrase)); }

struct OutboundFields {
    unsigned int offset = 42;
    unsigned int messageLength = 5;
    unsigned int toolIdLength = 4;
    std::size_t payloadLength = 47;
};

Payload outboundPayload(const OutboundFields& fields)
{
    return Payload()
        .u16(fields.offset)
        .u16(fields.messageLength)
        .u32(0x05060708)
        .u16(fields.toolIdLength)
        .text("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdef")
        .text("0123456789")
        .resize(fields.payloadLength);
}

std::string outboundVerdict(const OutboundFields& fields) { return verdict<Outbound>(outboundPayload(fields)); }

OutboundFields with(unsigned int OutboundFields::*field, unsigned int value, OutboundFields fields = {})
{
    fields.*field = value;
    return fields;
}

// --- built -----------------------------------------------------------------------------------------------------------

TEST(Outbound, IsBuiltWithTheMessageAtItsEnd)
{
    const CallerIdScope ids(6);
    const char message[] = {'h', '\0', '\xFF'};
    EXPECT_EQ(frameOf(Outbound(3, 0x05060708, "tool", message)), "DECAFF20"
                                                                 "0000004D" // 77
                                                                 "00000007"
                                                                 "7000"
                                                                 "00" // flags: asynchronous
                                                                 "00"
                                                                 "0000002D" // 45
                                                                 "0B0B"
                                                                 "0000"
                                                                 "0000"
                                                                 "0000"
                                                                 "00000000"
                                                                 "002A"     // offset: 42
                                                                 "0003"     // message length
                                                                 "05060708" // sender's tool type
                                                                 "0004"     // sender's tool id length
                                                                 "746F6F6C" +
                                                                     zeros(28) + "6800FF");
}

TEST(Outbound, IsBuiltWithoutToolIdAndMessage)
{
    const Outbound message(0, 1, "", nullptr);
    EXPECT_EQ(payloadOf(message), "002A"
                                  "0000"
                                  "00000001"
                                  "0000" +
                                      zeros(32));
    EXPECT_EQ(message.getSenderToolId(), "");
    EXPECT_EQ(message.getDaxPacket(), message.getData() + 42);
}

TEST(Outbound, IsNotBuiltWithAToolIdOf33Bytes)
{
    EXPECT_EQ(Outbound(0, 0, std::string(32, 'x'), nullptr).getSenderToolId(), std::string(32, 'x'));
    EXPECT_THAT([] { Outbound(0, 0, std::string(33, 'x'), nullptr); }, refused(kToolIdTooLong));
    EXPECT_THAT([] { Outbound(0, 0, std::string(65535, 'x'), nullptr); }, refused(kToolIdTooLong));
}

TEST(Outbound, UsesTheLengthOfTheToolIdModulo65536)
{
    EXPECT_EQ(payloadOf(Outbound(2, 1, std::string(65536, 'x'), "hi")), payloadOf(Outbound(2, 1, "", "hi")));
    EXPECT_EQ(payloadOf(Outbound(2, 1, "abcdefghijk" + std::string(65530, 'x'), "hi")),
              payloadOf(Outbound(2, 1, "abcde", "hi")));
    EXPECT_EQ(Outbound(0, 1, std::string(65568, 'x'), nullptr).getSenderToolId(), std::string(32, 'x'));
    EXPECT_THAT([] { Outbound(0, 1, std::string(65569, 'x'), nullptr); }, refused(kToolIdTooLong));
}

TEST(Outbound, ChecksTheToolIdBeforeTheMessagePointer)
{
    EXPECT_THAT([] { Outbound(1, 0, std::string(33, 'x'), nullptr); }, refused(kToolIdTooLong));
    EXPECT_THAT([] { Outbound(1, 0, "", nullptr); }, ThrowsMessage<std::invalid_argument>(StrEq("data")));
}

// --- passed on -------------------------------------------------------------------------------------------------------

TEST(Outbound, RelaysTheMessageWithTheSendersIdentity)
{
    const BroadcastReq request(1, 5, 0x11111111, "addressee", "hello");
    const CallerIdScope ids(6);
    const Outbound message(request, "sender", 0x22222222);
    EXPECT_EQ(payloadOf(message), "002A"
                                  "0005"
                                  "22222222"
                                  "0006"
                                  "73656E646572" +
                                      zeros(26) + "68656C6C6F");
    EXPECT_EQ(message.getCallerId(), 7U);
    EXPECT_EQ(message.getSenderToolType(), 0x22222222U);
    EXPECT_EQ(message.getSenderToolId(), "sender");
    EXPECT_EQ(std::string(message.getDaxPacket(), message.getBroadcastMsgLen()), "hello");
}

TEST(Outbound, RelaysTheMessageFromTheOffsetOfTheRequest)
{
    const Payload payload =
        Payload().u16(48).u8(0).u8(0).u16(4).u16(0).u32(1).u16(0).zeros(32).text("??data").text("tail");
    for (const auto& frame : {newFrame<BroadcastReq>(payload), oldFrame<BroadcastReq>(payload)}) {
        const Outbound message(received<BroadcastReq>(frame), "s", 2);
        EXPECT_EQ(payloadOf(message), "002A"
                                      "0004"
                                      "00000002"
                                      "0001"
                                      "73" +
                                          zeros(31) + "64617461");
        EXPECT_EQ(message.getDaxPacket(), message.getData() + 42);
    }
}

TEST(Outbound, RelaysAnEmptyMessage)
{
    const BroadcastReq request(0, 0, 1, "addressee", nullptr);
    EXPECT_EQ(payloadOf(Outbound(request, "s", 2)), payloadOf(Outbound(0, 2, "s", nullptr)));
}

TEST(Outbound, IsNotRelayedWithAToolIdOf33Bytes)
{
    const BroadcastReq request(0, 2, 1, "", "hi");
    EXPECT_THAT([&] { Outbound(request, std::string(33, 'x'), 2); }, refused(kToolIdTooLong));
    EXPECT_EQ(Outbound(request, std::string(32, 'x'), 2).getSenderToolId(), std::string(32, 'x'));
}

// --- received --------------------------------------------------------------------------------------------------------

TEST(Outbound, NeedsItsFixedPart)
{
    OutboundFields fields;
    fields.messageLength = 0;
    fields.payloadLength = 41;
    EXPECT_EQ(outboundVerdict(fields), kTooShort);
    fields.payloadLength = 42;
    EXPECT_EQ(outboundVerdict(fields), "accepted");
}

TEST(Outbound, NeedsAnOffsetPastItsFixedPart)
{
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 0)), kBadOffset);
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 41)), kBadOffset);
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 42)), "accepted");
}

TEST(Outbound, NeedsTheWholeMessage)
{
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 43)), kMessageTooLong);
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::messageLength, 6)), kMessageTooLong);
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::messageLength, 5)), "accepted");
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::messageLength, 4)), "accepted");
    // In 16 bits both sums would wrap: FFFF + FFFF, and FFFF + 002D to less than the payload length.
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 0xFFFF, with(&OutboundFields::messageLength, 0xFFFF))),
              kMessageTooLong);
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 0xFFFF, with(&OutboundFields::messageLength, 0x2D))),
              kMessageTooLong);
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 47, with(&OutboundFields::messageLength, 0))), "accepted");
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::offset, 48, with(&OutboundFields::messageLength, 0))),
              kMessageTooLong);
}

TEST(Outbound, ToolIdHasAtMost32Bytes)
{
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::toolIdLength, 0)), "accepted");
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::toolIdLength, 32)), "accepted");
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::toolIdLength, 33)), kToolIdTooLong);
    EXPECT_EQ(outboundVerdict(with(&OutboundFields::toolIdLength, 0xFFFF)), kToolIdTooLong);
}

TEST(Outbound, ChecksInAFixedOrder)
{
    OutboundFields fields; // every check fails; the fields are corrected one by one
    fields.payloadLength = 41;
    fields.offset = 41;
    fields.messageLength = 0xFFFF;
    fields.toolIdLength = 33;
    EXPECT_EQ(outboundVerdict(fields), kTooShort);
    fields.payloadLength = 46;
    EXPECT_EQ(outboundVerdict(fields), kBadOffset);
    fields.offset = 42;
    EXPECT_EQ(outboundVerdict(fields), kMessageTooLong);
    fields.messageLength = 4;
    EXPECT_EQ(outboundVerdict(fields), kToolIdTooLong);
    fields.toolIdLength = 32;
    EXPECT_EQ(outboundVerdict(fields), "accepted");
}

TEST(Outbound, SkipsBytesBetweenTheFixedPartAndTheMessage)
{
    OutboundFields fields;
    fields.offset = 44;
    fields.messageLength = 3;
    const auto message = received<Outbound>(outboundPayload(fields));
    EXPECT_EQ(message.getDaxPacket(), message.getData() + 44);
    EXPECT_EQ(std::string(message.getDaxPacket(), message.getBroadcastMsgLen()), "234");
}

TEST(Outbound, AcceptsAnEmptyPacketAtTheEnd)
{
    OutboundFields fields;
    fields.messageLength = 0;
    fields.payloadLength = 42;
    const auto message = received<Outbound>(outboundPayload(fields));
    EXPECT_EQ(message.getDaxPacket(), message.getData() + message.dataLength());
}

TEST(Outbound, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = outboundPayload(OutboundFields());
    for (const auto& frame : {newFrame<Outbound>(payload), oldFrame<Outbound>(payload)}) {
        const auto message = received<Outbound>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getBroadcastMsgLen(), 5);
        EXPECT_EQ(message.getSenderToolType(), 0x05060708U);
        EXPECT_EQ(message.getSenderToolId(), "ABCD");
        EXPECT_EQ(std::string(message.getDaxPacket(), 5), "01234");
        EXPECT_EQ(detailsOf(message), " mOffset               0x002A\n"
                                      " mBroadcastMsgLen:     0x0005\n"
                                      " mSenderToolType:      0x05060708\n"
                                      " mSenderToolId:        ABCD\n");
    }
}

TEST(Outbound, PrintsTheReceivedOffset)
{
    OutboundFields fields;
    fields.offset = 44;
    fields.messageLength = 3;
    fields.toolIdLength = 0;
    EXPECT_EQ(detailsOf(received<Outbound>(outboundPayload(fields))), " mOffset               0x002C\n"
                                                                      " mBroadcastMsgLen:     0x0003\n"
                                                                      " mSenderToolType:      0x05060708\n"
                                                                      " mSenderToolId:        \n");
}

TEST(Outbound, PrintsTheRawBytesInUpperCase)
{
    const test::OddBytes frame(
        newFrame<Outbound>(Payload().u16(42).u16(1).u32(0xABCDEF01).u16(1).text("z", 32).u8(0xFE))
            .callerId(0xAA)
            .status(0x8006)
            .statusDetail(0xBEEF)
            .bytes());
    EXPECT_EQ(test::dumpOf(Outbound(frame.data(), frame.length())),
              "\n"
              "EyeCatcher:     0xDECAFF20\n"
              "MsgLength:      0x0000004B\n"
              "CallerId:       0x000000AA\n"
              "Function:       0x7000 (QelMessageFunctionDax)\n"
              "Operation:      0x0B0B (QelMessageOpOutboundBroadcastAsync)\n"
              "Flags:          0x00 (no flags set)\n"
              "PadByteLen:     0x00\n"
              "DataLength:     0x0000002B\n"
              "Status:         0x00008006 (QelMessageStatusHypervisorGenericError)\n"
              "StatusDetail:   0xBEEF\n"
              "\n"
              "Additional message details:\n"
              " mOffset               0x002A\n"
              " mBroadcastMsgLen:     0x0001\n"
              " mSenderToolType:      0xABCDEF01\n"
              " mSenderToolId:        z\n"
              "\n"
              "\n"
              "Current raw message contents:\n"
              " DECA FF20 0000 004B 0000 00AA 7000 0000\n"
              " 0000 002B 0B0B 8006 BEEF 0000 0000 0000\n"
              " 002A 0001 ABCD EF01 0001 7A00 0000 0000\n"
              " 0000 0000 0000 0000 0000 0000 0000 0000\n"
              " 0000 0000 0000 0000 0000 FE\n"
              "\n");
}

// --- connection closed -----------------------------------------------------------------------------------------------

TEST(KrogConnectionClosed, IsBuiltWithoutPayload)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageKrogConnectionClosedAsync()), "DECAFF20"
                                                              "00000020"
                                                              "00000007"
                                                              "7000"
                                                              "00"
                                                              "00"
                                                              "00000000"
                                                              "A009"
                                                              "0000"
                                                              "0000"
                                                              "0000"
                                                              "00000000");
}

} // namespace
} // namespace qel
