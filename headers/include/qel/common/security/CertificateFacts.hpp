#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include <string>
#include <vector>

/// @file
/// Facts about certificates, requests and keys for programs that show or check them, beyond what their classes report.
///
/// Thread safety: any thread may call any function; the records are plain values.
/// All functions throw SSLException when OpenSSL fails, and std::bad_alloc.

namespace qel {

struct NameField {
    std::string name;  ///< short name of the attribute, or its number in dots
    std::string value; ///< UTF-8; "#" and hexadecimal digits for a value that is not a text
};

/// A name, in its own order. A field may occur several times.
using NameFields = std::vector<NameField>;

struct PublicKeyFacts {
    std::string type; ///< "RSA", "EC", "ED25519", ...; "unknown" when OpenSSL does not know it
    int bits = 0;     ///< 0 if unknown
};

struct CertificateFacts {
    NameFields subject;
    NameFields issuer;
    std::string serial; ///< as SSLCertificate::getSerialNumber() gives it
    SSLValidityPeriod validity;
    PublicKeyFacts key;
    std::string fingerprint;
};

struct RequestFacts {
    NameFields subject;
    PublicKeyFacts key;
    std::string fingerprint;
    bool isSignatureValid; ///< see isSignatureValid()
};

QEL_EXPORT CertificateFacts factsOf(const SSLCertificate& certificate);
QEL_EXPORT RequestFacts factsOf(const SSLCertificateRequest& request);

/// The SHA-256 of the DER form, which identifies a certificate: 32 bytes in upper-case hexadecimal, separated by ':'.
QEL_EXPORT std::string fingerprintOf(const SSLCertificate& certificate);

/// The type of the first private key of a PEM text, as in PublicKeyFacts.
/// @return empty when the text holds no key that can be read without a pass phrase
QEL_EXPORT std::string privateKeyType(const std::string& pem);

/// Whether a request is signed with the private key of its public key, which proves that the sender has that key.
QEL_EXPORT bool isSignatureValid(const SSLCertificateRequest& request);

/// Whether the two subjects are equal by the rules of RFC 5280, 7.1, which ignore case and the number of blanks. Every
/// peer takes a certificate whose subject equals its issuer for self-signed.
QEL_EXPORT bool haveSameSubject(const SSLCertificateRequest& request, const SSLCertificate& certificate);

/// @param name  the short or the long name of an attribute, or its number in dots
/// @return the short name, or the number when the attribute has no name; empty for an unknown name
QEL_EXPORT std::string attributeName(const std::string& name);

/// Whether a name of an attribute, in one of the forms above, is that of an X.509 extension, such as subjectAltName.
/// OpenSSL puts even those into a subject, where no peer looks for them.
QEL_EXPORT bool isExtension(const std::string& name);

/// Why an attribute cannot have a value: X.520 sets limits.
/// @return empty when it can
QEL_EXPORT std::string objectionTo(const std::string& attribute, const std::string& value);

} // namespace qel
