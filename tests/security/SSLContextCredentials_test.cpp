#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLException.hpp>

#include "security/ContextKit.hpp"
#include "support/Authority.hpp"
#include "support/CapturedLog.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/ssl.h>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::anchorsOf;
using test::Authority;
using test::CapturedLog;
using test::clientContext;
using test::connect;
using test::Ends;
using test::expectEveryFailureIsReported;
using test::expectSSLErrorAt;
using test::handleOf;
using test::kBadCertificate;
using test::kBadKey;
using test::namesIn;
using test::OpenSSLCalls;
using test::Probe;
using test::serverContext;
using test::trusted;
using test::trusts;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

const char* const kFile = "SSLContext.cpp";

// --- credentials

TEST(SSLCredentials, HoldCertificateKeyAndRootInThisOrder)
{
    const SSLCredentials credentials{"cert", "key", "root"};
    EXPECT_EQ(credentials.mCert, "cert");
    EXPECT_EQ(credentials.mKey, "key");
    EXPECT_EQ(credentials.mRootCA, "root");
}

TEST(SSLContextCredentials, InstallRootCertificateAndKey)
{
    Probe probe;
    probe.setCredentials(trusted().clientCredentials());
    SSL_CTX* const handle = probe.mContext.get();
    EXPECT_EQ(anchorsOf(handle), 1U);
    EXPECT_TRUE(trusts(handle, trusted().root()));
    EXPECT_EQ(X509_cmp(SSL_CTX_get0_certificate(handle), trusted().client().get()), 0);
    EXPECT_EQ(EVP_PKEY_cmp(SSL_CTX_get0_privatekey(handle), trusted().client().getPrivateKey()->get()), 1);
}

TEST(SSLContextCredentials, AreReplacedByLaterOnes)
{
    SSLServerContext context;
    context.setCredentials(trusted().serverCredentials());
    context.setCredentials(Authority::stranger().serverCredentials());
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(anchorsOf(handle), 1U);
    EXPECT_TRUE(trusts(handle, Authority::stranger().root()));
    EXPECT_EQ(X509_cmp(SSL_CTX_get0_certificate(handle), Authority::stranger().server().get()), 0);
    EXPECT_THAT(namesIn(SSL_CTX_get_client_CA_list(handle)), ElementsAre("/CN=another root"));
}

TEST(SSLContextCredentials, OnlyTheServerAnnouncesItsRoot)
{
    EXPECT_THAT(namesIn(SSL_CTX_get_client_CA_list(handleOf(*serverContext()))), ElementsAre("/CN=QEL test root"));
    EXPECT_THAT(namesIn(SSL_CTX_get_client_CA_list(handleOf(*clientContext()))), IsEmpty());
}

TEST(SSLContextCredentials, AreInstalledInOrder)
{
    const SSLCredentials credentials = trusted().serverCredentials();
    const std::vector<std::string> parsing = {
        "BIO_new_mem_buf", "PEM_read_bio_X509",                                                        // the root
        "BIO_new_mem_buf", "PEM_read_bio_RSAPrivateKey", "EVP_PKEY_new",          "EVP_PKEY_set1_RSA", // the key
        "BIO_new_mem_buf", "PEM_read_bio_X509", // the certificate
        "X509_STORE_new",  "X509_STORE_add_cert",        "SSL_CTX_set_cert_store"};
    const std::vector<std::string> installing = {"SSL_CTX_use_certificate", "SSL_CTX_use_PrivateKey",
                                                 "SSL_CTX_check_private_key"};
    const auto namesOf = [](const OpenSSLCalls& watch) {
        std::vector<std::string> names;
        for (const std::string& call : watch.calls())
            names.push_back(test::nameOf(call));
        return names;
    };
    SSLClientContext client;
    SSLServerContext server;
    {
        const OpenSSLCalls watch;
        client.setCredentials(credentials);
        std::vector<std::string> expected = parsing;
        expected.insert(expected.end(), installing.begin(), installing.end());
        EXPECT_EQ(namesOf(watch), expected);
    }
    {
        const OpenSSLCalls watch;
        server.setCredentials(credentials);
        std::vector<std::string> expected = parsing;
        expected.insert(expected.end(), {"SSL_CTX_set_client_CA_list", "SSL_CTX_add_client_CA"});
        expected.insert(expected.end(), installing.begin(), installing.end());
        EXPECT_EQ(namesOf(watch), expected);
    }
}

TEST(SSLContextCredentials, AreInstalledThroughAnOverriddenSetRootCA)
{
    Probe probe;
    std::string seen;
    probe.onSetRootCA = [&](SSLCertificate& root) {
        seen = root.getPEM();
        EXPECT_EQ(root.getPrivateKey(), nullptr);
        EXPECT_EQ(SSL_CTX_get0_certificate(probe.mContext.get()), nullptr) << "the root comes first";
    };
    probe.setCredentials(trusted().clientCredentials());
    EXPECT_EQ(seen, trusted().root().getPEM());
}

TEST(SSLContextCredentials, AreParsedRootThenKeyThenCertificate)
{
    const SSLCredentials good = trusted().clientCredentials();
    const struct {
        const char* label;
        SSLCredentials credentials;
        const char* complaint;
        std::vector<std::string> read;
    } rows[] = {
        {"nothing", {"", "", ""}, kBadCertificate, {"PEM_read_bio_X509()"}},
        {"bad root", {good.mCert, good.mKey, "x"}, kBadCertificate, {"PEM_read_bio_X509()"}},
        {"bad root and key", {good.mCert, "x", "x"}, kBadCertificate, {"PEM_read_bio_X509()"}},
        {"bad key", {good.mCert, "x", good.mRootCA}, kBadKey, {"PEM_read_bio_X509()", "PEM_read_bio_RSAPrivateKey()"}},
        {"bad key and certificate",
         {"x", "x", good.mRootCA},
         kBadKey,
         {"PEM_read_bio_X509()", "PEM_read_bio_RSAPrivateKey()"}},
        {"bad certificate",
         {"x", good.mKey, good.mRootCA},
         kBadCertificate,
         {"PEM_read_bio_X509()", "PEM_read_bio_RSAPrivateKey()", "PEM_read_bio_X509()"}},
        {"key and certificate exchanged",
         {good.mKey, good.mCert, good.mRootCA},
         kBadKey,
         {"PEM_read_bio_X509()", "PEM_read_bio_RSAPrivateKey()"}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.label);
        SSLServerContext context;
        const OpenSSLCalls watch;
        EXPECT_THAT([&] { context.setCredentials(row.credentials); },
                    ThrowsMessage<SSLException>(StrEq(row.complaint)));
        std::vector<std::string> read;
        for (const std::string& call : watch.calls())
            if (call.rfind("PEM_read", 0) == 0) read.push_back(call);
        EXPECT_EQ(read, row.read);
    }
}

TEST(SSLContextCredentials, InAWrongFormatLeaveTheContextUnchanged)
{
    Probe probe;
    probe.setCredentials(trusted().clientCredentials());
    X509_STORE* const store = SSL_CTX_get_cert_store(probe.mContext.get());
    X509* const certificate = SSL_CTX_get0_certificate(probe.mContext.get());

    const SSLCredentials other = Authority::stranger().clientCredentials();
    for (const SSLCredentials& credentials :
         {SSLCredentials{"", other.mKey, other.mRootCA}, SSLCredentials{other.mCert, "", other.mRootCA},
          SSLCredentials{other.mCert, other.mKey, ""}}) {
        EXPECT_THROW(probe.setCredentials(credentials), SSLException);
        EXPECT_EQ(SSL_CTX_get_cert_store(probe.mContext.get()), store);
        EXPECT_EQ(SSL_CTX_get0_certificate(probe.mContext.get()), certificate);
        EXPECT_NE(SSL_CTX_get0_privatekey(probe.mContext.get()), nullptr);
    }
    EXPECT_TRUE(trusts(probe.mContext.get(), trusted().root()));
}

TEST(SSLContextCredentials, WithTheKeyOfAnotherCertificateAreRefused)
{
    const SSLCredentials good = trusted().clientCredentials();
    const SSLCredentials mismatch{good.mCert, trusted().serverCredentials().mKey, good.mRootCA};
    SSLClientContext client;
    SSLServerContext server;
    for (SSLContext* const context : {static_cast<SSLContext*>(&client), static_cast<SSLContext*>(&server)}) {
        const CapturedLog log;
        expectSSLErrorAt(kFile, [&] { context->setCredentials(mismatch); });
        EXPECT_THAT(log.lines(), AllOf(Not(IsEmpty()), Each(StartsWith("E: [libssl] "))));
    }
}

// This is why a context must not be used after a failure until other credentials are accepted.
TEST(SSLContextCredentials, ThatAreRefusedMayBeInstalledInPart)
{
    Probe probe;
    probe.setCredentials(trusted().clientCredentials());
    const SSLCredentials other = Authority::stranger().clientCredentials();
    EXPECT_THROW(probe.setCredentials({other.mCert, trusted().clientCredentials().mKey, other.mRootCA}), SSLException);
    SSL_CTX* const handle = probe.mContext.get();
    EXPECT_TRUE(trusts(handle, Authority::stranger().root()));
    EXPECT_FALSE(trusts(handle, trusted().root()));
    EXPECT_EQ(SSL_CTX_get0_privatekey(handle), nullptr);
    X509* const certificate = SSL_CTX_get0_certificate(handle); // some versions of OpenSSL drop it with the key
    if (certificate != nullptr) {
        EXPECT_EQ(X509_cmp(certificate, Authority::stranger().client().get()), 0);
    }

    probe.setCredentials(trusted().clientCredentials());
    EXPECT_TRUE(trusts(handle, trusted().root()));
    EXPECT_NE(SSL_CTX_get0_privatekey(handle), nullptr);
}

TEST(SSLContextCredentials, ReportEveryFailure)
{
    const SSLCredentials credentials = trusted().serverCredentials();
    const std::set<std::string> exceptions = {"PEM_read_bio_X509", "PEM_read_bio_RSAPrivateKey",
                                              "SSL_CTX_set_cert_store", "SSL_CTX_set_client_CA_list"};
    SSLClientContext client;
    SSLServerContext server;
    EXPECT_EQ(expectEveryFailureIsReported([&] { client.setCredentials(credentials); }, exceptions), 10U);
    EXPECT_EQ(expectEveryFailureIsReported([&] { server.setCredentials(credentials); }, exceptions), 11U);
}

TEST(SSLContextCredentials, KeepTheEarlierRootWhenTheNewOneCannotBeStored)
{
    for (const char* name : {"X509_STORE_new", "X509_STORE_add_cert"}) {
        SCOPED_TRACE(name);
        Probe probe;
        probe.setCredentials(trusted().clientCredentials());
        const SSLCredentials other = Authority::stranger().clientCredentials();
        OpenSSLCalls watch;
        watch.failNext(name);
        EXPECT_THROW(probe.setCredentials(other), SSLException);
        EXPECT_TRUE(watch.hasFailed());
        EXPECT_EQ(anchorsOf(probe.mContext.get()), 1U);
        EXPECT_TRUE(trusts(probe.mContext.get(), trusted().root()));
        EXPECT_EQ(X509_cmp(SSL_CTX_get0_certificate(probe.mContext.get()), trusted().client().get()), 0);
    }
}

TEST(SSLContextCredentials, OfAnExistingConnectionDoNotChange)
{
    const std::unique_ptr<SSLClientContext> client = clientContext();
    const std::unique_ptr<SSLServerContext> server = serverContext();
    SSL_PTR earlier = client->allocateConnection();
    client->setCredentials(trusted().serverCredentials());
    const Ends ends = connect(std::move(earlier), server->allocateConnection());
    ASSERT_TRUE(ends.bothDone());
    const X509_PTR seen(SSL_get_peer_certificate(ends.server.get()));
    EXPECT_EQ(X509_cmp(seen.get(), trusted().client().get()), 0);
}

} // namespace
} // namespace qel
