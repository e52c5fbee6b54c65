#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/TypeInfo.hpp>

#include "decode/FrameDecoder.hpp"
#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/GoldenFrame.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <optional>
#include <ostream>
#include <sstream>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using tool::FrameDecoder;

std::string text(const std::vector<char>& bytes) { return std::string(bytes.begin(), bytes.end()); }
std::string text(const RawFrame& frame) { return text(frame.bytes()); }

/// A frame of nothing that is known, of some length.
RawFrame frameOf(unsigned int length)
{
    RawFrame frame = RawFrame::newForm();
    frame.function(0x1234).operation(0x5678).payload(std::vector<char>(length - 32, 'x'));
    return frame;
}

/// Only the first 8 bytes of a frame that says it has that length, and `more` bytes after them.
std::string prefixed(unsigned int length, std::size_t more)
{
    const auto byte = [length](unsigned int shift) { return static_cast<char>(length >> shift & 0xFF); };
    return std::string("\xDE\xCA\xFF\x20", 4) + byte(24) + byte(16) + byte(8) + byte(0) + std::string(more, '\0');
}

class FrameDecoderTest : public ::testing::Test {
protected:
    /// What is found in some bytes: "offset class", or "offset: reason".
    std::vector<std::string> decode(const std::string& bytes)
    {
        std::istringstream input(bytes);
        FrameDecoder decoder(input);
        FrameDecoder::Item item;
        std::vector<std::string> found;
        while (decoder.next(item)) {
            std::string line = std::to_string(item.offset);
            if (item.message != nullptr) {
                const std::string name = TypeInfo::getTypeName(*item.message);
                line += " " + name.substr(name.rfind(':') + 1);
            }
            if (!item.reason.empty()) line += ": " + item.reason;
            found.push_back(line);
        }
        taken = decoder.offset();
        return found;
    }

    CapturedLog log{LogLevel::Critical};
    std::uint64_t taken = 0; // bytes by the last decode()
};

TEST_F(FrameDecoderTest, EmptyInputHasNoFrames)
{
    EXPECT_THAT(decode(""), IsEmpty());
    EXPECT_EQ(taken, 0U);
}

TEST_F(FrameDecoderTest, FramesFollowEachOther)
{
    EXPECT_THAT(decode(text(frameOf(32)) + text(frameOf(100)) + text(frameOf(33))),
                ElementsAre("0 QelMessage", "32 QelMessage", "132 QelMessage"));
    EXPECT_EQ(taken, 165U);
}

TEST_F(FrameDecoderTest, AFrameKeepsItsBytes)
{
    const std::string bytes = text(frameOf(45));
    std::istringstream input(bytes + bytes);
    FrameDecoder decoder(input);
    FrameDecoder::Item item;
    for (int i = 0; i < 2; ++i) {
        ASSERT_TRUE(decoder.next(item));
        ASSERT_NE(item.message, nullptr);
        EXPECT_EQ(hex(item.message->serialize(), item.message->msgLength()), hex(bytes));
    }
    EXPECT_FALSE(decoder.next(item));
}

TEST_F(FrameDecoderTest, DecodesEveryMessageAsItsClass)
{
    // Two responses are built only; no frame becomes an object of theirs.
    const std::vector<std::string> builtOnly{"QelMessageGetInterfaceLimitsRsp", "QelMessageGetQelTodRsp"};
    std::string all;
    std::vector<std::string> expected;
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame frame = GoldenFrame::load(name);
        const bool isPlain = std::count(builtOnly.begin(), builtOnly.end(), frame.className()) != 0;
        expected.push_back(std::to_string(all.size()) + " " + (isPlain ? "QelMessage" : frame.className()));
        all += frame.bytes();
    }
    ASSERT_GE(expected.size(), 36U);
    EXPECT_EQ(decode(all), expected);
    EXPECT_EQ(taken, all.size());
}

TEST_F(FrameDecoderTest, DecodesHandshakeMessages)
{
    const QelMessageUpgradeConnectionAsync upgrade;
    const QelMessageAbortHandshakeAsync abort;
    EXPECT_THAT(decode(std::string(upgrade.serialize(), upgrade.msgLength()) +
                       std::string(abort.serialize(), abort.msgLength())),
                ElementsAre("0 QelMessageUpgradeConnectionAsync", "32 QelMessageAbortHandshakeAsync"));
}

TEST_F(FrameDecoderTest, HandshakeMessageWithWrongFlagsIsUnknown)
{
    RawFrame frame = RawFrame::newForm();
    frame.function(0x6001).operation(0x0001).flags(0x80);
    EXPECT_THAT(decode(text(frame)), ElementsAre("0 QelMessage"));
}

TEST_F(FrameDecoderTest, ReportsABadEyecatcher)
{
    EXPECT_THAT(decode("this is not a frame, and neither is what follows"), ElementsAre("0: i_buffer bad eyecatcher"));
    EXPECT_THAT(decode("x"), ElementsAre("0: i_buffer bad eyecatcher"));
    EXPECT_THAT(decode(text(frameOf(32)) + "x" + text(frameOf(32))),
                ElementsAre("0 QelMessage", "32: i_buffer bad eyecatcher"));
    for (std::size_t i = 0; i < 3; ++i) {
        SCOPED_TRACE(i);
        std::string bytes = text(frameOf(32));
        bytes[i] = '\x01';
        EXPECT_THAT(decode(bytes), ElementsAre("0: i_buffer bad eyecatcher"));
    }
}

TEST_F(FrameDecoderTest, ReportsEveryTruncation)
{
    const std::string whole = text(frameOf(40));
    for (std::size_t length = 1; length < whole.size(); ++length) {
        SCOPED_TRACE(length);
        const std::string there = "32: the input ends after " + std::to_string(length) + " of ";
        EXPECT_THAT(decode(text(frameOf(32)) + whole.substr(0, length)),
                    ElementsAre("0 QelMessage",
                                length < 8 ? there + "8 bytes that hold the length of a frame" : there + "40 bytes"));
        EXPECT_EQ(taken, 32 + length);
    }
}

TEST_F(FrameDecoderTest, MalformedLengthEndsTheDecoding)
{
    for (const unsigned int length : {0U, 1U, 8U, 16385U, 0xFFFFFFFFU}) {
        SCOPED_TRACE(length);
        EXPECT_THAT(decode(prefixed(length, 20000)), ElementsAre("0: Invalid length " + std::to_string(length)));
        EXPECT_EQ(taken, 8U);
    }
}

TEST_F(FrameDecoderTest, ReportsALengthTooShortForAHeader)
{
    struct Row {
        unsigned int length;
        const char* reason;
    };
    for (const Row& row : {Row{9, "length"}, Row{21, "length"}, Row{22, "i_length shorter than old header"},
                           Row{23, "i_length shorter than old header"}, Row{24, "i_length shorter than new header"},
                           Row{31, "i_length shorter than new header"}}) {
        SCOPED_TRACE(row.length);
        EXPECT_THAT(decode(prefixed(row.length, row.length - 8) + text(frameOf(32))),
                    ElementsAre(std::string("0: ") + row.reason, std::to_string(row.length) + " QelMessage"));
    }
}

TEST_F(FrameDecoderTest, DecodesTheLongestFrame)
{
    EXPECT_THAT(decode(text(frameOf(16384)) + text(frameOf(32))), ElementsAre("0 QelMessage", "16384 QelMessage"));
    EXPECT_THAT(decode(text(frameOf(16385)) + text(frameOf(32))), ElementsAre("0: Invalid length 16385"));
}

TEST_F(FrameDecoderTest, GoesOnAfterABadFrameOfKnownLength)
{
    std::string badVersion = text(frameOf(40));
    badVersion[3] = '\x10';
    std::string badDataLength = text(frameOf(40));
    badDataLength[19] = '\x7F';
    EXPECT_THAT(decode(badVersion + text(frameOf(32)) + badDataLength + text(frameOf(32))),
                ElementsAre("0: i_buffer bad header version", "40 QelMessage", "72: i_buffer bad MsgLength in header",
                            "112 QelMessage"));
}

TEST_F(FrameDecoderTest, ReportsAMalformedPayload)
{
    RawFrame shortOpen = RawFrame::newForm();
    shortOpen.function(0x6002).operation(0x0402).flags(0x80).payload(bytes({0, 1, 0, 0, 0, 0, 0}));
    EXPECT_THAT(decode(text(shortOpen) + text(frameOf(32))),
                ElementsAre("0 QelMessage: dataLength shorter than actual data size", "39 QelMessage"));
}

TEST_F(FrameDecoderTest, AcceptsAStatusWithoutPayload)
{
    RawFrame response = RawFrame::newForm();
    response.function(0x6002).operation(0x0402).flags(0x40);
    EXPECT_THAT(decode(text(response)), ElementsAre("0 QelMessage: dataLength shorter than actual data size"));
    response.status(0x13);
    EXPECT_THAT(decode(text(response)), ElementsAre("0 QelMessage"));
}

TEST_F(FrameDecoderTest, ReasonOfOneFrameDoesNotReachTheNext)
{
    RawFrame request = RawFrame::newForm();
    request.function(0x6002).operation(0x0402).flags(0x80);
    const QelMessageVirtualSerialOpenReq good(1, 2, false);
    EXPECT_THAT(
        decode(text(request) + std::string(good.serialize(), good.msgLength())),
        ElementsAre("0 QelMessage: dataLength shorter than actual data size", "32 QelMessageVirtualSerialOpenReq"));
}

} // namespace

} // namespace qel::test
