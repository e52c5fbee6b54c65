#pragma once

#include <type_traits>

/// @file
/// Bitwise operators for enumerations whose values are bits. Mark the enumeration, and `|`, `&`, `^`, `~` and the
/// compound forms work on it and give the same type:
/// @code
/// enum class Option : int { Default = 0, Blocking = 1, LowPriority = 2 };
/// template <> struct is_bitmask_enum<Option> : std::true_type {};
/// if ((options & Option::Blocking) != Option::Default) ...
/// @endcode
/// The enumeration needs a fixed underlying type (an `enum class` always has one): only then is every combination a
/// value of it. The operators live in namespace qel and are found by themselves for enumerations of that namespace and
/// of classes in it; code in another namespace names them, as in `using qel::operator|;`.

namespace qel {

/// Whether an enumeration is a set of bits. Specialise as std::true_type, in namespace qel.
template <typename E>
struct is_bitmask_enum : std::false_type {};

/// The type E, for enumerations that are marked; for all other types there is none and the operators do not take part
/// in overload resolution.
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
