#include <qel/common/QelMessageVirtualSerial.hpp>

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

using OpenReq = QelMessageVirtualSerialOpenReq;
using OpenRsp = QelMessageVirtualSerialOpenRsp;
using CloseReq = QelMessageVirtualSerialCloseReq;
using MaxSessionsRsp = QelMessageVirtualSerialGetMaxSessionsRsp;
using SetupReq = QelMessageVirtualSerialSetupSessionReq;
using SessionClosed = QelMessageVirtualSerialSessionClosedAsync;
using DataToOs = QelMessageVirtualSerialDataToOsAsync;
using DataToDax = QelMessageVirtualSerialDataToDaxAsync;

const char* const kTooShort = "dataLength shorter than actual data size";

/// The address that the tests use: partition 4660, connection 17.
Payload address() { return Payload().u16(0x1234).u16(17); }

const std::string kAddressText = "  Data:\n"
                                 "      LPID:               4660\n"
                                 "      VSS connection num: 17\n";

// --- the session address ---------------------------------------------------------------------------------------------

template <typename T>
class SessionAddress : public testing::Test {};
using MessagesWithAddress = testing::Types<OpenReq, OpenRsp, CloseReq, SetupReq, SessionClosed, DataToOs, DataToDax>;
TYPED_TEST_SUITE(SessionAddress, MessagesWithAddress, test::ClassNames);

TYPED_TEST(SessionAddress, BeginsThePayloadInEitherForm)
{
    const Payload payload = address().zeros(sizeof(typename TypeParam::Data) - 4);
    for (const auto& frame : {newFrame<TypeParam>(payload), oldFrame<TypeParam>(payload)}) {
        const auto message = received<TypeParam>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getLpId(), 0x1234);
        EXPECT_EQ(message.getVssConnectionNumber(), 17);
        EXPECT_THAT(detailsOf(message), testing::StartsWith(kAddressText));
    }
}

TYPED_TEST(SessionAddress, HoldsAnyNumber)
{
    const auto message = received<TypeParam>(Payload().u32(0xFFFFFFFF).zeros(sizeof(typename TypeParam::Data) - 4));
    EXPECT_EQ(message.getLpId(), 0xFFFF);
    EXPECT_EQ(message.getVssConnectionNumber(), 0xFFFF);
    EXPECT_THAT(detailsOf(message), testing::StartsWith("  Data:\n"
                                                        "      LPID:               65535\n"
                                                        "      VSS connection num: 65535\n"));
}

// --- open ------------------------------------------------------------------------------------------------------------

TEST(OpenReq, IsBuilt)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(OpenReq(0x1234, 0x5678, true)), "DECAFF20"
                                                      "00000028"
                                                      "00000007"
                                                      "6002"
                                                      "80"
                                                      "00"
                                                      "00000008"
                                                      "0402"
                                                      "0000"
                                                      "0000"
                                                      "0000"
                                                      "00000000"
                                                      "1234"
                                                      "5678"
                                                      "8000"   // flags: force open
                                                      "0000"); // reserved
    EXPECT_EQ(payloadOf(OpenReq(0x1234, 0x5678, false)), "1234567800000000");
    EXPECT_TRUE(OpenReq(1, 2, true).isForceOpen());
    EXPECT_FALSE(OpenReq(1, 2, false).isForceOpen());
}

TEST(OpenReq, NeedsEightBytes)
{
    EXPECT_EQ(verdict<OpenReq>(address().zeros(3)), kTooShort);
    EXPECT_EQ(verdict<OpenReq>(address().zeros(4)), "accepted");
    EXPECT_EQ(verdict<OpenReq>(address().zeros(5)), "accepted");
}

TEST(OpenReq, IsForcedOnlyByBit15)
{
    struct Row {
        unsigned int flags;
        bool forced;
    };
    for (const Row& row : {Row{0x0000, false}, Row{0x7FFF, false}, Row{0x0080, false}, Row{0x4000, false},
                           Row{0x8000, true}, Row{0x8001, true}, Row{0xFFFF, true}}) {
        SCOPED_TRACE(row.flags);
        const Payload payload = address().u16(row.flags).u16(0xEEEE);
        for (const auto& frame : {newFrame<OpenReq>(payload), oldFrame<OpenReq>(payload)}) {
            const auto message = received<OpenReq>(frame);
            EXPECT_EQ(message.isForceOpen(), row.forced);
            EXPECT_EQ(detailsOf(message), kAddressText + (row.forced ? "      Is force open:      True\n"
                                                                     : "      Is force open:      False\n"));
        }
    }
}

TEST(OpenReq, PrintsTheRawBytesInUpperCase)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(test::dumpOf(OpenReq(0x00AB, 0xCDEF, true)),
              "\n"
              "EyeCatcher:     0xDECAFF20\n"
              "MsgLength:      0x00000028\n"
              "CallerId:       0x00000007\n"
              "Function:       0x6002 (QelMessageFunctionVirtualSerial)\n"
              "Operation:      0x0402 (QelMessageOpOpenVirtualSerialSession)\n"
              "Flags:          0x80 (MsgResponseExpected)\n"
              "PadByteLen:     0x00\n"
              "DataLength:     0x00000008\n"
              "Status:         0x00000000 (QelMessageStatusNoError)\n"
              "StatusDetail:   0x0000\n"
              "\n"
              "Additional message details:\n"
              "  Data:\n"
              "      LPID:               171\n"
              "      VSS connection num: 52719\n"
              "      Is force open:      True\n"
              "\n"
              "\n"
              "Current raw message contents:\n"
              " DECA FF20 0000 0028 0000 0007 6002 8000\n"
              " 0000 0008 0402 0000 0000 0000 0000 0000\n"
              " 00AB CDEF 8000 0000\n"
              "\n");
}

TEST(OpenRsp, IsBuilt)
{
    EXPECT_EQ(frameOf(OpenRsp(0xAABBCCDD, 0x1234, 0x5678)), "DECAFF20"
                                                            "00000028"
                                                            "AABBCCDD"
                                                            "6002"
                                                            "40"
                                                            "00"
                                                            "00000008"
                                                            "0402"
                                                            "0000"
                                                            "0000"
                                                            "0000"
                                                            "00000000"
                                                            "1234"
                                                            "5678"
                                                            "00000000"); // reserved
}

TEST(OpenRsp, NeedsEightBytes)
{
    EXPECT_EQ(verdict<OpenRsp>(address().zeros(3)), kTooShort);
    EXPECT_EQ(verdict<OpenRsp>(address().zeros(4)), "accepted");
    EXPECT_EQ(verdict<OpenRsp>(address().zeros(5)), "accepted");
}

TEST(OpenRsp, PrintsOnlyTheAddress)
{
    EXPECT_EQ(detailsOf(OpenRsp(1, 0x1234, 17)), kAddressText);
    EXPECT_EQ(detailsOf(received<OpenRsp>(oldFrame<OpenRsp>(address().u32(0xEEEEEEEE)))), kAddressText);
}

// --- close -----------------------------------------------------------------------------------------------------------

TEST(CloseReq, IsBuilt)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(CloseReq(0x1234, 0x5678, true)), "DECAFF20"
                                                       "00000025"
                                                       "00000007"
                                                       "6002"
                                                       "80"
                                                       "00"
                                                       "00000005"
                                                       "0403"
                                                       "0000"
                                                       "0000"
                                                       "0000"
                                                       "00000000"
                                                       "1234"
                                                       "5678"
                                                       "FF"); // force close
    EXPECT_EQ(payloadOf(CloseReq(0x1234, 0x5678, false)), "1234567800");
    EXPECT_TRUE(CloseReq(1, 2, true).isForceClose());
    EXPECT_FALSE(CloseReq(1, 2, false).isForceClose());
}

TEST(CloseReq, NeedsFiveBytes)
{
    EXPECT_EQ(verdict<CloseReq>(address()), kTooShort);
    EXPECT_EQ(verdict<CloseReq>(address().zeros(1)), "accepted");
    EXPECT_EQ(verdict<CloseReq>(address().zeros(2)), "accepted");
}

TEST(CloseReq, IsForcedOnlyByFF)
{
    for (const unsigned int value : {0x00U, 0x01U, 0x7FU, 0x80U, 0xFEU, 0xFFU}) {
        SCOPED_TRACE(value);
        for (const auto& frame : {newFrame<CloseReq>(address().u8(value)), oldFrame<CloseReq>(address().u8(value))}) {
            const auto message = received<CloseReq>(frame);
            EXPECT_EQ(message.isForceClose(), value == 0xFF);
            EXPECT_EQ(detailsOf(message), kAddressText + (value == 0xFF ? "      Is force close:     True\n"
                                                                        : "      Is force close:     False\n"));
        }
    }
}

// --- maximum of sessions ---------------------------------------------------------------------------------------------

TEST(MaxSessionsRsp, IsBuilt)
{
    EXPECT_EQ(frameOf(MaxSessionsRsp(0xAABBCCDD, 0x1234, 0xEF)), "DECAFF20"
                                                                 "00000023"
                                                                 "AABBCCDD"
                                                                 "6002"
                                                                 "40"
                                                                 "00"
                                                                 "00000003"
                                                                 "0404"
                                                                 "0000"
                                                                 "0000"
                                                                 "0000"
                                                                 "00000000"
                                                                 "1234" // systems
                                                                 "EF"); // partitions
}

TEST(MaxSessionsRsp, NeedsThreeBytes)
{
    EXPECT_EQ(verdict<MaxSessionsRsp>(Payload().zeros(2)), kTooShort);
    EXPECT_EQ(verdict<MaxSessionsRsp>(Payload().zeros(3)), "accepted");
    EXPECT_EQ(verdict<MaxSessionsRsp>(Payload().zeros(4)), "accepted");
}

TEST(MaxSessionsRsp, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = Payload().u16(0x1234).u8(200);
    for (const auto& frame : {newFrame<MaxSessionsRsp>(payload), oldFrame<MaxSessionsRsp>(payload)}) {
        const auto message = received<MaxSessionsRsp>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getMaxCec(), 0x1234);
        EXPECT_EQ(message.getMaxLpar(), 200);
        EXPECT_EQ(detailsOf(message), "  Data:\n"
                                      "      Max CEC:            4660\n"
                                      "      Max LPAR:           200\n");
    }
}

// --- serial data -----------------------------------------------------------------------------------------------------

template <typename T>
class SerialData : public testing::Test {};
using DataMessages = testing::Types<DataToOs, DataToDax>;
TYPED_TEST_SUITE(SerialData, DataMessages, test::ClassNames);

TYPED_TEST(SerialData, IsBuiltWithACopyOfTheBytes)
{
    char data[] = {'l', '\0', '\xFF', '\n'};
    const TypeParam message(0x1234, 0x5678, 4, data);
    data[0] = 'X';
    EXPECT_EQ(payloadOf(message), "1234"
                                  "5678"
                                  "0004"
                                  "6C00FF0A");
    ASSERT_NE(message.getSerialData(), nullptr);
    EXPECT_EQ(message.getSerialData(), message.getData() + 6);
    EXPECT_EQ(message.getSerialDataLength(), 4);
}

TYPED_TEST(SerialData, IsBuiltWithoutBytes)
{
    for (const char* const data : {static_cast<const char*>(nullptr), "ignored"}) {
        const TypeParam message(0x1234, 0x5678, 0, data);
        EXPECT_EQ(payloadOf(message), "123456780000");
        EXPECT_EQ(message.getSerialDataLength(), 0);
        EXPECT_EQ(message.getSerialData(), nullptr);
    }
}

TYPED_TEST(SerialData, IsBuiltWithTheLargestLength)
{
    const std::string data(65535, 'x');
    const TypeParam message(1, 2, 65535, data.data());
    EXPECT_EQ(message.dataLength(), 65541U);
    EXPECT_EQ(std::string(message.getSerialData(), message.getSerialDataLength()), data);
}

TYPED_TEST(SerialData, NeedsItsFixedPart)
{
    EXPECT_EQ(verdict<TypeParam>(Payload()), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(address().zeros(1)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(address().zeros(2)), "accepted");
}

TYPED_TEST(SerialData, NeedsAllItsBytes)
{
    EXPECT_EQ(verdict<TypeParam>(address().u16(1)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(address().u16(10).zeros(9)), kTooShort);
    EXPECT_EQ(verdict<TypeParam>(address().u16(10).zeros(10)), "accepted");
    EXPECT_EQ(verdict<TypeParam>(address().u16(10).zeros(11)), "accepted");
    EXPECT_EQ(verdict<TypeParam>(address().u16(0xFFFF).zeros(10)), kTooShort);
    // 6 + FFFA wraps to 0 in 16 bits.
    EXPECT_EQ(verdict<TypeParam>(address().u16(0xFFFA)), kTooShort);
}

TYPED_TEST(SerialData, IsNullWhenTheLengthIs0EvenIfBytesFollow)
{
    const auto message = received<TypeParam>(address().u16(0).text("abc"));
    EXPECT_EQ(message.dataLength(), 9U);
    EXPECT_EQ(message.getSerialDataLength(), 0);
    EXPECT_EQ(message.getSerialData(), nullptr);
}

TYPED_TEST(SerialData, ReadsItsFieldsFromEitherForm)
{
    const Payload payload = address().u16(12).text("twelve bytes and a tail");
    for (const auto& frame : {newFrame<TypeParam>(payload), oldFrame<TypeParam>(payload)}) {
        const auto message = received<TypeParam>(frame);
        SCOPED_TRACE(frameOf(message));
        EXPECT_EQ(message.getSerialDataLength(), 12);
        ASSERT_NE(message.getSerialData(), nullptr);
        EXPECT_EQ(std::string(message.getSerialData(), 12), "twelve bytes");
        EXPECT_EQ(detailsOf(message), kAddressText + "      Serial data length: 12\n");
    }
}

TEST(DataToOs, HasItsHeader)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(DataToOs(1, 2, 1, "x")), "DECAFF20"
                                               "00000027"
                                               "00000007"
                                               "6002"
                                               "00" // flags: asynchronous
                                               "00"
                                               "00000007"
                                               "0405"
                                               "0000"
                                               "0000"
                                               "0000"
                                               "00000000"
                                               "00010002000178");
}

TEST(DataToDax, HasItsHeader)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(DataToDax(1, 2, 1, "x")), "DECAFF20"
                                                "00000027"
                                                "00000007"
                                                "7000"
                                                "00" // flags: asynchronous
                                                "00"
                                                "00000007"
                                                "0401"
                                                "0000"
                                                "0000"
                                                "0000"
                                                "00000000"
                                                "00010002000178");
}

// --- setup -----------------------------------------------------------------------------------------------------------

TEST(SetupReq, IsBuilt)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(SetupReq(0x1234, 0x5678)), "DECAFF20"
                                                 "00000024"
                                                 "00000007"
                                                 "6002"
                                                 "80"
                                                 "00"
                                                 "00000004"
                                                 "0406"
                                                 "0000"
                                                 "0000"
                                                 "0000"
                                                 "00000000"
                                                 "1234"
                                                 "5678");
}

TEST(SetupReq, NeedsFourBytes)
{
    EXPECT_EQ(verdict<SetupReq>(Payload().zeros(3)), kTooShort);
    EXPECT_EQ(verdict<SetupReq>(Payload().zeros(4)), "accepted");
    EXPECT_EQ(verdict<SetupReq>(Payload().zeros(5)), "accepted");
}

TEST(SetupReq, PrintsOnlyTheAddress)
{
    EXPECT_EQ(detailsOf(SetupReq(0x1234, 17)), kAddressText);
    EXPECT_EQ(detailsOf(received<SetupReq>(oldFrame<SetupReq>(address()))), kAddressText);
}

// --- session closed --------------------------------------------------------------------------------------------------

TEST(SessionClosed, IsBuilt)
{
    const CallerIdScope ids(6);
    EXPECT_EQ(frameOf(SessionClosed(0x1234, 0x5678, SessionClosed::CloseReasonWriteFailure)), "DECAFF20"
                                                                                              "00000028"
                                                                                              "00000007"
                                                                                              "7000"
                                                                                              "00" // asynchronous
                                                                                              "00"
                                                                                              "00000008"
                                                                                              "A005"
                                                                                              "0000"
                                                                                              "0000"
                                                                                              "0000"
                                                                                              "00000000"
                                                                                              "1234"
                                                                                              "5678"
                                                                                              "00000005"); // reason
}

TEST(SessionClosed, IsBuiltWithAnyReason)
{
    const SessionClosed message(1, 2, static_cast<SessionClosed::CloseReason>(9));
    EXPECT_EQ(payloadOf(message), "0001000200000009");
    EXPECT_EQ(message.getCloseReason(), SessionClosed::CloseReasonUnknown);
}

TEST(SessionClosed, ReasonsHaveTheirNumbers)
{
    EXPECT_EQ(SessionClosed::CloseReasonUnknown, 1U);
    EXPECT_EQ(SessionClosed::CloseReasonForceClose, 2U);
    EXPECT_EQ(SessionClosed::CloseReasonQelShutdown, 3U);
    EXPECT_EQ(SessionClosed::CloseReasonReadFailure, 4U);
    EXPECT_EQ(SessionClosed::CloseReasonWriteFailure, 5U);
    EXPECT_EQ(SessionClosed::CloseReasonMin, 1U);
    EXPECT_EQ(SessionClosed::CloseReasonMax, 5U);
}

TEST(SessionClosed, NeedsEightBytes)
{
    EXPECT_EQ(verdict<SessionClosed>(address().zeros(3)), kTooShort);
    EXPECT_EQ(verdict<SessionClosed>(address().zeros(4)), "accepted");
    EXPECT_EQ(verdict<SessionClosed>(address().zeros(5)), "accepted");
}

TEST(SessionClosed, ReadsUndefinedReasonsAsUnknownAndPrintsTheNumber)
{
    struct Row {
        unsigned int stored;
        unsigned int read;
        const char* printed;
    };
    const Row rows[] = {
        {0, 1, "0"},
        {1, 1, "1"},
        {2, 2, "2"},
        {3, 3, "3"},
        {4, 4, "4"},
        {5, 5, "5"},
        {6, 1, "6"},
        {9, 1, "9"},
        {17, 1, "17"},
        {0x01000002, 1, "16777218"},
        {0xFFFFFFFF, 1, "4294967295"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.stored);
        const Payload payload = address().u32(row.stored);
        for (const auto& frame : {newFrame<SessionClosed>(payload), oldFrame<SessionClosed>(payload)}) {
            const auto message = received<SessionClosed>(frame);
            EXPECT_EQ(message.getCloseReason(), static_cast<SessionClosed::CloseReason>(row.read));
            EXPECT_EQ(detailsOf(message), kAddressText + "      Close reason:       " + row.printed + "\n");
        }
    }
}

} // namespace
} // namespace qel
