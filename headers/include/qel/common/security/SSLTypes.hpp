#pragma once

#include <qel/common/util/CustomDeleter.hpp>

#include <memory>
#include <openssl/asn1.h>
#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>

/// @file
/// Owning pointers to the handles of OpenSSL, so that none is freed by hand. Each is a std::unique_ptr as small as a
/// plain pointer; get() lends the handle, release() gives it away to a function that takes it over.
///
/// OpenSSL 1.1.1 and newer. Some of the functions that are used here and in programs are marked as outdated by OpenSSL
/// 3; whoever includes this header is to be compiled with OPENSSL_API_COMPAT=0x10101000L, which the target qel::common
/// and the pkg-config file carry.

static_assert(OPENSSL_VERSION_NUMBER >= 0x10101000L, "OpenSSL 1.1.1 or newer is needed: TLS 1.3 came with it");

namespace qel {

/// A TLS context: what all connections of one side share.
using SSL_CTX_PTR = std::unique_ptr<SSL_CTX, CustomDeleter<SSL_CTX, void, SSL_CTX_free>>;
/// One TLS connection.
using SSL_PTR = std::unique_ptr<SSL, CustomDeleter<SSL, void, SSL_free>>;
/// A chain of BIOs: freed with all that are pushed behind it.
using BIO_PTR = std::unique_ptr<BIO, CustomDeleter<BIO, void, BIO_free_all>>;
/// A certificate.
using X509_PTR = std::unique_ptr<X509, CustomDeleter<X509, void, X509_free>>;
/// A certificate request.
using X509_REQ_PTR = std::unique_ptr<X509_REQ, CustomDeleter<X509_REQ, void, X509_REQ_free>>;
/// A store of trusted certificates.
using X509_STORE_PTR = std::unique_ptr<X509_STORE, CustomDeleter<X509_STORE, void, X509_STORE_free>>;
/// A key of any kind.
using EVP_PKEY_PTR = std::unique_ptr<EVP_PKEY, CustomDeleter<EVP_PKEY, void, EVP_PKEY_free>>;
/// An RSA key.
using RSA_PTR = std::unique_ptr<RSA, CustomDeleter<RSA, void, RSA_free>>;
/// A big number.
using BN_PTR = std::unique_ptr<BIGNUM, CustomDeleter<BIGNUM, void, BN_free>>;
/// An integer as certificates hold it.
using ASN1_INT_PTR = std::unique_ptr<ASN1_INTEGER, CustomDeleter<ASN1_INTEGER, void, ASN1_INTEGER_free>>;

} // namespace qel
