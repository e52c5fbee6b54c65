// What the program says to command lines, without any connection.

#include "integration/TestConsole.hpp"
#include "support/TemporaryDirectory.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;

std::string joined(const std::vector<std::string>& arguments)
{
    std::string text = "qel";
    for (const std::string& argument : arguments)
        text += " " + argument;
    return text;
}

TEST(CommandLine, EveryLevelHasHelpAndVersion)
{
    const std::vector<std::vector<std::string>> levels{
        {},
        {"serve"},
        {"call"},
        {"call", "version"},
        {"call", "capabilities"},
        {"call", "limits"},
        {"call", "time"},
        {"call", "max-sessions"},
        {"call", "get-mode"},
        {"call", "set-mode"},
        {"call", "get-metadata"},
        {"call", "set-metadata"},
        {"call", "broadcast"},
        {"console"},
        {"bench"},
        {"decode"},
        {"check"},
        {"check", "server"}, // those of "ca" have a test beside the others of "ca"
    };
    for (std::vector<std::string> level : levels) {
        SCOPED_TRACE(joined(level));
        level.push_back("--help");
        const auto help = runQel(level);
        EXPECT_EQ(help.exitStatus, 0);
        level.pop_back();
        EXPECT_THAT(help.output, HasSubstr("Usage: " + joined(level) + " "));
        EXPECT_THAT(help.errors, IsEmpty());
        level.push_back("-h");
        EXPECT_EQ(runQel(level).output, help.output);
        level.back() = "--version";
        const auto version = runQel(level);
        EXPECT_EQ(version.exitStatus, 0);
        EXPECT_THAT(version.output, MatchesRegex("qel [0-9]+\\.[0-9]+\\.[0-9]+\n"));
    }
}

TEST(CommandLine, HelpThatCannotBePrintedIsAFailure)
{
    for (const std::string arguments : {"--help", "--version", "call --help", "call version --version"}) {
        SCOPED_TRACE(arguments);
        const auto result = run({"/bin/sh", "-c", "exec \"$0\" " + arguments + " >/dev/full", QEL_PROGRAM});
        EXPECT_EQ(result.exitStatus, 4);
        EXPECT_EQ(result.errors, "qel: cannot write to standard output\n");
    }
}

TEST(CommandLine, IntegersAreReadByOneRuleEverywhere)
{
    // What is wrong with these is said only once the integers have been read.
    const std::vector<std::string> serve{"serve", "--listen", "10.0.0.1:0", "--plain", "--partition"};
    for (const std::string id : {"10", "000010", "0xA", "0x0a", "00000000000000000000000010"}) {
        SCOPED_TRACE(id);
        std::vector<std::string> arguments = serve;
        arguments.insert(arguments.end(), {id + "=cat", "--partition", "10=cat"});
        EXPECT_EQ(runQel(arguments).errors, "qel: --plain is refused for 10.0.0.1:0: it is not a loopback address\n");
        arguments[2] = "127.0.0.1:0";
        EXPECT_EQ(runQel(arguments).errors, "qel: --partition: partition 10 is given twice\n");
        EXPECT_EQ(runQel({"console", "--connect", "10.0.0.1:1", "--plain", id}).errors,
                  "qel: --plain is refused for 10.0.0.1:1: it is not a loopback address\n");
    }
}

} // namespace

} // namespace qel::test
