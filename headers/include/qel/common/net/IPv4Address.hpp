#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPFamily.hpp>
#include <qel/common/util/Comparable.hpp>

#include <array>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <stdexcept>
#include <string>

namespace qel {

/// An IPv4 address: four bytes in network order. Addresses compare in numeric order.
/// Thread safety: a plain value.
class QEL_EXPORT IPv4Address : public Comparable<IPv4Address> {
public:
    /// 0.0.0.0
    static const IPv4Address ZERO;
    static constexpr IPFamily Family = IPFamily::IPv4;
    /// Bytes of an address.
    static constexpr std::size_t kNumBytes = 4;

    /// 0.0.0.0
    constexpr IPv4Address() noexcept : mAddress{} {}

    /// @param bytes  up to four bytes in network order; missing trailing bytes are zero
    /// @throws std::invalid_argument  "length": more than four bytes
    constexpr IPv4Address(std::initializer_list<unsigned char> bytes) : mAddress{}
    {
        if (bytes.size() > kNumBytes) throw std::invalid_argument("length");
        std::size_t index = 0;
        for (const unsigned char byte : bytes)
            mAddress[index++] = byte;
    }

    /// @param bytes  all four bytes in network order
    explicit constexpr IPv4Address(const std::array<unsigned char, kNumBytes>& bytes) noexcept : mAddress(bytes) {}

    /// @param hostOrder  the address as an integer in host byte order: 0x7F000001 is 127.0.0.1.
    ///                   Mind the brackets: IPv4Address(1u) is 0.0.0.1, IPv4Address{1} is the byte list 1.0.0.0.
    explicit constexpr IPv4Address(std::uint32_t hostOrder) noexcept
        : mAddress{static_cast<unsigned char>(hostOrder >> 24), static_cast<unsigned char>(hostOrder >> 16),
                   static_cast<unsigned char>(hostOrder >> 8), static_cast<unsigned char>(hostOrder)}
    {}

    /// Reads the dotted form of inet_pton(3): four decimal numbers without leading zeros.
    /// @throws std::invalid_argument  "'TEXT' is not a valid IPv4 address"
    static IPv4Address parse(const std::string& text);

    /// @return the dotted form, as in "10.0.0.1"
    std::string str() const;

    /// @return the four bytes in network order, owned by this object
    const std::array<unsigned char, kNumBytes>& bytes() const noexcept { return mAddress; }
    explicit operator std::array<unsigned char, kNumBytes>() const noexcept { return mAddress; }

    /// @return the address as an integer in host byte order: 0x7F000001 for 127.0.0.1
    std::uint32_t toUint32() const noexcept;

    /// Takes the address as a netmask.
    /// @return the number of leading 1 bits, 0 to 32: 24 for 255.255.255.0
    /// @throws std::invalid_argument  "IP address is not a subnet mask": a 1 bit follows a 0 bit
    unsigned subnetPrefix() const;

    /// @return -1, 0 or 1: this address is less than, equal to or greater than the other
    int compare(const IPv4Address& other) const noexcept;

private:
    std::array<unsigned char, kNumBytes> mAddress;
};

inline constexpr IPv4Address IPv4Address::ZERO{};

} // namespace qel
