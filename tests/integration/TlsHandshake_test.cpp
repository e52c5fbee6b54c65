// The steps from TCP to TLS: peers that leave the path, and deadlines.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "integration/TlsConsole.hpp"
#include "integration/TlsTest.hpp"
#include "integration/WrongServer.hpp"

#include <atomic>
#include <csignal>
#include <functional>
#include <gmock/gmock.h>
#include <thread>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr unsigned int kUpgrade = QelMessageOpUpgradeConnection;
constexpr unsigned int kAbort = QelMessageOpAbortHandshake;

// Plain meets TLS.

TEST_F(Tls, APlainConsoleReportsThatTheServerRequiresTls)
{
    const auto server = serve();
    const auto result = server->call({"limits"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              "qel: the server refused the connection: it accepts only TLS; give credentials instead of --plain\n");
    EXPECT_THAT(server->stop().errors,
                AllOf(HasSubstr(": refused: the peer did not ask for TLS but sent something else: [CID: "),
                      Not(HasSubstr("console 1 connected"))));
}

TEST_F(Tls, ATlsConsoleIsRefusedByAPlainServer)
{
    ServeProcess server;
    const auto result = call(server);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              prefix(server.endpoint()) +
                  "the server refused this console: it admits no more consoles, is stopping, or does not use TLS\n");
    EXPECT_THAT(server.stop().errors,
                HasSubstr("(W): [qel] console 1: closed, it asked for TLS, which is not done here\n"));
}

// Consoles that go wrong on the way to TLS and inside it: cases of "qel check", and what the server logs about them.

class TlsCase : public Tls {
protected:
    /// Runs one case, which must hold.
    void expectHolds(const ServeProcess& server, const std::string& id) const
    {
        const auto result =
            runQel(Arguments{"check", "server", "--connect", server.endpoint(), "--only", id, "--timeout", "20"} +
                   directory.options("client"));
        EXPECT_EQ(result.exitStatus, 0) << result.output;
        EXPECT_THAT(result.output, HasSubstr("ok       " + id + "\n"));
    }
};

TEST_F(TlsCase, RefusesTlsInsideTls)
{
    const auto server = serve();
    expectHolds(*server, "tls/inside/upgrade");
    EXPECT_THAT(server->stop().errors, HasSubstr("closed, it asked for TLS, which is not done here\n"));
}

TEST_F(TlsCase, IgnoresMessagesInTheClearInsteadOfTls)
{
    const auto server = serve();
    expectHolds(*server, "tls/upgrade/clear-after-answer");
    EXPECT_THAT(server->stop().errors, AllOf(HasSubstr(": refused: the TLS handshake failed: SSL error 1\n"),
                                             Not(HasSubstr("console 1 connected"))));
}

TEST_F(TlsCase, IgnoresMessagesInTheClearAfterTheRequestForTls)
{
    const auto server = serve();
    expectHolds(*server, "tls/upgrade/data-before-answer");
    EXPECT_THAT(server->stop().errors, AllOf(HasSubstr(": refused: the peer sent data too early in the handshake\n"),
                                             Not(HasSubstr("console 1 connected"))));
}

TEST_F(TlsCase, RefusesTlsWithoutARequest)
{
    const auto server = serve();
    expectHolds(*server, "tls/first/tls-without-asking");
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: the peer did not ask for TLS but sent something "
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

TEST_F(TlsDeadline, EndsASilentConsole)
{
    const auto server = impatient("0.1");
    TlsConsole console(server->endpoint());
    EXPECT_TRUE(console.isClosed());
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: the peer did not ask for TLS in time\n"));
}

TEST_F(TlsDeadline, EndsAConsoleThatIsSilentAfterItsRequest)
{
    const auto server = impatient("1.5");
    TlsConsole console(server->endpoint());
    console.ask();
    EXPECT_EQ(console.takeAnswer(), kUpgrade);
    EXPECT_TRUE(console.isClosed());
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: the TLS handshake did not finish in time\n"));
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

TEST_F(Tls, StalledConsolesDoNotBlockOthers)
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

TEST_F(Tls, AStoppingServerRefusesConsolesInTheirHandshake)
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
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: the server stops\n"));
}

TEST_F(Tls, RefusesTooManyConsolesBeforeTls)
{
    const auto server = serve({"--max-consoles", "1"});
    TlsConsole first(server->endpoint());
    first.comeIn("first");
    const auto result = call(*server);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              prefix(server->endpoint()) +
                  "the server refused this console: it admits no more consoles, is stopping, or does not use TLS\n");
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: no more consoles are taken\n"));
}

// Servers that go wrong before TLS.

struct WrongServerRow {
    const char* name;
    std::function<void(LoopbackMessages&)> behave;
    int exitStatus;
    std::string errors; // after the endpoint
};

void PrintTo(const WrongServerRow& row, std::ostream* os) { *os << row.name; }

class TlsWrongServer : public Tls, public ::testing::WithParamInterface<WrongServerRow> {};

TEST_P(TlsWrongServer, EndsTheCallWithStatusAndText)
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

const std::string kNoAnswer = "the peer did not answer the request for TLS ";

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
                       "the server refused this console: it admits no more consoles, is stopping, or does not use TLS"},
        WrongServerRow{"SaysMoreThanTheAnswer",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.sendBytes(frameOf(QelMessageUpgradeConnectionAsync()) + "x");
                           stayUntilTheEnd(messages);
                       },
                       5, "the peer sent data too early in the handshake"},
        WrongServerRow{"AnswersAndIsSilent",
                       [](LoopbackMessages& messages) {
                           messages.receive();
                           messages.send(QelMessageUpgradeConnectionAsync());
                           stayUntilTheEnd(messages);
                       },
                       6, "the TLS handshake did not finish in time"},
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

} // namespace

} // namespace qel::test
