#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/common/security/SSLTypes.hpp>

namespace qel {

class SSLCertificate;

/// The TLS configuration that all connections of one side share.
///
/// The profile is fixed: TLS 1.3 (RFC 8446) only; both ends present a certificate, and each verifies that the one
/// configured root issued the peer's; no session resumption (no tickets, no cache), no compression, no renegotiation.
/// The system's list of trusted certificates is never loaded. Names are not checked: any certificate of the root is
/// accepted in either role, so read the peer's certificate after the handshake to know who the peer is.
///
/// Without credentials, the handshakes of a context's connections fail. After setCredentials() has thrown, do not use
/// the context until a call succeeds. To change the credentials of a running program, configure a new context for new
/// connections; existing connections keep the credentials they started with.
///
/// Ownership: a connection keeps what it needs of the context alive, so the context may be destroyed first.
/// Thread safety: takes no lock. One thread configures it; after that, several threads may call allocateConnection() at
/// the same time.
class QEL_EXPORT SSLContext {
public:
    /// Makes a new connection. The overrides also set its role.
    /// @return the handle, owned by the caller, never null; it has no transport, which the TLS stream attaches
    /// @throws SSLException  OpenSSL cannot make it ("An SSL error occurred at ...")
    virtual SSL_PTR allocateConnection() = 0;

    /// Sets the root that this side trusts and the certificate and key that it presents, and replaces earlier ones. All
    /// three texts are parsed before anything changes.
    /// @throws SSLException  "X509 certificate string is not in a supported format" (the root or the certificate) or
    ///                       "RSA private key string is not in a supported format": the context is unchanged.
    ///                       "An SSL error occurred at ...": OpenSSL refused the root, the certificate or the key, or
    ///                       the key does not match the certificate. The root, or the certificate without its key, may
    ///                       be installed by then: do not use the context until a call succeeds.
    void setCredentials(const SSLCredentials& credentials);

    SSLContext(const SSLContext&) = delete;
    SSLContext& operator=(const SSLContext&) = delete;

protected:
    /// @throws SSLException  OpenSSL cannot make or configure the context ("An SSL error occurred at ...")
    SSLContext();

    /// Makes the root the only trusted certificate.
    /// @param root  the context keeps a counted reference to its handle; it must not change afterwards
    /// @throws SSLException  "An SSL error occurred at ..."
    virtual void pSetRootCA(SSLCertificate& root);

public:
    virtual ~SSLContext(); // declared last: the order of virtual operations is part of the binary interface

protected:
    SSL_CTX_PTR mContext;
};

/// The side that opens connections (the console).
/// Ownership and thread safety: as SSLContext.
class QEL_EXPORT SSLClientContext : public SSLContext {
public:
    /// @throws SSLException  OpenSSL cannot make or configure the context ("An SSL error occurred at ...")
    SSLClientContext();
    ~SSLClientContext() override;

    /// @return a connection in the connect state
    /// @throws SSLException  OpenSSL cannot make it ("An SSL error occurred at ...")
    SSL_PTR allocateConnection() override;
};

/// The side that accepts connections (the hypervisor). It also sends the name of its root to clients, which choose the
/// certificate to present by it.
/// Ownership and thread safety: as SSLContext.
class QEL_EXPORT SSLServerContext : public SSLContext {
public:
    /// @throws SSLException  OpenSSL cannot make or configure the context ("An SSL error occurred at ...")
    SSLServerContext();
    ~SSLServerContext() override;

    /// @return a connection in the accept state
    /// @throws SSLException  OpenSSL cannot make it ("An SSL error occurred at ...")
    SSL_PTR allocateConnection() override;

protected:
    void pSetRootCA(SSLCertificate& root) override;
};

} // namespace qel
