#include <qel/common/security/RSAPrivateKey.hpp>

#include "security/PEMText.hpp"
#include "security/SSLCheck.hpp"

#include <utility>

namespace qel {

namespace {

constexpr int kKeyBits = 2048;

EVP_PKEY_PTR newKey()
{
    EVP_PKEY_PTR key(EVP_PKEY_new());
    checkSSL(key != nullptr);
    return key;
}

EVP_PKEY_PTR generateKey()
{
    EVP_PKEY_PTR key = newKey();
    const BN_PTR exponent(BN_new());
    checkSSL(exponent != nullptr);
    checkSSL(BN_set_word(exponent.get(), RSA_F4) == 1);
    const RSA_PTR rsa(RSA_new());
    checkSSL(rsa != nullptr);
    checkSSL(RSA_generate_key_ex(rsa.get(), kKeyBits, exponent.get(), nullptr) == 1);
    checkSSL(EVP_PKEY_set1_RSA(key.get(), rsa.get()) == 1);
    return key;
}

EVP_PKEY_PTR wrap(const RSA_PTR& rsa)
{
    EVP_PKEY_PTR key = newKey();
    checkSSL(EVP_PKEY_set1_RSA(key.get(), rsa.get()) == 1);
    return key;
}

EVP_PKEY_PTR loadKey(const std::string& pem)
{
    const RSA_PTR rsa(readPEM(pem, &PEM_read_bio_RSAPrivateKey, "RSA private key string is not in a supported format"));
    return wrap(rsa);
}

/// Duplicates the RSA key itself: a second EVP_PKEY would share it with the first.
EVP_PKEY_PTR duplicate(const RSA_PTR& rsa)
{
    const RSA_PTR copy(RSAPrivateKey_dup(rsa.get()));
    checkSSL(copy != nullptr);
    return wrap(copy);
}

} // namespace

static_assert(RSA_F4 == 65537, "the public exponent");

RSAPrivateKey::RSAPrivateKey() : mKey(generateKey()) {}

RSAPrivateKey::RSAPrivateKey(const std::string& pem) : mKey(loadKey(pem)) {}

RSAPrivateKey::RSAPrivateKey(const RSAPrivateKey& other) : mKey(duplicate(other.pShareRSA())) {}

RSAPrivateKey& RSAPrivateKey::operator=(const RSAPrivateKey& other)
{
    RSAPrivateKey copy(other);
    mKey = std::move(copy.mKey);
    return *this;
}

RSAPrivateKey::RSAPrivateKey(RSAPrivateKey&& other) noexcept = default;
RSAPrivateKey& RSAPrivateKey::operator=(RSAPrivateKey&& other) noexcept = default;
RSAPrivateKey::~RSAPrivateKey() = default;

std::unique_ptr<RSAPrivateKey> RSAPrivateKey::clone() const { return std::make_unique<RSAPrivateKey>(*this); }

std::string RSAPrivateKey::getPEM() const
{
    const RSA_PTR rsa = pShareRSA();
    return writePEM([&rsa](BIO* bio) {
        checkSSL(PEM_write_bio_RSAPrivateKey(bio, rsa.get(), nullptr, nullptr, 0, nullptr, nullptr) == 1);
    });
}

/// @return a counted reference to the RSA key inside the handle. EVP_PKEY_get0_RSA would need no counting, but its
///         result, and the parameters that take it, are const in OpenSSL 3 and not in 1.1.1.
RSA_PTR RSAPrivateKey::pShareRSA() const
{
    checkSSL(mKey != nullptr); // moved from
    RSA_PTR rsa(EVP_PKEY_get1_RSA(mKey.get()));
    checkSSL(rsa != nullptr);
    return rsa;
}

} // namespace qel
