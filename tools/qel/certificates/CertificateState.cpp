#include "certificates/CertificateState.hpp"

#include "base/Text.hpp"

#include <array>
#include <ctime>
#include <stdexcept>

namespace qel::tool {

namespace {

using std::chrono::seconds;
using Clock = SSLValidityPeriod::Clock;

constexpr std::size_t kMostDigits = 10; // so that the longest number of weeks is far from the end of the type
constexpr seconds kLongest = std::chrono::hours(24) * 36525;

/// @return 0 for what is no unit
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

bool isNumber(const std::string& text)
{
    return !text.empty() && text.size() <= kMostDigits && text.find_first_not_of("0123456789") == std::string::npos;
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
    const std::string number = text.substr(0, text.empty() ? 0 : text.size() - 1);
    const seconds unit = text.empty() ? seconds(0) : unitOf(text.back());
    const bool isPeriod = unit.count() != 0 && isNumber(number);
    const seconds period = isPeriod ? seconds(std::stoll(number) * unit) : seconds::max();
    if (period <= kLongest) return period;
    throw std::invalid_argument(quoted(text) + " is no length of time: a number with s, m, h, d or w, as in 30d, and " +
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
