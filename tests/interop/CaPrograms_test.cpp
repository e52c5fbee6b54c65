// Credentials that "qel ca" has made, at both ends: the TLS programs of OpenSSL and GnuTLS at one, our streams at the
// other.

#include <qel/common/Utilities.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "support/TlsCalls.hpp"
#include "support/TlsPrograms.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <vector>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::Pair;

using Options = std::vector<std::string>;

/// A directory of "qel ca" with a root and the ends "console" and "hypervisor".
class AuthorityDirectory {
public:
    AuthorityDirectory()
    {
        pRun({"init", mDirectory.path(), "--subject", "CN=Our root,O=Example"});
        for (const std::string name : {"console", "hypervisor"})
            pRun({"issue", mDirectory.path(), name, "--subject", "CN=" + name});
    }

    std::string file(const std::string& name) const { return mDirectory.file(name); }

    SSLCredentials credentialsOf(const std::string& name) const
    {
        return {pRead(name + ".crt"), pRead(name + ".key"), pRead("root.crt")};
    }

private:
    void pRun(Options arguments) const
    {
        arguments.insert(arguments.begin(), {QEL_PROGRAM, "ca"});
        const Process::Result result = run(arguments);
        EXPECT_EQ(result.exitStatus, 0) << result.errors;
    }

    std::string pRead(const std::string& name) const { return Utilities::readFile(file(name)); }

    TemporaryDirectory mDirectory;
};

const AuthorityDirectory& authority()
{
    static const AuthorityDirectory sAuthority;
    return sAuthority;
}

class CaPrograms : public ProgramTest {
protected:
    CaPrograms()
    {
        mClientSide.setCredentials(authority().credentialsOf("console"));
        mServerSide.setCredentials(authority().credentialsOf("hypervisor"));
    }

    static Options opensslCredentials(const std::string& name)
    {
        return {"-cert",
                authority().file(name + ".crt"),
                "-key",
                authority().file(name + ".key"),
                "-CAfile",
                authority().file("root.crt"),
                "-verify_return_error"};
    }

    static Options gnutlsCredentials(const std::string& name)
    {
        return {"--x509certfile", authority().file(name + ".crt"), "--x509keyfile", authority().file(name + ".key"),
                "--x509cafile",   authority().file("root.crt")};
    }

    static std::unique_ptr<Process> startWith(Options command, const Options& more)
    {
        command.insert(command.end(), more.begin(), more.end());
        return start(command);
    }

    SSLClientContext mClientSide;
    SSLServerContext mServerSide;
};

TEST_F(CaPrograms, OpensslClientAndOurServerTalk)
{
    skipWithout("openssl");
    if (IsSkipped()) return;
    const auto client =
        startWith({"openssl", "s_client", "-connect", "127.0.0.1:" + listen()}, opensslCredentials("console"));
    client->writeInput("v");
    const auto server = acceptClient(mServerSide);
    ASSERT_EQ(here([&server] { server->handshake(); }).failure, "") << client->errors();
    EXPECT_THAT(server->getPeerCertificate()->getSubject(), ElementsAre(Pair("CN", "console")));
    EXPECT_THAT(server->getPeerCertificate()->getIssuer(), ElementsAre(Pair("CN", "Our root"), Pair("O", "Example")));
    writeText(*server, "from the server\n");
    client->awaitOutput("from the server\n");
    client->writeInput("from the client\n");
    EXPECT_EQ(readExactly(*server, 16), "from the client\n");
    server->close();
    EXPECT_THAT(client->wait().output, HasSubstr("Verify return code: 0 (ok)"));
}

TEST_F(CaPrograms, OpensslServerAndOurClientTalk)
{
    skipWithout("openssl");
    if (IsSkipped()) return;
    const auto server = startWith({"openssl", "s_server", "-accept", "127.0.0.1:0", "-naccept", "1", "-Verify", "1"},
                                  opensslCredentials("hypervisor"));
    server->writeInput("v");
    const auto client = connectTo(*server, mClientSide);
    ASSERT_EQ(here([&client] { client->handshake(); }).failure, "") << server->errors();
    EXPECT_THAT(client->getPeerCertificate()->getSubject(), ElementsAre(Pair("CN", "hypervisor")));
    writeText(*client, "from the client\n");
    server->awaitOutput("from the client\n");
    server->writeInput("from the server\n");
    EXPECT_EQ(readExactly(*client, 16), "from the server\n");
}

TEST_F(CaPrograms, GnutlsClientAndOurServerTalk)
{
    skipWithout("gnutls-cli");
    if (IsSkipped()) return;
    Options options = gnutlsCredentials("console");
    options.emplace_back("127.0.0.1");
    const auto client = startWith({"gnutls-cli", "--port", listen(), "--verify-hostname", "hypervisor"}, options);
    client->writeInput("version\n");
    const auto server = acceptClient(mServerSide);
    ASSERT_EQ(here([&server] { server->handshake(); }).failure, "") << client->output();
    EXPECT_THAT(server->getPeerCertificate()->getSubject(), ElementsAre(Pair("CN", "console")));
    EXPECT_EQ(readExactly(*server, 7), "ersion\n");
    writeText(*server, "from the server\n");
    client->awaitOutput("from the server\n");
    server->close();
    EXPECT_THAT(client->wait().output, HasSubstr("The certificate is trusted"));
}

TEST_F(CaPrograms, GnutlsServerAndOurClientTalk)
{
    skipWithout("gnutls-serv");
    if (IsSkipped()) return;
    Options command{"gnutls-serv", "--port", "0", "--echo", "--require-client-cert", "--verify-client-cert"};
    const Options credentials = gnutlsCredentials("hypervisor");
    command.insert(command.end(), credentials.begin(), credentials.end());
    const auto server = startOnLoopback(command);
    const auto client = connectTo(*server, mClientSide);
    {
        // It answers whole lines of text only, so the version that we send must be one.
        TlsCalls calls;
        calls.SSL_write = [](SSL* ssl, const void*, int) { return SSL_write(ssl, "\n", 1); };
        ASSERT_EQ(here([&client] { client->handshake(); }).failure, "") << server->output() << server->errors();
    }
    EXPECT_THAT(client->getPeerCertificate()->getSubject(), ElementsAre(Pair("CN", "hypervisor")));
    writeText(*client, "hello\n");
    EXPECT_EQ(readExactly(*client, 6), "hello\n");
}

} // namespace

} // namespace qel::test
