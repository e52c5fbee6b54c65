#include "certificates/PeriodText.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "base/OptionChecks.hpp"

#include <cstdint>
#include <optional>
#include <stdexcept>

namespace qel::tool {

namespace {

using std::chrono::seconds;

constexpr seconds kMaxPeriod = std::chrono::hours(24) * 36525;

/// @return 0 when it is not a unit
seconds unitOf(char c)
{
    switch (c) {
    case 's':
        return seconds(1);
    case 'm':
        return std::chrono::minutes(1);
    case 'h':
        return std::chrono::hours(1);
    case 'd':
        return std::chrono::hours(24);
    case 'w':
        return std::chrono::hours(7 * 24);
    default:
        return seconds(0);
    }
}

/// Hexadecimal digits are left out: the "d" of "0x1d" could be a digit as well as the unit.
std::optional<std::uint64_t> parseDecimal(const std::string& text)
{
    if (text.find_first_not_of("0123456789") != std::string::npos) return std::nullopt;
    return parseInteger(text);
}

} // namespace

seconds parsePeriod(const std::string& text)
{
    const seconds unit = text.empty() ? seconds(0) : unitOf(text.back());
    const auto number = unit.count() == 0 ? std::nullopt : parseDecimal(text.substr(0, text.size() - 1));
    if (number && *number <= static_cast<std::uint64_t>(kMaxPeriod / unit)) return *number * unit;
    throw std::invalid_argument(quoted(text) +
                                " is not a length of time: a number with s, m, h, d or w, as in 30d, and " +
                                "at most 100 years");
}

} // namespace qel::tool
