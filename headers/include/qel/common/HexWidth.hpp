#pragma once

#include <cstddef>
#include <type_traits>

namespace qel {

/// The minimum number of digits with which hexFormat() (StreamFormatters.hpp) prints a value of type T: two for each
/// byte of T. A type that needs another width specialises this in its own header, in namespace qel:
/// @code
/// enum QelMessageStatusCodes : unsigned short { ... };
/// template <> struct HexWidth<QelMessageStatusCodes> : std::integral_constant<std::size_t, 8> {};
/// @endcode
/// This header is apart from StreamFormatters.hpp so that such a header stays cheap to compile.
/// Thread safety: a compile-time constant.
template <typename T>
struct HexWidth : std::integral_constant<std::size_t, 2 * sizeof(T)> {};

} // namespace qel
