#pragma once

#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <string>

/// @file
/// What a credential file holds. A text of the wrong kind, such as a key where a certificate is expected, gets a
/// message that names the file and both kinds.
///
/// All functions are safe to call from any thread.

namespace qel::protocol {

/// Parses the first certificate of a PEM text.
/// @param path  of the file that the text came from, for messages
/// @throws CredentialsUnusable  the text holds no usable certificate
QEL_PROTOCOL_EXPORT SSLCertificate parseCertificate(const std::string& path, const std::string& pem);

/// Parses the first certificate request of a PEM text.
/// @throws CredentialsUnusable  the text holds no usable request
QEL_PROTOCOL_EXPORT SSLCertificateRequest parseRequest(const std::string& path, const std::string& pem);

/// Parses the first private key of a PEM text, an RSA key without encryption.
/// @throws CredentialsUnusable  the text holds no such key
QEL_PROTOCOL_EXPORT RSAPrivateKey parseKey(const std::string& path, const std::string& pem);

/// Whether a PEM text holds a certificate, which need not be well-formed.
QEL_PROTOCOL_EXPORT bool holdsCertificate(const std::string& pem);

/// Whether a PEM text holds a certificate request, which need not be well-formed.
QEL_PROTOCOL_EXPORT bool holdsRequest(const std::string& pem);

/// Whether a PEM text holds objects of known kinds, and none of them is a private key.
QEL_PROTOCOL_EXPORT bool holdsNoKey(const std::string& pem);

/// The kind of the first object of a known kind in a PEM text, such as "a private key", "an encrypted private key" or
/// "a certificate".
/// @return empty for a text without a PEM object of a known kind
QEL_PROTOCOL_EXPORT std::string describePem(const std::string& pem);

} // namespace qel::protocol
