#pragma once

#include <qel/common/net/IPAddress.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

namespace qel::protocol {

/// Where a server can be reached: a host, by name or by IP address, and a port. A plain value.
class QEL_PROTOCOL_EXPORT ServerAddress {
public:
    /// Parses "hypervisor.example:4711", "127.0.0.1:4711" or "[::1]:4711".
    /// @throws std::invalid_argument  "server: ..." says what is wrong: no port, a port outside [1, 65535], no host, or
    ///         a host that is neither an address nor a name of letters, digits, '-', '_' and '.' (RFC 1123, 2.1)
    static ServerAddress parse(const std::string& text);

    const std::string& getHost() const noexcept { return mHost; } ///< without brackets
    std::uint16_t getPort() const noexcept { return mPort; }

    /// The text that parse() takes.
    std::string str() const;

private:
    ServerAddress(std::string host, std::uint16_t port);

    std::string mHost;
    std::uint16_t mPort;
};

/// True for 127.0.0.0/8, ::1, and 127.0.0.0/8 as IPv4-mapped IPv6 addresses. Thread safety: any thread.
QEL_PROTOCOL_EXPORT bool isLoopback(const IPAddress& address);

/// Finds the addresses of a server, in the order of preference of the system (getaddrinfo(3), RFC 6724).
///
/// getaddrinfo() knows no deadline, so it runs on a thread of its own. When the deadline passes first, that thread ends
/// by itself later. A numeric host is not looked up, and starts no thread.
/// @return at least one
/// @throws NameNotResolved  the host has no address, the resolver failed, or the system allows no more threads
///         (std::system_error is nested then)
/// @throws DeadlinePassed  the resolver did not answer in time
/// Thread safety: any thread.
QEL_PROTOCOL_EXPORT std::vector<IPEndpoint> resolve(const ServerAddress& server,
                                                    std::chrono::steady_clock::time_point deadline);

/// Connects over TCP to the first of the endpoints that accepts. Each attempt gets an equal share of the time that is
/// left, so that one silent address does not use up the time of the others.
/// @param endpoints  at least one
/// @return a blocking, close-on-exec socket, which announces segments of at most 16 KiB: with the 64 KiB of loopback a
///         peer would wait for a timer when the receive buffer of a SocketStream has less room than that
/// @throws CannotConnect  none accepted in time: "cannot connect to SERVER: " and the reason of the last attempt, which
///         is nested
/// Thread safety: any thread.
QEL_PROTOCOL_EXPORT Socket connectTo(const ServerAddress& server, const std::vector<IPEndpoint>& endpoints,
                                     std::chrono::steady_clock::time_point deadline);

} // namespace qel::protocol
