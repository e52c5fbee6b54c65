#include "TlsEnds.hpp"

#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509_vfy.h>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>

namespace qel::bench {

namespace {

/// A root and one certificate for each end.
class Authority {
public:
    Authority() : mRoot(SSLSubject{{"CN", "bench root"}}, SSLValidityPeriod::days(2)) {}

    SSLCredentials issue(const char* name) const
    {
        SSLCertificateRequest request(SSLSubject{{"CN", name}});
        const SSLCertificate certificate = mRoot.sign(request, SSLValidityPeriod::days(1));
        return {certificate.getPEM(), certificate.getPrivateKey()->getPEM(), mRoot.getPEM()};
    }

private:
    SSLCertificate mRoot;
};

const Authority& authority()
{
    static const Authority sAuthority;
    return sAuthority;
}

template <typename Object>
Object* parse(const std::string& pem, Object* (*read)(BIO*, Object**, pem_password_cb*, void*))
{
    const BIO_PTR text(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    Object* const object = read(text.get(), nullptr, nullptr, nullptr);
    checkCall(object != nullptr, "PEM_read_bio");
    return object;
}

} // namespace

const SSLCredentials& clientCredentials()
{
    static const SSLCredentials sCredentials = authority().issue("bench client");
    return sCredentials;
}

const SSLCredentials& serverCredentials()
{
    static const SSLCredentials sCredentials = authority().issue("bench server");
    return sCredentials;
}

void checkCall(bool succeeded, const char* call)
{
    if (!succeeded) throw std::runtime_error(call);
}

SSL_CTX_PTR rawContext(const SSLCredentials& credentials)
{
    SSL_CTX_PTR context(SSL_CTX_new(TLS_method()));
    checkCall(context != nullptr, "SSL_CTX_new");
    SSL_CTX_set_verify(context.get(), SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT, nullptr);
    SSL_CTX_set_options(context.get(), SSL_OP_NO_RENEGOTIATION | SSL_OP_NO_COMPRESSION | SSL_OP_NO_TICKET);
    SSL_CTX_set_session_cache_mode(context.get(), SSL_SESS_CACHE_OFF);
    checkCall(SSL_CTX_set_num_tickets(context.get(), 0) == 1, "SSL_CTX_set_num_tickets");
    checkCall(SSL_CTX_set_min_proto_version(context.get(), TLS1_3_VERSION) == 1, "SSL_CTX_set_min_proto_version");

    const X509_PTR root(parse(credentials.mRootCA, &PEM_read_bio_X509));
    const X509_PTR certificate(parse(credentials.mCert, &PEM_read_bio_X509));
    const EVP_PKEY_PTR key(parse(credentials.mKey, &PEM_read_bio_PrivateKey));
    X509_STORE* const store = SSL_CTX_get_cert_store(context.get());
    checkCall(X509_STORE_add_cert(store, root.get()) == 1, "X509_STORE_add_cert");
    checkCall(SSL_CTX_add_client_CA(context.get(), root.get()) == 1, "SSL_CTX_add_client_CA");
    checkCall(SSL_CTX_use_certificate(context.get(), certificate.get()) == 1, "SSL_CTX_use_certificate");
    checkCall(SSL_CTX_use_PrivateKey(context.get(), key.get()) == 1, "SSL_CTX_use_PrivateKey");
    return context;
}

void bothEnds(const std::function<void()>& near, const std::function<void()>& far)
{
    std::thread thread(far); // a failure in it ends the program
    near();
    thread.join();
}

OurContexts::OurContexts()
{
    client.setCredentials(clientCredentials());
    server.setCredentials(serverCredentials());
}

OurTlsPair::OurTlsPair(OurContexts& contexts, TcpPair&& pair)
    : near(std::make_unique<SSLStream>(contexts.client, std::move(pair.near))),
      far(std::make_unique<SSLStream>(contexts.server, std::move(pair.far)))
{}

void OurTlsPair::handshake()
{
    bothEnds([this] { near->handshake(); }, [this] { far->handshake(); });
}

RawContexts::RawContexts() : client(rawContext(clientCredentials())), server(rawContext(serverCredentials())) {}

RawTlsPair::RawTlsPair(const RawContexts& contexts, const TcpPair& pair)
    : near(SSL_new(contexts.client.get())), far(SSL_new(contexts.server.get()))
{
    checkCall(SSL_set_fd(near.get(), pair.nearFd()) == 1, "SSL_set_fd");
    checkCall(SSL_set_fd(far.get(), pair.farFd()) == 1, "SSL_set_fd");
    SSL_set_connect_state(near.get());
    SSL_set_accept_state(far.get());
}

void RawTlsPair::handshake()
{
    const auto oneEnd = [](SSL* connection) {
        checkCall(SSL_do_handshake(connection) == 1, "SSL_do_handshake");
        char version = 0;
        rawWrite(connection, &version, 1);
        rawRead(connection, &version, 1);
    };
    bothEnds([&] { oneEnd(near.get()); }, [&] { oneEnd(far.get()); });
}

void rawWrite(SSL* connection, const char* buffer, std::size_t length)
{
    // Without SSL_MODE_ENABLE_PARTIAL_WRITE everything goes in one call.
    const int count = SSL_write(connection, buffer, static_cast<int>(length));
    checkCall(count == static_cast<int>(length), "SSL_write");
}

void rawRead(SSL* connection, char* buffer, std::size_t length)
{
    while (length > 0) {
        const int count = SSL_read(connection, buffer, static_cast<int>(length));
        checkCall(count > 0, "SSL_read");
        buffer += count;
        length -= static_cast<std::size_t>(count);
    }
}

} // namespace qel::bench
