#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/CatalogFrames.hpp"
#include "support/MessageProbe.hpp"
#include "support/TimeZoneScope.hpp"

#include <ctime>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <stdexcept>
#include <string>

namespace qel {
namespace {

using test::bytes;
using test::CallerIdScope;
using test::detailsOf;
using test::frameOf;
using test::hex;
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

// --- interface version request ---------------------------------------------------------------------------------------

using VersionReq = QelMessageGetEnclTypeAndInterfaceVersionReq;

/// A payload of `length` bytes whose id length field says `toolIdLength`.
Payload versionReqPayload(std::size_t length, unsigned int toolIdLength)
{
    return Payload()
        .u32(0x01020304)
        .u32(0x05060708)
        .u16(toolIdLength)
        .u16(0x1112)
        .u16(0x1314)
        .u16(0)
        .text("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdef")
        .resize(length);
}

TEST(VersionReq, IsBuiltAtItsFullSize)
{
    const CallerIdScope ids(6);
    const VersionReq message(0x01020304, 0x05060708, 0x1112, 0x1314, "tool-1");
    EXPECT_EQ(frameOf(message), "DECAFF20"
                                "00000050" // frame length: 80
                                "00000007" // caller id
                                "6003"     // function
                                "80"       // flags: request
                                "00"       // pad
                                "00000030" // payload length: 48
                                "0101"     // operation
                                "0000"     // status
                                "0000"
                                "0000"
                                "00000000"
                                "01020304"     // interface version
                                "05060708"     // tool type
                                "0006"         // tool id length
                                "1112"         // major version
                                "1314"         // minor version
                                "0000"         // reserved
                                "746F6F6C2D31" // tool id
                                    + zeros(26));
}

TEST(VersionReq, IsBuiltWithAnEmptyToolId)
{
    EXPECT_EQ(payloadOf(VersionReq(1, 2, 3, 4, "")), "00000001"
                                                     "00000002"
                                                     "0000"
                                                     "0003"
                                                     "0004"
                                                     "0000" +
                                                         zeros(32));
}

TEST(VersionReq, IsBuiltWithAToolIdOf32Bytes)
{
    const VersionReq message(1, 2, 3, 4, std::string(32, 'x'));
    EXPECT_EQ(message.dataLength(), 48U);
    EXPECT_EQ(message.getToolId(), std::string(32, 'x'));
}

TEST(VersionReq, IsNotBuiltWithAToolIdOf33Bytes)
{
    EXPECT_THAT([] { VersionReq(1, 2, 3, 4, std::string(33, 'x')); }, refused("Tool ID is too long"));
    EXPECT_THAT([] { VersionReq(1, 2, 3, 4, std::string(65535, 'x')); }, refused("Tool ID is too long"));
}

TEST(VersionReq, TakesTheLengthOfTheToolIdModulo65536)
{
    const VersionReq empty(1, 2, 3, 4, std::string(65536, 'x'));
    EXPECT_EQ(payloadOf(empty), payloadOf(VersionReq(1, 2, 3, 4, "")));

    const VersionReq five(1, 2, 3, 4, "abcdefghijk" + std::string(65530, 'x'));
    EXPECT_EQ(payloadOf(five), payloadOf(VersionReq(1, 2, 3, 4, "abcde")));

    EXPECT_EQ(VersionReq(1, 2, 3, 4, std::string(65568, 'x')).getToolId(), std::string(32, 'x'));
    EXPECT_THAT([] { VersionReq(1, 2, 3, 4, std::string(65569, 'x')); }, refused("Tool ID is too long"));
}

TEST(VersionReq, CarriesAnyBytesInTheToolId)
{
    const std::string toolId("\0\xFF\0", 3);
    EXPECT_EQ(VersionReq(1, 2, 3, 4, toolId).getToolId(), toolId);
}

TEST(VersionReq, NeedsItsFixedPart)
{
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(0, 0)), kTooShort);
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(15, 0)), kTooShort);
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(16, 0)), "accepted");
}

TEST(VersionReq, ChecksTheFixedPartFirst) { EXPECT_EQ(verdict<VersionReq>(versionReqPayload(15, 33)), kTooShort); }

TEST(VersionReq, NeedsAsManyBytesAsTheToolIdHas)
{
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(16, 1)), "Tool ID length is invalid");
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(22, 7)), "Tool ID length is invalid");
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(23, 7)), "accepted");
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(47, 32)), "Tool ID length is invalid");
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(48, 32)), "accepted");
    EXPECT_EQ(received<VersionReq>(versionReqPayload(23, 7)).getToolId(), "ABCDEFG");
}

TEST(VersionReq, ToolIdHasAtMost32Bytes)
{
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(100, 32)), "accepted");
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(100, 33)), "Tool ID length is invalid");
    EXPECT_EQ(verdict<VersionReq>(versionReqPayload(100, 0xFFFF)), "Tool ID length is invalid");
}

TEST(VersionReq, AcceptsGarbageInReservedFieldsAndTails)
{
    const auto message = received<VersionReq>(versionReqPayload(48, 2).at(14, bytes({0xFF, 0xEE})));
    EXPECT_EQ(message.getToolId(), "AB");
}

TEST(VersionReq, ReadsItsFieldsFromEitherForm)
{
    for (const auto& frame :
         {newFrame<VersionReq>(versionReqPayload(48, 3)), oldFrame<VersionReq>(versionReqPayload(48, 3)),
          oldFrame<VersionReq>(versionReqPayload(19, 3))}) {
        const auto message = received<VersionReq>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getInterfaceVersion(), 0x01020304U);
        EXPECT_EQ(message.getToolType(), 0x05060708U);
        EXPECT_EQ(message.getMajorVersion(), 0x1112);
        EXPECT_EQ(message.getMinorVersion(), 0x1314);
        EXPECT_EQ(message.getToolId(), "ABC");
    }
}

TEST(VersionReq, PrintsItsFields)
{
    const char* const text = "  Interface version:      0x0102030A\n"
                             "  Tool type:              0x05060708\n"
                             "  Major version:          0x1112\n"
                             "  Minor version:          0x001F\n"
                             "  Tool ID:                tool-1\n";
    const VersionReq message(0x0102030A, 0x05060708, 0x1112, 0x001F, "tool-1");
    EXPECT_EQ(detailsOf(message), text);
    EXPECT_EQ(detailsOf(received<VersionReq>(oldFrame<VersionReq>(
                  Payload().u32(0x0102030A).u32(0x05060708).u16(6).u16(0x1112).u16(0x1F).u16(0).text("tool-1")))),
              text);
    EXPECT_EQ(detailsOf(VersionReq(0, 0, 0, 0, "")), "  Interface version:      0x00000000\n"
                                                     "  Tool type:              0x00000000\n"
                                                     "  Major version:          0x0000\n"
                                                     "  Minor version:          0x0000\n"
                                                     "  Tool ID:                \n");
}

TEST(VersionReq, PrintsItsWholeDumpInUpperCase)
{
    const CallerIdScope ids(0xAABBCCD);
    EXPECT_EQ(test::dumpOf(VersionReq(0xABCDEF01, 2, 3, 4, "z")),
              "\n"
              "EyeCatcher:     0xDECAFF20\n"
              "MsgLength:      0x00000050\n"
              "CallerId:       0x0AABBCCE\n"
              "Function:       0x6003 (QelMessageFunctionQelInterfaceCmp)\n"
              "Operation:      0x0101 (QelMessageOpGetEnclTypeAndInterfaceVersion)\n"
              "Flags:          0x80 (MsgResponseExpected)\n"
              "PadByteLen:     0x00\n"
              "DataLength:     0x00000030\n"
              "Status:         0x00000000 (QelMessageStatusNoError)\n"
              "StatusDetail:   0x0000\n"
              "\n"
              "Additional message details:\n"
              "  Interface version:      0xABCDEF01\n"
              "  Tool type:              0x00000002\n"
              "  Major version:          0x0003\n"
              "  Minor version:          0x0004\n"
              "  Tool ID:                z\n"
              "\n"
              "\n"
              "Current raw message contents:\n"
              " DECA FF20 0000 0050 0AAB BCCE 6003 8000\n"
              " 0000 0030 0101 0000 0000 0000 0000 0000\n"
              " ABCD EF01 0000 0002 0001 0003 0004 0000\n"
              " 7A00 0000 0000 0000 0000 0000 0000 0000\n"
              " 0000 0000 0000 0000 0000 0000 0000 0000\n"
              "\n");
}

// --- interface version response --------------------------------------------------------------------------------------

using VersionRsp = QelMessageGetEnclTypeAndInterfaceVersionRsp;

/// A payload of `length` bytes whose length fields say what is given.
Payload versionRspPayload(std::size_t length, unsigned int machineTypeLength, unsigned int serialLength)
{
    return Payload()
        .text("F")
        .u8(7)
        .u16(0x1112)
        .u16(0x1314)
        .zeros(6)
        .u16(machineTypeLength)
        .u16(serialLength)
        .text("abcdefghijklmnop")
        .text("ABCDEFGHIJKLMNOP")
        .resize(length);
}

TEST(VersionRsp, IsBuiltAtItsFullSize)
{
    const VersionRsp message(0xAABBCCDD, 'F', 0x1112, 0x1314, "9119", "02C4E1");
    EXPECT_EQ(frameOf(message), "DECAFF20"
                                "00000050"
                                "AABBCCDD" // caller id
                                "6003"
                                "40" // flags: response
                                "00"
                                "00000030"
                                "0101"
                                "0000"
                                "0000"
                                "0000"
                                "00000000"
                                "46"           // family
                                "02"           // enclosure type
                                "1112"         // major version
                                "1314"         // minor version
                                "000000000000" // reserved
                                "0004"         // machine type length
                                "0006"         // serial number length
                                "39313139" +
                                    zeros(12) + "303243344531" + zeros(10));
}

TEST(VersionRsp, IsBuiltWithEmptyTexts)
{
    const VersionRsp message(1, 'F', 0, 0, "", "");
    EXPECT_EQ(payloadOf(message), "4602" + zeros(46));
}

TEST(VersionRsp, IsBuiltWithTextsOf16Bytes)
{
    const VersionRsp message(1, 'F', 0, 0, std::string(16, 'm'), std::string(16, 's'));
    EXPECT_EQ(message.dataLength(), 48U);
    EXPECT_EQ(message.getSystemMachineType(), std::string(16, 'm'));
    EXPECT_EQ(message.getSystemSerialNum(), std::string(16, 's'));
}

TEST(VersionRsp, IsNotBuiltWithALongerText)
{
    const auto build = [](std::size_t machineTypeLength, std::size_t serialLength) {
        return [=] { VersionRsp(1, 'F', 0, 0, std::string(machineTypeLength, 'm'), std::string(serialLength, 's')); };
    };
    EXPECT_THAT(build(16, 17), refused("System serial size is too large"));
    EXPECT_THAT(build(17, 16), refused("System machine type is too large"));
    // Both are wrong: the serial number is checked first.
    EXPECT_THAT(build(17, 17), refused("System serial size is too large"));
    // The whole length counts, not what fits the length field.
    EXPECT_THAT(build(0, 65536), refused("System serial size is too large"));
    EXPECT_THAT(build(65536, 0), refused("System machine type is too large"));
}

TEST(VersionRsp, NeedsItsFixedPart)
{
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(0, 0, 0)), kTooShort);
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(31, 0, 0)), kTooShort);
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(32, 0, 0)), "accepted");
}

TEST(VersionRsp, MachineTypeLiesInTheFixedPart)
{
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(32, 16, 0)), "accepted");
    EXPECT_EQ(received<VersionRsp>(versionRspPayload(32, 16, 0)).getSystemMachineType(), "abcdefghijklmnop");
    EXPECT_EQ(received<VersionRsp>(versionRspPayload(32, 16, 0)).getSystemSerialNum(), "");
}

TEST(VersionRsp, TextsHaveAtMost16Bytes)
{
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(48, 16, 16)), "accepted");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(48, 17, 16)), "Invalid machine type length");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(48, 16, 17)), "Invalid system serial length");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(100, 16, 17)), "Invalid system serial length");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(100, 0xFFFF, 0)), "Invalid machine type length");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(100, 0, 0xFFFF)), "Invalid system serial length");
}

TEST(VersionRsp, NeedsAsManyBytesAsTheSerialNumberHas)
{
    const char* const text = "dataLength not long enough to encapsulate final string field";
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(32, 0, 1)), text);
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(36, 0, 5)), text);
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(37, 0, 5)), "accepted");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(47, 0, 16)), text);
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(48, 0, 16)), "accepted");
}

TEST(VersionRsp, ChecksInAFixedOrder)
{
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(31, 17, 17)), kTooShort);
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(32, 17, 17)), "Invalid machine type length");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(32, 17, 16)), "Invalid machine type length");
    EXPECT_EQ(verdict<VersionRsp>(versionRspPayload(32, 16, 17)), "Invalid system serial length");
}

TEST(VersionRsp, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = versionRspPayload(48, 3, 4).at(6, bytes({1, 2, 3, 4, 5, 6})); // garbage in reserved bytes
    for (const auto& frame : {newFrame<VersionRsp>(payload), oldFrame<VersionRsp>(payload)}) {
        const auto message = received<VersionRsp>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getInterfaceVersionFamily(), 'F');
        EXPECT_EQ(message.getEnclosureType(), 7);
        EXPECT_EQ(message.getMajorVersion(), 0x1112);
        EXPECT_EQ(message.getMinorVersion(), 0x1314);
        EXPECT_EQ(message.getSystemMachineType(), "abc");
        EXPECT_EQ(message.getSystemSerialNum(), "ABCD");
    }
}

TEST(VersionRsp, PrintsItsFieldsSerialNumberFirst)
{
    EXPECT_EQ(detailsOf(VersionRsp(1, 'F', 0x1112, 0x001F, "9119", "02C4E1")), "  IF version family:      0x46\n"
                                                                               "  Enclosure type:         0x02\n"
                                                                               "  Major version:          0x1112\n"
                                                                               "  Minor version:          0x001F\n"
                                                                               "  System serial number:   02C4E1\n"
                                                                               "  System machine type:    9119\n");
    EXPECT_EQ(detailsOf(received<VersionRsp>(oldFrame<VersionRsp>(versionRspPayload(48, 3, 4)))),
              "  IF version family:      0x46\n"
              "  Enclosure type:         0x07\n"
              "  Major version:          0x1112\n"
              "  Minor version:          0x1314\n"
              "  System serial number:   ABCD\n"
              "  System machine type:    abc\n");
}

TEST(VersionRsp, PrintsANegativeFamilyWithItsSign)
{
    EXPECT_THAT(detailsOf(VersionRsp(1, '\x80', 0, 0, "", "")),
                testing::StartsWith("  IF version family:      0xFF80\n"));
    EXPECT_EQ(VersionRsp(1, '\x80', 0, 0, "", "").getInterfaceVersionFamily(), '\x80');
}

// --- capabilities ----------------------------------------------------------------------------------------------------

using CapabilitiesReq = QelMessageExchIntCapabilitiesReq;
using CapabilitiesRsp = QelMessageExchIntCapabilitiesRsp;

const char* const kNotAMultipleOf4 = "Given capability length is invalid (length % 4 wasn't 0)";

TEST(CapabilitiesReq, CarriesFourBytes)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(CapabilitiesReq(QelCapabilities("1000000011"))), "DECAFF20"
                                                                       "00000028"
                                                                       "00000007"
                                                                       "6003"
                                                                       "80"
                                                                       "00"
                                                                       "00000008"
                                                                       "0104"
                                                                       "0000"
                                                                       "0000"
                                                                       "0000"
                                                                       "00000000"
                                                                       "00000004"   // capability length
                                                                       "80C00000"); // bits 0, 8 and 9
}

TEST(CapabilitiesReq, PutsBitNUnderItsMask)
{
    for (std::size_t bit = 0; bit < 32; ++bit) {
        SCOPED_TRACE(bit);
        std::vector<unsigned char> expected(4);
        expected[bit / 8] = static_cast<unsigned char>(0x80 >> (bit % 8));
        const CapabilitiesReq message(QelCapabilities().set(bit));
        EXPECT_EQ(payloadOf(message), "00000004" + hex(expected.data(), expected.size()));
        EXPECT_EQ(message.getCapabilities(), QelCapabilities().set(bit));
        EXPECT_EQ(received<CapabilitiesReq>(Payload().u32(4).u32(0x80000000U >> bit)).getCapabilities(),
                  QelCapabilities().set(bit));
    }
}

TEST(CapabilitiesRsp, CarriesAsManyBytesAsAskedFor)
{
    const QelCapabilities all(std::string(32, '1'));
    EXPECT_EQ(payloadOf(CapabilitiesRsp(0, all)), "00000000");
    EXPECT_EQ(payloadOf(CapabilitiesRsp(4, all)), "00000004FFFFFFFF");
    EXPECT_EQ(payloadOf(CapabilitiesRsp(8, all)), "00000008FFFFFFFF00000000");
    EXPECT_EQ(payloadOf(CapabilitiesRsp(12, QelCapabilities("01"))), "0000000C400000000000000000000000");
}

TEST(CapabilitiesRsp, CarriesTheCallerIdOfItsRequest)
{
    EXPECT_EQ(frameOf(CapabilitiesRsp(0xAABBCCDD, 4, QelCapabilities("1"))), "DECAFF20"
                                                                             "00000028"
                                                                             "AABBCCDD"
                                                                             "6003"
                                                                             "40"
                                                                             "00"
                                                                             "00000008"
                                                                             "0104"
                                                                             "0000"
                                                                             "0000"
                                                                             "0000"
                                                                             "00000000"
                                                                             "00000004"
                                                                             "80000000");
}

TEST(CapabilitiesRsp, IsNotBuiltWithALengthThatIsNoMultipleOf4)
{
    for (const unsigned int length : {1U, 2U, 3U, 5U, 6U, 7U, 0xFFFFFFFDU, 0xFFFFFFFEU, 0xFFFFFFFFU}) {
        SCOPED_TRACE(length);
        EXPECT_THAT([=] { CapabilitiesRsp(length, QelCapabilities()); }, refused(kNotAMultipleOf4));
        EXPECT_THAT([=] { CapabilitiesRsp(1, length, QelCapabilities()); }, refused(kNotAMultipleOf4));
    }
}

TEST(CapabilitiesRsp, IsNotBuiltWithALengthThatNoFrameCanHave)
{
    // 4 + FFFFFFFC is 2^32, and with FFFFFFDC the header no longer fits; neither sum may wrap.
    for (const unsigned int length : {0xFFFFFFDCU, 0xFFFFFFF8U, 0xFFFFFFFCU}) {
        SCOPED_TRACE(length);
        EXPECT_THAT([=] { CapabilitiesRsp(length, QelCapabilities()); },
                    ThrowsMessage<std::invalid_argument>(StrEq("length")));
    }
}

template <typename T>
class ReceivedCapabilities : public testing::Test {};
using CapabilityMessages = testing::Types<CapabilitiesReq, CapabilitiesRsp>;
TYPED_TEST_SUITE(ReceivedCapabilities, CapabilityMessages, test::ClassNames);

TYPED_TEST(ReceivedCapabilities, NeedTheirFixedPart)
{
    EXPECT_EQ(verdict<TypeParam>(Payload()), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(3)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(4)), "accepted");
}

TYPED_TEST(ReceivedCapabilities, NeedALengthThatIsAMultipleOf4)
{
    for (const unsigned int length : {1U, 2U, 3U, 5U, 6U, 7U}) {
        SCOPED_TRACE(length);
        EXPECT_EQ(verdict<TypeParam>(Payload().u32(length).zeros(8)), kNotAMultipleOf4);
    }
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(8).zeros(8)), "accepted");
}

TYPED_TEST(ReceivedCapabilities, NeedAsManyBytesAsTheLengthSays)
{
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(4)), "capabilityLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(4).zeros(3)), "capabilityLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(4).zeros(4)), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(4).zeros(5)), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(8).zeros(7)), "capabilityLen larger than acceptable");
}

TYPED_TEST(ReceivedCapabilities, RefuseALengthThatWouldWrap)
{
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(0xFFFFFFFC)), "capabilityLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(0xFFFFFFFC).zeros(8)), "capabilityLen larger than acceptable");
}

TYPED_TEST(ReceivedCapabilities, AreCheckedInAFixedOrder)
{
    EXPECT_EQ(verdict<TypeParam>(Payload().fill(3, '\x01')), kTooShort);
    // No multiple of 4 and longer than the payload: the first is said.
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(0xFFFFFFFF)), kNotAMultipleOf4);
    EXPECT_EQ(verdict<TypeParam>(Payload().u32(6).zeros(4)), kNotAMultipleOf4);
}

TYPED_TEST(ReceivedCapabilities, IgnoreBytesPastTheFourth)
{
    const auto message = received<TypeParam>(Payload().u32(8).u32(0x80000001).u32(0xFFFFFFFF));
    EXPECT_EQ(message.getCapabilityLen(), 8U);
    EXPECT_EQ(message.getCapabilities(), QelCapabilities().set(0).set(31));
}

TYPED_TEST(ReceivedCapabilities, IgnoreBytesPastTheirLength)
{
    const auto message = received<TypeParam>(Payload().u32(0).u32(0xFFFFFFFF));
    EXPECT_EQ(message.getCapabilityLen(), 0U);
    EXPECT_EQ(message.getCapabilities(), QelCapabilities());
}

TYPED_TEST(ReceivedCapabilities, ReadTheirFieldsFromEitherForm)
{
    const Payload payload = Payload().u32(4).u32(0x8000C001);
    for (const auto& frame : {newFrame<TypeParam>(payload), oldFrame<TypeParam>(payload)}) {
        const auto message = received<TypeParam>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getCapabilityLen(), 4U);
        EXPECT_EQ(message.getCapabilities(), QelCapabilities().set(0).set(16).set(17).set(31));
        EXPECT_EQ(detailsOf(message), "  mCapabilityLen:         4\n"
                                      "  mSupportedCapabilities: 10000000000000001100000000000001\n");
    }
}

TEST(CapabilitiesReq, PrintsItsFields)
{
    EXPECT_EQ(detailsOf(CapabilitiesReq(QelCapabilities("011"))),
              "  mCapabilityLen:         4\n"
              "  mSupportedCapabilities: 01100000000000000000000000000000\n");
}

TEST(CapabilitiesRsp, PrintsItsLengthInDecimal)
{
    EXPECT_EQ(detailsOf(CapabilitiesRsp(16, QelCapabilities("1"))),
              "  mCapabilityLen:         16\n"
              "  mSupportedCapabilities: 10000000000000000000000000000000\n");
    EXPECT_EQ(detailsOf(CapabilitiesRsp(0, QelCapabilities("1"))),
              "  mCapabilityLen:         0\n"
              "  mSupportedCapabilities: 00000000000000000000000000000000\n");
}

// --- limits ----------------------------------------------------------------------------------------------------------

TEST(LimitsRsp, CarriesFixedValues)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageGetInterfaceLimitsRsp()), "DECAFF20"
                                                          "00000030"
                                                          "00000007"
                                                          "6003"
                                                          "40"
                                                          "00"
                                                          "00000010"
                                                          "0105"
                                                          "0000"
                                                          "0000"
                                                          "0000"
                                                          "00000000"
                                                          "4000"   // 16384
                                                          "1000"   // 4096
                                                          "3FB2"   // 16306
                                                          "0000"   // reserved
                                                          "02"     // consoles
                                                          "000000" // reserved
                                                          "0000"   // non-persistent locks
                                                          "0000"); // persistent locks
}

TEST(LimitsRsp, CarriesTheCallerIdOfItsRequest)
{
    const QelMessageGetInterfaceLimitsRsp message(0xAABBCCDD);
    EXPECT_EQ(message.getCallerId(), 0xAABBCCDDU);
    EXPECT_EQ(payloadOf(message), payloadOf(QelMessageGetInterfaceLimitsRsp()));
}

TEST(LimitsRsp, ConstantsHaveAddresses)
{
    const unsigned int* const consoles = &QelMessageGetInterfaceLimitsRsp::DAXS_SUPPORTED;
    const unsigned int* const nonPersistent = &QelMessageGetInterfaceLimitsRsp::NON_PERSISTENT_LOCKS_SUPPORTED;
    const unsigned int* const persistent = &QelMessageGetInterfaceLimitsRsp::PERSISTENT_LOCKS_SUPPORTED;
    EXPECT_EQ(*consoles, 2U);
    EXPECT_EQ(*nonPersistent, 0U);
    EXPECT_EQ(*persistent, 0U);
}

TEST(LimitsRsp, PrintsNoPayloadFields)
{
    EXPECT_EQ(detailsOf(QelMessageGetInterfaceLimitsRsp()), "    <no additional details>");
}

TEST(LimitsRsp, IsReadByItsReceiverThroughItsLayout)
{
    using Data = QelMessageGetInterfaceLimitsRsp::Data;
    const QelMessageGetInterfaceLimitsRsp sent;
    const QelMessage plain(sent.serialize(), sent.msgLength());
    ASSERT_EQ(plain.dataLength(), sizeof(Data));
    const Data& limits = *reinterpret_cast<const Data*>(plain.getData());
    EXPECT_EQ(limits.mMaxCommandSize, QelMessage::MtuMax);
    EXPECT_EQ(limits.mMaxKrogCommandSize, QelMessage::MtuWexMax);
    EXPECT_EQ(limits.mBroadcastMsgPacketSize, 16306);
    EXPECT_EQ(limits.mDaxsSupported, 2);
    EXPECT_EQ(limits.mNonpersistentLocksSupported, 0);
    EXPECT_EQ(limits.mPersistentLocksSupported, 0);
}

TEST(LimitsRsp, LargestBroadcastMakesTheLongestFrame)
{
    using Data = QelMessageGetInterfaceLimitsRsp::Data;
    const QelMessageGetInterfaceLimitsRsp limits;
    const std::uint16_t largest = reinterpret_cast<const Data*>(limits.getData())->mBroadcastMsgPacketSize;
    const std::string broadcast(largest, 'x');
    EXPECT_EQ(QelMessageDaxBroadcastReq(0, largest, 0, "", broadcast.data()).msgLength(), 16384U);
}

// --- broadcast request -----------------------------------------------------------------------------------------------

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
    // The whole length counts, not what fits the length field.
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
    // FFFF + FFFF does not fit 16 bits, and FFFF + 0031 wraps to the payload's own length there.
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 0xFFFF, with(&BroadcastFields::messageLength, 0xFFFF))),
              text);
    EXPECT_EQ(broadcastVerdict(with(&BroadcastFields::offset, 0xFFFF, with(&BroadcastFields::messageLength, 0x31))),
              text);
    // Without a message the offset may still not lie past the end.
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
    BroadcastFields fields; // everything is wrong, and is put right one after the other
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
    // The two about the id exclude each other; the end of the message comes before the second one, too.
    fields.toolIdLength = 33;
    EXPECT_EQ(broadcastVerdict(fields), kToolIdTooLong);
    fields.messageLength = 5;
    EXPECT_EQ(broadcastVerdict(fields), "message greater than maximum acceptable size");
}

TEST(BroadcastReq, SkipsWhatALaterProtocolLevelPutsBeforeTheMessage)
{
    BroadcastFields fields;
    fields.offset = 48;
    fields.messageLength = 4;
    fields.payloadLength = 52;
    const auto message = received<BroadcastReq>(broadcastPayload(fields));
    EXPECT_EQ(message.getDaxPacket(), message.getData() + 48);
    EXPECT_EQ(std::string(message.getDaxPacket(), message.getBroadcastMsgLen()), "2345");
}

TEST(BroadcastReq, PacketOfNoBytesMayLieAtTheEnd)
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

TEST(BroadcastReq, PrintsTheOffsetAsItCame)
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

// --- time of day -----------------------------------------------------------------------------------------------------

using TodRsp = QelMessageGetQelTodRsp;

constexpr std::time_t kMarch2024 = 1709618828;   // 2024-03-05 06:07:08
constexpr std::time_t kYear0 = -62167219200;     // 0000-01-01 00:00:00
constexpr std::time_t kYear10000 = 253402300800; // 10000-01-01 00:00:00

TEST(TodRsp, CarriesTheTimeInBcd)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(TodRsp(kMarch2024)), "DECAFF20"
                                           "00000028"
                                           "00000007"
                                           "6003"
                                           "40"
                                           "00"
                                           "00000008"
                                           "0107"
                                           "0000"
                                           "0000"
                                           "0000"
                                           "00000000"
                                           "2024"
                                           "03"
                                           "05"
                                           "06"
                                           "07"
                                           "08"
                                           "00");
}

TEST(TodRsp, CarriesTheCallerIdOfItsRequest)
{
    const TodRsp message(0xAABBCCDD, kMarch2024);
    EXPECT_EQ(message.getCallerId(), 0xAABBCCDDU);
    EXPECT_EQ(payloadOf(message), "2024030506070800");
}

TEST(TodRsp, CarriesUtcWhateverTheTimeZone)
{
    const test::TimeZoneScope zone("TST-13:30"); // 13 and a half hours ahead
    std::tm local{};
    ASSERT_NE(::localtime_r(&kMarch2024, &local), nullptr);
    ASSERT_EQ(local.tm_hour, 19); // the zone is in force
    EXPECT_EQ(payloadOf(TodRsp(kMarch2024)), "2024030506070800");
}

TEST(TodRsp, CarriesEveryTimeOfTheYears0To9999)
{
    struct Row {
        const char* name;
        std::time_t time;
        const char* payload;
    };
    const Row rows[] = {
        {"the epoch", 0, "1970010100000000"},
        {"before the epoch", -1, "1969123123595900"},
        {"leap day", 951782400, "2000022900000000"},
        {"all fields at their largest", 1735689599, "2024123123595900"},
        {"beyond 32 bits", 4102444800, "2100010100000000"},
        {"first second", kYear0, "0000010100000000"},
        {"last second", kYear10000 - 1, "9999123123595900"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(payloadOf(TodRsp(row.time)), row.payload);
    }
}

TEST(TodRsp, IsNotBuiltForOtherTimes)
{
    struct Row {
        const char* name;
        std::time_t time;
    };
    const Row rows[] = {
        {"after the year 9999", kYear10000},
        {"before the year 0", kYear0 - 1},
        {"a year past the range of int", 67768036191676799}, // the last second that the C library can break down
        {"what the C library cannot break down", std::numeric_limits<std::time_t>::max()},
        {"the same in the past", std::numeric_limits<std::time_t>::min()},
    };
    const auto outOfRange = ThrowsMessage<std::range_error>(StrEq("type cannot be represented in BCD"));
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        EXPECT_THAT([&] { TodRsp(row.time); }, outOfRange);
        EXPECT_THAT([&] { TodRsp(1, row.time); }, outOfRange);
    }
}

TEST(TodRsp, PrintsItsFieldsInDecimalWithoutLeadingZeros)
{
    EXPECT_EQ(detailsOf(TodRsp(kMarch2024)), " mYear      2024\n"
                                             " mMonth     3\n"
                                             " mDay       5\n"
                                             " mHour      6\n"
                                             " mMinute    7\n"
                                             " mSecond    8\n");
    EXPECT_EQ(detailsOf(TodRsp(1735689599)), " mYear      2024\n"
                                             " mMonth     12\n"
                                             " mDay       31\n"
                                             " mHour      23\n"
                                             " mMinute    59\n"
                                             " mSecond    59\n");
}

TEST(TodRsp, IsReadByItsReceiverThroughItsLayout)
{
    using Data = TodRsp::Data;
    const TodRsp sent(kMarch2024);
    const QelMessage plain(sent.serialize(), sent.msgLength());
    ASSERT_EQ(plain.dataLength(), sizeof(Data));
    const Data& time = *reinterpret_cast<const Data*>(plain.getData());
    EXPECT_EQ(time.mYear, 2024);
    EXPECT_EQ(time.mMonth, 3);
    EXPECT_EQ(time.mDay, 5);
    EXPECT_EQ(time.mHour, 6);
    EXPECT_EQ(time.mMinute, 7);
    EXPECT_EQ(time.mSecond, 8);
}

// --- global mode attribute -------------------------------------------------------------------------------------------

template <typename T>
class GlobalMode : public testing::Test {};
using GlobalModeMessages = testing::Types<QelMessageSetGlobalModeAttributeReq, QelMessageGetGlobalModeAttributeRsp>;
TYPED_TEST_SUITE(GlobalMode, GlobalModeMessages, test::ClassNames);

TYPED_TEST(GlobalMode, IsBuiltWithItsText)
{
    EXPECT_EQ(payloadOf(TypeParam(0x7F, "9119*02C4E1")), "7F"   // mode
                                                         "00"   // reserved
                                                         "000B" // text length
                                                         "393131392A303243344531");
    EXPECT_EQ(payloadOf(TypeParam(1, "")), "01000000");
}

TYPED_TEST(GlobalMode, KeepsEmbeddedNuls)
{
    const std::string text("a\0b\0", 4);
    EXPECT_EQ(payloadOf(TypeParam(0, text)), "0000000461006200");
    EXPECT_EQ(TypeParam(0, text).getMTMS(), text);
}

TYPED_TEST(GlobalMode, SendsALongTextWholeWithItsLengthModulo65536)
{
    const TypeParam longest(1, std::string(65535, 'x'));
    EXPECT_EQ(longest.getMTMSLen(), 65535);
    EXPECT_EQ(longest.getMTMS(), std::string(65535, 'x'));

    const std::string text = "abc" + std::string(65536, 'x');
    const TypeParam wrapped(1, text);
    EXPECT_EQ(wrapped.dataLength(), 65543U);
    EXPECT_EQ(wrapped.getMTMSLen(), 3);
    EXPECT_EQ(wrapped.getMTMS(), "abc");
    EXPECT_EQ(std::string(wrapped.getData() + 4, text.size()), text);
    EXPECT_EQ(verdict<TypeParam>(newFrame<TypeParam>(Payload().text({wrapped.getData(), wrapped.dataLength()}))),
              "accepted");
}

TYPED_TEST(GlobalMode, NeedsItsFixedPart)
{
    EXPECT_EQ(verdict<TypeParam>(Payload()), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(3)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(4)), "accepted");
}

TYPED_TEST(GlobalMode, NeedsItsWholeText)
{
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(1)), "mtmsLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(5).text("abcd")), "mtmsLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(4).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(3).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0).u16(0xFFFF).text("abcd")), "mtmsLen larger than acceptable");
}

TYPED_TEST(GlobalMode, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = Payload().u8(200).u8(0xEE).u16(4).text("abcdtail");
    for (const auto& frame : {newFrame<TypeParam>(payload), oldFrame<TypeParam>(payload)}) {
        const auto message = received<TypeParam>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getMode(), 200);
        EXPECT_EQ(message.getMTMSLen(), 4);
        EXPECT_EQ(message.getMTMS(), "abcd");
        EXPECT_EQ(detailsOf(message), " mMode      200\n"
                                      " mMTMSLen   4\n"
                                      " mMTMS      abcd\n");
    }
}

TYPED_TEST(GlobalMode, ReadsAnEmptyText)
{
    for (const auto& frame : {newFrame<TypeParam>(Payload().zeros(4)), oldFrame<TypeParam>(Payload().zeros(4))}) {
        const auto message = received<TypeParam>(frame);
        EXPECT_EQ(message.getMTMS(), "");
        EXPECT_EQ(detailsOf(message), " mMode      0\n"
                                      " mMTMSLen   0\n"
                                      " mMTMS      \n");
    }
}

TEST(SetGlobalModeReq, HasItsHeader)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageSetGlobalModeAttributeReq(1, "x")), "DECAFF20"
                                                                    "00000025"
                                                                    "00000007"
                                                                    "6003"
                                                                    "80"
                                                                    "00"
                                                                    "00000005"
                                                                    "0108"
                                                                    "0000"
                                                                    "0000"
                                                                    "0000"
                                                                    "00000000"
                                                                    "0100000178");
}

TEST(GetGlobalModeRsp, HasItsHeader)
{
    const std::string afterCallerId = "6003"
                                      "40"
                                      "00"
                                      "00000005"
                                      "0109"
                                      "0000"
                                      "0000"
                                      "0000"
                                      "00000000"
                                      "0100000178";
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageGetGlobalModeAttributeRsp(1, "x")), "DECAFF200000002500000007" + afterCallerId);
    EXPECT_EQ(frameOf(QelMessageGetGlobalModeAttributeRsp(0xAABBCCDD, 1, "x")),
              "DECAFF2000000025AABBCCDD" + afterCallerId);
}

// --- global save-area metadata ---------------------------------------------------------------------------------------

template <typename T>
class GlobalMetadata : public testing::Test {};
using GlobalMetadataMessages =
    testing::Types<QelMessageSetGlobalSaveAreaMetadataReq, QelMessageGetGlobalSaveAreaMetadataRsp>;
TYPED_TEST_SUITE(GlobalMetadata, GlobalMetadataMessages, test::ClassNames);

TYPED_TEST(GlobalMetadata, IsBuiltWithItsBytes)
{
    EXPECT_EQ(payloadOf(TypeParam("meta")), "00046D657461");
    EXPECT_EQ(payloadOf(TypeParam("")), "0000");
}

TYPED_TEST(GlobalMetadata, KeepsEmbeddedNuls)
{
    const std::string metadata("\0\xFF\0", 3);
    EXPECT_EQ(payloadOf(TypeParam(metadata)), "000300FF00");
    EXPECT_EQ(TypeParam(metadata).getMetadata(), metadata);
}

TYPED_TEST(GlobalMetadata, SendsManyBytesWholeWithTheirLengthModulo65536)
{
    const TypeParam longest(std::string(65535, 'x'));
    EXPECT_EQ(longest.getMetadataLen(), 65535);
    EXPECT_EQ(longest.getMetadata(), std::string(65535, 'x'));

    const std::string metadata = "abc" + std::string(65536, 'x');
    const TypeParam wrapped(metadata);
    EXPECT_EQ(wrapped.dataLength(), 65541U);
    EXPECT_EQ(wrapped.getMetadataLen(), 3);
    EXPECT_EQ(wrapped.getMetadata(), "abc");
    EXPECT_EQ(std::string(wrapped.getData() + 2, metadata.size()), metadata);
}

TYPED_TEST(GlobalMetadata, NeedsItsFixedPart)
{
    EXPECT_EQ(verdict<TypeParam>(Payload()), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(1)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(Payload().zeros(2)), "accepted");
}

TYPED_TEST(GlobalMetadata, NeedsAllItsBytes)
{
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(1)), "metadataLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(5).text("abcd")), "metadataLen larger than acceptable");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(4).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(3).text("abcd")), "accepted");
    EXPECT_EQ(verdict<TypeParam>(Payload().u16(0xFFFF).text("abcd")), "metadataLen larger than acceptable");
}

TYPED_TEST(GlobalMetadata, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = Payload().u16(12).text("twelve bytes and a tail");
    for (const auto& frame : {newFrame<TypeParam>(payload), oldFrame<TypeParam>(payload)}) {
        const auto message = received<TypeParam>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getMetadataLen(), 12);
        EXPECT_EQ(message.getMetadata(), "twelve bytes");
        EXPECT_EQ(detailsOf(message), " mMetadataLen 12\n"
                                      " mMetadata    twelve bytes\n");
    }
}

TYPED_TEST(GlobalMetadata, ReadsNoBytes)
{
    for (const auto& frame : {newFrame<TypeParam>(Payload().zeros(2)), oldFrame<TypeParam>(Payload().zeros(2))}) {
        const auto message = received<TypeParam>(frame);
        EXPECT_EQ(message.getMetadata(), "");
        EXPECT_EQ(detailsOf(message), " mMetadataLen 0\n"
                                      " mMetadata    \n");
    }
}

TEST(SetGlobalMetadataReq, HasItsHeader)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageSetGlobalSaveAreaMetadataReq("x")), "DECAFF20"
                                                                    "00000023"
                                                                    "00000007"
                                                                    "6003"
                                                                    "80"
                                                                    "00"
                                                                    "00000003"
                                                                    "010A"
                                                                    "0000"
                                                                    "0000"
                                                                    "0000"
                                                                    "00000000"
                                                                    "000178");
}

TEST(GetGlobalMetadataRsp, HasItsHeader)
{
    const std::string afterCallerId = "6003"
                                      "40"
                                      "00"
                                      "00000003"
                                      "010B"
                                      "0000"
                                      "0000"
                                      "0000"
                                      "00000000"
                                      "000178";
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(QelMessageGetGlobalSaveAreaMetadataRsp("x")), "DECAFF200000002300000007" + afterCallerId);
    EXPECT_EQ(frameOf(QelMessageGetGlobalSaveAreaMetadataRsp(0xAABBCCDD, "x")),
              "DECAFF2000000023AABBCCDD" + afterCallerId);
}

} // namespace
} // namespace qel
