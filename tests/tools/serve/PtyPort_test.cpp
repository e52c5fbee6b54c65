#include <qel/common/util/PosixError.hpp>

#include "serve/PtyPort.hpp"
#include "tools/base/PtyFixture.hpp"

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <gmock/gmock.h>

namespace {

bool sNoTerminals = false; ///< posix_openpt() fails for want of descriptors

} // namespace

/// Takes the place of the system's, so that it can be made to fail.
extern "C" int posix_openpt(int flags)
{
    if (!sNoTerminals) return ::open("/dev/ptmx", flags);
    errno = EMFILE;
    return -1;
}

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::ThrowsMessage;
using tool::PtyPort;

using PtyPortTest = PtyFixture;

TEST_F(PtyPortTest, BeforeTheStartItIsDown)
{
    PtyPort port("echo hello", reaper);
    EXPECT_FALSE(port.isRunning());
    EXPECT_EQ(port.descriptor(), -1);
    port.stop();
    EXPECT_FALSE(port.isRunning());
}

TEST_F(PtyPortTest, TheCommandsOutputIsRead)
{
    EXPECT_EQ(outputOf("echo hello; echo error >&2", reaper), "hello\r\nerror\r\n");
}

TEST_F(PtyPortTest, TheCommandIsOneForTheShell)
{
    EXPECT_EQ(outputOf("for i in 1 2; do echo \"$i\"; done | cat", reaper), "1\r\n2\r\n");
}

TEST_F(PtyPortTest, TheCommandHasATerminalOfItsOwn)
{
    EXPECT_THAT(outputOf("tty", reaper), MatchesRegex("/dev/pts/[0-9]+\r\n"));
    EXPECT_EQ(outputOf("stty size", reaper), "24 80\r\n");
    EXPECT_EQ(outputOf("echo controlled > /dev/tty", reaper), "controlled\r\n");
}

TEST_F(PtyPortTest, TheCommandLeadsASessionOfItsOwn)
{
    // The sixth word is the session: see proc(5).
    EXPECT_EQ(outputOf("test \"$(cut -d ' ' -f 6 /proc/$$/stat)\" = $$ && echo leader", reaper), "leader\r\n");
}

TEST_F(PtyPortTest, TheCommandFindsSignalsAsUsual)
{
    sigset_t blocked;
    sigset_t before;
    ::sigemptyset(&blocked);
    ::sigaddset(&blocked, SIGTERM);
    ::pthread_sigmask(SIG_BLOCK, &blocked, &before);
    const auto pipeBefore = std::signal(SIGPIPE, SIG_IGN);
    EXPECT_THAT(outputOf("sh -c 'kill -TERM $$; echo survived'; echo status=$?", reaper), HasSubstr("status=143\r\n"));
    EXPECT_THAT(outputOf("sh -c 'kill -PIPE $$; echo survived'; echo status=$?", reaper), HasSubstr("status=141\r\n"));
    static_cast<void>(std::signal(SIGPIPE, pipeBefore));
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

TEST_F(PtyPortTest, TheCommandSeesNoOtherPartitionsLine)
{
    PtyPort other("cat", reaper);
    other.start();
    EXPECT_THAT(outputOf("ls -l /proc/self/fd", reaper), Not(HasSubstr("ptmx")));
}

TEST_F(PtyPortTest, InputReachesTheCommand)
{
    PtyPort port("read line; echo \"got $line\"", reaper);
    port.start();
    EXPECT_EQ(port.write("abc\n", 4), 4U);
    EXPECT_THAT(readUntilEnd(port), HasSubstr("got abc\r\n"));
}

TEST_F(PtyPortTest, WithNothingToReadTheLineIsIdle)
{
    PtyPort port("cat", reaper);
    port.start();
    char byte = 0;
    EXPECT_EQ(port.read(&byte, 1).state, LineState::Idle);
    EXPECT_FALSE(port.hasHungUp());
}

TEST_F(PtyPortTest, ALineThatTakesNoMoreInputSaysSo)
{
    PtyPort port("stty raw -echo; echo ready; exec sleep 1000", reaper);
    port.start();
    readUntil(port, "ready");
    const std::string chunk(4096, 'x');
    std::size_t taken = 0;
    while (const std::size_t count = port.write(chunk.data(), chunk.size())) {
        taken += count;
        ASSERT_LT(taken, 100U * 1000 * 1000);
    }
    EXPECT_GT(taken, 0U);
}

TEST_F(PtyPortTest, AfterTheEndOfTheCommandItsOutputIsStillThere)
{
    PtyPort port("echo last", reaper);
    port.start();
    const PollFd fd(port.descriptor(), PollEvents::Error); // the end alone
    ASSERT_TRUE(PollSet(fd).wait(std::chrono::seconds(20)).anyReady());
    EXPECT_TRUE(port.hasHungUp());
    EXPECT_TRUE(port.isRunning());
    EXPECT_EQ(readUntilEnd(port), "last\r\n");
    char byte = 0;
    EXPECT_EQ(port.read(&byte, 1).state, LineState::Ended);
}

TEST_F(PtyPortTest, StartingARunningCommandChangesNothing)
{
    PtyPort port("echo pid=$$; cat", reaper);
    port.start();
    const std::string first = readUntil(port, "\n");
    port.start();
    EXPECT_EQ(port.write("x\n", 2), 2U);
    EXPECT_THAT(readUntil(port, "x\r\nx\r\n"), Not(HasSubstr("pid=")));
}

TEST_F(PtyPortTest, ACommandThatHasEndedIsStartedAfresh)
{
    PtyPort port("echo pid=$$; read line", reaper);
    port.start();
    const pid_t first = pidIn(readUntil(port, "\n"));
    EXPECT_EQ(port.write("\n", 1), 1U);
    readUntilEnd(port);
    while (port.hasHungUp())
        port.start(); // the line ends a moment before the command does
    EXPECT_NE(pidIn(readUntil(port, "\n")), first);
}

TEST_F(PtyPortTest, ItDoesNotMatterWhoReapsTheCommand)
{
    const auto before = std::signal(SIGCHLD, SIG_IGN); // the system does
    PtyPort port("echo pid=$$; read line", reaper);
    port.start();
    const pid_t first = pidIn(readUntil(port, "\n"));
    EXPECT_EQ(port.write("\n", 1), 1U);
    readUntilEnd(port);
    while (port.hasHungUp())
        port.start();
    EXPECT_NE(pidIn(readUntil(port, "\n")), first);
    port.stop();
    reaper.finish();
    static_cast<void>(std::signal(SIGCHLD, before));
}

TEST_F(PtyPortTest, AStoppedLineCanBeStartedAgain)
{
    PtyPort port("echo hello; cat", reaper);
    port.start();
    readUntil(port, "hello");
    port.stop();
    EXPECT_FALSE(port.isRunning());
    EXPECT_EQ(port.descriptor(), -1);
    port.start();
    readUntil(port, "hello");
}

TEST_F(PtyPortTest, WithoutDescriptorsItCannotStart)
{
    PtyPort port("echo hello", reaper);
    sNoTerminals = true;
    EXPECT_THAT([&] { port.start(); },
                ThrowsMessage<PosixError>("cannot open a pseudo-terminal: 24 (Too many open files)"));
    sNoTerminals = false;
    EXPECT_FALSE(port.isRunning());
    port.start();
    EXPECT_EQ(readUntilEnd(port), "hello\r\n");
}

} // namespace

} // namespace qel::test
