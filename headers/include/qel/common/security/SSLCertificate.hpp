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

/// The fields of a name: field name to value. A field name is the short or the long name of an X.509 attribute ("CN" or
/// "commonName", "O", "C", ...) or its number in dots. The fields enter a name in the order of the map's keys: {CN, O,
/// C} gives C, CN, O.
///
/// Values are read as Latin-1 up to the first NUL, so use plain ASCII: UTF-8 text is stored byte by byte as Latin-1.
/// The limits of X.520 apply: CN has 1 to 64 characters, C exactly 2; a value must not be empty.
///
/// Write the type when you pass one, `SSLCertificateRequest(SSLSubject{{"CN", "console"}})`: without it, a pair of
/// texts can also mean a string that is made from two iterators.
using SSLSubject = std::map<std::string, std::string>;

/// An X.509 certificate (RFC 5280), with or without its private key. With the key it can issue other certificates;
/// without it, it can only be presented or trusted.
///
/// Certificates made here have version 1 and no extensions, so they do not restrict how they may be used. The subject
/// of an issued certificate must differ from the root's: otherwise every peer takes it for self-signed and refuses it.
///
/// A small authority:
/// @code
/// const SSLCertificate root(SSLSubject{{"CN", "our root"}}, SSLValidityPeriod::days(3650));
/// SSLCertificateRequest request(SSLSubject{{"CN", "console"}});
/// const SSLCertificate console = root.sign(request, SSLValidityPeriod::days(365));
/// const SSLCredentials credentials{console.getPEM(), console.getPrivateKey()->getPEM(), root.getPEM()};
/// @endcode
///
/// Ownership: owns the certificate and the key. Copies have their own. A moved-from certificate may only be destroyed
/// or assigned to.
///
/// Thread safety: several threads may call const operations at the same time; anything else needs exclusive access.
class QEL_EXPORT SSLCertificate {
public:
    /// Loads the first certificate of a PEM text ("CERTIFICATE"), without a key. Whatever follows it, such as the rest
    /// of a chain, is ignored. The kind of its public key does not matter.
    /// @throws SSLException  "X509 certificate string is not in a supported format", or "An SSL error occurred at ..."
    explicit SSLCertificate(const std::string& pem);

    /// Loads a certificate and attaches a copy of its key.
    /// @throws SSLException  as above; "An SSL error occurred at ..." also when the key does not match the certificate
    SSLCertificate(const std::string& pem, const RSAPrivateKey& key);

    /// Makes a self-signed root with a new key (getPrivateKey()) and a random serial number, signed with SHA-256 and
    /// RSA. An empty subject is allowed.
    /// @throws SSLException  "An SSL error occurred at ...": also when a field or value is not accepted, or the
    ///                       period does not fit a certificate
    SSLCertificate(const SSLSubject& subject, const SSLValidityPeriod& validity);

    /// Starts the certificate to be issued for a request: carries a copy of the request's key, if it has one, and is
    /// otherwise empty. sign() uses this. An empty certificate has no other use: copying it and getPEM() throw.
    /// @throws SSLException  "An SSL error occurred at ..."
    explicit SSLCertificate(const SSLCertificateRequest& request);

    /// @throws SSLException  the certificate is empty, or it or its key cannot be duplicated
    SSLCertificate(const SSLCertificate& other);
    /// @throws SSLException  as above; this certificate is unchanged
    SSLCertificate& operator=(const SSLCertificate& other);
    SSLCertificate(SSLCertificate&& other) noexcept;
    SSLCertificate& operator=(SSLCertificate&& other) noexcept;
    ~SSLCertificate();

    /// Issues a certificate with the subject, the public key and, if present, the private key of the request. This
    /// certificate is its issuer and signs it with SHA-256 and RSA. The serial number is random.
    ///
    /// The request is trusted as it is. The caller must check that the sender holds the private key
    /// (X509_REQ_verify(3)) and may use the subject. The validity of this certificate is not checked.
    /// @param request  only read
    /// @throws SSLException  "Certificate cannot be used for signing - it does not have an associated private key", or
    ///                       "An SSL error occurred at ..."
    SSLCertificate sign(SSLCertificateRequest& request, const SSLValidityPeriod& validity) const;

    /// @return the certificate as PEM text, "-----BEGIN CERTIFICATE-----", without the key
    /// @throws SSLException  "An SSL error occurred at ...": also when the certificate is empty
    std::string getPEM() const;

    /// @return the handle. This object owns it and keeps it valid until it is destroyed or assigned to. Null only after
    ///         a move.
    X509* get() const noexcept { return mCert.get(); }

    /// @return the private key, owned by this object and valid as long as get(); null when there is none
    const RSAPrivateKey* getPrivateKey() const noexcept { return mPrivateKey.get(); }

    /// Who the certificate belongs to. After a handshake this names the peer.
    /// @return the subject by short field names, or by numbers in dots for fields without one; values in UTF-8. The
    ///         values of a field that occurs several times are joined in order, with a line feed between them. A single
    ///         value may contain line feeds too.
    /// @throws SSLException  "An SSL error occurred at ...": a value is not a text
    SSLSubject getSubject() const;

    /// @return the issuer, in the form of getSubject()
    /// @throws SSLException  "An SSL error occurred at ...": a value is not a text
    SSLSubject getIssuer() const;

    /// @return the serial number in upper-case hexadecimal, two digits a byte ("0" for the number 0), after a "-" when
    ///         it is negative. An authority uses each number once, so issuer and number identify a certificate.
    /// @throws SSLException  "An SSL error occurred at ..."
    std::string getSerialNumber() const;

    /// @return the first and the last second at which the certificate is valid
    /// @throws SSLException  "An SSL error occurred at ...": a time in the certificate is malformed
    SSLValidityPeriod getValidityPeriod() const;

private:
    static ASN1_INT_PTR pGenerateSerialNumber();

    void pSetValidityPeriod(const SSLValidityPeriod& validity);

    X509_PTR mCert;
    std::unique_ptr<RSAPrivateKey> mPrivateKey; // may be empty
};

} // namespace qel
