#pragma once

#include <qel/common/security/SSLTypes.hpp>
#include <qel/common/util/CustomDeleter.hpp>

#include <gtest/gtest.h>
#include <memory>
#include <openssl/ec.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>

namespace qel::test {

/// Generates a key that the library itself would not make.
/// @param type  EVP_PKEY_RSA, EVP_PKEY_EC (on the curve P-256) or EVP_PKEY_ED25519
/// @param bits  for RSA alone
inline EVP_PKEY_PTR foreignKey(int type, int bits = 0)
{
    using ContextPtr = std::unique_ptr<EVP_PKEY_CTX, CustomDeleter<EVP_PKEY_CTX, void, EVP_PKEY_CTX_free>>;
    const ContextPtr context(EVP_PKEY_CTX_new_id(type, nullptr));
    EXPECT_EQ(EVP_PKEY_keygen_init(context.get()), 1);
    if (type == EVP_PKEY_RSA) {
        EXPECT_GT(EVP_PKEY_CTX_set_rsa_keygen_bits(context.get(), bits), 0);
    }
    if (type == EVP_PKEY_EC) {
        EXPECT_GT(EVP_PKEY_CTX_set_ec_paramgen_curve_nid(context.get(), NID_X9_62_prime256v1), 0);
    }
    EVP_PKEY* key = nullptr;
    EXPECT_EQ(EVP_PKEY_keygen(context.get(), &key), 1);
    return EVP_PKEY_PTR(key);
}

} // namespace qel::test
