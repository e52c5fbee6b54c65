#pragma once

#include <qel/common/QelExport.hpp>

#include <bitset>
#include <cstddef>
#include <iosfwd>
#include <string>

namespace qel {

/// The 32 capability bits that the two peers of a connection exchange when it starts.
///
/// A small value, cheap to copy. The programs define what a bit means; this class only carries it.
/// The text form has one character for each bit, and the first character is bit 0. This is deliberately the reverse of
/// std::bitset: the characters are in the order in which the bits are sent.
/// Thread safety: as an int; objects share no state.
class QEL_EXPORT QelCapabilities {
public:
    /// All bits clear.
    QelCapabilities() noexcept = default;

    /// Reads the text form: character i equal to '1' sets bit i, '0' leaves it clear.
    /// @param text any length: bits without a character stay clear, and characters after the 32nd are ignored
    /// @throws std::invalid_argument "invalid string given to capability set": one of the first 32 characters is
    ///         neither '0' nor '1'
    explicit QelCapabilities(const std::string& text);

    /// @param index number of the bit, 0 to 31
    /// @return true if the bit is set
    /// @throws std::out_of_range the index is 32 or more
    bool operator[](std::size_t index) const { return mCapabilities.test(index); }

    /// Sets one bit.
    /// @param index number of the bit, 0 to 31
    /// @return this object, for chaining
    /// @throws std::out_of_range the index is 32 or more; nothing changes
    QelCapabilities& set(std::size_t index);

    /// Clears one bit.
    /// @param index number of the bit, 0 to 31
    /// @return this object, for chaining
    /// @throws std::out_of_range the index is 32 or more; nothing changes
    QelCapabilities& reset(std::size_t index);

    /// The number of bits, set or not.
    static constexpr std::size_t size() noexcept { return kBits; }

    /// The text form: exactly 32 characters "0" or "1", bit 0 first.
    std::string to_string() const;

    bool operator==(const QelCapabilities& other) const noexcept { return mCapabilities == other.mCapabilities; }
    bool operator!=(const QelCapabilities& other) const noexcept { return mCapabilities != other.mCapabilities; }

private:
    static constexpr std::size_t kBits = 32;

    std::bitset<kBits> mCapabilities;
};

/// Prints the text form, as QelCapabilities::to_string() returns it.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelCapabilities& capabilities);

} // namespace qel
