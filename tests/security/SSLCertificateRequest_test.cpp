#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLException.hpp>

#include "support/Authority.hpp"
#include "support/CapturedLog.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <openssl/objects.h>
#include <openssl/pem.h>
#include <string>
#include <type_traits>
#include <utility>

namespace qel {
namespace {

using test::Authority;
using test::CapturedLog;
using test::expectEveryFailureIsReported;
using test::expectSSLErrorAt;
using test::OpenSSLCalls;
using test::QuickKeys;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

static_assert(std::is_nothrow_move_constructible<SSLCertificateRequest>::value, "");
static_assert(std::is_nothrow_move_assignable<SSLCertificateRequest>::value, "");
static_assert(!std::is_convertible<std::string, SSLCertificateRequest>::value, "a text is a request only when asked");
static_assert(!std::is_convertible<SSLSubject, SSLCertificateRequest>::value, "so is a subject");
static_assert(sizeof(SSLCertificateRequest) == sizeof(X509_REQ*) + sizeof(RSAPrivateKey*), "two members");

const char* const kBadFormat = "X509 certificate request string is not in a supported format";
const char* const kFile = "SSLCertificateRequest.cpp";

// A request shared by all tests; they must not change it.
const SSLCertificateRequest& shared()
{
    static const SSLCertificateRequest sRequest(SSLSubject{{"CN", "console"}, {"O", "Org"}, {"C", "US"}});
    return sRequest;
}

const RSAPrivateKey& anotherKey() { return *Authority::trusted().clientRequest().getPrivateKey(); }

std::string subjectOf(const SSLCertificateRequest& request)
{
    char* const text = X509_NAME_oneline(X509_REQ_get_subject_name(request.get()), nullptr, 0);
    const std::string result(text);
    OPENSSL_free(text);
    return result;
}

bool isSignedBy(const SSLCertificateRequest& request, const RSAPrivateKey& key)
{
    const bool verified = X509_REQ_verify(request.get(), key.get()) == 1;
    ERR_clear_error();
    return verified;
}

bool holdsKey(const SSLCertificateRequest& request, const RSAPrivateKey& key)
{
    return EVP_PKEY_cmp(X509_REQ_get0_pubkey(request.get()), key.get()) == 1;
}

// --- a new request

TEST(SSLCertificateRequestNew, HoldsTheSubjectInTheOrderOfItsKeys)
{
    EXPECT_EQ(X509_REQ_get_version(shared().get()), 0);
    EXPECT_EQ(subjectOf(shared()), "/C=US/CN=console/O=Org");
    EXPECT_EQ(X509_REQ_get_attr_count(shared().get()), 0);
}

TEST(SSLCertificateRequestNew, CarriesItsNewKey)
{
    ASSERT_NE(shared().getPrivateKey(), nullptr);
    EXPECT_EQ(EVP_PKEY_bits(shared().getPrivateKey()->get()), 2048);
    EXPECT_TRUE(holdsKey(shared(), *shared().getPrivateKey()));
    EXPECT_FALSE(holdsKey(shared(), anotherKey()));
}

TEST(SSLCertificateRequestNew, IsSignedByItsKeyWithSha256)
{
    EXPECT_TRUE(isSignedBy(shared(), *shared().getPrivateKey()));
    EXPECT_FALSE(isSignedBy(shared(), anotherKey()));
    EXPECT_EQ(X509_REQ_get_signature_nid(shared().get()), NID_sha256WithRSAEncryption);
}

TEST(SSLCertificateRequestNew, MayHaveAnEmptySubject)
{
    const SSLCertificateRequest request(SSLSubject{});
    EXPECT_EQ(X509_NAME_entry_count(X509_REQ_get_subject_name(request.get())), 0);
    EXPECT_TRUE(isSignedBy(request, *request.getPrivateKey()));
    EXPECT_EQ(SSLCertificateRequest(request.getPEM()).getPEM(), request.getPEM());
}

TEST(SSLCertificateRequestNew, RefusesInvalidFieldsAndValues)
{
    const QuickKeys quick;
    for (const SSLSubject& subject :
         {SSLSubject{{"noSuchField", "a"}}, SSLSubject{{"CN", ""}}, SSLSubject{{"CN", std::string(65, 'x')}}}) {
        SCOPED_TRACE(subject.begin()->first);
        const CapturedLog log;
        expectSSLErrorAt("X509Name.cpp", [&] { SSLCertificateRequest request(subject); });
        EXPECT_THAT(log.lines(), AllOf(Not(IsEmpty()), Each(StartsWith("E: [libssl] "))));
    }
}

TEST(SSLCertificateRequestNew, TakesItsStepsInOrder)
{
    const OpenSSLCalls watch;
    const SSLCertificateRequest request(SSLSubject{{"CN", "console"}, {"O", "Org"}});
    EXPECT_THAT(watch.calls(),
                ElementsAre("EVP_PKEY_new()", "BN_new()", "BN_set_word(65537)", "RSA_new()",
                            "RSA_generate_key_ex(2048)", "EVP_PKEY_set1_RSA()", // the key
                            "X509_REQ_new()", "X509_REQ_set_version(0)", "X509_NAME_add_entry_by_txt(4097, -1, -1, 0)",
                            "X509_NAME_add_entry_by_txt(4097, -1, -1, 0)", "X509_REQ_set_pubkey()", "X509_REQ_sign()"));
}

TEST(SSLCertificateRequestNew, ReportsEveryFailure)
{
    const QuickKeys quick;
    EXPECT_EQ(expectEveryFailureIsReported([] { SSLCertificateRequest request(SSLSubject{{"CN", "console"}}); }), 11U);
}

// --- text

TEST(SSLCertificateRequestText, LoadsBackWithoutKey)
{
    const std::string pem = shared().getPEM();
    EXPECT_THAT(pem, StartsWith("-----BEGIN CERTIFICATE REQUEST-----\n"));
    EXPECT_THAT(pem, EndsWith("\n-----END CERTIFICATE REQUEST-----\n"));
    const SSLCertificateRequest loaded(pem);
    EXPECT_EQ(loaded.getPEM(), pem);
    EXPECT_EQ(subjectOf(loaded), subjectOf(shared()));
    EXPECT_TRUE(isSignedBy(loaded, *shared().getPrivateKey()));
    EXPECT_EQ(loaded.getPrivateKey(), nullptr);
}

TEST(SSLCertificateRequestText, LoadsTheFirstOfItsKindFromALongerText)
{
    const std::string pem = shared().getPEM();
    const std::string other = Authority::trusted().clientRequest().getPEM();
    EXPECT_EQ(SSLCertificateRequest("for the console\n" + pem).getPEM(), pem);
    EXPECT_EQ(SSLCertificateRequest(shared().getPrivateKey()->getPEM() + pem).getPEM(), pem);
    EXPECT_EQ(SSLCertificateRequest(pem + other).getPEM(), pem);
    EXPECT_EQ(SSLCertificateRequest(pem.substr(0, pem.size() - 1)).getPEM(), pem);
}

TEST(SSLCertificateRequestText, RefusesATextWithoutARequest)
{
    const std::string pem = shared().getPEM();
    std::string spoilt = pem;
    spoilt[pem.size() / 2] = '!';
    const struct {
        const char* label;
        std::string text;
    } rows[] = {
        {"empty", ""},
        {"other text", "not a request\n"},
        {"cut in the middle", pem.substr(0, pem.size() / 2)},
        {"not base64", spoilt},
        {"base64 of something else", "-----BEGIN CERTIFICATE REQUEST-----\nAAAA\n-----END CERTIFICATE REQUEST-----\n"},
        {"key", shared().getPrivateKey()->getPEM()},
        {"certificate", Authority::trusted().client().getPEM()},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.label);
        const CapturedLog log;
        EXPECT_THAT([&] { SSLCertificateRequest request(row.text); }, ThrowsMessage<SSLException>(StrEq(kBadFormat)));
        EXPECT_EQ(ERR_peek_error(), 0UL);
        EXPECT_THAT(log.lines(), AllOf(Not(IsEmpty()), Each(StartsWith("E: [libssl] "))));
        EXPECT_THAT([&] { SSLCertificateRequest request(row.text, anotherKey()); },
                    ThrowsMessage<SSLException>(StrEq(kBadFormat)));
    }
}

TEST(SSLCertificateRequestText, ReportsEveryFailure)
{
    const std::string pem = shared().getPEM();
    EXPECT_EQ(expectEveryFailureIsReported([] { shared().getPEM(); }), 2U);
    EXPECT_EQ(expectEveryFailureIsReported([&] { SSLCertificateRequest request(pem); }, {"PEM_read_bio_X509_REQ"}), 1U);
}

// --- with a key

TEST(SSLCertificateRequestWithKey, HoldsACopyOfIt)
{
    const SSLCertificateRequest request(shared().getPEM(), *shared().getPrivateKey());
    ASSERT_NE(request.getPrivateKey(), nullptr);
    EXPECT_NE(request.getPrivateKey()->get(), shared().getPrivateKey()->get());
    EXPECT_EQ(request.getPrivateKey()->getPEM(), shared().getPrivateKey()->getPEM());
}

TEST(SSLCertificateRequestWithKey, RefusesTheKeyOfAnother)
{
    const CapturedLog log;
    expectSSLErrorAt(kFile, [] { SSLCertificateRequest(shared().getPEM(), anotherKey()); });
    EXPECT_THAT(log.lines(), AllOf(Not(IsEmpty()), Each(StartsWith("E: [libssl] "))));
}

TEST(SSLCertificateRequestWithKey, ReportsEveryFailure)
{
    const std::string pem = shared().getPEM();
    EXPECT_EQ(expectEveryFailureIsReported([&] { SSLCertificateRequest(pem, *shared().getPrivateKey()); },
                                           {"PEM_read_bio_X509_REQ"}),
              6U);
}

// --- copies

TEST(SSLCertificateRequestCopy, SharesNoHandle)
{
    const SSLCertificateRequest copy(shared());
    EXPECT_NE(copy.get(), shared().get());
    EXPECT_EQ(copy.getPEM(), shared().getPEM());
    ASSERT_NE(copy.getPrivateKey(), nullptr);
    EXPECT_NE(copy.getPrivateKey()->get(), shared().getPrivateKey()->get());
    EXPECT_EQ(copy.getPrivateKey()->getPEM(), shared().getPrivateKey()->getPEM());
}

TEST(SSLCertificateRequestCopy, OutlivesTheOriginal)
{
    auto original = std::make_unique<SSLCertificateRequest>(shared());
    const SSLCertificateRequest copy(*original);
    original.reset();
    EXPECT_EQ(copy.getPEM(), shared().getPEM());
    EXPECT_TRUE(isSignedBy(copy, *copy.getPrivateKey()));
}

TEST(SSLCertificateRequestCopy, ReplacesRequestAndKey)
{
    SSLCertificateRequest request(Authority::trusted().clientRequest());
    request = shared();
    EXPECT_NE(request.get(), shared().get());
    EXPECT_EQ(request.getPEM(), shared().getPEM());
    EXPECT_EQ(request.getPrivateKey()->getPEM(), shared().getPrivateKey()->getPEM());

    const SSLCertificateRequest& alias = request;
    request = alias;
    EXPECT_EQ(request.getPEM(), shared().getPEM());

    request = SSLCertificateRequest(shared().getPEM()); // without key
    EXPECT_EQ(request.getPrivateKey(), nullptr);
}

TEST(SSLCertificateRequestCopy, ReportsEveryFailure)
{
    const SSLCertificateRequest& request = shared();
    EXPECT_EQ(expectEveryFailureIsReported([&] { SSLCertificateRequest copy(request); }), 5U);
}

TEST(SSLCertificateRequestCopy, LeavesTheOldOneWhenItFails)
{
    const SSLCertificateRequest& other = shared();
    SSLCertificateRequest request(Authority::trusted().clientRequest());
    for (const char* name : {"X509_REQ_dup", "RSAPrivateKey_dup"}) {
        SCOPED_TRACE(name);
        OpenSSLCalls watch;
        watch.failNext(name);
        EXPECT_THROW(request = other, SSLException);
        EXPECT_TRUE(watch.hasFailed());
        EXPECT_EQ(request.getPEM(), Authority::trusted().clientRequest().getPEM());
        EXPECT_EQ(request.getPrivateKey()->getPEM(), anotherKey().getPEM());
    }
}

TEST(SSLCertificateRequestMove, TakesHandleAndKey)
{
    SSLCertificateRequest from(shared());
    X509_REQ* const handle = from.get();
    const RSAPrivateKey* const key = from.getPrivateKey();
    SSLCertificateRequest to(std::move(from));
    EXPECT_EQ(to.get(), handle);
    EXPECT_EQ(to.getPrivateKey(), key);
    EXPECT_EQ(from.get(), nullptr); // NOLINT(bugprone-use-after-move)
    EXPECT_EQ(from.getPrivateKey(), nullptr);

    SSLCertificateRequest third(Authority::trusted().clientRequest());
    third = std::move(to);
    EXPECT_EQ(third.get(), handle);
}

TEST(SSLCertificateRequestMove, LeavesAnObjectThatTakesANewRequest)
{
    SSLCertificateRequest from(shared());
    const SSLCertificateRequest to(std::move(from));
    expectSSLErrorAt(kFile, [&] { from.getPEM(); });
    expectSSLErrorAt(kFile, [&] { const SSLCertificateRequest copy(from); });
    from = shared();
    EXPECT_EQ(from.getPEM(), shared().getPEM());
}

} // namespace
} // namespace qel
