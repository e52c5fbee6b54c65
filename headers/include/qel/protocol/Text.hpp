#pragma once

#include <qel/protocol/ProtocolExport.hpp>

#include <string>

namespace qel::protocol {

/// Makes untrusted bytes safe to print on a terminal: printable ASCII stays, a backslash is doubled, every other byte
/// becomes "\xHH".
QEL_PROTOCOL_EXPORT std::string printable(const std::string& bytes);

/// printable() in double quotes; a double quote inside becomes "\"".
QEL_PROTOCOL_EXPORT std::string quoted(const std::string& bytes);

/// printable() for text of several lines: line feeds stay.
QEL_PROTOCOL_EXPORT std::string printableLines(const std::string& bytes);

/// Two lower-case hexadecimal digits for each byte, without separators.
QEL_PROTOCOL_EXPORT std::string hexDigits(const std::string& bytes);

} // namespace qel::protocol
