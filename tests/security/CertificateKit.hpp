#pragma once

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>

#include "support/Authority.hpp"
#include "support/MemoryBio.hpp"

#include <ctime>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/x509_vfy.h>
#include <string>

namespace qel::test {

inline const char* const kBadFormat = "X509 certificate string is not in a supported format";

inline constexpr std::time_t kNow = 2000000000; // 2033-05-18 03:33:20 UTC
inline constexpr std::time_t kDay = 86400;

inline const SSLValidityPeriod kPeriod(SSLValidityPeriod::Clock::from_time_t(1500000000),
                                       SSLValidityPeriod::Clock::from_time_t(kNow));

inline const Authority& trusted() { return Authority::trusted(); }

inline const RSAPrivateKey& rootKey() { return *trusted().root().getPrivateKey(); }

// A separate root, made once and shared; tests must not change it.
inline const SSLCertificate& sharedRoot()
{
    static const SSLCertificate sRoot(SSLSubject{{"CN", "root"}, {"O", "Org"}, {"C", "US"}}, kPeriod);
    return sRoot;
}

inline std::string nameOf(const X509_NAME* name)
{
    char* const text = X509_NAME_oneline(name, nullptr, 0);
    const std::string result(text);
    OPENSSL_free(text);
    return result;
}

inline std::string subjectOf(const SSLCertificate& certificate)
{
    return nameOf(X509_get_subject_name(certificate.get()));
}
inline std::string issuerOf(const SSLCertificate& certificate)
{
    return nameOf(X509_get_issuer_name(certificate.get()));
}

inline BN_PTR serialOf(const SSLCertificate& certificate)
{
    return BN_PTR(ASN1_INTEGER_to_BN(X509_get0_serialNumber(certificate.get()), nullptr));
}

inline bool isSignedBy(const SSLCertificate& certificate, const RSAPrivateKey& key)
{
    const bool verified = X509_verify(certificate.get(), key.get()) == 1;
    ERR_clear_error();
    return verified;
}

inline bool holdsKey(const SSLCertificate& certificate, const RSAPrivateKey& key)
{
    return EVP_PKEY_cmp(X509_get0_pubkey(certificate.get()), key.get()) == 1;
}

// Verifies a certificate as a peer that trusts only the root. @return X509_V_OK or the error
inline int verificationOf(const SSLCertificate& certificate, const SSLCertificate& root)
{
    using StoreContextPtr = std::unique_ptr<X509_STORE_CTX, CustomDeleter<X509_STORE_CTX, void, X509_STORE_CTX_free>>;
    const X509_STORE_PTR store(X509_STORE_new());
    EXPECT_EQ(X509_STORE_add_cert(store.get(), root.get()), 1);
    const StoreContextPtr context(X509_STORE_CTX_new());
    EXPECT_EQ(X509_STORE_CTX_init(context.get(), store.get(), certificate.get(), nullptr), 1);
    const int verified = X509_verify_cert(context.get());
    const int error = X509_STORE_CTX_get_error(context.get());
    EXPECT_EQ(verified == 1, error == X509_V_OK);
    ERR_clear_error();
    return error;
}

inline std::string textOf(X509* certificate)
{
    return writtenBy([&](BIO* bio) { return PEM_write_bio_X509(bio, certificate); });
}

// A changed copy of the shared root, signed again with its key.
template <typename Change>
SSLCertificate changed(const Change& change)
{
    const X509_PTR certificate(X509_dup(sharedRoot().get()));
    change(certificate.get());
    EXPECT_GT(X509_sign(certificate.get(), sharedRoot().getPrivateKey()->get(), nullptr), 0);
    return SSLCertificate(textOf(certificate.get()));
}

inline SSLCertificate withSerial(const char* decimal)
{
    return changed([&](X509* certificate) {
        BIGNUM* number = nullptr;
        EXPECT_GT(BN_dec2bn(&number, decimal), 0);
        const BN_PTR owner(number);
        const ASN1_INT_PTR serial(BN_to_ASN1_INTEGER(number, nullptr));
        EXPECT_EQ(X509_set_serialNumber(certificate, serial.get()), 1);
    });
}

inline SSLCertificateRequest copyOf(const SSLCertificateRequest& request) { return request; }

} // namespace qel::test
