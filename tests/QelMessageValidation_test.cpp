#include <qel/common/QelMessage.hpp>

#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <cstddef>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <memory>
#include <string>
#include <vector>

namespace qel {
namespace {

using test::CapturedLog;
using test::frameOf;
using test::heapCopy;
using test::hex;
using test::letters;
using test::MessageProbe;
using test::RawFrame;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

using Header = QelMessage::CommonHeader;

struct RejectedCase {
    const char* name;
    std::vector<char> frame;
    const char* text;
    const char* log; // "*" matches any number of leading zeros
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
        // the sum of the lengths is 2^32 + 32 and must not wrap to 32
        {"LengthsThatWouldWrap", RawFrame(newForm).dataLength(0xFFFFFFFF).pad(1).msgLength(32).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x00000020"},
        {"LengthsThatWouldWrapInTheOldForm", RawFrame(oldForm).dataLength(0xFFFFFFFF).pad(17).msgLength(40).bytes(),
         "i_buffer bad MsgLength in header", "E: bad header MsgLength = 0x00000028"},

        // two checks fail: the earlier one throws
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
        // 24 bytes are enough for an old header, but no consistent frame is that short
        {"OldHeaderAlone", RawFrame(oldForm).pad(0).bytes(), "i_buffer bad header pad length",
         "E: bad header pad length (old) = 0x00 < expected 0x*10"},
        {"OldHeaderBelowNewLength", RawFrame(oldForm).payload(letters(7)).pad(0).bytes(),
         "i_buffer bad header pad length", "E: bad header pad length (old) = 0x00 < expected 0x*09"},
    };
}

class QelMessageRejected : public testing::TestWithParam<RejectedCase> {};

TEST_P(QelMessageRejected, ThrowsTheFirstFailedCheckAndLogsItsValue)
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

TEST(QelMessage, RejectsANullBufferAndLogsNothing)
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

TEST(QelMessage, LogsNothingForAValidFrame)
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

TEST(QelMessage, IgnoresBytesAfterTheFrame)
{
    const std::vector<char> frame = RawFrame::newForm().payload(letters(6)).bytes();
    std::vector<char> longer = frame;
    longer.insert(longer.end(), 50, 'x');
    EXPECT_EQ(frameOf(MessageProbe(longer)), hex(frame));
}

TEST(QelMessage, KeepsExactlyTheFrameOfALongerBuffer)
{
    const std::vector<char> frame = RawFrame::newForm().payload(letters(6)).bytes();
    std::vector<char> longer = frame;
    longer.insert(longer.end(), 100000, 'x');
    const QelMessage message(longer.data(), static_cast<unsigned int>(longer.size()));
    const std::size_t block = ::malloc_usable_size(const_cast<char*>(message.serialize()));
    EXPECT_GE(block, frame.size());
    EXPECT_LT(block, frame.size() + 64) << "an allocator may round up, but not to the length of the buffer";
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

} // namespace
} // namespace qel
