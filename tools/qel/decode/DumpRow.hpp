#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace qel::tool {

/// One row of a hex dump with an offset and a character column.
struct DumpRow {
    std::uint64_t offset = 0;
    std::string bytes;
};

/// Reads a row that `xxd` prints: "00000000: deca ff20 0000 0028  ... ...(".
/// @return none for a line of another form
std::optional<DumpRow> parseXxdRow(const std::string& text);

/// Reads a row that `hexdump -C` prints: "00000000  de ca ff 20 00 00 00 28  |... ...(|".
/// @return none for a line of another form
std::optional<DumpRow> parseHexdumpRow(const std::string& line);

/// Reads the last line that `hexdump -C` prints: the offset after the last byte, alone.
/// @return none for a line of another form
std::optional<std::uint64_t> parseHexdumpEnd(const std::string& text);

} // namespace qel::tool
