#include <qel/common/net/IPv4Address.hpp>

#include <arpa/inet.h>
#include <cstring>

namespace qel {

IPv4Address IPv4Address::parse(const std::string& text)
{
    IPv4Address address;
    // inet_pton stops at a NUL byte: whatever follows one would pass unseen.
    const bool hasNul = text.find('\0') != std::string::npos;
    if (hasNul || ::inet_pton(AF_INET, text.c_str(), address.mAddress.data()) != 1) {
        throw std::invalid_argument("'" + text + "' is not a valid IPv4 address");
    }
    return address;
}

std::string IPv4Address::str() const
{
    char text[INET_ADDRSTRLEN]; // holds every IPv4 address, so the call cannot fail
    return ::inet_ntop(AF_INET, mAddress.data(), text, sizeof(text));
}

std::uint32_t IPv4Address::toUint32() const noexcept
{
    return std::uint32_t{mAddress[0]} << 24 | std::uint32_t{mAddress[1]} << 16 | std::uint32_t{mAddress[2]} << 8 |
           std::uint32_t{mAddress[3]};
}

unsigned IPv4Address::subnetPrefix() const
{
    constexpr unsigned kBits = 32;
    const std::uint32_t mask = toUint32();
    unsigned prefix = 0;
    while (prefix < kBits && (mask & (0x80000000U >> prefix)) != 0)
        ++prefix;
    // A shift by all 32 bits is undefined, and behind 32 leading ones there is nothing left to look at.
    if (prefix < kBits && (mask << prefix) != 0) {
        throw std::invalid_argument("IP address is not a subnet mask");
    }
    return prefix;
}

int IPv4Address::compare(const IPv4Address& other) const noexcept
{
    const int order = std::memcmp(mAddress.data(), other.mAddress.data(), kNumBytes);
    return (order > 0) - (order < 0);
}

} // namespace qel
