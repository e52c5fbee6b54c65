#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>

#include "support/CredentialDirectory.hpp"
#include "support/Errors.hpp"
#include "support/LoopbackEnds.hpp"
#include "support/ScriptedStream.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <thread>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::MatchesRegex;
using ::testing::Property;
using ::testing::StartsWith;
using ::testing::Throws;

std::vector<char> frameOf(const QelMessage& message)
{
    return std::vector<char>(message.serialize(), message.serialize() + message.msgLength());
}

std::vector<char> upgrade() { return frameOf(QelMessageUpgradeConnectionAsync()); }
std::vector<char> abortMessage() { return frameOf(QelMessageAbortHandshakeAsync()); }

constexpr int kNoDescriptor = -1;

/// What was written, as a message; nothing may be left over. @return null when nothing was
std::unique_ptr<QelMessage> messageIn(const ScriptedStream& stream)
{
    const auto bytes = stream.written();
    if (bytes.empty()) return nullptr;
    auto message =
        QelInternalMessageRegistry::getInstance().deserialize(bytes.data(), static_cast<unsigned int>(bytes.size()));
    EXPECT_EQ(message->msgLength(), bytes.size());
    return message;
}

template <typename T>
bool wrote(const ScriptedStream& stream)
{
    const auto message = messageIn(stream);
    return dynamic_cast<const T*>(message.get()) != nullptr;
}

// The console's step.

TEST(RequestUpgrade, SendsTheUpgradeMessageAndTakesItAsTheAnswer)
{
    ScriptedStream stream;
    stream.deliverOneByOne(upgrade());
    protocol::requestUpgrade(stream, kNoDescriptor);
    EXPECT_TRUE(wrote<QelMessageUpgradeConnectionAsync>(stream));
    EXPECT_EQ(stream.bytesLeft(), 0U);
}

TEST(RequestUpgrade, TheAbortMessageIsRefused)
{
    ScriptedStream stream;
    stream.deliver(abortMessage());
    EXPECT_THAT([&] { protocol::requestUpgrade(stream, kNoDescriptor); },
                failsWith<protocol::TurnedAway>(StartsWith("the server refused this console: ")));
}

TEST(RequestUpgrade, AnyOtherMessageBreaksTheProtocol)
{
    ScriptedStream stream;
    stream.deliver(frameOf(QelMessageGetQelTodReq()));
    EXPECT_THAT([&] { protocol::requestUpgrade(stream, kNoDescriptor); },
                failsWith<protocol::ProtocolBroken>(
                    StartsWith("the peer did not answer the request for TLS but sent something else: [CID: ")));
}

TEST(RequestUpgrade, BytesThatAreNotAMessageBreakTheProtocol)
{
    ScriptedStream stream;
    stream.deliver(std::vector<char>(64, '\x16'));
    EXPECT_THAT([&] { protocol::requestUpgrade(stream, kNoDescriptor); },
                failsWith<protocol::ProtocolBroken>(
                    "the peer did not answer the request for TLS but sent something else: Invalid length"));
}

TEST(RequestUpgrade, ReportsTheEndOfTheConnection)
{
    for (std::size_t length : {std::size_t{0}, std::size_t{5}, upgrade().size() - 1}) {
        SCOPED_TRACE(length);
        ScriptedStream stream;
        auto part = upgrade();
        part.resize(length);
        if (length > 0) stream.deliver(part);
        stream.end();
        EXPECT_THAT([&] { protocol::requestUpgrade(stream, kNoDescriptor); },
                    failsWith<protocol::ClosedByPeer>(
                        "the peer did not answer the request for TLS but ended the connection: EOF"));
    }
}

TEST(RequestUpgrade, ReportsAPassedDeadline)
{
    ScriptedStream stream;
    stream.fail("I/O deadline");
    EXPECT_THAT([&] { protocol::requestUpgrade(stream, kNoDescriptor); },
                failsWith<protocol::DeadlinePassed>("the peer did not answer the request for TLS in time"));
}

TEST(RequestUpgrade, NothingBeyondTheAnswerIsRead)
{
    ScriptedStream stream;
    auto both = upgrade();
    both.push_back('x');
    stream.deliver(both);
    protocol::requestUpgrade(stream, kNoDescriptor);
    EXPECT_EQ(stream.bytesLeft(), 1U);
}

TEST(RequestUpgrade, BytesAfterTheAnswerBreakTheProtocol)
{
    Loopback loopback;
    auto both = upgrade();
    both.push_back('x');
    loopback.near->write(both.data(), both.size());
    loopback.far->setReadDeadline(Loopback::kDeadline);
    EXPECT_THAT([&] { protocol::requestUpgrade(*loopback.far, loopback.far->getSocket().getFd()); },
                failsWith<protocol::ProtocolBroken>("the peer sent data too early in the handshake"));
}

// The hypervisor end's step.

TEST(AwaitUpgrade, TakesTheUpgradeMessageAndAnswersNothingYet)
{
    ScriptedStream stream;
    stream.deliver(upgrade());
    protocol::awaitUpgrade(stream, kNoDescriptor);
    EXPECT_TRUE(stream.written().empty());
    protocol::grantUpgrade(stream);
    EXPECT_TRUE(wrote<QelMessageUpgradeConnectionAsync>(stream));
}

TEST(AwaitUpgrade, AnyOtherMessageIsAnsweredWithTheAbortMessage)
{
    for (const auto& frame : {frameOf(QelMessageGetQelTodReq()), abortMessage()}) {
        ScriptedStream stream;
        stream.deliver(frame);
        EXPECT_THAT([&] { protocol::awaitUpgrade(stream, kNoDescriptor); },
                    failsWith<protocol::ProtocolBroken>(
                        StartsWith("the peer did not ask for TLS but sent something else: [CID: ")));
        EXPECT_TRUE(wrote<QelMessageAbortHandshakeAsync>(stream));
    }
}

TEST(AwaitUpgrade, BytesThatAreNotAMessageGetNoAnswer)
{
    ScriptedStream stream;
    stream.deliver(std::vector<char>(64, '\x16'));
    EXPECT_THAT(
        [&] { protocol::awaitUpgrade(stream, kNoDescriptor); },
        failsWith<protocol::ProtocolBroken>("the peer did not ask for TLS but sent something else: Invalid length"));
    EXPECT_TRUE(stream.written().empty());
}

TEST(AwaitUpgrade, BytesAfterTheRequestBreakTheProtocol)
{
    Loopback loopback;
    auto both = upgrade();
    both.push_back('x');
    loopback.near->write(both.data(), both.size());
    loopback.far->setReadDeadline(Loopback::kDeadline);
    EXPECT_THAT([&] { protocol::awaitUpgrade(*loopback.far, loopback.far->getSocket().getFd()); },
                failsWith<protocol::ProtocolBroken>("the peer sent data too early in the handshake"));
}

TEST(AwaitUpgrade, AConsoleThatShutsDownItsSideIsNotTooEarly)
{
    Loopback loopback;
    loopback.near->write(upgrade().data(), upgrade().size());
    ASSERT_EQ(::shutdown(loopback.near->getSocket().getFd(), SHUT_WR), 0);
    loopback.far->setReadDeadline(Loopback::kDeadline);
    EXPECT_NO_THROW(protocol::awaitUpgrade(*loopback.far, loopback.far->getSocket().getFd()));
}

TEST(AbortHandshake, SendsTheAbortMessage)
{
    ScriptedStream stream;
    protocol::abortHandshake(stream);
    EXPECT_TRUE(wrote<QelMessageAbortHandshakeAsync>(stream));
}

TEST(GrantUpgrade, ReportsAConsoleThatHasGone)
{
    ScriptedStream stream;
    stream.failWriteAt(0, "gone");
    EXPECT_THAT([&] { protocol::grantUpgrade(stream); },
                failsWith<protocol::ClosedByPeer>("the peer did not take the answer to its request for TLS but "
                                                  "ended the connection: gone"));
}

TEST(LimitTo, GivesBothDirectionsTheRemainingTime)
{
    ScriptedStream stream;
    protocol::limitTo(stream, TimeProvider::steady() - std::chrono::seconds(1));
    protocol::limitTo(stream, TimeProvider::steady() + std::chrono::hours(1));
    const auto isAnHour = AllOf(::testing::Le(std::chrono::hours(1)), ::testing::Gt(std::chrono::minutes(59)));
    EXPECT_THAT(stream.readDeadlines(), ::testing::ElementsAre(std::chrono::milliseconds(1), isAnHour));
    EXPECT_THAT(stream.writeDeadlines(), ::testing::ElementsAre(std::chrono::milliseconds(1), isAnHour));
}

// TLS.

/// Does the TLS handshake of both ends over loopback.
class StartTls : public ::testing::Test {
protected:
    /// How the two ends came out of it: empty, or "STATUS: text".
    struct Outcomes {
        std::string console;
        std::string hypervisor;
    };

    static std::string outcomeOf(const std::function<void()>& work)
    {
        try {
            work();
        } catch (const protocol::CertificateRejected& error) {
            return std::string("rejected: ") + error.what();
        } catch (const protocol::ClosedByPeer& error) {
            return std::string("closed: ") + error.what();
        } catch (const protocol::Error& error) {
            return std::string("error: ") + error.what();
        }
        return {};
    }

    static Outcomes start(const SSLCredentials& console, const SSLCredentials& hypervisor)
    {
        Loopback loopback;
        SSLClientContext clientContext;
        SSLServerContext serverContext;
        clientContext.setCredentials(console);
        serverContext.setCredentials(hypervisor);
        loopback.far->setReadDeadline(Loopback::kDeadline);
        SSLStream client(clientContext, std::move(loopback.near));
        SSLStream server(serverContext, std::move(loopback.far));
        Outcomes outcomes;
        std::thread other([&] { outcomes.hypervisor = outcomeOf([&] { protocol::startTls(server); }); });
        outcomes.console = outcomeOf([&] { protocol::startTls(client); });
        other.join();
        return outcomes;
    }

    static SSLCredentials strangerThatTrustsUs()
    {
        SSLCredentials credentials = Authority::stranger().clientCredentials();
        credentials.mRootCA = Authority::trusted().root().getPEM();
        return credentials;
    }

    const SSLCredentials client = Authority::trusted().clientCredentials();
    const SSLCredentials server = Authority::trusted().serverCredentials();
    const std::string refusedByTheOther = "closed: the peer closed the connection in the TLS handshake, perhaps "
                                          "because it refuses this end's certificate: ";
};

TEST_F(StartTls, SucceedsAtBothEnds)
{
    const Outcomes outcomes = start(client, server);
    EXPECT_EQ(outcomes.console, "");
    EXPECT_EQ(outcomes.hypervisor, "");
}

TEST_F(StartTls, ThePeerOfAnExpiredCertificateReportsIt)
{
    const Outcomes console = start(expiredCredentials(Authority::trusted().clientRequest()), server);
    EXPECT_THAT(console.console, StartsWith(refusedByTheOther));
    EXPECT_EQ(console.hypervisor, "rejected: the peer's certificate is refused: certificate has expired");

    const Outcomes hypervisor = start(client, expiredCredentials(Authority::trusted().serverRequest()));
    EXPECT_EQ(hypervisor.console, "rejected: the peer's certificate is refused: certificate has expired");
    EXPECT_THAT(hypervisor.hypervisor, StartsWith(refusedByTheOther));
}

TEST_F(StartTls, ReportsACertificateThatIsNotYetValid)
{
    const Outcomes outcomes = start(futureCredentials(Authority::trusted().clientRequest()), server);
    EXPECT_EQ(outcomes.hypervisor, "rejected: the peer's certificate is refused: certificate is not yet valid");
}

TEST_F(StartTls, ReportsACertificateOfAnotherRoot)
{
    const Outcomes outcomes = start(strangerThatTrustsUs(), server);
    EXPECT_THAT(outcomes.console, StartsWith(refusedByTheOther));
    EXPECT_EQ(outcomes.hypervisor,
              "rejected: the peer's certificate is refused: unable to get local issuer certificate");
}

TEST_F(StartTls, ReportsACertificateWithTheRootsSubject)
{
    const Authority& authority = Authority::trusted();
    const SSLCertificateRequest request(authority.root().getSubject());
    const SSLCertificate impostor = authority.issue(request, SSLValidityPeriod::days(1));
    const Outcomes outcomes = start(client, authority.credentialsOf(impostor));
    EXPECT_THAT(outcomes.console, MatchesRegex("rejected: the peer's certificate is refused: self.signed certificate"));
}

TEST_F(StartTls, BytesThatAreNotTlsBreakTheProtocol)
{
    Loopback loopback;
    SSLServerContext context;
    context.setCredentials(server);
    loopback.near->write("GET / HTTP/1.1\r\n\r\n", 18);
    SSLStream stream(context, std::move(loopback.far));
    EXPECT_EQ(outcomeOf([&] { protocol::startTls(stream); }), "error: the TLS handshake failed: SSL error 1");
}

TEST_F(StartTls, ReportsAPassedDeadline)
{
    Loopback loopback;
    SSLServerContext context;
    context.setCredentials(server);
    loopback.far->setReadDeadline(std::chrono::milliseconds(20));
    SSLStream stream(context, std::move(loopback.far));
    EXPECT_EQ(outcomeOf([&] { protocol::startTls(stream); }), "error: the TLS handshake did not finish in time");
}

} // namespace

} // namespace qel::test
