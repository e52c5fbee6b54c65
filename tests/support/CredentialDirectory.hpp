#pragma once

#include <qel/common/security/SSLCredentials.hpp>

#include "support/Authority.hpp"
#include "support/TemporaryDirectory.hpp"

#include <string>
#include <vector>

namespace qel::test {

/// A directory of credentials as the program takes them: those of "server" and "client" with the root of
/// Authority::trusted(), and whatever else a test puts there.
class CredentialDirectory {
public:
    CredentialDirectory();

    std::string path() const { return mDirectory.path(); }
    std::string file(const std::string& name) const { return mDirectory.file(name); }

    /// Writes NAME.crt, and NAME.key with mode 0600; replaces what is there. The root stays as it is.
    void put(const std::string& name, const SSLCredentials& credentials) const;

    /// The options of the program for TLS with the credentials of a name.
    std::vector<std::string> options(const std::string& name) const;

private:
    TemporaryDirectory mDirectory;
};

/// Credentials of Authority::trusted() whose time is over, or has not begun.
SSLCredentials expiredCredentials(const SSLCertificateRequest& request);
SSLCredentials futureCredentials(const SSLCertificateRequest& request);

} // namespace qel::test
