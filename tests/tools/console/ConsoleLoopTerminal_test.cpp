#include "tools/console/ConsoleLoopFixture.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using tool::ConsoleLoop;
using tool::InputOptions;
using tool::TerminalMode;
using ExitReason = ConsoleLoop::ExitReason;

// Signals, raised while the loop watches for them.

TEST_F(ConsoleLoopTest, ASignalEndsTheLoop)
{
    open([](const std::string&) { ::raise(SIGUSR1); });
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    const ConsoleLoop::Outcome outcome = run();
    EXPECT_EQ(outcome.reason, ExitReason::Signal);
    EXPECT_EQ(outcome.signal, SIGUSR1);
}

TEST_F(ConsoleLoopTest, AnIgnoredSignalStaysIgnored)
{
    const auto before = std::signal(SIGUSR2, SIG_IGN);
    open([&](const std::string&) {
        ::raise(SIGUSR2);
        closeSession();
    });
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    const ConsoleLoop::Outcome outcome = run();
    static_cast<void>(std::signal(SIGUSR2, before));
    EXPECT_EQ(outcome.reason, ExitReason::Ended);
    EXPECT_EQ(outcome.signal, 0);
}

TEST_F(ConsoleLoopTest, ASignalDoesNotWaitForTheOutput)
{
    fillOutput();
    open([&](const std::string&) { closeSession(); });
    output("stuck");
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    const pthread_t self = ::pthread_self();
    std::thread other([&] {
        // The session has ended and only the output is left to wait for once nothing is left to be read.
        while (unreadBytes() != 0)
            std::this_thread::yield();
        ::pthread_kill(self, SIGUSR1);
    });
    const ConsoleLoop::Outcome outcome = run();
    other.join();
    EXPECT_EQ(outcome.reason, ExitReason::Signal);
    EXPECT_EQ(outcome.signal, SIGUSR1);
}

// A terminal.

TEST_F(ConsoleLoopTest, TheTerminalIsInRawModeDuringTheSession)
{
    const Pty pty;
    const termios before = pty.attributes();
    open([](const std::string&) {});
    output("$ ");
    std::thread person([&] {
        screenUntil(pty, "$ ");
        EXPECT_TRUE(isRaw(pty.attributes()));
        pty.type("~.");
    });
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Left);
    person.join();
    EXPECT_TRUE(pty.attributes() == before);
}

TEST_F(ConsoleLoopTest, TypedInputIsSentAndTheLeaveCommandLeaves)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw(); // so that what is typed before the loop begins is there to be read
    open([](const std::string&) {});
    pty.type("ls\r~~\r~.typed too late");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Left);
    EXPECT_EQ(sent, "ls\r~\r");
    EXPECT_EQ(screenUntil(pty, "\n"), "qel: connected to partition 1 of fake:1 (plain); ~. at the start of a line "
                                      "leaves, ~? lists the commands\r\n");
    EXPECT_EQ(errors.str(), "");
}

TEST_F(ConsoleLoopTest, WhoWatchesIsToldSoAndThePartitionHasAName)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    protocol::SerialOptions watching;
    watching.connection = 3;
    session.emplace(console.openSerial(kPartition, watching));
    pty.type("~.");
    InputOptions options;
    options.partitionName = "lab/web1";
    EXPECT_EQ(run(options, &pty).reason, ExitReason::Left);
    EXPECT_EQ(screenUntil(pty, "\n"),
              "qel: watching partition 1 (lab/web1) of fake:1 (plain); ~. at the start of a line "
              "leaves, ~? lists the commands\r\n");
}

TEST_F(ConsoleLoopTest, TheLeaveCommandWorksWhileTheConnectionTakesNothing)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([](const std::string&) { ADD_FAILURE() << "sent"; });
    end->stopTaking();
    pty.type("ls\r~.");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Left);
}

TEST_F(ConsoleLoopTest, TheHelpCommandListsTheCommands)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([](const std::string&) {});
    pty.type("~?~.");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Left);
    EXPECT_THAT(screenUntil(pty, "leave\r\n"), EndsWith("\r\nqel: at the start of a line:\r\n  ~.   leave\r\n"));
    EXPECT_EQ(sent, "");
}

TEST_F(ConsoleLoopTest, WithoutAnEscapeCharacterAllInputIsSent)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([&](const std::string& all) {
        if (all == "~.") closeSession();
    });
    pty.type("~.");
    InputOptions options;
    options.escape.reset();
    EXPECT_EQ(run(options, &pty).reason, ExitReason::Ended);
    EXPECT_EQ(screenUntil(pty, "\n"),
              "qel: connected to partition 1 of fake:1 (plain); there is no escape character\r\n");
}

TEST_F(ConsoleLoopTest, ATypedControlDDoesNotEndTheInput)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([&](const std::string& all) {
        EXPECT_EQ(all, "\x04");
        closeSession();
    });
    pty.type("\x04");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
}

TEST_F(ConsoleLoopTest, MessagesStartOnALineOfTheirOwnOnASharedTerminal)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([](const std::string&) {});
    output("$ ");
    end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
    closeSession();
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
    EXPECT_THAT(screenUntil(pty, "hi\r\n"),
                EndsWith("commands\r\n$ \r\nqel: broadcast from tool type 1, \"them\": hi\r\n"));
}

TEST_F(ConsoleLoopTest, AnExceptionRestoresTheTerminal)
{
    const Pty pty;
    const termios before = pty.attributes();
    open([](const std::string&) {});
    end->end();
    EXPECT_THROW(run(InputOptions(), &pty), tool::ClosedByPeer);
    EXPECT_TRUE(pty.attributes() == before);
}

TEST_F(ConsoleLoopTest, AHungUpTerminalCountsAsLeaving)
{
    Pty pty;
    open([&](const std::string&) { pty.hangUp(); });
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    pty.type("x");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Left);
}

TEST_F(ConsoleLoopTest, ContinuingEntersRawModeAgain)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([&](const std::string& all) {
        if (all == "x") {
            raw.restore(); // as a shell does while the process is stopped
            ::raise(SIGCONT);
            output("going on");
        } else {
            EXPECT_TRUE(isRaw(pty.attributes()));
            closeSession();
        }
    });
    pty.type("x");
    std::thread person([&] {
        screenUntil(pty, "going on");
        pty.type("y\r"); // a whole line, so that it comes in any mode
    });
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
    person.join();
    EXPECT_EQ(sent, "xy\r");
}

} // namespace

} // namespace qel::test
