#include <qel/common/net/IPv6Address.hpp>
#include <qel/common/net/MACAddress.hpp>

#include "net/AddressBytes.hpp"

#include <algorithm>
#include <arpa/inet.h>
#include <cstring>

namespace qel {

IPv6Address IPv6Address::parse(const std::string& text)
{
    return IPv6Address(parseAddress<kNumBytes>(AF_INET6, "IPv6", text));
}

std::string IPv6Address::str() const
{
    char text[INET6_ADDRSTRLEN]; // holds every IPv6 address, so the call cannot fail
    return ::inet_ntop(AF_INET6, mAddress.data(), text, sizeof(text));
}

IPv6Address IPv6Address::eui64(const IPv6Address& prefix, const MACAddress& mac)
{
    constexpr std::size_t kPrefixBytes = 8;
    constexpr unsigned char kUniversalLocalBit = 0x02;
    const std::array<unsigned char, MACAddress::NUM_BYTES> macBytes = mac.bytes();

    IPv6Address address;
    std::copy_n(prefix.mAddress.begin(), kPrefixBytes, address.mAddress.begin());
    std::copy_n(macBytes.begin(), 3, address.mAddress.begin() + 8);
    address.mAddress[8] = static_cast<unsigned char>(address.mAddress[8] ^ kUniversalLocalBit);
    address.mAddress[11] = 0xFF;
    address.mAddress[12] = 0xFE;
    std::copy_n(macBytes.begin() + 3, 3, address.mAddress.begin() + 13);
    return address;
}

IPv6Address IPv6Address::linkLocal(const MACAddress& mac) { return eui64(LINK_LOCAL_PREFIX, mac); }

bool IPv6Address::isLinkLocal() const noexcept
{
    return mAddress[0] == LINK_LOCAL_PREFIX.mAddress[0] && (mAddress[1] & 0xC0) == LINK_LOCAL_PREFIX.mAddress[1];
}

bool IPv6Address::isIPv4Mapped() const noexcept
{
    constexpr std::size_t kPrefixBytes = 12;
    return std::memcmp(mAddress.data(), IPV4_MAPPED_PREFIX.mAddress.data(), kPrefixBytes) == 0;
}

IPv6Address IPv6Address::operator~() const noexcept
{
    IPv6Address result;
    for (std::size_t i = 0; i < kNumBytes; ++i)
        result.mAddress[i] = static_cast<unsigned char>(~mAddress[i]);
    return result;
}

IPv6Address IPv6Address::operator&(const IPv6Address& other) const noexcept { return IPv6Address(*this) &= other; }

IPv6Address IPv6Address::operator|(const IPv6Address& other) const noexcept { return IPv6Address(*this) |= other; }

IPv6Address& IPv6Address::operator&=(const IPv6Address& other) noexcept
{
    for (std::size_t i = 0; i < kNumBytes; ++i) {
        mAddress[i] = static_cast<unsigned char>(mAddress[i] & other.mAddress[i]);
    }
    return *this;
}

IPv6Address& IPv6Address::operator|=(const IPv6Address& other) noexcept
{
    for (std::size_t i = 0; i < kNumBytes; ++i) {
        mAddress[i] = static_cast<unsigned char>(mAddress[i] | other.mAddress[i]);
    }
    return *this;
}

int IPv6Address::compare(const IPv6Address& other) const noexcept { return compareBytes(mAddress, other.mAddress); }

} // namespace qel
