#pragma once

#include <qel/common/security/SSLStream.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <string>

namespace qel::protocol {

/// Who the peer of a TLS connection is, from its certificate. All texts are empty for a connection without TLS.
struct PeerIdentity {
    std::string commonName;  ///< untrusted bytes, as the certificate has them; empty when it has none
    std::string subject;     ///< all fields, as nameText() writes them: safe to print
    std::string fingerprint; ///< SHA-256 of the certificate, as fingerprintOf() writes it
};

/// Reads the identity of the peer. Call it once for a connection: it reads and parses the certificate.
/// @param stream  after its handshake
/// @throws ClosedByPeer  "the connection is closed"
/// @throws SSLException  OpenSSL fails
QEL_PROTOCOL_EXPORT PeerIdentity identityOf(const SSLStream& stream);

/// Describes the peer for a line of log: its subject in quotes and its fingerprint. Safe to print.
QEL_PROTOCOL_EXPORT std::string describePeer(const PeerIdentity& peer);

} // namespace qel::protocol
