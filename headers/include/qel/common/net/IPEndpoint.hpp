#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPAddress.hpp>

#include <cstdint>
#include <iosfwd>
#include <string>
#include <sys/socket.h>

namespace qel {

/// An IP address and a TCP port.
/// Text form: 10.0.0.1:80 for IPv4, [fe80::1]:80 for IPv6; the last colon always separates the port.
/// Thread safety: a plain value.
class QEL_EXPORT IPEndpoint {
public:
    /// 0.0.0.0:0
    IPEndpoint() noexcept;

    /// @param port  in host byte order
    IPEndpoint(const IPAddress& address, std::uint16_t port) noexcept;

    /// Reads the text form. The port is checked before the host and may have leading zeros.
    /// @throws std::invalid_argument  "No port delimiter": there is no ':'
    /// @throws std::invalid_argument  "Invalid character in port": a character other than a digit after the last ':'
    /// @throws std::invalid_argument  the text of std::stoul: nothing follows the last ':'
    /// @throws std::out_of_range      "Port value is too large": 65536 or more
    /// @throws std::invalid_argument  "IPv6 address is not contained in brackets": the host is neither an IPv4 address
    ///                                nor in brackets
    /// @throws std::invalid_argument  "'HOST' is not a valid IPv6 address": the text in the brackets is malformed
    explicit IPEndpoint(const std::string& text);

    /// @param address  an AF_INET or AF_INET6 socket address (ip(7), ipv6(7)); its flow and scope are dropped
    /// @throws std::invalid_argument  "Not an IP address family": another family
    explicit IPEndpoint(const sockaddr_storage& address);

    /// @return the address, owned by this object
    const IPAddress& getAddress() const noexcept { return mAddress; }
    IPFamily getFamily() const noexcept { return mAddress.getFamily(); }
    /// @return the port in host byte order
    std::uint16_t getPort() const noexcept { return mPort; }

    /// @return the socket address for bind(2) and connect(2); everything but family, address and port is zero
    sockaddr_storage getSockaddr() const noexcept;

    /// @return the text form
    std::string str() const;

    friend bool operator==(const IPEndpoint& a, const IPEndpoint& b) noexcept
    {
        return a.mAddress == b.mAddress && a.mPort == b.mPort;
    }
    friend bool operator!=(const IPEndpoint& a, const IPEndpoint& b) noexcept { return !(a == b); }
    /// Orders by address, then by port.
    friend bool operator<(const IPEndpoint& a, const IPEndpoint& b) noexcept
    {
        const int order = a.mAddress.compare(b.mAddress);
        return order < 0 || (order == 0 && a.mPort < b.mPort);
    }

private:
    IPAddress mAddress;
    std::uint16_t mPort; // in host byte order
};

/// Prints the text form, with the port in decimal.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const IPEndpoint& endpoint);

} // namespace qel
