#pragma once

#include <qel/common/security/SSLStream.hpp>

#include <string>
#include <vector>

namespace qel::tool {

/// Who the other end may be, beyond holding a certificate of the root.
struct PeerPins {
    std::vector<std::string> names;        ///< the common name is one of these; empty: any
    std::vector<std::string> fingerprints; ///< as fingerprintOf() writes them, one of these; empty: any
};

/// Brings a SHA-256 fingerprint into the form of fingerprintOf(): 64 hexadecimal digits of either case, or 32 pairs of
/// them with ':' between.
/// @return empty when the text is neither
std::string normalizedFingerprint(const std::string& text);

/// Looks at the other end's certificate. To be called right after the TLS handshake, before anything is sent to the
/// other end or taken from it.
/// @throws CommandFailure  Refused: it is not one of those that the pins name
void checkPeer(const SSLStream& stream, const PeerPins& pins);

/// Who the other end is, for a line of log: its subject in quotes and the fingerprint of its certificate. Safe to
/// print.
std::string describePeer(const SSLStream& stream);

} // namespace qel::tool
