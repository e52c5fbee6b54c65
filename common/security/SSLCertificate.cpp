#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLException.hpp>

#include "security/PEMText.hpp"
#include "security/SSLCheck.hpp"
#include "security/X509Name.hpp"

#include <ctime>
#include <openssl/objects.h>
#include <utility>

namespace qel {

namespace {

using Clock = SSLValidityPeriod::Clock;

constexpr long kVersion1 = 0; // X.509 counts from zero
constexpr int kSerialNumberBits = 128;

struct FreeByOpenSSL {
    void operator()(char* text) const noexcept { OPENSSL_free(text); }
};

X509_PTR newCertificate()
{
    X509_PTR certificate(X509_new());
    checkSSL(certificate != nullptr);
    return certificate;
}

/// A certificate that was parsed or signed names the algorithm of its public key, whether or not this OpenSSL knows
/// that algorithm; an empty certificate names none. Without this check, versions of OpenSSL differ in what they make of
/// an empty certificate: an unreadable text or an error.
void checkNotEmpty(const X509* certificate)
{
    checkSSL(certificate != nullptr); // null after a move
    ASN1_OBJECT* algorithm = nullptr;
    checkSSL(X509_PUBKEY_get0_param(&algorithm, nullptr, nullptr, nullptr, X509_get_X509_PUBKEY(certificate)) == 1);
    checkSSL(OBJ_length(algorithm) > 0);
}

X509_PTR duplicate(X509* certificate)
{
    checkNotEmpty(certificate);
    X509_PTR copy(X509_dup(certificate));
    checkSSL(copy != nullptr);
    return copy;
}

std::unique_ptr<RSAPrivateKey> cloneOf(const RSAPrivateKey* key) { return key != nullptr ? key->clone() : nullptr; }

/// Passes no digest, so the default digest of the key applies.
void sign(X509* certificate, const RSAPrivateKey& key)
{
    const int signatureBytes = X509_sign(certificate, key.get(), nullptr);
    checkSSL(signatureBytes > 0);
}

void setSerialNumber(X509* certificate, const ASN1_INT_PTR& serial)
{
    checkSSL(X509_set_serialNumber(certificate, serial.get()) == 1);
}

Clock::time_point timePointOf(const ASN1_TIME* time)
{
    std::tm calendar{};
    checkSSL(ASN1_TIME_to_tm(time, &calendar) == 1); // UTC, in either notation of a certificate
    return Clock::from_time_t(::timegm(&calendar));
}

} // namespace

SSLCertificate::SSLCertificate(const std::string& pem)
    : mCert(readPEM(pem, &PEM_read_bio_X509, "X509 certificate string is not in a supported format"))
{}

SSLCertificate::SSLCertificate(const std::string& pem, const RSAPrivateKey& key) : SSLCertificate(pem)
{
    mPrivateKey = key.clone();
    checkSSL(X509_check_private_key(mCert.get(), mPrivateKey->get()) == 1);
}

SSLCertificate::SSLCertificate(const SSLSubject& subject, const SSLValidityPeriod& validity)
    : mPrivateKey(std::make_unique<RSAPrivateKey>())
{
    mCert = newCertificate();
    checkSSL(X509_set_version(mCert.get(), kVersion1) == 1);
    X509_NAME* const name = X509_get_subject_name(mCert.get());
    addFields(name, subject);
    checkSSL(X509_set_pubkey(mCert.get(), mPrivateKey->get()) == 1);
    checkSSL(X509_set_issuer_name(mCert.get(), name) == 1);
    pSetValidityPeriod(validity);
    setSerialNumber(mCert.get(), pGenerateSerialNumber());
    qel::sign(mCert.get(), *mPrivateKey);
}

SSLCertificate::SSLCertificate(const SSLCertificateRequest& request)
    : mCert(newCertificate()), mPrivateKey(cloneOf(request.getPrivateKey()))
{}

SSLCertificate::SSLCertificate(const SSLCertificate& other)
    : mCert(duplicate(other.mCert.get())), mPrivateKey(cloneOf(other.mPrivateKey.get()))
{}

SSLCertificate& SSLCertificate::operator=(const SSLCertificate& other)
{
    SSLCertificate copy(other);
    return *this = std::move(copy);
}

SSLCertificate::SSLCertificate(SSLCertificate&& other) noexcept = default;
SSLCertificate& SSLCertificate::operator=(SSLCertificate&& other) noexcept = default;
SSLCertificate::~SSLCertificate() = default;

SSLCertificate SSLCertificate::sign(SSLCertificateRequest& request, const SSLValidityPeriod& validity) const
{
    if (mPrivateKey == nullptr) {
        throw SSLException("Certificate cannot be used for signing - it does not have an associated private key");
    }
    SSLCertificate issued(request);
    X509* const certificate = issued.mCert.get();
    checkSSL(X509_set_version(certificate, kVersion1) == 1);
    const EVP_PKEY_PTR publicKey(X509_REQ_get_pubkey(request.get()));
    checkSSL(publicKey != nullptr);
    checkSSL(X509_set_pubkey(certificate, publicKey.get()) == 1);
    checkSSL(X509_set_subject_name(certificate, X509_REQ_get_subject_name(request.get())) == 1);
    checkSSL(X509_set_issuer_name(certificate, X509_get_subject_name(mCert.get())) == 1);
    issued.pSetValidityPeriod(validity);
    setSerialNumber(certificate, pGenerateSerialNumber());
    qel::sign(certificate, *mPrivateKey);
    return issued;
}

std::string SSLCertificate::getPEM() const
{
    checkNotEmpty(mCert.get());
    return writePEM([this](BIO* bio) { checkSSL(PEM_write_bio_X509(bio, mCert.get()) == 1); });
}

SSLSubject SSLCertificate::getSubject() const { return readFields(X509_get_subject_name(mCert.get())); }

SSLSubject SSLCertificate::getIssuer() const { return readFields(X509_get_issuer_name(mCert.get())); }

std::string SSLCertificate::getSerialNumber() const
{
    const BN_PTR number(ASN1_INTEGER_to_BN(X509_get0_serialNumber(mCert.get()), nullptr));
    checkSSL(number != nullptr);
    const std::unique_ptr<char, FreeByOpenSSL> text(BN_bn2hex(number.get()));
    checkSSL(text != nullptr);
    return text.get();
}

SSLValidityPeriod SSLCertificate::getValidityPeriod() const
{
    return SSLValidityPeriod(timePointOf(X509_get0_notBefore(mCert.get())),
                             timePointOf(X509_get0_notAfter(mCert.get())));
}

/// Random numbers need no record of those already used. No bit is forced: half of the numbers begin with a zero bit,
/// half are even.
ASN1_INT_PTR SSLCertificate::pGenerateSerialNumber()
{
    constexpr int kAnyTopBit = -1;
    constexpr int kAnyBottomBit = 0;
    const BN_PTR number(BN_new());
    checkSSL(number != nullptr);
    checkSSL(BN_rand(number.get(), kSerialNumberBits, kAnyTopBit, kAnyBottomBit) == 1);
    ASN1_INT_PTR serial(BN_to_ASN1_INTEGER(number.get(), nullptr));
    checkSSL(serial != nullptr);
    return serial;
}

void SSLCertificate::pSetValidityPeriod(const SSLValidityPeriod& validity)
{
    const std::time_t notBefore = Clock::to_time_t(validity.getNotBefore());
    const std::time_t notAfter = Clock::to_time_t(validity.getNotAfter());
    checkSSL(ASN1_TIME_set(X509_getm_notBefore(mCert.get()), notBefore) != nullptr);
    checkSSL(ASN1_TIME_set(X509_getm_notAfter(mCert.get()), notAfter) != nullptr);
}

} // namespace qel
