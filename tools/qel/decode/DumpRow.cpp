#include "decode/DumpRow.hpp"

#include "decode/HexDigits.hpp"

#include <charconv>

namespace qel::tool {

namespace {

constexpr std::size_t kXxdOffsetDigits = 8; // at least; fewer digits before ':' are an address of another tool
constexpr std::size_t kHexdumpOffsetDigits = 7;

/// @return how many hexadecimal digits there are from `begin` on
std::size_t digitsFrom(const std::string& line, std::size_t begin)
{
    std::size_t end = begin;
    while (end < line.size() && isHexDigit(line[end]))
        ++end;
    return end - begin;
}

std::optional<std::uint64_t> parseOffset(const std::string& line, std::size_t digits)
{
    std::uint64_t offset = 0;
    const char* const end = line.data() + digits;
    const auto result = std::from_chars(line.data(), end, offset, 16);
    if (result.ec != std::errc() || result.ptr != end) return std::nullopt;
    return offset;
}

/// Reads groups of digits with single blanks between them.
/// @param at  where the first group begins; becomes the end of the last one
std::string parseGroups(const std::string& line, std::size_t& at)
{
    std::string bytes;
    std::size_t begin = at;
    for (;;) {
        const std::size_t digits = digitsFrom(line, begin);
        if (digits == 0 || digits % 2 != 0) return bytes;
        for (std::size_t i = begin; i < begin + digits; i += 2)
            bytes += byteOf(line[i], line[i + 1]);
        at = begin + digits;
        if (at >= line.size() || line[at] != ' ') return bytes;
        begin = at + 1;
    }
}

std::string withoutLineEnd(const std::string& line) { return line.substr(0, line.find_last_not_of("\r\n") + 1); }

bool isBlank(const std::string& text) { return text.find_first_not_of(' ') == std::string::npos; }

/// Tells the character column from further digits: it has one character for each byte of the row, at its end.
bool isCharacterColumn(const std::string& rest, std::size_t bytes)
{
    if (rest.size() < 2 || rest[0] != ' ' || rest[1] != ' ') return false;
    if (rest.size() >= bytes + 2 && isBlank(rest.substr(0, rest.size() - bytes))) return true;
    // An editor may have removed blanks from the end of the line.
    return rest.size() < bytes + 2 && rest.find_first_not_of("0123456789abcdefABCDEF ") != std::string::npos;
}

} // namespace

std::optional<DumpRow> parseXxdRow(const std::string& text)
{
    const std::string line = withoutLineEnd(text);
    const std::size_t digits = digitsFrom(line, 0);
    const bool hasOffset = digits >= kXxdOffsetDigits && line.compare(digits, 2, ": ") == 0;
    const auto offset = hasOffset ? parseOffset(line, digits) : std::nullopt;
    if (!offset) return std::nullopt;
    std::size_t at = digits + 2;
    DumpRow row{*offset, parseGroups(line, at)};
    if (row.bytes.empty() || !isCharacterColumn(line.substr(at), row.bytes.size())) return std::nullopt;
    return row;
}

std::optional<DumpRow> parseHexdumpRow(const std::string& line)
{
    const std::size_t digits = digitsFrom(line, 0);
    const std::size_t column = line.find('|');
    const bool hasOffset = digits >= kHexdumpOffsetDigits && line.compare(digits, 2, "  ") == 0;
    if (!hasOffset || column == std::string::npos) return std::nullopt;
    const auto offset = parseOffset(line, digits);
    if (!offset) return std::nullopt;
    std::size_t at = digits + 2;
    DumpRow row{*offset, parseGroups(line, at)};
    if (at + 2 < column && line.compare(at, 2, "  ") == 0) { // a wider gap after eight bytes
        const std::size_t second = at + 2;
        if (digitsFrom(line, second) > 0) {
            at = second;
            row.bytes += parseGroups(line, at);
        }
    }
    if (row.bytes.empty() || !isBlank(line.substr(at, column - at))) return std::nullopt;
    return row;
}

std::optional<std::uint64_t> parseHexdumpEnd(const std::string& text)
{
    const std::string line = withoutLineEnd(text);
    const std::size_t digits = digitsFrom(line, 0);
    if (digits < kHexdumpOffsetDigits || digits != line.size()) return std::nullopt;
    return parseOffset(line, digits);
}

} // namespace qel::tool
