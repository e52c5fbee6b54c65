#include <qel/common/security/SSLCertificateRequest.hpp>

#include "security/PEMText.hpp"
#include "security/SSLCheck.hpp"
#include "security/X509Name.hpp"

#include <utility>

namespace qel {

namespace {

constexpr long kVersion1 = 0; // PKCS #10 counts from zero

X509_REQ_PTR duplicate(X509_REQ* request)
{
    checkSSL(request != nullptr); // moved from
    X509_REQ_PTR copy(X509_REQ_dup(request));
    checkSSL(copy != nullptr);
    return copy;
}

} // namespace

SSLCertificateRequest::SSLCertificateRequest(const std::string& pem)
    : mReq(readPEM(pem, &PEM_read_bio_X509_REQ, "X509 certificate request string is not in a supported format"))
{}

SSLCertificateRequest::SSLCertificateRequest(const std::string& pem, const RSAPrivateKey& key)
    : SSLCertificateRequest(pem)
{
    mPrivateKey = key.clone();
    checkSSL(X509_REQ_check_private_key(mReq.get(), mPrivateKey->get()) == 1);
}

SSLCertificateRequest::SSLCertificateRequest(const SSLSubject& subject) : mPrivateKey(std::make_unique<RSAPrivateKey>())
{
    mReq.reset(X509_REQ_new());
    checkSSL(mReq != nullptr);
    checkSSL(X509_REQ_set_version(mReq.get(), kVersion1) == 1);
    addFields(X509_REQ_get_subject_name(mReq.get()), subject);
    checkSSL(X509_REQ_set_pubkey(mReq.get(), mPrivateKey->get()) == 1);
    const int signatureBytes = X509_REQ_sign(mReq.get(), mPrivateKey->get(), nullptr); // the key's default digest
    checkSSL(signatureBytes > 0);
}

SSLCertificateRequest::SSLCertificateRequest(const SSLCertificateRequest& other)
    : mReq(duplicate(other.mReq.get())),
      mPrivateKey(other.mPrivateKey != nullptr ? other.mPrivateKey->clone() : nullptr)
{}

SSLCertificateRequest& SSLCertificateRequest::operator=(const SSLCertificateRequest& other)
{
    SSLCertificateRequest copy(other);
    return *this = std::move(copy);
}

SSLCertificateRequest::SSLCertificateRequest(SSLCertificateRequest&& other) noexcept = default;
SSLCertificateRequest& SSLCertificateRequest::operator=(SSLCertificateRequest&& other) noexcept = default;
SSLCertificateRequest::~SSLCertificateRequest() = default;

std::string SSLCertificateRequest::getPEM() const
{
    checkSSL(mReq != nullptr); // moved from
    return writePEM([this](BIO* bio) { checkSSL(PEM_write_bio_X509_REQ(bio, mReq.get()) == 1); });
}

} // namespace qel
