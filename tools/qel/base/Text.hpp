#pragma once

#include <string>

namespace qel::tool {

/// Makes untrusted bytes safe to print on a terminal: printable ASCII stays, a backslash is doubled, every other byte
/// becomes "\xHH".
std::string printable(const std::string& bytes);

/// printable() in double quotes; a double quote inside becomes "\"".
std::string quoted(const std::string& bytes);

/// printable() for text of several lines: line feeds stay.
std::string printableLines(const std::string& bytes);

/// Two lower-case hexadecimal digits for each byte, without separators.
std::string hexDigits(const std::string& bytes);

} // namespace qel::tool
