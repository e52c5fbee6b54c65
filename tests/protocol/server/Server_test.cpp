#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/CertificateFacts.hpp>

#include "protocol/hypervisor/FakeSerialLine.hpp"
#include "protocol/server/ServerFixture.hpp"
#include "support/ComesTrue.hpp"
#include "support/RecordingLogBackend.hpp"
#include "support/SettableClock.hpp"

#include <algorithm>
#include <gmock/gmock.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sstream>

namespace qel::test {

namespace {

using protocol::Server;
using protocol::ServerOptions;
using ::testing::Contains;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

/// A server with timeouts of an hour: nothing ends by a timeout unless the test moves the clock.
class PatientServerTest : public ServerFixture {
protected:
    static constexpr std::chrono::hours kTime{1};

    PatientServerTest()
    {
        ServerOptions options = tlsOptions();
        options.handshakeTimeout = kTime;
        options.linger = kTime;
        make(options);
    }
    ~PatientServerTest() override { server.reset(); } // before the clock

    SettableClock clock;
};

TEST_F(PatientServerTest, StopsWithoutWaitingForUnfinishedHandshakes)
{
    run();
    const auto silent = connect();
    const auto stalled = connect();
    askForTls(*stalled); // the other connection came first, so it is accepted too
    stop();
    expect<QelMessageAbortHandshakeAsync>(*silent);
    EXPECT_TRUE(isClosed(*silent));
    EXPECT_TRUE(isClosed(*stalled));
    EXPECT_TRUE(hasEnded());
    EXPECT_THAT(log.lines(), Contains(EndsWith(": refused: the server stops")));
}

TEST_F(PatientServerTest, TheHandshakeDeadlineContinuesInsideTls)
{
    QelLogger::get().setLevel(LogLevel::Info);
    QelLogger::get().addBackend(std::make_shared<OnLine>(": over TLS: ", [this] { clock.advance(kTime); }));
    run();
    auto socket = connect();
    askForTls(*socket);
    socket->clearReadDeadline(); // the test moves the clock
    SSLStream console(clientContext(), std::move(socket));
    console.handshake();
    // It sends nothing more, and the deadline has passed.
    auto closed = std::async(std::launch::async, [&console] { return isClosed(console); });
    EXPECT_EQ(closed.wait_for(Loopback::kDeadline), std::future_status::ready);
    console.close(); // in case it was not closed
    EXPECT_TRUE(closed.get());
    stop();
    EXPECT_TRUE(hasEnded());
    EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not introduce itself in time"));
}

class ServerTest : public ServerFixture {};

TEST_F(ServerTest, ListensOnSeveralEndpoints)
{
    ServerOptions options = plainOptions();
    options.listen = {"127.0.0.1:0", "[::1]:0", "127.0.0.2:0"};
    make(options);
    const std::vector<IPEndpoint> endpoints = server->endpoints();
    ASSERT_EQ(endpoints.size(), 3U);
    EXPECT_THAT(endpoints[0].str(), StartsWith("127.0.0.1:"));
    EXPECT_THAT(endpoints[1].str(), StartsWith("[::1]:"));
    EXPECT_THAT(endpoints[2].str(), StartsWith("127.0.0.2:"));
    run();
    unsigned number = 0;
    for (const IPEndpoint& endpoint : endpoints) {
        const auto console = connect(endpoint);
        EXPECT_EQ(introduce(*console, std::to_string(++number)), 0U) << endpoint;
    }
}

TEST_F(ServerTest, RunsAgainAfterAStop)
{
    make(plainOptions());
    for (int round = 0; round < 3; ++round) {
        run();
        const auto console = connect();
        EXPECT_EQ(introduce(*console, std::to_string(round)), 0U);
        pause();
        EXPECT_EQ(LoopbackMessages(*console).ask(QelMessageGetQelTodReq())->getStatus(), 0U); // served on
    }
}

TEST_F(ServerTest, ServesAStreamInMemoryWithoutBeingRun)
{
    ServerOptions options = plainOptions();
    options.listen = {};
    make(options);
    EXPECT_TRUE(server->endpoints().empty());
    const auto console = connectInMemory("a test");
    EXPECT_EQ(introduce(*console, "x"), 0U);
    std::ostringstream text;
    server->dumpStatistics(text);
    EXPECT_THAT(text.str(), StartsWith("Queue of console 1, a test:\n"));
}

TEST_F(ServerTest, ServesAStreamInMemoryOverTls)
{
    ServerOptions options = tlsOptions();
    options.listen = {};
    make(options);
    auto clear = connectInMemory("a test");
    askForTls(*clear);
    SSLStream console(clientContext(), std::move(clear));
    console.handshake();
    EXPECT_EQ(introduce(console, "x"), 0U);
    server->finish();
    LoopbackMessages messages(console);
    EXPECT_NE(messages.receive<QelMessageKrogConnectionClosedAsync>(), nullptr);
    EXPECT_TRUE(messages.isClosed());
}

TEST_F(ServerTest, AStreamInMemoryThatDoesNotAskForTlsIsClosedAtTheEnd)
{
    ServerOptions options = tlsOptions();
    options.listen = {};
    make(options);
    const auto console = connectInMemory("a test");
    server->finish();
    EXPECT_TRUE(isClosed(*console, true)); // after the abort message, if it had not begun to wait
}

/// Takes no input.
class FullLine : public FakeSerialLine {
public:
    FullLine() { takes = 0; }
    int descriptor() const override { return mDescriptor.getPollFd().mFd.fd; }

private:
    protocol::WakeUp mDescriptor;
};

TEST_F(ServerTest, NoticesThatACallersSocketHasHungUpWhileItDoesNotRead)
{
    machine.addPartition(1, std::make_unique<FullLine>());
    ServerOptions options = plainOptions();
    options.listen = {};
    make(options);
    Loopback ends;
    server->serve(std::move(ends.far), "a test");
    EXPECT_EQ(introduce(*ends.near, "x"), 0U);
    LoopbackMessages messages(*ends.near);
    messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    EXPECT_EQ(messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0))->getStatus(), 0U);
    const std::string data(16000, 'x');
    for (int i = 0; i < 5; ++i) // they stop the reader
        messages.send(QelMessageVirtualSerialDataToOsAsync(1, 0, 16000, data.data()));
    messages.send(QelMessageGetQelTodReq());
    ends.near.reset();
    EXPECT_TRUE(comesTrue([&] {
        std::ostringstream text;
        server->dumpStatistics(text);
        return text.str() == "No console is connected.\n";
    }));
}

TEST_F(ServerTest, RefusesANullStream)
{
    make(plainOptions());
    EXPECT_THROW(server->serve(nullptr, "x"), std::invalid_argument);
}

TEST_F(ServerTest, AfterTheEndNothingIsServed)
{
    make(plainOptions());
    const IPEndpoint endpoint = server->endpoints().front();
    server->finish();
    server->finish();
    const auto console = connectInMemory("late");
    EXPECT_TRUE(isClosed(*console));
    EXPECT_ANY_THROW(connect(endpoint));
    server->run(stopFd()); // returns, though nothing stops it
}

TEST_F(ServerTest, TheEndSendsTheNoticeAndWaitsForItToBeTaken)
{
    make(plainOptions());
    const auto console = connectInMemory("a test");
    EXPECT_EQ(introduce(*console, "x"), 0U);
    server->finish();
    LoopbackMessages messages(*console);
    EXPECT_NE(messages.receive<QelMessageKrogConnectionClosedAsync>(), nullptr);
    EXPECT_TRUE(messages.isClosed());
}

TEST_F(ServerTest, AConsoleThatTakesNothingIsCutAfterTheLingerTime)
{
    ServerOptions options = plainOptions();
    options.linger = std::chrono::milliseconds(30);
    make(options);
    auto ends = protocol::makeMemoryStreams(16); // the notice does not fit
    server->serve(std::move(ends.second), "a test");
    const QelMessageGetEnclTypeAndInterfaceVersionReq request(1, 1, 1, 1, "x");
    ends.first->write(request.serialize(), request.msgLength());
    std::vector<char> some(80);
    ends.first->fill(some.data(), some.size()); // the response
    const auto begin = std::chrono::steady_clock::now();
    server->finish();
    EXPECT_GE(std::chrono::steady_clock::now() - begin, options.linger);
}

TEST_F(ServerTest, WithoutConsolesTheStatisticsSaySo)
{
    make(plainOptions());
    std::ostringstream text;
    server->dumpStatistics(text);
    EXPECT_EQ(text.str(), "No console is connected.\n");
}

TEST_F(ServerTest, NewCredentialsAreForNewConnections)
{
    make(tlsOptions());
    run();
    const auto before = connectTls();
    server->setCredentials(protocol::Credentials::fromTexts(Authority::stranger().serverCredentials()));
    EXPECT_EQ(introduce(*before, "x"), 0U);
    EXPECT_THROW(connectTls(), StreamIOException); // of a root that the console does not trust
}

TEST_F(ServerTest, APlainServerTakesNoCredentials)
{
    make(plainOptions());
    EXPECT_THROW(server->setCredentials(*tlsOptions().credentials), std::logic_error);
}

TEST_F(ServerTest, TooManyHandshakesAreRefusedUntilOneHasIdentifiedItself)
{
    ServerOptions options = plainOptions();
    options.maxHandshakes = 2;
    make(options);
    run();
    const auto first = connect();
    const auto second = connect();
    EXPECT_TRUE(isClosed(*connect()));
    EXPECT_THAT(log.lines(), Contains(EndsWith(": refused: too many connections are in their handshake")));
    EXPECT_EQ(introduce(*first, "first"), 0U);
    EXPECT_TRUE(comesTrue([&] { return canIntroduce("later"); }));
    EXPECT_EQ(introduce(*second, "second"), 0U); // it has kept its place
}

TEST_F(ServerTest, TooManyHandshakesFromOneAddressAreRefused)
{
    ServerOptions options = plainOptions();
    options.listen = {"127.0.0.1:0", "[::1]:0"};
    options.maxHandshakesPerAddress = 1;
    make(options);
    run();
    const auto first = connect();
    EXPECT_TRUE(isClosed(*connect()));
    EXPECT_THAT(log.lines(),
                Contains(EndsWith(": refused: too many connections from its address are in their handshake")));
    const auto other = connect(server->endpoints()[1]); // of another address
    EXPECT_EQ(introduce(*other, "other"), 0U);
}

TEST_F(ServerTest, AConnectionThatEndsInItsHandshakeGivesItsPlaceBack)
{
    for (const bool plain : {true, false}) {
        ServerOptions options = plain ? plainOptions() : tlsOptions();
        options.maxHandshakes = 1;
        make(options);
        run();
        auto first = connect();
        EXPECT_TRUE(isClosed(*connect(), true));
        first.reset();
        EXPECT_TRUE(comesTrue([&] {
            const auto next = connect();
            next->setReadDeadline(std::chrono::milliseconds(20));
            try {
                return !isClosed(*next, true);
            } catch (const StreamIOException&) {
                return true; // it is waited for
            }
        }));
        stop();
        EXPECT_TRUE(hasEnded());
    }
}

TEST_F(ServerTest, AConsoleWithoutAPlaceLearnsThatItIsTurnedAway)
{
    ServerOptions options = tlsOptions();
    options.maxHandshakes = 1;
    make(options);
    run();
    const auto first = connect();
    const auto second = connect();
    expect<QelMessageAbortHandshakeAsync>(*second);
    EXPECT_TRUE(isClosed(*second));
}

TEST_F(ServerTest, AConsoleWithoutAPlaceThatHasAskedForTlsGetsTheAbortMessageAndTheEnd)
{
    ServerOptions options = tlsOptions();
    options.maxHandshakes = 1;
    make(options);
    const auto first = connect();
    const auto second = connect();
    QelMessageStream(*second, QelInternalMessageRegistry::getInstance()).write(QelMessageUpgradeConnectionAsync());
    run(); // accepts both; the request of the second waits unread
    expect<QelMessageAbortHandshakeAsync>(*second);
    EXPECT_TRUE(isClosed(*second)); // not reset, which could have overtaken the message
}

TEST_F(ServerTest, StreamsInMemoryNeedNoPlace)
{
    ServerOptions options = plainOptions();
    options.maxHandshakes = 1;
    make(options);
    const auto first = connectInMemory("a");
    const auto second = connectInMemory("b");
    EXPECT_EQ(introduce(*second, "b"), 0U);
    EXPECT_EQ(introduce(*first, "a"), 0U);
}

TEST_F(ServerTest, ItsConnectionsHaveTheKeepAliveOfTheOptions)
{
    ServerOptions options = plainOptions();
    options.keepAlive = std::chrono::seconds(1234);
    make(options);
    run();
    const auto console = connect();
    EXPECT_EQ(introduce(*console, "x"), 0U);
    const IPEndpoint from = console->getSocket().getSocketName();
    int found = 0;
    for (int fd = 0; fd < 1024; ++fd) {
        sockaddr_in peer{};
        socklen_t length = sizeof(peer);
        if (::getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &length) != 0 || peer.sin_family != AF_INET) continue;
        if (ntohs(peer.sin_port) != from.getPort()) continue;
        int idle = 0;
        length = sizeof(idle);
        ASSERT_EQ(::getsockopt(fd, IPPROTO_TCP, TCP_KEEPIDLE, &idle, &length), 0);
        EXPECT_EQ(idle, 617);
        ++found;
    }
    EXPECT_EQ(found, 1);
}

TEST_F(ServerTest, TheLogOfAPeerThatRepeatsItselfIsSummedUp)
{
    auto throttled = std::make_shared<RecordingLogBackend>();
    QelLogger::get().addBackend(std::make_shared<protocol::LogBackendThrottled>(throttled));
    make(plainOptions());
    run();
    const auto console = connect();
    EXPECT_EQ(introduce(*console, "x"), 0U);
    LoopbackMessages messages(*console);
    for (int i = 0; i < 1000; ++i)
        messages.send(QelMessageGeneric(1, 0x7000, 0x0B0B, NoFlagSet));
    EXPECT_EQ(messages.ask(QelMessageGetQelTodReq())->getStatus(), 0U);
    EXPECT_TRUE(comesTrue([&] { // by run(), without further traffic
        const auto lines = throttled->lines();
        return !lines.empty() &&
               lines.back().find("127.0.0.1: 990 more lines like this one: console 1: ignored ") != std::string::npos;
    }));
}

/// Counts the lines that go out about messages that are ignored, while the clock stands still.
class ServerLogTest : public ServerFixture {
protected:
    void make(ServerOptions options)
    {
        options.listen = {};
        QelLogger::get().addBackend(std::make_shared<protocol::LogBackendThrottled>(throttled));
        ServerFixture::make(options);
    }

    ~ServerLogTest() override { server.reset(); } // before the clock

    /// A console that introduces itself, sends 8 messages that are ignored, and leaves.
    static void annoy(Stream& stream)
    {
        EXPECT_EQ(introduce(stream, "x"), 0U);
        LoopbackMessages messages(stream);
        for (int i = 0; i < 8; ++i)
            messages.send(QelMessageGeneric(1, 0x7000, 0x0B0B, NoFlagSet));
        EXPECT_EQ(messages.ask(QelMessageGetQelTodReq())->getStatus(), 0U);
        stream.close();
    }

    void annoyOverTls(const SSLCredentials& credentials)
    {
        SSLClientContext context;
        context.setCredentials(credentials);
        auto clear = connectInMemory("192.0.2.7");
        askForTls(*clear);
        SSLStream console(context, std::move(clear));
        console.handshake();
        annoy(console);
        expectNoConsole();
    }

    /// So that the next one may introduce itself by the same name.
    void expectNoConsole()
    {
        EXPECT_TRUE(comesTrue([&] {
            std::ostringstream text;
            server->dumpStatistics(text);
            return text.str() == "No console is connected.\n";
        }));
    }

    long ignored() const
    {
        const auto lines = throttled->lines();
        return std::count_if(lines.begin(), lines.end(),
                             [](const std::string& line) { return line.find(": ignored ") != std::string::npos; });
    }

    const SettableClock clock;
    std::shared_ptr<RecordingLogBackend> throttled = std::make_shared<RecordingLogBackend>();
};

TEST_F(ServerLogTest, AConsoleThatConnectsAgainGetsNoNewBurst)
{
    make(plainOptions());
    for (int round = 0; round < 3; ++round) {
        annoy(*connectInMemory("192.0.2.7"));
        expectNoConsole();
    }
    EXPECT_EQ(ignored(), 10);
    annoy(*connectInMemory("192.0.2.8"));
    EXPECT_EQ(ignored(), 18);
}

TEST_F(ServerLogTest, OverTlsAConsoleCountsByItsAddressAndCertificate)
{
    make(tlsOptions());
    const Authority& authority = Authority::trusted();
    for (int round = 0; round < 3; ++round)
        annoyOverTls(authority.clientCredentials());
    EXPECT_EQ(ignored(), 10);
    annoyOverTls(authority.credentialsOf(authority.server())); // another certificate of the same root
    EXPECT_EQ(ignored(), 18);
    server->finish();
    EXPECT_THAT(throttled->lines(), Contains(HasSubstr("192.0.2.7, SHA-256 " + factsOf(authority.client()).fingerprint +
                                                       ": 14 more lines like this one: console 3: ignored ")));
}

TEST_F(ServerTest, ConnectionsThatAreResetBeforeTheyAreAcceptedDoNotFillTheLog)
{
    auto throttled = std::make_shared<RecordingLogBackend>();
    QelLogger::get().setLevel(LogLevel::Info);
    QelLogger::get().addBackend(std::make_shared<protocol::LogBackendThrottled>(throttled));
    const SettableClock clock; // stands still
    make(plainOptions());
    for (int i = 0; i < 50; ++i) {
        Socket socket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(server->endpoints().front(), Loopback::kDeadline);
        const linger reset{1, 0};
        ASSERT_EQ(::setsockopt(socket.getFd(), SOL_SOCKET, SO_LINGER, &reset, sizeof(reset)), 0);
    }
    run();
    EXPECT_TRUE(canIntroduce("x")); // those before it have been accepted
    stop();
    EXPECT_TRUE(hasEnded());
    server.reset(); // before the clock
    const auto lines = throttled->lines();
    EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                            [](const std::string& line) {
                                return line.find("[qel] a connection ended before it was served") != std::string::npos;
                            }),
              10);
    EXPECT_THAT(lines, Contains(HasSubstr(
                           "new connections: 40 more lines like this one: a connection ended before it was served")));
    EXPECT_LT(lines.size(), 50U); // the common library has a line about each of them too
}

} // namespace

} // namespace qel::test
