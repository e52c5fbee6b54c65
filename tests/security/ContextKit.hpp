#pragma once

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLContext.hpp>

#include "support/Authority.hpp"

#include <cstddef>
#include <cstring>
#include <functional>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

inline const char* const kBadCertificate = "X509 certificate string is not in a supported format";
inline const char* const kBadKey = "RSA private key string is not in a supported format";

// A context that exposes its handle and the order of its virtual operations.
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
    // The index of a virtual operation in the virtual table. In the C++ ABI of our platforms, a pointer to a virtual
    // member function begins with the byte offset in the table, plus one on some of them.
    template <typename Member>
    static std::size_t placeOf(Member member)
    {
        std::ptrdiff_t offset = 0;
        std::memcpy(&offset, &member, sizeof(offset));
        return static_cast<std::size_t>(offset) / sizeof(void*);
    }
};

inline const Authority& trusted() { return Authority::trusted(); }

inline std::unique_ptr<SSLClientContext>
clientContext(const SSLCredentials& credentials = trusted().clientCredentials())
{
    auto context = std::make_unique<SSLClientContext>();
    context->setCredentials(credentials);
    return context;
}

inline std::unique_ptr<SSLServerContext>
serverContext(const SSLCredentials& credentials = trusted().serverCredentials())
{
    auto context = std::make_unique<SSLServerContext>();
    context->setCredentials(credentials);
    return context;
}

inline SSL_CTX* handleOf(SSLContext& context) { return SSL_get_SSL_CTX(context.allocateConnection().get()); }

inline std::size_t anchorsOf(SSL_CTX* context)
{
    return static_cast<std::size_t>(sk_X509_OBJECT_num(X509_STORE_get0_objects(SSL_CTX_get_cert_store(context))));
}

inline bool trusts(SSL_CTX* context, const SSLCertificate& root)
{
    const STACK_OF(X509_OBJECT)* const objects = X509_STORE_get0_objects(SSL_CTX_get_cert_store(context));
    for (int i = 0; i < sk_X509_OBJECT_num(objects); ++i)
        if (X509_cmp(X509_OBJECT_get0_X509(sk_X509_OBJECT_value(objects, i)), root.get()) == 0) return true;
    return false;
}

inline std::vector<std::string> namesIn(const STACK_OF(X509_NAME) * names)
{
    std::vector<std::string> result;
    for (int i = 0; i < sk_X509_NAME_num(names); ++i) {
        char* const text = X509_NAME_oneline(sk_X509_NAME_value(names, i), nullptr, 0);
        result.emplace_back(text);
        OPENSSL_free(text);
    }
    return result;
}

// --- two connected ends in memory

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

// One step of one end. @return true while it can continue
inline bool advance(SSL* ssl, int& error, std::string& reason)
{
    if (error == SSL_ERROR_SSL || error == SSL_ERROR_ZERO_RETURN) return false;
    char byte = 0;
    // After the handshake, reading reports the alert of a peer that refuses.
    const int result = SSL_is_init_finished(ssl) != 0 ? SSL_peek(ssl, &byte, 1) : SSL_do_handshake(ssl);
    error = SSL_get_error(ssl, result);
    if (error == SSL_ERROR_SSL) {
        const char* const text = ERR_reason_error_string(ERR_peek_error());
        reason = text != nullptr ? text : "";
    }
    ERR_clear_error();
    return error == SSL_ERROR_NONE || error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE;
}

inline Ends connect(SSL_PTR client, SSL_PTR server)
{
    constexpr int kEnoughSteps = 20;
    BIO* clientBio = nullptr;
    BIO* serverBio = nullptr;
    EXPECT_EQ(BIO_new_bio_pair(&clientBio, 0, &serverBio, 0), 1);
    SSL_set_bio(client.get(), clientBio, clientBio);
    SSL_set_bio(server.get(), serverBio, serverBio);

    Ends ends;
    ends.client = std::move(client);
    ends.server = std::move(server);
    for (int i = 0; i < kEnoughSteps; ++i) {
        advance(ends.client.get(), ends.clientError, ends.clientReason);
        advance(ends.server.get(), ends.serverError, ends.serverReason);
    }
    // An end that waits for more data has read everything.
    if (ends.clientError == SSL_ERROR_WANT_READ) ends.clientError = SSL_ERROR_NONE;
    if (ends.serverError == SSL_ERROR_WANT_READ) ends.serverError = SSL_ERROR_NONE;
    return ends;
}

inline Ends connect(SSLContext& client, SSLContext& server)
{
    return connect(client.allocateConnection(), server.allocateConnection());
}

// A peer made of OpenSSL alone.
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

} // namespace qel::test
