#pragma once

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include <string>

namespace qel::protocol {

/// Refuses a certificate of this end that is expired or not yet valid. Every peer would refuse it too, but could not
/// say why: the connection would just end in the handshake.
/// @param what  "own certificate" or "root certificate"
/// @param path  its file; both are for the message
/// @param now   the current time
/// @throws CredentialsUnusable  Validity: names the file and the time
void checkOwnCertificate(const std::string& what, const std::string& path, const SSLCertificate& certificate,
                         SSLValidityPeriod::Clock::time_point now);

} // namespace qel::protocol
