#pragma once

namespace qel {

/// Gives a class the six relational operators of its compare(). Derive publicly from Comparable of the class itself:
/// @code
/// class Version : public Comparable<Version> {
/// public:
///     int compare(const Version& other) const noexcept; // negative, 0 or positive, as strcmp(3)
/// };
/// @endcode
/// Has no data, and adds none to the class.
/// Thread safety: as the class's compare().
template <typename Derived>
class Comparable {
public:
    friend bool operator==(const Derived& a, const Derived& b) noexcept { return a.compare(b) == 0; }
    friend bool operator!=(const Derived& a, const Derived& b) noexcept { return a.compare(b) != 0; }
    friend bool operator<(const Derived& a, const Derived& b) noexcept { return a.compare(b) < 0; }
    friend bool operator>(const Derived& a, const Derived& b) noexcept { return a.compare(b) > 0; }
    friend bool operator<=(const Derived& a, const Derived& b) noexcept { return a.compare(b) <= 0; }
    friend bool operator>=(const Derived& a, const Derived& b) noexcept { return a.compare(b) >= 0; }
};

} // namespace qel
