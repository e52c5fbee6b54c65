#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>

#include "support/CapturedLog.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <stdexcept>
#include <string>
#include <type_traits>

namespace qel::test {
namespace {

using ::testing::StrEq;
using ::testing::Throws;
using ::testing::ThrowsMessage;

constexpr LogLevel::Level kAboveRange = static_cast<LogLevel::Level>(5);
constexpr LogLevel::Level kBelowRange = static_cast<LogLevel::Level>(-2);

struct LevelNames {
    LogLevel::Level level;
    int number;
    const char* name;
    char letter;
};

constexpr LevelNames kLevels[] = {
    {LogLevel::Inherit, -1, "INHERIT", '^'}, {LogLevel::Debug, 0, "DEBUG", 'D'},
    {LogLevel::Info, 1, "INFO", 'I'},        {LogLevel::Warn, 2, "WARN", 'W'},
    {LogLevel::Error, 3, "ERROR", 'E'},      {LogLevel::Critical, 4, "CRITICAL", 'C'},
};

TEST(LogLevel, IsASigned32BitInteger)
{
    EXPECT_TRUE((std::is_same_v<std::underlying_type_t<LogLevel::Level>, std::int32_t>));
}

TEST(LogLevel, EachLevelHasItsNumberNameAndLetter)
{
    for (const LevelNames& row : kLevels) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(row.level, row.number);
        EXPECT_EQ(LogLevel::getName(row.level), row.name);
        EXPECT_EQ(LogLevel::getAbbreviatedName(row.level), row.letter);
        EXPECT_TRUE(LogLevel::isValid(row.level));
    }
}

TEST(LogLevel, MinAndMaxAreTheEndsOfTheRange)
{
    EXPECT_EQ(LogLevel::Min, LogLevel::Inherit);
    EXPECT_EQ(LogLevel::Max, LogLevel::Critical);
    EXPECT_FALSE(LogLevel::isValid(kBelowRange));
    EXPECT_FALSE(LogLevel::isValid(kAboveRange));
}

TEST(LogLevel, ValuesOutsideTheRangePrintAsNumbers)
{
    EXPECT_EQ(LogLevel::getName(static_cast<LogLevel::Level>(7)), "7");
    EXPECT_EQ(LogLevel::getName(kBelowRange), "-2");
    EXPECT_EQ(LogLevel::getAbbreviatedName(static_cast<LogLevel::Level>(7)), '?');
    EXPECT_EQ(LogLevel::getAbbreviatedName(kBelowRange), '?');
}

TEST(LogLevel, ParsesNamesLettersAndNumbers)
{
    struct {
        const char* text;
        LogLevel::Level level;
    } const rows[] = {
        {"inherit", LogLevel::Inherit},
        {"INHERIT", LogLevel::Inherit},
        {"^", LogLevel::Inherit},
        {"-1", LogLevel::Inherit},
        {"debug", LogLevel::Debug},
        {"d", LogLevel::Debug},
        {"D", LogLevel::Debug},
        {"0", LogLevel::Debug},
        {"Info", LogLevel::Info},
        {"i", LogLevel::Info}, // not Inherit, which begins with the same letter
        {"I", LogLevel::Info},
        {"1", LogLevel::Info},
        {"warn", LogLevel::Warn},
        {"WARN", LogLevel::Warn},
        {"wArN", LogLevel::Warn},
        {"W", LogLevel::Warn},
        {"w", LogLevel::Warn},
        {"2", LogLevel::Warn},
        {"error", LogLevel::Error},
        {"e", LogLevel::Error},
        {"3", LogLevel::Error},
        {"critical", LogLevel::Critical},
        {"C", LogLevel::Critical},
        {"4", LogLevel::Critical},
        // what std::stoi parses as a decimal number
        {"4x", LogLevel::Critical},
        {" 3", LogLevel::Error},
        {"+2", LogLevel::Warn},
        {"0X1", LogLevel::Debug},
        {"0x1", LogLevel::Debug},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_EQ(LogLevel::parse(row.text), row.level);
    }
}

TEST(LogLevel, RefusesANumberOutsideTheRange)
{
    for (const char* text : {"5", "-2", "2147483647", "-2147483648"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT([text] { LogLevel::parse(text); }, ThrowsMessage<std::invalid_argument>(StrEq("name")));
    }
}

TEST(LogLevel, ParsingNeitherNameNorNumberThrowsTheExceptionOfStoi)
{
    for (const char* text : {"loud", "", " ", "^^", "warning", "warn ", " warn", "?", "-"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT([text] { LogLevel::parse(text); }, ThrowsMessage<std::invalid_argument>(StrEq("stoi")));
    }
    EXPECT_THAT([] { LogLevel::parse("99999999999"); }, ThrowsMessage<std::out_of_range>(StrEq("stoi")));
}

TEST(LogLevel, IsWrittenByItsFullName)
{
    std::ostringstream os;
    os << LogLevel::Inherit << ' ' << LogLevel::Critical << ' ' << static_cast<LogLevel::Level>(7);
    EXPECT_EQ(os.str(), "INHERIT CRITICAL 7");
}

TEST(LogLevel, IsReadAsOneWord)
{
    std::istringstream is("  error\tw 0\n^rest");
    LogLevel::Level level = LogLevel::Inherit;
    is >> level;
    EXPECT_EQ(level, LogLevel::Error);
    is >> level;
    EXPECT_EQ(level, LogLevel::Warn);
    is >> level;
    EXPECT_EQ(level, LogLevel::Debug);
    EXPECT_THAT([&] { is >> level; }, ThrowsMessage<std::invalid_argument>(StrEq("stoi"))) << "\"^rest\" is one word";
    EXPECT_EQ(level, LogLevel::Debug) << "kept after an invalid word";
}

TEST(LogLevel, KeepsItsValueWithoutAWordToRead)
{
    std::istringstream is("   ");
    LogLevel::Level level = LogLevel::Error;
    is >> level;
    EXPECT_TRUE(is.fail());
    EXPECT_EQ(level, LogLevel::Error);
}

TEST(LogLevel, ReadingThrowsTheExceptionsOfParse)
{
    std::istringstream is("5 99999999999");
    LogLevel::Level level = LogLevel::Error;
    EXPECT_THAT([&] { is >> level; }, ThrowsMessage<std::invalid_argument>(StrEq("name")));
    EXPECT_THAT([&] { is >> level; }, Throws<std::out_of_range>());
    EXPECT_EQ(level, LogLevel::Error);
}

TEST(LogLevel, SetLogLevelSetsTheRootLogger)
{
    const CapturedLog log(LogLevel::Warn);
    LogLevel::setLogLevel(LogLevel::Info);
    EXPECT_EQ(QelLogger::get().getEffectiveLevel(), LogLevel::Info);
    LogLevel::setLogLevel(kAboveRange);
    EXPECT_EQ(QelLogger::get().getEffectiveLevel(), LogLevel::Info) << "an invalid level changes nothing";
    LogLevel::setLogLevel(LogLevel::Inherit);
    EXPECT_EQ(QelLogger::get().getEffectiveLevel(), LogLevel::Warn);
}

} // namespace
} // namespace qel::test
