#pragma once

#include <qel/common/security/SSLStream.hpp>

#include <string>

namespace qel::protocol {

/// What the peer has against this end's certificate, if it has said so with a TLS alert, such as "unknown CA (TLS alert
/// 48)". Empty: it has not.
///
/// In TLS 1.3 a client sends its certificate last. Its handshake is complete then, and the alert of a server that
/// refuses the certificate comes with one of the next reads.
std::string certificateAlert(const SSLStream& stream);

} // namespace qel::protocol
