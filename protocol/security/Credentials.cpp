#include <qel/common/security/SSLException.hpp>
#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/PemContent.hpp>

#include "security/OwnCertificate.hpp"

#include <utility>

namespace qel::protocol {

namespace {

/// Wipes the key of a record at the end of a scope, unless it was moved away.
class KeyWiped {
public:
    explicit KeyWiped(SSLCredentials& texts) : mTexts(texts) {}
    ~KeyWiped() { wipe(mTexts.mKey); }
    KeyWiped(const KeyWiped&) = delete;
    KeyWiped& operator=(const KeyWiped&) = delete;

private:
    SSLCredentials& mTexts;
};

/// Checks the texts one by one first: the exception of a context does not say which of the three is wrong.
void check(const SSLCredentials& texts, const CredentialPaths& paths)
{
    const SSLCertificate root = parseCertificate(paths.root, texts.mRootCA);
    const SSLCertificate own = parseCertificate(paths.certificate, texts.mCert);
    parseKey(paths.key, texts.mKey);
    try {
        SSLClientContext().setCredentials(texts);
    } catch (const SSLException&) {
        throw CredentialsUnusable(paths.certificate + " and " + paths.key +
                                  " cannot be used: they do not belong together, or are too weak");
    }
    const auto now = SSLValidityPeriod::Clock::now();
    checkOwnCertificate("own certificate", paths.certificate, own, now);
    checkOwnCertificate("root certificate", paths.root, root, now);
}

template <typename Context>
std::unique_ptr<Context> makeContext(const SSLCredentials& texts)
{
    auto context = std::make_unique<Context>();
    context->setCredentials(texts);
    return context;
}

} // namespace

Credentials Credentials::fromDirectory(const std::string& directory, const std::string& name,
                                       KeyPermissions permissions)
{
    return fromFiles(credentialPaths(directory, name), permissions);
}

Credentials Credentials::fromFiles(const CredentialPaths& paths, KeyPermissions permissions)
{
    SSLCredentials texts;
    const KeyWiped wiped(texts);
    texts.mCert = readPemFile(paths.certificate);
    texts.mKey = readKeyFile(paths.key, permissions);
    texts.mRootCA = readPemFile(paths.root);
    check(texts, paths);
    return Credentials(std::move(texts));
}

Credentials Credentials::fromTexts(const SSLCredentials& texts)
{
    check(texts, {"the certificate", "the key", "the root certificate"});
    SSLCredentials copy = texts;
    return Credentials(std::move(copy));
}

Credentials::Credentials(SSLCredentials&& texts) noexcept : mTexts(std::move(texts)) {}

Credentials::Credentials(const Credentials& other) = default;

Credentials& Credentials::operator=(const Credentials& other)
{
    if (this != &other) *this = Credentials(other);
    return *this;
}

Credentials::Credentials(Credentials&& other) noexcept : mTexts(std::move(other.mTexts)) { wipe(other.mTexts.mKey); }

Credentials& Credentials::operator=(Credentials&& other) noexcept
{
    std::swap(mTexts, other.mTexts); // the other one wipes what this one had
    return *this;
}

Credentials::~Credentials() { wipe(mTexts.mKey); }

std::unique_ptr<SSLClientContext> Credentials::makeClientContext() const
{
    return makeContext<SSLClientContext>(mTexts);
}

std::unique_ptr<SSLServerContext> Credentials::makeServerContext() const
{
    return makeContext<SSLServerContext>(mTexts);
}

} // namespace qel::protocol
