// What the program says to command lines, without any connection.

#include "integration/TestConsole.hpp"
#include "support/TemporaryDirectory.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::Not;

std::string joined(const std::vector<std::string>& arguments)
{
    std::string text = "qel";
    for (const std::string& argument : arguments)
        text += " " + argument;
    return text;
}

TEST(CommandLine, HelpAndVersionStandAtEveryLevel)
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
        {"decode"}, // those of "ca" have a test beside the others of "ca"
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

TEST(CommandLine, AnythingThatCannotBeCarriedOutIsUsage)
{
    const TemporaryDirectory directory;
    const std::vector<std::vector<std::string>> bad{
        {},
        {"nonsense"},
        {"--nonsense"},
        {"serve", "extra"},
        {"serve"}, // neither with credentials nor with --plain
        {"serve", "--plain", "--listen", "localhost:0"},
        {"serve", "--plain", "--listen", "127.0.0.1"},
        {"serve", "--plain", "--listen", "0.0.0.0:0"},
        {"serve", "--plain", "--listen", "10.0.0.1:0"},
        {"serve", "--plain", "--listen", "[::]:0"},
        {"serve", "--plain", "--partition"},
        {"serve", "--plain", "--partition", "1"},
        {"serve", "--plain", "--partition", "=cat"},
        {"serve", "--plain", "--partition", "1="},
        {"serve", "--plain", "--partition", "0=cat"},
        {"serve", "--plain", "--partition", "65536=cat"},
        {"serve", "--plain", "--partition", "99999999999999999999=cat"},
        {"serve", "--plain", "--partition", "-1=cat"},
        {"serve", "--plain", "--partition", "one=cat"},
        {"serve", "--plain", "--partition", "1=cat", "--partition", "1=cat"},
        {"serve", "--plain", "--partition", "1=cat", "--partition", "01=cat"},
        {"serve", "--plain", "--max-consoles", "0"},
        {"serve", "--plain", "--max-consoles", "256"},
        {"serve", "--plain", "--queue-limit", "0"},
        {"serve", "--plain", "--queue-limit", "1073741825"},
        {"serve", "--plain", "--queue-limit", "x"},
        {"serve", "--plain", "--handshake-timeout", "0"},
        {"serve", "--plain", "--system-type", "01234567890123456"},
        {"serve", "--plain", "--system-serial", "01234567890123456"},
        {"serve", "--plain", "--interface-family", "QQ"},
        {"serve", "--plain", "--interface-version", "1"},
        {"serve", "--plain", "--interface-version", "1."},
        {"serve", "--plain", "--interface-version", "1.65536"},
        {"serve", "--plain", "--interface-version", "1.2.3"},
        {"serve", "--plain", "--capabilities", "012"},
        {"serve", "--plain", "--capabilities", std::string(33, '0')},
        {"serve", "--plain", "--log-level", "loud"},
        {"serve", "--plain", "--log-dir", directory.file("missing")},
        {"call"},
        {"call", "time"},
        {"call", "--connect", "127.0.0.1:1", "time"}, // the same
        {"call", "--connect", "127.0.0.1:1", "--plain"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "nonsense"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "time", "extra"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "time", "limits"},
        {"call", "--connect", "10.0.0.1:1", "--plain", "time"},
        {"call", "--connect", "[fe80::1]:1", "--plain", "time"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "capabilities", "2"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "capabilities", std::string(33, '1')},
        {"call", "--connect", "127.0.0.1:1", "--plain", "set-mode"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "set-mode", "256"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "set-mode", "-1"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "set-mode", "1", std::string(16349, 'x')},
        {"call", "--connect", "127.0.0.1:1", "--plain", "set-metadata"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "set-metadata", std::string(16351, 'x')},
        {"call", "--connect", "127.0.0.1:1", "--plain", "broadcast"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "broadcast", std::string(16307, 'x')},
        {"call", "--connect", "127.0.0.1:1", "--plain", "broadcast", "--type", "1", "x"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "broadcast", "--type", "256", "x"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "broadcast", "--to-id", "x", "x"},
        {"call", "--connect", "127.0.0.1:1", "--plain", "broadcast", "--type", "1", "--to-id", std::string(33, 'x'),
         "x"},
        {"bench"},
        {"bench", "--connect", "127.0.0.1:1"}, // without --plain
        {"bench", "--connect", "10.0.0.1:1", "--plain"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "extra"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--connections", "0"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--connections", "1"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--connections", "3"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--connections", "0x1B"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--connections", "256"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--size", "0"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--size", "16307"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--rate", "0"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--rate", "1000001"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--rate", "nan"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--count", "0"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--seconds", "0"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--seconds", "604801"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--seconds", "nan"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--seconds", "1", "--count", "1"},
        {"bench", "--connect", "127.0.0.1:1", "--plain", "--tool-id", std::string(29, 'x')},
    };
    for (const auto& arguments : bad) {
        SCOPED_TRACE(joined(arguments).substr(0, 200));
        const auto result = runQel(arguments);
        EXPECT_EQ(result.exitStatus, 2);
        EXPECT_EQ(result.output, "");
        EXPECT_THAT(result.errors, Not(IsEmpty()));
    }
}

TEST(CommandLine, TheReasonForRefusingATransportIsSaid)
{
    EXPECT_THAT(runQel({"serve"}).errors,
                HasSubstr("--credentials DIR --name NAME: is required, or --cert, --key and --root, or --plain for a "
                          "loopback address\n"));
    EXPECT_THAT(runQel({"serve", "--plain", "--listen", "0.0.0.0:0"}).errors,
                HasSubstr("--plain: is refused for 0.0.0.0:0, which is no loopback address\n"));
}

TEST(CommandLine, MorePartitionsThanTheProtocolCanCountAreUsage)
{
    std::vector<std::string> arguments{"serve", "--plain"};
    for (int id = 1; id <= 256; ++id) {
        arguments.push_back("--partition");
        arguments.push_back(std::to_string(id) + "=cat");
    }
    const auto result = runQel(arguments);
    EXPECT_EQ(result.exitStatus, 2);
    EXPECT_THAT(result.errors, HasSubstr("more than 255 partitions"));
}

} // namespace

} // namespace qel::test
