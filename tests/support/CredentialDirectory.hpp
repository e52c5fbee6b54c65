#pragma once

#include <qel/common/security/SSLCredentials.hpp>

#include "support/Authority.hpp"
#include "support/TemporaryDirectory.hpp"

#include <string>
#include <vector>

namespace qel::test {

/// A directory of credentials for the program: those of "server" and "client" with the root of Authority::trusted(),
/// and those that a test adds.
class CredentialDirectory {
public:
    CredentialDirectory();

    std::string path() const { return mDirectory.path(); }
    std::string file(const std::string& name) const { return mDirectory.file(name); }

    /// Writes NAME.crt, and NAME.key with mode 0600; replaces existing files. Does not change the root.
    void put(const std::string& name, const SSLCredentials& credentials) const;

    /// The options of the program for TLS with the credentials of a name.
    std::vector<std::string> options(const std::string& name) const;

private:
    TemporaryDirectory mDirectory;
};

/// Credentials of Authority::trusted() that are expired, or not yet valid.
SSLCredentials expiredCredentials(const SSLCertificateRequest& request);
SSLCredentials futureCredentials(const SSLCertificateRequest& request);

} // namespace qel::test
