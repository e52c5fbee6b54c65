// "qel serve --config": rules over TLS, and what it says without serving.

#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/Utilities.hpp>

#include "integration/TlsConsole.hpp"
#include "integration/TlsTest.hpp"
#include "support/ComesTrue.hpp"
#include "support/TemporaryDirectory.hpp"

#include <chrono>
#include <csignal>
#include <gmock/gmock.h>
#include <regex>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::StartsWith;

/// The certificate of the test's console has the common name "client".
class ServeConfigured : public Tls {
protected:
    std::string file() const { return directory.file("serve.toml"); }

    void write(const std::string& toml) const { Utilities::writeFile(file(), toml); }

    std::unique_ptr<ServeProcess> serveWith(const std::string& toml, const Arguments& more = {}) const
    {
        write(toml);
        return serve(Arguments{"--config", file()} + more);
    }

    /// What the client's `qel console` says about a partition.
    std::string opening(const ServeProcess& server, const Arguments& words) const
    {
        return console(server, "", words).errors;
    }
};

const std::string kPartitions =
    "[partition.web]\nid = 1\nline = 'echo hello; cat'\n[partition.db]\nid = 2\nline = 'cat'\n";

TEST_F(ServeConfigured, ServesThePartitionsOfTheFile)
{
    const auto server = serveWith(kPartitions);
    const auto result = console(*server, "", {"1"});
    EXPECT_THAT(result.output, HasSubstr("hello"));
    server->stop();
}

TEST_F(ServeConfigured, SaysThatAnyCertificateOfTheRootMayDoAnything)
{
    const std::string note = "(I): [qel] any certificate of the root may do anything: there are no rules, and no "
                             "--peer-name\n";
    EXPECT_THAT(serve()->stop().errors, HasSubstr(note));
    EXPECT_THAT(serve({"--peer-name", "client"})->stop().errors, Not(HasSubstr(note)));
    EXPECT_THAT(serveWith("[[rule]]\nname = '*'\nmay = 'type'\n")->stop().errors, Not(HasSubstr(note)));
}

TEST_F(ServeConfigured, ACertificateWithoutARuleIsTurnedAway)
{
    const auto server = serveWith(kPartitions + "[[rule]]\nname = 'somebody else'\nmay = 'type'\n");
    const auto result = call(*server);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.errors, HasSubstr("its rules do not let this certificate in"));
    EXPECT_THAT(result.errors, HasSubstr("0x00000012 (QelMessageStatusTooManyConnections)"));
    EXPECT_THAT(server->stop().errors,
                AllOf(HasSubstr("audit: refused console=1 name=\"client\" fingerprint="),
                      HasSubstr(" status=18 why=QelMessageStatusTooManyConnections by=rules\n")));
}

TEST_F(ServeConfigured, AForbiddenPartitionDoesNotExist)
{
    const auto server = serveWith(kPartitions + "[[rule]]\nname = 'client'\nmay = 'type'\npartitions = 'web'\n");
    EXPECT_THAT(opening(*server, {"2"}), HasSubstr("0x00000015 (QelMessageStatusInvalidLparId)"));
    EXPECT_THAT(console(*server, "", {"1"}).output, HasSubstr("hello"));
    EXPECT_THAT(server->stop().errors, HasSubstr(" status=21 why=QelMessageStatusInvalidLparId by=rules\n"));
}

TEST_F(ServeConfigured, WhoMayOnlyWatchIsToldSo)
{
    const auto server = serveWith(kPartitions + "[[rule]]\nname = 'client'\nmay = 'watch'\n");
    EXPECT_THAT(opening(*server, {"1"}),
                HasSubstr("the rules of the server do not let this console type in partition 1"));
    server->stop();
}

TEST_F(ServeConfigured, WhoMayNotForceBroadcastOrSetIsToldSo)
{
    const auto server = serveWith(kPartitions + "[[rule]]\nname = 'client'\nmay = 'type'\n");
    EXPECT_THAT(opening(*server, {"--force", "1"}),
                HasSubstr("the rules of the server do not let this console type in partition 1, or take it by force"));
    for (const Arguments& words : {Arguments{"broadcast", "hello"}, Arguments{"set-metadata", "x"}}) {
        SCOPED_TRACE(words.front());
        const auto result =
            runQel(Arguments{"call", "--connect", server->endpoint()} + directory.options("client") + words);
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_THAT(result.errors, HasSubstr("the rules of the server do not let this console"));
    }
    server->stop();
}

TEST_F(ServeConfigured, OneCertificateCannotTakeAllPlaces)
{
    const auto server = serveWith(kPartitions, {"--max-consoles-per-certificate", "1"});
    TlsConsole first(server->endpoint());
    first.ask();
    first.takeAnswer();
    first.startTls(Authority::trusted().clientCredentials());
    first.messages().send(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 0, "first"));
    EXPECT_EQ(first.messages().receive()->getStatus(), QelMessageStatusNoError);
    EXPECT_THAT(call(*server).errors, HasSubstr("QelMessageStatusTooManyConnections"));
    EXPECT_EQ(call(*server, {}, "server").exitStatus, 0); // another certificate
    EXPECT_THAT(server->stop().errors, HasSubstr(" by=max-consoles-per-certificate\n"));
}

TEST_F(ServeConfigured, LogsWhoDidWhat)
{
    const auto server = serveWith(kPartitions);
    console(*server, "", {"1"});
    call(*server);
    const std::string log = server->stop().errors;
    const std::string who = " console=1 name=\"client\" fingerprint=[0-9A-F:]{95} address=127\\.0\\.0\\.1:[0-9]+";
    for (const std::string& event : {"connected" + who + " tool=1,\"qel-[0-9]+\"",
                                     "opened" + who + " partition=1 connection=0", "left" + who + " why=closed"}) {
        SCOPED_TRACE(event);
        EXPECT_TRUE(std::regex_search(log, std::regex("\\(I\\): \\[qel\\] audit: " + event + "\n"))) << log;
    }
}

TEST_F(ServeConfigured, SighupReadsTheRulesAgain)
{
    const auto server = serveWith(kPartitions);
    EXPECT_EQ(call(*server).exitStatus, 0);
    write(kPartitions + "[[rule]]\nname = 'nobody'\nmay = 'type'\n");
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: read " + file() + ": 2 partitions, 1 rule, 0 sessions ended\n");
    EXPECT_EQ(call(*server).exitStatus, 1);
    server->stop();
}

/// A console with an open session on connection 0 of partition 1, by the certificate "client".
class HoldingConsole {
public:
    explicit HoldingConsole(const ServeProcess& server, std::uint16_t connection = 0) : mConsole(server.endpoint())
    {
        mConsole.comeIn("holder");
        pGrant(QelMessageInterfaceCmpOpenKrogSessionReq());
        pGrant(QelMessageVirtualSerialOpenReq(1, connection, false));
        pGrant(QelMessageVirtualSerialSetupSessionReq(1, connection));
    }

    /// The status of a request; data and notices before its response are dropped.
    unsigned int statusOf(const QelMessage& request)
    {
        mConsole.messages().send(request);
        for (;;) {
            const auto message = mConsole.messages().receive();
            if (message->getClassification() == QelMessageClassification::Response) return message->getStatus();
        }
    }

    /// Waits for the session-closed notice. @return its reason
    unsigned int awaitClosed()
    {
        for (;;) {
            const auto message = mConsole.messages().receive();
            const auto* closed = dynamic_cast<const QelMessageVirtualSerialSessionClosedAsync*>(message.get());
            if (closed != nullptr) return closed->getCloseReason();
        }
    }

private:
    void pGrant(const QelMessage& request) { EXPECT_EQ(statusOf(request), 0U) << request.getLogID(); }

    TlsConsole mConsole;
};

TEST_F(ServeConfigured, SighupEndsTheSessionsThatTheRulesForbidAndNoOthers)
{
    const auto server = serveWith(kPartitions);
    HoldingConsole typing(*server);
    write(kPartitions + "[[rule]]\nname = 'client'\nmay = 'type'\n");
    server->process().signal(SIGHUP);
    server->process().awaitErrors(": 2 partitions, 1 rule, 0 sessions ended\n");
    EXPECT_EQ(typing.statusOf(QelMessageVirtualSerialCloseReq(1, 0, false)), 0U); // it was still open
    EXPECT_EQ(typing.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 0U);
    write(kPartitions + "[[rule]]\nname = 'client'\nmay = 'watch'\n");
    server->process().signal(SIGHUP);
    EXPECT_EQ(typing.awaitClosed(), 2U);
    server->process().awaitErrors("partition 1: the session on connection 0 is ended, the rules do not allow it any "
                                  "more\n");
    server->process().awaitErrors(": 2 partitions, 1 rule, 1 session ended\n");
    EXPECT_EQ(typing.statusOf(QelMessageVirtualSerialOpenReq(1, 1, false)), 0U);
    server->stop();
}

TEST_F(ServeConfigured, SighupOpensAndClosesTheLogOfALine)
{
    const TemporaryDirectory logs;
    const std::string partition = "[partition.web]\nid = 1\nline = 'echo hello; cat'\n";
    const auto server = serveWith(partition);
    HoldingConsole holder(*server);
    write(partition + "log = '" + logs.path() + "'\n");
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: read ");
    EXPECT_THAT(Utilities::readFile(logs.file("web.log")), HasSubstr(" [qel: the log begins]\n"));
    write(partition + "[partition.new]\nid = 2\nline = 'cat'\n"); // whose line in the log is awaited
    server->process().signal(SIGHUP);
    server->process().awaitErrors("partition 2: added\n");
    EXPECT_TRUE(comesTrue(
        [&] { return Utilities::readFile(logs.file("web.log")).find(" [qel: the log ends]\n") != std::string::npos; }));
    EXPECT_EQ(holder.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 19U); // its session goes on
    server->stop();
}

TEST_F(ServeConfigured, SighupTakesCredentialsWithAnotherName)
{
    directory.put("other", Authority::trusted().serverCredentials());
    const std::string common = "credentials = '" + directory.path() + "'\n";
    write(common + "name = 'server'\n");
    ServeProcess server({"--config", file()}, "127.0.0.1:0", {});
    write(common + "name = 'none'\n");
    server.process().signal(SIGHUP);
    server.process().awaitErrors("(E): [qel] SIGHUP: the credentials stay as they were: ");
    EXPECT_EQ(call(server).exitStatus, 0);
    write(common + "name = 'other'\nmax-consoles = 9\n");
    server.process().signal(SIGHUP);
    server.process().awaitErrors("SIGHUP: these need a restart: max-consoles\n");
    server.process().awaitErrors("SIGHUP: loaded " + directory.file("other.crt") + " for new connections\n");
    EXPECT_EQ(call(server).exitStatus, 0);
}

TEST_F(ServeConfigured, SighupMutesMessagesBetweenConsoles)
{
    const auto server = serveWith("no-broadcasts = false\n" + kPartitions);
    const auto broadcast = [&] {
        return runQel(Arguments{"call", "--connect", server->endpoint()} + directory.options("client") +
                      Arguments{"broadcast", "hello"});
    };
    EXPECT_EQ(broadcast().exitStatus, 0);
    write("no-broadcasts = true\n" + kPartitions);
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: loaded ");
    const auto muted = broadcast();
    EXPECT_EQ(muted.exitStatus, 1);
    EXPECT_THAT(muted.errors, HasSubstr("0x00000001 (QelMessageStatusInvalidOperation)"));
    EXPECT_THAT(server->stop().errors, AllOf(Not(HasSubstr("need a restart")), HasSubstr(" by=no-broadcasts\n")));
}

TEST_F(ServeConfigured, AConsoleThatSaysNothingIsLetGo)
{
    const auto server = serveWith("idle-timeout = 1\n" + kPartitions);
    HoldingConsole holder(*server);
    EXPECT_EQ(holder.awaitClosed(), 2U);
    server->process().awaitErrors("console 1: let go, nothing has come from this console for 1 s\n");
    server->process().awaitErrors(" why=idle\n");
    server->stop();
}

TEST_F(ServeConfigured, SighupAddsAndRemovesPartitionsAndLeavesTheOthersAlone)
{
    const std::string kept = "[partition.web]\nid = 1\nline = 'cat'\n";
    const auto server = serveWith(kept + "[partition.old]\nid = 2\nline = 'cat'\n");
    HoldingConsole holder(*server);
    write(kept + "description = 'renamed'\n[partition.new]\nid = 3\nline = 'cat'\n");
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: read " + file() + ": 2 partitions, 0 rules, 0 sessions ended\n");
    EXPECT_EQ(holder.statusOf(QelMessageVirtualSerialOpenReq(2, 0, false)), 21U);
    EXPECT_EQ(holder.statusOf(QelMessageVirtualSerialOpenReq(3, 0, false)), 0U);
    EXPECT_EQ(holder.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 19U); // its own session is still there
    server->stop();
}

TEST_F(ServeConfigured, SighupReplacesAPartitionWhoseLineHasChanged)
{
    const auto server = serveWith("[partition.web]\nid = 1\nline = 'cat'\n");
    HoldingConsole holder(*server);
    write("[partition.web]\nid = 1\nline = 'echo new; cat'\n");
    server->process().signal(SIGHUP);
    EXPECT_EQ(holder.awaitClosed(), 3U);
    server->process().awaitErrors("partition 1: added\n");
    EXPECT_THAT(console(*server, "", {"1"}).output, HasSubstr("new"));
    server->stop();
}

TEST_F(ServeConfigured, AWrongFileChangesNothingAtSighup)
{
    const auto server = serveWith(kPartitions + "[[rule]]\nname = 'client'\nmay = 'type'\n");
    write("[[rule]]\nname = 'nobody'\nmay = 'type'\nmax-consols = 3\n");
    server->process().signal(SIGHUP);
    server->process().awaitErrors("(E): [qel] SIGHUP: the configuration stays as it was: " + file() +
                                  ":4:1: unknown key \"max-consols\"");
    server->process().awaitErrors("SIGHUP: loaded ");
    EXPECT_EQ(call(*server).exitStatus, 0);
    server->stop();
}

TEST_F(ServeConfigured, SaysAtSighupWhatNeedsARestart)
{
    const auto server = serveWith("max-consoles = 3\n");
    write("max-consoles = 4\nterm = 'xterm'\n");
    server->process().signal(SIGHUP);
    server->process().awaitErrors("(W): [qel] SIGHUP: these need a restart: term, max-consoles\n");
    server->stop();
}

TEST_F(ServeConfigured, ChecksWithoutServing)
{
    write("name = 'server'\ncredentials = '" + directory.path() + "'\n" + kPartitions);
    const auto fine = runQel({"serve", "--config", file(), "--check-config"});
    EXPECT_EQ(fine.exitStatus, 0) << fine.errors;
    EXPECT_EQ(fine.output,
              file() + " is fine: 2 partitions, no rules: every certificate of the root may do anything\n");
    write("name = 'nobody'\ncredentials = '" + directory.path() + "'\n");
    const auto wrong = runQel({"serve", "--config", file(), "--check-config"});
    EXPECT_EQ(wrong.exitStatus, 2);
    EXPECT_THAT(wrong.errors, StartsWith("qel: cannot open " + directory.file("nobody.crt")));
}

TEST_F(ServeConfigured, PrintsTheConfigurationWithoutServing)
{
    write("name = 'server'\ncredentials = '" + directory.path() + "'\n");
    const auto result = runQel({"serve", "--config", file(), "--print-config"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_THAT(result.output, HasSubstr("# " + file() + ":1\n"));
}

// Certificates that expire soon, and clients without pins.

SSLCredentials credentialsFor(const SSLCertificateRequest& request, std::chrono::hours left)
{
    const auto now = SSLValidityPeriod::Clock::now();
    const SSLValidityPeriod validity(now - std::chrono::hours(24), now + left);
    return Authority::trusted().credentialsOf(Authority::trusted().issue(request, validity));
}

TEST_F(ServeConfigured, WarnsOfAnOwnCertificateThatExpiresSoon)
{
    constexpr std::chrono::hours kTenDays{10 * 24 + 12};
    directory.put("soon", credentialsFor(Authority::trusted().serverRequest(), kTenDays));
    const std::string note = "(W): [qel] own certificate " + directory.file("soon.crt") + " expires at " +
                             endOf("soon.crt") + ", in 10 days";
    const auto server = serve({}, "soon");
    server->process().awaitErrors(note);
    server->process().signal(SIGALRM); // as once a day
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: loaded ");
    EXPECT_THAT(server->stop().errors, MatchesRegex("(.|\n)*expires at(.|\n)*expires at(.|\n)*"));
    EXPECT_THAT(serve({"--warn-expiry", "9"}, "soon")->stop().errors, Not(HasSubstr("expires at")));
}

TEST_F(ServeConfigured, AClientSaysThatItsCertificateExpiresSoon)
{
    const auto server = serve();
    directory.put("soon", credentialsFor(Authority::trusted().clientRequest(), std::chrono::hours(36)));
    const auto result = call(*server, {"--peer-name", "server"}, "soon");
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.errors, "qel: note: own certificate " + directory.file("soon.crt") + " expires at " +
                                 endOf("soon.crt") + ", in 1 day: replace it\n");
    server->stop();
}

TEST_F(ServeConfigured, AClientWithoutAPinSaysSoOnce)
{
    const auto server = serve();
    const Arguments common = Arguments{"--connect", server->endpoint()} + directory.options("client");
    for (const Arguments& words : {Arguments{"call"} + common + Arguments{"time"},
                                   Arguments{"bench"} + common + Arguments{"--count", "1", "--connections", "2"}}) {
        SCOPED_TRACE(words.front());
        const auto result = runQel(words);
        EXPECT_EQ(result.exitStatus, 0) << result.errors;
        EXPECT_EQ(result.errors, pinNote());
    }
    EXPECT_EQ(runQel(Arguments{"call", "--peer-name", "server"} + common + Arguments{"time"}).errors, "");
    server->stop();
}

} // namespace

} // namespace qel::test
