#include "support/Authority.hpp"

namespace qel::test {

const Authority& Authority::trusted()
{
    static const Authority sAuthority("QEL test root");
    return sAuthority;
}

const Authority& Authority::stranger()
{
    static const Authority sAuthority("another root");
    return sAuthority;
}

Authority::Authority(const std::string& rootName)
    : mRoot(SSLSubject{{"CN", rootName}}, SSLValidityPeriod::days(200)), mServerRequest(SSLSubject{{"CN", "server"}}),
      mClientRequest(SSLSubject{{"CN", "client"}}), mServer(issue(mServerRequest, SSLValidityPeriod::days(100))),
      mClient(issue(mClientRequest, SSLValidityPeriod::days(100)))
{}

SSLCertificate Authority::issue(const SSLCertificateRequest& request, const SSLValidityPeriod& validity) const
{
    SSLCertificateRequest copy(request); // signing takes one that may be changed
    return mRoot.sign(copy, validity);
}

SSLCredentials Authority::credentialsOf(const SSLCertificate& certificate) const
{
    return {certificate.getPEM(), certificate.getPrivateKey()->getPEM(), mRoot.getPEM()};
}

} // namespace qel::test
