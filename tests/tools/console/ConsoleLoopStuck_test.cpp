// The user can leave, and is told, whatever does not move.

#include "tools/console/ConsoleLoopFixture.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using tool::ConsoleLoop;
using tool::HeldInput;
using tool::InputOptions;
using tool::TerminalMode;
using ExitReason = ConsoleLoop::ExitReason;

constexpr const char* kLeaveHint = "; ~. at the start of a line leaves and throws them away\r\n";

class ConsoleLoopStuckTest : public ConsoleLoopTest {
protected:
    ConsoleLoopStuckTest() { raw.enterRaw(); }

    const Pty pty;
    TerminalMode raw{pty.slave()};
};

TEST_F(ConsoleLoopStuckTest, TheKeyboardIsReadWhileTheConnectionTakesNothing)
{
    open([](const std::string&) { ADD_FAILURE() << "sent"; });
    end->stopTaking();
    std::thread person([&] {
        screenUntil(pty, "commands\r\n");
        pty.type(std::string(256 * 1024, 'x') + "\r"); // waits for the reader of the terminal
        pty.type("~.");
    });
    const ConsoleLoop::Outcome outcome = run(InputOptions(), &pty);
    person.join();
    EXPECT_EQ(outcome.reason, ExitReason::Left);
    EXPECT_EQ(outcome.thrownAway, 256U * 1024 + 1);
}

TEST_F(ConsoleLoopStuckTest, InputBeyondTheLimitIsDroppedWithABell)
{
    open([](const std::string&) { ADD_FAILURE() << "sent"; });
    end->stopTaking();
    std::thread person([&] {
        screenUntil(pty, "commands\r\n");
        pty.type(std::string(HeldInput::kLimit, 'x') + "\r");
        const std::string screen = screenUntil(pty, "\r\n");
        EXPECT_THAT(screen, EndsWith("\aqel: the limit of 1 MiB is reached: further input is dropped until there is "
                                     "room; ~. at the start of a line leaves and throws them away\r\n"));
        pty.type("more\r~.");
    });
    const ConsoleLoop::Outcome outcome = run(InputOptions(), &pty);
    person.join();
    EXPECT_EQ(outcome.reason, ExitReason::Left);
    EXPECT_EQ(outcome.thrownAway, HeldInput::kLimit + 6);
}

TEST_F(ConsoleLoopStuckTest, HeldInputIsMarkedOnceItWaitsAndSentInTheEnd)
{
    SettableClock clock;
    open([&](const std::string& all) {
        if (all == "ls\r") closeSession();
    });
    end->stopTaking();
    std::thread person([&] {
        screenUntil(pty, "commands\r\n");
        const unsigned int before = clock.steadyReads();
        pty.type("ls\r");
        while (clock.steadyReads() < before + 2)
            std::this_thread::yield(); // it has been read
        clock.advance(HeldInput::kPatience);
        end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi")); // makes the loop look at the clock
        EXPECT_THAT(
            screenUntil(pty, "away\r\n"),
            EndsWith(std::string("qel: 3 bytes of input are held back: the partition or the server takes none") +
                     kLeaveHint));
        end->takeAgain();
        EXPECT_THAT(screenUntil(pty, "sent\r\n"), EndsWith("qel: all input that was held back has been sent\r\n"));
    });
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
    person.join();
    EXPECT_EQ(sent, "ls\r");
}

TEST_F(ConsoleLoopStuckTest, TheUserCanLeaveWhileTheLastOutputIsStuck)
{
    fillOutput();
    open([](const std::string&) {});
    output("stuck");
    closeSession();
    tool::SignalWatch signals{SIGUSR1};
    tool::ConsoleScreen screen(outputWrite.get(), errors, true, raw);
    ConsoleLoop loop(screen, pty.slave(), raw, signals, InputOptions());
    std::thread person([&] {
        while (unreadBytes() != 0)
            std::this_thread::yield();
        pty.type("~.");
    });
    EXPECT_EQ(loop.run(console, *session).reason, ExitReason::Left);
    person.join();
}

TEST_F(ConsoleLoopStuckTest, InputThatHasBeenReadMeanwhileIsNotWaitedFor)
{
    open([](const std::string&) { ADD_FAILURE() << "sent"; });
    pty.type("x");
    output("a");
    closeSession();
    end->beforeRead = [&] {
        char key = 0;
        if (!PollSet(PollFd(pty.slave(), PollEvents::Read)).poll().anyReady()) return;
        ASSERT_EQ(::read(pty.slave(), &key, 1), 1);
    };
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
}

TEST_F(ConsoleLoopStuckTest, ASilentServerIsReportedAndSoIsItsReturn)
{
    SettableClock clock;
    InputOptions options;
    options.keepAlive = std::chrono::milliseconds(1500);
    open([](const std::string&) {});
    end->onMessage = [&](const QelMessage& message) {
        EXPECT_NE(dynamic_cast<const QelMessageGetQelTodReq*>(&message), nullptr);
        ++dataMessages;
        clock.advance(std::chrono::milliseconds(750)); // and does not answer
    };
    std::thread person([&] {
        screenUntil(pty, "commands\r\n");
        clock.advance(std::chrono::milliseconds(750));
        pty.type("~?"); // makes the loop look at the clock
        EXPECT_THAT(screenUntil(pty, "of a line\r\n"),
                    EndsWith("qel: the server has sent nothing for 1.5 s: it is gone or stopped; wait, or leave with "
                             "~. at the start of a line\r\n"));
        end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
        screenUntil(pty, "qel: the server answers again\r\n");
        pty.type("~.");
    });
    EXPECT_EQ(run(options, &pty).reason, ExitReason::Left);
    person.join();
    EXPECT_EQ(dataMessages, 1U) << "it asks once";
}

} // namespace

} // namespace qel::test
