#include "base/Failures.hpp"
#include "decode/HexText.hpp"
#include "support/Bytes.hpp"

#include <gmock/gmock.h>
#include <istream>
#include <iterator>
#include <ostream>
#include <sstream>
#include <streambuf>
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
        Row{"ConsecutiveGoldenFrames", "name: a\nframe:\n0000  DE\nname: b\nclass: c\nframe:\n0000  CA # x\n", "DECA"},
        Row{"GoldenFrameAfterPlainText", "0000: DE\nname: a\nframe:\n0000  CA", "DECA"},
        Row{"AGoldenFrameWithCarriageReturns", "name: a\r\nframe:\r\n0000  DE # x\r\n\r\n0001  CA\r\n", "DECA"},
        Row{"AnAddressAloneInAGoldenFrame", "name: a\nframe:\n0000\n0000 # none\n 0000  DE", "DE"},
        Row{"AnAddressThatIsAComment", "#0000: CA\nDE", "DE"}, Row{"NoEndOfTheLastLine", "DE\nCA", "DECA"},
        Row{"Xxd",
            "00000000: deca ff20 0000 0028 a0b1 c2d3 7000 0000  ... ...(....p...\n"
            "00000010: 0000 0008 a005                           ......\n",
            "DECAFF2000000028A0B1C2D37000000000000008A005"},
        Row{"XxdInSingleBytes", "00000000: de ca ff  ...\n00000003: 20  #\n", "DECAFF20"},
        Row{"XxdWithDigitsAsCharacters", "00000000: 4445 4144  DEAD\n00000004: 30  0", "4445414430"},
        Row{"XxdWithBlanksAsCharacters", "00000000: 2020 20de     .\n00000004: 2020    ", "202020DE2020"},
        Row{"XxdWithoutItsLastBlanks", "00000000: 412e 2020  A.\n00000004: 2020\n", "412E20202020"},
        Row{"XxdOfALineEnd", "00000000: 7c23 0a00  |#..\r\n", "7C230A00"},
        Row{"AnAddressOfFewDigitsBeforeWideGaps", "0000: DECA  FF20", "DECAFF20"},
        Row{"Hexdump",
            "00000000  de ca ff 20 00 00 00 28  a0 b1 c2 d3 70 00 00 00  |... ...(....p...|\n"
            "00000010  00 00 00 08 a0 05                                 |......|\n00000016\n",
            "DECAFF2000000028A0B1C2D37000000000000008A005"},
        Row{"HexdumpOfItsOwnSigns", "00000000  7c 2a 23 de                                       ||*#.|\n00000004\n",
            "7C2A23DE"},
        Row{"HexdumpWithRepeatedRows", "00000000  41 42  |AB|\n*\n00000006  de ca  |..|\n*\n0000000a\n",
            "414241424142DECADECA"},
        Row{"HexdumpWithoutAnyRepetition", "00000000  41 42  |AB|\n*\n00000002  de ca  |..|\n", "4142DECA"},
        Row{"TwoHexdumps", "00000000  41  |A|\n00000001\n00000000  42  |B|\n00000001\n", "4142"},
        Row{"TextAfterAHexdump", "00000000  41  |A|\n00000001\nDE CA\n00000001", "41DECA00000001"},
        Row{"BytesAfterAHexdumpThatAreNotItsEnd", "00000000  41  |A|\nDECAFF20\n", "41DECAFF20"},
        Row{"BytesThatLookLikeAnOffset", "0000000000\nDECAFF20", "0000000000DECAFF20"}),
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
        BadRow{"AGoldenFrameWithoutRows", "name: a\nclass: b", "line 2: the line 'frame:' is missing after it"},
        BadRow{"AMistakeInAGoldenFrame", "name: a\nframe:\n0000  D",
               "line 3: 'D' is half a byte: write two digits for each"},
        BadRow{"TheHeadOfAGoldenFrameAlone", "class: b", "line 1: 'l' is not a hexadecimal digit"},
        BadRow{"ALetter", "DE CX", "line 1: 'X' is not a hexadecimal digit"},
        BadRow{"OnALaterLine", "DE\n# x\n\nCA FF\nxy", "line 5: 'x' is not a hexadecimal digit"},
        BadRow{"APrefixAlone", "0x", "line 1: 'x' is not a hexadecimal digit"},
        BadRow{"APrefixWithin", "DE0xCA", "line 1: 'x' is not a hexadecimal digit"},
        BadRow{"ASeparator", "DE,CA", "line 1: ',' is not a hexadecimal digit"},
        BadRow{"AnAddressWithin", "DE 00: CA", "line 1: ':' is not a hexadecimal digit"},
        BadRow{"AControlCharacter", "DE \x1B[2J", "line 1: '\\x1b' is not a hexadecimal digit"},
        BadRow{"AByteThatIsNotAscii", "DE \xC3\x84", "line 1: '\\xc3' is not a hexadecimal digit"},
        BadRow{"HalfAByte", "DE C", "line 1: 'C' is half a byte: write two digits for each"},
        BadRow{"HalfAByteInAWord", "DECAFF2", "line 1: 'DECAFF2' is half a byte: write two digits for each"},
        BadRow{"HalfAByteAfterAPrefix", "0x123", "line 1: '123' is half a byte: write two digits for each"},
        BadRow{"ARepetitionOfNothing", "*", "line 1: '*' is not a hexadecimal digit"},
        BadRow{"ARepetitionAfterOtherText", "00000000  41  |A|\nDE\n*", "line 3: '*' is not a hexadecimal digit"},
        BadRow{"ARepetitionThatGoesBack", "00000010  41 42  |AB|\n*\n00000010\n",
               "line 3: the offset does not fit a repetition of the row before '*'"},
        BadRow{"ARepetitionOfHalfARow", "00000000  41 42  |AB|\n*\n00000003\n",
               "line 3: the offset does not fit a repetition of the row before '*'"},
        BadRow{"ACharacterColumnWithoutRows", "DE CA |..|", "line 1: '|' is not a hexadecimal digit"},
        BadRow{"AByteOverTwoLines", "D\nE", "line 1: 'D' is half a byte: write two digits for each"}),
    [](const auto& row) { return row.param.name; });

TEST(HexText, MistakeHasExitStatusRefused)
{
    try {
        bytesOf("x");
        ADD_FAILURE() << "accepted";
    } catch (const CommandFailure& failure) {
        EXPECT_EQ(failure.getExitStatus(), ExitStatus::Refused);
    }
}

TEST(HexText, MessageShortensALongWord)
{
    EXPECT_THAT([] { bytesOf(std::string(39, 'A')); },
                ThrowsMessage<CommandFailure>(
                    StrEq("line 1: '" + std::string(39, 'A') + "' is half a byte: write two digits for each")));
    EXPECT_THAT([] { bytesOf(std::string(100001, 'A')); },
                ThrowsMessage<CommandFailure>(
                    StrEq("line 1: '" + std::string(40, 'A') + "...' is half a byte: write two digits for each")));
}

/// A text that is made while it is read: digits for ever, on one line.
class EndlessDigits : public std::streambuf {
protected:
    int_type underflow() override
    {
        setg(mDigits.data(), mDigits.data(), mDigits.data() + mDigits.size());
        return traits_type::to_int_type(mDigits.front());
    }

private:
    std::string mDigits = "deca";
};

TEST(HexText, ALongLineIsReadInPieces)
{
    // The line has no end, so that a reader that wants all of it would never put out a byte.
    EndlessDigits digits;
    std::istream text(&digits);
    HexTextBuffer buffer(text);
    std::istream bytes(&buffer);
    std::string all(100000, '\0');
    bytes.read(all.data(), static_cast<std::streamsize>(all.size()));
    EXPECT_EQ(bytes.gcount(), 100000);
    for (std::size_t i = 0; i < all.size(); ++i)
        ASSERT_EQ(all[i], i % 2 == 0 ? '\xDE' : '\xCA') << i;
}

TEST(HexText, PiecesOfALongLineFitTogether)
{
    for (const std::size_t digits : {4094U, 4095U, 4096U, 4097U, 8192U, 100000U}) {
        SCOPED_TRACE(digits);
        std::string blanks(digits, ' ');
        EXPECT_EQ(bytesOf(blanks + "DE 0xCA # " + blanks + "FF\n20"), "DECA20");
        EXPECT_EQ(bytesOf("# " + blanks + "\nDE"), "DE");
        EXPECT_EQ(bytesOf("name: a" + blanks + "\nframe:\n0000 DE"), "DE");
        EXPECT_EQ(bytesOf("00: " + std::string(2 * digits, 'A')), std::string(2 * digits, 'A'));
    }
}

TEST(HexText, ARepetitionComesInPieces)
{
    EXPECT_EQ(bytesOf("00000000  41 42  |AB|\n*\n00030d40\n").size(), 2 * 200000U);
}

TEST(HexText, BytesBeforeAMistakeAreRead)
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

TEST(HexText, IsRecognizedByItsFirstCharacter)
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
