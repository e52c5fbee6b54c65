#include <qel/common/StreamFormatters.hpp>

#include "support/Bytes.hpp"
#include "support/GroupingLocale.hpp"
#include "support/Printed.hpp"

#include <climits>
#include <cstdint>
#include <cstdio>
#include <gtest/gtest.h>
#include <iomanip>
#include <locale>
#include <memory>
#include <sstream>
#include <streambuf>
#include <string>
#include <vector>

namespace qel {

enum FormatterTestCode : unsigned short { FormatterTestCodeFive = 5 };
template <>
struct HexWidth<FormatterTestCode> : std::integral_constant<std::size_t, 8> {};

enum FormatterTestWideCode : unsigned short { kFormatterTestWideCode = 10 };
template <>
struct HexWidth<FormatterTestWideCode> : std::integral_constant<std::size_t, 24> {};

namespace {

using test::printed;

enum ByteEnumeration : unsigned char { kByteFlag = 0x40 };
enum class SignedByteEnumeration : signed char { Negative = -1 };
enum WordEnumeration : unsigned short { kWord = 0x6003 };
enum class WideEnumeration : int { Value = 5, Negative = -5 };

// ---------------------------------------------------------------------------------------------- hexadecimal numbers

TEST(HexFormat, PrintsTwoDigitsForEachByteOfTheType)
{
    EXPECT_EQ(printed(hexFormat(static_cast<unsigned char>(10))), "0x0A");
    EXPECT_EQ(printed(hexFormat(std::uint16_t(0x1F))), "0x001F");
    EXPECT_EQ(printed(hexFormat(0x1FU)), "0x0000001F");
    EXPECT_EQ(printed(hexFormat(std::uint64_t(0x1F))), "0x000000000000001F");
}

TEST(HexFormat, PrintsEveryDigitOfAFullValue)
{
    EXPECT_EQ(printed(hexFormat(static_cast<unsigned char>(0xFE))), "0xFE");
    EXPECT_EQ(printed(hexFormat(std::uint16_t(0xFEDC))), "0xFEDC");
    EXPECT_EQ(printed(hexFormat(0xFEDCBA98U)), "0xFEDCBA98");
    EXPECT_EQ(printed(hexFormat(std::uint64_t(0xFEDCBA9876543210))), "0xFEDCBA9876543210");
}

TEST(HexFormat, PrintsCharactersAsNumbers)
{
    EXPECT_EQ(printed(hexFormat('A')), "0x41");
    EXPECT_EQ(printed(hexFormat('\0')), "0x00");
    EXPECT_EQ(printed(hexFormat('\x7F')), "0x7F");
    EXPECT_EQ(printed(hexFormat(true)), "0x01");
}

TEST(HexFormat, SignExtendsANegativeCharacterToFourDigits)
{
    EXPECT_EQ(printed(hexFormat('\x80')), "0xFF80");
    EXPECT_EQ(printed(hexFormat('\xFF')), "0xFFFF");
    EXPECT_EQ(printed(hexFormat(static_cast<signed char>(-2))), "0xFFFE");
    EXPECT_EQ(printed(hexFormat(static_cast<unsigned char>(0x80))), "0x80");
}

TEST(HexFormat, PrintsNegativeNumbersAsTheirBits)
{
    EXPECT_EQ(printed(hexFormat(static_cast<short>(-1))), "0xFFFF");
    EXPECT_EQ(printed(hexFormat(-1)), "0xFFFFFFFF");
    EXPECT_EQ(printed(hexFormat(INT_MIN)), "0x80000000");
    EXPECT_EQ(printed(hexFormat(-1L)), std::string("0x") + std::string(2 * sizeof(long), 'F'));
}

TEST(HexFormat, PrintsEnumerationsAsTheirNumbers)
{
    EXPECT_EQ(printed(hexFormat(kByteFlag)), "0x40");
    EXPECT_EQ(printed(hexFormat(kWord)), "0x6003");
    EXPECT_EQ(printed(hexFormat(WideEnumeration::Value)), "0x00000005");
    EXPECT_EQ(printed(hexFormat(SignedByteEnumeration::Negative)), "0xFFFF");
}

TEST(HexFormat, HexWidthGivesATypeAnotherWidth)
{
    EXPECT_EQ(printed(hexFormat(FormatterTestCodeFive)), "0x00000005");
    EXPECT_EQ(printed(hexFormat(FormatterTestCodeFive).noPrefix()), "00000005");
    EXPECT_EQ(printed(decFormat(FormatterTestCodeFive)), "5");
}

TEST(HexFormat, PrintsWireIntegersAsTheirHostValue)
{
    EXPECT_EQ(printed(hexFormat(be_uint16_t(0x1F))), "0x001F");
    EXPECT_EQ(printed(hexFormat(be_uint32_t(0xDECAFF20))), "0xDECAFF20");
    EXPECT_EQ(printed(hexFormat(endian_uint<unsigned char, 4321>(0x0A))), "0x0A");
}

TEST(HexFormat, PrintsBinaryCodedDecimalsAsTheirDecodedValue)
{
    EXPECT_EQ(printed(hexFormat(bcd_uint8_t(99))), "0x63");
    EXPECT_EQ(printed(hexFormat(bcd_uint16_t(2024))), "0x07E8");
}

TEST(HexFormat, NoPrefixLeavesThePrefixOutAndChains)
{
    EXPECT_EQ(printed(hexFormat(std::uint16_t(0x1F)).noPrefix()), "001F");
    auto formatter = hexFormat(std::uint16_t(0x1F));
    EXPECT_EQ(&formatter.noPrefix(), &formatter);
    EXPECT_EQ(printed(formatter), "001F");
    EXPECT_EQ(printed(formatter), "001F");
}

TEST(HexFormat, PrefixesHaveAddresses)
{
    const char* const& prefix = HexFormatterBase::PREFIX;
    const char* const& noPrefix = HexFormatterBase::NO_PREFIX;
    EXPECT_STREQ(prefix, "0x");
    EXPECT_STREQ(noPrefix, "");
}

TEST(HexFormat, LeavesTheStreamInUpperCaseHexadecimalWithZeroFill)
{
    std::ostringstream os;
    os << hexFormat(std::uint16_t(1)) << ' ' << 171 << ' ' << std::setw(4) << 1;
    EXPECT_EQ(os.str(), "0x0001 AB 0001");
    EXPECT_EQ(os.fill(), '0');
    EXPECT_EQ(os.flags() & std::ios_base::basefield, std::ios_base::hex);
    EXPECT_NE(os.flags() & std::ios_base::uppercase, std::ios_base::fmtflags());
}

TEST(HexFormat, AGroupingLocaleOfTheStreamAppliesToTheDigits)
{
    const test::GroupingLocale grouping;
    EXPECT_EQ(printed(hexFormat(std::uint16_t(0x6003))), "0x6.003");
    EXPECT_EQ(toString(hexFormat(std::uint16_t(0x6003))), "0x6003");
}

// What hexFormat() is defined as: the prefix, the settings, then the number as the stream prints it.
template <typename T>
void printByTheStream(std::ostream& os, T value)
{
    os << "0x";
    os.setf(std::ios_base::hex, std::ios_base::basefield);
    os.setf(std::ios_base::uppercase);
    os.fill('0');
    os.width(2 * sizeof(T));
    os << value;
}

template <typename T>
void expectSameAsTheStream(const std::ios_base::fmtflags flags, int width, char fill, T value)
{
    std::ostringstream expected;
    std::ostringstream found;
    for (std::ostringstream* os : {&expected, &found}) {
        os->flags(flags);
        os->width(width);
        os->fill(fill);
    }
    printByTheStream(expected, value);
    found << hexFormat(value);
    EXPECT_EQ(found.str(), expected.str());
    EXPECT_EQ(found.flags(), expected.flags());
    EXPECT_EQ(found.width(), expected.width());
    EXPECT_EQ(found.fill(), expected.fill());
}

TEST(HexFormat, IsTheNumberAsTheStreamPrintsItWithAnySettings)
{
    using Ios = std::ios_base;
    const Ios::fmtflags settings[] = {Ios::dec,
                                      Ios::fmtflags(),
                                      Ios::dec | Ios::left,
                                      Ios::dec | Ios::right,
                                      Ios::hex | Ios::internal,
                                      Ios::showbase,
                                      Ios::showpos,
                                      Ios::unitbuf,
                                      Ios::left | Ios::right,
                                      Ios::left | Ios::showbase,
                                      Ios::oct | Ios::showbase | Ios::internal};
    for (const Ios::fmtflags flags : settings) {
        for (const int width : {0, 1, 7, 30}) {
            SCOPED_TRACE(std::to_string(static_cast<int>(flags)) + ", " + std::to_string(width));
            for (const unsigned int value : {0U, 1U, 0xABCDU, 0x89ABCDEFU, UINT_MAX}) {
                expectSameAsTheStream(flags, width, '*', value);
                expectSameAsTheStream(flags, width, '0', static_cast<int>(value));
                expectSameAsTheStream(flags, width, ' ', static_cast<std::uint16_t>(value));
                expectSameAsTheStream(flags, width, ' ', static_cast<short>(value));
                expectSameAsTheStream(flags, width, ' ', static_cast<std::uint64_t>(value) << 31);
                expectSameAsTheStream(flags, width, ' ', -static_cast<long long>(value));
            }
        }
    }
}

TEST(HexFormat, WritesWhatFitsAndMarksAStreamThatIsFull)
{
    for (std::streamsize room = 0; room <= 11; ++room) {
        SCOPED_TRACE(room);
        std::string texts[2];
        std::ios_base::iostate states[2];
        for (int i = 0; i < 2; ++i) {
            char memory[16] = {};
            struct : std::streambuf {
                using std::streambuf::setp;
            } full;
            full.setp(memory, memory + room);
            std::ostream os(&full);
            if (i == 0) {
                printByTheStream(os, 0x89ABCDEFU);
            } else {
                os << hexFormat(0x89ABCDEFU);
            }
            os << 'x';
            texts[i] = memory;
            states[i] = os.rdstate();
        }
        EXPECT_EQ(texts[1], texts[0]);
        EXPECT_EQ(states[1], states[0]);
    }
}

TEST(HexFormat, PrintsNothingOntoAStreamThatHasFailed)
{
    for (const std::ios_base::iostate state : {std::ios_base::badbit, std::ios_base::failbit, std::ios_base::eofbit}) {
        std::ostringstream expected;
        std::ostringstream found;
        expected.setstate(state);
        found.setstate(state);
        printByTheStream(expected, 1);
        found << hexFormat(1);
        EXPECT_EQ(found.str(), "");
        EXPECT_EQ(found.rdstate(), expected.rdstate());
        EXPECT_EQ(found.width(), expected.width());
        EXPECT_EQ(found.flags(), expected.flags());
    }
}

TEST(HexFormat, AFacetOfTheStreamsLocalePrintsTheDigits)
{
    struct Named : std::num_put<char> {
        iter_type do_put(iter_type to, std::ios_base&, char, unsigned long) const override
        {
            for (const char letter : std::string("six"))
                *to++ = letter;
            return to;
        }
    };
    std::ostringstream os;
    os.imbue(std::locale(std::locale::classic(), new Named));
    os << hexFormat(6U);
    EXPECT_EQ(os.str(), "0xsix");
}

TEST(HexFormat, PrintsMoreDigitsThanAnyIntegerHasIfTheTypeRequestsThem)
{
    EXPECT_EQ(printed(hexFormat(kFormatterTestWideCode)), "0x00000000000000000000000A");
    EXPECT_EQ(printed(hexFormat(kFormatterTestWideCode).noPrefix()), "00000000000000000000000A");
}

TEST(HexFormat, ReturnsTheStream)
{
    std::ostringstream os;
    EXPECT_EQ(&(os << hexFormat(1)), &os);
    EXPECT_EQ(&(os << decFormat(1)), &os);
}

TEST(HexFormat, HoldsACopyOfTheValue)
{
    unsigned int value = 1;
    const auto hexadecimal = hexFormat(value);
    const auto decimal = decFormat(value);
    value = 2;
    EXPECT_EQ(printed(hexadecimal), "0x00000001");
    EXPECT_EQ(printed(decimal), "1");
}

// -------------------------------------------------------------------------------------------------- decimal numbers

TEST(DecFormat, SwitchesTheStreamBackToDecimal)
{
    std::ostringstream os;
    os << hexFormat(std::uint16_t(255)) << ' ' << decFormat(255) << ' ' << 255;
    EXPECT_EQ(os.str(), "0x00FF 255 255");
}

TEST(DecFormat, KeepsTheSignOfEverythingWiderThanAByte)
{
    EXPECT_EQ(printed(decFormat(static_cast<short>(-1))), "-1");
    EXPECT_EQ(printed(decFormat(-42)), "-42");
    EXPECT_EQ(printed(decFormat(LLONG_MIN)), "-9223372036854775808");
    EXPECT_EQ(printed(decFormat(ULLONG_MAX)), "18446744073709551615");
    EXPECT_EQ(printed(decFormat(WideEnumeration::Negative)), "-5");
}

TEST(DecFormat, WidensOneByteTypesToUnsignedSixteenBits)
{
    EXPECT_EQ(printed(decFormat('A')), "65");
    EXPECT_EQ(printed(decFormat(static_cast<unsigned char>(200))), "200");
    EXPECT_EQ(printed(decFormat('\x80')), "65408");
    EXPECT_EQ(printed(decFormat(static_cast<signed char>(-1))), "65535");
    EXPECT_EQ(printed(decFormat(kByteFlag)), "64");
}

TEST(DecFormat, PrintsWireIntegersAndBinaryCodedDecimals)
{
    EXPECT_EQ(printed(decFormat(be_uint16_t(0x1234))), "4660");
    EXPECT_EQ(printed(decFormat(be_uint32_t(0xFFFFFFFF))), "4294967295");
    EXPECT_EQ(printed(decFormat(bcd_uint8_t(59))), "59");
    EXPECT_EQ(printed(decFormat(bcd_uint16_t(2024))), "2024");
}

TEST(DecFormat, RestoresNeitherBaseNorFill)
{
    std::ostringstream os;
    os << std::setfill('*') << std::hex << decFormat(10) << ' ' << std::setw(4) << 10;
    EXPECT_EQ(os.str(), "10 **10");
}

// ------------------------------------------------------------------------------------------------------ byte strings

TEST(HexString, PrintsOneRunOfDigitsWithOnePrefix)
{
    const std::vector<char> data = test::bytes({0x01, 0xAB, 0x00});
    EXPECT_EQ(printed(HexStringFormatter(data.data(), data.size())), "0x01AB00");
}

TEST(HexString, PrintsBytesAboveSevenBitsWithTwoDigits)
{
    const std::vector<char> data = test::bytes({0x80, 0xFF});
    EXPECT_EQ(printed(HexStringFormatter(data.data(), data.size())), "0x80FF");
}

TEST(HexString, ReadsExactlyTheGivenBytes)
{
    const std::vector<char> data = test::bytes({0xDE, 0xCA, 0xFF, 0x20});
    const std::unique_ptr<char[]> copy = test::heapCopy(data);
    EXPECT_EQ(printed(HexStringFormatter(copy.get(), data.size())), "0xDECAFF20");
}

TEST(HexString, OfNoBytesIsThePrefix) { EXPECT_EQ(printed(HexStringFormatter(nullptr, 0)), "0x"); }

TEST(HexString, NoPrefixLeavesThePrefixOutAndChains)
{
    const std::vector<char> data = test::bytes({0x01, 0xAB});
    HexStringFormatter formatter(data.data(), data.size());
    EXPECT_EQ(&formatter.noPrefix(), &formatter);
    EXPECT_EQ(printed(formatter), "01AB");
    EXPECT_EQ(printed(HexStringFormatter(data.data(), 1).noPrefix()), "01");
}

TEST(HexString, LeavesTheStreamInUpperCaseHexadecimal)
{
    std::ostringstream os;
    os << HexStringFormatter("\x01", 1) << ' ' << 171;
    EXPECT_EQ(os.str(), "0x01 AB");
}

// --------------------------------------------------------------------------------------------------------- hex dumps

std::string countingBytes(std::size_t length)
{
    std::string data;
    for (std::size_t i = 0; i < length; ++i) {
        data += static_cast<char>(static_cast<unsigned char>(i));
    }
    return data;
}

TEST(HexDump, PrintsSixteenBytesInEightGroupsOfTwo)
{
    const std::string data = countingBytes(16);
    EXPECT_EQ(printed(HexDumpFormatter(data.data(), data.size(), false)),
              " 0001 0203 0405 0607 0809 0a0b 0c0d 0e0f\n\n");
}

TEST(HexDump, StartsALineAfterSixteenBytes)
{
    const std::string data = countingBytes(17);
    EXPECT_EQ(printed(HexDumpFormatter(data.data(), data.size(), false)),
              " 0001 0203 0405 0607 0809 0a0b 0c0d 0e0f\n 10\n\n");
}

TEST(HexDump, PrintsLengthsAroundGroupAndLineLimits)
{
    struct Row {
        std::size_t length;
        const char* text;
    };
    const Row rows[] = {
        {0, "\n\n"},
        {1, " 00\n\n"},
        {2, " 0001\n\n"},
        {3, " 0001 02\n\n"},
        {15, " 0001 0203 0405 0607 0809 0a0b 0c0d 0e\n\n"},
        {32, " 0001 0203 0405 0607 0809 0a0b 0c0d 0e0f\n 1011 1213 1415 1617 1819 1a1b 1c1d 1e1f\n\n"},
        {33, " 0001 0203 0405 0607 0809 0a0b 0c0d 0e0f\n 1011 1213 1415 1617 1819 1a1b 1c1d 1e1f\n 20\n\n"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.length);
        const std::unique_ptr<char[]> data = test::heapCopy(countingBytes(row.length));
        EXPECT_EQ(printed(HexDumpFormatter(data.get(), row.length, false)), row.text);
    }
}

TEST(HexDump, OfNoBytesPrintsOnlyTheTwoLineEnds)
{
    EXPECT_EQ(printed(HexDumpFormatter(nullptr, 0, false)), "\n\n");
    EXPECT_EQ(printed(HexDumpFormatter(nullptr, 0, true)), "\n\n");
}

TEST(HexDump, PrintsTheAddressOfTheFirstByteOfEachLine)
{
    const std::string data = countingBytes(17);
    char expected[128];
    const auto address = static_cast<unsigned long long>(reinterpret_cast<std::uintptr_t>(data.data()));
    std::snprintf(expected, sizeof(expected), "%016llx: 0001 0203 0405 0607 0809 0a0b 0c0d 0e0f\n%016llx: 10\n\n",
                  address, address + 16);
    EXPECT_EQ(printed(HexDumpFormatter(data.data(), data.size(), true)), expected);
}

TEST(HexDump, IsUpperCaseAfterAHexadecimalFormatter)
{
    std::ostringstream os;
    os << hexFormat(std::uint16_t(1)) << HexDumpFormatter("\xAB\xCD", 2, false);
    EXPECT_EQ(os.str(), "0x0001 ABCD\n\n");
}

TEST(HexDump, IsLowerCaseOnAFreshStream) { EXPECT_EQ(printed(HexDumpFormatter("\xAB\xCD", 2, false)), " abcd\n\n"); }

TEST(HexDump, SetsBaseAndFillItself)
{
    std::ostringstream os;
    os << std::dec << std::setfill('*') << HexDumpFormatter("\x0A", 1, false) << 16;
    EXPECT_EQ(os.str(), " 0a\n\n10");
    EXPECT_EQ(os.fill(), '0');
}

class SyncCountingBuffer : public std::stringbuf {
public:
    int syncs() const { return mSyncs; }

protected:
    int sync() override
    {
        ++mSyncs;
        return std::stringbuf::sync();
    }

private:
    int mSyncs = 0;
};

TEST(HexDump, FlushesAtEachLineEnd)
{
    SyncCountingBuffer buffer;
    std::ostream os(&buffer);
    const std::string data = countingBytes(33);
    os << HexDumpFormatter(data.data(), data.size(), false);
    EXPECT_EQ(buffer.syncs(), 4); // after lines one, two and three, and after the empty line
}

} // namespace
} // namespace qel
