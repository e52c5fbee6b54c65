#include <qel/common/net/IPAddress.hpp>

#include <array>
#include <cstring>
#include <ostream>
#include <stdexcept>

namespace qel {

namespace {

template <std::size_t Size>
std::array<unsigned char, Size> takeBytes(const void* bytes, unsigned length)
{
    if (length < Size) throw std::invalid_argument("length");
    if (bytes == nullptr) throw std::invalid_argument("bytes");
    std::array<unsigned char, Size> result;
    std::memcpy(result.data(), bytes, Size);
    return result;
}

} // namespace

IPAddress::IPAddress() noexcept : IPAddress(IPv4Address::ZERO) {}

IPAddress::IPAddress(IPFamily family, const void* bytes, unsigned length) : IPAddress()
{
    switch (family) {
    case IPFamily::IPv4:
        *this = IPv4Address(takeBytes<IPv4Address::kNumBytes>(bytes, length));
        return;
    case IPFamily::IPv6:
        *this = IPv6Address(takeBytes<IPv6Address::kNumBytes>(bytes, length));
        return;
    }
    throw std::invalid_argument("family");
}

IPAddress::IPAddress(const IPv4Address& address) noexcept : mFamily(IPv4Address::Family), mAddress(address) {}

IPAddress::IPAddress(const IPv6Address& address) noexcept : mFamily(IPv6Address::Family), mAddress(address) {}

const IPv4Address& IPAddress::getIPv4() const
{
    if (mFamily != IPFamily::IPv4) throw std::invalid_argument("family");
    return mAddress.mIPv4;
}

const IPv6Address& IPAddress::getIPv6() const
{
    if (mFamily != IPFamily::IPv6) throw std::invalid_argument("family");
    return mAddress.mIPv6;
}

const unsigned char* IPAddress::bytes() const noexcept
{
    return mFamily == IPFamily::IPv4 ? mAddress.mIPv4.bytes().data() : mAddress.mIPv6.bytes().data();
}

std::size_t IPAddress::size() const noexcept
{
    return mFamily == IPFamily::IPv4 ? IPv4Address::kNumBytes : IPv6Address::kNumBytes;
}

std::string IPAddress::str() const { return mFamily == IPFamily::IPv4 ? mAddress.mIPv4.str() : mAddress.mIPv6.str(); }

int IPAddress::compare(const IPAddress& other) const noexcept
{
    if (mFamily != other.mFamily) return mFamily < other.mFamily ? -1 : 1;
    return mFamily == IPFamily::IPv4 ? mAddress.mIPv4.compare(other.mAddress.mIPv4)
                                     : mAddress.mIPv6.compare(other.mAddress.mIPv6);
}

std::ostream& operator<<(std::ostream& os, const IPAddress& address) { return os << address.str(); }

} // namespace qel
