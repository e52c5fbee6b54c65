#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLContext.hpp>

#include "security/SSLCheck.hpp"

namespace qel {

namespace {

constexpr auto kOptions = SSL_OP_NO_RENEGOTIATION | SSL_OP_NO_COMPRESSION | SSL_OP_NO_TICKET;
static_assert(kOptions == 0x40024000, "no renegotiation, no compression, no tickets");

} // namespace

// The mode lets SSL_write(3) return after each record, so that one record is sent before the next is encrypted. Tickets
// need two settings: the option is for older protocols, the number for TLS 1.3.
SSLContext::SSLContext() : mContext(SSL_CTX_new(TLS_method()))
{
    checkSSL(mContext != nullptr);
    SSL_CTX* const context = mContext.get();
    SSL_CTX_set_verify(context, SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT, nullptr);
    SSL_CTX_set_options(context, kOptions);
    SSL_CTX_set_session_cache_mode(context, SSL_SESS_CACHE_OFF);
    checkSSL(SSL_CTX_set_num_tickets(context, 0) == 1);
    checkSSL(SSL_CTX_set_min_proto_version(context, TLS1_3_VERSION) == 1);
    SSL_CTX_set_mode(context, SSL_MODE_ENABLE_PARTIAL_WRITE);
}

SSLContext::~SSLContext() = default;

SSL_PTR SSLContext::allocateConnection()
{
    SSL_PTR connection(SSL_new(mContext.get()));
    checkSSL(connection != nullptr);
    return connection;
}

void SSLContext::setCredentials(const SSLCredentials& credentials)
{
    SSLCertificate root(credentials.mRootCA);
    const RSAPrivateKey key(credentials.mKey);
    const SSLCertificate certificate(credentials.mCert);

    pSetRootCA(root);
    checkSSL(SSL_CTX_use_certificate(mContext.get(), certificate.get()) == 1);
    checkSSL(SSL_CTX_use_PrivateKey(mContext.get(), key.get()) == 1);
    checkSSL(SSL_CTX_check_private_key(mContext.get()) == 1);
}

void SSLContext::pSetRootCA(SSLCertificate& root)
{
    X509_STORE_PTR store(X509_STORE_new());
    checkSSL(store != nullptr);
    checkSSL(X509_STORE_add_cert(store.get(), root.get()) == 1);
    SSL_CTX_set_cert_store(mContext.get(), store.release()); // the context owns it now
}

SSLClientContext::SSLClientContext() = default;
SSLClientContext::~SSLClientContext() = default;

SSL_PTR SSLClientContext::allocateConnection()
{
    SSL_PTR connection = SSLContext::allocateConnection();
    SSL_set_connect_state(connection.get());
    return connection;
}

SSLServerContext::SSLServerContext() = default;
SSLServerContext::~SSLServerContext() = default;

SSL_PTR SSLServerContext::allocateConnection()
{
    SSL_PTR connection = SSLContext::allocateConnection();
    SSL_set_accept_state(connection.get());
    return connection;
}

void SSLServerContext::pSetRootCA(SSLCertificate& root)
{
    SSLContext::pSetRootCA(root);
    SSL_CTX_set_client_CA_list(mContext.get(), nullptr);
    checkSSL(SSL_CTX_add_client_CA(mContext.get(), root.get()) == 1);
}

} // namespace qel
