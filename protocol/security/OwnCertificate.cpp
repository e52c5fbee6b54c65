#include "security/OwnCertificate.hpp"

#include <qel/common/security/SSLException.hpp>
#include <qel/protocol/CertificateState.hpp>
#include <qel/protocol/Error.hpp>

namespace qel::protocol {

namespace {

SSLValidityPeriod validityOf(const std::string& path, const SSLCertificate& certificate)
{
    try {
        return certificate.getValidityPeriod();
    } catch (const SSLException&) {
        throw CredentialsUnusable(path + ": the validity period of the certificate is malformed",
                                  CredentialsUnusable::Reason::Validity);
    }
}

} // namespace

void checkOwnCertificate(const std::string& what, const std::string& path, const SSLCertificate& certificate,
                         SSLValidityPeriod::Clock::time_point now)
{
    const SSLValidityPeriod validity = validityOf(path, certificate);
    const CertificateState state = stateAt(validity, now, std::chrono::seconds(0));
    if (state == CertificateState::Expired) {
        throw CredentialsUnusable(what + " " + path + " expired at " + isoTime(validity.getNotAfter()) + ": replace it",
                                  CredentialsUnusable::Reason::Validity);
    }
    if (state == CertificateState::NotYetValid) {
        throw CredentialsUnusable(what + " " + path + " is not valid before " + isoTime(validity.getNotBefore()) +
                                      ": replace it, or correct this machine's clock",
                                  CredentialsUnusable::Reason::Validity);
    }
}

} // namespace qel::protocol
