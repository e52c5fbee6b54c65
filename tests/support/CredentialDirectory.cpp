#include "support/CredentialDirectory.hpp"

#include <qel/common/Utilities.hpp>

#include <sys/stat.h>

namespace qel::test {

namespace {

constexpr std::chrono::hours kDay(24);

SSLCredentials validFor(const SSLCertificateRequest& request, std::chrono::hours from, std::chrono::hours until)
{
    const auto now = SSLValidityPeriod::Clock::now();
    const Authority& authority = Authority::trusted();
    return authority.credentialsOf(authority.issue(request, SSLValidityPeriod(now + from, now + until)));
}

} // namespace

CredentialDirectory::CredentialDirectory()
{
    const Authority& authority = Authority::trusted();
    Utilities::writeFile(file("root.crt"), authority.root().getPEM());
    put("server", authority.serverCredentials());
    put("client", authority.clientCredentials());
}

void CredentialDirectory::put(const std::string& name, const SSLCredentials& credentials) const
{
    Utilities::writeFile(file(name + ".crt"), credentials.mCert);
    Utilities::writeFile(file(name + ".key"), credentials.mKey);
    ::chmod(file(name + ".key").c_str(), S_IRUSR | S_IWUSR);
}

std::vector<std::string> CredentialDirectory::options(const std::string& name) const
{
    return {"--credentials", path(), "--name", name};
}

SSLCredentials expiredCredentials(const SSLCertificateRequest& request) { return validFor(request, -2 * kDay, -kDay); }

SSLCredentials futureCredentials(const SSLCertificateRequest& request) { return validFor(request, kDay, 2 * kDay); }

} // namespace qel::test
