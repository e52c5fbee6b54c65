#pragma once

#include <string>

namespace qel {

/// What one end of a connection proves its identity with and whom it trusts: three PEM texts (RFC 7468). Programs
/// fill it from files; SSLContext::setCredentials() checks it.
///
/// The key is a secret and stands here in the clear: keep this record only as long as it is needed.
///
/// From certificates that were made in the same process:
/// @code
/// const SSLCredentials credentials{certificate.getPEM(), certificate.getPrivateKey()->getPEM(), root.getPEM()};
/// @endcode
struct SSLCredentials {
    std::string mCert;   ///< the certificate that this end presents
    std::string mKey;    ///< the RSA private key of that certificate, not encrypted
    std::string mRootCA; ///< the one certificate that is trusted; the other end's must be issued by it
};

} // namespace qel
