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

const char* const kTooShort = "dataLength smaller than minimum acceptable size";

std::string zeros(std::size_t count) { return std::string(2 * count, '0'); }

auto refused(const char* phrase) { return ThrowsMessage<QelMessageValidationException>(StrEq(phrase)); }

using BroadcastReq = QelMessageDaxBroadcastReq;

const char* const kNoToolId = "Unicast message has no valid toolID";
const char* const kToolIdTooLong = "toolIdLen greater than maximum acceptable size";

struct BroadcastFields {
    unsigned int offset = 46;
    unsigned int type = 0;
    unsigned int messageLength = 5;
    unsigned int toolIdLength = 4;
    std::size_t payloadLength = 51;
};

Payload broadcastPayload(const BroadcastFields& fields)
{
    return Payload()
        .u16(fields.offset)
        .u8(fields.type)
        .u8(0)
        .u16(fields.messageLength)
        .u16(0)
        .u32(0x05060708)
        .u16(fields.toolIdLength)
        .text("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdef")
        .text("0123456789")
        .resize(fields.payloadLength);
}

std::string broadcastVerdict(const BroadcastFields& fields) { return verdict<BroadcastReq>(broadcastPayload(fields)); }

BroadcastFields with(unsigned int BroadcastFields::*field, unsigned int value, BroadcastFields fields = {})
{
    fields.*field = value;
    return fields;
}

TEST(BroadcastReq, IsBuiltWithTheMessageAtItsEnd)
{
    const CallerIdScope ids(6);
    const char message[] = {'h', '\0', '\xFF'};
    EXPECT_EQ(frameOf(BroadcastReq(1, 3, 0x05060708, "tool", message)), "DECAFF20"
                                                                        "00000051" // 81
                                                                        "00000007"
                                                                        "6003"
                                                                        "80"
                                                                        "00"
                                                                        "00000031" // 49
                                                                        "0106"
                                                                        "0000"
                                                                        "0000"
                                                                        "0000"
                                                                        "00000000"
                                                                        "002E"     // offset: 46
                                                                        "01"       // type
                                                                        "00"       // reserved
                                                                        "0003"     // message length
                                                                        "0000"     // reserved
                                                                        "05060708" // tool type
                                                                        "0004"     // tool id length
                                                                        "746F6F6C" +
                                                                            zeros(28) + "6800FF");
}

TEST(BroadcastReq, IsBuiltWithoutAMessage)
{
    const BroadcastReq message(2, 0, 0, "", "ignored");
    EXPECT_EQ(payloadOf(message), "002E02" + zeros(43));
    EXPECT_EQ(message.getBroadcastMsgLen(), 0);
    EXPECT_EQ(message.getDaxPacket(), message.getData() + 46);
}

TEST(BroadcastReq, UnicastIsNotBuiltWithoutAToolId)
{
    EXPECT_THAT([] { BroadcastReq(1, 0, 0, "", nullptr); }, refused(kNoToolId));
    EXPECT_NO_THROW(BroadcastReq(1, 0, 0, "x", nullptr));
    for (const unsigned int type : {0U, 2U, 3U, 0xFFU}) {
        SCOPED_TRACE(type);
        EXPECT_NO_THROW(BroadcastReq(static_cast<std::uint8_t>(type), 0, 0, "", nullptr));
    }
    EXPECT_EQ(BroadcastReq::kUnicast, 1);
}

TEST(BroadcastReq, IsNotBuiltWithAToolIdOf33Bytes)
{
    EXPECT_EQ(BroadcastReq(0, 0, 0, std::string(32, 'x'), nullptr).getToolId(), std::string(32, 'x'));
    EXPECT_THAT([] { BroadcastReq(0, 0, 0, std::string(33, 'x'), nullptr); }, refused(kToolIdTooLong));
    EXPECT_THAT([] { BroadcastReq(1, 0, 0, std::string(33, 'x'), nullptr); }, refused(kToolIdTooLong));
    // The whole length is checked, not its value modulo 65536.
    EXPECT_THAT([] { BroadcastReq(0, 0, 0, std::string(65536, 'x'), nullptr); }, refused(kToolIdTooLong));
    EXPECT_THAT([] { BroadcastReq(1, 0, 0, std::string(65541, 'x'), nullptr); }, refused(kToolIdTooLong));
}

TEST(BroadcastReq, ChecksTheToolIdBeforeTheMessagePointer)
{
    EXPECT_THAT([] { BroadcastReq(1, 1, 0, "", nullptr); }, refused(kNoToolId));
    EXPECT_THAT([] { BroadcastReq(0, 1, 0, std::string(33, 'x'), nullptr); }, refused(kToolIdTooLong));
    EXPECT_THAT([] { BroadcastReq(0, 1, 0, "", nullptr); }, ThrowsMessage<std::invalid_argument>(StrEq("data")));
}

TEST(BroadcastReq, NeedsItsFixedPart)
{
    BroadcastFields fields;
    fields.messageLength = 0;
    fields.payloadLength = 45;
    EXPECT_EQ(broadcastVerdict(fields), kTooShort);
    fields.payloadLength = 46;
    EXPECT_EQ(broadcastVerdict(fields), "accepted");
}

TEST(BroadcastReq, NeedsAnOffsetPastItsFixedPart)
{
    const char* const text = "message offset less than minimum acceptable size";
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 0)), text);
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 45)), text);
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 46)), "accepted");
}

TEST(BroadcastReq, NeedsTheWholeMessage)
{
    const char* const text = "message greater than maximum acceptable size";
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 47)), text);
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::messageLength, 6)), text);
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::messageLength, 5)), "accepted");
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::messageLength, 4)), "accepted");
    // In 16 bits both sums would wrap: FFFF + FFFF, and FFFF + 0031 to the payload length.
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 0xFFFF, with(&BroadcastFields::messageLength, 0xFFFF))),
              text);
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 0xFFFF, with(&BroadcastFields::messageLength, 0x31))),
              text);
    // The offset of an empty message must not be past the end either.
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 51, with(&BroadcastFields::messageLength, 0))),
              "accepted");
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 52, with(&BroadcastFields::messageLength, 0))), text);
}

TEST(BroadcastReq, UnicastNeedsAToolId)
{
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::type, 1, with(&BroadcastFields::toolIdLength, 0))), kNoToolId);
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::type, 1, with(&BroadcastFields::toolIdLength, 1))), "accepted");
    for (const unsigned int type : {0U, 2U, 0xFFU}) {
        SCOPED_TRACE(type);
        EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::type, type, with(&BroadcastFields::toolIdLength, 0))),
                  "accepted");
    }
}

TEST(BroadcastReq, ToolIdHasAtMost32Bytes)
{
    for (const unsigned int type : {0U, 1U}) {
        SCOPED_TRACE(type);
        const BroadcastFields fields = with(&BroadcastFields::type, type);
        EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::toolIdLength, 32, fields)), "accepted");
        EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::toolIdLength, 33, fields)), kToolIdTooLong);
        EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::toolIdLength, 0xFFFF, fields)), kToolIdTooLong);
    }
}

TEST(BroadcastReq, ChecksInAFixedOrder)
{
    BroadcastFields fields; // every check fails; the fields are corrected one by one
    fields.payloadLength = 45;
    fields.offset = 45;
    fields.messageLength = 0xFFFF;
    fields.type = 1;
    fields.toolIdLength = 0;
    EXPECT_EQ(broadcastVerdict(fields), kTooShort);
    fields.payloadLength = 50;
    EXPECT_EQ(broadcastVerdict(fields), "message offset less than minimum acceptable size");
    fields.offset = 46;
    EXPECT_EQ(broadcastVerdict(fields), "message greater than maximum acceptable size");
    fields.messageLength = 4;
    EXPECT_EQ(broadcastVerdict(fields), kNoToolId);
    // The two checks of the id exclude each other; the end of the message is checked before both.
    fields.toolIdLength = 33;
    EXPECT_EQ(broadcastVerdict(fields), kToolIdTooLong);
    fields.messageLength = 5;
    EXPECT_EQ(broadcastVerdict(fields), "message greater than maximum acceptable size");
}

TEST(BroadcastReq, SkipsBytesBetweenTheFixedPartAndTheMessage)
{
    BroadcastFields fields;
    fields.offset = 48;
    fields.messageLength = 4;
    fields.payloadLength = 52;
    const auto message = received<BroadcastReq>(broadcastPayload(fields));
    EXPECT_EQ(message.getDaxPacket(), message.getData() + 48);
    EXPECT_EQ(std::string(message.getDaxPacket(), message.getBroadcastMsgLen()), "2345");
}

TEST(BroadcastReq, AcceptsAnEmptyPacketAtTheEnd)
{
    BroadcastFields fields;
    fields.messageLength = 0;
    fields.payloadLength = 46;
    const auto message = received<BroadcastReq>(broadcastPayload(fields));
    EXPECT_EQ(message.getDaxPacket(), message.getData() + message.dataLength());
}

TEST(BroadcastReq, ReadsItsFieldsFromEitherForm)
{
    BroadcastFields fields;
    fields.type = 9;
    const Payload payload = broadcastPayload(fields).at(3, bytes({0xEE})).at(6, bytes({0xEE, 0xEE}));
    for (const auto& frame : {newFrame<BroadcastReq>(payload), oldFrame<BroadcastReq>(payload)}) {
        const auto message = received<BroadcastReq>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getBroadcastMode(), 9);
        EXPECT_EQ(message.getToolType(), 0x05060708U);
        EXPECT_EQ(message.getBroadcastMsgLen(), 5);
        EXPECT_EQ(message.getToolId(), "ABCD");
        EXPECT_EQ(std::string(message.getDaxPacket(), 5), "01234");
        EXPECT_EQ(detailsOf(message), " mOffset               0x002E\n"
                                      " mBroadcastType        0x09\n"
                                      " mBroadcastMsgLen:     0x0005\n"
                                      " mToolType:            0x05060708\n"
                                      " mToolId:              ABCD\n");
    }
}

TEST(BroadcastReq, PrintsTheReceivedOffset)
{
    BroadcastFields fields;
    fields.offset = 48;
    fields.messageLength = 0;
    fields.toolIdLength = 0;
    EXPECT_EQ(detailsOf(received<BroadcastReq>(broadcastPayload(fields))), " mOffset               0x0030\n"
                                                                           " mBroadcastType        0x00\n"
                                                                           " mBroadcastMsgLen:     0x0000\n"
                                                                           " mToolType:            0x05060708\n"
                                                                           " mToolId:              \n");
}

} // namespace
} // namespace qel
