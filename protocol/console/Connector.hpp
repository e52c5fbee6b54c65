#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/protocol/ConsoleOptions.hpp>
#include <qel/protocol/PeerIdentity.hpp>

#include "base/TimeLeft.hpp"
#include "console/CloseSwitch.hpp"
#include "console/ReadAhead.hpp"
#include "transport/Readiness.hpp"

#include <chrono>
#include <memory>
#include <string>

namespace qel::protocol {

/// A connected stream, protected as the options say.
struct ConnectedStream {
    std::unique_ptr<Stream> stream;
    ReadAhead* readAhead = nullptr; ///< under the TLS of the stream; null: a plain connection
    int descriptor = -1;            ///< of the stream; -1: none
    Readiness* readiness = nullptr; ///< of a stream without a descriptor, part of it; null: it cannot tell
    PeerIdentity peer;
};

/// Makes the connections of one console.
/// Thread safety: one thread.
class Connector {
public:
    /// Checks the options, and makes the TLS configuration from the credentials.
    /// @param needsAddress  the options must name a server to connect to
    /// @throws std::invalid_argument  as Console documents
    Connector(const ConsoleOptions& options, bool needsAddress);

    /// Connects and protects the connection.
    /// @param end  for connecting. The handshake has ConsoleOptions::handshakeTimeout as well: see handshakeEnd
    /// @param closeSwitch  watches the stream during the handshake
    /// @param handshakeEnd  set to the deadline of the handshake
    /// @throws what Console documents for its constructor
    ConnectedStream connect(TimePoint end, CloseSwitch& closeSwitch, TimePoint& handshakeEnd);

    /// The same for a stream that is connected already.
    ConnectedStream adopt(std::unique_ptr<Stream> stream, int descriptor, TimePoint end, CloseSwitch& closeSwitch,
                          TimePoint& handshakeEnd);

    /// True when connections are made over TLS.
    bool isProtecting() const noexcept { return mContext != nullptr; }

private:
    void pProtect(ConnectedStream& connected, TimePoint end, CloseSwitch& closeSwitch);

    const std::string mServer;
    const PeerPins mPins;
    const std::chrono::milliseconds mHandshakeTimeout;
    std::unique_ptr<SSLClientContext> mContext; // null: plain
};

} // namespace qel::protocol
