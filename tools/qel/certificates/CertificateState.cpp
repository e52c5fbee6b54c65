#include "certificates/CertificateState.hpp"

#include "base/OptionChecks.hpp"
#include "base/Text.hpp"

#include <array>
#include <ctime>
#include <optional>
#include <stdexcept>

namespace qel::tool {

namespace {

using std::chrono::seconds;
using Clock = SSLValidityPeriod::Clock;

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

CertificateState stateAt(const SSLValidityPeriod& validity, Clock::time_point now, seconds within)
{
    if (now > validity.getNotAfter()) return CertificateState::Expired;
    if (now < validity.getNotBefore()) return CertificateState::NotYetValid;
    return validity.getNotAfter() - now <= within ? CertificateState::Due : CertificateState::Fine;
}

const char* stateName(CertificateState state)
{
    switch (state) {
    case CertificateState::Fine:
        return "fine";
    case CertificateState::Due:
        return "due";
    case CertificateState::Expired:
        return "expired";
    case CertificateState::NotYetValid:
        break;
    }
    return "not yet valid";
}

seconds parsePeriod(const std::string& text)
{
    const seconds unit = text.empty() ? seconds(0) : unitOf(text.back());
    const auto number = unit.count() == 0 ? std::nullopt : parseDecimal(text.substr(0, text.size() - 1));
    if (number && *number <= static_cast<std::uint64_t>(kMaxPeriod / unit)) return *number * unit;
    throw std::invalid_argument(quoted(text) +
                                " is not a length of time: a number with s, m, h, d or w, as in 30d, and " +
                                "at most 100 years");
}

std::string isoTime(Clock::time_point time)
{
    const std::time_t seconds = Clock::to_time_t(time);
    std::tm calendar{};
    std::array<char, 64> text{};
    if (::gmtime_r(&seconds, &calendar) == nullptr) return "beyond the calendar";
    std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%SZ", &calendar);
    return text.data();
}

} // namespace qel::tool
