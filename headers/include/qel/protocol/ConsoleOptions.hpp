#pragma once

#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

namespace qel::protocol {

/// The identity of a console. A hypervisor refuses a second console with the same type and id.
struct Identity {
    static constexpr std::size_t kMaxToolIdBytes = 32;

    std::uint32_t toolType = 1;
    std::string toolId; ///< at most kMaxToolIdBytes; empty: "qel-" and the process id
};

/// The identity with the defaults filled in. Thread safety: any thread.
QEL_PROTOCOL_EXPORT Identity completeIdentity(const Identity& identity);

/// How long to wait between attempts to connect. The wait grows from `first` to `longest` by `factor`. Each is
/// shortened at random, by up to half, so that consoles that lost the same server do not return at the same moment.
struct Backoff {
    std::chrono::milliseconds first{500}; ///< more than 0
    std::chrono::milliseconds longest{30000};
    double factor = 2;         ///< at least 1
    unsigned int attempts = 0; ///< at most so many; 0: as many as the deadline allows
};

/// How a console reaches its server and who it is. A plain value.
///
/// Set either `credentials` or `plain`. The caller makes this struct, and the structs in it, so their layout is part of
/// the binary interface: a new member needs a new soname.
struct ConsoleOptions {
    /// @param address  of the server: "hypervisor.example:4711", "127.0.0.1:4711" or "[::1]:4711"
    explicit ConsoleOptions(std::string address) : server(std::move(address)) {}

    std::string server;                     ///< as ServerAddress::parse() takes it
    std::optional<Credentials> credentials; ///< for TLS
    bool plain = false;                     ///< no TLS; for loopback addresses only
    PeerPins pins;                          ///< with TLS: which servers are accepted
    Identity identity;

    /// From the TCP connection to the response to the version request.
    std::chrono::milliseconds handshakeTimeout{10000};
    /// For a request and its response, unless the call says otherwise.
    std::chrono::milliseconds requestTimeout{10000};
    /// For one message, from its first byte to its last.
    std::chrono::milliseconds frameTimeout{10000};

    /// With this, connecting is tried again when waiting may help: see Console. Without it the first failure is final.
    std::optional<Backoff> retry;
};

} // namespace qel::protocol
