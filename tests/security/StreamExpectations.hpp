#pragma once

#include <qel/common/security/SSLStream.hpp>

#include "support/TlsKit.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <string>
#include <thread>
#include <vector>

namespace qel::test {

using Lines = std::vector<std::string>;

inline const std::string kInvalidState = "StreamIOException: Invalid state for SSL stream operation";
inline const std::string kSSLError1 = "StreamIOException: SSL error 1";
inline const std::string kSSLError6 = "StreamIOException: SSL error 6";
inline const std::string kEOF = "StreamIOException: EOF";

inline const std::string kUnrecoverable1 = "E: SSL stream encountered unrecoverable error code 0x00000001";
inline const std::string kUnrecoverable6 = "E: SSL stream encountered unrecoverable error code 0x00000006";
inline const std::string kEOFInHandshake = "E: SSLStream: EOF during handshake";
inline const std::string kLibssl = "E: [libssl]";

/// The log of an end that receives invalid TLS.
inline const Lines kRefusal = {kUnrecoverable1, kLibssl};

/// The log of an end that refuses the peer's certificate.
inline Lines refusedCertificate(long reason)
{
    return {kUnrecoverable1, kLibssl,
            std::string("E: SSL peer certificate verification failed: ") + X509_verify_cert_error_string(reason)};
}

/// The log of an end whose peer closes after this end has completed its TLS handshake.
inline Lines endedAfterHandshake()
{
    Lines lines = handshakeLines();
    lines.resize(3);
    lines.push_back(kEOFInHandshake);
    return lines;
}

inline std::string nameOf(Transport transport) { return transport == Transport::Memory ? "Memory" : "Tcp"; }

/// Does something on another thread and waits for it.
inline void elsewhere(const std::function<void()>& work) { std::thread(work).join(); }

/// The failure of a socket stream, or of a stream in memory, that this end has closed.
inline auto failsClosed()
{
    return ::testing::AnyOf("StreamIOException: memory stream closed", "StreamIOException: socket stream send failure");
}

} // namespace qel::test
