#pragma once

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include <string>
#include <vector>

/// @file
/// What certificates and requests say, as far as the library does not tell. The one place of this program that calls
/// OpenSSL.
/// Thread safety: every function from any thread. Those that read throw SSLException when OpenSSL fails.

namespace qel::tool {

struct NameField {
    std::string name;  ///< short name of the attribute, or its number in dots
    std::string value; ///< UTF-8; "#" and hexadecimal digits for a value that is no text
};

/// A name in the order in which it is written. A field may stand there several times.
using NameFields = std::vector<NameField>;

struct PublicKeyFacts {
    std::string type; ///< "RSA", "EC", "ED25519", ...; "unknown" for one that OpenSSL does not know
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

CertificateFacts factsOf(const SSLCertificate& certificate);
RequestFacts factsOf(const SSLCertificateRequest& request);

/// The SHA-256 of the DER form, which names a certificate: 32 bytes in upper-case hexadecimal, ':' between them.
std::string fingerprintOf(const SSLCertificate& certificate);

/// Whether a request is signed with the private key that belongs to its public key, so that its sender has that key.
bool isSignatureValid(const SSLCertificateRequest& request);

/// Whether the two subjects are one name by the rules of RFC 5280, 7.1: upper and lower case are the same, and so are
/// one blank and several. A certificate with the name of its issuer is taken for self-signed by every peer.
bool haveSameSubject(const SSLCertificateRequest& request, const SSLCertificate& certificate);

/// @param name  the short or the long name of an attribute, or its number in dots
/// @return the short name, or the number for one that has none; empty for an unknown name
std::string attributeName(const std::string& name);

/// Why a value cannot stand in a name: X.520 sets limits. @return empty when it can
std::string objectionTo(const std::string& attribute, const std::string& value);

} // namespace qel::tool
