#pragma once

#include <type_traits>

/// @file
/// Bitwise operators for enumerations whose values are bits. Specialise is_bitmask_enum for the enumeration; `|`, `&`,
/// `^`, `~`, `|=`, `&=` and `^=` then take it and return the same type:
/// @code
/// enum class Option : int { Default = 0, Blocking = 1, LowPriority = 2 };
/// template <> struct is_bitmask_enum<Option> : std::true_type {};
/// if ((options & Option::Blocking) != Option::Default) ...
/// @endcode
/// The enumeration needs a fixed underlying type (an `enum class` always has one): only then is every combination of
/// bits a value of it. Argument-dependent lookup finds the operators for enumerations in namespace qel and in its
/// classes; for an enumeration of another namespace write `using qel::operator|;`.
/// Thread safety: the operators are functions of their arguments; the compound ones write to their left one.

namespace qel {

/// Whether the values of an enumeration are sets of bits. Specialise as std::true_type, in namespace qel.
template <typename E>
struct is_bitmask_enum : std::false_type {};

/// E, if is_bitmask_enum<E> is true. There is no such type otherwise, which removes the operators from overload
/// resolution.
template <typename E>
using bitmask_enum_t = std::enable_if_t<std::is_enum<E>::value && is_bitmask_enum<E>::value, E>;

template <typename E>
constexpr bitmask_enum_t<E> operator|(E left, E right) noexcept
{
    using Bits = std::underlying_type_t<E>;
    return static_cast<E>(static_cast<Bits>(static_cast<Bits>(left) | static_cast<Bits>(right)));
}

template <typename E>
constexpr bitmask_enum_t<E> operator&(E left, E right) noexcept
{
    using Bits = std::underlying_type_t<E>;
    return static_cast<E>(static_cast<Bits>(static_cast<Bits>(left) & static_cast<Bits>(right)));
}

template <typename E>
constexpr bitmask_enum_t<E> operator^(E left, E right) noexcept
{
    using Bits = std::underlying_type_t<E>;
    return static_cast<E>(static_cast<Bits>(static_cast<Bits>(left) ^ static_cast<Bits>(right)));
}

template <typename E>
constexpr bitmask_enum_t<E> operator~(E value) noexcept
{
    using Bits = std::underlying_type_t<E>;
    return static_cast<E>(static_cast<Bits>(~static_cast<Bits>(value)));
}

template <typename E>
constexpr bitmask_enum_t<E>& operator|=(E& left, E right) noexcept
{
    return left = left | right;
}

template <typename E>
constexpr bitmask_enum_t<E>& operator&=(E& left, E right) noexcept
{
    return left = left & right;
}

template <typename E>
constexpr bitmask_enum_t<E>& operator^=(E& left, E right) noexcept
{
    return left = left ^ right;
}

} // namespace qel
