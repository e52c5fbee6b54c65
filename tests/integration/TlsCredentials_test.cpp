// Credentials of the program: those that it refuses, those that its peers refuse, and their exchange by SIGHUP.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/CertificateFacts.hpp>

#include "integration/TlsConsole.hpp"
#include "integration/TlsTest.hpp"
#include "integration/WrongServer.hpp"
#include "support/RawTlsPeer.hpp"

#include <csignal>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

constexpr unsigned int kUpgrade = QelMessageOpUpgradeConnection;

/// Forwards to a stream that it does not own.
class BorrowedStream : public Stream {
public:
    explicit BorrowedStream(Stream& stream) : mStream(stream) {}

    void close() override { mStream.close(); }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mStream.setReadDeadline(timeout); }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mStream.setWriteDeadline(timeout); }
    std::size_t read(char* buffer, std::size_t length) override { return mStream.read(buffer, length); }
    void write(const char* buffer, std::size_t length) override { mStream.write(buffer, length); }

private:
    Stream& mStream;
};

SSLCredentials strangerThatTrustsUs()
{
    SSLCredentials credentials = Authority::stranger().clientCredentials();
    credentials.mRootCA = Authority::trusted().root().getPEM();
    return credentials;
}

// Certificates that the peer refuses.

TEST_F(Tls, AServerOfAnotherRootIsRefused)
{
    const auto server = serve();
    directory.put("stranger", Authority::stranger().clientCredentials());
    Utilities::writeFile(directory.file("other-root.crt"), Authority::stranger().root().getPEM());
    const auto result = withoutPinNote(
        runQel({"call", "--connect", server->endpoint(), "--cert", directory.file("stranger.crt"), "--key",
                directory.file("stranger.key"), "--root", directory.file("other-root.crt"), "time"}));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.errors,
                AllOf(StartsWith(prefix(server->endpoint()) + "the peer's certificate is refused: "),
                      EndsWith("certificate in certificate chain\n"))); // versions spell "self-signed" differently
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: the peer closed the connection in the TLS handshake, "
                                                 "perhaps because it refuses this end's certificate: EOF\n"));
}

TEST_F(Tls, AClientOfAnotherRootIsRefused)
{
    const auto server = serve();
    directory.put("stranger", strangerThatTrustsUs());
    const auto result = call(*server, {}, "stranger");
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.errors,
                StartsWith(prefix(server->endpoint()) + "the peer closed the connection in the TLS handshake, perhaps "
                                                        "because it refuses this end's certificate: "));
    EXPECT_EQ(result.output, "");
    EXPECT_EQ(call(*server).exitStatus, 0);
    EXPECT_THAT(server->stop().errors,
                AllOf(HasSubstr("(E): SSL peer certificate verification failed: unable to get local issuer "
                                "certificate\n"),
                      HasSubstr(": refused: the peer's certificate is refused: unable to get local "
                                "issuer certificate\n"),
                      Not(HasSubstr("console 2 connected"))));
}

TEST_F(Tls, RefusesAPeerWhoseCertificateIsExpired)
{
    // A scripted server: qel serve refuses to start with such a certificate.
    const WrongServer server([](LoopbackMessages& messages) {
        messages.receive();
        messages.send(QelMessageUpgradeConnectionAsync());
        SSLServerContext context;
        context.setCredentials(expiredCredentials(Authority::trusted().serverRequest()));
        SSLStream(context, std::make_unique<BorrowedStream>(messages.stream())).handshake();
    });
    const auto result = callTo(server.endpoint());
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              prefix(server.endpoint()) + "the peer's certificate is refused: certificate has expired\n");
}

TEST_F(Tls, TheServerRefusesAClientWhoseCertificateIsExpired)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.ask();
    ASSERT_EQ(console.takeAnswer(), kUpgrade);
    EXPECT_THROW(console.startTls(expiredCredentials(Authority::trusted().clientRequest())), StreamIOException);
    EXPECT_THAT(server->stop().errors,
                HasSubstr(": refused: the peer's certificate is refused: certificate has expired\n"));
}

TEST_F(Tls, TheServerRefusesAClientWhoseCertificateIsNotYetValid)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.ask();
    ASSERT_EQ(console.takeAnswer(), kUpgrade);
    EXPECT_THROW(console.startTls(futureCredentials(Authority::trusted().clientRequest())), StreamIOException);
    EXPECT_THAT(server->stop().errors, HasSubstr("certificate is not yet valid\n"));
}

TEST_F(Tls, RefusesAClientWithoutACertificate)
{
    const auto server = serve();
    TlsConsole console(server->endpoint());
    console.ask();
    ASSERT_EQ(console.takeAnswer(), kUpgrade);
    RawTlsPeer anonymous(RawTlsPeer::Client, {}, console.takeStream());
    anonymous.handshake(); // succeeds: the refusal comes later
    EXPECT_EQ(anonymous.read(1), "");
    EXPECT_THAT(server->stop().errors, AllOf(HasSubstr("peer did not return a certificate"),
                                             HasSubstr(": refused: the TLS handshake failed: SSL error 1\n")));
}

TEST_F(Tls, RefusesAClientWithTls12)
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
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: the TLS handshake failed: SSL error 1\n"));
}

// Own credentials that cannot be used.

TEST_F(Tls, RefusesAKeyThatOthersMayReadUnlessAllowed)
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

TEST_F(Tls, TheServerDoesNotStartWithAnExpiredCertificateOfItsOwn)
{
    directory.put("server", expiredCredentials(Authority::trusted().serverRequest()));
    const auto result = runQel(Arguments{"serve"} + directory.options("server"));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.output, "") << "it listened";
    EXPECT_EQ(result.errors, "qel: own certificate " + directory.file("server.crt") + " expired at " +
                                 endOf("server.crt") + ": replace it\n");
}

TEST_F(Tls, TheServerDoesNotStartWithACertificateOfItsOwnThatIsNotYetValid)
{
    directory.put("server", futureCredentials(Authority::trusted().serverRequest()));
    const auto result = runQel(Arguments{"serve"} + directory.options("server"));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.output, "") << "it listened";
    EXPECT_EQ(result.errors, "qel: own certificate " + directory.file("server.crt") + " is not valid before " +
                                 startOf("server.crt") + ": replace it, or correct this machine's clock\n");
}

TEST_F(Tls, ClientsCheckTheirOwnCertificateBeforeTheyConnect)
{
    directory.put("client", expiredCredentials(Authority::trusted().clientRequest()));
    const std::string reason = "own certificate " + directory.file("client.crt") + " expired at " +
                               endOf("client.crt") + ": replace it\n"; // bench also says which of its connections
    const Arguments to = Arguments{"--connect", "127.0.0.1:1"} + directory.options("client"); // where nothing listens
    for (const Arguments& command : {Arguments{"call"} + to + Arguments{"limits"},
                                     Arguments{"console"} + to + Arguments{"1"}, Arguments{"bench"} + to}) {
        SCOPED_TRACE(command.front());
        const auto result = runQel(command);
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_THAT(result.errors, AllOf(StartsWith("qel: "), EndsWith(reason)));
    }
}

TEST_F(Tls, MissingCredentialFilesAreALocalFailure)
{
    const auto result = callTo("127.0.0.1:1", {}, "nobody");
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_THAT(result.errors, StartsWith("qel: cannot open " + directory.file("nobody.crt")));
    EXPECT_EQ(runQel(Arguments{"serve"} + directory.options("nobody")).exitStatus, 4);
}

TEST_F(Tls, RefusesAKeyThatDoesNotMatchTheCertificate)
{
    Utilities::writeFile(directory.file("client.crt"), Authority::trusted().server().getPEM());
    const auto result = callTo("127.0.0.1:1");
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.errors, HasSubstr("cannot be used: they do not belong together"));
}

// New credentials.

TEST_F(Tls, SighupLoadsTheCredentialsForNewConnections)
{
    const auto server = serve({"--partition", "1=cat"});
    TlsConsole old(server->endpoint());
    old.comeIn("old");

    const Authority& authority = Authority::trusted();
    const SSLCertificate fresh = authority.issue(authority.serverRequest(), SSLValidityPeriod::days(1));
    const Arguments pin{"--peer-fingerprint", fingerprintOf(fresh)};
    directory.put("server", authority.credentialsOf(fresh));
    EXPECT_EQ(call(*server, pin).exitStatus, 1) << "before SIGHUP";
    server->process().signal(SIGHUP);
    server->process().awaitErrors("(I): [qel] SIGHUP: loaded " + directory.file("server.crt") +
                                  " for new connections\n");
    const auto result = call(*server, pin);
    EXPECT_EQ(result.exitStatus, 0) << result.errors;

    EXPECT_EQ(old.messages().ask(QelMessageGetQelTodReq())->getStatus(), 0U);
    EXPECT_EQ(fingerprintOf(*old.tls().getPeerCertificate()), fingerprintOf(authority.server()));
    server->stop();
}

TEST_F(Tls, SighupKeepsTheOldCredentialsWhenTheNewOnesCannotBeUsed)
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

    const SSLCredentials expired = expiredCredentials(Authority::trusted().serverRequest());
    Utilities::writeFile(directory.file("server.crt"), expired.mCert); // of the same key
    server->process().signal(SIGHUP);
    server->process().awaitErrors(line + "own certificate " + directory.file("server.crt") + " expired at " +
                                  endOf("server.crt") + ": replace it\n");
    EXPECT_EQ(call(*server).exitStatus, 0);

    ASSERT_EQ(::unlink(directory.file("server.crt").c_str()), 0);
    server->process().signal(SIGHUP);
    server->process().awaitErrors(line + "cannot open " + directory.file("server.crt"));
    const Arguments pin{"--peer-fingerprint", fingerprintOf(Authority::trusted().server())};
    EXPECT_EQ(call(*server, pin).exitStatus, 0);
    EXPECT_EQ(old.messages().ask(QelMessageGetQelTodReq())->getStatus(), 0U);
    server->stop();
}

TEST_F(Tls, ANewRootAffectsNewConnectionsOnly)
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
