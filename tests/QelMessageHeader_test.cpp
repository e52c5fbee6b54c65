#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <stdexcept>
#include <string>

namespace qel {
namespace {

using test::hex;
using testing::StrEq;
using testing::ThrowsMessage;

using Header = QelMessage::CommonHeader;

TEST(QelMessageHeader, HasTheSizeOfTheWireHeaderAndAlignment1)
{
    EXPECT_EQ(sizeof(Header), 24U);
    EXPECT_EQ(alignof(Header), 1U);
    EXPECT_EQ(sizeof(QelMessage::ExtendedHeader), 8U);
    EXPECT_EQ(alignof(QelMessage::ExtendedHeader), 1U);
}

TEST(QelMessageHeader, ListsTwoVersionsAndTheirLengths)
{
    const std::map<unsigned char, unsigned int> expected = {{0x00, 24}, {0x20, 32}};
    EXPECT_EQ(Header::QelHeaderVersionToLength, expected);
    EXPECT_EQ(Header::MessageVersion24, 0);
    EXPECT_EQ(Header::MessageVersion32, 32);
    EXPECT_EQ(hex(Header::DaxCmdDesc, sizeof(Header::DaxCmdDesc)), "DECAFF");
}

TEST(QelMessageHeader, ReturnsTheLengthOfTheTableAndThrowsForAllOtherVersions)
{
    Header header{};
    for (unsigned int version = 0; version <= 0xFF; ++version) {
        SCOPED_TRACE(version);
        header.mHeaderVersion = static_cast<unsigned char>(version);
        const auto row = Header::QelHeaderVersionToLength.find(header.mHeaderVersion);
        if (row == Header::QelHeaderVersionToLength.end()) {
            EXPECT_THROW(header.getHeaderLength(), std::out_of_range);
            EXPECT_THROW(header.hasExtendedFields(), std::out_of_range);
        } else {
            EXPECT_EQ(header.getHeaderLength(), row->second);
            EXPECT_EQ(header.hasExtendedFields(), row->second > 31);
        }
    }
}

struct LengthCase {
    const char* name;
    unsigned char version;
    unsigned char padBefore;
    unsigned int dataLength;
    unsigned char pad;
    unsigned int msgLength;
};

class QelMessageHeaderLengths : public testing::TestWithParam<LengthCase> {};

TEST_P(QelMessageHeaderLengths, FollowThePayload)
{
    Header header{};
    header.mHeaderVersion = GetParam().version;
    header.mPadLength = GetParam().padBefore;
    header.setDataLength(GetParam().dataLength);
    EXPECT_EQ(header.mDataLength.value(), GetParam().dataLength);
    EXPECT_EQ(header.mPadLength, GetParam().pad);
    EXPECT_EQ(header.mMsgLength.value(), GetParam().msgLength);
}

INSTANTIATE_TEST_SUITE_P(
    , QelMessageHeaderLengths,
    testing::Values(LengthCase{"OldEmpty", 0x00, 0, 0, 16, 40}, LengthCase{"OldOne", 0x00, 0, 1, 15, 40},
                    LengthCase{"OldFifteen", 0x00, 0, 15, 1, 40}, LengthCase{"OldSixteen", 0x00, 0, 16, 0, 40},
                    LengthCase{"OldSeventeen", 0x00, 0, 17, 0, 41}, LengthCase{"OldForty", 0x00, 0, 40, 0, 64},
                    LengthCase{"OldPadIsResetAboveSixteen", 0x00, 9, 17, 0, 41},
                    LengthCase{"OldPadIsRecomputedBelow", 0x00, 200, 10, 6, 40},
                    LengthCase{"OldLongest", 0x00, 0, 0xFFFFFFE7, 0, 0xFFFFFFFF},
                    LengthCase{"NewEmpty", 0x20, 0, 0, 0, 32}, LengthCase{"NewSeventeen", 0x20, 0, 17, 0, 49},
                    LengthCase{"NewPadIsKept", 0x20, 4, 10, 4, 46},
                    LengthCase{"NewPadIsKeptWithoutPayload", 0x20, 255, 0, 255, 287},
                    LengthCase{"NewLongest", 0x20, 0, 0xFFFFFFDF, 0, 0xFFFFFFFF},
                    LengthCase{"NewLongestWithPad", 0x20, 4, 0xFFFFFFDB, 4, 0xFFFFFFFF}),
    [](const auto& row) { return std::string(row.param.name); });

class QelMessageHeaderTooLong : public testing::TestWithParam<LengthCase> {};

TEST_P(QelMessageHeaderTooLong, IsRefusedAndNothingChanges)
{
    Header header{};
    header.mHeaderVersion = GetParam().version;
    header.mPadLength = GetParam().padBefore;
    header.mDataLength = 7;
    header.mMsgLength = 9;
    const std::string before = hex(&header, sizeof(header));
    EXPECT_THAT([&] { header.setDataLength(GetParam().dataLength); },
                ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_EQ(hex(&header, sizeof(header)), before);
}

INSTANTIATE_TEST_SUITE_P(, QelMessageHeaderTooLong,
                         testing::Values(LengthCase{"OldByOne", 0x00, 0, 0xFFFFFFE8, 0, 0},
                                         LengthCase{"OldMost", 0x00, 0, 0xFFFFFFFF, 0, 0},
                                         LengthCase{"NewByOne", 0x20, 0, 0xFFFFFFE0, 0, 0},
                                         LengthCase{"NewByOneWithPad", 0x20, 4, 0xFFFFFFDC, 0, 0},
                                         LengthCase{"NewMost", 0x20, 255, 0xFFFFFFFF, 0, 0}),
                         [](const auto& row) { return std::string(row.param.name); });

TEST(QelMessageHeader, OfAnUnknownVersionRefusesAPayloadLength)
{
    Header header{};
    header.mHeaderVersion = 0x10;
    const std::string before = hex(&header, sizeof(header));
    EXPECT_THROW(header.setDataLength(5), std::out_of_range);
    EXPECT_EQ(hex(&header, sizeof(header)), before);
}

} // namespace
} // namespace qel
