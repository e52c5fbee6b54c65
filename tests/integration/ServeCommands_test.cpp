// The commands of partitions: their environment, and how their end is reported.

#include "integration/TestConsole.hpp"
#include "support/PtyProcess.hpp"

#include <algorithm>
#include <csignal>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;

/// Runs the console program on a partition, with no input. @return what it wrote
Process::Result runConsole(const ServeProcess& server, const std::string& partition)
{
    return runQel({"console", "--connect", server.endpoint(), "--plain", "--no-eof", partition});
}

/// Prints the environment that the kernel gave the shell, one variable a line.
const char* const kPrintEnvironment = "stty -onlcr; tr '\\0' '\\n' </proc/$$/environ";

TEST(ServeCommands, TheConsoleAndTheLogReportTheExitStatus)
{
    ServeProcess server({"--partition", "1=exit 3"});
    const auto console = runConsole(server, "1");
    EXPECT_EQ(console.exitStatus, 8);
    EXPECT_EQ(console.output, "");
    EXPECT_EQ(console.errors, "qel: session closed: the command exited with status 3\n");
    EXPECT_THAT(server.stop().errors, HasSubstr("(I): [qel] partition 1: the command exited with status 3\n"));
}

TEST(ServeCommands, TheConsoleAndTheLogReportTheSignal)
{
    ServeProcess server({"--partition", "1=kill -KILL $$"});
    const auto console = runConsole(server, "1");
    EXPECT_EQ(console.exitStatus, 8);
    EXPECT_EQ(console.errors, "qel: session closed: the command was killed by signal 9 (Killed)\n");
    EXPECT_THAT(server.stop().errors,
                HasSubstr("(I): [qel] partition 1: the command was killed by signal 9 (Killed)\n"));
}

TEST(ServeCommands, TheExitStatusIsTheLastLineOnATerminal)
{
    ServeProcess server({"--partition", "1=echo last words; exit 3"});
    PtyProcess person(qelCommand({"console", "--connect", server.endpoint(), "--plain", "1"}));
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 8);
    EXPECT_THAT(result.screen, EndsWith("last words\r\nqel: session closed: the command exited with status 3\r\n"));
    server.stop();
}

TEST(ServeCommands, TheEnvironmentIsCleanAndNotTheServers)
{
    ServeProcess server({"--partition", std::string("7=") + kPrintEnvironment}, "127.0.0.1:0", {"--plain"},
                        {{"QEL_SECRET", "of the server"},
                         {"TERM", "of-the-server"},
                         {"LANG", "of_THE.server"},
                         {"HOME", "/of/the/server"},
                         {"PATH", "/of/the/server:/usr/bin:/bin"}});
    const std::string output = runConsole(server, "7").output;
    EXPECT_THAT(output, HasSubstr("TERM=vt220\n"));
    EXPECT_THAT(output, HasSubstr("\nPATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin\nUSER="));
    EXPECT_THAT(output, HasSubstr("\nLANG=C.UTF-8\nQEL_PARTITION=7\n"));
    EXPECT_THAT(output, Not(HasSubstr("of the server")));
    EXPECT_THAT(output, Not(HasSubstr("/of/the/server")));
    EXPECT_EQ(std::count(output.begin(), output.end(), '\n'), 7) << output;
    server.stop();
}

TEST(ServeCommands, TermSetsTheTerminalType)
{
    ServeProcess server({"--term", "xterm-256color", "--partition", "1=stty -onlcr; echo \"$TERM\""});
    EXPECT_EQ(runConsole(server, "1").output, "xterm-256color\n");
    server.stop();
}

TEST(ServeCommands, RefusesATermThatIsNotATerminalType)
{
    for (const std::string term : {"vt 220", "vt/220", "vt=220", "\xC3\xA4"}) {
        SCOPED_TRACE(term);
        const auto result = runQel({"serve", "--plain", "--term", term});
        EXPECT_EQ(result.exitStatus, 2);
        EXPECT_EQ(result.output, "");
        EXPECT_EQ(result.errors, "qel: --term: \"" + term + "\" is not a terminal type, such as vt220\n");
    }
}

TEST(ServeCommands, AnIgnoredSigchldDoesNotHideTheExitStatus)
{
    Process shell({"/bin/sh", "-c", "trap '' CHLD; exec \"$0\" serve --plain --partition '1=exit 3'", QEL_PROGRAM});
    const std::string endpoint = shell.readLine();
    const auto console = runQel({"console", "--connect", endpoint, "--plain", "--no-eof", "1"});
    EXPECT_EQ(console.errors, "qel: session closed: the command exited with status 3\n");
    shell.signal(SIGTERM);
    EXPECT_EQ(shell.wait().exitStatus, 0);
}

} // namespace

} // namespace qel::test
