#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLException.hpp>

#include "security/ContextKit.hpp"
#include "support/Authority.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/ssl.h>
#include <string>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::Authority;
using test::clientContext;
using test::connect;
using test::Ends;
using test::Foreign;
using test::handleOf;
using test::namesIn;
using test::serverContext;
using test::trusted;
using test::trusts;
using ::testing::ElementsAre;

// --- handshakes

TEST(SSLContextHandshake, ConnectsTwoEndsOfOneRoot)
{
    const Ends ends = connect(*clientContext(), *serverContext());
    ASSERT_TRUE(ends.bothDone()) << ends.clientReason << ", " << ends.serverReason;
    for (SSL* const ssl : {ends.client.get(), ends.server.get()}) {
        EXPECT_STREQ(SSL_get_version(ssl), "TLSv1.3");
        EXPECT_STREQ(SSL_CIPHER_get_name(SSL_get_current_cipher(ssl)), "TLS_AES_256_GCM_SHA384");
        EXPECT_EQ(SSL_get_verify_result(ssl), X509_V_OK);
        EXPECT_EQ(SSL_get_current_compression(ssl), nullptr);
    }
    const X509_PTR client(SSL_get_peer_certificate(ends.server.get()));
    const X509_PTR server(SSL_get_peer_certificate(ends.client.get()));
    EXPECT_EQ(X509_cmp(client.get(), trusted().client().get()), 0);
    EXPECT_EQ(X509_cmp(server.get(), trusted().server().get()), 0);
}

TEST(SSLContextHandshake, CarriesData)
{
    const Ends ends = connect(*clientContext(), *serverContext());
    ASSERT_TRUE(ends.bothDone());
    ASSERT_EQ(SSL_write(ends.client.get(), "ping", 4), 4);
    char received[8] = {};
    EXPECT_EQ(SSL_read(ends.server.get(), received, sizeof(received)), 4);
    EXPECT_STREQ(received, "ping");
}

TEST(SSLContextHandshake, SendsTheServersRootToTheClient)
{
    SSL_PTR client = clientContext()->allocateConnection();
    std::vector<std::string> told;
    SSL_set_cert_cb(
        client.get(),
        [](SSL* ssl, void* names) {
            *static_cast<std::vector<std::string>*>(names) = namesIn(SSL_get0_peer_CA_list(ssl));
            return 1;
        },
        &told);
    const Ends ends = connect(std::move(client), serverContext()->allocateConnection());
    EXPECT_TRUE(ends.bothDone());
    EXPECT_THAT(told, ElementsAre("/CN=QEL test root"));
}

TEST(SSLContextHandshake, AcceptsTheRootItselfAsACertificate)
{
    const Ends ends = connect(*clientContext(trusted().credentialsOf(trusted().root())), *serverContext());
    EXPECT_TRUE(ends.bothDone()) << ends.serverReason;
}

// Any certificate of the root is accepted in either role; the caller must check who the peer is.
TEST(SSLContextHandshake, ChecksNoName)
{
    const Ends ends =
        connect(*clientContext(trusted().serverCredentials()), *serverContext(trusted().clientCredentials()));
    ASSERT_TRUE(ends.bothDone());
    const X509_PTR server(SSL_get_peer_certificate(ends.client.get()));
    EXPECT_EQ(X509_cmp(server.get(), trusted().client().get()), 0);
}

TEST(SSLContextHandshake, RefusesAServerOfAnotherRoot)
{
    const Ends ends = connect(*clientContext(), *serverContext(Authority::stranger().serverCredentials()));
    EXPECT_FALSE(ends.bothDone());
    EXPECT_EQ(ends.clientError, SSL_ERROR_SSL);
    EXPECT_EQ(ends.clientReason, "certificate verify failed");
    EXPECT_NE(SSL_get_verify_result(ends.client.get()), X509_V_OK);
}

TEST(SSLContextHandshake, RefusesAClientOfAnotherRoot)
{
    // The client trusts the server's root, but has no certificate of it.
    SSLCredentials credentials = Authority::stranger().clientCredentials();
    credentials.mRootCA = trusted().root().getPEM();
    const Ends ends = connect(*clientContext(credentials), *serverContext());
    EXPECT_FALSE(ends.bothDone());
    EXPECT_EQ(ends.serverError, SSL_ERROR_SSL);
    EXPECT_EQ(ends.serverReason, "certificate verify failed");
}

TEST(SSLContextHandshake, RefusesAClientWithoutCertificate)
{
    const Foreign client;
    const Ends ends = connect(client.client(), serverContext()->allocateConnection());
    EXPECT_FALSE(ends.bothDone());
    EXPECT_EQ(ends.serverError, SSL_ERROR_SSL);
    EXPECT_EQ(ends.serverReason, "peer did not return a certificate");
}

TEST(SSLContextHandshake, FailsWithoutCredentials)
{
    SSLClientContext bareClient;
    SSLServerContext bareServer;
    EXPECT_FALSE(connect(bareClient, *serverContext()).bothDone());
    EXPECT_FALSE(connect(*clientContext(), bareServer).bothDone());
    EXPECT_FALSE(connect(bareClient, bareServer).bothDone());
}

TEST(SSLContextHandshake, FailsAfterCredentialsWereRefused)
{
    const SSLCredentials mismatch{trusted().clientCredentials().mCert, trusted().serverCredentials().mKey,
                                  trusted().root().getPEM()};
    SSLClientContext client;
    SSLServerContext server;
    EXPECT_THROW(client.setCredentials(mismatch), SSLException);
    EXPECT_THROW(server.setCredentials(mismatch), SSLException);
    EXPECT_FALSE(connect(client, *serverContext()).bothDone());
    EXPECT_FALSE(connect(*clientContext(), server).bothDone());
}

TEST(SSLContextHandshake, RefusesAnOlderProtocol)
{
    const Foreign oldClient(&trusted().client());
    const Foreign oldServer(&trusted().server());
    ASSERT_EQ(SSL_CTX_set_max_proto_version(oldClient.context.get(), TLS1_2_VERSION), 1);
    ASSERT_EQ(SSL_CTX_set_max_proto_version(oldServer.context.get(), TLS1_2_VERSION), 1);
    ASSERT_TRUE(connect(oldClient.client(), oldServer.server()).bothDone()) << "they would do among themselves";

    const Ends atServer = connect(oldClient.client(), serverContext()->allocateConnection());
    EXPECT_FALSE(atServer.bothDone());
    EXPECT_EQ(atServer.serverError, SSL_ERROR_SSL);
    EXPECT_EQ(atServer.serverReason, "unsupported protocol");

    const Ends atClient = connect(clientContext()->allocateConnection(), oldServer.server());
    EXPECT_FALSE(atClient.bothDone());
    EXPECT_EQ(atClient.clientError, SSL_ERROR_SSL);
}

TEST(SSLContextHandshake, ConnectsPeersMadeWithoutThisLibrary)
{
    const Foreign client(&trusted().client());
    const Foreign server(&trusted().server());
    EXPECT_TRUE(connect(client.client(), serverContext()->allocateConnection()).bothDone());
    // That server requests no certificate; the client verifies.
    EXPECT_TRUE(connect(clientContext()->allocateConnection(), server.server()).bothDone());
}

TEST(SSLContextHandshake, SendsNoSessionTickets)
{
    const std::unique_ptr<SSLClientContext> client = clientContext();
    const std::unique_ptr<SSLServerContext> server = serverContext();
    const Ends first = connect(*client, *server);
    ASSERT_TRUE(first.bothDone());
    SSL_SESSION* const session = SSL_get_session(first.client.get());
    ASSERT_NE(session, nullptr);
    EXPECT_EQ(SSL_SESSION_is_resumable(session), 0);
    EXPECT_EQ(SSL_SESSION_has_ticket(session), 0);

    SSL_PTR again = client->allocateConnection();
    SSL_set_session(again.get(), session);
    const Ends second = connect(std::move(again), server->allocateConnection());
    ASSERT_TRUE(second.bothDone());
    EXPECT_EQ(SSL_session_reused(second.client.get()), 0);
    EXPECT_EQ(SSL_session_reused(second.server.get()), 0);
    EXPECT_EQ(SSL_CTX_sess_number(handleOf(*server)), 0);
    EXPECT_EQ(SSL_CTX_sess_number(handleOf(*client)), 0);
}

} // namespace
} // namespace qel
