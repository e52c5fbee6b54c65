#pragma once

#include <qel/common/security/SSLValidityPeriod.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <chrono>
#include <string>

namespace qel::protocol {

/// The state of a certificate at some time.
enum class CertificateState {
    Fine,
    Due,        ///< valid, but about to expire
    Expired,    ///< no longer valid
    NotYetValid ///< valid later
};

/// The period is inclusive: a certificate expires one second after its last second.
/// @param within  a certificate that expires within this time is due; not negative
/// Thread safety: any thread.
QEL_PROTOCOL_EXPORT CertificateState stateAt(const SSLValidityPeriod& validity,
                                             SSLValidityPeriod::Clock::time_point now, std::chrono::seconds within);

/// "fine", "due", "expired" or "not yet valid".
QEL_PROTOCOL_EXPORT const char* stateName(CertificateState state);

/// A time in UTC as ISO 8601 text: "2026-01-31T12:00:00Z". Thread safety: any thread.
QEL_PROTOCOL_EXPORT std::string isoTime(SSLValidityPeriod::Clock::time_point time);

} // namespace qel::protocol
