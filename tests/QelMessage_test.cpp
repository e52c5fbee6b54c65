#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/CapturedLog.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <thread>
#include <type_traits>
#include <typeinfo>

namespace qel {
namespace {

using test::bytes;
using test::CallerIdScope;
using test::CapturedLog;
using test::frameOf;
using test::heapCopy;
using test::hex;
using test::MessageProbe;
using test::RawFrame;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

using Header = QelMessage::CommonHeader;

const char* const kDefaultFrame = "DECAFF20" // eyecatcher, version
                                  "00000020" // frame length
                                  "00000000" // caller id
                                  "0000"     // function
                                  "00"       // flags
                                  "00"       // pad length
                                  "00000000" // payload length
                                  "0000"     // operation
                                  "0000"     // status
                                  "0000"     // status detail
                                  "0000"     // reserved
                                  "00000000";

std::vector<char> letters(std::size_t count)
{
    std::vector<char> text;
    for (std::size_t i = 0; i < count; ++i)
        text.push_back(static_cast<char>('a' + i % 26));
    return text;
}

/// A copy that no rule of copying could have changed, for comparing before and after.
std::string payloadOf(const QelMessage& message) { return {message.getData(), message.dataLength()}; }

// --- layout and constants

TEST(QelMessageHeader, LiesOverTheBytesOfTheFrameWithoutAlignment)
{
    EXPECT_EQ(sizeof(Header), 24U);
    EXPECT_EQ(alignof(Header), 1U);
    EXPECT_EQ(sizeof(QelMessage::ExtendedHeader), 8U);
    EXPECT_EQ(alignof(QelMessage::ExtendedHeader), 1U);
}

TEST(QelMessageHeader, KnowsTwoVersionsAndTheirLengths)
{
    const std::map<unsigned char, unsigned int> expected = {{0x00, 24}, {0x20, 32}};
    EXPECT_EQ(Header::QelHeaderVersionToLength, expected);
    EXPECT_EQ(Header::MessageVersion24, 0);
    EXPECT_EQ(Header::MessageVersion32, 32);
    EXPECT_EQ(hex(Header::DaxCmdDesc, sizeof(Header::DaxCmdDesc)), "DECAFF");
}

TEST(QelMessageHeader, GivesEveryVersionTheLengthOfTheTableAndRefusesAllOthers)
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

TEST(QelMessage, NamesTheSizesOfFramesScopedAndUnscoped)
{
    EXPECT_EQ(QelMessage::MtuMax, 16384U);
    EXPECT_EQ(QelMessage::Mtu::MtuMax, 16384U);
    EXPECT_EQ(QelMessage::MaxHeaderSize, 32U);
    EXPECT_EQ(QelMessage::MtuWexMax, 4096U);
    EXPECT_EQ(QelMessage::MaxWexPayloadSize, 4064U);
}

// --- the lengths of a header

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

TEST(QelMessageHeader, OfAnUnknownVersionTakesNoPayloadLength)
{
    Header header{};
    header.mHeaderVersion = 0x10;
    const std::string before = hex(&header, sizeof(header));
    EXPECT_THROW(header.setDataLength(5), std::out_of_range);
    EXPECT_EQ(hex(&header, sizeof(header)), before);
}

// --- building

TEST(QelMessage, BuiltByDefaultIsAHeaderOfZeros) { EXPECT_EQ(frameOf(QelMessage()), kDefaultFrame); }

TEST(QelMessage, BuiltFromArgumentsCarriesThem)
{
    const QelMessage message(0x01020304, 0x6003, 0x010B, MsgResponseExpected);
    EXPECT_EQ(frameOf(message), "DECAFF20"
                                "00000020"
                                "01020304"
                                "6003"
                                "80"
                                "00"
                                "00000000"
                                "010B"
                                "0000"
                                "0000"
                                "0000"
                                "00000000");
    EXPECT_EQ(message.getCallerId(), 0x01020304U);
    EXPECT_EQ(message.getFunction(), QelMessageFunctionQelInterfaceCmp);
    EXPECT_EQ(message.getOperation(), QelMessageOpGetGlobalSaveAreaMetadata);
    EXPECT_EQ(message.getFlags(), MsgResponseExpected);
    EXPECT_EQ(message.getStatus(), QelMessageStatusNoError);
    EXPECT_EQ(message.getStatusDetail(), 0);
    EXPECT_EQ(message.msgLength(), 32U);
    EXPECT_EQ(message.dataLength(), 0U);
    EXPECT_EQ(message.getData(), nullptr);
}

TEST(QelMessage, BuiltWithAPayloadLengthHasThatManyZeros)
{
    const MessageProbe message(std::uint64_t{5});
    EXPECT_EQ(frameOf(message), "DECAFF20"
                                "00000025"
                                "01020304"
                                "6003"
                                "80"
                                "00"
                                "00000005"
                                "0101"
                                "0000"
                                "0000"
                                "0000"
                                "00000000"
                                "0000000000");
    EXPECT_EQ(message.getData(), message.serialize() + 32);
}

TEST(QelMessage, BuiltWithAPayloadLengthOfZeroHasNoPayload)
{
    const MessageProbe message(std::uint64_t{0});
    EXPECT_EQ(message.msgLength(), 32U);
    EXPECT_EQ(message.getData(), nullptr);
}

TEST(QelMessage, IsNotBuiltWithAPayloadThatItsLengthFieldCannotTell)
{
    const std::uint64_t lengths[] = {0xFFFFFFE0, 0xFFFFFFFF, 0x100000000, 0x100000020,
                                     std::numeric_limits<std::uint64_t>::max()};
    for (const std::uint64_t length : lengths) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { MessageProbe message(length); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
    }
}

TEST(QelMessage, MayBeLongerThanAnyStreamAccepts)
{
    const MessageProbe built(std::uint64_t{65581});
    EXPECT_EQ(built.msgLength(), 65613U);
    const std::vector<char> received = RawFrame::newForm().payload(letters(QelMessage::MtuMax)).bytes();
    EXPECT_EQ(MessageProbe(received).msgLength(), 16416U);
}

// --- checking received bytes

struct RejectedCase {
    const char* name;
    std::vector<char> frame;
    const char* text;
    const char* log; // "*" stands for leading zeros, however many
};

testing::Matcher<std::string> isLine(const std::string& pattern)
{
    const std::size_t star = pattern.find('*');
    if (star == std::string::npos) return StrEq(pattern);
    return testing::AllOf(testing::StartsWith(pattern.substr(0, star)), testing::EndsWith(pattern.substr(star + 1)));
}

/// The first `length` bytes of a frame.
std::vector<char> cut(std::vector<char> frame, std::size_t length)
{
    frame.resize(length);
    return frame;
}

RawFrame badEyecatcher() { return RawFrame::newForm().eyecatcher(0xDE, 0xCA, 0xFE); }

std::vector<RejectedCase> rejectedCases()
{
    const RawFrame newForm = RawFrame::newForm();
    const RawFrame oldForm = RawFrame::oldForm();
    return {
        // one for each check
        {"Empty", {}, "i_length shorter than old header", "E: bad length = 0x00000000"},
        {"OneByte", cut(newForm.bytes(), 1), "i_length shorter than old header", "E: bad length = 0x00000001"},
        {"BelowOldHeader", cut(newForm.bytes(), 23), "i_length shorter than old header", "E: bad length = 0x00000017"},
        {"FirstEyecatcherByte", RawFrame(newForm).eyecatcher(0xDD, 0xCA, 0xFF).bytes(), "i_buffer bad eyecatcher",
         "E: bad eyecatcher = 0xDDCAFF"},
        {"SecondEyecatcherByte", RawFrame(newForm).eyecatcher(0xDE, 0x00, 0xFF).bytes(), "i_buffer bad eyecatcher",
         "E: bad eyecatcher = 0xDE00FF"},
        {"ThirdEyecatcherByte", badEyecatcher().bytes(), "i_buffer bad eyecatcher", "E: bad eyecatcher = 0xDECAFE"},
        {"NewHeaderCutShort", cut(newForm.bytes(), 31), "i_length shorter than new header",
         "E: bad length = 0x0000001F"},
        {"NewHeaderCutToOldLength", cut(newForm.bytes(), 24), "i_length shorter than new header",
         "E: bad length = 0x00000018"},
        {"MsgLengthBeyondBuffer", RawFrame(newForm).msgLength(33).bytes(), "i_length shorter than total message length",
         "E: i_length shorter than message length field in header"},
        {"MsgLengthFarBeyondBuffer", RawFrame(newForm).msgLength(0xFFFFFFFF).bytes(),
         "i_length shorter than total message length", "E: i_length shorter than message length field in header"},
        {"PayloadCutShort", cut(RawFrame(newForm).payload(letters(10)).bytes(), 41),
         "i_length shorter than total message length", "E: i_length shorter than message length field in header"},
        {"UnknownVersion", RawFrame(newForm).version(0x10).bytes(), "i_buffer bad header version",
         "E: bad header version = 0x10"},
        {"HighestVersion", RawFrame(newForm).version(0xFF).bytes(), "i_buffer bad header version",
         "E: bad header version = 0xFF"},
        {"OldPadOneShort", RawFrame(oldForm).pad(15).bytes(), "i_buffer bad header pad length",
         "E: bad header pad length (old) = 0x0F < expected 0x*10"},
        {"OldPadMissing", RawFrame(oldForm).pad(0).payload(letters(10)).bytes(), "i_buffer bad header pad length",
         "E: bad header pad length (old) = 0x00 < expected 0x*06"},
        {"OldPadMissingForOneByte", RawFrame(oldForm).pad(0).payload(letters(15)).bytes(),
         "i_buffer bad header pad length", "E: bad header pad length (old) = 0x00 < expected 0x*01"},
        {"MsgLengthTooSmall", RawFrame(newForm).payload(letters(10)).msgLength(41).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x00000029"},
        {"MsgLengthZero", RawFrame(newForm).msgLength(0).bytes(), "i_buffer bad MsgLength in header",
         "E: bad header MsgLength = 0x00000000"},
        {"DataLengthTooBig", RawFrame(newForm).payload(letters(10)).dataLength(11).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x0000002A"},
        {"DataLengthTooSmall", RawFrame(newForm).payload(letters(10)).dataLength(9).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x0000002A"},
        {"NewPadIsCounted", RawFrame(newForm).pad(4).msgLength(32).bytes(), "i_buffer bad MsgLength in header",
         "E: bad header MsgLength = 0x00000020"},
        {"OldPadIsCounted", RawFrame(oldForm).pad(20).msgLength(40).bytes(), "i_buffer bad MsgLength in header",
         "E: bad header MsgLength = 0x00000028"},
        {"OldLongPayloadLengths", RawFrame(oldForm).payload(letters(17)).msgLength(40).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x00000028"},
        // the sum of the lengths is 2^32 + 32 and must not be taken for 32
        {"LengthsThatWouldWrap", RawFrame(newForm).dataLength(0xFFFFFFFF).pad(1).msgLength(32).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x00000020"},
        {"LengthsThatWouldWrapInTheOldForm", RawFrame(oldForm).dataLength(0xFFFFFFFF).pad(17).msgLength(40).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x00000028"},

        // two things wrong at once: the earlier check speaks
        {"LengthBeforeEyecatcher", cut(badEyecatcher().bytes(), 23), "i_length shorter than old header",
         "E: bad length = 0x00000017"},
        {"EyecatcherBeforeNewHeader", cut(badEyecatcher().bytes(), 31), "i_buffer bad eyecatcher",
         "E: bad eyecatcher = 0xDECAFE"},
        {"NewHeaderBeforeMsgLength", cut(RawFrame(newForm).msgLength(100).bytes(), 31),
         "i_length shorter than new header", "E: bad length = 0x0000001F"},
        {"NewHeaderBeforeVersion", cut(RawFrame(newForm).version(0x10).bytes(), 24), "i_length shorter than new header",
         "E: bad length = 0x00000018"},
        {"MsgLengthBeforeVersion", RawFrame(newForm).version(0x10).msgLength(33).bytes(),
         "i_length shorter than total message length", "E: i_length shorter than message length field in header"},
        {"MsgLengthBeforePad", cut(oldForm.bytes(), 24), "i_length shorter than total message length",
         "E: i_length shorter than message length field in header"},
        {"VersionBeforeLengths", RawFrame(newForm).version(0x01).msgLength(31).bytes(), "i_buffer bad header version",
         "E: bad header version = 0x01"},
        {"PadBeforeLengths", RawFrame(oldForm).pad(15).msgLength(38).bytes(), "i_buffer bad header pad length",
         "E: bad header pad length (old) = 0x0F < expected 0x*10"},
        // the old form may be as short as its header, but cannot be consistent then
        {"OldHeaderAlone", RawFrame(oldForm).pad(0).bytes(), "i_buffer bad header pad length",
         "E: bad header pad length (old) = 0x00 < expected 0x*10"},
        {"OldHeaderBelowNewLength", RawFrame(oldForm).payload(letters(7)).pad(0).bytes(),
         "i_buffer bad header pad length", "E: bad header pad length (old) = 0x00 < expected 0x*09"},
    };
}

class QelMessageRejected : public testing::TestWithParam<RejectedCase> {};

TEST_P(QelMessageRejected, NamesTheFirstThingThatIsWrongAndLogsItsValues)
{
    const std::unique_ptr<char[]> frame = heapCopy(GetParam().frame);
    const unsigned int length = static_cast<unsigned int>(GetParam().frame.size());
    CapturedLog log;
    EXPECT_THAT([&] { Header::validate(frame.get(), length); },
                ThrowsMessage<QelMessageValidationException>(StrEq(GetParam().text)));
    EXPECT_THAT(log.lines(), ElementsAre(isLine(GetParam().log)));

    log.clear();
    EXPECT_THAT([&] { QelMessage message(frame.get(), length); },
                ThrowsMessage<QelMessageValidationException>(StrEq(GetParam().text)));
    EXPECT_THAT(log.lines(), ElementsAre(isLine(GetParam().log)));
}

INSTANTIATE_TEST_SUITE_P(, QelMessageRejected, testing::ValuesIn(rejectedCases()),
                         [](const auto& row) { return std::string(row.param.name); });

TEST(QelMessage, RejectsANullBufferWithoutALine)
{
    CapturedLog log;
    for (const unsigned int length : {0U, 23U, 24U, 100U}) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { Header::validate(nullptr, length); },
                    ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer")));
        EXPECT_THAT([&] { QelMessage message(nullptr, length); },
                    ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer")));
    }
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(QelMessage, RejectsEveryUnknownVersion)
{
    for (unsigned int version = 0; version <= 0xFF; ++version) {
        if (version == 0x00 || version == 0x20) continue;
        SCOPED_TRACE(version);
        const std::vector<char> frame = RawFrame::newForm().version(version).payload(letters(8)).bytes();
        EXPECT_THAT([&] { MessageProbe message(frame); },
                    ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer bad header version")));
    }
}

TEST(QelMessage, RejectsEveryTruncation)
{
    for (const RawFrame& form : {RawFrame::newForm().payload(letters(21)).pad(3),
                                 RawFrame::oldForm().payload(letters(5)), RawFrame::oldForm().payload(letters(30))}) {
        const std::vector<char> whole = form.bytes();
        for (std::size_t length = 0; length < whole.size(); ++length) {
            SCOPED_TRACE(length);
            EXPECT_THROW(MessageProbe(cut(whole, length)), QelMessageValidationException);
        }
        EXPECT_NO_THROW(MessageProbe{whole});
    }
}

TEST(QelMessage, WritesNothingToTheLogForAGoodFrame)
{
    CapturedLog log;
    MessageProbe message(RawFrame::newForm().payload(letters(3)).bytes());
    EXPECT_THAT(log.lines(), IsEmpty());
}

struct AcceptedCase {
    const char* name;
    std::vector<char> frame;
    unsigned int headerLength;
    std::vector<char> payload;
};

class QelMessageAccepted : public testing::TestWithParam<AcceptedCase> {};

TEST_P(QelMessageAccepted, IsKeptByteForByte)
{
    const std::unique_ptr<char[]> frame = heapCopy(GetParam().frame);
    const unsigned int length = static_cast<unsigned int>(GetParam().frame.size());

    const Header* const header = Header::validate(frame.get(), length);
    EXPECT_EQ(static_cast<const void*>(header), frame.get()) << "a view of the caller's own bytes";
    EXPECT_EQ(header->getHeaderLength(), GetParam().headerLength);

    const QelMessage message(frame.get(), length);
    EXPECT_NE(message.serialize(), frame.get());
    EXPECT_EQ(frameOf(message), hex(GetParam().frame));
    EXPECT_EQ(message.msgLength(), length);
    EXPECT_EQ(message.dataLength(), GetParam().payload.size());
    if (GetParam().payload.empty()) {
        EXPECT_EQ(message.getData(), nullptr);
    } else {
        EXPECT_EQ(message.getData(), message.serialize() + GetParam().headerLength);
        EXPECT_EQ(hex(message.getData(), message.dataLength()), hex(GetParam().payload));
    }
}

INSTANTIATE_TEST_SUITE_P(
    , QelMessageAccepted,
    testing::Values(AcceptedCase{"NewEmpty", RawFrame::newForm().bytes(), 32, {}},
                    AcceptedCase{"NewOneByte", RawFrame::newForm().payload(letters(1)).bytes(), 32, letters(1)},
                    AcceptedCase{"NewWithPad", RawFrame::newForm().payload(letters(9)).pad(4).bytes(), 32, letters(9)},
                    AcceptedCase{"NewWithPadAlone", RawFrame::newForm().pad(255).bytes(), 32, {}},
                    AcceptedCase{"NewWithReservedFieldsSet",
                                 RawFrame::newForm().reserved2(0xFFFF).reserved3(0xFFFFFFFF).bytes(),
                                 32,
                                 {}},
                    AcceptedCase{"OldEmpty", RawFrame::oldForm().bytes(), 24, {}},
                    AcceptedCase{"OldSixteen", RawFrame::oldForm().payload(letters(16)).bytes(), 24, letters(16)},
                    AcceptedCase{"OldSeventeen", RawFrame::oldForm().payload(letters(17)).bytes(), 24, letters(17)},
                    AcceptedCase{"OldPadLargerThanNeeded", RawFrame::oldForm().pad(20).bytes(), 24, {}},
                    AcceptedCase{"OldPadWhereNoneIsNeeded", RawFrame::oldForm().payload(letters(30)).pad(7).bytes(), 24,
                                 letters(30)}),
    [](const auto& row) { return std::string(row.param.name); });

TEST(QelMessage, IgnoresBytesBehindTheFrame)
{
    const std::vector<char> frame = RawFrame::newForm().payload(letters(6)).bytes();
    std::vector<char> longer = frame;
    longer.insert(longer.end(), 50, 'x');
    EXPECT_EQ(frameOf(MessageProbe(longer)), hex(frame));
}

TEST(QelMessage, IsReadFromAnyAddress)
{
    const std::vector<char> frame = RawFrame::newForm()
                                        .callerId(0xA1B2C3D4)
                                        .function(0x6003)
                                        .operation(0x0101)
                                        .status(5)
                                        .payload(letters(3))
                                        .bytes();
    for (std::size_t offset = 0; offset < 8; ++offset) {
        SCOPED_TRACE(offset);
        std::vector<char> shifted(offset, 'x');
        shifted.insert(shifted.end(), frame.begin(), frame.end());
        const std::unique_ptr<char[]> buffer = heapCopy(shifted);
        const unsigned int length = static_cast<unsigned int>(frame.size());
        EXPECT_EQ(Header::validate(buffer.get() + offset, length)->mCallerId.value(), 0xA1B2C3D4U);
        EXPECT_EQ(frameOf(QelMessage(buffer.get() + offset, length)), hex(frame));
    }
}

// --- reading

TEST(QelMessage, ReadsEveryFieldOfANewHeader)
{
    const MessageProbe message(RawFrame::newForm()
                                   .callerId(0xF1E2D3C4)
                                   .function(0x7000)
                                   .operation(0xA005)
                                   .flags(0xFF)
                                   .status(0x8006)
                                   .statusDetail(0x1234)
                                   .payload(letters(4))
                                   .pad(2)
                                   .bytes());
    EXPECT_EQ(message.getCallerId(), 0xF1E2D3C4U);
    EXPECT_EQ(message.getFunction(), QelMessageFunctionDax);
    EXPECT_EQ(message.getOperation(), QelMessageOpSendVirtualSerialSessionClosed);
    EXPECT_EQ(message.getFlags(), 0xFF);
    EXPECT_EQ(message.getStatus(), QelMessageStatusHypervisorGenericError);
    EXPECT_EQ(message.getStatusDetail(), 0x1234);
    EXPECT_EQ(message.msgLength(), 38U);
    EXPECT_EQ(message.dataLength(), 4U);
    EXPECT_EQ(payloadOf(message), "abcd");
}

TEST(QelMessage, ReadsEveryFieldOfAnOldHeader)
{
    const MessageProbe message(RawFrame::oldForm()
                                   .callerId(0xF1E2D3C4)
                                   .function(0x6002)
                                   .operation(0x0402)
                                   .flags(0x80)
                                   .status(19)
                                   .payload(letters(4))
                                   .bytes());
    EXPECT_EQ(message.getCallerId(), 0xF1E2D3C4U);
    EXPECT_EQ(message.getFunction(), QelMessageFunctionVirtualSerial);
    EXPECT_EQ(message.getOperation(), QelMessageOpOpenVirtualSerialSession);
    EXPECT_EQ(message.getFlags(), MsgResponseExpected);
    EXPECT_EQ(message.getStatus(), QelMessageStatusConnectionNotAvailable);
    EXPECT_EQ(message.getStatusDetail(), 0) << "there is no such field";
    EXPECT_EQ(message.msgLength(), 40U);
    EXPECT_EQ(message.dataLength(), 4U);
    EXPECT_EQ(payloadOf(message), "abcd");
}

TEST(QelMessage, TellsItsClassificationByTheFlags)
{
    EXPECT_EQ(QelMessage(1, 2, 3, MsgResponseExpected).getClassification(), QelMessageClassification::Request);
    EXPECT_EQ(QelMessage(1, 2, 3, MsgResponse).getClassification(), QelMessageClassification::Response);
    EXPECT_EQ(QelMessage(1, 2, 3, NoFlagSet).getClassification(), QelMessageClassification::Async);
    EXPECT_EQ(QelMessage(1, 2, 3, MsgResponse | MsgResponseExpected).getClassification(),
              QelMessageClassification::Unknown);
}

TEST(QelMessage, AccessorsGiveTheTypesThatPrintWithNames)
{
    const QelMessage message;
    static_assert(std::is_same<decltype(message.getFunction()), QelMessageFunctionCodes>::value, "");
    static_assert(std::is_same<decltype(message.getOperation()), QelMessageOpTypes>::value, "");
    static_assert(std::is_same<decltype(message.getFlags()), QelMessageFlags>::value, "");
    static_assert(std::is_same<decltype(message.getStatus()), QelMessageStatusCodes>::value, "");
    std::ostringstream os;
    os << message.getFunction();
    EXPECT_EQ(os.str(), "0x0000 (QelMessageFunctionInvalid)");
}

TEST(QelMessage, ShowsDerivedClassesTheFrameInPlace)
{
    MessageProbe newForm(RawFrame::newForm().payload(letters(4)).bytes());
    EXPECT_EQ(newForm.pGetMessage(), newForm.serialize());
    EXPECT_EQ(static_cast<const void*>(newForm.pGetHeader()), newForm.serialize());
    EXPECT_EQ(static_cast<const void*>(newForm.pGetExtendedHeader()), newForm.serialize() + 24);
    EXPECT_EQ(newForm.pGetData(), newForm.serialize() + 32);
    EXPECT_EQ(static_cast<const void*>(&newForm.pPayload<be_uint32_t>()), newForm.serialize() + 32);
    EXPECT_EQ(newForm.pPayload<be_uint32_t>().value(), 0x61626364U);

    MessageProbe oldForm(RawFrame::oldForm().payload(letters(4)).bytes());
    EXPECT_EQ(oldForm.pGetExtendedHeader(), nullptr);
    EXPECT_EQ(oldForm.pGetData(), oldForm.serialize() + 24);
    EXPECT_EQ(oldForm.pPayload<be_uint32_t>().value(), 0x61626364U);

    const MessageProbe& constant = oldForm;
    EXPECT_EQ(constant.pGetMessage(), oldForm.serialize());
    EXPECT_EQ(static_cast<const void*>(constant.pGetHeader()), oldForm.serialize());
    EXPECT_EQ(constant.pGetExtendedHeader(), nullptr);
    EXPECT_EQ(constant.pGetData(), oldForm.serialize() + 24);
    EXPECT_EQ(constant.pPayload<be_uint32_t>().value(), 0x61626364U);

    const MessageProbe empty;
    EXPECT_EQ(empty.pGetData(), nullptr);
}

TEST(QelMessage, WritesThroughTheHeaderInPlace)
{
    MessageProbe message;
    message.pGetHeader()->mStatus = QelMessageStatusCmdFailed;
    message.pGetExtendedHeader()->mStatusDetail = 0xBEEF;
    EXPECT_EQ(message.getStatus(), QelMessageStatusCmdFailed);
    EXPECT_EQ(message.getStatusDetail(), 0xBEEF);
    EXPECT_EQ(hex(message.serialize() + 22, 4), "0006BEEF");
}

TEST(QelMessage, WhoseVersionWasBrokenFailsAsTheTableDoes)
{
    MessageProbe message(std::uint64_t{4});
    message.pGetHeader()->mHeaderVersion = 0x10;
    EXPECT_THROW(message.pGetHeader()->getHeaderLength(), std::out_of_range);
    EXPECT_THROW(message.getData(), std::out_of_range);
    EXPECT_THROW(message.pAllocData(3), std::out_of_range);
}

// --- copying

TEST(QelMessage, CopiesTheWholeFrame)
{
    const std::vector<char> frame = RawFrame::newForm().callerId(7).payload(letters(12)).pad(3).bytes();
    const MessageProbe original(frame);
    const QelMessage copy(original);
    EXPECT_EQ(frameOf(copy), hex(frame));
    EXPECT_NE(copy.serialize(), original.serialize());
}

TEST(QelMessage, AssignmentReplacesTheFrameWhateverItsSize)
{
    const MessageProbe longer(RawFrame::newForm().callerId(7).payload(letters(100)).bytes());
    const MessageProbe shorter(RawFrame::oldForm().callerId(8).bytes());
    QelMessage target;
    target = longer;
    EXPECT_EQ(frameOf(target), frameOf(longer));
    target = shorter;
    EXPECT_EQ(frameOf(target), frameOf(shorter));
    EXPECT_EQ(&(target = longer), &target);
}

TEST(QelMessage, AssignmentToItselfStaysWithinItsMemory)
{
    MessageProbe message(RawFrame::newForm().payload(letters(40)).bytes());
    const QelMessage& itself = message;
    static_cast<QelMessage&>(message) = itself;
    EXPECT_NE(message.serialize(), nullptr);
}

TEST(QelMessage, MovingCopiesAndLeavesTheSourceWhole)
{
    const std::vector<char> frame = RawFrame::newForm().callerId(9).payload(letters(5)).bytes();
    MessageProbe source(frame);
    const QelMessage constructed(std::move(static_cast<QelMessage&>(source)));
    EXPECT_EQ(frameOf(constructed), hex(frame));
    EXPECT_EQ(frameOf(source), hex(frame));

    QelMessage assigned;
    assigned = std::move(static_cast<QelMessage&>(source));
    EXPECT_EQ(frameOf(assigned), hex(frame));
    EXPECT_EQ(frameOf(source), hex(frame));
}

TEST(QelMessage, CloneIsAPlainMessageWithTheSameFrame)
{
    const std::vector<char> frame = RawFrame::oldForm().callerId(9).payload(letters(5)).bytes();
    const MessageProbe probe(frame);
    const QelMessage message(probe);
    const std::unique_ptr<QelMessage> copy = message.clone();
    const QelMessage& copied = *copy;
    EXPECT_EQ(typeid(copied), typeid(QelMessage));
    EXPECT_NE(copy->serialize(), message.serialize());
    EXPECT_EQ(frameOf(*copy), hex(frame));
}

// --- changing the payload

TEST(QelMessage, NewPayloadIsZeroAndTheOldOneIsDropped)
{
    MessageProbe message(RawFrame::newForm().payload(letters(8)).bytes());
    char* const data = message.pAllocData(12);
    EXPECT_EQ(data, message.pGetData());
    EXPECT_EQ(hex(message.getData(), message.dataLength()), "000000000000000000000000");
    EXPECT_EQ(message.msgLength(), 44U);
}

TEST(QelMessage, NewPayloadOfZeroBytesIsNone)
{
    MessageProbe message(RawFrame::newForm().payload(letters(8)).bytes());
    EXPECT_EQ(message.pAllocData(0), nullptr);
    EXPECT_EQ(message.getData(), nullptr);
    EXPECT_EQ(message.dataLength(), 0U);
    EXPECT_EQ(message.msgLength(), 32U);
}

TEST(QelMessage, NewPayloadKeepsAllOtherFieldsOfANewHeader)
{
    RawFrame frame = RawFrame::newForm();
    frame.callerId(0x11223344).function(0x6003).flags(0xC1).operation(0x0104).status(0x0007).statusDetail(0x5566);
    frame.reserved2(0x7788).reserved3(0x99AABBCC);
    MessageProbe message(RawFrame(frame).payload(letters(8)).pad(4).bytes());
    message.pAllocData(3);
    EXPECT_EQ(frameOf(message), hex(RawFrame(frame).payload(bytes({0, 0, 0})).pad(4).bytes()))
        << "the pad of a received frame in the new form is kept";
}

TEST(QelMessage, NewPayloadKeepsTheOldFormAndPadsIt)
{
    RawFrame frame = RawFrame::oldForm();
    frame.callerId(0x11223344).function(0x6002).flags(0x40).operation(0x0402).status(0x0009);
    struct {
        unsigned int payload;
        unsigned int pad;
    } const cases[] = {{0, 16}, {1, 15}, {16, 0}, {17, 0}, {40, 0}};
    for (const auto& row : cases) {
        SCOPED_TRACE(row.payload);
        MessageProbe message(RawFrame(frame).payload(letters(3)).pad(20).bytes());
        message.pAllocData(row.payload);
        EXPECT_EQ(frameOf(message),
                  hex(RawFrame(frame).payload(std::vector<char>(row.payload, '\0')).pad(row.pad).bytes()));
    }
}

TEST(QelMessage, NewPayloadThatDoesNotFitChangesNothing)
{
    const std::vector<char> frames[] = {RawFrame::newForm().payload(letters(8)).bytes(),
                                        RawFrame::newForm().payload(letters(8)).pad(32).bytes(),
                                        RawFrame::oldForm().payload(letters(8)).bytes()};
    for (const std::vector<char>& frame : frames) {
        MessageProbe message(frame);
        const char* const before = message.serialize();
        for (const unsigned int length : {0xFFFFFFE8U, 0xFFFFFFFFU}) {
            EXPECT_THAT([&] { message.pAllocData(length); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
            EXPECT_THAT([&] { message.pSetData("x", length); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
        }
        EXPECT_EQ(message.serialize(), before);
        EXPECT_EQ(frameOf(message), hex(frame));
    }
}

TEST(QelMessage, SetPayloadCopiesTheBytes)
{
    MessageProbe message(std::uint64_t{2});
    const std::vector<char> data = bytes({0x00, 0xFF, 0x0A});
    message.pSetData(heapCopy(data).get(), 3);
    EXPECT_EQ(hex(message.getData(), message.dataLength()), "00FF0A");
    EXPECT_EQ(message.msgLength(), 35U);
    EXPECT_EQ(message.getCallerId(), 0x01020304U);
}

TEST(QelMessage, SetPayloadOfNothingClearsIt)
{
    MessageProbe message(std::uint64_t{2});
    message.pSetData(nullptr, 0);
    EXPECT_EQ(message.getData(), nullptr);
    EXPECT_EQ(message.msgLength(), 32U);

    message.pSetData("abc", 3);
    message.pSetData("abc", 0);
    EXPECT_EQ(message.getData(), nullptr);
}

TEST(QelMessage, SetPayloadFromNowhereChangesNothing)
{
    const std::vector<char> frame = RawFrame::newForm().payload(letters(8)).bytes();
    MessageProbe message(frame);
    const char* const before = message.serialize();
    for (const unsigned int length : {1U, 100U, 0xFFFFFFFFU}) {
        EXPECT_THAT([&] { message.pSetData(nullptr, length); }, ThrowsMessage<std::invalid_argument>(StrEq("data")));
    }
    EXPECT_EQ(message.serialize(), before);
    EXPECT_EQ(frameOf(message), hex(frame));
}

TEST(QelMessage, SetPayloadTakesBytesOfItsOwnPayload)
{
    MessageProbe message(RawFrame::newForm().payload(letters(20)).bytes());
    message.pSetData(message.getData() + 5, 6);
    EXPECT_EQ(payloadOf(message), "fghijk");
    message.pSetData(message.getData(), 6);
    EXPECT_EQ(payloadOf(message), "fghijk");
}

// --- status

TEST(QelMessage, WithoutAStatusPassesTheCheck) { EXPECT_NO_THROW(QelMessage().checkStatus()); }

TEST(QelMessage, WithAStatusFailsTheCheck)
{
    for (const unsigned int status : {1U, 5U, 0x8006U, 0xFFFFU}) {
        SCOPED_TRACE(status);
        const MessageProbe message(RawFrame::newForm().status(status).bytes());
        EXPECT_THROW(message.checkStatus(), QelMessageStatusException);
    }
}

TEST(QelMessage, StatusCheckDoesNotLookAtTheDetail)
{
    EXPECT_NO_THROW(MessageProbe(RawFrame::newForm().statusDetail(7).bytes()).checkStatus());
}

// --- caller ids

// A process of its own, because every other test may take ids: the death test runs this one alone in a fresh process.
TEST(QelMessageCallerIdDeathTest, FirstOfAProcessIsTwo)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            const bool right = QelMessage::generateNextUint32() == 2 && QelMessage::generateNextUint32() == 3;
            std::exit(right ? 42 : 1);
        },
        testing::ExitedWithCode(42), "");
}

TEST(QelMessageCallerId, GrowsByOne)
{
    CallerIdScope scope(100);
    EXPECT_EQ(QelMessage::generateNextUint32(), 101U);
    EXPECT_EQ(QelMessage::generateNextUint32(), 102U);
}

TEST(QelMessageCallerId, GoesRound)
{
    CallerIdScope scope(0xFFFFFFFE);
    EXPECT_EQ(QelMessage::generateNextUint32(), 0xFFFFFFFFU);
    EXPECT_EQ(QelMessage::generateNextUint32(), 0U);
    EXPECT_EQ(QelMessage::generateNextUint32(), 1U);
}

TEST(QelMessageCallerId, IsNotTakenByPlainMessages)
{
    CallerIdScope scope(100);
    QelMessage empty;
    QelMessage built(5, 0x6003, 0x0101, MsgResponseExpected);
    MessageProbe received(RawFrame::newForm().callerId(6).bytes());
    QelMessage copy(received);
    empty = copy;
    const std::unique_ptr<QelMessage> clone = copy.clone();
    received.pAllocData(10);
    EXPECT_EQ(scope.last(), 100U);
    EXPECT_EQ(built.getCallerId(), 5U);
    EXPECT_EQ(clone->getCallerId(), 6U);
}

TEST(QelMessageCallerId, IsUniqueAcrossThreads)
{
    static_assert(std::atomic<unsigned int>::is_always_lock_free, "ids are taken without a lock");
    constexpr unsigned int kThreads = 4;
    constexpr unsigned int kIds = 2000;
    CallerIdScope scope(1000);
    std::vector<std::vector<unsigned int>> taken(kThreads);
    std::vector<std::thread> threads;
    for (std::vector<unsigned int>& ids : taken) {
        threads.emplace_back([&ids] {
            for (unsigned int i = 0; i < kIds; ++i)
                ids.push_back(QelMessage::generateNextUint32());
        });
    }
    for (std::thread& thread : threads)
        thread.join();

    std::vector<unsigned int> all;
    for (const std::vector<unsigned int>& ids : taken) {
        EXPECT_TRUE(std::is_sorted(ids.begin(), ids.end()));
        all.insert(all.end(), ids.begin(), ids.end());
    }
    std::sort(all.begin(), all.end());
    ASSERT_EQ(all.size(), kThreads * kIds);
    for (unsigned int i = 0; i < all.size(); ++i)
        ASSERT_EQ(all[i], 1001 + i);
}

} // namespace
} // namespace qel
