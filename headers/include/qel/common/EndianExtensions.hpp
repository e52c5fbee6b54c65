#pragma once

#include <cstdint>
#include <cstring>
#include <type_traits>

/// @file
/// Integers in the byte order of the wire, laid directly over the bytes of a frame.

namespace qel {

/// An unsigned integer stored in a fixed byte order. Only order 4321 (big-endian, network byte order) is defined.
template <typename T, unsigned int Order>
class endian_uint;

/// An unsigned integer of 8, 16 or 32 bits stored in network byte order, most significant byte first.
///
/// Shape: exactly sizeof(T) bytes, alignment 1, no padding. A structure of such members can therefore be laid over
/// received bytes at any address, odd ones included.
/// A default-constructed object is uninitialised, like a plain integer, so that overlays cost nothing.
/// Thread safety: as a plain integer. Nothing here throws.
template <typename T>
class endian_uint<T, 4321> {
    static_assert(std::is_unsigned<T>::value && sizeof(T) <= 4, "wire integers are unsigned and have 8, 16 or 32 bits");

public:
    endian_uint() noexcept = default;

    /// Stores a value given in host byte order. Implicit, so that a field is assigned like a plain integer.
    endian_uint(T hostValue) noexcept
    {
        const T stored = convert(hostValue);
        std::memcpy(mValue, &stored, sizeof(T));
    }

    /// @return the value in host byte order
    T value() const noexcept
    {
        T stored;
        std::memcpy(&stored, mValue, sizeof(T));
        return convert(stored);
    }

    /// The same as value(); implicit, so that a field is read like a plain integer.
    operator T() const noexcept { return value(); }

    /// Converts between host byte order and network byte order: swaps the bytes on a little-endian host and returns the
    /// value unchanged on a big-endian host. A single byte never changes.
    static constexpr T convert(T value) noexcept
    {
#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_BIG_ENDIAN__
        return value;
#else
        if constexpr (sizeof(T) == 4) {
            return __builtin_bswap32(value);
        } else if constexpr (sizeof(T) == 2) {
            return __builtin_bswap16(value);
        } else {
            return value;
        }
#endif
    }

private:
    unsigned char mValue[sizeof(T)]; // as on the wire: most significant byte first
};

using be_uint16_t = endian_uint<unsigned short, 4321>;
using be_uint32_t = endian_uint<unsigned int, 4321>;

static_assert(sizeof(endian_uint<unsigned char, 4321>) == 1 && alignof(endian_uint<unsigned char, 4321>) == 1,
              "overlays the frame buffer");
static_assert(sizeof(be_uint16_t) == 2 && alignof(be_uint16_t) == 1, "overlays the frame buffer");
static_assert(sizeof(be_uint32_t) == 4 && alignof(be_uint32_t) == 1, "overlays the frame buffer");
static_assert(std::is_trivial<be_uint16_t>::value && std::is_standard_layout<be_uint16_t>::value,
              "overlays the frame buffer");

} // namespace qel
