#pragma once

#include <qel/common/security/SSLValidityPeriod.hpp>

#include <chrono>
#include <string>

namespace qel::tool {

/// How a certificate stands at some time.
enum class CertificateState {
    Fine,
    Due,        ///< still valid, but not for long
    Expired,    ///< it was valid
    NotYetValid ///< it will be valid
};

/// Both ends of the validity are in it: a certificate is not expired before the second after its last.
/// @param within  a certificate that ends so soon, or sooner, is due; not negative
CertificateState stateAt(const SSLValidityPeriod& validity, SSLValidityPeriod::Clock::time_point now,
                         std::chrono::seconds within);

/// "fine", "due", "expired" or "not yet valid".
const char* stateName(CertificateState state);

/// Reads a length of time: a whole number and its unit, "s", "m" (minutes), "h", "d" or "w"; at most 100 years.
/// @throws std::invalid_argument  says that it is none
std::chrono::seconds parsePeriod(const std::string& text);

/// A time as ISO 8601 writes it, in UTC: "2026-01-31T12:00:00Z".
std::string isoTime(SSLValidityPeriod::Clock::time_point time);

} // namespace qel::tool
