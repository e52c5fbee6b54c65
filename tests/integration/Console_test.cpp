// A person, or a script, at the serial console of a partition.

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/Listen.hpp>

#include "integration/TestConsole.hpp"
#include "support/PtyProcess.hpp"
#include "support/TemporaryDirectory.hpp"

#include <csignal>
#include <fstream>
#include <functional>
#include <gmock/gmock.h>
#include <regex>
#include <thread>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

constexpr const char* kEndedLine = "qel: session closed: the command exited with status 0\n";

using Arguments = std::vector<std::string>;

Arguments consoleTo(const std::string& endpoint, const Arguments& more)
{
    Arguments arguments = qelCommand({"console", "--connect", endpoint, "--plain"});
    arguments.insert(arguments.end(), more.begin(), more.end());
    return arguments;
}

/// A command line for a shell, each word quoted.
std::string commandLine(const Arguments& arguments)
{
    std::string line;
    for (const std::string& argument : arguments)
        line += "'" + argument + "' ";
    return line;
}

Arguments shell(const std::string& script, const std::string& option = "-c") { return {"/bin/sh", option, script}; }

/// Partition 1 is a shell, 2 repeats its input, 3 says "ready" and repeats a million bytes as they are, 4 is
/// silent.
class ConsoleTest : public ::testing::Test {
protected:
    Arguments console(const Arguments& more) const { return consoleTo(server.endpoint(), more); }
    Process::Result runConsole(const Arguments& more, const std::string& input) const
    {
        return run(console(more), input);
    }

    ServeProcess server{{"--partition", "1=PS1='$ ' exec /bin/sh", "--partition", "2=exec cat", "--partition",
                         "3=stty raw -echo; echo ready; head -c 1000000", "--partition", "4=exec sleep 1000",
                         "--max-consoles", "8"}};
};

// Input that is not a terminal.

TEST_F(ConsoleTest, RunsACommandFromAPipe)
{
    const auto result = runConsole({"1"}, "echo $((6 * 7)) is it\n");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, HasSubstr("42 is it\r\n"));
    EXPECT_THAT(result.output, HasSubstr("echo $((6 * 7)) is it\r\n")) << "the terminal of the partition echoes";
    EXPECT_EQ(result.errors, kEndedLine);
}

TEST_F(ConsoleTest, ReadsInputFromAFile)
{
    const TemporaryDirectory directory;
    std::ofstream(directory.file("script")) << "echo $((6 * 7))\n";
    const auto result = run(shell(commandLine(console({"1"})) + "<" + directory.file("script")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, HasSubstr("42\r\n"));
}

TEST_F(ConsoleTest, WaitsForLateOutput)
{
    const auto result = runConsole({"1"}, "sleep 1.2; echo late-$((6 * 7))\n");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, HasSubstr("late-42\r\n"));
}

TEST_F(ConsoleTest, TheEndOfTheInputReachesEveryCommand)
{
    // The first end-of-file character ends cat, the next one the shell.
    const auto result = runConsole({"1"}, "cat; echo $((6 * 7))\nhello\n");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, AllOf(HasSubstr("hello\r\n"), HasSubstr("42\r\n")));
    EXPECT_EQ(result.errors, kEndedLine);
}

TEST_F(ConsoleTest, AnUnfinishedLineIsExecuted)
{
    const auto result = runConsole({"1"}, "echo $((6 * 7))");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, HasSubstr("42\r\n"));
}

TEST_F(ConsoleTest, EmptyInputEndsTheCommand)
{
    const auto result = runConsole({"2"}, "");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.output, "");
    EXPECT_EQ(result.errors, kEndedLine);
}

TEST_F(ConsoleTest, EscapeCharactersInAPipeAreInput)
{
    const auto result = runConsole({"2"}, "~.\n~?\n~~\n");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, AllOf(HasSubstr("~.\r\n"), HasSubstr("~?\r\n"), HasSubstr("~~\r\n")));
}

TEST_F(ConsoleTest, TheShellSurvivesWithoutEndOfFileAndWithLinger)
{
    const auto first = runConsole({"1", "--no-eof", "--linger", "0.1"}, "x=$((6 * 7))\n");
    EXPECT_EQ(first.exitStatus, 0);
    EXPECT_EQ(first.errors, "");
    const auto second = runConsole({"1"}, "echo x is $x\n");
    EXPECT_EQ(second.exitStatus, 0);
    EXPECT_THAT(second.output, HasSubstr("x is 42\r\n"));
}

TEST_F(ConsoleTest, LeavesAnEndlessCommandAfterTheLingerTime)
{
    const auto result = runConsole({"4", "--linger", "0.1"}, "hello\n");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.errors, "");
    EXPECT_EQ(runConsole({"4", "--linger", "0"}, "").exitStatus, 0) << "the session was closed, and the name is free";
}

TEST_F(ConsoleTest, ConsolesInARowDoNotCollide)
{
    for (int i = 0; i < 20; ++i) {
        const auto result = runConsole({"4", "--linger", "0", "--tool-id", "me"}, "");
        ASSERT_EQ(result.exitStatus, 0) << result.errors;
    }
}

TEST_F(ConsoleTest, LargeDataArrivesUnchangedInBothDirections)
{
    std::string data;
    for (unsigned int i = 0; data.size() < 1000000; ++i)
        data += std::to_string(i) + (i % 7 == 0 ? "\r" : "\n\x04~.");
    data.resize(1000000);
    Process process(console({"3"}));
    process.awaitOutput("ready\n");
    process.writeInput(data);
    process.closeInput();
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_TRUE(result.output == "ready\n" + data);
    EXPECT_EQ(result.errors, kEndedLine);
}

TEST_F(ConsoleTest, ASlowReaderGetsAllOutput)
{
    const std::string script = commandLine(console({"1"})) + "| (head -c 1000; sleep 0.3; cat) | tail -c 13";
    const auto result = run(shell(script), "seq -w 200000; echo $((6 * 7))\n");
    EXPECT_THAT(result.output, HasSubstr("00\r\n42\r\n$ "));
}

TEST_F(ConsoleTest, TheReaderOfTheOutputMayClose)
{
    const std::string script = "{ " + commandLine(console({"1"})) + "; echo \"status $?\" >&2; } | head -n 1";
    const auto result = run(shell(script), "seq 200000\n");
    EXPECT_THAT(result.output, EndsWith("seq 200000\r\n"));
    EXPECT_THAT(result.errors, HasSubstr("qel: cannot write to standard output: 32 (Broken pipe)\nstatus 4\n"));
}

TEST_F(ConsoleTest, ClosedStandardDescriptorsAreNotReusedForTheConnection)
{
    const auto noInput = run(shell(commandLine(console({"2"})) + "<&-"));
    EXPECT_EQ(noInput.exitStatus, 4);
    EXPECT_EQ(noInput.errors, "qel: cannot read standard input: 9 (Bad file descriptor)\n");
    const auto noOutput = run(shell(commandLine(console({"2"})) + ">&-"), "hello\n");
    EXPECT_EQ(noOutput.exitStatus, 4);
    EXPECT_EQ(noOutput.errors, "qel: cannot write to standard output: 9 (Bad file descriptor)\n");
    const auto noErrors = run(shell(commandLine(console({"2"})) + "2>&-"), "hello\n");
    EXPECT_EQ(noErrors.exitStatus, 0);
    EXPECT_THAT(noErrors.output, HasSubstr("hello\r\nhello\r\n"));
    const auto noAnswer =
        run(shell(commandLine(qelCommand({"call", "--connect", server.endpoint(), "--plain", "version"})) + ">&-"));
    EXPECT_EQ(noAnswer.exitStatus, 4);
}

// A person at a terminal.

TEST_F(ConsoleTest, APersonTypesSeesTheOutputAndLeaves)
{
    PtyProcess person(console({"1", "--tool-id", "me"}));
    person.await("qel: connected to partition 1 of " + server.endpoint() +
                 " (plain); ~. at the start of a line leaves, ~? lists the commands\r\n");
    EXPECT_TRUE(isRaw(person.terminal().attributes()));
    person.await("$ ");
    person.type("echo $((6 * 7))\r");
    person.await("echo $((6 * 7))\r\n42\r\n$ ");
    person.type("~.");
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.screen, EndsWith("$ \r\nqel: left partition 1\r\n"));
    EXPECT_TRUE(person.isTerminalUntouched());

    // The session is closed, and the hypervisor has forgotten the name.
    EXPECT_EQ(runConsole({"1", "--tool-id", "me"}, "").exitStatus, 0);
}

TEST_F(ConsoleTest, TheEndOfTheCommandEndsTheConsole)
{
    PtyProcess person(console({"1"}));
    person.await("$ ");
    person.type("exit\r");
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.screen, EndsWith("\r\nqel: session closed: the command exited with status 0\r\n"));
    EXPECT_TRUE(person.isTerminalUntouched());
}

TEST_F(ConsoleTest, ControlCharactersGoToThePartition)
{
    PtyProcess person(console({"1"}));
    person.await("$ ");
    person.type("sh -c 'echo $((6 * 7)); exec sleep 1000'\r");
    person.await("42\r\n");
    person.type("\x03"); // the terminal throws away what has not been read or shown yet
    person.await("^C");
    person.type("echo $((7 * 7))\r");
    person.await("49\r\n");
    person.type("\x04");
    EXPECT_EQ(person.wait().exitStatus, 0);
}

TEST_F(ConsoleTest, ListsTheEscapeCommands)
{
    PtyProcess person(console({"2"}));
    person.await("connected");
    person.type("~?");
    person.await("qel: at the start of a line:\r\n  ~.   leave\r\n");
    person.type("~~x\r");
    person.await("~x\r\n~x\r\n");
    person.type("~.");
    EXPECT_EQ(person.wait().exitStatus, 0);
}

TEST_F(ConsoleTest, LogLinesInRawModeEndWithCarriageReturn)
{
    PtyProcess person(console({"2", "--log-level", "debug"}));
    person.await("qel: connected");
    person.type("~.");
    const std::string screen = person.wait().screen;
    EXPECT_THAT(screen.substr(screen.find("qel: connected")), HasSubstr("(D): "));
    EXPECT_EQ(std::regex_replace(screen, std::regex("\r\n"), "").find('\n'), std::string::npos) << screen;
}

TEST_F(ConsoleTest, TheEscapeCharacterCanBeChosen)
{
    PtyProcess person(console({"2", "--escape", "^]"}));
    person.await("; ^]. at the start of a line leaves, ^]? lists the commands\r\n");
    person.type("~.\r");
    person.await("~.\r\n~.\r\n");
    person.type("\x1D.");
    EXPECT_EQ(person.wait().exitStatus, 0);
}

TEST_F(ConsoleTest, TheEscapeCharacterCanBeDisabled)
{
    PtyProcess person(console({"2", "--escape", "none"}));
    person.type("~.\r");
    person.await("~.\r\n~.\r\n");
    person.type("\x04");
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.screen, HasSubstr("; there is no escape character\r\n"));
}

TEST_F(ConsoleTest, ASignalEndsTheConsoleAndRestoresTheTerminal)
{
    for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGQUIT}) {
        SCOPED_TRACE(signal);
        PtyProcess person(console({"1", "--tool-id", "me"}));
        person.await("connected");
        ASSERT_TRUE(isRaw(person.terminal().attributes()));
        person.signal(signal);
        const auto result = person.wait();
        EXPECT_EQ(result.signal, signal);
        EXPECT_TRUE(person.isTerminalUntouched());
    }
}

TEST_F(ConsoleTest, SignalsThatAreIgnoredStayIgnored)
{
    PtyProcess person(shell("trap '' HUP; exec " + commandLine(console({"2"}))));
    person.await("connected");
    person.signal(SIGHUP);
    person.type("still here\r");
    person.await("still here\r\nstill here\r\n");
    person.signal(SIGTERM);
    EXPECT_EQ(person.wait().signal, SIGTERM);
}

TEST_F(ConsoleTest, SuspendingRestoresTheTerminalUntilItContinues)
{
    PtyProcess person(
        shell(commandLine(console({"2"})) + "; echo stopped $?; read line; echo got $line; fg; echo left $?", "-mc"));
    person.await("connected");
    person.type("~\x1A");
    person.await("stopped ");
    EXPECT_TRUE(person.isTerminalUntouched());
    person.type("a line\n");
    person.await("got a line\r\n");
    person.type("hello\r");
    person.await("hello\r\nhello\r\n");
    EXPECT_TRUE(isRaw(person.terminal().attributes()));
    person.type("~.");
    person.await("left 0");
    EXPECT_EQ(person.wait().exitStatus, 0);
    EXPECT_TRUE(person.isTerminalUntouched());
}

TEST_F(ConsoleTest, TheTerminalOfAnotherJobIsNotChanged)
{
    // A signal that cannot be caught stops the console in raw mode. The shell goes on with a mode of its own, and then
    // the console is told to end.
    PtyProcess person(shell(commandLine(console({"2"})) +
                                "; stty sane -echoe; echo stopped; read line; kill -TERM %1; bg >/dev/null; wait %1; "
                                "echo ended $?; read line",
                            "-mc"));
    person.await("connected");
    const pid_t foreground = ::tcgetpgrp(person.terminal().master());
    ASSERT_GT(foreground, 0);
    ASSERT_EQ(::kill(-foreground, SIGSTOP), 0);
    person.await("stopped\r\n");
    const termios ofTheShell = person.terminal().attributes();
    ASSERT_FALSE(isRaw(ofTheShell));
    person.type("\n");
    person.await("ended 143\r\n");
    EXPECT_TRUE(person.terminal().attributes() == ofTheShell);
    person.type("\n");
    EXPECT_EQ(person.wait().exitStatus, 0);
}

TEST_F(ConsoleTest, BroadcastsOfOtherConsolesAreShownOnALineOfTheirOwn)
{
    PtyProcess person(console({"1"}));
    person.await("$ ");
    EXPECT_EQ(
        server.call({"--tool-type", "9", "--tool-id", "\x1B]0;them\x07", "broadcast", "hi\r\n\x1B[2J\\"}).exitStatus,
        0);
    person.await("\r\nqel: broadcast from tool type 9, \"\\x1b]0;them\\x07\": hi\\x0d\\x0a\\x1b[2J\\\\\r\n");
    person.type("echo $((6 * 7))\r");
    person.await("42\r\n");
    person.type("~.");
    EXPECT_EQ(person.wait().exitStatus, 0);
}

// Other consoles.

TEST_F(ConsoleTest, AHeldPartitionIsRefused)
{
    PtyProcess holder(console({"1"}));
    holder.await("connected");
    const auto refused = runConsole({"1"}, "");
    EXPECT_EQ(refused.exitStatus, 1);
    EXPECT_EQ(refused.output, "");
    EXPECT_EQ(refused.errors,
              "qel: partition 1 is held by another console; --force takes it, --watch looks on: 0x00000013 "
              "(QelMessageStatusConnectionNotAvailable)\n");
}

TEST_F(ConsoleTest, AHeldPartitionCanBeTakenByForce)
{
    PtyProcess holder(console({"1"}));
    holder.await("$ ");
    const auto taken = runConsole({"1", "--force"}, "echo $((6 * 7))\n");
    EXPECT_EQ(taken.exitStatus, 0);
    EXPECT_THAT(taken.output, HasSubstr("42\r\n"));
    const auto result = holder.wait();
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.screen, EndsWith("$ \r\nqel: session closed: taken or closed by another console\r\n"));
    EXPECT_TRUE(holder.isTerminalUntouched());
}

TEST_F(ConsoleTest, AnUnknownPartitionOrConnectionIsRefused)
{
    const auto partition = runConsole({"9"}, "");
    EXPECT_EQ(partition.exitStatus, 1);
    EXPECT_EQ(partition.errors,
              "qel: the server does not have partition 9: 0x00000015 (QelMessageStatusInvalidLparId)\n");
    EXPECT_EQ(runConsole({"09"}, "").errors, partition.errors); // no octal number, which would be none
    const auto connection = runConsole({"1", "--connection", "16"}, "");
    EXPECT_EQ(connection.exitStatus, 1);
    EXPECT_EQ(connection.errors,
              "qel: partition 1 does not have this serial connection; --connection 0 types, 1 to 15 watch: 0x00000010 "
              "(QelMessageStatusInvalidConnectionNumber)\n");
}

TEST_F(ConsoleTest, AToolIdInUseIsRefused)
{
    PtyProcess holder(console({"1", "--tool-id", "me"}));
    holder.await("connected");
    const auto refused = runConsole({"2", "--tool-id", "me"}, "");
    EXPECT_EQ(refused.exitStatus, 1);
    EXPECT_EQ(refused.errors,
              "qel: a console with this tool type and id is connected already; choose another --tool-id: 0x00000025 "
              "(QelMessageStatusDaxAlreadyConnected)\n");
}

// The server shuts down or is killed.

TEST_F(ConsoleTest, AServerShutdownEndsTheConsole)
{
    PtyProcess person(console({"1"}));
    person.await("$ ");
    server.stop();
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.screen, EndsWith("$ \r\nqel: session closed: the server shut down\r\n"));
    EXPECT_TRUE(person.isTerminalUntouched());
}

TEST_F(ConsoleTest, AKilledServerEndsTheConsole)
{
    PtyProcess person(console({"1"}));
    person.await("$ ");
    server.process().signal(SIGKILL);
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.screen, HasSubstr("qel: connection lost: "));
    EXPECT_TRUE(person.isTerminalUntouched());
}

// A hypervisor that misbehaves.

/// Accepts one connection and plays its hypervisor on a thread.
class BadHypervisor {
public:
    /// @param afterSetUp  called once the session is open; the connection ends when it returns
    explicit BadHypervisor(std::function<void(LoopbackMessages&)> afterSetUp)
        : mListener(listenOn(IPEndpoint("127.0.0.1:0"), 1)), mEndpoint(mListener.getSocketName().str()),
          mThread([this, afterSetUp = std::move(afterSetUp)] {
              SocketStream stream(mListener.accept());
              stream.setReadDeadline(Process::kDeadline);
              LoopbackMessages messages(stream);
              for (int requests = 0; requests < 4; ++requests) {
                  const auto request = messages.receive();
                  messages.send(QelMessageGeneric(request->getCallerId(), request->getFunction(),
                                                  request->getOperation(), MsgResponse));
              }
              afterSetUp(messages);
          })
    {}
    ~BadHypervisor() { mThread.join(); }
    BadHypervisor(const BadHypervisor&) = delete;
    BadHypervisor& operator=(const BadHypervisor&) = delete;

    const std::string& endpoint() const { return mEndpoint; }

private:
    Socket mListener;
    std::string mEndpoint;
    std::thread mThread;
};

/// Waits until the console has gone.
void awaitEnd(LoopbackMessages& messages)
{
    try {
        while (!messages.isClosed())
            continue;
    } catch (const StreamIOException&) {
        return; // reset
    }
}

TEST(Console, GarbageBreaksTheProtocol)
{
    BadHypervisor hypervisor([](LoopbackMessages& messages) {
        messages.sendBytes(std::string(100, 'x'));
        awaitEnd(messages);
    });
    PtyProcess person(consoleTo(hypervisor.endpoint(), {"1"}));
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 5);
    EXPECT_THAT(result.screen, EndsWith("qel: the peer broke the protocol: Invalid length\r\n"));
    EXPECT_TRUE(person.isTerminalUntouched());
}

TEST(Console, AnIncompleteFrameTimesOut)
{
    BadHypervisor hypervisor([](LoopbackMessages& messages) {
        messages.sendBytes(std::string("\xDE\xCA\xFF\x20\0\0\0\x28half", 12));
        awaitEnd(messages);
    });
    const auto result = run(consoleTo(hypervisor.endpoint(), {"1", "--no-eof", "--timeout", "0.5"}));
    EXPECT_EQ(result.exitStatus, 6);
    EXPECT_THAT(result.errors, StartsWith("qel: timed out after 0.5 s (--timeout): "));
}

TEST(Console, LeavesWhenTheServerDoesNotCloseInTime)
{
    BadHypervisor hypervisor([](LoopbackMessages& messages) { awaitEnd(messages); });
    PtyProcess person(consoleTo(hypervisor.endpoint(), {"1", "--timeout", "0.5"}));
    person.await("connected");
    person.type("~.");
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_TRUE(person.isTerminalUntouched());
}

TEST(Console, ASilentServerTimesOut)
{
    const Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
    const auto result = run(consoleTo(listener.getSocketName().str(), {"1", "--timeout", "0.2"}));
    EXPECT_EQ(result.exitStatus, 6);
}

TEST(Console, OutputBeforeTheConnectionBreaksIsWritten)
{
    BadHypervisor hypervisor([](LoopbackMessages& messages) {
        messages.send(QelMessageVirtualSerialDataToDaxAsync(1, 0, 10, "last words"));
    });
    Process process(consoleTo(hypervisor.endpoint(), {"1"}));
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_EQ(result.output, "last words");
    EXPECT_EQ(result.errors, "qel: connection lost: EOF\n");
}

TEST(Console, ARefusedConnectionIsReported)
{
    const Socket unused(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
    Socket bound(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
    bound.bind(IPEndpoint("127.0.0.1:0")); // and does not listen
    const auto result = run(consoleTo(bound.getSocketName().str(), {"1"}));
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_THAT(result.errors, HasSubstr("qel: cannot connect to 127.0.0.1:"));
}

// The command line.

TEST(Console, HelpShowsHowToLeave)
{
    const auto help = runQel({"console", "--help"});
    EXPECT_EQ(help.exitStatus, 0);
    EXPECT_THAT(help.output, HasSubstr("Usage: qel console [OPTIONS] partition\n"));
    EXPECT_THAT(help.output, HasSubstr("\"~.\" at the start of a line leaves"));
    EXPECT_THAT(runQel({"--help"}).output, HasSubstr("\n  console "));
}

} // namespace

} // namespace qel::test
