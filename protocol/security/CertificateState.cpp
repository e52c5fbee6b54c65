#include <qel/protocol/CertificateState.hpp>

#include <array>
#include <ctime>

namespace qel::protocol {

using Clock = SSLValidityPeriod::Clock;

CertificateState stateAt(const SSLValidityPeriod& validity, Clock::time_point now, std::chrono::seconds within)
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

std::string isoTime(Clock::time_point time)
{
    const std::time_t seconds = Clock::to_time_t(time);
    std::tm calendar{};
    std::array<char, 64> text{};
    if (::gmtime_r(&seconds, &calendar) == nullptr) return "beyond the calendar";
    std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%SZ", &calendar);
    return text.data();
}

} // namespace qel::protocol
