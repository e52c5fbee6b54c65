#include <qel/common/util/PosixError.hpp>

#include "hypervisor/PtyPort.hpp"
#include "protocol/hypervisor/PtyFixture.hpp"
#include "support/ComesTrue.hpp"

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <optional>

namespace {

bool sNoTerminals = false; ///< posix_openpt() fails for want of descriptors

} // namespace

/// Replaces the function of the system, so that it can be made to fail.
extern "C" int posix_openpt(int flags)
{
    if (!sNoTerminals) return ::open("/dev/ptmx", flags);
    errno = EMFILE;
    return -1;
}

namespace qel::test {

namespace {

using protocol::CommandEnd;
using protocol::PtyPort;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::ThrowsMessage;

using PtyPortTest = PtyFixture;

TEST_F(PtyPortTest, IsDownBeforeStart)
{
    PtyPort port("echo hello", reaper);
    EXPECT_EQ(port.descriptor(), -1);
    port.stop();
    EXPECT_EQ(port.descriptor(), -1);
}

TEST_F(PtyPortTest, TheCommandsOutputIsRead)
{
    EXPECT_EQ(outputOf("echo hello; echo error >&2"), "hello\r\nerror\r\n");
}

TEST_F(PtyPortTest, TheShellRunsTheCommand)
{
    EXPECT_EQ(outputOf("for i in 1 2; do echo \"$i\"; done | cat"), "1\r\n2\r\n");
}

TEST_F(PtyPortTest, TheCommandHasATerminalOfItsOwn)
{
    EXPECT_THAT(outputOf("tty"), MatchesRegex("/dev/pts/[0-9]+\r\n"));
    EXPECT_EQ(outputOf("stty size"), "24 80\r\n");
    EXPECT_EQ(outputOf("echo controlled > /dev/tty"), "controlled\r\n");
}

TEST_F(PtyPortTest, TheCommandLeadsASessionOfItsOwn)
{
    // The sixth word is the session: see proc(5).
    EXPECT_EQ(outputOf("test \"$(cut -d ' ' -f 6 /proc/$$/stat)\" = $$ && echo leader"), "leader\r\n");
}

TEST_F(PtyPortTest, TheCommandHasDefaultSignals)
{
    sigset_t blocked;
    sigset_t before;
    ::sigemptyset(&blocked);
    ::sigaddset(&blocked, SIGTERM);
    ::pthread_sigmask(SIG_BLOCK, &blocked, &before);
    const auto pipeBefore = std::signal(SIGPIPE, SIG_IGN);
    EXPECT_THAT(outputOf("sh -c 'kill -TERM $$; echo survived'; echo status=$?"), HasSubstr("status=143\r\n"));
    EXPECT_THAT(outputOf("sh -c 'kill -PIPE $$; echo survived'; echo status=$?"), HasSubstr("status=141\r\n"));
    static_cast<void>(std::signal(SIGPIPE, pipeBefore));
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

TEST_F(PtyPortTest, TheCommandInheritsNoOtherTerminal)
{
    PtyPort other("cat", reaper);
    other.start(kPartition);
    EXPECT_THAT(outputOf("ls -l /proc/self/fd"), Not(HasSubstr("ptmx")));
}

TEST_F(PtyPortTest, InputReachesTheCommand)
{
    PtyPort port("read line; echo \"got $line\"", reaper);
    port.start(kPartition);
    EXPECT_EQ(port.write("abc\n", 4), 4U);
    EXPECT_THAT(readUntilEnd(port), HasSubstr("got abc\r\n"));
}

TEST_F(PtyPortTest, WithNothingToReadTheLineIsIdle)
{
    PtyPort port("cat", reaper);
    port.start(kPartition);
    char byte = 0;
    EXPECT_EQ(port.read(&byte, 1).state, LineState::Idle);
    EXPECT_FALSE(port.hasHungUp());
}

TEST_F(PtyPortTest, WriteReturnsZeroWhenTheTerminalIsFull)
{
    PtyPort port("stty raw -echo; echo ready; exec sleep 1000", reaper);
    port.start(kPartition);
    readUntil(port, "ready");
    const std::string chunk(4096, 'x');
    std::size_t taken = 0;
    while (const std::size_t count = port.write(chunk.data(), chunk.size())) {
        taken += count;
        ASSERT_LT(taken, 100U * 1000 * 1000);
    }
    EXPECT_GT(taken, 0U);
}

TEST_F(PtyPortTest, OutputCanBeReadAfterTheCommandEnds)
{
    PtyPort port("echo last", reaper);
    port.start(kPartition);
    const PollFd fd(port.descriptor(), PollEvents::Error); // hang-up only
    ASSERT_TRUE(PollSet(fd).wait(std::chrono::seconds(20)).anyReady());
    EXPECT_TRUE(port.hasHungUp());
    EXPECT_GE(port.descriptor(), 0);
    EXPECT_EQ(readUntilEnd(port), "last\r\n");
    char byte = 0;
    EXPECT_EQ(port.read(&byte, 1).state, LineState::Ended);
}

TEST_F(PtyPortTest, StartingARunningCommandChangesNothing)
{
    PtyPort port("echo pid=$$; cat", reaper);
    port.start(kPartition);
    const std::string first = readUntil(port, "\n");
    port.start(kPartition);
    EXPECT_EQ(port.write("x\n", 2), 2U);
    EXPECT_THAT(readUntil(port, "x\r\nx\r\n"), Not(HasSubstr("pid=")));
}

TEST_F(PtyPortTest, AnEndedCommandIsStartedAgain)
{
    PtyPort port("echo pid=$$; read line", reaper);
    port.start(kPartition);
    const pid_t first = pidIn(readUntil(port, "\n"));
    EXPECT_EQ(port.write("\n", 1), 1U);
    readUntilEnd(port);
    while (port.hasHungUp())
        port.start(kPartition); // the line ends a moment before the command does
    EXPECT_NE(pidIn(readUntil(port, "\n")), first);
}

TEST_F(PtyPortTest, ACommandReapedByTheSystemIsStartedAgain)
{
    const auto before = std::signal(SIGCHLD, SIG_IGN); // the system reaps children
    PtyPort port("echo pid=$$; read line", reaper);
    port.start(kPartition);
    const pid_t first = pidIn(readUntil(port, "\n"));
    EXPECT_EQ(port.write("\n", 1), 1U);
    readUntilEnd(port);
    while (port.hasHungUp())
        port.start(kPartition);
    EXPECT_NE(pidIn(readUntil(port, "\n")), first);
    port.stop();
    reaper->finish();
    static_cast<void>(std::signal(SIGCHLD, before));
}

TEST_F(PtyPortTest, AStoppedLineCanBeStartedAgain)
{
    PtyPort port("echo hello; cat", reaper);
    port.start(kPartition);
    readUntil(port, "hello");
    port.stop();
    EXPECT_EQ(port.descriptor(), -1);
    port.start(kPartition);
    readUntil(port, "hello");
}

TEST_F(PtyPortTest, ReportsHowTheCommandEnded)
{
    struct Row {
        const char* command;
        CommandEnd::Kind kind;
        unsigned int number;
    };
    const Row rows[] = {
        {"exit 0", CommandEnd::Kind::Exited, 0},
        {"exit 3", CommandEnd::Kind::Exited, 3},
        {"exit 255", CommandEnd::Kind::Exited, 255},
        {"kill -KILL $$", CommandEnd::Kind::Killed, SIGKILL},
        {"kill -TERM $$", CommandEnd::Kind::Killed, SIGTERM},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.command);
        PtyPort port(row.command, reaper);
        port.start(kPartition);
        EXPECT_EQ(readUntilEnd(port), "");
        std::optional<CommandEnd> end;
        ASSERT_TRUE(comesTrue([&] { return (end = port.commandEnd()).has_value(); }));
        EXPECT_EQ(end->kind, row.kind);
        EXPECT_EQ(end->number, row.number);
        EXPECT_TRUE(port.commandEnd().has_value()); // asking does not reap it
    }
}

TEST_F(PtyPortTest, ARunningCommandHasNotEnded)
{
    PtyPort port("echo ready; cat", reaper);
    port.start(kPartition);
    readUntil(port, "ready");
    EXPECT_FALSE(port.commandEnd().has_value());
}

TEST_F(PtyPortTest, TheEndOfACommandReapedByTheSystemIsUnknown)
{
    const auto before = std::signal(SIGCHLD, SIG_IGN);
    PtyPort port("exit 3", reaper);
    port.start(kPartition);
    readUntilEnd(port);
    std::optional<CommandEnd> end;
    EXPECT_TRUE(comesTrue([&] { return (end = port.commandEnd()).has_value(); }));
    EXPECT_EQ(end->kind, CommandEnd::Kind::Unknown);
    static_cast<void>(std::signal(SIGCHLD, before));
}

TEST_F(PtyPortTest, TheCommandHasTheGivenEnvironmentAndItsPartition)
{
    ::setenv("QEL_TEST_SECRET", "of the server", 1);
    PtyPort port("tr '\\0' '\\n' </proc/$$/environ", reaper, {"A=1", "B=two words", "C="});
    port.start(kPartition);
    EXPECT_EQ(readUntilEnd(port), "A=1\r\nB=two words\r\nC=\r\nQEL_PARTITION=7\r\n");
    ::unsetenv("QEL_TEST_SECRET");
}

TEST_F(PtyPortTest, StartWithoutDescriptorsThrows)
{
    PtyPort port("echo hello", reaper);
    sNoTerminals = true;
    EXPECT_THAT([&] { port.start(kPartition); },
                ThrowsMessage<PosixError>("cannot open a pseudo-terminal: 24 (Too many open files)"));
    sNoTerminals = false;
    EXPECT_EQ(port.descriptor(), -1);
    port.start(kPartition);
    EXPECT_EQ(readUntilEnd(port), "hello\r\n");
}

} // namespace

} // namespace qel::test
