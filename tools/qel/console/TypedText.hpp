#pragma once

#include <optional>
#include <string>

namespace qel::tool {

/// Replaces "\r", "\n", "\t", "\e", "\\" and "\xHH" by the characters that they stand for.
/// @return none when a backslash is followed by something else
std::optional<std::string> parseTypedText(const std::string& text);

/// For a validator. @return what is wrong; empty: nothing
std::string checkTypedText(std::string& text);

/// The same for a POSIX extended regular expression.
std::string checkPattern(std::string& text);

} // namespace qel::tool
