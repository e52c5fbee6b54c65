// "qel status" and "qel list" with a server as a process, and its status socket.

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"
#include "support/CredentialDirectory.hpp"
#include "support/PtyProcess.hpp"
#include "support/TemporaryDirectory.hpp"

#include <csignal>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <sys/ioctl.h>
#include <vector>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::StartsWith;

using Json = nlohmann::json;
using Arguments = std::vector<std::string>;

class StatusTest : public ::testing::Test {
protected:
    Arguments serving() const
    {
        return {"--status-socket", socket, "--partition", "1=echo ready; exec cat", "--partition", "2=exec cat"};
    }
    Arguments statusCommand(const Arguments& more = {}) const
    {
        Arguments arguments = qelCommand({"status", "--socket", socket});
        arguments.insert(arguments.end(), more.begin(), more.end());
        return arguments;
    }
    Process::Result status(const Arguments& more = {}) const { return run(statusCommand(more)); }
    Json report() const
    {
        const Process::Result result = status({"--json"});
        EXPECT_EQ(result.exitStatus, 0) << result.errors;
        return Json::parse(result.output, nullptr, false);
    }

    const TemporaryDirectory directory;
    const std::string socket = directory.file("s");
};

TEST_F(StatusTest, ShowsConsolesAndPartitionsOfARunningServer)
{
    ServeProcess server(serving());
    TestConsole types(server.endpoint());
    types.openSession("ops-1");
    types.openSerial(1);
    types.readUntil(1, "ready\r\n");
    const Json found = report();
    EXPECT_EQ(found.at("pid"), server.process().pid());
    EXPECT_THAT(found.at("listen"), ElementsAre(server.endpoint()));
    EXPECT_EQ(found.at("consoles").at(0).at("toolId"), "ops-1");
    EXPECT_EQ(found.at("partitions").at(0).at("output").at("bytes"), 7);
    EXPECT_EQ(found.at("partitions").at(0).at("line"), "up");
    EXPECT_EQ(found.at("partitions").at(1).at("line"), "down");
    EXPECT_EQ(found.at("connections").at("accepted"), 1);

    const Process::Result text = status();
    EXPECT_EQ(text.exitStatus, 0);
    EXPECT_EQ(text.errors, "");
    EXPECT_THAT(text.output, StartsWith("qel serve "));
    EXPECT_THAT(text.output, HasSubstr(", on " + server.endpoint() + "\n\nConsoles: 1 of at most 16\n"));
    EXPECT_THAT(text.output, HasSubstr("\n  1   -     up    ops-1 #1  -      1 (7 B)  0 (0 B)  7 B of 64 KiB  1\n"));
    EXPECT_THAT(status({"--prometheus"}).output, HasSubstr("\nqel_consoles 1\n"));
    server.stop();
    EXPECT_FALSE(std::filesystem::exists(socket));
}

TEST_F(StatusTest, ClosesAnothersSessionAndLogsWhoDidIt)
{
    ServeProcess server(serving());
    TestConsole types(server.endpoint());
    types.openSession("ops-1");
    types.openSerial(2);
    const Process::Result closed = status({"--close", "2"});
    EXPECT_EQ(closed.exitStatus, 0) << closed.errors;
    EXPECT_EQ(closed.output, "closed: ops-1 on partition 2, connection 0\n");
    EXPECT_EQ(types.awaitClosed(2), 2U);
    const Process::Result again = status({"--close", "2"});
    EXPECT_EQ(again.exitStatus, 1);
    EXPECT_EQ(again.errors, "qel: partition 2, connection 0: there is no session\n");
    EXPECT_THAT(server.stop().errors, HasSubstr(" partition=2 connection=0 uid=" + std::to_string(::getuid()) + "\n"));
}

TEST_F(StatusTest, SaysThatALineHasNoBreak)
{
    ServeProcess server(serving());
    EXPECT_EQ(status({"--break", "1"}).errors, "qel: partition 1: its line is down\n");
    TestConsole types(server.endpoint());
    types.openSession("ops-1");
    types.openSerial(1);
    const Process::Result result = status({"--break", "1"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              "qel: partition 1: its line has no break, or could not send it; the server's log says so then\n");
}

TEST_F(StatusTest, ASecondServerDoesNotTakeTheSocketUnlessTheFirstIsDead)
{
    auto first = std::make_unique<ServeProcess>(serving());
    Arguments second = qelCommand({"serve", "--plain", "--listen", "127.0.0.1:0"});
    const Arguments more = serving();
    second.insert(second.end(), more.begin(), more.end());
    const Process::Result refused = run(second);
    EXPECT_EQ(refused.exitStatus, 3);
    EXPECT_THAT(refused.errors, HasSubstr("qel: cannot listen on " + socket + ": another server listens there\n"));
    EXPECT_EQ(report().at("pid"), first->process().pid());
    first->process().signal(SIGKILL);
    first->process().wait();
    EXPECT_TRUE(std::filesystem::exists(socket));
    EXPECT_EQ(status().errors, "qel: cannot reach a server over " + socket + ": no server listens there any more\n");
    EXPECT_EQ(status().exitStatus, 3);
    const ServeProcess third(serving());
    EXPECT_EQ(report().at("listen").at(0), third.endpoint());
}

TEST_F(StatusTest, ServersOfAUserShareADefaultThatTheFirstOneHas)
{
    const std::map<std::string, std::string> environment{{"XDG_RUNTIME_DIR", directory.path()}};
    ServeProcess first({}, "127.0.0.1:0", {"--plain"}, environment);
    ServeProcess second({}, "127.0.0.1:0", {"--plain"}, environment);
    second.process().awaitErrors("no status socket: cannot listen on ");
    Process asks(qelCommand({"status", "--json"}), environment);
    EXPECT_EQ(Json::parse(asks.wait().output).at("listen").at(0), first.endpoint());
    const ServeProcess none({"--status-socket", "none"}, "127.0.0.1:0", {"--plain"}, environment);
    const Process::Result without = run(qelCommand({"status", "--socket", directory.file("t")}));
    EXPECT_EQ(without.exitStatus, 3);
}

TEST_F(StatusTest, OverTlsTheDaysUntilCertificatesExpireAreKnown)
{
    const CredentialDirectory credentials;
    ServeProcess server({"--status-socket", socket, "--warn-expiry", "3650"}, "127.0.0.1:0",
                        {"--credentials", credentials.path(), "--name", "server"});
    const Json certificates = report().at("certificates");
    ASSERT_EQ(certificates.size(), 2U);
    EXPECT_EQ(certificates.at(0).at("use"), "own");
    EXPECT_EQ(certificates.at(0).at("state"), "due");
    EXPECT_EQ(certificates.at(1).at("use"), "root");
    EXPECT_THAT(status().output,
                HasSubstr("\nWARNING: own certificate " + credentials.path() + "/server.crt expires at "));
}

TEST_F(StatusTest, AConsoleIsClosedByItsNameUnlessAPartitionHasTheSame)
{
    const CredentialDirectory credentials;
    const std::string file = directory.file("serve.toml");
    std::ofstream(file) << "[partition.other]\nid = 2\nline = \"exec cat\"\n";
    ServeProcess server({"--config", file, "--status-socket", socket}, "127.0.0.1:0", credentials.options("server"));
    const auto types = [&] { return report().at("partitions").back().at("sessions").size() == 1; };
    Arguments command = qelCommand({"console", "--connect", server.endpoint(), "2"});
    const Arguments own = credentials.options("client");
    command.insert(command.end(), own.begin(), own.end());
    Process first(command);
    ASSERT_TRUE(comesTrue(types));
    EXPECT_EQ(report().at("consoles").at(0).at("tls"), "1.3");
    EXPECT_EQ(status({"--close", "client"}).output, "closed: client on partition 2, connection 0\n");
    EXPECT_NE(first.wait().exitStatus, 0);

    std::ofstream(file, std::ios::app) << "[partition.client]\nid = 1\nline = \"exec cat\"\n";
    server.process().signal(SIGHUP);
    server.process().awaitErrors("SIGHUP: read ");
    Process second(command);
    ASSERT_TRUE(comesTrue(types));
    EXPECT_EQ(status({"--close", "client"}).errors,
              "qel: client is a partition and a console: give the number of one, such as 1 or #1\n");
    EXPECT_EQ(status({"--close", "#2"}).output, "closed: client on partition 2, connection 0\n");
    EXPECT_NE(second.wait().exitStatus, 0);
}

TEST_F(StatusTest, WithoutATerminalWatchingPrintsOneReportAfterTheOther)
{
    auto server = std::make_unique<ServeProcess>(serving());
    Process watching(statusCommand({"--watch", "0.1", "--json"}));
    const Json first = Json::parse(watching.readLine());
    const Json second = Json::parse(watching.readLine());
    EXPECT_EQ(first.at("pid"), server->process().pid());
    EXPECT_EQ(second.at("pid"), server->process().pid());
    Process lines(statusCommand({"--watch", "0.1"}));
    lines.awaitOutput("longer: 0\n\nqel serve ");
    EXPECT_THAT(lines.output(), Not(HasSubstr("\x1b")));
    server->stop();
    EXPECT_EQ(lines.wait().exitStatus, 3);
    EXPECT_EQ(watching.wait().exitStatus, 3);
}

/// "qel status --watch" on a terminal.
class StatusWatchTest : public StatusTest {
protected:
    static constexpr const char* kEnd = "\x1b[?25h\x1b[?1049l"; // cursor, and the screen as it was before

    std::unique_ptr<PtyProcess> watch() const
    {
        auto person = std::make_unique<PtyProcess>(statusCommand({"--watch", "0.1"}));
        person->await("\x1b[?1049h");
        person->await("Partitions: 2");
        return person;
    }

    std::unique_ptr<ServeProcess> server = std::make_unique<ServeProcess>(serving());
};

TEST_F(StatusWatchTest, RedrawsUntilTheUserLeaves)
{
    const auto person = watch();
    person->await("Consoles: 0 of");
    TestConsole console(server->endpoint());
    console.introduce("ops-1");
    person->await("Consoles: 1 of");
    person->await("ops-1");
    person->type("q");
    const PtyProcess::Result result = person->wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.screen, testing::EndsWith(kEnd));
    EXPECT_TRUE(person->isTerminalUntouched());
}

TEST_F(StatusWatchTest, RestoresTheTerminalOnEveryWayOut)
{
    for (const char* key : {"\x03", "\x04", "\x1c"}) {
        const auto person = watch();
        person->type(key);
        const PtyProcess::Result result = person->wait();
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_THAT(result.screen, testing::EndsWith(kEnd));
        EXPECT_TRUE(person->isTerminalUntouched());
    }
    for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGQUIT}) {
        const auto person = watch();
        person->signal(signal);
        const PtyProcess::Result result = person->wait();
        EXPECT_EQ(result.signal, 0) << signal;
        EXPECT_THAT(result.screen, testing::EndsWith(kEnd));
        EXPECT_TRUE(person->isTerminalUntouched());
    }
}

TEST_F(StatusWatchTest, FollowsTheSizeOfTheWindow)
{
    const auto person = watch();
    const winsize size{3, 20, 0, 0};
    ASSERT_EQ(::ioctl(person->terminal().slave(), TIOCSWINSZ, &size), 0);
    person->await(" more lines");
    person->type("q");
    EXPECT_EQ(person->wait().exitStatus, 0);
}

TEST_F(StatusWatchTest, WaitsForAServerThatIsRestarted)
{
    const auto person = watch();
    server->stop();
    person->await("cannot reach a server over");
    server = std::make_unique<ServeProcess>(serving());
    person->await("Partitions: 2");
    person->type("q");
    EXPECT_EQ(person->wait().exitStatus, 0);
}

TEST_F(StatusTest, WatchingNothingIsAnError)
{
    PtyProcess person(statusCommand({"--watch"}));
    const PtyProcess::Result result = person.wait();
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_THAT(result.screen, Not(HasSubstr("\x1b")));
}

TEST_F(StatusTest, OptionsThatContradictEachOtherAreRefused)
{
    for (const Arguments& options : std::vector<Arguments>{{"--json", "--prometheus"},
                                                           {"--watch", "--prometheus"},
                                                           {"--watch", "--close", "1"},
                                                           {"--break", "1", "--close", "1"},
                                                           {"--watch", "0"},
                                                           {"--watch", "x"}}) {
        EXPECT_EQ(status(options).exitStatus, 2) << options.front();
    }
    Process nowhere(qelCommand({"status"}), {{"XDG_RUNTIME_DIR", ""}, {"QEL_STATUS_SOCKET", ""}});
    const Process::Result result = nowhere.wait();
    EXPECT_EQ(result.exitStatus, 2);
    EXPECT_EQ(result.errors, "qel: no status socket is known: --socket names that of qel serve --status-socket\n");
}

TEST_F(StatusTest, ListSaysWhoIsOnWhereThatIsKnown)
{
    const ServeProcess server(serving());
    TestConsole types(server.endpoint());
    types.openSession("ops-1");
    types.openSerial(1);
    ASSERT_TRUE(std::filesystem::create_directory(directory.file("qel")));
    std::ofstream(directory.file("qel/config.toml"))
        << "[profile.lab]\nconnect = \"" << server.endpoint()
        << "\"\nplain = true\npartitions = { shell = 1, cat = 2 }\n"
        << "[profile.far]\nconnect = \"192.0.2.1\"\npartitions = { x = 1 }\n";
    const std::map<std::string, std::string> environment{
        {"XDG_CONFIG_HOME", directory.path()}, {"XDG_RUNTIME_DIR", ""}, {"QEL_STATUS_SOCKET", socket}};
    Process list(qelCommand({"list"}), environment);
    EXPECT_EQ(list.wait().output, "lab/shell  partition 1 of " + server.endpoint() + ", line up: ops-1 #1 types\n" +
                                      "lab/cat    partition 2 of " + server.endpoint() + ", line down: nobody\n" +
                                      "far/x      partition 1 of 192.0.2.1\n");
    Process json(qelCommand({"list", "--json"}), environment);
    const Json rows = Json::parse(json.wait().output).at("partitions");
    EXPECT_EQ(rows.at(0).at("sessions").dump(), R"([{"connection":0,"console":1,"name":"ops-1"}])");
    EXPECT_EQ(rows.at(2).count("sessions"), 0U);
    Process wrong(qelCommand({"list", "--socket", directory.file("none")}), environment);
    EXPECT_EQ(wrong.wait().exitStatus, 3);
}

} // namespace

} // namespace qel::test
