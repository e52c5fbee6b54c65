// Both ends of the program over TLS, and everything that comes before it.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "certificates/CertificateView.hpp"
#include "integration/TestConsole.hpp"
#include "integration/TlsConsole.hpp"
#include "integration/WrongServer.hpp"
#include "support/CredentialDirectory.hpp"
#include "support/RawTlsPeer.hpp"

#include <atomic>
#include <cctype>
#include <csignal>
#include <functional>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <thread>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

using Arguments = std::vector<std::string>;

constexpr unsigned int kUpgrade = QelMessageOpUpgradeConnection;
constexpr unsigned int kAbort = QelMessageOpAbortHandshake;

Arguments operator+(Arguments left, const Arguments& right)
{
    left.insert(left.end(), right.begin(), right.end());
    return left;
}

/// The bytes of a frame.
std::string frameOf(const QelMessage& message) { return std::string(message.serialize(), message.msgLength()); }

SSLCredentials strangerThatTrustsUs()
{
    SSLCredentials credentials = Authority::stranger().clientCredentials();
    credentials.mRootCA = Authority::trusted().root().getPEM();
    return credentials;
}

/// Credentials in a directory, and the program with them.
class Tls : public ::testing::Test {
protected:
    std::unique_ptr<ServeProcess> serve(const Arguments& options = {}, const std::string& name = "server") const
    {
        return std::make_unique<ServeProcess>(options, "127.0.0.1:0", directory.options(name));
    }

    Process::Result call(const ServeProcess& server, const Arguments& more = {}, const std::string& name = "client",
                         const std::string& request = "limits") const
    {
        return callTo(server.endpoint(), more, name, request);
    }

    Process::Result callTo(const std::string& endpoint, const Arguments& more = {}, const std::string& name = "client",
                           const std::string& request = "limits") const
    {
        return runQel(Arguments{"call", "--connect", endpoint} + directory.options(name) + more + Arguments{request});
    }

    Process::Result console(const ServeProcess& server, const std::string& input, const Arguments& more) const
    {
        return run(
            qelCommand(Arguments{"console", "--connect", server.endpoint()} + directory.options("client") + more),
            input);
    }

    static std::string prefix(const std::string& endpoint)
    {
        return "qel: no protected connection to " + endpoint + ": ";
    }

    CredentialDirectory directory;
};

// What works.

TEST_F(Tls, CallAsksOverTls)
{
    const auto server = serve();
    const auto result = call(*server);
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_THAT(result.output, HasSubstr("16384"));
    EXPECT_EQ(result.errors, "");
    EXPECT_THAT(server->stop().errors, AllOf(HasSubstr("(I): SSLStream protocol init complete: TLSv1.3 "),
                                             HasSubstr(": over TLS: \"CN=client\", SHA-256 " +
                                                       tool::fingerprintOf(Authority::trusted().client()) + "\n")));
}

TEST_F(Tls, TheCredentialsMayLieInThreeFiles)
{
    const Arguments files{"--cert", directory.file("server.crt"), "--key", directory.file("server.key"),
                          "--root", directory.file("root.crt")};
    ServeProcess server({}, "127.0.0.1:0", files);
    const auto result = runQel({"call", "--connect", server.endpoint(), "--cert", directory.file("client.crt"), "--key",
                                directory.file("client.key"), "--root", directory.file("root.crt"), "time"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    server.stop();
}

TEST_F(Tls, TheConsoleReachesAPartition)
{
    const auto server = serve({"--partition", "1=PS1='$ ' exec /bin/sh"});
    const auto result = console(*server, "echo $((6 * 7)) is it\n", {"1"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_THAT(result.output, HasSubstr("42 is it\r\n"));
    server->stop();
}

TEST_F(Tls, NothingOfALongOutputIsLostOrLeftWaiting)
{
    const auto server = serve({"--partition", "1=stty raw -echo; seq 1 200000"});
    std::string expected;
    for (int i = 1; i <= 200000; ++i)
        expected += std::to_string(i) + "\n";
    const auto result = console(*server, "", {"--no-eof", "1"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_TRUE(result.output == expected); // too long to be printed
    server->stop();
}

TEST_F(Tls, NothingOfALongInputIsLost)
{
    const auto server = serve({"--partition", "1=stty raw -echo; echo go; head -c 1000000"});
    std::string input;
    for (int i = 0; input.size() < 1000000; ++i)
        input += std::to_string(i) + " ";
    input.resize(1000000);
    Process process(qelCommand(Arguments{"console", "--connect", server->endpoint()} + directory.options("client") +
                               Arguments{"1"}));
    process.awaitOutput("go\n");
    process.writeInput(input);
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_TRUE(result.output == "go\n" + input); // too long to be printed
    server->stop();
}

TEST_F(Tls, CallsInARowAreNotInEachOthersWay)
{
    const auto server = serve({"--max-consoles", "1", "--log-level", "warn"});
    for (int i = 0; i < 10; ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(call(*server, {"--tool-id", "always the same"}).exitStatus, 0);
    }
    server->stop();
}

TEST_F(Tls, WhenTheServerStopsTheConsoleIsTold)
{
    const auto server = serve({"--partition", "1=echo ready; cat"});
    Process process(qelCommand(Arguments{"console", "--connect", server->endpoint()} + directory.options("client") +
                               Arguments{"1"}));
    process.awaitOutput("ready");
    server->stop();
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.errors, HasSubstr("shutdown"));
}

TEST_F(Tls, AServerThatIsKilledEndsTheConsole)
{
    const auto server = serve({"--partition", "1=stty raw -echo; echo ready; cat"});
    Process process(qelCommand(Arguments{"console", "--connect", server->endpoint()} + directory.options("client") +
                               Arguments{"1"}));
    process.awaitOutput("ready\n");
    server->process().signal(SIGKILL);
    process.writeInput(std::string(100000, 'x'));
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.errors, StartsWith("qel: connection lost: "));
}

// Certificates that are refused.

TEST_F(Tls, AServerOfAnotherRootIsRefused)
{
    const auto server = serve();
    directory.put("stranger", Authority::stranger().clientCredentials());
    Utilities::writeFile(directory.file("other-root.crt"), Authority::stranger().root().getPEM());
    const auto result =
        runQel({"call", "--connect", server->endpoint(), "--cert", directory.file("stranger.crt"), "--key",
                directory.file("stranger.key"), "--root", directory.file("other-root.crt"), "time"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.errors,
                AllOf(StartsWith(prefix(server->endpoint()) + "the other end has no valid certificate of our root: "),
                      EndsWith("certificate in certificate chain\n"))); // versions spell "self-signed" differently
    EXPECT_THAT(server->stop().errors,
                HasSubstr(": not let in: the other end ended the connection in the TLS handshake, perhaps because it "
                          "does not accept this end's certificate: EOF\n"));
}

TEST_F(Tls, AClientOfAnotherRootIsRefused)
{
    const auto server = serve();
    directory.put("stranger", strangerThatTrustsUs());
    const auto result = call(*server, {}, "stranger");
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.errors,
                StartsWith(prefix(server->endpoint()) + "the other end ended the connection in the TLS handshake, "
                                                        "perhaps because it does not accept this end's certificate: "));
    EXPECT_EQ(result.output, "");
    EXPECT_EQ(call(*server).exitStatus, 0);
    EXPECT_THAT(server->stop().errors,
                AllOf(HasSubstr("(E): SSL peer certificate verification failed: unable to get local issuer "
                                "certificate\n"),
                      HasSubstr(": not let in: the other end has no valid certificate of our root: unable to get local "
                                "issuer certificate\n"),
                      Not(HasSubstr("console 2 connected"))));
}

TEST_F(Tls, AnExpiredServerIsRefused)
{
    directory.put("old", expiredCredentials(Authority::trusted().serverRequest()));
    const auto server = serve({}, "old");
    const auto result = call(*server);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors, prefix(server->endpoint()) +
                                 "the other end has no valid certificate of our root: certificate has expired\n");
    server->stop();
}

TEST_F(Tls, AnExpiredClientIsRefused)
{
    const auto server = serve();
    directory.put("old", expiredCredentials(Authority::trusted().clientRequest()));
    EXPECT_EQ(call(*server, {}, "old").exitStatus, 7);
    EXPECT_THAT(
        server->stop().errors,
        HasSubstr(": not let in: the other end has no valid certificate of our root: certificate has expired\n"));
}

TEST_F(Tls, AClientThatIsNotYetValidIsRefused)
{
    const auto server = serve();
    directory.put("young", futureCredentials(Authority::trusted().clientRequest()));
    EXPECT_EQ(call(*server, {}, "young").exitStatus, 7);
    EXPECT_THAT(server->stop().errors, HasSubstr("certificate is not yet valid\n"));
}

TEST_F(Tls, WithoutACertificateThereIsNoWayIn)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.ask();
    ASSERT_EQ(console.takeAnswer(), kUpgrade);
    RawTlsPeer nobody(RawTlsPeer::Client, {}, console.takeStream());
    nobody.handshake(); // from which it cannot tell
    EXPECT_EQ(nobody.read(1), "");
    EXPECT_THAT(server->stop().errors, AllOf(HasSubstr("peer did not return a certificate"),
                                             HasSubstr(": not let in: the TLS handshake failed: SSL error 1\n")));
}

TEST_F(Tls, OlderTlsIsNoWayIn)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.ask();
    ASSERT_EQ(console.takeAnswer(), kUpgrade);
    const SSLCredentials credentials = Authority::trusted().clientCredentials();
    RawTlsPeer::Options options;
    options.credentials = &credentials;
    options.minimumVersion = options.maximumVersion = TLS1_2_VERSION;
    RawTlsPeer old(RawTlsPeer::Client, options, console.takeStream());
    EXPECT_FALSE(old.handshake());
    EXPECT_THAT(server->stop().errors, HasSubstr(": not let in: the TLS handshake failed: SSL error 1\n"));
}

// Credentials that cannot be used.

TEST_F(Tls, AKeyThatOthersMayReadIsRefusedUnlessItIsSaid)
{
    const auto server = serve();
    ASSERT_EQ(::chmod(directory.file("client.key").c_str(), 0644), 0);
    const auto refused = call(*server);
    EXPECT_EQ(refused.exitStatus, 1);
    EXPECT_THAT(refused.errors, StartsWith("qel: others may read or write the private key " +
                                           directory.file("client.key") + " (mode 0644)"));
    EXPECT_EQ(call(*server, {"--insecure-permissions"}).exitStatus, 0);
    server->stop();

    ASSERT_EQ(::chmod(directory.file("server.key").c_str(), 0644), 0);
    const auto serving = runQel(Arguments{"serve"} + directory.options("server"));
    EXPECT_EQ(serving.exitStatus, 1);
    EXPECT_EQ(serving.output, "") << "it listened";
    EXPECT_THAT(serving.errors, HasSubstr("(mode 0644)"));
    serve({"--insecure-permissions"})->stop();
}

TEST_F(Tls, CredentialsThatAreNotThereAreAFailureOfThisMachine)
{
    const auto result = callTo("127.0.0.1:1", {}, "nobody");
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_THAT(result.errors, StartsWith("qel: cannot open " + directory.file("nobody.crt")));
    EXPECT_EQ(runQel(Arguments{"serve"} + directory.options("nobody")).exitStatus, 4);
}

TEST_F(Tls, ACertificateWithTheKeyOfAnotherIsRefused)
{
    Utilities::writeFile(directory.file("client.crt"), Authority::trusted().server().getPEM());
    const auto result = callTo("127.0.0.1:1");
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.errors, HasSubstr("cannot be used: they do not belong together"));
}

// Plain meets TLS.

TEST_F(Tls, APlainConsoleIsToldThatTheServerWantsTls)
{
    const auto server = serve();
    const auto result = server->call({"limits"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              "qel: the server refused the connection: it accepts only TLS; give credentials instead of --plain\n");
    EXPECT_THAT(server->stop().errors,
                AllOf(HasSubstr(": not let in: the other end did not ask for TLS but sent something else: [CID: "),
                      Not(HasSubstr("console 1 connected"))));
}

TEST_F(Tls, AConsoleThatWantsTlsIsToldThatTheServerIsPlain)
{
    ServeProcess server;
    const auto result = call(server);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors, prefix(server.endpoint()) +
                                 "the hypervisor end turned this console away: it takes no more "
                                 "consoles, is about to stop, or does without TLS\n");
    EXPECT_THAT(server.stop().errors,
                HasSubstr("(W): [qel] console 1: closed, it asked for TLS, which is not done here\n"));
}

TEST_F(Tls, TlsInsideTlsIsNotToBeHad)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.comeIn("a");
    console.messages().send(QelMessageUpgradeConnectionAsync());
    EXPECT_EQ(console.messages().receive()->getOperation(), kAbort);
    EXPECT_TRUE(console.isClosed());
    server->stop();
}

// Consoles that go astray before TLS.

TEST_F(Tls, MessagesInTheClearInsteadOfTlsAreNotUsed)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.ask();
    ASSERT_EQ(console.takeAnswer(), kUpgrade);
    console.sendBytes(frameOf(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 0, "a")));
    EXPECT_TRUE(console.isClosed());
    EXPECT_THAT(server->stop().errors, AllOf(HasSubstr(": not let in: the TLS handshake failed: SSL error 1\n"),
                                             Not(HasSubstr("console 1 connected"))));
}

TEST_F(Tls, MessagesBehindTheRequestForTlsAreNotUsed)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.sendBytes(frameOf(QelMessageUpgradeConnectionAsync()) +
                      frameOf(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 0, "a")));
    server->process().awaitErrors(": not let in: the other end did not wait for its turn in the handshake\n");
    EXPECT_THAT(server->stop().errors, Not(HasSubstr("console 1 connected")));
}

TEST_F(Tls, TlsThatBeginsWithoutAskingIsRefused)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    EXPECT_THROW(console.startTls(Authority::trusted().clientCredentials()), StreamIOException);
    EXPECT_THAT(server->stop().errors, HasSubstr(": not let in: the other end did not ask for TLS but sent something "
                                                 "else: Invalid length\n"));
}

class TlsDeadline : public Tls {
protected:
    /// @param seconds  enough for the steps that the console takes, on a machine that is busy; then the test waits for
    ///                 the rest of it
    std::unique_ptr<ServeProcess> impatient(const std::string& seconds) const
    {
        return serve({"--handshake-timeout", seconds, "--log-level", "warn"});
    }
};

TEST_F(TlsDeadline, EndsAConsoleThatIsSilent)
{
    const auto server = impatient("0.1");
    TlsConsole console(server->endpoint());
    EXPECT_TRUE(console.isClosed());
    EXPECT_THAT(server->stop().errors, HasSubstr(": not let in: the other end did not ask for TLS in time\n"));
}

TEST_F(TlsDeadline, EndsAConsoleThatAsksAndThenIsSilent)
{
    const auto server = impatient("1.5");
    TlsConsole console(server->endpoint());
    console.ask();
    EXPECT_EQ(console.takeAnswer(), kUpgrade);
    EXPECT_TRUE(console.isClosed());
    EXPECT_THAT(server->stop().errors, HasSubstr(": not let in: the TLS handshake was not done in time\n"));
}

TEST_F(TlsDeadline, EndsAConsoleThatIsSilentInsideTls)
{
    const auto server = impatient("2.5");
    TlsConsole console(server->endpoint());
    console.ask();
    ASSERT_EQ(console.takeAnswer(), kUpgrade);
    console.startTls(Authority::trusted().clientCredentials());
    EXPECT_TRUE(console.isClosed());
    EXPECT_THAT(server->stop().errors, HasSubstr("console 1: closed, it did not introduce itself in time\n"));
}

TEST_F(Tls, AConsoleThatStallsHoldsUpNobodyElse)
{
    const auto server = serve({"--max-consoles", "40", "--log-level", "warn"});
    std::vector<std::unique_ptr<TlsConsole>> stalled;
    for (int i = 0; i < 20; ++i) {
        stalled.push_back(std::make_unique<TlsConsole>(server->endpoint()));
        if (i % 2 == 0) continue; // silent from the beginning
        stalled.back()->ask();
        ASSERT_EQ(stalled.back()->takeAnswer(), kUpgrade);
    }
    std::vector<std::thread> calls;
    std::atomic<int> done{0};
    for (int i = 0; i < 10; ++i) {
        calls.emplace_back([&, i] {
            if (call(*server, {"--tool-id", std::to_string(i)}).exitStatus == 0) ++done;
        });
    }
    for (std::thread& one : calls)
        one.join();
    EXPECT_EQ(done, 10);

    // Neither do they hold up the end: those that have not asked are turned away, the others are cut.
    server->stop();
    for (std::size_t i = 0; i < stalled.size(); ++i) {
        if (i % 2 == 0) {
            EXPECT_EQ(stalled[i]->takeAnswer(), kAbort);
        }
        EXPECT_TRUE(stalled[i]->isClosed());
    }
}

TEST_F(Tls, WhenTheServerStopsConsolesOnTheirWayInAreTurnedAway)
{
    const auto server = serve({"--handshake-timeout", "1000"});
    TlsConsole silent(server->endpoint());
    TlsConsole stalled(server->endpoint());
    stalled.ask();
    ASSERT_EQ(stalled.takeAnswer(), kUpgrade);
    server->process().signal(SIGTERM);
    EXPECT_EQ(silent.takeAnswer(), kAbort);
    EXPECT_TRUE(silent.isClosed());
    EXPECT_TRUE(stalled.isClosed());
    EXPECT_THAT(server->stop().errors, HasSubstr(": not let in: the server stops\n"));
}

TEST_F(Tls, TooManyConsolesAreTurnedAwayBeforeTls)
{
    const auto server = serve({"--max-consoles", "1"});
    TlsConsole first(server->endpoint());
    first.comeIn("first");
    const auto result = call(*server);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors, prefix(server->endpoint()) +
                                 "the hypervisor end turned this console away: it takes no more "
                                 "consoles, is about to stop, or does without TLS\n");
    EXPECT_THAT(server->stop().errors, HasSubstr(": not let in: no more consoles are taken\n"));
}

// Servers that go astray before TLS.

struct WrongServerRow {
    const char* name;
    std::function<void(LoopbackMessages&)> behave;
    int exitStatus;
    std::string errors; // behind the endpoint
};

void PrintTo(const WrongServerRow& row, std::ostream* os) { *os << row.name; }

class TlsWrongServer : public Tls, public ::testing::WithParamInterface<WrongServerRow> {};

TEST_P(TlsWrongServer, HasItsExitStatusAndText)
{
    const WrongServer server(GetParam().behave);
    const auto result = callTo(server.endpoint(), {"--handshake-timeout", "2"});
    EXPECT_EQ(result.exitStatus, GetParam().exitStatus);
    EXPECT_EQ(result.errors, prefix(server.endpoint()) + GetParam().errors + "\n");
}

void stayUntilTheEnd(LoopbackMessages& messages)
{
    while (!messages.isClosed())
        continue;
}

const std::string kNoAnswer = "the other end did not answer the request for TLS ";

std::string nameOfRow(const ::testing::TestParamInfo<WrongServerRow>& info) { return info.param.name; }

INSTANTIATE_TEST_SUITE_P(
    Rows, TlsWrongServer,
    ::testing::Values(
        WrongServerRow{"Silent", stayUntilTheEnd, 6, kNoAnswer + "in time"},
        WrongServerRow{"Closes", [](LoopbackMessages& messages) { messages.receive(); }, 7,
                       kNoAnswer + "but ended the connection: EOF"},
        WrongServerRow{"AnswersHalf",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.sendBytes(frameOf(QelMessageUpgradeConnectionAsync()).substr(0, 20));
                       },
                       7, kNoAnswer + "but ended the connection: EOF"},
        WrongServerRow{"IsNoQelServer",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.sendBytes("HTTP/1.1 400 Bad Request\r\n\r\n");
                       },
                       5, kNoAnswer + "but sent something else: Invalid length"},
        WrongServerRow{"Aborts",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.send(QelMessageAbortHandshakeAsync());
                       },
                       1,
                       "the hypervisor end turned this console away: it takes no more consoles, is about to stop, or "
                       "does without TLS"},
        WrongServerRow{"SaysMoreThanTheAnswer",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.sendBytes(frameOf(QelMessageUpgradeConnectionAsync()) + "x");
                           stayUntilTheEnd(messages);
                       },
                       5, "the other end did not wait for its turn in the handshake"},
        WrongServerRow{"AnswersAndIsSilent",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.send(QelMessageUpgradeConnectionAsync());
                           stayUntilTheEnd(messages);
                       },
                       6, "the TLS handshake was not done in time"},
        WrongServerRow{"AnswersTlsInTheClear",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.send(QelMessageUpgradeConnectionAsync());
                           messages.isClosed(); // TLS has begun to come
                           messages.send(QelMessageGetQelTodReq());
                           stayUntilTheEnd(messages);
                       },
                       5, "the TLS handshake failed: SSL error 1"}),
    nameOfRow);

// Pins.

TEST_F(Tls, AServerMayBePinnedByNameAndByFingerprint)
{
    const auto server = serve({"--log-level", "warn"});
    const std::string fingerprint = tool::fingerprintOf(Authority::trusted().server());
    std::string bare;
    for (const char character : fingerprint) {
        if (character != ':') bare += static_cast<char>(std::tolower(static_cast<unsigned char>(character)));
    }
    for (const Arguments& pins : std::vector<Arguments>{{"--peer-name", "server"},
                                                        {"--peer-fingerprint", fingerprint},
                                                        {"--peer-fingerprint", bare},
                                                        {"--peer-name", "other", "--peer-name", "server"},
                                                        {"--peer-name", "server", "--peer-fingerprint", bare}}) {
        const auto result = call(*server, pins);
        EXPECT_EQ(result.exitStatus, 0) << result.errors;
    }
    const auto name = call(*server, {"--peer-name", "other"});
    EXPECT_EQ(name.exitStatus, 1);
    EXPECT_EQ(name.errors, prefix(server->endpoint()) + "the other end is not who it should be: the name \"server\" is "
                                                        "not what --peer-name says\n");
    bare.front() = bare.front() == '0' ? '1' : '0';
    const auto print = call(*server, {"--peer-fingerprint", bare});
    EXPECT_EQ(print.exitStatus, 1);
    EXPECT_EQ(print.errors, prefix(server->endpoint()) + "the other end is not who it should be: the fingerprint " +
                                fingerprint + " is not what --peer-fingerprint says\n");
    server->stop();
}

TEST_F(Tls, TheConsoleCommandLooksAtThePinsToo)
{
    const auto server = serve({"--partition", "1=cat"});
    const auto result = console(*server, "", {"--peer-name", "other", "1"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.errors, HasSubstr("is not what --peer-name says"));
    server->stop();
}

TEST_F(Tls, ConsolesMayBePinnedToo)
{
    const auto server = serve({"--peer-name", "client", "--peer-name", "operator", "--log-level", "warn"});
    EXPECT_EQ(call(*server).exitStatus, 0);
    // Any certificate of the root opens either role; here it does not.
    const auto result = call(*server, {}, "server");
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_EQ(result.output, "");
    EXPECT_THAT(result.errors, StartsWith("qel: the server closed the connection right after the TLS handshake; "
                                          "it may not accept this console's certificate: "));
    EXPECT_THAT(server->stop().errors, HasSubstr(": not let in: the other end is not who it should be: the name "
                                                 "\"server\" is not what --peer-name says\n"));
}

// New credentials.

TEST_F(Tls, SighupLoadsTheCredentialsForNewConnections)
{
    const auto server = serve({"--partition", "1=cat"});
    TlsConsole old(server->endpoint());
    old.comeIn("old");

    const Authority& authority = Authority::trusted();
    const SSLCertificate fresh = authority.issue(authority.serverRequest(), SSLValidityPeriod::days(1));
    const Arguments pin{"--peer-fingerprint", tool::fingerprintOf(fresh)};
    directory.put("server", authority.credentialsOf(fresh));
    EXPECT_EQ(call(*server, pin).exitStatus, 1) << "nobody has said so yet";
    server->process().signal(SIGHUP);
    server->process().awaitErrors("(I): [qel] SIGHUP: loaded " + directory.file("server.crt") +
                                  " for new connections\n");
    const auto result = call(*server, pin);
    EXPECT_EQ(result.exitStatus, 0) << result.errors;

    EXPECT_EQ(old.messages().ask(QelMessageGetQelTodReq())->getStatus(), 0U);
    EXPECT_EQ(tool::fingerprintOf(*old.tls().getPeerCertificate()), tool::fingerprintOf(authority.server()));
    server->stop();
}

TEST_F(Tls, CredentialsThatCannotBeLoadedLeaveTheOldOnes)
{
    const auto server = serve();
    TlsConsole old(server->endpoint());
    old.comeIn("old");
    const std::string line = "(E): [qel] SIGHUP: the credentials stay as they were: ";

    Utilities::writeFile(directory.file("server.crt"), "nonsense");
    server->process().signal(SIGHUP);
    server->process().awaitErrors(line + directory.file("server.crt") +
                                  ": X509 certificate string is not in a supported format\n");
    EXPECT_EQ(call(*server).exitStatus, 0);

    Utilities::writeFile(directory.file("server.crt"), Authority::trusted().client().getPEM());
    server->process().signal(SIGHUP);
    server->process().awaitErrors(line + directory.file("server.crt") + " and ");
    EXPECT_EQ(call(*server).exitStatus, 0);

    ASSERT_EQ(::unlink(directory.file("server.crt").c_str()), 0);
    server->process().signal(SIGHUP);
    server->process().awaitErrors(line + "cannot open " + directory.file("server.crt"));
    const Arguments pin{"--peer-fingerprint", tool::fingerprintOf(Authority::trusted().server())};
    EXPECT_EQ(call(*server, pin).exitStatus, 0);
    EXPECT_EQ(old.messages().ask(QelMessageGetQelTodReq())->getStatus(), 0U);
    server->stop();
}

TEST_F(Tls, ANewRootHoldsForNewConnectionsOnly)
{
    const auto server = serve();
    TlsConsole old(server->endpoint());
    old.comeIn("old");
    directory.put("server", Authority::stranger().serverCredentials());
    Utilities::writeFile(directory.file("root.crt"), Authority::stranger().root().getPEM());
    server->process().signal(SIGHUP);
    server->process().awaitErrors("SIGHUP: loaded ");
    directory.put("client", Authority::stranger().clientCredentials());
    EXPECT_EQ(call(*server).exitStatus, 0);
    TlsConsole late(server->endpoint());
    EXPECT_THROW(late.comeIn("late"), StreamIOException); // with the certificate of the root that was
    EXPECT_EQ(old.messages().ask(QelMessageGetQelTodReq())->getStatus(), 0U);
    server->stop();
}

} // namespace

} // namespace qel::test
