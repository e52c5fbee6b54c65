#pragma once

#include <string>

namespace qel::tool {

/// Makes bytes from elsewhere safe to print on a terminal: printable ASCII stays as it is, a backslash is doubled,
/// every other byte becomes "\xHH". Nothing that the other end sends can move the cursor or change the terminal.
std::string printable(const std::string& bytes);

/// The same in double quotes; those within become "\"", so that the text cannot seem to end earlier than it does.
std::string quoted(const std::string& bytes);

/// The same for a text of several lines: its line feeds stay.
std::string printableLines(const std::string& bytes);

/// The bytes as hexadecimal digits, two a byte, lower case, nothing between them.
std::string hexDigits(const std::string& bytes);

} // namespace qel::tool
