#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/CertificateFacts.hpp>

#include "protocol/server/ServedFixture.hpp"
#include "support/CredentialDirectory.hpp"
#include "support/LoopbackEnds.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::Connection;
using protocol::ConnectionLimits;
using protocol::PeerPins;
using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

/// Keeps the consoles that have connected.
class RecordingMachine : public protocol::Hypervisor {
public:
    explicit RecordingMachine(std::vector<protocol::Peer>& peers) : mPeers(peers) {}
    void onConnected(const protocol::Peer& peer) override { mPeers.push_back(peer); }

private:
    std::vector<protocol::Peer>& mPeers;
};

/// The hypervisor end admits a console; the test plays the console.
class AdmissionTest : public ServedFixture {
protected:
    AdmissionTest()
    {
        serverContext.setCredentials(Authority::trusted().serverCredentials());
        clientContext.setCredentials(Authority::trusted().clientCredentials());
    }

    void start(std::chrono::milliseconds time = Loopback::kDeadline, PeerPins accepted = {})
    {
        pins = std::move(accepted);
        ConnectionLimits limits;
        limits.handshake = time;
        descriptor = loopback.far->getSocket().getFd();
        connection = ServedFixture::serve(loopback, limits, &serverContext);
        connection->start();
    }

    void expectEnd() { awaitEnd(*connection); }

    void expectRefusal(const std::string& reason)
    {
        expectEnd();
        EXPECT_THAT(log.lines(), Contains("W: [qel] the test: refused: " + reason));
    }

    /// Introduces a console inside TLS. @return the status of the response
    unsigned int introduce(SSLStream& tls) const { return LoopbackMessages(tls).ask(versionRequest("a"))->getStatus(); }

    void send(const QelMessage& message) { QelMessageStream(*loopback.near, internal()).write(message); }

    static QelInternalMessageRegistry& internal() { return QelInternalMessageRegistry::getInstance(); }

    /// Reads a message in the clear and expects a T.
    template <typename T>
    void expect()
    {
        const auto message = QelMessageStream(*loopback.near, internal()).read();
        EXPECT_NE(dynamic_cast<const T*>(message.get()), nullptr) << message->getLogID();
    }

    void expectClosed()
    {
        char byte = 0;
        EXPECT_EQ(loopback.near->read(&byte, 1), 0U);
    }

    /// Runs the console's steps up to TLS. @return its stream
    std::unique_ptr<SSLStream> startTls()
    {
        send(QelMessageUpgradeConnectionAsync());
        expect<QelMessageUpgradeConnectionAsync>();
        auto tls = std::make_unique<SSLStream>(clientContext, std::move(loopback.near));
        tls->handshake();
        return tls;
    }

    Loopback loopback;
    SSLServerContext serverContext;
    SSLClientContext clientContext;
    int descriptor = -1;                    // of the connection
    std::unique_ptr<Connection> connection; // destroyed before what it borrows
};

TEST_F(AdmissionTest, AConsoleThatAsksForTlsIsAdmitted)
{
    start();
    const auto console = startTls();
    EXPECT_EQ(introduce(*console), 0U);
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(AdmissionTest, TheHypervisorLearnsWhoTheConsoleIs)
{
    std::vector<protocol::Peer> peers;
    HypervisorFixture::serve(std::make_unique<RecordingMachine>(peers));
    start();
    const auto console = startTls();
    EXPECT_EQ(introduce(*console), 0U);
    ASSERT_THAT(peers, ::testing::SizeIs(1));
    EXPECT_EQ(peers.front().commonName, "client");
    EXPECT_EQ(peers.front().fingerprint, fingerprintOf(Authority::trusted().client()));
    EXPECT_EQ(peers.front().address, "the test");
    EXPECT_TRUE(peers.front().isProtected);
}

TEST_F(AdmissionTest, TheWriteDeadlineEndsWithTheHandshake)
{
    start();
    const auto console = startTls();
    EXPECT_EQ(introduce(*console), 0U);
    hypervisor->shutDown(); // the writer sends the notice, which passes the changed deadline to the kernel
    EXPECT_NE(LoopbackMessages(*console).receive<QelMessageKrogConnectionClosedAsync>(), nullptr);
    timeval timeout{};
    socklen_t length = sizeof(timeout);
    ASSERT_EQ(::getsockopt(descriptor, SOL_SOCKET, SO_SNDTIMEO, &timeout, &length), 0);
    EXPECT_EQ(timeout.tv_sec, 0);
    EXPECT_EQ(timeout.tv_usec, 0);
}

TEST_F(AdmissionTest, ASilentConsoleInsideTlsIsClosedAtTheDeadline)
{
    start(std::chrono::milliseconds(500));
    const auto console = startTls();
    char byte = 0;
    EXPECT_EQ(console->read(&byte, 1), 0U);
    expectEnd();
    EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not introduce itself in time"));
}

TEST_F(AdmissionTest, ASilentConsoleIsClosedAtTheDeadline)
{
    start(std::chrono::milliseconds(20));
    expectClosed();
    expectRefusal("the peer did not ask for TLS in time");
}

TEST_F(AdmissionTest, APartialRequestIsClosedAtTheDeadline)
{
    start(std::chrono::milliseconds(50));
    const QelMessageUpgradeConnectionAsync request;
    loopback.near->write(request.serialize(), request.msgLength() - 1);
    expectClosed();
    expectRefusal("the peer did not ask for TLS in time");
}

TEST_F(AdmissionTest, AConsoleSilentAfterItsRequestIsClosedAtTheDeadline)
{
    start(std::chrono::milliseconds(500)); // enough for the response
    send(QelMessageUpgradeConnectionAsync());
    expect<QelMessageUpgradeConnectionAsync>();
    expectClosed();
    expectRefusal("the TLS handshake did not finish in time");
}

TEST_F(AdmissionTest, OneDeadlineCoversAllSteps)
{
    // Each byte comes well before the deadline, all of them together do not.
    start(std::chrono::milliseconds(200));
    const QelMessageUpgradeConnectionAsync request;
    unsigned sent = 0;
    for (; sent + 1 < request.msgLength(); ++sent) {
        loopback.near->write(request.serialize() + sent, 1);
        if (PollSet(ended.getPollFd()).wait(std::chrono::milliseconds(20)).anyReady()) break;
    }
    EXPECT_LT(sent + 1, request.msgLength()) << "it was never closed";
}

TEST_F(AdmissionTest, AConsoleThatDisconnectsEndsTheAdmission)
{
    start();
    loopback.near.reset();
    expectRefusal("the peer did not ask for TLS but ended the connection: EOF");
}

TEST_F(AdmissionTest, AConsoleThatDoesNotAskForTlsIsRefused)
{
    start();
    send(versionRequest("a"));
    expect<QelMessageAbortHandshakeAsync>();
    expectClosed();
    expectEnd();
    EXPECT_THAT(log.lines(), Contains(HasSubstr("the test: refused: the peer did not ask for TLS but sent "
                                                "something else: [CID: ")));
}

TEST_F(AdmissionTest, TlsWithoutARequestIsAMalformedMessage)
{
    start();
    const std::string hello("\x16\x03\x01\x02\x00\x01\x00\x01\xfc\x03\x03", 11);
    loopback.near->write(hello.data(), hello.size());
    expectRefusal("the peer did not ask for TLS but sent something else: Invalid length");
}

TEST_F(AdmissionTest, BytesInTheClearAfterTheRequestAreRefused)
{
    const QelMessageUpgradeConnectionAsync request;
    const auto version = versionRequest("a");
    const std::string both =
        std::string(request.serialize(), request.msgLength()) + std::string(version.serialize(), version.msgLength());
    loopback.near->write(both.data(), both.size());
    start();
    expectRefusal("the peer sent data too early in the handshake");
}

TEST_F(AdmissionTest, MessagesInsteadOfTlsAreRefused)
{
    start();
    send(QelMessageUpgradeConnectionAsync());
    expect<QelMessageUpgradeConnectionAsync>();
    send(versionRequest("a"));
    expectRefusal("the TLS handshake failed: SSL error 1");
    Peer other;
    identify(other, "a"); // the identity is free
}

TEST_F(AdmissionTest, AtTheMaximumOfConsolesTheAnswerIsAbort)
{
    limitConsoles(1);
    Peer first;
    identify(first, "first");
    start();
    send(QelMessageUpgradeConnectionAsync());
    expect<QelMessageAbortHandshakeAsync>();
    expectClosed();
    expectRefusal("no more consoles are taken");
}

TEST_F(AdmissionTest, UnidentifiedConsolesDoNotCount)
{
    limitConsoles(1);
    Peer first;
    connect(first);
    start();
    EXPECT_NE(startTls(), nullptr);
}

TEST_F(AdmissionTest, DuringShutdownTheAnswerIsAbort)
{
    hypervisor->shutDown();
    start();
    send(QelMessageUpgradeConnectionAsync());
    expect<QelMessageAbortHandshakeAsync>();
    expectRefusal("no more consoles are taken");
}

TEST_F(AdmissionTest, StopSendsAbortToAConsoleThatHasNotAsked)
{
    start();
    connection->stop();
    expect<QelMessageAbortHandshakeAsync>();
    expectClosed();
    expectRefusal("the server stops");
}

TEST_F(AdmissionTest, StopDoesNotResetAConsoleWhoseRequestIsUnread)
{
    connection = ServedFixture::serve(loopback, {}, &serverContext);
    send(QelMessageUpgradeConnectionAsync());
    connection->stop();
    connection->start(); // finds both, and the stop comes first
    expect<QelMessageAbortHandshakeAsync>();
    expectEnd();
    connection.reset(); // closes the descriptor
    expectClosed();
    int error = -1; // a reset leaves EPIPE here
    socklen_t length = sizeof(error);
    ASSERT_EQ(::getsockopt(loopback.near->getSocket().getFd(), SOL_SOCKET, SO_ERROR, &error, &length), 0);
    EXPECT_EQ(error, 0);
}

TEST_F(AdmissionTest, StopCutsAConsoleInTheTlsHandshake)
{
    start();
    send(QelMessageUpgradeConnectionAsync());
    expect<QelMessageUpgradeConnectionAsync>();
    connection->stop();
    expectClosed();
    expectEnd();
}

TEST_F(AdmissionTest, CanBeDestroyedAtAnyTime)
{
    start();
    send(QelMessageUpgradeConnectionAsync());
    expect<QelMessageUpgradeConnectionAsync>();
    connection.reset();
    expectClosed();
}

TEST_F(AdmissionTest, CanBeDestroyedWithoutAStart)
{
    connection = ServedFixture::serve(loopback, {}, &serverContext);
    connection.reset();
    expectClosed();
}

TEST_F(AdmissionTest, AConsoleWithACertificateOfAnotherRootIsRefused)
{
    SSLCredentials stranger = Authority::stranger().clientCredentials();
    stranger.mRootCA = Authority::trusted().root().getPEM();
    clientContext.setCredentials(stranger);
    start();
    EXPECT_THROW(startTls(), StreamIOException);
    expectRefusal("the peer's certificate is refused: unable to get local issuer certificate");
}

TEST_F(AdmissionTest, AConsoleThatIsNotPinnedIsRefused)
{
    start(Loopback::kDeadline, {{"server"}, {}});
    const auto console = startTls(); // for the console TLS is done
    char byte = 0;
    EXPECT_EQ(console->read(&byte, 1), 0U);
    expectRefusal("wrong peer: the name \"client\" does not match the pinned names");
}

TEST_F(AdmissionTest, APinnedConsoleIsAdmitted)
{
    start(Loopback::kDeadline, {{"client"}, {}});
    const auto console = startTls();
    EXPECT_EQ(introduce(*console), 0U);
}

} // namespace

} // namespace qel::test
