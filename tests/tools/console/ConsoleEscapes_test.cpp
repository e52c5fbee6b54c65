// The commands of a person at a terminal, and what a script does instead of one.

#include "support/Errors.hpp"
#include "tools/console/ConsoleLoopFixture.hpp"

#include <fstream>
#include <gmock/gmock.h>
#include <sys/ioctl.h>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::ConsoleLoop;
using tool::InputOptions;
using tool::ScriptStep;
using tool::SessionScript;
using tool::TerminalMode;
using ExitReason = ConsoleLoop::ExitReason;

class ConsoleEscapesTest : public ConsoleLoopTest {
protected:
    ConsoleEscapesTest() { raw.enterRaw(); }

    /// Types before the loop begins; runs it. @return what was on the screen after the greeting, up to this text
    std::string runAndType(const std::string& text, const std::string& until)
    {
        pty.type(text);
        outcome = run(InputOptions(), &pty);
        screenUntil(pty, "commands\r\n");
        return screenUntil(pty, until);
    }

    const Pty pty;
    TerminalMode raw{pty.slave()};
    ConsoleLoop::Outcome outcome;
};

TEST_F(ConsoleEscapesTest, TheHelpListsEveryCommand)
{
    open([](const std::string&) {});
    EXPECT_EQ(runAndType("~?~.", "type ~\r\n"), "qel: at the start of a line:\r\n"
                                                "  ~.   leave\r\n"
                                                "  ~?   this list\r\n"
                                                "  ~i   tell about the session\r\n"
                                                "  ~l   turn the log off or on\r\n"
                                                "  ~t   time stamps: UTC, since the last line, off\r\n"
                                                "  ~r   read only: type nothing; or type again\r\n"
                                                "  ~f   open the session again by force, to type\r\n"
                                                "  ~b   how to send a break\r\n"
                                                "  ~w   type the command that sets the size of this window\r\n"
                                                "  ~#   type a file\r\n"
                                                "  ~^Z  suspend this program\r\n"
                                                "  ~~   type ~\r\n");
}

TEST_F(ConsoleEscapesTest, ThereIsNoCommandInTheMiddleOfALine)
{
    open([&](const std::string& all) {
        if (all.size() == 5) closeSession();
    });
    pty.type("abc~.");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
    EXPECT_EQ(sent, "abc~.");
}

TEST_F(ConsoleEscapesTest, TellsTheTraffic)
{
    SettableClock clock;
    const TemporaryDirectory directory;
    tool::LogFile logFile(directory.file("log"), tool::LogFile::Content::Raw);
    tools.logs.push_back(&logFile);
    open([](const std::string&) {});
    const std::string screen = runAndType("~i~l~l~.", "log off: " + logFile.path() + "\r\n");
    EXPECT_THAT(screen, HasSubstr("qel: connected to partition 1 of fake:1 (plain)"));
    EXPECT_THAT(screen, EndsWith("qel: 0 bytes received, 0 sent, 0 held\r\nqel: the partition has put out nothing so "
                                 "far\r\nqel: the server was heard 0 s ago\r\nqel: "
                                 "log on: " +
                                 logFile.path() + "\r\nqel: log off: " + logFile.path() + "\r\n"));
    EXPECT_EQ(screenUntil(pty, "\n"), "qel: log on: " + logFile.path() + "\r\n");
    EXPECT_TRUE(logFile.isOn());
}

TEST_F(ConsoleEscapesTest, TellsWhenTheLastOutputCame)
{
    SettableClock clock;
    open([](const std::string&) {});
    output("x\n");
    tool::SignalWatch signals{SIGUSR1};
    tool::TerminalMode mode(pty.slave());
    tool::ConsoleScreen screen(pty.slave(), errors, true, mode);
    tool::ConsoleLoop loop(screen, pty.slave(), mode, signals, InputOptions());
    std::thread person([&] {
        screenUntil(pty, "x\n");
        clock.advance(std::chrono::milliseconds(1500));
        pty.type("~i~.");
    });
    loop.run(console, *session);
    person.join();
    EXPECT_THAT(screenUntil(pty, "ago\r\n"), EndsWith("qel: the partition's last output came 1.5 s ago\r\n"));
}

TEST_F(ConsoleEscapesTest, WithoutALogThereIsNoneToTurnOn)
{
    open([](const std::string&) {});
    EXPECT_EQ(runAndType("~l~.", "FILE\r\n"), "qel: there is no log; start with --log FILE or --log-strip FILE\r\n");
}

TEST_F(ConsoleEscapesTest, TimeStampsAreTurnedOn)
{
    SettableClock clock;
    open([&](const std::string&) {
        output("one\r\ntwo\r\n");
        closeSession();
    });
    EXPECT_EQ(runAndType("~tx", "two\r\n"), "qel: time stamps in UTC\r\n[2024-01-02T03:04:05.000Z] one\r\n"
                                            "[2024-01-02T03:04:05.000Z] two\r\n");
}

TEST_F(ConsoleEscapesTest, ReadOnlySendsNothingUntilItIsTurnedOff)
{
    open([&](const std::string&) { closeSession(); });
    EXPECT_EQ(runAndType("~rsecret\r~wmore\r~rx", "again\r\n"),
              "qel: read only: nothing that is typed is sent\r\n\a\r\nqel: read only: nothing that is typed is sent\r\n"
              "\a\r\nqel: what is typed is sent again\r\n");
    EXPECT_EQ(sent, "x");
}

TEST_F(ConsoleEscapesTest, ABreakIsExplained)
{
    open([](const std::string&) {});
    EXPECT_EQ(runAndType("~b~.", "can\r\n"), "qel: the protocol carries no break; on the server's machine, qel status "
                                             "--break 1 sends one where the line can\r\n");
}

TEST_F(ConsoleEscapesTest, TheSizeOfTheWindowIsTyped)
{
    const winsize window{50, 132, 0, 0};
    ASSERT_EQ(::ioctl(pty.master(), TIOCSWINSZ, &window), 0);
    open([&](const std::string&) { closeSession(); });
    pty.type("~w");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
    EXPECT_EQ(sent, "stty rows 50 cols 132\r");
}

TEST_F(ConsoleEscapesTest, WhoWatchesTypesNeitherTheSizeOfTheWindowNorAFile)
{
    protocol::SerialOptions watching;
    watching.connection = 1;
    session.emplace(console.openSerial(kPartition, watching));
    const std::string text = "qel: who watches types nothing; ~f opens the session to type\r\n";
    EXPECT_EQ(runAndType("~w~#~.", "type\r\n"), text);
    EXPECT_EQ(screenUntil(pty, "type\r\n"), text);
}

TEST_F(ConsoleEscapesTest, AFileThatTheEndOfTheSessionCutsOffIsTold)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("text");
    std::ofstream(path) << std::string(100000, 'x');
    open([&](const std::string& all) {
        if (all.size() == 4096) closeSession();
    });
    pty.type("~#" + path + "\r");
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Ended);
    EXPECT_THAT(screenUntil(pty, "of the file\r\n"), HasSubstr("qel: stopped after "));
    EXPECT_EQ(sent.size() % 4096, 0U);
}

TEST_F(ConsoleEscapesTest, AWindowWithoutASizeIsNotTyped)
{
    open([](const std::string&) {});
    EXPECT_EQ(runAndType("~w~.", "known\r\n"), "qel: the size of this window is not known\r\n");
}

TEST_F(ConsoleEscapesTest, ForceIsAReasonToExit)
{
    open([](const std::string&) {});
    EXPECT_EQ(runAndType("~fmore", "force\r\n"), "qel: opening partition 1 again by force\r\n");
    EXPECT_EQ(outcome.reason, ExitReason::Force);
}

TEST_F(ConsoleEscapesTest, AFileIsTyped)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("text");
    const std::string text(100000, 'x');
    std::ofstream(path) << text << "~.\n";
    open([&](const std::string& all) {
        if (all.back() == '\n') closeSession();
    });
    EXPECT_EQ(runAndType("~#" + path + "\r", "stops it\r\n"), "qel: file to type (return alone cancels): " + path +
                                                                  "\r\nqel: typing " + path +
                                                                  " (100003 bytes); control-C stops it\r\n");
    EXPECT_EQ(sent, text + "~.\n");
}

TEST_F(ConsoleEscapesTest, NoFileIsTypedWhenThePromptIsCancelledOrTheFileIsNotThere)
{
    open([](const std::string&) { ADD_FAILURE() << "sent"; });
    const std::string screen = runAndType("~#\r~#/none/x\r~#ab\x03~.", "typed\r\n");
    EXPECT_THAT(screen, EndsWith("cancels): \r\nqel: no file is typed\r\n"));
    EXPECT_THAT(
        screenUntil(pty, "typed\r\n"),
        EndsWith("\r\nqel: cannot read /none/x: 2 (No such file or directory)\r\nqel: file to type (return alone "
                 "cancels): ab\r\nqel: no file is typed\r\n"));
}

TEST_F(ConsoleEscapesTest, AFileCanBeStopped)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("text");
    std::ofstream(path) << std::string(100000, 'x');
    open([](const std::string&) {});
    end->stopTaking();
    std::thread person([&] {
        screenUntil(pty, "commands\r\n");
        pty.type("~#" + path + "\r");
        screenUntil(pty, "stops it\r\n");
        pty.type("\x03");
        EXPECT_THAT(screenUntil(pty, "of the file\r\n"), EndsWith("qel: stopped after 0 bytes of the file\r\n"));
        pty.type("~.");
    });
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Left);
    person.join();
    EXPECT_EQ(sent, "");
}

TEST_F(ConsoleEscapesTest, OutputWaitsForTheAnswerToAPrompt)
{
    open([](const std::string&) {});
    std::thread person([&] {
        screenUntil(pty, "commands\r\n");
        pty.type("~#");
        screenUntil(pty, "cancels): ");
        output("later");
        pty.type("ab");
        EXPECT_EQ(pty.read(2), "ab");
        pty.type("\r");
        EXPECT_THAT(screenUntil(pty, "later"), HasSubstr("cannot read ab"));
        pty.type("~.");
    });
    EXPECT_EQ(run(InputOptions(), &pty).reason, ExitReason::Left);
    person.join();
}

TEST_F(ConsoleEscapesTest, TheLogGetsWhatTheSessionBrings)
{
    const TemporaryDirectory directory;
    tool::LogFile logFile(directory.file("log"), tool::LogFile::Content::Stripped);
    tools.logs.push_back(&logFile);
    open([](const std::string&) {});
    output("\x1B[1mbold\r\n");
    closeSession();
    EXPECT_EQ(run().reason, ExitReason::Ended);
    std::ifstream file(directory.file("log"));
    std::string line;
    std::getline(file, line);
    EXPECT_EQ(line, "bold");
    EXPECT_EQ(written(), "\x1B[1mbold\r\n") << "the screen gets it unchanged";
}

TEST_F(ConsoleEscapesTest, ALogThatFailsIsReportedAndTheSessionGoesOn)
{
    tool::LogFile logFile("/dev/full", tool::LogFile::Content::Raw);
    tools.logs.push_back(&logFile);
    open([](const std::string&) {});
    output("one");
    output("two");
    closeSession();
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(written(), "onetwo");
    EXPECT_EQ(errors.str(), "qel: cannot write the log /dev/full: 28 (No space left on device)\n");
}

// A script.

TEST_F(ConsoleEscapesTest, AScriptTypesWaitsAndEnds)
{
    SessionScript script(
        {{ScriptStep::Kind::Send, "a\r"}, {ScriptStep::Kind::Expect, "login:"}, {ScriptStep::Kind::Send, "b"}},
        std::chrono::seconds(20), "m");
    tools.script = &script;
    open([&](const std::string& all) {
        if (all == "a\r") output("login:");
    });
    typeAll("not read");
    EXPECT_EQ(run().reason, ExitReason::Lingered);
    EXPECT_EQ(sent, "a\rb");
    EXPECT_TRUE(script.isDone());
}

TEST_F(ConsoleEscapesTest, AScriptThatIsLateFails)
{
    SettableClock clock;
    SessionScript script({{ScriptStep::Kind::Send, "a"}, {ScriptStep::Kind::Expect, "login:"}},
                         std::chrono::milliseconds(2500), "m");
    tools.script = &script;
    open([&](const std::string&) { clock.advance(std::chrono::milliseconds(2500)); });
    EXPECT_THAT([&] { run(); }, ThrowsMessage<tool::CommandFailure>(StrEq(
                                    "timed out after 2.5 s (--timeout): waiting for output that matches \"login:\"")));
}

TEST_F(ConsoleEscapesTest, AScriptLingersIfAskedTo)
{
    SessionScript script({{ScriptStep::Kind::Send, "a"}}, std::chrono::seconds(20), "m");
    tools.script = &script;
    SettableClock clock;
    InputOptions options;
    options.linger = std::chrono::seconds(1);
    std::thread reader([&] {
        EXPECT_EQ(readOutput(6), "answer");
        clock.advance(std::chrono::seconds(1));
        end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi")); // makes the loop look at the clock
    });
    open([&](const std::string&) { output("answer"); });
    EXPECT_EQ(run(options).reason, ExitReason::Lingered);
    reader.join();
}

} // namespace

} // namespace qel::test
