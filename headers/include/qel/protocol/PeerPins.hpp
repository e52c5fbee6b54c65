#pragma once

#include <qel/protocol/PeerIdentity.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <string>
#include <vector>

namespace qel::protocol {

/// Which peers are accepted among those with a certificate of the root.
struct PeerPins {
    std::vector<std::string> names;        ///< the accepted common names; empty: all
    std::vector<std::string> fingerprints; ///< the accepted fingerprints, as normalizedFingerprint() returns them;
                                           ///< empty: all
};

/// Converts a SHA-256 fingerprint to the form of fingerprintOf().
/// @param text  64 hexadecimal digits of either case, or 32 pairs of them separated by ':'
/// @return empty when the text is neither
/// Thread safety: any thread.
QEL_PROTOCOL_EXPORT std::string normalizedFingerprint(const std::string& text);

/// Checks a peer against the pins. Call it right after the TLS handshake, before anything is sent or received. No pin
/// matches a peer without a common name, not even an empty pin.
/// @throws CertificateRejected  NamePin or FingerprintPin: the peer does not match the pins
/// Thread safety: any thread.
QEL_PROTOCOL_EXPORT void checkPeer(const PeerIdentity& peer, const PeerPins& pins);

} // namespace qel::protocol
