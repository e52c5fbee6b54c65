#include <qel/common/net/IPEndpoint.hpp>

#include <algorithm>
#include <arpa/inet.h>
#include <cstring>
#include <netinet/in.h>
#include <ostream>
#include <stdexcept>

namespace qel {

namespace {

std::uint16_t parsePort(const std::string& text)
{
    const bool digitsOnly = std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
    if (!digitsOnly) throw std::invalid_argument("Invalid character in port");

    constexpr unsigned long kMaxPort = 65535;
    constexpr const char* kTooLarge = "Port value is too large";
    unsigned long port = 0;
    try {
        port = std::stoul(text);
    } catch (const std::out_of_range&) {
        throw std::out_of_range(kTooLarge);
    }
    if (port > kMaxPort) throw std::out_of_range(kTooLarge);
    return static_cast<std::uint16_t>(port);
}

IPAddress parseHost(const std::string& text)
{
    const bool inBrackets = text.size() > 1 && text.front() == '[' && text.back() == ']';
    if (inBrackets) return IPv6Address::parse(text.substr(1, text.size() - 2));
    try {
        return IPv4Address::parse(text);
    } catch (const std::invalid_argument&) {
        throw std::invalid_argument("IPv6 address is not contained in brackets");
    }
}

} // namespace

IPEndpoint::IPEndpoint() noexcept : mPort(0) {}

IPEndpoint::IPEndpoint(const IPAddress& address, std::uint16_t port) noexcept : mAddress(address), mPort(port) {}

IPEndpoint::IPEndpoint(const std::string& text) : mPort(0)
{
    const std::string::size_type delimiter = text.rfind(':');
    if (delimiter == std::string::npos) throw std::invalid_argument("No port delimiter");
    mPort = parsePort(text.substr(delimiter + 1));
    mAddress = parseHost(text.substr(0, delimiter));
}

// The address is copied out of and into the sockaddr_storage, because access through a pointer of another type is
// undefined.
IPEndpoint::IPEndpoint(const sockaddr_storage& address) : mPort(0)
{
    switch (address.ss_family) {
    case AF_INET: {
        sockaddr_in ipv4;
        std::memcpy(&ipv4, &address, sizeof(ipv4));
        mAddress = IPAddress(IPFamily::IPv4, &ipv4.sin_addr, sizeof(ipv4.sin_addr));
        mPort = ntohs(ipv4.sin_port);
        return;
    }
    case AF_INET6: {
        sockaddr_in6 ipv6;
        std::memcpy(&ipv6, &address, sizeof(ipv6));
        mAddress = IPAddress(IPFamily::IPv6, &ipv6.sin6_addr, sizeof(ipv6.sin6_addr));
        mPort = ntohs(ipv6.sin6_port);
        return;
    }
    default:
        throw std::invalid_argument("Not an IP address family");
    }
}

sockaddr_storage IPEndpoint::getSockaddr() const noexcept
{
    sockaddr_storage address{};
    if (getFamily() == IPFamily::IPv6) {
        sockaddr_in6 ipv6{};
        ipv6.sin6_family = AF_INET6;
        ipv6.sin6_port = htons(mPort);
        std::memcpy(&ipv6.sin6_addr, mAddress.bytes(), mAddress.size());
        std::memcpy(&address, &ipv6, sizeof(ipv6));
    } else {
        sockaddr_in ipv4{};
        ipv4.sin_family = AF_INET;
        ipv4.sin_port = htons(mPort);
        std::memcpy(&ipv4.sin_addr, mAddress.bytes(), mAddress.size());
        std::memcpy(&address, &ipv4, sizeof(ipv4));
    }
    return address;
}

// Composed without a stream, whose locale may group digits: 127.0.0.1:8,080 is not an endpoint.
std::string IPEndpoint::str() const
{
    const std::string address = mAddress.str();
    const std::string host = getFamily() == IPFamily::IPv6 ? "[" + address + "]" : address;
    return host + ":" + std::to_string(mPort);
}

std::ostream& operator<<(std::ostream& os, const IPEndpoint& endpoint) { return os << endpoint.str(); }

} // namespace qel
