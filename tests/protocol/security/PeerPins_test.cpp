#include <qel/common/security/CertificateFacts.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/PeerPins.hpp>

#include "support/Authority.hpp"
#include "support/Errors.hpp"
#include "support/MemoryStreamPair.hpp"

#include <gmock/gmock.h>
#include <thread>

namespace qel::test {

namespace {

using protocol::identityOf;
using protocol::normalizedFingerprint;
using protocol::PeerPins;
using ::testing::StrEq;

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

    static std::string serverFingerprint() { return fingerprintOf(Authority::trusted().server()); }

    static auto refusal(const std::string& text) { return failsWith<protocol::CertificateRejected>(StrEq(text)); }

    MemoryStreamPair memory;
    SSLClientContext clientContext;
    SSLServerContext serverContext;
    SSLStream client{configured(clientContext, Authority::trusted().clientCredentials()), memory.takeClient()};
    SSLStream server{configured(serverContext, Authority::trusted().serverCredentials()), memory.takeServer()};
};

TEST_F(CheckPeer, WithoutPinsAcceptsAnyCertificateOfTheRoot)
{
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(client), {}));
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(server), {}));
}

TEST_F(CheckPeer, TheNameMustBeOneOfThoseGiven)
{
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(client), {{"server"}, {}}));
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(client), {{"other", "server"}, {}}));
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(server), {{"client"}, {}}));
    for (const char* name : {"other", "Server", "serve", "server ", "", "CN=server", "client"}) {
        EXPECT_THAT(
            [&] {
                protocol::checkPeer(identityOf(client), {{name}, {}});
            },
            refusal("wrong peer: the name \"server\" does not match the pinned names"))
            << name;
    }
}

TEST_F(CheckPeer, TheFingerprintMustBeOneOfThoseGiven)
{
    const std::string right = serverFingerprint();
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(client), {{}, {right}}));
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(client), {{}, {kNormal, right}}));
    EXPECT_THAT(
        [&] {
            protocol::checkPeer(identityOf(client), {{}, {kNormal}});
        },
        refusal("wrong peer: the fingerprint " + right + " does not match the pinned fingerprints"));
}

TEST_F(CheckPeer, NameAndFingerprintMustBothBeRight)
{
    EXPECT_NO_THROW(protocol::checkPeer(identityOf(client), {{"server"}, {serverFingerprint()}}));
    EXPECT_THROW(protocol::checkPeer(identityOf(client), {{"server"}, {kNormal}}), protocol::CertificateRejected);
    EXPECT_THROW(protocol::checkPeer(identityOf(client), {{"other"}, {serverFingerprint()}}),
                 protocol::CertificateRejected);
}

TEST_F(CheckPeer, ReportsAConnectionThatWasClosedMeanwhile)
{
    client.close();
    EXPECT_THAT([&] { protocol::checkPeer(identityOf(client), {}); },
                failsWith<protocol::ClosedByPeer>(StrEq("the connection is closed")));
}

TEST_F(CheckPeer, ThePeerIsDescribedBySubjectAndFingerprint)
{
    EXPECT_EQ(protocol::describePeer(identityOf(client)), "\"CN=server\", SHA-256 " + serverFingerprint());
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
        protocol::checkPeer(identityOf(client), {{name}, {}});
    }
};

TEST_F(CheckPeerName, IsTheCommonNameAndNoOtherField)
{
    const SSLSubject subject{{"CN", "one"}, {"O", "two"}};
    EXPECT_NO_THROW(check(subject, "one"));
    EXPECT_THROW(check(subject, "two"), protocol::CertificateRejected);
}

TEST_F(CheckPeerName, NoPinMatchesACertificateWithoutACommonName)
{
    const SSLSubject subject{{"O", "two"}};
    EXPECT_THROW(check(subject, "two"), protocol::CertificateRejected);
    EXPECT_THROW(check(subject, ""), protocol::CertificateRejected); // as from a variable that was not set
}

} // namespace

} // namespace qel::test
