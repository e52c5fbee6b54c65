#include "base/Failures.hpp"
#include "decode/HexText.hpp"
#include "support/Bytes.hpp"

#include <gmock/gmock.h>
#include <istream>
#include <iterator>
#include <ostream>
#include <sstream>
#include <string>

namespace qel::test {

namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::CommandFailure;
using tool::ExitStatus;
using tool::HexTextBuffer;
using tool::looksLikeHexText;

/// The bytes that a text stands for, in hexadecimal digits again.
std::string bytesOf(const std::string& text)
{
    std::istringstream stream(text);
    HexTextBuffer buffer(stream);
    std::istream bytes(&buffer);
    bytes.exceptions(std::ios::badbit);
    std::string all;
    char c = 0;
    while (bytes.get(c))
        all += c;
    return hex(all);
}

struct Row {
    const char* name;
    const char* text;
    const char* bytes;
};

void PrintTo(const Row& row, std::ostream* os) { *os << row.name; }

class HexTextRows : public ::testing::TestWithParam<Row> {};

TEST_P(HexTextRows, IsRead) { EXPECT_EQ(bytesOf(GetParam().text), GetParam().bytes); }

INSTANTIATE_TEST_SUITE_P(
    All, HexTextRows,
    ::testing::Values(
        Row{"Nothing", "", ""}, Row{"OneByte", "a5", "A5"}, Row{"BothCases", "aAbBcCdDeEfF09", "AABBCCDDEEFF09"},
        Row{"Blanks", " DE CA\tFF\v20\f00 ", "DECAFF2000"}, Row{"Lines", "DE\nCA\r\nFF\n\n\n20", "DECAFF20"},
        Row{"Words", "DECA FF20 00000020", "DECAFF2000000020"}, Row{"OnlyLineEnds", "\n\r\n\n", ""},
        Row{"Prefixes", "0xDE 0XCA 0xFF20", "DECAFF20"}, Row{"AByteThatLooksLikeHalfAPrefix", "0f 00", "0F00"},
        Row{"Comments", "# first\nDE # 01\n#\nCA#FF", "DECA"}, Row{"OnlyAComment", "# nothing", ""},
        Row{"Addresses", "0000: DE CA\n  0002:FF\n0000000a: 20", "DECAFF20"}, Row{"AnAddressAlone", "0000:\nDE", "DE"},
        Row{"AGoldenFrame",
            "name: Any\nclass: Abc\nheader.mFlags: 0x80\npayload.mText: \"0000  AA\"\nframe:\n"
            "0000  DE CA FF                 # mDesc: eyecatcher\n0003  20                       # mHeaderVersion\n",
            "DECAFF20"},
        Row{"GoldenFramesBehindEachOther", "name: a\nframe:\n0000  DE\nname: b\nclass: c\nframe:\n0000  CA # x\n",
            "DECA"},
        Row{"AGoldenFrameBehindPlainText", "0000: DE\nname: a\nframe:\n0000  CA", "DECA"},
        Row{"AGoldenFrameWithCarriageReturns", "name: a\r\nframe:\r\n0000  DE # x\r\n\r\n0001  CA\r\n", "DECA"},
        Row{"AnAddressAloneInAGoldenFrame", "name: a\nframe:\n0000\n0000 # none\n 0000  DE", "DE"},
        Row{"AnAddressThatIsAComment", "#0000: CA\nDE", "DE"}, Row{"NoEndOfTheLastLine", "DE\nCA", "DECA"}),
    [](const auto& row) { return row.param.name; });

struct BadRow {
    const char* name;
    const char* text;
    const char* reason;
};

void PrintTo(const BadRow& row, std::ostream* os) { *os << row.name; }

class HexTextRefused : public ::testing::TestWithParam<BadRow> {};

TEST_P(HexTextRefused, WithTheNumberOfItsLine)
{
    EXPECT_THAT([] { bytesOf(GetParam().text); }, ThrowsMessage<CommandFailure>(StrEq(GetParam().reason)));
}

INSTANTIATE_TEST_SUITE_P(
    All, HexTextRefused,
    ::testing::Values(
        BadRow{"AGoldenFrameWithoutRows", "name: a\nclass: b", "line 2: the line 'frame:' is missing behind it"},
        BadRow{"AMistakeInAGoldenFrame", "name: a\nframe:\n0000  D", "line 3: 'D' is not a whole number of bytes"},
        BadRow{"TheHeadOfAGoldenFrameAlone", "class: b", "line 1: 'l' is no hexadecimal digit"},
        BadRow{"ALetter", "DE CX", "line 1: 'X' is no hexadecimal digit"},
        BadRow{"OnALaterLine", "DE\n# x\n\nCA FF\nxy", "line 5: 'x' is no hexadecimal digit"},
        BadRow{"APrefixAlone", "0x", "line 1: 'x' is no hexadecimal digit"},
        BadRow{"APrefixWithin", "DE0xCA", "line 1: 'x' is no hexadecimal digit"},
        BadRow{"ASeparator", "DE,CA", "line 1: ',' is no hexadecimal digit"},
        BadRow{"AnAddressWithin", "DE 00: CA", "line 1: ':' is no hexadecimal digit"},
        BadRow{"AControlCharacter", "DE \x1B[2J", "line 1: '\\x1b' is no hexadecimal digit"},
        BadRow{"AByteThatIsNoAscii", "DE \xC3\x84", "line 1: '\\xc3' is no hexadecimal digit"},
        BadRow{"HalfAByte", "DE C", "line 1: 'C' is not a whole number of bytes"},
        BadRow{"HalfAByteInAWord", "DECAFF2", "line 1: 'DECAFF2' is not a whole number of bytes"},
        BadRow{"HalfAByteBehindAPrefix", "0x123", "line 1: '123' is not a whole number of bytes"},
        BadRow{"AByteOverTwoLines", "D\nE", "line 1: 'D' is not a whole number of bytes"}),
    [](const auto& row) { return row.param.name; });

TEST(HexText, RefusingIsAnswerNo)
{
    try {
        bytesOf("x");
        ADD_FAILURE() << "accepted";
    } catch (const CommandFailure& failure) {
        EXPECT_EQ(failure.getExitStatus(), ExitStatus::Refused);
    }
}

TEST(HexText, AnEndlessWordIsShownInPart)
{
    EXPECT_THAT(
        [] { bytesOf(std::string(39, 'A')); },
        ThrowsMessage<CommandFailure>(StrEq("line 1: '" + std::string(39, 'A') + "' is not a whole number of bytes")));
    EXPECT_THAT([] { bytesOf(std::string(100001, 'A')); },
                ThrowsMessage<CommandFailure>(
                    StrEq("line 1: '" + std::string(40, 'A') + "...' is not a whole number of bytes")));
}

TEST(HexText, WhatStandsBeforeAMistakeIsRead)
{
    std::istringstream text("DE CA\nxx");
    HexTextBuffer buffer(text);
    std::istream bytes(&buffer);
    bytes.exceptions(std::ios::badbit);
    char pair[2];
    bytes.read(pair, 2);
    EXPECT_EQ(hex(pair, 2), "DECA");
    EXPECT_THROW(bytes.get(), CommandFailure);
}

TEST(HexText, IsToldFromRawFramesByItsFirstCharacter)
{
    for (const char* const text : {"DE", "de", "00", "# comment", " ", "\n", "\t", "\r", "0x", "name: a", "x", "~"}) {
        std::istringstream stream(text);
        EXPECT_TRUE(looksLikeHexText(stream)) << text;
        EXPECT_EQ(stream.get(), static_cast<unsigned char>(text[0])) << "nothing was taken";
    }
    for (const char* const text : {"", "\xDE\xCA\xFF", "\x7F", "\x1F", "\xFF"}) {
        std::istringstream stream(text);
        EXPECT_FALSE(looksLikeHexText(stream)) << text;
    }
}

} // namespace

} // namespace qel::test
