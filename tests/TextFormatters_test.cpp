// The formatters that do not print plain numbers or bytes: characters, signals, exceptions, durations, ranges.

#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/GroupingLocale.hpp"
#include "support/Printed.hpp"

#include <chrono>
#include <climits>
#include <cstdint>
#include <cstring>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iomanip>
#include <list>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

namespace qel {
namespace {

using test::printed;

// ---------------------------------------------------------------------------------------------------- character runs

TEST(CharArray, PrintsExactlyTheGivenCharacters)
{
    const char text[] = {'a', '\0', 'b', '\n', 'c'};
    EXPECT_EQ(printed(CharArrayFormatter(text, sizeof(text))), std::string("a\0b\nc", 5));
    EXPECT_EQ(printed(CharArrayFormatter(text, 1)), "a");
    EXPECT_EQ(printed(CharArrayFormatter(nullptr, 0)), "");
}

TEST(CharArray, IsNotPaddedToAPendingWidth)
{
    std::ostringstream os;
    os << std::setw(6) << std::setfill('*') << CharArrayFormatter("ab", 2);
    EXPECT_EQ(os.str(), "ab");
}

// ----------------------------------------------------------------------------------------------------------- signals

TEST(Signal, PrintsTheDescriptionOfEverySignalThatHasOne)
{
    for (int number = 1; number <= 31; ++number) {
        SCOPED_TRACE(number);
        EXPECT_EQ(printed(SignalFormatter(number)), std::to_string(number) + " (" + ::strsignal(number) + ")");
    }
}

TEST(Signal, PrintsTheKnownTexts)
{
    EXPECT_EQ(printed(SignalFormatter(1)), "1 (Hangup)");
    EXPECT_EQ(printed(SignalFormatter(11)), "11 (Segmentation fault)");
    EXPECT_EQ(printed(SignalFormatter(15)), "15 (Terminated)");
}

TEST(Signal, PrintsANumberWithoutADescriptionAlone)
{
    EXPECT_EQ(printed(SignalFormatter(0)), "0");
    for (int number = 32; number <= 64; ++number) {
        EXPECT_EQ(printed(SignalFormatter(number)), std::to_string(number));
    }
}

TEST(Signal, PrintsANumberOutsideTheTableAlone)
{
    EXPECT_EQ(printed(SignalFormatter(65)), "65");
    EXPECT_EQ(printed(SignalFormatter(-1)), "-1");
    EXPECT_EQ(printed(SignalFormatter(INT_MAX)), "2147483647");
    EXPECT_EQ(printed(SignalFormatter(INT_MIN)), "-2147483648");
}

TEST(Signal, IsDecimalAfterAHexadecimalFormatter)
{
    std::ostringstream os;
    os << hexFormat(std::uint16_t(1)) << ' ' << SignalFormatter(15);
    EXPECT_EQ(os.str(), "0x0001 15 (Terminated)");
}

// -------------------------------------------------------------------------------------------------------- exceptions

class FormatterTestException : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

TEST(ExceptionInfo, PrintsTypeAndText)
{
    const FileIOError error(PosixErrorCode(5), "disk");
    EXPECT_EQ(printed(ExceptionInfo(error)), "qel::FileIOError: disk: 5 (Input/output error)");
    EXPECT_EQ(printed(ExceptionInfo(std::runtime_error("text"))), "std::runtime_error: text");
}

TEST(ExceptionInfo, PrintsTheDynamicType)
{
    try {
        throw FormatterTestException("text");
    } catch (const std::exception& exception) {
        EXPECT_EQ(printed(ExceptionInfo(exception)), "qel::(anonymous namespace)::FormatterTestException: text");
    }
}

// ------------------------------------------------------------------------------------------------------- indentation

TEST(IndentFormatter, PrintsCopiesOfItsCharacter)
{
    EXPECT_EQ(printed(Indent(3, ' ')), "   ");
    EXPECT_EQ(printed(Indent(2, '*')), "**");
    EXPECT_EQ(printed(Indent(0, '*')), "");
}

TEST(IndentFormatter, PlusMakesADeeperOneAndKeepsTheOriginal)
{
    const Indent outer(1, '.');
    const Indent inner = outer + 2;
    EXPECT_EQ(printed(inner), "...");
    EXPECT_EQ(printed(outer), ".");
    EXPECT_EQ(printed(outer + 0), ".");
}

TEST(IndentFormatter, PlusAssignDeepensInPlaceAndChains)
{
    Indent indent(1, '.');
    EXPECT_EQ(&(indent += 2), &indent);
    EXPECT_EQ(printed(indent), "...");
    (indent += 1) += 1;
    EXPECT_EQ(printed(indent), ".....");
}

TEST(IndentFormatter, LeavesAPendingWidthAlone)
{
    std::ostringstream os;
    os << std::setfill('*') << std::setw(4) << Indent(2, ' ') << 7;
    EXPECT_EQ(os.str(), "  ***7");
}

// --------------------------------------------------------------------------------------------------------- durations

using std::chrono::milliseconds;

constexpr long long kDay = 86400000;
constexpr long long kHour = 3600000;
constexpr long long kMinute = 60000;
constexpr long long kSecond = 1000;

TEST(DHMSDuration, PrintsDaysHoursMinutesSecondsAndMilliseconds)
{
    struct Row {
        long long milliseconds;
        const char* text;
    };
    const Row rows[] = {
        {0, "000d:00h:00m:00.000s"},
        {1, "000d:00h:00m:00.001s"},
        {999, "000d:00h:00m:00.999s"},
        {kSecond, "000d:00h:00m:01.000s"},
        {kMinute - 1, "000d:00h:00m:59.999s"},
        {kMinute, "000d:00h:01m:00.000s"},
        {kHour - 1, "000d:00h:59m:59.999s"},
        {kHour, "000d:01h:00m:00.000s"},
        {kDay - 1, "000d:23h:59m:59.999s"},
        {kDay, "001d:00h:00m:00.000s"},
        {kDay + 2 * kHour + 3 * kMinute + 4 * kSecond + 5, "001d:02h:03m:04.005s"},
        {999 * kDay, "999d:00h:00m:00.000s"},
        {1000 * kDay, "1000d:00h:00m:00.000s"},
        {INT_MAX * kDay + kDay - 1, "2147483647d:23h:59m:59.999s"},
        {(INT_MAX + 1LL) * kDay, "-2147483648d:00h:00m:00.000s"}, // the days are a signed 32-bit count
        {(UINT_MAX + 1LL) * kDay, "000d:00h:00m:00.000s"},
        {-1, "000d:00h:00m:00.0-1s"},
        {-kSecond, "000d:00h:00m:-1.000s"},
        {-kDay - 2 * kHour, "0-1d:-2h:00m:00.000s"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.milliseconds);
        EXPECT_EQ(printed(DHMSDurationFormatter(milliseconds(row.milliseconds))), row.text);
    }
}

TEST(DHMSDuration, PrintsTheLargestDurations)
{
    EXPECT_THAT(printed(DHMSDurationFormatter(milliseconds::max())), testing::StrEq("-622191233d:07h:12m:55.807s"));
    EXPECT_THAT(printed(DHMSDurationFormatter(milliseconds::min())), testing::StrEq("622191233d:-7h:-12m:-55.-808s"));
}

TEST(DHMSDuration, IsDecimalAndRightAlignedOnAnyStream)
{
    std::ostringstream os;
    os << hexFormat(std::uint16_t(1)) << std::left << ' '
       << DHMSDurationFormatter(milliseconds(10 * kDay + 11 * kHour + 12 * kMinute + 13 * kSecond + 14));
    EXPECT_EQ(os.str(), "0x0001 010d:11h:12m:13.014s");
}

TEST(DHMSDuration, RestoresTheFlagsButNotTheFill)
{
    std::ostringstream os;
    os << std::hex << std::uppercase << std::left << std::setfill('*');
    const std::ios_base::fmtflags before = os.flags();
    os << DHMSDurationFormatter(milliseconds(0));
    EXPECT_EQ(os.flags(), before);
    EXPECT_EQ(os.fill(), '0');
    os.str("");
    os << 171;
    EXPECT_EQ(os.str(), "AB");
}

// ----------------------------------------------------------------------------------------------------------- joining

struct Element {
    int number;
};
std::ostream& operator<<(std::ostream& os, const Element& element) { return os << '<' << element.number << '>'; }

TEST(Join, WritesTheSeparatorBetweenTheElements)
{
    const std::vector<int> numbers{1, 2, 3};
    EXPECT_EQ(printed(join(numbers, ", ")), "1, 2, 3");
    EXPECT_EQ(printed(join(numbers, "")), "123");
}

TEST(Join, PrintsNoSeparatorForOneElement)
{
    const std::vector<int> numbers{1};
    EXPECT_EQ(printed(join(numbers, ", ")), "1");
}

TEST(Join, AnEmptyRangePrintsNothing)
{
    const std::vector<int> numbers;
    std::ostringstream os;
    os << '[' << join(numbers, ", ") << ']';
    EXPECT_EQ(os.str(), "[]");
}

TEST(Join, UsesTheInsertionOperatorOfTheElements)
{
    const std::list<Element> elements{{1}, {2}};
    EXPECT_EQ(printed(join(elements, "-")), "<1>-<2>");
}

TEST(Join, TakesAPairOfIterators)
{
    const std::vector<std::string> words{"a", "b", "c", "d"};
    EXPECT_EQ(printed(join(words.begin() + 1, words.end() - 1, "; ")), "b; c");
    EXPECT_EQ(printed(join(words.begin(), words.begin(), "; ")), "");
}

TEST(Join, TakesAnArray)
{
    const int numbers[] = {4, 5};
    EXPECT_EQ(printed(join(numbers, "+")), "4+5");
}

TEST(Join, PrintsNumbersInTheBaseOfTheStream)
{
    const std::vector<int> numbers{10, 171};
    std::ostringstream os;
    os << hexFormat(std::uint16_t(1)) << ' ' << join(numbers, ",");
    EXPECT_EQ(os.str(), "0x0001 A,AB");
}

TEST(Join, OwnsItsSeparator)
{
    const std::vector<int> numbers{1, 2};
    std::string separator = " and then ";
    const auto joined = join(numbers, separator);
    separator = "overwritten";
    EXPECT_EQ(printed(joined), "1 and then 2");
}

TEST(Join, CanBePrintedTwice)
{
    const std::vector<int> numbers{1, 2};
    const auto joined = join(numbers, ",");
    EXPECT_EQ(printed(joined), "1,2");
    EXPECT_EQ(printed(joined), "1,2");
}

// ---------------------------------------------------------------------------------------------------------- toString

TEST(ToString, GivesWhatTheValuePrints)
{
    EXPECT_EQ(toString(42), "42");
    EXPECT_EQ(toString(std::string("text")), "text");
    EXPECT_EQ(toString(hexFormat(std::uint16_t(0x1F))), "0x001F");
    EXPECT_EQ(toString(Element{7}), "<7>");
}

TEST(ToString, IsTheSameInEveryLocale)
{
    const test::GroupingLocale grouping;
    EXPECT_EQ(printed(4711), "4.711"); // the locale is in force
    EXPECT_EQ(toString(4711), "4711");
}

} // namespace
} // namespace qel
