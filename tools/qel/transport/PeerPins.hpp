#pragma once

#include <qel/common/security/SSLStream.hpp>

#include <string>
#include <vector>

namespace qel::tool {

/// Which peers are accepted among those with a certificate of the root.
struct PeerPins {
    std::vector<std::string> names;        ///< the accepted common names; empty: all
    std::vector<std::string> fingerprints; ///< the accepted fingerprints, as fingerprintOf() writes them; empty: all
};

/// Converts a SHA-256 fingerprint to the form of fingerprintOf().
/// @param text  64 hexadecimal digits of either case, or 32 pairs of them separated by ':'
/// @return empty when the text is neither
std::string normalizedFingerprint(const std::string& text);

/// Checks the peer's certificate. Call it right after the TLS handshake, before anything is sent or received.
/// @throws CommandFailure  Refused: the certificate does not match the pins
void checkPeer(const SSLStream& stream, const PeerPins& pins);

/// Describes the peer for a line of log: its subject in quotes and the fingerprint of its certificate. Safe to print.
/// @throws CommandFailure  ClosedByPeer: the connection is closed
std::string describePeer(const SSLStream& stream);

} // namespace qel::tool
