#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLTypes.hpp>

#include <memory>
#include <string>

namespace qel {

/// A certificate request (PKCS #10, RFC 2986): a subject and a public key, signed with the private key. It may carry
/// the private key.
///
/// Ownership: owns the request and the key. Copies have their own. A moved-from request may only be destroyed or
/// assigned to.
/// Thread safety: several threads may call const operations at the same time; anything else needs exclusive access.
class QEL_EXPORT SSLCertificateRequest {
public:
    /// Loads the first request of a PEM text ("CERTIFICATE REQUEST"), without a key. Its signature is not verified.
    /// @throws SSLException  "X509 certificate request string is not in a supported format", or
    ///                       "An SSL error occurred at ..."
    explicit SSLCertificateRequest(const std::string& pem);

    /// Loads a request and attaches a copy of its key.
    /// @throws SSLException  as above; "An SSL error occurred at ..." also when the key does not match the request
    SSLCertificateRequest(const std::string& pem, const RSAPrivateKey& key);

    /// Makes a request with a new key (getPrivateKey()), signed with SHA-256 and RSA.
    /// @throws SSLException  "An SSL error occurred at ...": also when a field or value is not accepted
    explicit SSLCertificateRequest(const SSLSubject& subject);

    /// @throws SSLException  the request or its key cannot be duplicated
    SSLCertificateRequest(const SSLCertificateRequest& other);
    /// @throws SSLException  as above; this request is unchanged
    SSLCertificateRequest& operator=(const SSLCertificateRequest& other);
    SSLCertificateRequest(SSLCertificateRequest&& other) noexcept;
    SSLCertificateRequest& operator=(SSLCertificateRequest&& other) noexcept;
    ~SSLCertificateRequest();

    /// @return the request as PEM text, "-----BEGIN CERTIFICATE REQUEST-----", without the key
    /// @throws SSLException  "An SSL error occurred at ..."
    std::string getPEM() const;

    /// @return the handle. This object owns it and keeps it valid until it is destroyed or assigned to. Null only after
    ///         a move.
    X509_REQ* get() const noexcept { return mReq.get(); }

    /// @return the private key, owned by this object and valid as long as get(); null when there is none
    const RSAPrivateKey* getPrivateKey() const noexcept { return mPrivateKey.get(); }

private:
    X509_REQ_PTR mReq;
    std::unique_ptr<RSAPrivateKey> mPrivateKey; // may be empty
};

} // namespace qel
