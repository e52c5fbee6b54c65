#include "transport/OwnCertificate.hpp"

#include <qel/common/security/SSLException.hpp>

#include "base/Failures.hpp"
#include "certificates/CertificateState.hpp"

namespace qel::tool {

namespace {

SSLValidityPeriod validityOf(const std::string& path, const SSLCertificate& certificate)
{
    try {
        return certificate.getValidityPeriod();
    } catch (const SSLException&) {
        throw CommandFailure(ExitStatus::Refused, path + ": the validity period of the certificate is malformed");
    }
}

} // namespace

void checkOwnCertificate(const std::string& what, const std::string& path, const SSLCertificate& certificate,
                         SSLValidityPeriod::Clock::time_point now)
{
    const SSLValidityPeriod validity = validityOf(path, certificate);
    const CertificateState state = stateAt(validity, now, std::chrono::seconds(0));
    if (state == CertificateState::Expired) {
        throw CommandFailure(ExitStatus::Refused,
                             what + " " + path + " expired at " + isoTime(validity.getNotAfter()) + ": replace it");
    }
    if (state == CertificateState::NotYetValid) {
        throw CommandFailure(ExitStatus::Refused, what + " " + path + " is not valid before " +
                                                      isoTime(validity.getNotBefore()) +
                                                      ": replace it, or correct this machine's clock");
    }
}

} // namespace qel::tool
