#pragma once

#include <qel/common/EndianExtensions.hpp>

#include <stdexcept>
#include <type_traits>

/// @file
/// Packed binary-coded decimal numbers, laid directly over the bytes of a frame.

namespace qel {

/// A packed binary-coded decimal number: one decimal digit in each half byte, most significant digit first. 2024 is
/// stored as the bytes 20 24. T is unsigned char (two digits) or unsigned short (four digits).
///
/// Shape: exactly sizeof(T) bytes, alignment 1. A default-constructed object is uninitialised, like a plain integer.
/// Thread safety: as a plain integer.
template <typename T>
class bcd_uint {
    static_assert(std::is_same<T, unsigned char>::value || std::is_same<T, unsigned short>::value,
                  "only numbers of two and four digits occur on the wire");

public:
    bcd_uint() noexcept = default;

    /// Encodes a number. The parameter is the widest integer type, so that a number that does not fit is refused and
    /// never truncated. Implicit, so that a field is assigned like a plain integer.
    /// @throws std::range_error "type cannot be represented in BCD": the number has more than digits() digits
    bcd_uint(unsigned long long hostValue) : mValue(bcd(hostValue)) {}

    /// @return the number of decimal digits that the type holds: 2 for unsigned char, 4 for unsigned short
    static constexpr unsigned int digits() noexcept { return 2 * sizeof(T); }

    /// @return the decoded number; see debcd()
    T value() const noexcept { return debcd(mValue.value()); }

    /// The same as value(); implicit, so that a field is read like a plain integer.
    operator T() const noexcept { return value(); }

    /// Encodes a number: the lowest decimal digit goes to the lowest half byte.
    /// @return the code in host byte order, for example 0x2024 for 2024
    /// @throws std::range_error "type cannot be represented in BCD": the number has more than digits() digits
    static T bcd(unsigned long long value)
    {
        unsigned int code = 0;
        for (unsigned int digit = 0; digit < digits(); ++digit) {
            code |= static_cast<unsigned int>(value % 10) << (4 * digit);
            value /= 10;
        }
        if (value != 0) throw std::range_error("type cannot be represented in BCD");
        return static_cast<T>(code);
    }

    /// Decodes a code given in host byte order. A half byte above 9 is not refused but contributes its value: an A in
    /// the tens adds 100. This is deliberate; a receiver that accepts only digits checks the bytes itself.
    static T debcd(T raw) noexcept
    {
        unsigned int value = 0;
        unsigned int weight = 1;
        for (unsigned int digit = 0; digit < digits(); ++digit) {
            value += ((static_cast<unsigned int>(raw) >> (4 * digit)) & 0xFU) * weight;
            weight *= 10;
        }
        return static_cast<T>(value); // 16665 at most, for FFFF
    }

private:
    endian_uint<T, 4321> mValue;
};

using bcd_uint8_t = bcd_uint<unsigned char>;
using bcd_uint16_t = bcd_uint<unsigned short>;

static_assert(sizeof(bcd_uint8_t) == 1 && alignof(bcd_uint8_t) == 1, "overlays the frame buffer");
static_assert(sizeof(bcd_uint16_t) == 2 && alignof(bcd_uint16_t) == 1, "overlays the frame buffer");

} // namespace qel
