#pragma once

#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/PeerPins.hpp>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace qel::protocol {

/// How a Server listens, whom it admits, and what it lets a console use up. Either `credentials` or `plain` is needed.
/// The caller makes this struct, so its layout is part of the binary interface: a new member needs a new soname.
struct ServerOptions {
    /// Where to listen, as IPEndpoint takes it: "127.0.0.1:4711", "[::1]:0". Port 0 lets the system choose one. Empty:
    /// nowhere, Server::serve() brings the connections.
    std::vector<std::string> listen{"127.0.0.1:0"};

    /// Descriptors of sockets that listen already, such as those of a service manager; the server listens on them too.
    /// Borrowed for the constructor, which duplicates them. They are made non-blocking.
    std::vector<int> sockets;

    std::optional<Credentials> credentials; ///< for TLS
    bool plain = false;                     ///< no TLS; for loopback addresses and Server::serve() only
    PeerPins pins;                          ///< which consoles are admitted over TLS

    std::uint8_t maxConsoles = 16; ///< that have identified themselves, at a time; at least 1

    /// Connections that have not identified themselves, at a time; at least 1. Further ones are closed at once.
    unsigned int maxHandshakes = 256;
    /// The same from one IPv4 address, or from one IPv6 network of 64 bits; at least 1. Server::serve() has no limit.
    unsigned int maxHandshakesPerAddress = 64;

    std::size_t queueBytes = 256 * 1024; ///< that may be queued for a console, half of them serial data; at least 1

    // Each of these times is at most 24 hours, that of the keep-alive at most 32767 seconds.
    std::chrono::milliseconds handshakeTimeout{10000}; ///< from connecting to a granted version request; more than 0
    std::chrono::milliseconds frameTimeout{10000};     ///< from the first byte of a message to its last; more than 0
    /// In which TCP notices that an idle peer is gone; at least 1. One that data waits for has the system's
    /// retransmission limits, which is minutes.
    std::chrono::seconds keepAlive{60};
    /// After which a console that says nothing is let go; 0: never. A request for the time, with which consoles look
    /// whether the server is there, says nothing. No time passes while the server does not read from the console.
    std::chrono::seconds idleTimeout{0};
    std::chrono::milliseconds linger{2000}; ///< for the last messages to a console that is being closed; 0 or more
};

} // namespace qel::protocol
