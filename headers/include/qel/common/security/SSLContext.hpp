#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/common/security/SSLTypes.hpp>

namespace qel {

class SSLCertificate;

/// The TLS configuration that all connections of one side share.
///
/// There is nothing to choose: TLS 1.3 (RFC 8446) or nothing; both ends present a certificate and both verify that the
/// other's was issued by the one configured root; no session is ever resumed (no tickets, no cache); no compression, no
/// renegotiation. The system's own list of trusted certificates is never loaded. No name is checked: any certificate
/// of the root is accepted in either role, so who the peer is must be read from its certificate after the handshake.
///
/// Two ways to use it wrongly: without credentials a context makes connections whose handshakes fail, and after
/// setCredentials() has thrown it must not be used until setCredentials() succeeds. To change the credentials of a
/// running program, configure a new context for the connections to come; those that exist keep what they began with.
///
/// Ownership: a connection keeps what it needs of the context alive, so the context may be destroyed first.
/// Thread safety: takes no lock. It is configured once, by one thread; from then on any threads may allocate
/// connections at the same time.
class QEL_EXPORT SSLContext {
public:
    /// Makes the handle of a new connection. The overrides also give it its role.
    /// @return never null; without a transport, which the TLS stream attaches
    /// @throws SSLException  OpenSSL could not make it ("An SSL error occurred at ...")
    virtual SSL_PTR allocateConnection() = 0;

    /// Sets whom this side trusts and what it presents, in place of earlier credentials. All three texts are parsed
    /// before anything changes.
    /// @throws SSLException  "X509 certificate string is not in a supported format" (the root or the certificate) or
    ///                       "RSA private key string is not in a supported format": the context is as it was.
    ///                       "An SSL error occurred at ...": OpenSSL refused the root, the certificate or the key, or
    ///                       the key is not that of the certificate. The root may be installed by then, and the
    ///                       certificate without its key: the context must not be used before a call succeeds.
    void setCredentials(const SSLCredentials& credentials);

    SSLContext(const SSLContext&) = delete;
    SSLContext& operator=(const SSLContext&) = delete;

protected:
    /// @throws SSLException  OpenSSL could not make or configure the context ("An SSL error occurred at ...")
    SSLContext();

    /// Makes the root the only certificate that is trusted.
    /// @param root  shared with the context from here on, never changed
    /// @throws SSLException  "An SSL error occurred at ..."
    virtual void pSetRootCA(SSLCertificate& root);

public:
    virtual ~SSLContext(); // behind the others: their order is part of the binary interface

protected:
    SSL_CTX_PTR mContext;
};

/// The side that opens connections (the console).
class QEL_EXPORT SSLClientContext : public SSLContext {
public:
    SSLClientContext();
    ~SSLClientContext() override;

    /// @return a connection in the connect state
    SSL_PTR allocateConnection() override;
};

/// The side that accepts connections (the hypervisor). It also tells clients the name of its root, so that they know
/// which certificate to present.
class QEL_EXPORT SSLServerContext : public SSLContext {
public:
    SSLServerContext();
    ~SSLServerContext() override;

    /// @return a connection in the accept state
    SSL_PTR allocateConnection() override;

protected:
    void pSetRootCA(SSLCertificate& root) override;
};

} // namespace qel
