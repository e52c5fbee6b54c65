#pragma once

#include <qel/common/QelExport.hpp>

#include <array>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <iosfwd>

namespace qel {

/// The hardware address of a network card: six bytes.
/// Thread safety: a plain value.
class QEL_EXPORT MACAddress {
public:
    /// Bytes of an address.
    static constexpr std::size_t NUM_BYTES = 6;
    /// The bits of an integer that hold an address: the low 48.
    static constexpr std::uint64_t MASK = 0xFFFFFFFFFFFF;

    /// 00:00:00:00:00:00
    constexpr MACAddress() noexcept : mBeU64(0) {}

    /// @param value  the first byte in bits 47 to 40, the last in bits 7 to 0; higher bits are ignored
    explicit constexpr MACAddress(std::uint64_t value) noexcept : mBeU64(value & MASK) {}

    /// @param bytes  exactly six, in the order in which they print
    /// @throws std::invalid_argument  "length": not six bytes
    MACAddress(std::initializer_list<unsigned char> bytes);

    /// @param bytes   copied, in the order in which they print; of any alignment
    /// @param length  exactly six
    /// @throws std::invalid_argument  "length": not six; "bytes": a null pointer
    MACAddress(const void* bytes, std::size_t length);

    /// @return the six bytes in the order in which they print
    std::array<unsigned char, NUM_BYTES> bytes() const noexcept;

    friend bool operator==(const MACAddress& a, const MACAddress& b) noexcept { return a.mBeU64 == b.mBeU64; }
    friend bool operator!=(const MACAddress& a, const MACAddress& b) noexcept { return a.mBeU64 != b.mBeU64; }
    friend bool operator<(const MACAddress& a, const MACAddress& b) noexcept { return a.mBeU64 < b.mBeU64; }
    friend bool operator>(const MACAddress& a, const MACAddress& b) noexcept { return a.mBeU64 > b.mBeU64; }
    friend bool operator<=(const MACAddress& a, const MACAddress& b) noexcept { return a.mBeU64 <= b.mBeU64; }
    friend bool operator>=(const MACAddress& a, const MACAddress& b) noexcept { return a.mBeU64 >= b.mBeU64; }

private:
    std::uint64_t mBeU64; // first byte in bits 47 to 40, so that integers compare as the addresses do
};

/// Prints six pairs of upper-case hexadecimal digits with ':' between them: AA:BB:CC:00:11:22. Leaves the stream in
/// upper-case hexadecimal with the fill character '0', as every hexadecimal formatter of the library does.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const MACAddress& address);

} // namespace qel
