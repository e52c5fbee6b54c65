#pragma once

#include <qel/common/QelMessageExceptions.hpp>

#include <cstdint>
#include <string>

namespace qel {

/// Out of line, so that a check costs the good case one comparison.
/// @throws QelMessageValidationException  always
[[noreturn, gnu::cold, gnu::noinline]] inline void throwValidation(const char* phrase)
{
    throw QelMessageValidationException(phrase);
}

/// Refuses a frame, or the arguments of a builder, if a condition does not hold.
/// @param phrase  the text of the exception
/// @throws QelMessageValidationException  the condition is false
inline void require(bool condition, const char* phrase)
{
    if (!condition) throwValidation(phrase);
}

/// The length of a text as its 16-bit length field holds it: it wraps from 65536 bytes on. The peer sees only the
/// wrapped number, so checks and copies that depend on it must use it too.
inline std::uint16_t wireLength(const std::string& text) noexcept { return static_cast<std::uint16_t>(text.size()); }

} // namespace qel
