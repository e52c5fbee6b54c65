#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLTypes.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include <map>
#include <memory>
#include <string>

namespace qel {

class SSLCertificateRequest;

/// The fields of a name: from field name to value. A field name is the short or the long name of an X.509 attribute
/// ("CN" or "commonName", "O", "C", ...) or its number in dots. The fields enter a name in the order of the map's keys,
/// so {CN, O, C} gives C, CN, O.
///
/// Values are taken byte by byte as Latin-1, up to the first NUL, so plain ASCII is best: UTF-8 text is stored, but not
/// as what it means. The limits of X.520 hold: CN has 1 to 64 characters, C exactly 2; no value is empty.
///
/// Write the type when passing one, `SSLCertificateRequest(SSLSubject{{"CN", "console"}})`: without it a pair of texts
/// can also mean a string made from two iterators.
using SSLSubject = std::map<std::string, std::string>;

/// An X.509 certificate (RFC 5280), perhaps with its private key. With the key it can issue other certificates;
/// without it, it can only be presented or trusted.
///
/// Certificates made here are of version 1 and hold no extensions: they say nothing about what they may be used for.
/// The subject of an issued certificate must differ from that of its root: otherwise every peer takes it for
/// self-signed and refuses it.
///
/// A small authority:
/// @code
/// const SSLCertificate root(SSLSubject{{"CN", "our root"}}, SSLValidityPeriod::days(3650));
/// SSLCertificateRequest request(SSLSubject{{"CN", "console"}});
/// const SSLCertificate console = root.sign(request, SSLValidityPeriod::days(365));
/// const SSLCredentials credentials{console.getPEM(), console.getPrivateKey()->getPEM(), root.getPEM()};
/// @endcode
///
/// Copies own a certificate and a key of their own. One that was moved from may only be assigned to or destroyed.
/// Thread safety: const operations from several threads at the same time; anything else by one thread.
class QEL_EXPORT SSLCertificate {
public:
    /// Loads the first certificate of a PEM text ("CERTIFICATE"), without key. Whatever follows it, such as the rest of
    /// a chain, is ignored.
    /// @throws SSLException  "X509 certificate string is not in a supported format", or "An SSL error occurred at ..."
    explicit SSLCertificate(const std::string& pem);

    /// The same with a copy of the key.
    /// @throws SSLException  also "An SSL error occurred at ...": the key is not that of the certificate
    SSLCertificate(const std::string& pem, const RSAPrivateKey& key);

    /// Makes a self-signed root with a new key (getPrivateKey()): a random serial number, SHA-256 with RSA. An empty
    /// subject is allowed.
    /// @throws SSLException  "An SSL error occurred at ...": a field or value is not accepted, or the period cannot be
    ///                       expressed
    SSLCertificate(const SSLSubject& subject, const SSLValidityPeriod& validity);

    /// Starts the certificate that is to be issued for a request: carries a copy of the request's key, if it has one,
    /// and is otherwise empty. sign() makes use of this; an empty certificate is good for nothing else: copying it and
    /// getPEM() throw.
    /// @throws SSLException  "An SSL error occurred at ..."
    explicit SSLCertificate(const SSLCertificateRequest& request);

    /// @throws SSLException  the certificate is empty, or it or its key could not be duplicated
    SSLCertificate(const SSLCertificate& other);
    /// @throws SSLException  as above; this one is as it was
    SSLCertificate& operator=(const SSLCertificate& other);
    SSLCertificate(SSLCertificate&& other) noexcept;
    SSLCertificate& operator=(SSLCertificate&& other) noexcept;
    ~SSLCertificate();

    /// Issues a certificate: subject, public key and, if it is there, private key of the request; issued and signed by
    /// this certificate; a random serial number, SHA-256 with RSA.
    ///
    /// The request is believed: that its sender holds the private key (X509_REQ_verify(3)), and that the subject is
    /// his, is for the caller to check. This certificate's own validity is not looked at.
    /// @param request  only read
    /// @throws SSLException  "Certificate cannot be used for signing - it does not have an associated private key", or
    ///                       "An SSL error occurred at ..."
    SSLCertificate sign(SSLCertificateRequest& request, const SSLValidityPeriod& validity) const;

    /// @return the certificate as PEM text, "-----BEGIN CERTIFICATE-----"; the key is not in it
    /// @throws SSLException  "An SSL error occurred at ..."
    std::string getPEM() const;

    /// @return the handle, owned by this object and valid as long as it; null only after a move
    X509* get() const noexcept { return mCert.get(); }

    /// @return the private key, owned by this object and valid as long as it; null when there is none
    const RSAPrivateKey* getPrivateKey() const noexcept { return mPrivateKey.get(); }

    /// Who the certificate is for. Look at this, after a handshake, to know whom one is talking to.
    /// @return the subject by short field names, or numbers in dots for fields that have none; values in UTF-8. A field
    ///         that stands there several times has its values in one text, in their order, with a line feed between
    ///         them: such a text equals no single value, unless that itself holds a line feed, which nothing forbids.
    /// @throws SSLException  "An SSL error occurred at ...": a value is no text
    SSLSubject getSubject() const;

    /// @return who issued it, in the form of getSubject()
    /// @throws SSLException  "An SSL error occurred at ..."
    SSLSubject getIssuer() const;

    /// @return the serial number in upper-case hexadecimal, two digits a byte ("0" for the number 0), with a "-" in
    ///         front of a negative one. An authority gives no number twice, so with the issuer it names a certificate.
    /// @throws SSLException  "An SSL error occurred at ..."
    std::string getSerialNumber() const;

    /// @return from when until when the certificate is valid
    /// @throws SSLException  "An SSL error occurred at ...": the certificate holds no proper times
    SSLValidityPeriod getValidityPeriod() const;

private:
    static ASN1_INT_PTR pGenerateSerialNumber();

    void pSetValidityPeriod(const SSLValidityPeriod& validity);

    X509_PTR mCert;
    std::unique_ptr<RSAPrivateKey> mPrivateKey; // may be empty
};

} // namespace qel
