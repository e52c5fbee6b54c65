#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/CatalogFrames.hpp"
#include "support/MessageProbe.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
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

// --- interface version request --------------------------------------------------------------------------------------

using VersionReq = QelMessageGetEnclTypeAndInterfaceVersionReq;

/// A payload of `length` bytes with `toolIdLength` in its length field.
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

TEST(VersionReq, UsesTheLengthOfTheToolIdModulo65536)
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

// --- interface version response -------------------------------------------------------------------------------------

using VersionRsp = QelMessageGetEnclTypeAndInterfaceVersionRsp;

/// A payload of `length` bytes with the given numbers in its length fields.
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
    // Both are too long: the serial number is checked first.
    EXPECT_THAT(build(17, 17), refused("System serial size is too large"));
    // The whole length is checked, not its value modulo 65536.
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

} // namespace
} // namespace qel
