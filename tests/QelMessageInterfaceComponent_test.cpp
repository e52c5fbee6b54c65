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
#include <vector>

namespace qel {
namespace {

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

auto refused(const char* phrase) { return ThrowsMessage<QelMessageValidationException>(StrEq(phrase)); }

// --- capabilities ---------------------------------------------------------------------------------------------------

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

TEST(CapabilitiesRsp, CarriesTheRequestedNumberOfBytes)
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

TEST(CapabilitiesRsp, IsNotBuiltWithALengthThatIsNotAMultipleOf4)
{
    for (const unsigned int length : {1U, 2U, 3U, 5U, 6U, 7U, 0xFFFFFFFDU, 0xFFFFFFFEU, 0xFFFFFFFFU}) {
        SCOPED_TRACE(length);
        EXPECT_THAT([=] { CapabilitiesRsp(length, QelCapabilities()); }, refused(kNotAMultipleOf4));
        EXPECT_THAT([=] { CapabilitiesRsp(1, length, QelCapabilities()); }, refused(kNotAMultipleOf4));
    }
}

TEST(CapabilitiesRsp, IsNotBuiltLongerThanTheLengthFieldHolds)
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
    // Not a multiple of 4 and longer than the payload: the first check throws.
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

// --- limits ---------------------------------------------------------------------------------------------------------

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

TEST(LimitsRsp, ConstantsCanBeOdrUsed)
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

TEST(LimitsRsp, IsReadThroughItsDataLayout)
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

// --- time of day ----------------------------------------------------------------------------------------------------

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

TEST(TodRsp, CarriesUtcInAnyTimeZone)
{
    const test::TimeZoneScope zone("TST-13:30"); // UTC+13:30
    std::tm local{};
    ASSERT_NE(::localtime_r(&kMarch2024, &local), nullptr);
    ASSERT_EQ(local.tm_hour, 19); // the time zone is set
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

TEST(TodRsp, IsNotBuiltForYearsOutside0To9999)
{
    struct Row {
        const char* name;
        std::time_t time;
    };
    const Row rows[] = {
        {"after the year 9999", kYear10000},
        {"before the year 0", kYear0 - 1},
        {"a year past the range of int", 67768036191676799}, // the last second that the C library converts
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

TEST(TodRsp, IsReadThroughItsDataLayout)
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

} // namespace
} // namespace qel
