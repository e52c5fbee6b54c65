#pragma once

#include <qel/common/QelMessageExceptions.hpp>

#include <cstdint>
#include <string>

namespace qel {

/// Refuses a frame, or the arguments of a message to be built.
/// @param phrase  what is wrong, a fixed phrase
/// @throws QelMessageValidationException  with the phrase, unless the condition holds
inline void require(bool condition, const char* phrase)
{
    if (!condition) throw QelMessageValidationException(phrase);
}

/// The length fields of texts are 16 bits wide, and a text of 65536 bytes or more wraps in them. The peer sees the
/// wrapped number only, so whatever is checked or copied by that number must use it too.
inline std::uint16_t wireLength(const std::string& text) noexcept { return static_cast<std::uint16_t>(text.size()); }

} // namespace qel
