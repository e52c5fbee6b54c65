#include <qel/common/net/IPv4Address.hpp>

#include "net/AddressBytes.hpp"

#include <arpa/inet.h>

namespace qel {

IPv4Address IPv4Address::parse(const std::string& text)
{
    return IPv4Address(parseAddress<kNumBytes>(AF_INET, "IPv4", text));
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
    // A shift by all 32 bits is undefined; a mask of 32 ones has no bits left to check.
    if (prefix < kBits && (mask << prefix) != 0) {
        throw std::invalid_argument("IP address is not a subnet mask");
    }
    return prefix;
}

int IPv4Address::compare(const IPv4Address& other) const noexcept { return compareBytes(mAddress, other.mAddress); }

} // namespace qel
