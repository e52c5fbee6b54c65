#pragma once

#include <qel/protocol/PeerIdentity.hpp>

#include <cstdint>
#include <string>

namespace qel::protocol {

/// One connection to a hypervisor, and the console at its other end. `commonName`, `subject` and `fingerprint` are
/// those of the console's certificate, and empty on a plain connection.
///
/// Decide by the certificate: the peer has proven that it holds the key. The tool's type and id are only what the
/// console says.
struct Peer : PeerIdentity {
    std::uint64_t id = 0;       ///< of the connection, from 1 in the order of connecting; no number is used twice
    std::string address;        ///< such as "192.0.2.7:40312", or the name given for a stream of one's own
    bool isProtected = false;   ///< over TLS
    std::uint32_t toolType = 0; ///< this and the next: what the console says about itself in its version request
    std::string toolId;
};

} // namespace qel::protocol
