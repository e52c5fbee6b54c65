#include "console/EscapeFilter.hpp"

#include <gmock/gmock.h>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using ::testing::StartsWith;
using tool::characterName;
using tool::EscapeFilter;
using Command = EscapeFilter::Command;

struct Row {
    const char* name;
    std::string typed;
    std::string forPartition;
    std::vector<Command> commands; // in the order in which they were typed
};

void PrintTo(const Row& row, std::ostream* os) { *os << row.name; }

const std::vector<Row>& rows()
{
    static const std::vector<Row> all{
        {"Nothing", "", "", {}},
        {"Text", "ls -l\r", "ls -l\r", {}},
        {"EveryOtherByte",
         std::string("\0\x03\x04\x1A\x1B\x7F\x80\xFF", 8),
         std::string("\0\x03\x04\x1A\x1B\x7F\x80\xFF", 8),
         {}},
        {"LeaveAtOnce", "~.", "", {Command::Leave}},
        {"LeaveAfterReturn", "x\r~.", "x\r", {Command::Leave}},
        {"LeaveAfterLineFeed", "x\n~.", "x\n", {Command::Leave}},
        {"NotWithinALine", "x~.", "x~.", {}},
        {"NotAfterABlank", " ~.", " ~.", {}},
        {"NotAfterABackspace", "\x7F~.", "\x7F~.", {}},
        {"Help", "~?", "", {Command::Help}},
        {"Suspend", "~\x1A", "", {Command::Suspend}},
        {"ACommandTypesNothing", "~?~.", "", {Command::Help, Command::Leave}},
        {"TextBehindACommand", "~?ls\r", "ls\r", {Command::Help}},
        {"TwiceTypesIt", "~~", "~", {}},
        {"TwiceIsTheBeginningOfALine", "~~.", "~.", {}},
        {"TwiceAndTwiceMore", "~~~~", "~~~", {}},
        {"BeforeAnythingElse", "~x", "~x", {}},
        {"BeforeAReturn", "~\r~.", "~\r", {Command::Leave}},
        {"SeveralLines", "a\r~?b\r~~c\r~.", "a\rb\r~c\r", {Command::Help, Command::Leave}},
    };
    return all;
}

/// Types the characters of a row in pieces of some length.
void type(const Row& row, std::size_t pieceLength)
{
    EscapeFilter filter('~');
    std::string forPartition;
    std::vector<Command> commands;
    for (std::size_t begin = 0; begin < row.typed.size(); begin += pieceLength) {
        std::string piece = row.typed.substr(begin, pieceLength);
        while (!piece.empty()) {
            const Command command = filter.take(piece, forPartition);
            if (command != Command::None) commands.push_back(command);
        }
    }
    EXPECT_EQ(forPartition, row.forPartition);
    EXPECT_EQ(commands, row.commands);
}

class EscapeFilterRows : public ::testing::TestWithParam<Row> {};

TEST_P(EscapeFilterRows, TypedAtOnce) { type(GetParam(), 1000); }
TEST_P(EscapeFilterRows, TypedKeyByKey) { type(GetParam(), 1); }

INSTANTIATE_TEST_SUITE_P(All, EscapeFilterRows, ::testing::ValuesIn(rows()),
                         [](const auto& row) { return row.param.name; });

TEST(EscapeFilter, InputAfterACommandIsKept)
{
    EscapeFilter filter('~');
    std::string typed = "~.rest";
    std::string forPartition = "before";
    EXPECT_EQ(filter.take(typed, forPartition), Command::Leave);
    EXPECT_EQ(typed, "rest");
    EXPECT_EQ(forPartition, "before");
}

TEST(EscapeFilter, TheEscapeCharacterAloneWaitsForTheNext)
{
    EscapeFilter filter('~');
    std::string typed = "~";
    std::string forPartition;
    EXPECT_EQ(filter.take(typed, forPartition), Command::None);
    EXPECT_EQ(forPartition, "");
    typed = "a";
    EXPECT_EQ(filter.take(typed, forPartition), Command::None);
    EXPECT_EQ(forPartition, "~a");
}

TEST(EscapeFilter, AnyOtherCharacterCanBeTheEscape)
{
    EscapeFilter filter('\x1D');
    std::string typed = "~.\r\x1D\x1D\r\x1D.";
    std::string forPartition;
    EXPECT_EQ(filter.take(typed, forPartition), Command::Leave);
    EXPECT_EQ(forPartition, "~.\r\x1D\r");
}

TEST(EscapeFilter, WithoutAnEscapeEverythingIsInput)
{
    EscapeFilter filter(std::nullopt);
    std::string typed = "~.\r~?\r~~";
    std::string forPartition;
    EXPECT_EQ(filter.take(typed, forPartition), Command::None);
    EXPECT_EQ(forPartition, "~.\r~?\r~~");
    EXPECT_EQ(filter.help("\n"), "there is no escape character");
}

TEST(EscapeFilter, HelpNamesTheCommands)
{
    const std::string help = EscapeFilter('~').help("\n");
    EXPECT_THAT(help, StartsWith("at the start of a line:\n  ~.   leave\n  ~?   this list\n"));
    EXPECT_THAT(help, EndsWith("\n  ~^Z  suspend this program\n  ~~   type ~"));
    const std::string other = EscapeFilter('\x1D').help("|");
    EXPECT_THAT(other, StartsWith("at the start of a line:|  ^].   leave|"));
    EXPECT_THAT(other, EndsWith("|  ^]^Z  suspend this program|  ^]^]  type ^]"));
}

TEST(EscapeFilter, CommandCharactersCannotBeTheEscape)
{
    for (const char c : {'.', '?', '\x1A', '\r', '\n'})
        EXPECT_TRUE(EscapeFilter::isCommandCharacter(c)) << int{c};
    for (const char c : {'~', '%', '\x1D', 'a'})
        EXPECT_FALSE(EscapeFilter::isCommandCharacter(c)) << int{c};
}

TEST(EscapeFilter, CharactersHaveNames)
{
    EXPECT_EQ(characterName('~'), "~");
    EXPECT_EQ(characterName('\x1D'), "^]");
    EXPECT_EQ(characterName('\0'), "^@");
    EXPECT_EQ(characterName('\x7F'), "^?");
    EXPECT_EQ(characterName('\xFF'), "\\xff");
}

TEST(EscapeFilter, ALineCanBeginWithoutAReturn)
{
    EscapeFilter filter('~');
    std::string forPartition;
    std::string typed = "ls";
    EXPECT_EQ(filter.take(typed, forPartition), Command::None);
    filter.startLine();
    typed = "~.";
    EXPECT_EQ(filter.take(typed, forPartition), Command::Leave);
    EXPECT_EQ(forPartition, "ls");
    typed = "~";
    EXPECT_EQ(filter.take(typed, forPartition), Command::None);
    filter.startLine();
    typed = ".x";
    EXPECT_EQ(filter.take(typed, forPartition), Command::None) << "the escape character belongs to the line before";
    EXPECT_EQ(forPartition, "ls.x");
}

} // namespace

} // namespace qel::test
