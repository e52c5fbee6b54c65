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
/// Owning pointers to OpenSSL handles, so that no code frees one by hand. Each is a std::unique_ptr with the size of a
/// plain pointer. get() lends the handle; release() gives it to a function that takes ownership.
///
/// Needs OpenSSL 1.1.1 or newer. OpenSSL 3 marks some of the functions used here and in programs as deprecated: compile
/// programs that include this header with OPENSSL_API_COMPAT=0x10101000L. The target qel::common and the pkg-config
/// file set it.
///
/// Thread safety: that of std::unique_ptr, and of the handle inside (see the OpenSSL manual).

static_assert(OPENSSL_VERSION_NUMBER >= 0x10101000L, "OpenSSL 1.1.1 or newer is required for TLS 1.3");

namespace qel {

/// A TLS context: what all connections of one side share.
using SSL_CTX_PTR = std::unique_ptr<SSL_CTX, CustomDeleter<SSL_CTX, void, SSL_CTX_free>>;
/// One TLS connection.
using SSL_PTR = std::unique_ptr<SSL, CustomDeleter<SSL, void, SSL_free>>;
/// A chain of BIOs: all of its BIOs are freed together.
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
/// An ASN.1 integer, such as a serial number.
using ASN1_INT_PTR = std::unique_ptr<ASN1_INTEGER, CustomDeleter<ASN1_INTEGER, void, ASN1_INTEGER_free>>;

} // namespace qel
