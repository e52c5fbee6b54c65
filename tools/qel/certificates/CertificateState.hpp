#pragma once

#include <qel/common/security/SSLValidityPeriod.hpp>

#include <chrono>
#include <string>

namespace qel::tool {

/// The state of a certificate at some time.
enum class CertificateState {
    Fine,
    Due,        ///< valid, but about to expire
    Expired,    ///< no longer valid
    NotYetValid ///< valid later
};

/// The period is inclusive: a certificate expires one second after its last second.
/// @param within  a certificate that expires within this time is due; not negative
CertificateState stateAt(const SSLValidityPeriod& validity, SSLValidityPeriod::Clock::time_point now,
                         std::chrono::seconds within);

/// "fine", "due", "expired" or "not yet valid".
const char* stateName(CertificateState state);

/// Parses a length of time: an integer and a unit, "s", "m" (minutes), "h", "d" or "w"; at most 100 years.
/// @throws std::invalid_argument  anything else
std::chrono::seconds parsePeriod(const std::string& text);

/// A time in UTC as ISO 8601 text: "2026-01-31T12:00:00Z".
std::string isoTime(SSLValidityPeriod::Clock::time_point time);

} // namespace qel::tool
