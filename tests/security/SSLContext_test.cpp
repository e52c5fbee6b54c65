#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLException.hpp>

#include "support/Authority.hpp"
#include "support/CapturedLog.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <cstddef>
#include <cstring>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::Authority;
using test::CapturedLog;
using test::expectEveryFailureIsReported;
using test::expectSSLErrorAt;
using test::OpenSSLCalls;
using ::testing::AllOf;
using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

static_assert(std::is_abstract<SSLContext>::value, "");
static_assert(std::has_virtual_destructor<SSLContext>::value, "programs hold contexts by their base");
static_assert(!std::is_copy_constructible<SSLContext>::value && !std::is_copy_assignable<SSLContext>::value, "");
static_assert(!std::is_move_constructible<SSLClientContext>::value, "");
static_assert(std::is_default_constructible<SSLClientContext>::value, "");
static_assert(std::is_default_constructible<SSLServerContext>::value, "");
static_assert(sizeof(SSLContext) == 2 * sizeof(void*), "one member beside the table of virtual functions");
static_assert(std::is_aggregate<SSLCredentials>::value, "");

const char* const kBadCertificate = "X509 certificate string is not in a supported format";
const char* const kBadKey = "RSA private key string is not in a supported format";
const char* const kFile = "SSLContext.cpp";

// A context that shows its parts.
class Probe : public SSLContext {
public:
    using SSLContext::mContext;

    SSL_PTR allocateConnection() override { return SSLContext::allocateConnection(); }

    static std::size_t placeOfAllocateConnection() { return placeOf(&Probe::allocateConnection); }
    static std::size_t placeOfSetRootCA() { return placeOf(&Probe::pSetRootCA); }

    std::function<void(SSLCertificate&)> onSetRootCA;

protected:
    void pSetRootCA(SSLCertificate& root) override
    {
        if (onSetRootCA) onSetRootCA(root);
        SSLContext::pSetRootCA(root);
    }

private:
    // The place of a virtual operation in its table, counted in pointers: under the C++ ABI of our platforms a pointer
    // to a virtual member function begins with the byte offset in the table (plus one on some of them).
    template <typename Member>
    static std::size_t placeOf(Member member)
    {
        std::ptrdiff_t offset = 0;
        std::memcpy(&offset, &member, sizeof(offset));
        return static_cast<std::size_t>(offset) / sizeof(void*);
    }
};

const Authority& trusted() { return Authority::trusted(); }

std::unique_ptr<SSLClientContext> clientContext(const SSLCredentials& credentials = trusted().clientCredentials())
{
    auto context = std::make_unique<SSLClientContext>();
    context->setCredentials(credentials);
    return context;
}

std::unique_ptr<SSLServerContext> serverContext(const SSLCredentials& credentials = trusted().serverCredentials())
{
    auto context = std::make_unique<SSLServerContext>();
    context->setCredentials(credentials);
    return context;
}

SSL_CTX* handleOf(SSLContext& context) { return SSL_get_SSL_CTX(context.allocateConnection().get()); }

std::size_t anchorsOf(SSL_CTX* context)
{
    return static_cast<std::size_t>(sk_X509_OBJECT_num(X509_STORE_get0_objects(SSL_CTX_get_cert_store(context))));
}

bool trusts(SSL_CTX* context, const SSLCertificate& root)
{
    const STACK_OF(X509_OBJECT)* const objects = X509_STORE_get0_objects(SSL_CTX_get_cert_store(context));
    for (int i = 0; i < sk_X509_OBJECT_num(objects); ++i)
        if (X509_cmp(X509_OBJECT_get0_X509(sk_X509_OBJECT_value(objects, i)), root.get()) == 0) return true;
    return false;
}

std::vector<std::string> namesIn(const STACK_OF(X509_NAME) * names)
{
    std::vector<std::string> result;
    for (int i = 0; i < sk_X509_NAME_num(names); ++i) {
        char* const text = X509_NAME_oneline(sk_X509_NAME_value(names, i), nullptr, 0);
        result.emplace_back(text);
        OPENSSL_free(text);
    }
    return result;
}

// --- two connections that talk to each other in memory

struct Ends {
    SSL_PTR client;
    SSL_PTR server;
    int clientError = SSL_ERROR_NONE; // how the handshake ended at each end
    int serverError = SSL_ERROR_NONE;
    std::string clientReason; // the first entry of the error queue, in OpenSSL's words
    std::string serverReason;

    bool bothDone() const
    {
        return SSL_is_init_finished(client.get()) != 0 && SSL_is_init_finished(server.get()) != 0 &&
               clientError == SSL_ERROR_NONE && serverError == SSL_ERROR_NONE;
    }
};

// One turn of one end. @return true while it may still go on
bool advance(SSL* ssl, int& error, std::string& reason)
{
    if (error == SSL_ERROR_SSL || error == SSL_ERROR_ZERO_RETURN) return false;
    char byte = 0;
    // Once the handshake is done, reading shows the alert of a peer that is not content.
    const int result = SSL_is_init_finished(ssl) != 0 ? SSL_peek(ssl, &byte, 1) : SSL_do_handshake(ssl);
    error = SSL_get_error(ssl, result);
    if (error == SSL_ERROR_SSL) {
        const char* const text = ERR_reason_error_string(ERR_peek_error());
        reason = text != nullptr ? text : "";
    }
    ERR_clear_error();
    return error == SSL_ERROR_NONE || error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE;
}

Ends connect(SSL_PTR client, SSL_PTR server)
{
    constexpr int kEnoughTurns = 20;
    BIO* clientBio = nullptr;
    BIO* serverBio = nullptr;
    EXPECT_EQ(BIO_new_bio_pair(&clientBio, 0, &serverBio, 0), 1);
    SSL_set_bio(client.get(), clientBio, clientBio);
    SSL_set_bio(server.get(), serverBio, serverBio);

    Ends ends;
    ends.client = std::move(client);
    ends.server = std::move(server);
    for (int i = 0; i < kEnoughTurns; ++i) {
        advance(ends.client.get(), ends.clientError, ends.clientReason);
        advance(ends.server.get(), ends.serverError, ends.serverReason);
    }
    // Nothing is left to be read at an end that waits for more.
    if (ends.clientError == SSL_ERROR_WANT_READ) ends.clientError = SSL_ERROR_NONE;
    if (ends.serverError == SSL_ERROR_WANT_READ) ends.serverError = SSL_ERROR_NONE;
    return ends;
}

Ends connect(SSLContext& client, SSLContext& server)
{
    return connect(client.allocateConnection(), server.allocateConnection());
}

// A peer that was not made by this library.
struct Foreign {
    SSL_CTX_PTR context{SSL_CTX_new(TLS_method())};

    explicit Foreign(const SSLCertificate* certificate = nullptr)
    {
        SSL_CTX_set_verify(context.get(), SSL_VERIFY_NONE, nullptr);
        if (certificate != nullptr) {
            EXPECT_EQ(SSL_CTX_use_certificate(context.get(), certificate->get()), 1);
            EXPECT_EQ(SSL_CTX_use_PrivateKey(context.get(), certificate->getPrivateKey()->get()), 1);
        }
    }

    SSL_PTR client() const
    {
        SSL_PTR connection(SSL_new(context.get()));
        SSL_set_connect_state(connection.get());
        return connection;
    }

    SSL_PTR server() const
    {
        SSL_PTR connection(SSL_new(context.get()));
        SSL_set_accept_state(connection.get());
        return connection;
    }
};

// --- a new context

TEST(SSLContextNew, HasItsOperationsInOrder)
{
    EXPECT_EQ(Probe::placeOfAllocateConnection(), 0U);
    EXPECT_EQ(Probe::placeOfSetRootCA(), 1U);
}

template <typename Context>
class SSLContextNewOfEachSide : public testing::Test {};

using Sides = testing::Types<SSLClientContext, SSLServerContext>;
TYPED_TEST_SUITE(SSLContextNewOfEachSide, Sides, );

TYPED_TEST(SSLContextNewOfEachSide, DemandsAndVerifiesThePeersCertificate)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(SSL_CTX_get_verify_mode(handle), 3);
    EXPECT_EQ(SSL_CTX_get_verify_callback(handle), nullptr);
}

TYPED_TEST(SSLContextNewOfEachSide, LeavesNothingToNegotiate)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(SSL_CTX_get_options(handle) & 0x40024000U, 0x40024000U);
    EXPECT_EQ(SSL_CTX_get_min_proto_version(handle), 0x0304);
    EXPECT_EQ(SSL_CTX_get_max_proto_version(handle), 0);
}

TYPED_TEST(SSLContextNewOfEachSide, KeepsNoSessions)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(SSL_CTX_get_session_cache_mode(handle), 0);
    EXPECT_EQ(SSL_CTX_get_num_tickets(handle), 0U);
}

TYPED_TEST(SSLContextNewOfEachSide, WritesRecordByRecord)
{
    TypeParam context;
    EXPECT_EQ(SSL_CTX_get_mode(handleOf(context)) & SSL_MODE_ENABLE_PARTIAL_WRITE, SSL_MODE_ENABLE_PARTIAL_WRITE);
    EXPECT_EQ(SSL_CTX_get_mode(handleOf(context)) & SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER, 0);
}

TYPED_TEST(SSLContextNewOfEachSide, LeavesTheSecurityLevelToOpenSSL)
{
    const SSL_CTX_PTR untouched(SSL_CTX_new(TLS_method()));
    TypeParam context;
    EXPECT_EQ(SSL_CTX_get_security_level(handleOf(context)), SSL_CTX_get_security_level(untouched.get()));
    EXPECT_EQ(SSL_get_security_level(context.allocateConnection().get()), SSL_CTX_get_security_level(untouched.get()));
}

TYPED_TEST(SSLContextNewOfEachSide, TrustsAndPresentsNothing)
{
    TypeParam context;
    SSL_CTX* const handle = handleOf(context);
    EXPECT_EQ(anchorsOf(handle), 0U);
    EXPECT_EQ(SSL_CTX_get0_certificate(handle), nullptr);
    EXPECT_EQ(SSL_CTX_get0_privatekey(handle), nullptr);
    EXPECT_THAT(namesIn(SSL_CTX_get_client_CA_list(handle)), IsEmpty());
}

TYPED_TEST(SSLContextNewOfEachSide, TakesItsStepsInOrder)
{
    const OpenSSLCalls watch;
    TypeParam context;
    EXPECT_THAT(watch.calls(), ElementsAre("SSL_CTX_new()", "SSL_CTX_set_verify(3)", "SSL_CTX_set_options(1073889280)",
                                           "SSL_CTX_ctrl(44, 0)", // session cache mode
                                           "SSL_CTX_set_num_tickets(0)",
                                           "SSL_CTX_ctrl(123, 772)", // minimum protocol version
                                           "SSL_CTX_ctrl(33, 1)"));  // mode
}

TYPED_TEST(SSLContextNewOfEachSide, ReportsEveryFailure)
{
    EXPECT_EQ(expectEveryFailureIsReported([] { TypeParam context; }, {"SSL_CTX_set_verify", "SSL_CTX_set_options",
                                                                       "SSL_CTX_ctrl(44, 0)", "SSL_CTX_ctrl(33, 1)"}),
              3U);
}

TYPED_TEST(SSLContextNewOfEachSide, IgnoresTheResultOfSettingTheMode)
{
    OpenSSLCalls watch;
    watch.failCall(6);
    TypeParam context;
    EXPECT_EQ(watch.calls().back(), "SSL_CTX_ctrl(33, 1)");
    EXPECT_TRUE(watch.hasFailed());
    ERR_clear_error(); // the one that the failure left
}

// --- connections

TEST(SSLContextConnections, OfAClientConnect)
{
    SSLClientContext context;
    const SSL_PTR connection = context.allocateConnection();
    ASSERT_NE(connection, nullptr);
    EXPECT_EQ(SSL_is_server(connection.get()), 0);
    EXPECT_EQ(SSL_in_before(connection.get()), 1);
    EXPECT_EQ(SSL_get_verify_mode(connection.get()), 3);
}

TEST(SSLContextConnections, OfAServerAccept)
{
    SSLServerContext context;
    const SSL_PTR connection = context.allocateConnection();
    ASSERT_NE(connection, nullptr);
    EXPECT_EQ(SSL_is_server(connection.get()), 1);
    EXPECT_EQ(SSL_in_before(connection.get()), 1);
}

TEST(SSLContextConnections, TakeTheirStepsInOrder)
{
    SSLClientContext client;
    SSLServerContext server;
    const OpenSSLCalls watch;
    client.allocateConnection();
    server.allocateConnection();
    EXPECT_THAT(watch.calls(),
                ElementsAre("SSL_new()", "SSL_set_connect_state()", "SSL_new()", "SSL_set_accept_state()"));
}

TEST(SSLContextConnections, AreNewEachTime)
{
    SSLClientContext context;
    const SSL_PTR first = context.allocateConnection();
    const SSL_PTR second = context.allocateConnection();
    EXPECT_NE(first, second);
    EXPECT_EQ(SSL_get_SSL_CTX(first.get()), SSL_get_SSL_CTX(second.get()));
}

TEST(SSLContextConnections, OutliveTheirContext)
{
    std::unique_ptr<SSLClientContext> client = clientContext();
    std::unique_ptr<SSLServerContext> server = serverContext();
    SSL_PTR clientConnection = client->allocateConnection();
    SSL_PTR serverConnection = server->allocateConnection();
    client.reset();
    server.reset();
    EXPECT_TRUE(connect(std::move(clientConnection), std::move(serverConnection)).bothDone());
}

TEST(SSLContextConnections, HaveNoRoleWithoutAnOverride)
{
    Probe probe;
    const OpenSSLCalls watch;
    EXPECT_NE(probe.allocateConnection(), nullptr);
    EXPECT_THAT(watch.calls(), ElementsAre("SSL_new()"));
}

TEST(SSLContextConnections, ReportEveryFailure)
{
    SSLClientContext client;
    SSLServerContext server;
    EXPECT_EQ(expectEveryFailureIsReported([&] { client.allocateConnection(); }, {"SSL_set_connect_state"}), 1U);
    EXPECT_EQ(expectEveryFailureIsReported([&] { server.allocateConnection(); }, {"SSL_set_accept_state"}), 1U);
}

TEST(SSLContextConnections, AreAllocatedByManyThreads)
{
    constexpr int kThreads = 4;
    constexpr int kConnections = 50;
    const std::unique_ptr<SSLServerContext> context = serverContext();
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i)
        threads.emplace_back([&] {
            for (int n = 0; n < kConnections; ++n)
                EXPECT_EQ(SSL_is_server(context->allocateConnection().get()), 1);
        });
    for (std::thread& thread : threads)
        thread.join();
}

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

TEST(SSLContextCredentials, TellClientsTheRootAtTheServerOnly)
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

TEST(SSLContextCredentials, LetAContextSetTheRootItself)
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

TEST(SSLContextCredentials, InAWrongFormatLeaveTheContextAsItWas)
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

// The reason why a context must not be used after this, until other credentials have been accepted.
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

// --- handshakes

TEST(SSLContextHandshake, JoinsTwoEndsOfOneRoot)
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

TEST(SSLContextHandshake, TellsTheClientTheServersRoot)
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

// Any certificate of the root will do for either role; who the peer is must be asked for.
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
    // Its owner trusts the server's root, but has no certificate of it.
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

TEST(SSLContextHandshake, JoinsForeignEndsOfTheSameProtocol)
{
    const Foreign client(&trusted().client());
    const Foreign server(&trusted().server());
    EXPECT_TRUE(connect(client.client(), serverContext()->allocateConnection()).bothDone());
    // That server asks for no certificate; it is the client that verifies.
    EXPECT_TRUE(connect(clientContext()->allocateConnection(), server.server()).bothDone());
}

TEST(SSLContextHandshake, GivesNothingToResumeASessionWith)
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
