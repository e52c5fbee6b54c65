#pragma once

#include <qel/common/QelExport.hpp>

#include <bitset>
#include <cstddef>
#include <iosfwd>
#include <string>

namespace qel {

/// The 32 capability bits that the two ends of a connection tell each other when it starts.
///
/// A small value: copy it freely. What a bit means is agreed between the programs; this class only carries it.
/// The text form has one character for each bit, and the first character is bit 0. That is the reverse of the order in
/// which std::bitset reads and prints, and it is meant: the text then stands in the order in which the bits travel.
/// Thread safety: that of an int; objects share nothing.
class QEL_EXPORT QelCapabilities {
public:
    /// All bits clear.
    QelCapabilities() noexcept = default;

    /// Reads the text form: character i equal to '1' sets bit i, '0' leaves it clear.
    /// @param text any length: bits without a character stay clear, and characters after the 32nd are not looked at
    /// @throws std::invalid_argument "invalid string given to capability set": another character among the first 32
    explicit QelCapabilities(const std::string& text);

    /// @param index number of the bit, 0 to 31
    /// @throws std::out_of_range the index is 32 or more
    bool operator[](std::size_t index) const { return mCapabilities.test(index); }

    /// Sets one bit.
    /// @param index number of the bit, 0 to 31
    /// @return this object, so that calls chain
    /// @throws std::out_of_range the index is 32 or more; nothing is changed
    QelCapabilities& set(std::size_t index);

    /// Clears one bit.
    /// @param index number of the bit, 0 to 31
    /// @return this object, so that calls chain
    /// @throws std::out_of_range the index is 32 or more; nothing is changed
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

/// Writes the text form, the same as QelCapabilities::to_string().
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const QelCapabilities& capabilities);

} // namespace qel
