#pragma once

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLCredentials.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include <string>

namespace qel::test {

/// A small certificate authority for tests: a root, and one certificate for each end of a connection, all valid now.
/// Keys are slow to make, so they are made on first use and shared by all tests of the program. Tests must not change
/// them. Thread safety: any thread may call any operation.
class Authority {
public:
    /// The root that both ends trust. Its subject is "CN=QEL test root", its certificates are "CN=server" and
    /// "CN=client".
    static const Authority& trusted();
    /// Another authority, "CN=another root", with the same names for its certificates.
    static const Authority& stranger();

    const SSLCertificate& root() const { return mRoot; }

    /// The requests, each with its key.
    const SSLCertificateRequest& serverRequest() const { return mServerRequest; }
    const SSLCertificateRequest& clientRequest() const { return mClientRequest; }
    /// The certificates issued for them, each with its key.
    const SSLCertificate& server() const { return mServer; }
    const SSLCertificate& client() const { return mClient; }

    /// Issues another certificate for a request, for example one that has expired.
    SSLCertificate issue(const SSLCertificateRequest& request, const SSLValidityPeriod& validity) const;

    /// @return credentials that trust this root
    SSLCredentials serverCredentials() const { return credentialsOf(mServer); }
    SSLCredentials clientCredentials() const { return credentialsOf(mClient); }
    /// @param certificate  with its key
    SSLCredentials credentialsOf(const SSLCertificate& certificate) const;

private:
    explicit Authority(const std::string& rootName);

    SSLCertificate mRoot;
    SSLCertificateRequest mServerRequest;
    SSLCertificateRequest mClientRequest;
    SSLCertificate mServer;
    SSLCertificate mClient;
};

} // namespace qel::test
