#include <qel/common/security/SSLContext.hpp>

#include "base/Failures.hpp"
#include "certificates/CertificateView.hpp"
#include "support/Authority.hpp"
#include "support/MemoryStreamPair.hpp"
#include "transport/PeerPins.hpp"

#include <gmock/gmock.h>
#include <thread>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::Property;
using ::testing::StrEq;
using ::testing::Throws;
using tool::CommandFailure;
using tool::ExitStatus;
using tool::normalizedFingerprint;
using tool::PeerPins;

std::string repeated(const std::string& text, unsigned times)
{
    std::string all;
    for (unsigned i = 0; i < times; ++i)
        all += text;
    return all;
}

const std::string kNormal = repeated("0A:", 31) + "0A";

TEST(NormalizedFingerprint, AcceptsEverySpelling)
{
    for (const std::string& text : {kNormal, repeated("0a:", 31) + "0a", repeated("0A", 32), repeated("0a", 32)}) {
        EXPECT_EQ(normalizedFingerprint(text), kNormal) << text;
    }
}

TEST(NormalizedFingerprint, RefusesEverythingElse)
{
    const std::vector<std::string> bad{
        "",
        ":",
        "0A",
        repeated("0A", 31),
        repeated("0A", 33),
        repeated("0A", 20), // a SHA-1
        repeated("0A", 31) + "0",
        repeated("0A", 31) + "0G",
        repeated("0A:", 31) + "0G",
        repeated("0A:", 32),
        ":" + repeated("0A:", 31) + "0A",
        repeated("0A:", 30) + "0A0A",
        repeated("0A", 16) + ":" + repeated("0A", 16),
        "0A0" + repeated(":A0", 30) + ":A",
        repeated("0A ", 31) + "0A",
        repeated("0A-", 31) + "0A",
        repeated("0A:", 30) + "0A-0A",
        " " + repeated("0A", 32),
        "SHA256:" + repeated("0A", 32),
    };
    for (const std::string& text : bad)
        EXPECT_EQ(normalizedFingerprint(text), "") << text;
}

/// Both ends of a connection after their handshake.
class CheckPeer : public ::testing::Test {
protected:
    static SSLContext& configured(SSLContext& context, const SSLCredentials& credentials)
    {
        context.setCredentials(credentials);
        return context;
    }

    void SetUp() override
    {
        std::thread other([this] { server.handshake(); });
        client.handshake();
        other.join();
    }

    static std::string serverFingerprint() { return tool::fingerprintOf(Authority::trusted().server()); }

    static auto refusal(const std::string& text)
    {
        return Throws<CommandFailure>(AllOf(Property("status", &CommandFailure::getExitStatus, ExitStatus::Refused),
                                            Property("text", &CommandFailure::what, StrEq(text))));
    }

    MemoryStreamPair memory;
    SSLClientContext clientContext;
    SSLServerContext serverContext;
    SSLStream client{configured(clientContext, Authority::trusted().clientCredentials()), memory.takeClient()};
    SSLStream server{configured(serverContext, Authority::trusted().serverCredentials()), memory.takeServer()};
};

TEST_F(CheckPeer, WithoutPinsAcceptsAnyCertificateOfTheRoot)
{
    EXPECT_NO_THROW(tool::checkPeer(client, {}));
    EXPECT_NO_THROW(tool::checkPeer(server, {}));
}

TEST_F(CheckPeer, TheNameMustBeOneOfThoseGiven)
{
    EXPECT_NO_THROW(tool::checkPeer(client, {{"server"}, {}}));
    EXPECT_NO_THROW(tool::checkPeer(client, {{"other", "server"}, {}}));
    EXPECT_NO_THROW(tool::checkPeer(server, {{"client"}, {}}));
    for (const char* name : {"other", "Server", "serve", "server ", "", "CN=server", "client"}) {
        EXPECT_THAT(
            [&] {
                tool::checkPeer(client, {{name}, {}});
            },
            refusal("wrong peer: the name \"server\" does not match --peer-name"))
            << name;
    }
}

TEST_F(CheckPeer, TheFingerprintMustBeOneOfThoseGiven)
{
    const std::string right = serverFingerprint();
    EXPECT_NO_THROW(tool::checkPeer(client, {{}, {right}}));
    EXPECT_NO_THROW(tool::checkPeer(client, {{}, {kNormal, right}}));
    EXPECT_THAT(
        [&] {
            tool::checkPeer(client, {{}, {kNormal}});
        },
        refusal("wrong peer: the fingerprint " + right + " does not match --peer-fingerprint"));
}

TEST_F(CheckPeer, NameAndFingerprintMustBothBeRight)
{
    EXPECT_NO_THROW(tool::checkPeer(client, {{"server"}, {serverFingerprint()}}));
    EXPECT_THROW(tool::checkPeer(client, {{"server"}, {kNormal}}), CommandFailure);
    EXPECT_THROW(tool::checkPeer(client, {{"other"}, {serverFingerprint()}}), CommandFailure);
}

TEST_F(CheckPeer, ReportsAConnectionThatWasClosedMeanwhile)
{
    client.close();
    EXPECT_THAT([&] { tool::checkPeer(client, {}); },
                Throws<CommandFailure>(Property("status", &CommandFailure::getExitStatus, ExitStatus::ClosedByPeer)));
}

TEST_F(CheckPeer, ThePeerIsDescribedBySubjectAndFingerprint)
{
    EXPECT_EQ(tool::describePeer(client), "\"CN=server\", SHA-256 " + serverFingerprint());
}

class CheckPeerName : public ::testing::Test {
protected:
    /// Looks at a server with a certificate of this subject.
    static void check(const SSLSubject& subject, const std::string& name)
    {
        const Authority& authority = Authority::trusted();
        SSLCertificateRequest request(subject);
        const SSLCertificate certificate = authority.issue(request, SSLValidityPeriod::days(1));
        MemoryStreamPair memory;
        SSLClientContext clientContext;
        SSLServerContext serverContext;
        clientContext.setCredentials(authority.clientCredentials());
        serverContext.setCredentials(authority.credentialsOf(certificate));
        SSLStream client(clientContext, memory.takeClient());
        SSLStream server(serverContext, memory.takeServer());
        std::thread other([&] { server.handshake(); });
        client.handshake();
        other.join();
        tool::checkPeer(client, {{name}, {}});
    }
};

TEST_F(CheckPeerName, IsTheCommonNameAndNoOtherField)
{
    const SSLSubject subject{{"CN", "one"}, {"O", "two"}};
    EXPECT_NO_THROW(check(subject, "one"));
    EXPECT_THROW(check(subject, "two"), CommandFailure);
}

TEST_F(CheckPeerName, NoPinMatchesACertificateWithoutACommonName)
{
    const SSLSubject subject{{"O", "two"}};
    EXPECT_THROW(check(subject, "two"), CommandFailure);
    EXPECT_THROW(check(subject, ""), CommandFailure); // as from a variable that was not set
}

} // namespace

} // namespace qel::test
