#include <qel/common/security/SSLTypes.hpp>

#include <gtest/gtest.h>
#include <memory>
#include <type_traits>

namespace qel {
namespace {

template <typename Pointer, typename Handle, void (*Free)(Handle*)>
constexpr bool isOwnerOf()
{
    return std::is_same<Pointer, std::unique_ptr<Handle, CustomDeleter<Handle, void, Free>>>::value &&
           sizeof(Pointer) == sizeof(Handle*);
}

static_assert(isOwnerOf<SSL_CTX_PTR, SSL_CTX, SSL_CTX_free>(), "");
static_assert(isOwnerOf<SSL_PTR, SSL, SSL_free>(), "");
static_assert(isOwnerOf<BIO_PTR, BIO, BIO_free_all>(), "");
static_assert(isOwnerOf<X509_PTR, X509, X509_free>(), "");
static_assert(isOwnerOf<X509_REQ_PTR, X509_REQ, X509_REQ_free>(), "");
static_assert(isOwnerOf<X509_STORE_PTR, X509_STORE, X509_STORE_free>(), "");
static_assert(isOwnerOf<EVP_PKEY_PTR, EVP_PKEY, EVP_PKEY_free>(), "");
static_assert(isOwnerOf<RSA_PTR, RSA, RSA_free>(), "");
static_assert(isOwnerOf<BN_PTR, BIGNUM, BN_free>(), "");
static_assert(isOwnerOf<ASN1_INT_PTR, ASN1_INTEGER, ASN1_INTEGER_free>(), "");

// The address sanitizer reports a leak when a pointer does not free its handle.
TEST(SSLTypes, FreeTheirHandles)
{
    const SSL_CTX_PTR context(SSL_CTX_new(TLS_method()));
    ASSERT_NE(context, nullptr);
    EXPECT_NE(SSL_PTR(SSL_new(context.get())), nullptr);
    EXPECT_NE(X509_PTR(X509_new()), nullptr);
    EXPECT_NE(X509_REQ_PTR(X509_REQ_new()), nullptr);
    EXPECT_NE(X509_STORE_PTR(X509_STORE_new()), nullptr);
    EXPECT_NE(EVP_PKEY_PTR(EVP_PKEY_new()), nullptr);
    EXPECT_NE(RSA_PTR(RSA_new()), nullptr);
    EXPECT_NE(BN_PTR(BN_new()), nullptr);
    EXPECT_NE(ASN1_INT_PTR(ASN1_INTEGER_new()), nullptr);
}

int sFreedBios;

int countFreed(BIO* /*bio*/)
{
    ++sFreedBios;
    return 1;
}

TEST(SSLTypes, FreeAWholeChainOfBios)
{
    const std::unique_ptr<BIO_METHOD, CustomDeleter<BIO_METHOD, void, BIO_meth_free>> method(
        BIO_meth_new(BIO_TYPE_SOURCE_SINK, "counting"));
    ASSERT_NE(method, nullptr);
    ASSERT_EQ(BIO_meth_set_destroy(method.get(), countFreed), 1);
    ASSERT_EQ(BIO_meth_set_ctrl(method.get(), [](BIO*, int, long, void*) { return 1L; }), 1);

    sFreedBios = 0;
    {
        BIO_PTR first(BIO_new(method.get()));
        BIO_PTR second(BIO_new(method.get()));
        ASSERT_NE(first, nullptr);
        ASSERT_NE(second, nullptr);
        BIO_push(first.get(), second.release());
        EXPECT_EQ(sFreedBios, 0);
    }
    EXPECT_EQ(sFreedBios, 2);
}

} // namespace
} // namespace qel
