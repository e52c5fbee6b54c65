#pragma once

#include <string>

namespace qel {

/// The identity of one end of a connection and the root that it trusts: three PEM texts (RFC 7468). Programs fill it
/// from files; SSLContext::setCredentials() checks it.
///
/// The key is a secret and is held here unencrypted. Keep this record only as long as it is needed.
///
/// From certificates that were made in the same process:
/// @code
/// const SSLCredentials credentials{certificate.getPEM(), certificate.getPrivateKey()->getPEM(), root.getPEM()};
/// @endcode
///
/// Thread safety: that of a plain value.
struct SSLCredentials {
    std::string mCert;   ///< the certificate that this end presents
    std::string mKey;    ///< the RSA private key of that certificate, not encrypted
    std::string mRootCA; ///< the only trusted certificate; it must have issued the peer's
};

} // namespace qel
