// A console without a person: scripts, logs, recordings, lost connections.

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/net/Listen.hpp>

#include "integration/TestConsole.hpp"
#include "support/PtyProcess.hpp"
#include "support/TemporaryDirectory.hpp"

#include <csignal>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <iterator>
#include <map>
#include <string>
#include <thread>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::Not;

using Arguments = std::vector<std::string>;

Arguments consoleTo(const std::string& endpoint, const Arguments& more)
{
    Arguments arguments = qelCommand({"console", "--connect", endpoint, "--plain"});
    arguments.insert(arguments.end(), more.begin(), more.end());
    return arguments;
}

std::string contentOf(const std::string& path)
{
    std::ifstream file(path);
    return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
}

/// Partition 1 is a shell, 2 exits with 3, 3 is killed.
class ConsoleScriptTest : public ::testing::Test {
protected:
    Process::Result runConsole(const Arguments& more) const { return run(consoleTo(server.endpoint(), more)); }

    const TemporaryDirectory directory;
    ServeProcess server{
        {"--partition", "1=PS1='$ ' exec /bin/sh", "--partition", "2=exit 3", "--partition", "3=kill -9 $$"}};
};

TEST_F(ConsoleScriptTest, ACommandPrintsItsOutputOnly)
{
    const auto result = runConsole({"1", "--exec", "echo \"it's $((6 * 7))\"; echo two"});
    EXPECT_EQ(result.output, "it's 42\ntwo\n");
    EXPECT_EQ(result.errors, "");
    EXPECT_EQ(result.exitStatus, 0);
}

TEST_F(ConsoleScriptTest, TheExitStatusIsThatOfTheFirstCommandThatFails)
{
    const auto result =
        runConsole({"1", "--exec", "echo one", "--exec", "exit 7", "--exec", "exit 5", "--exec", "echo two"});
    EXPECT_EQ(result.output, "one\ntwo\n");
    EXPECT_EQ(result.errors, "qel: the command exited with status 7\n");
    EXPECT_EQ(result.exitStatus, 7);
}

TEST_F(ConsoleScriptTest, FailuresOfTheConsoleItselfKeepClearOfTheStatusOfACommand)
{
    const auto late = runConsole({"1", "--exec", "sleep 1000", "--timeout", "0.3"});
    EXPECT_EQ(late.errors, "qel: timed out after 0.3 s (--timeout): waiting for the end of \"sleep 1000\"\n");
    EXPECT_EQ(late.exitStatus, 246);
    EXPECT_EQ(runConsole({"2", "--exec", "true"}).exitStatus, 248);
    EXPECT_EQ(runConsole({"9", "--exec", "true"}).exitStatus, 241);
    EXPECT_EQ(runConsole({"9"}).exitStatus, 1);
}

TEST_F(ConsoleScriptTest, AScriptLeavesTheTerminalAloneAndControlCEndsIt)
{
    PtyProcess person(consoleTo(server.endpoint(), {"1", "--send", "echo up$((6 * 7))\\r", "--expect", "never"}));
    person.await("up42");
    EXPECT_TRUE(person.isTerminalUntouched());
    person.type("\x03");
    EXPECT_EQ(person.wait().signal, SIGINT);
}

TEST_F(ConsoleScriptTest, StepsAreDoneInTheirOrder)
{
    const auto result = runConsole({"1", "--expect", "\\$ ", "--send", "echo $((6 * 7))\\r", "--expect", "^42",
                                    "--expect", "\\$ ", "--send", "exit\\r", "--linger", "1"});
    EXPECT_THAT(result.output, HasSubstr("42\r\n$ exit"));
    EXPECT_EQ(result.exitStatus, 0);
}

TEST_F(ConsoleScriptTest, OutputThatDoesNotComeIsAnError)
{
    const auto result = runConsole({"1", "--expect", "never", "--timeout", "0.3"});
    EXPECT_EQ(result.errors, "qel: timed out after 0.3 s (--timeout): waiting for output that matches \"never\"\n");
    EXPECT_EQ(result.exitStatus, 6);
}

TEST_F(ConsoleScriptTest, ASessionThatEndsBeforeTheScriptIsAnError)
{
    const auto result = runConsole({"1", "--send", "exit 0\\r", "--expect", "never"});
    EXPECT_EQ(result.errors, "qel: the session ended while waiting for output that matches \"never\": session closed: "
                             "the command exited with status 0\n");
    EXPECT_EQ(result.exitStatus, 8);
}

TEST_F(ConsoleScriptTest, ACommandOfAPartitionThatFailsHasAStatusOfItsOwn)
{
    const auto failed = runConsole({"2"});
    EXPECT_EQ(failed.errors, "qel: session closed: the command exited with status 3\n");
    EXPECT_EQ(failed.exitStatus, 8);
    const auto killed = runConsole({"3"});
    EXPECT_EQ(killed.errors, "qel: session closed: the command was killed by signal 9 (Killed)\n");
    EXPECT_EQ(killed.exitStatus, 8);
}

TEST_F(ConsoleScriptTest, LogsAndARecordingAreWritten)
{
    const std::string log = directory.file("log");
    const std::string stripped = directory.file("stripped");
    const std::string recording = directory.file("recording");
    const auto result =
        runConsole({"1", "--log", log, "--log-strip", stripped, "--timestamps", "iso", "--record", recording, "--send",
                    "printf '\\\\n\\\\033[1m%s\\\\n' bold$((6 * 7))\\r", "--expect", "bold42"});
    ASSERT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_THAT(contentOf(log), HasSubstr("\x1B[1mbold42"));
    EXPECT_THAT(contentOf(stripped), HasSubstr("Z] bold42"));
    EXPECT_THAT(contentOf(recording), HasSubstr("\\u001b[1mbold42"));
    EXPECT_THAT(result.output, HasSubstr("Z] \x1B[1mbold42")) << "the screen is stamped too";
}

TEST_F(ConsoleScriptTest, ALogThatCannotBeOpenedIsReported)
{
    const auto result = runConsole({"1", "--log", "/none/log"});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_EQ(result.errors, "qel: cannot write the log /none/log: 2 (No such file or directory)\n");
}

TEST_F(ConsoleScriptTest, MisspeltWordsAreAnsweredWithTheNearestOne)
{
    EXPECT_EQ(runConsole({"1", "--timestamps", "iso8"}).errors,
              "qel: --timestamps: \"iso8\" is none of iso, delta; did you mean \"iso\"?\n");
    EXPECT_EQ(runConsole({"1", "--log-level", "inof"}).errors,
              "qel: --log-level: \"inof\" is not a log level: debug, info, warn, error or critical; did you mean "
              "\"info\"?\n");
    EXPECT_EQ(runConsole({"1", "--reconect"}).errors,
              "qel: unknown option \"--reconect\"; did you mean \"--reconnect\"?\n");
}

TEST_F(ConsoleScriptTest, WatchingExcludesTyping)
{
    EXPECT_EQ(runConsole({"1", "--watch", "--force"}).exitStatus, 2);
    EXPECT_EQ(runConsole({"1", "--watch", "--connection", "1"}).exitStatus, 2);
}

TEST_F(ConsoleScriptTest, AsciinemaTakesARecording)
{
    const Process::Result found = run({"/bin/sh", "-c", "command -v asciinema"});
    if (found.exitStatus != 0) GTEST_SKIP() << "there is no asciinema here; script/setup installs it";
    const std::string recording = directory.file("recording");
    const auto recorded = runConsole({"1", "--record", recording, "--send",
                                      "printf '\\\\033[1m\\\\303\\\\251%s\\\\n' $((6 * 7))\\r", "--expect", "42"});
    ASSERT_EQ(recorded.exitStatus, 0) << recorded.errors;
    PtyProcess player({"/usr/bin/env", "LC_ALL=C.UTF-8", "asciinema", "cat", recording});
    const auto played = player.wait();
    EXPECT_EQ(played.exitStatus, 0);
    EXPECT_THAT(played.screen, HasSubstr("\x1B[1m\xC3\xA9"
                                         "42"));
}

// Profiles.

TEST_F(ConsoleScriptTest, AProfileNamesTheServerAndItsPartitions)
{
    ASSERT_TRUE(std::filesystem::create_directory(directory.file("qel")));
    std::ofstream(directory.file("qel/config.toml")) << "[profile.lab]\nconnect = \"" << server.endpoint()
                                                     << "\"\nplain = true\npartitions = { shell = 1, failing = 2 }\n";
    const std::map<std::string, std::string> environment{{"XDG_CONFIG_HOME", directory.path()}};
    Process console(qelCommand({"console", "lab/failing"}), environment);
    EXPECT_EQ(console.wait().errors, "qel: session closed: the command exited with status 3\n");
    Process list(qelCommand({"list"}), environment);
    EXPECT_EQ(list.wait().output, "lab/shell    partition 1 of " + server.endpoint() +
                                      "\nlab/failing  partition 2 of " + server.endpoint() + "\n");
    Process unknown(qelCommand({"console", "lab/sell"}), environment);
    const auto result = unknown.wait();
    EXPECT_EQ(result.exitStatus, 2);
    EXPECT_EQ(result.errors, "qel: there is no partition \"lab/sell\"; did you mean \"lab/shell\"?\n");
    Process bare(qelCommand({"console", "--connect", "127.0.0.1:1", "shell"}), environment);
    const auto refused = bare.wait();
    EXPECT_EQ(refused.exitStatus, 2);
    EXPECT_EQ(refused.errors,
              "qel: \"shell\" is no partition id from 0 to 65535 and no PROFILE/PARTITION; did you mean "
              "\"lab/shell\"?\n");
}

// A lost connection.

TEST(ConsoleReconnect, AKilledServerIsFoundAgain)
{
    const TemporaryDirectory directory;
    const Arguments partition{"--partition", "1=PS1='$ ' exec /bin/sh"};
    auto first = std::make_unique<ServeProcess>(partition);
    const std::string endpoint = first->endpoint();
    PtyProcess person(consoleTo(endpoint, {"1", "--reconnect", "--log", directory.file("log")}));
    person.await("$ ");
    first->process().signal(SIGKILL);
    person.await("; connecting again\r\n");
    first.reset();
    const ServeProcess second(partition, endpoint);
    person.await("qel: connected again after ");
    person.await("connected to partition 1 of " + endpoint);
    person.await("$ ");
    person.type("echo $((6 * 7))\r");
    person.await("42\r\n");
    person.type("~.");
    EXPECT_EQ(person.wait().exitStatus, 0);
    EXPECT_TRUE(person.isTerminalUntouched());
    EXPECT_THAT(contentOf(directory.file("log")), HasSubstr("\n[qel: connected again after "));
}

TEST(ConsoleReconnect, ThePersonCanLeaveWhileItConnects)
{
    auto server = std::make_unique<ServeProcess>(Arguments{"--partition", "1=exec cat"});
    PtyProcess person(consoleTo(server->endpoint(), {"1", "--reconnect"}));
    person.await("connected");
    person.type("half a line");
    person.await("half a line");
    server->stop();
    person.await("qel: session closed: the server shut down; connecting again\r\n");
    person.await("Connection refused); next attempt in 2 s\r\n");
    person.type("~i");
    person.await("qel: there is no session at the moment\r\n");
    person.type("~.");
    const auto result = person.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.screen, EndsWith("\r\nqel: left partition 1\r\n"));
    EXPECT_TRUE(person.isTerminalUntouched());
}

// Watching.

TEST_F(ConsoleScriptTest, AWatcherSeesWhatIsTypedAndCanTakeOver)
{
    PtyProcess holder(consoleTo(server.endpoint(), {"1"}));
    holder.await("$ ");
    PtyProcess watcher(consoleTo(server.endpoint(), {"1", "--watch"}));
    watcher.await("watching partition 1");
    watcher.await("$ ");
    holder.type("echo $((6 * 7))\r");
    watcher.await("42\r\n");
    watcher.type("\r~f");
    watcher.await("qel: opening partition 1 again by force\r\n");
    EXPECT_EQ(holder.wait().exitStatus, 1);
    watcher.await("connected to partition 1");
    watcher.type("echo $((7 * 7))\r");
    watcher.await("49\r\n");
    watcher.type("~.");
    EXPECT_EQ(watcher.wait().exitStatus, 0);
    EXPECT_TRUE(watcher.isTerminalUntouched());
}

// Output from before.

TEST(ConsoleReplay, IsNoAnswerToWhatAScriptTypes)
{
    const ServeProcess server({"--partition", "1=stty -echo; exec cat"});
    const auto runConsole = [&](const Arguments& more) { return run(consoleTo(server.endpoint(), more)); };
    ASSERT_EQ(runConsole({"1", "--send", "one\\rtwo\\r", "--expect", "two"}).exitStatus, 0);
    EXPECT_EQ(runConsole({"1", "--send", "three\\r", "--expect", "two", "--timeout", "0.3"}).exitStatus, 6);
    const auto result = runConsole({"1", "--expect", "one", "--send", "four\\r", "--expect", "four"});
    EXPECT_EQ(result.exitStatus, 0) << "before it types, a script may expect what is there";
}

TEST(ConsoleReplay, ASessionThatEndsAtOnceEndsTheScript)
{
    const ServeProcess server({"--partition", "1=echo over"});
    const auto result = run(consoleTo(server.endpoint(), {"1", "--expect", "over", "--expect", "never"}));
    EXPECT_THAT(result.errors, HasSubstr("the session ended while waiting for output that matches \"never\""));
    EXPECT_EQ(result.exitStatus, 8);
}

// A server that lets people watch, played by the test.

/// Answers the requests up to the open session; sessions with other numbers than `free` are held.
class WatchedServer {
public:
    explicit WatchedServer(std::uint16_t free)
        : mListener(listenOn(IPEndpoint("127.0.0.1:0"), 1)), mEndpoint(mListener.getSocketName().str()),
          mThread([this, free] {
              SocketStream stream(mListener.accept());
              stream.setReadDeadline(Process::kDeadline);
              LoopbackMessages messages(stream);
              for (bool isSetUp = false; !isSetUp;) {
                  const auto request = messages.receive();
                  const auto* const open = dynamic_cast<const QelMessageVirtualSerialOpenReq*>(request.get());
                  QelMessageGeneric response(request->getCallerId(), request->getFunction(), request->getOperation(),
                                             MsgResponse);
                  if (open != nullptr && open->getVssConnectionNumber() != free)
                      response.setStatus(QelMessageStatusConnectionNotAvailable);
                  messages.send(response);
                  isSetUp = request->getOperation() == QelMessageOpSetupVirtualSerialSession;
                  if (open != nullptr) ++mOpens;
                  if (mOpens == 15 && !isSetUp) return;
              }
              messages.send(QelMessageVirtualSerialDataToDaxAsync(1, free, 5, "look\n"));
              messages.send(QelMessageVirtualSerialSessionClosedAsync(
                  1, free, QelMessageVirtualSerialSessionClosedAsync::CloseReasonReadFailure));
              messages.receive(); // to close the session
          })
    {}
    ~WatchedServer() { mThread.join(); }
    WatchedServer(const WatchedServer&) = delete;
    WatchedServer& operator=(const WatchedServer&) = delete;

    const std::string& endpoint() const { return mEndpoint; }

private:
    int mOpens = 0;
    Socket mListener;
    std::string mEndpoint;
    std::thread mThread;
};

TEST(ConsoleWatch, TakesTheFirstFreePlace)
{
    const WatchedServer server(3);
    const auto result = run(consoleTo(server.endpoint(), {"1", "--watch", "--no-eof"}));
    EXPECT_EQ(result.output, "look\n");
}

TEST_F(ConsoleScriptTest, TheEndOfTheInputOfAWatcherIsNotTyped)
{
    const auto result = runConsole({"1", "--watch", "--linger", "0.3"});
    EXPECT_THAT(result.output, Not(HasSubstr("not passed on"))) << "a warning of the server";
    EXPECT_EQ(result.errors, "");
    EXPECT_EQ(result.exitStatus, 0);
}

TEST(ConsoleWatch, SaysWhenAllPlacesAreTaken)
{
    const WatchedServer server(16);
    const auto result = run(consoleTo(server.endpoint(), {"1", "--watch"}));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors, "qel: 15 consoles watch partition 1 already; wait until one leaves\n");
}

} // namespace

} // namespace qel::test
