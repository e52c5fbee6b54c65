#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLTypes.hpp>

#include <memory>
#include <string>

namespace qel {

/// A request for a certificate (PKCS #10, RFC 2986): a subject and a public key, signed with the private key, which may
/// be kept beside it.
///
/// Copies own a request and a key of their own. One that was moved from may only be assigned to or destroyed.
/// Thread safety: const operations from several threads at the same time; anything else by one thread.
class QEL_EXPORT SSLCertificateRequest {
public:
    /// Loads the first request of a PEM text ("CERTIFICATE REQUEST"), without key. Its signature is not verified.
    /// @throws SSLException  "X509 certificate request string is not in a supported format", or
    ///                       "An SSL error occurred at ..."
    explicit SSLCertificateRequest(const std::string& pem);

    /// The same with a copy of the key.
    /// @throws SSLException  also "An SSL error occurred at ...": the key is not that of the request
    SSLCertificateRequest(const std::string& pem, const RSAPrivateKey& key);

    /// Makes a request with a new key (getPrivateKey()), signed by SHA-256 with RSA.
    /// @throws SSLException  "An SSL error occurred at ...": a field or value is not accepted
    explicit SSLCertificateRequest(const SSLSubject& subject);

    /// @throws SSLException  the request or its key could not be duplicated
    SSLCertificateRequest(const SSLCertificateRequest& other);
    /// @throws SSLException  as above; this one is as it was
    SSLCertificateRequest& operator=(const SSLCertificateRequest& other);
    SSLCertificateRequest(SSLCertificateRequest&& other) noexcept;
    SSLCertificateRequest& operator=(SSLCertificateRequest&& other) noexcept;
    ~SSLCertificateRequest();

    /// @return the request as PEM text, "-----BEGIN CERTIFICATE REQUEST-----"; the key is not in it
    /// @throws SSLException  "An SSL error occurred at ..."
    std::string getPEM() const;

    /// @return the handle, owned by this object and valid as long as it; null only after a move
    X509_REQ* get() const noexcept { return mReq.get(); }

    /// @return the private key, owned by this object and valid as long as it; null when there is none
    const RSAPrivateKey* getPrivateKey() const noexcept { return mPrivateKey.get(); }

private:
    X509_REQ_PTR mReq;
    std::unique_ptr<RSAPrivateKey> mPrivateKey; // may be empty
};

} // namespace qel
