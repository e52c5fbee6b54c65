#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "base/Failures.hpp"
#include "support/CredentialDirectory.hpp"
#include "support/ScriptedStream.hpp"
#include "tools/transport/Loopback.hpp"
#include "transport/Handshake.hpp"

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
using tool::CommandFailure;
using tool::ExitStatus;

auto failsWith(ExitStatus status, const ::testing::Matcher<std::string>& text)
{
    return Throws<CommandFailure>(AllOf(Property("status", &CommandFailure::getExitStatus, status),
                                        Property("text", &CommandFailure::what, text)));
}

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
    tool::requestUpgrade(stream, kNoDescriptor);
    EXPECT_TRUE(wrote<QelMessageUpgradeConnectionAsync>(stream));
    EXPECT_EQ(stream.bytesLeft(), 0U);
}

TEST(RequestUpgrade, TheAbortMessageIsRefused)
{
    ScriptedStream stream;
    stream.deliver(abortMessage());
    EXPECT_THAT([&] { tool::requestUpgrade(stream, kNoDescriptor); },
                failsWith(ExitStatus::Refused, StartsWith("the server refused this console: ")));
}

TEST(RequestUpgrade, AnyOtherMessageBreaksTheProtocol)
{
    ScriptedStream stream;
    stream.deliver(frameOf(QelMessageGetQelTodReq()));
    EXPECT_THAT([&] { tool::requestUpgrade(stream, kNoDescriptor); },
                failsWith(ExitStatus::ProtocolBroken,
                          StartsWith("the peer did not answer the request for TLS but sent something else: [CID: ")));
}

TEST(RequestUpgrade, BytesThatAreNotAMessageBreakTheProtocol)
{
    ScriptedStream stream;
    stream.deliver(std::vector<char>(64, '\x16'));
    EXPECT_THAT([&] { tool::requestUpgrade(stream, kNoDescriptor); },
                failsWith(ExitStatus::ProtocolBroken,
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
        EXPECT_THAT([&] { tool::requestUpgrade(stream, kNoDescriptor); },
                    failsWith(ExitStatus::ClosedByPeer,
                              "the peer did not answer the request for TLS but ended the connection: EOF"));
    }
}

TEST(RequestUpgrade, ReportsAPassedDeadline)
{
    ScriptedStream stream;
    stream.fail("I/O deadline");
    EXPECT_THAT([&] { tool::requestUpgrade(stream, kNoDescriptor); },
                failsWith(ExitStatus::DeadlinePassed, "the peer did not answer the request for TLS in time"));
}

TEST(RequestUpgrade, NothingBeyondTheAnswerIsRead)
{
    ScriptedStream stream;
    auto both = upgrade();
    both.push_back('x');
    stream.deliver(both);
    tool::requestUpgrade(stream, kNoDescriptor);
    EXPECT_EQ(stream.bytesLeft(), 1U);
}

TEST(RequestUpgrade, BytesAfterTheAnswerBreakTheProtocol)
{
    Loopback loopback;
    auto both = upgrade();
    both.push_back('x');
    loopback.near->write(both.data(), both.size());
    loopback.far->setReadDeadline(Loopback::kDeadline);
    EXPECT_THAT([&] { tool::requestUpgrade(*loopback.far, loopback.far->getSocket().getFd()); },
                failsWith(ExitStatus::ProtocolBroken, "the peer sent data too early in the handshake"));
}

// The hypervisor end's step.

TEST(AwaitUpgrade, TakesTheUpgradeMessageAndAnswersNothingYet)
{
    ScriptedStream stream;
    stream.deliver(upgrade());
    tool::awaitUpgrade(stream, kNoDescriptor);
    EXPECT_TRUE(stream.written().empty());
    tool::grantUpgrade(stream);
    EXPECT_TRUE(wrote<QelMessageUpgradeConnectionAsync>(stream));
}

TEST(AwaitUpgrade, AnyOtherMessageIsAnsweredWithTheAbortMessage)
{
    for (const auto& frame : {frameOf(QelMessageGetQelTodReq()), abortMessage()}) {
        ScriptedStream stream;
        stream.deliver(frame);
        EXPECT_THAT([&] { tool::awaitUpgrade(stream, kNoDescriptor); },
                    failsWith(ExitStatus::ProtocolBroken,
                              StartsWith("the peer did not ask for TLS but sent something else: [CID: ")));
        EXPECT_TRUE(wrote<QelMessageAbortHandshakeAsync>(stream));
    }
}

TEST(AwaitUpgrade, BytesThatAreNotAMessageGetNoAnswer)
{
    ScriptedStream stream;
    stream.deliver(std::vector<char>(64, '\x16'));
    EXPECT_THAT(
        [&] { tool::awaitUpgrade(stream, kNoDescriptor); },
        failsWith(ExitStatus::ProtocolBroken, "the peer did not ask for TLS but sent something else: Invalid length"));
    EXPECT_TRUE(stream.written().empty());
}

TEST(AwaitUpgrade, BytesAfterTheRequestBreakTheProtocol)
{
    Loopback loopback;
    auto both = upgrade();
    both.push_back('x');
    loopback.near->write(both.data(), both.size());
    loopback.far->setReadDeadline(Loopback::kDeadline);
    EXPECT_THAT([&] { tool::awaitUpgrade(*loopback.far, loopback.far->getSocket().getFd()); },
                failsWith(ExitStatus::ProtocolBroken, "the peer sent data too early in the handshake"));
}

TEST(AwaitUpgrade, AConsoleThatShutsDownItsSideIsNotTooEarly)
{
    Loopback loopback;
    loopback.near->write(upgrade().data(), upgrade().size());
    ASSERT_EQ(::shutdown(loopback.near->getSocket().getFd(), SHUT_WR), 0);
    loopback.far->setReadDeadline(Loopback::kDeadline);
    EXPECT_NO_THROW(tool::awaitUpgrade(*loopback.far, loopback.far->getSocket().getFd()));
}

TEST(AbortHandshake, SendsTheAbortMessage)
{
    ScriptedStream stream;
    tool::abortHandshake(stream);
    EXPECT_TRUE(wrote<QelMessageAbortHandshakeAsync>(stream));
}

TEST(GrantUpgrade, ReportsAConsoleThatHasGone)
{
    ScriptedStream stream;
    stream.failWriteAt(0, "gone");
    EXPECT_THAT([&] { tool::grantUpgrade(stream); },
                failsWith(ExitStatus::ClosedByPeer, "the peer did not take the answer to its request for TLS but "
                                                    "ended the connection: gone"));
}

TEST(LimitTo, GivesBothDirectionsTheRemainingTime)
{
    ScriptedStream stream;
    tool::limitTo(stream, TimeProvider::steady() - std::chrono::seconds(1));
    tool::limitTo(stream, TimeProvider::steady() + std::chrono::hours(1));
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
        } catch (const CommandFailure& failure) {
            return std::to_string(static_cast<int>(failure.getExitStatus())) + ": " + failure.what();
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
        std::thread other([&] { outcomes.hypervisor = outcomeOf([&] { tool::startTls(server); }); });
        outcomes.console = outcomeOf([&] { tool::startTls(client); });
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
    const std::string refusedByTheOther =
        "7: the peer closed the connection in the TLS handshake, perhaps because it refuses this end's certificate: ";
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
    EXPECT_EQ(console.hypervisor, "1: the peer's certificate is refused: certificate has expired");

    const Outcomes hypervisor = start(client, expiredCredentials(Authority::trusted().serverRequest()));
    EXPECT_EQ(hypervisor.console, "1: the peer's certificate is refused: certificate has expired");
    EXPECT_THAT(hypervisor.hypervisor, StartsWith(refusedByTheOther));
}

TEST_F(StartTls, ReportsACertificateThatIsNotYetValid)
{
    const Outcomes outcomes = start(futureCredentials(Authority::trusted().clientRequest()), server);
    EXPECT_EQ(outcomes.hypervisor, "1: the peer's certificate is refused: certificate is not yet valid");
}

TEST_F(StartTls, ReportsACertificateOfAnotherRoot)
{
    const Outcomes outcomes = start(strangerThatTrustsUs(), server);
    EXPECT_THAT(outcomes.console, StartsWith(refusedByTheOther));
    EXPECT_EQ(outcomes.hypervisor, "1: the peer's certificate is refused: unable to get local issuer certificate");
}

TEST_F(StartTls, ReportsACertificateWithTheRootsSubject)
{
    const Authority& authority = Authority::trusted();
    const SSLCertificateRequest request(authority.root().getSubject());
    const SSLCertificate impostor = authority.issue(request, SSLValidityPeriod::days(1));
    const Outcomes outcomes = start(client, authority.credentialsOf(impostor));
    EXPECT_THAT(outcomes.console, MatchesRegex("1: the peer's certificate is refused: self.signed certificate"));
}

TEST_F(StartTls, BytesThatAreNotTlsBreakTheProtocol)
{
    Loopback loopback;
    SSLServerContext context;
    context.setCredentials(server);
    loopback.near->write("GET / HTTP/1.1\r\n\r\n", 18);
    SSLStream stream(context, std::move(loopback.far));
    EXPECT_EQ(outcomeOf([&] { tool::startTls(stream); }), "5: the TLS handshake failed: SSL error 1");
}

TEST_F(StartTls, ReportsAPassedDeadline)
{
    Loopback loopback;
    SSLServerContext context;
    context.setCredentials(server);
    loopback.far->setReadDeadline(std::chrono::milliseconds(20));
    SSLStream stream(context, std::move(loopback.far));
    EXPECT_EQ(outcomeOf([&] { tool::startTls(stream); }), "6: the TLS handshake did not finish in time");
}

} // namespace

} // namespace qel::test
