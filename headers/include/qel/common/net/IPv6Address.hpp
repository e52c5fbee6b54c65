#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPFamily.hpp>
#include <qel/common/util/Comparable.hpp>

#include <array>
#include <cstddef>
#include <initializer_list>
#include <stdexcept>
#include <string>

namespace qel {

class MACAddress;

/// An IPv6 address: sixteen bytes in network order. Addresses compare in numeric order.
/// It has no scope (the "%eth0" of a text form): a link-local address can be built, compared and printed, but the
/// system cannot connect to it without its scope. To connect to one, connect a descriptor of your own and pass it to
/// Socket(int).
/// Thread safety: a plain value.
class QEL_EXPORT IPv6Address : public Comparable<IPv6Address> {
public:
    /// ::
    static const IPv6Address ZERO;
    /// fe80::, the prefix of the link-local addresses (RFC 4291, section 2.5.6)
    static const IPv6Address LINK_LOCAL_PREFIX;
    /// ::ffff:0:0, the prefix of the IPv4-mapped addresses (RFC 4291, section 2.5.5.2)
    static const IPv6Address IPV4_MAPPED_PREFIX;
    static constexpr IPFamily Family = IPFamily::IPv6;
    /// Bytes of an address.
    static constexpr std::size_t kNumBytes = 16;

    /// ::
    constexpr IPv6Address() noexcept : mAddress{} {}

    /// @param bytes  up to sixteen bytes in network order; missing trailing bytes are zero
    /// @throws std::invalid_argument  "length": more than sixteen bytes
    constexpr IPv6Address(std::initializer_list<unsigned char> bytes) : mAddress{}
    {
        if (bytes.size() > kNumBytes) throw std::invalid_argument("length");
        std::size_t index = 0;
        for (const unsigned char byte : bytes)
            mAddress[index++] = byte;
    }

    /// @param bytes  all sixteen bytes in network order
    explicit constexpr IPv6Address(const std::array<unsigned char, kNumBytes>& bytes) noexcept : mAddress(bytes) {}

    /// Reads a text form of inet_pton(3), as in "fe80::1" or "::ffff:10.0.0.1"; no brackets, no scope.
    /// @throws std::invalid_argument  "'TEXT' is not a valid IPv6 address"
    static IPv6Address parse(const std::string& text);

    /// @return the shortest text form, as inet_ntop(3) writes it
    std::string str() const;

    /// @return the interface address that a network card with this MAC address gives itself: the first eight bytes of
    ///         the prefix, then the modified EUI-64 identifier (RFC 4291, appendix A), which is the MAC address with
    ///         its universal/local bit inverted and FF FE in the middle
    static IPv6Address eui64(const IPv6Address& prefix, const MACAddress& mac);
    /// @return eui64(LINK_LOCAL_PREFIX, mac)
    static IPv6Address linkLocal(const MACAddress& mac);

    /// @return true for fe80::/10: the first ten bits are those of LINK_LOCAL_PREFIX
    bool isLinkLocal() const noexcept;
    /// @return true for ::ffff:0:0/96: the first twelve bytes are those of IPV4_MAPPED_PREFIX
    bool isIPv4Mapped() const noexcept;

    /// @return the sixteen bytes in network order, owned by this object
    const std::array<unsigned char, kNumBytes>& bytes() const noexcept { return mAddress; }
    explicit operator std::array<unsigned char, kNumBytes>() const noexcept { return mAddress; }

    /// Bit operations over all 128 bits, for masking.
    IPv6Address operator~() const noexcept;
    IPv6Address operator&(const IPv6Address& other) const noexcept;
    IPv6Address operator|(const IPv6Address& other) const noexcept;
    IPv6Address& operator&=(const IPv6Address& other) noexcept;
    IPv6Address& operator|=(const IPv6Address& other) noexcept;

    /// @return -1, 0 or 1: this address is less than, equal to or greater than the other
    int compare(const IPv6Address& other) const noexcept;

private:
    std::array<unsigned char, kNumBytes> mAddress;
};

inline constexpr IPv6Address IPv6Address::ZERO{};
inline constexpr IPv6Address IPv6Address::LINK_LOCAL_PREFIX{0xFE, 0x80};
inline constexpr IPv6Address IPv6Address::IPV4_MAPPED_PREFIX{0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xFF, 0xFF};

} // namespace qel
