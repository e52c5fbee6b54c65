// The options of "qel serve": from the command line, the environment and a file.

#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"
#include "base/Program.hpp"
#include "serve/ServePlan.hpp"
#include "support/TemporaryDirectory.hpp"

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <gmock/gmock.h>
#include <sstream>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StartsWith;
using tool::ServePlan;

/// A variable of the environment while the object lives.
class Variable {
public:
    Variable(const std::string& name, const std::string& value) : mName(name)
    {
        ::setenv(name.c_str(), value.c_str(), 1);
    }
    ~Variable() { ::unsetenv(mName.c_str()); }
    Variable(const Variable&) = delete;
    Variable& operator=(const Variable&) = delete;

private:
    std::string mName;
};

class ServePlanning : public ::testing::Test {
protected:
    /// Parses "qel serve" with these words.
    ServePlan plan(std::vector<std::string> words) const
    {
        CLI::App app("", "qel");
        const tool::ServeInput input(tool::addCommand(app, "serve", ""));
        words.insert(words.begin(), "serve");
        std::reverse(words.begin(), words.end());
        app.parse(words);
        return input.plan();
    }

    /// The same with a file.
    ServePlan planOf(const std::string& toml, std::vector<std::string> words = {}) const
    {
        write(toml);
        words.insert(words.begin(), {"--config", file()});
        return plan(words);
    }

    void write(const std::string& toml) const { std::ofstream(file()) << toml; }
    std::string file() const { return directory.file("s.toml"); }

    /// What is said about words that are wrong.
    std::string said(const std::vector<std::string>& words) const
    {
        try {
            plan(words);
        } catch (const CLI::ParseError& error) {
            return error.what();
        } catch (const tool::CommandFailure& error) {
            EXPECT_EQ(error.getExitStatus(), tool::ExitStatus::Usage);
            return error.what();
        }
        return "no error";
    }

    /// What is said about a file, without its path.
    std::string saidOf(const std::string& toml, std::vector<std::string> words = {}) const
    {
        write(toml);
        words.insert(words.begin(), {"--config", file()});
        const std::string text = said(words);
        return text.rfind(file(), 0) == 0 ? text.substr(file().size()) : text;
    }

    static std::string setting(const ServePlan& plan, const std::string& key)
    {
        for (const tool::Setting& each : plan.settings)
            if (each.key == key) return each.value + " " + each.origin;
        return "none";
    }

    TemporaryDirectory directory;
};

TEST_F(ServePlanning, TheOptionComesBeforeTheVariableAndTheVariableBeforeTheFile)
{
    const std::string toml = "plain = true\nmax-consoles = 3\n";
    EXPECT_EQ(plan({"--plain"}).server.maxConsoles, 16);
    EXPECT_EQ(setting(plan({"--plain"}), "max-consoles"), "16 default");
    EXPECT_EQ(planOf(toml).server.maxConsoles, 3);
    EXPECT_EQ(setting(planOf(toml), "max-consoles"), "3 " + file() + ":2");
    const Variable variable("QEL_MAX_CONSOLES", "4");
    EXPECT_EQ(planOf(toml).server.maxConsoles, 4);
    EXPECT_EQ(setting(planOf(toml), "max-consoles"), "4 environment QEL_MAX_CONSOLES");
    EXPECT_EQ(planOf(toml, {"--max-consoles", "5"}).server.maxConsoles, 5);
    EXPECT_EQ(setting(planOf(toml, {"--max-consoles", "5"}), "max-consoles"), "5 option");
}

TEST_F(ServePlanning, AnEmptyVariableIsNoVariable)
{
    const Variable variable("QEL_MAX_CONSOLES", "");
    EXPECT_EQ(plan({"--plain"}).server.maxConsoles, 16);
}

TEST_F(ServePlanning, AVariableNamesTheFile)
{
    write("plain = true\nmax-consoles = 3\n");
    const Variable variable("QEL_CONFIG", file());
    EXPECT_EQ(plan({}).server.maxConsoles, 3);
    EXPECT_EQ(plan({}).file, file());
}

TEST_F(ServePlanning, TheFileTakesTheKindsOfValuesThatTheOptionsTake)
{
    const ServePlan made = planOf("listen = ['127.0.0.1:1', '[::1]:2']\nplain = true\nframe-timeout = 2.5\n"
                                  "queue-limit = 1_000\nsystem-serial = '0000007'\ninterface-version = '2.7'\n"
                                  "insecure-permissions = false\n");
    EXPECT_THAT(made.server.listen, ElementsAre("127.0.0.1:1", "[::1]:2"));
    EXPECT_TRUE(made.server.plain);
    EXPECT_EQ(made.server.frameTimeout.count(), 2500);
    EXPECT_EQ(made.server.queueBytes, 1000U);
    EXPECT_EQ(made.machine.serialNumber, "0000007");
    EXPECT_EQ(made.machine.majorVersion, 2);
    EXPECT_EQ(made.machine.minorVersion, 7);
}

TEST_F(ServePlanning, AListOfTheCommandLineReplacesThatOfTheFile)
{
    EXPECT_THAT(planOf("plain = true\nlisten = ['127.0.0.1:1', '[::1]:2']", {"--listen", "127.0.0.1:3"}).server.listen,
                ElementsAre("127.0.0.1:3"));
}

TEST_F(ServePlanning, TheFileMayHaveWhatAnOptionOfTheCommandLineNeeds)
{
    const ServePlan made = planOf("credentials = '/etc/qel'", {"--name", "server"});
    EXPECT_EQ(made.transport.directory, "/etc/qel");
    EXPECT_EQ(made.transport.name, "server");
    EXPECT_THAT(said({"--name", "server"}), HasSubstr("--name requires --credentials"));
}

TEST_F(ServePlanning, AFalseFlagIsAsIfItWereNotThere)
{
    EXPECT_FALSE(planOf("credentials = '/etc/qel'\nname = 'server'\nplain = false\n").transport.plain);
    const Variable variable("QEL_PLAIN", "false");
    EXPECT_FALSE(planOf("credentials = '/etc/qel'\nname = 'server'").transport.plain);
}

TEST_F(ServePlanning, NamesTheLineAndTheColumnOfAWrongValue)
{
    EXPECT_EQ(saidOf("plain = true\nmax-consoles = 0"), ":2:16: max-consoles: \"0\" is not an integer in [1, 255]");
    EXPECT_EQ(
        saidOf("listen = ['127.0.0.1:1',\n 'x']"),
        ":2:2: listen: \"x:4717\" is not an endpoint such as 127.0.0.1:4711 or [::1]:4711: \"x\" is not an IP address "
        "(names are not looked up)");
    EXPECT_EQ(saidOf("plain = 'yes'"), ":1:9: plain takes true or false, not a text");
    EXPECT_EQ(saidOf("name = ['a', 'b']"), ":1:8: name takes one value, not a list");
    EXPECT_EQ(saidOf("listen = [true]"), ":1:11: listen takes a text or a number, not true or false");
    EXPECT_EQ(saidOf("plain = true\nterm = 1979-05-27"), ":2:8: term takes a text or a number, not a time");
    EXPECT_EQ(saidOf("plain = true\nlog-level = 'loud'"),
              ":2:13: log-level: \"loud\" is not a log level: debug, info, warn, error or critical");
}

TEST_F(ServePlanning, NamesTheNearestKey)
{
    EXPECT_EQ(saidOf("max-consols = 1"), ":1:1: unknown key \"max-consols\"; did you mean \"max-consoles\"?");
    EXPECT_THAT(saidOf("config = 'x'"), StartsWith(":1:1: unknown key \"config\""));
    EXPECT_THAT(saidOf("help = true"), StartsWith(":1:1: unknown key \"help\""));
}

TEST_F(ServePlanning, NamesTheVariableThatIsWrong)
{
    const Variable variable("QEL_MAX_CONSOLES", "x");
    EXPECT_EQ(said({"--plain"}), "the variable QEL_MAX_CONSOLES: \"x\" is not an integer in [1, 255]");
    EXPECT_EQ(said({"--plain", "--max-consoles", "1"}), "no error");
}

TEST_F(ServePlanning, AFileThatIsNotThereIsAFailure)
{
    EXPECT_THROW(plan({"--config", directory.file("none")}), FileIOError);
}

TEST_F(ServePlanning, HelpNeedsNoFile)
{
    EXPECT_THROW(plan({"--config", directory.file("none"), "--help"}), CLI::CallForHelp);
}

TEST_F(ServePlanning, OtherCommandsDoNotReadTheVariables)
{
    const Variable config("QEL_CONFIG", directory.file("none"));
    const Variable listen("QEL_LISTEN", "nonsense");
    CLI::App app("", "qel");
    const tool::ServeInput input(tool::addCommand(app, "serve", ""));
    tool::addCommand(app, "call", "");
    app.parse("call", false);
    EXPECT_TRUE(app.got_subcommand("call"));
}

TEST_F(ServePlanning, PartitionsComeFromTheFileAndFromTheCommandLine)
{
    const ServePlan made = planOf("plain = true\n[partition.web]\nid = 2\nline = 'cat'\ndescription = 'd'\n",
                                  {"--partition", "1=echo a=b"});
    ASSERT_EQ(made.partitions.size(), 2U);
    EXPECT_EQ(made.partitions.at(1).line, "echo a=b");
    EXPECT_EQ(made.partitions.at(1).options.name, "");
    EXPECT_EQ(made.partitions.at(2).line, "cat");
    EXPECT_EQ(made.partitions.at(2).options.name, "web");
    EXPECT_EQ(made.partitions.at(2).options.description, "d");
}

TEST_F(ServePlanning, APartitionIsServedAsTheOptionsSayUnlessItsOwnKeysSayOtherwise)
{
    const Variable variable("QEL_REPLAY", "7"); // is for all partitions, not for those with a key of their own
    const ServePlan made = planOf("plain = true\nstart = 'boot'\n[partition.a]\nid = 1\nline = 'cat'\n"
                                  "[partition.b]\nid = 2\nline = 'cat'\nreplay = 8\nstart = 'open'\n"
                                  "restart = 'failure'\nwhen-unattended = 'wait'\n",
                                  {"--partition", "3=cat", "--restart", "always"});
    for (const std::uint16_t id : std::vector<std::uint16_t>{1, 3}) {
        SCOPED_TRACE(id);
        EXPECT_EQ(made.partitions.at(id).options.replayBytes, 7U);
        EXPECT_EQ(made.partitions.at(id).options.start, protocol::StartLine::Boot);
        EXPECT_EQ(made.partitions.at(id).options.restart, protocol::RestartLine::Always);
        EXPECT_EQ(made.partitions.at(id).options.unattended, protocol::WhenUnattended::Keep);
    }
    EXPECT_EQ(made.partitions.at(2).options.replayBytes, 8U);
    EXPECT_EQ(made.partitions.at(2).options.start, protocol::StartLine::AtFirstOpen);
    EXPECT_EQ(made.partitions.at(2).options.restart, protocol::RestartLine::OnFailure);
    EXPECT_EQ(made.partitions.at(2).options.unattended, protocol::WhenUnattended::Wait);
}

TEST_F(ServePlanning, AWrongKeyOfAPartitionIsRefusedWithItsPlace)
{
    EXPECT_EQ(saidOf("plain = true\n[partition.a]\nid = 1\nline = 'cat'\nrestart = 'no'\n"),
              ":5:11: restart: \"no\" is not never, failure or always");
    EXPECT_EQ(saidOf("plain = true\n[partition.a]\nid = 1\nline = 'cat'\nreplay = -1\n"),
              ":5:10: replay: \"-1\" is not an integer in [0, 16777216]");
}

TEST_F(ServePlanning, ALineIsLoggedWithTheOthersUnlessItsPartitionSaysOtherwise)
{
    const TemporaryDirectory own;
    const auto partition = [](int id, const std::string& log) {
        const std::string number = std::to_string(id);
        return "[partition.p" + number + "]\nid = " + number + "\nline = 'cat'\n" + log;
    };
    const std::string partitions =
        partition(1, "") + partition(2, "log = false\n") + partition(3, "log = '" + own.path() + "'\n");
    const ServePlan made =
        planOf("plain = true\nline-log = '" + directory.path() + "'\n" + partitions + partition(4, "log = true\n"),
               {"--partition", "5=cat"});
    EXPECT_EQ(made.partitions.at(1).logDirectory, directory.path());
    EXPECT_EQ(made.partitions.at(2).logDirectory, "");
    EXPECT_EQ(made.partitions.at(3).logDirectory, own.path());
    EXPECT_EQ(made.partitions.at(4).logDirectory, directory.path());
    EXPECT_EQ(made.partitions.at(5).logDirectory, directory.path());
    const ServePlan without = planOf("plain = true\n" + partitions);
    EXPECT_EQ(without.partitions.at(1).logDirectory, "");
    EXPECT_EQ(without.partitions.at(3).logDirectory, own.path());
}

TEST_F(ServePlanning, AWrongLogOfAPartitionIsRefusedWithItsPlace)
{
    const std::string partition = "plain = true\n[partition.a]\nid = 1\nline = 'cat'\n";
    EXPECT_EQ(saidOf(partition + "log = true\n"), ":5:7: log: line-log names no directory; name one here");
    EXPECT_EQ(saidOf(partition + "log = '/no/such'\n"), ":5:7: log: \"/no/such\" is not a directory");
    EXPECT_EQ(saidOf(partition + "log = ''\n"), ":5:7: log: \"\" is not a directory");
    EXPECT_EQ(saidOf(partition + "log = 1\n"), ":5:7: log takes true, false or a directory, not an integer");
    EXPECT_EQ(saidOf(partition + "log = ['/']\n"), ":5:7: log takes true, false or a directory, not a list");
}

TEST_F(ServePlanning, AnEmptyListIsNotTheDefault)
{
    EXPECT_EQ(saidOf("plain = true\nlisten = []\n"), ":2:10: listen: the list is empty; leave the key out");
    EXPECT_EQ(planOf("plain = true\npeer-name = []\n").server.pins.names.size(), 0U); // which is the default
}

TEST_F(ServePlanning, AWrongTextIsShownOnOneLine)
{
    EXPECT_EQ(saidOf("plain = true\nterm = \"a\\nb\\u001b\"\n"),
              ":2:8: term: \"a\\x0ab\\x1b\" is not a terminal type, such as vt220");
    EXPECT_EQ(saidOf("plain = true\nterm = \"vt220\\u0000x\"\n"), ":2:8: term: has a null character");
    EXPECT_EQ(saidOf("plain = true\n[partition.a]\nid = 1\nline = \"cat\\u0000x\"\n"),
              ":4:8: line: has a null character");
}

TEST_F(ServePlanning, TakesTheIdleTimeoutAndTheMutedBroadcasts)
{
    const ServePlan plain = plan({"--plain"});
    EXPECT_EQ(plain.server.idleTimeout.count(), 0);
    EXPECT_FALSE(plain.policy.mutesBroadcasts);
    const ServePlan made = planOf("plain = true\nidle-timeout = 86400\nno-broadcasts = true\n");
    EXPECT_EQ(made.server.idleTimeout, std::chrono::hours(24));
    EXPECT_TRUE(made.policy.mutesBroadcasts);
    EXPECT_EQ(said({"--plain", "--idle-timeout", "86401"}),
              "--idle-timeout: \"86401\" is not an integer in [0, 86400]");
}

TEST_F(ServePlanning, ALineThatIsNoneIsRefused)
{
    EXPECT_THAT(saidOf("plain = true\n[partition.web]\nid = 1\nline = 'tcp:nowhere'\n"),
                StartsWith(":4:8: line \"tcp:nowhere\": "));
    EXPECT_THAT(said({"--plain", "--partition", "1=tcp:nowhere"}), StartsWith("--partition: line \"tcp:nowhere\": "));
    EXPECT_EQ(said({"--plain", "--partition", "1=unix:/run/x"}), "no error");
}

TEST_F(ServePlanning, APartitionOfBothIsRefused)
{
    EXPECT_EQ(saidOf("plain = true\n[partition.web]\nid = 1\nline = 'cat'\n", {"--partition", "1=cat"}),
              ":2:12: partition 1 is given by --partition too");
}

TEST_F(ServePlanning, TakesTwoHundredAndFiftyFivePartitionsAndRefusesMore)
{
    std::string toml = "plain = true\n";
    for (int id = 1; id <= 255; ++id)
        toml += "[partition.p" + std::to_string(id) + "]\nid = " + std::to_string(id) + "\nline = 'cat'\n";
    EXPECT_EQ(planOf(toml).partitions.size(), 255U);
    EXPECT_EQ(saidOf(toml, {"--partition", "256=cat"}), "more than 255 partitions");
}

TEST_F(ServePlanning, RulesNeedCertificates)
{
    EXPECT_EQ(saidOf("plain = true\n[[rule]]\nname = 'a'\nmay = 'type'\n"),
              "rules and access need certificates, and --plain has none");
    EXPECT_EQ(planOf("credentials = 'x'\nname = 'y'\n[[rule]]\nname = 'a'\nmay = 'type'\n").policy.rules.size(), 1U);
}

TEST_F(ServePlanning, WhatIsPrintedIsAFileThatSaysTheSame)
{
    const std::string toml = "listen = ['127.0.0.1:1', '[::1]:2']\nplain = true\nframe-timeout = 2.5\n"
                             "system-serial = '0000007'\nterm = 'xterm'\n[partition.web]\nid = 2\nline = 'cat \"x\"'\n";
    const ServePlan made = planOf(toml, {"--partition", "7=echo", "--max-consoles=5"});
    std::ostringstream first;
    printPlan(first, made);
    EXPECT_THAT(first.str(), StartsWith("listen = [\"127.0.0.1:1\", \"[::1]:2\"]  # " + file() + ":1\n"));
    EXPECT_THAT(first.str(), HasSubstr("\n# credentials: not set\n"));
    EXPECT_THAT(first.str(),
                HasSubstr("\n[partition.p7]  # option\nid = 7         # option\nline = \"echo\"  # option\n"));
    const ServePlan again = planOf(first.str());
    EXPECT_EQ(again.server.listen, made.server.listen);
    EXPECT_EQ(again.server.maxConsoles, 5);
    EXPECT_EQ(again.server.frameTimeout, made.server.frameTimeout);
    EXPECT_EQ(again.machine.serialNumber, "0000007");
    EXPECT_EQ(again.partitions.at(2).line, "cat \"x\"");
    EXPECT_EQ(again.partitions.at(7).line, "echo");
    for (std::size_t i = 0; i < made.settings.size(); ++i)
        EXPECT_EQ(again.settings.at(i).value, made.settings[i].value) << made.settings[i].key;
}

TEST_F(ServePlanning, APlanIsMadeAgainFromTheFileAsItIsThen)
{
    const Variable variable("QEL_TERM", "vt100");
    const ServePlan made = planOf("plain = true\nmax-consoles = 3\n",
                                  {"--partition", "1=echo --x", "--partition", "2=a=b", "--keepalive", "9"});
    write("plain = true\nmax-consoles = 4\n[partition.web]\nid = 3\nline = 'cat'\n");
    const ServePlan again = tool::planAgain(made.words);
    EXPECT_EQ(again.server.maxConsoles, 4);
    EXPECT_EQ(again.server.keepAlive.count(), 9);
    EXPECT_EQ(again.term, "vt100");
    EXPECT_EQ(again.file, file());
    ASSERT_EQ(again.partitions.size(), 3U);
    EXPECT_EQ(again.partitions.at(1).line, "echo --x");
    EXPECT_EQ(again.partitions.at(2).line, "a=b");
    write("max-consoles = 0");
    EXPECT_THROW(tool::planAgain(made.words), tool::CommandFailure);
}

TEST(OptionSources, QuotesTextsAsTomlDoes)
{
    const std::string text = "a \"b\" \\ \t\x7F\xC3\xA4\n";
    const std::string toml = tool::tomlQuoted(text);
    EXPECT_EQ(toml, "\"a \\\"b\\\" \\\\ \\u0009\\u007F\xC3\xA4\\u000A\"");
    EXPECT_EQ(tool::parseToml("a = " + toml, "f").find("a")->value.text, text);
}

TEST(OptionSources, NamesTheVariableOfAKey) { EXPECT_EQ(tool::variableOf("max-consoles"), "QEL_MAX_CONSOLES"); }

} // namespace

} // namespace qel::test
