// Certificates as texts, with keys, as copies and for requests.

#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLException.hpp>

#include "security/CertificateKit.hpp"
#include "support/CapturedLog.hpp"
#include "support/MemoryBio.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <string>
#include <type_traits>
#include <utility>

namespace qel {
namespace {

using test::CapturedLog;
using test::copyOf;
using test::expectEveryFailureIsReported;
using test::expectSSLErrorAt;
using test::holdsKey;
using test::isSignedBy;
using test::kBadFormat;
using test::kPeriod;
using test::OpenSSLCalls;
using test::rootKey;
using test::sharedRoot;
using test::trusted;
using test::writtenBy;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::EndsWith;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

const char* const kFile = "SSLCertificate.cpp";

static_assert(std::is_same<SSLSubject, std::map<std::string, std::string>>::value, "");
static_assert(std::is_nothrow_move_constructible<SSLCertificate>::value, "");
static_assert(std::is_nothrow_move_assignable<SSLCertificate>::value, "");
static_assert(!std::is_convertible<std::string, SSLCertificate>::value, "a text is a certificate only when asked");
static_assert(!std::is_convertible<const SSLCertificateRequest&, SSLCertificate>::value, "nor is a request");
static_assert(sizeof(SSLCertificate) == sizeof(X509*) + sizeof(RSAPrivateKey*), "two members");

// --- text

TEST(SSLCertificateText, LoadsBackWithoutKey)
{
    const std::string pem = sharedRoot().getPEM();
    EXPECT_THAT(pem, StartsWith("-----BEGIN CERTIFICATE-----\n"));
    EXPECT_THAT(pem, EndsWith("\n-----END CERTIFICATE-----\n"));
    const SSLCertificate loaded(pem);
    EXPECT_EQ(loaded.getPEM(), pem);
    EXPECT_EQ(X509_cmp(loaded.get(), sharedRoot().get()), 0);
    EXPECT_EQ(loaded.getPrivateKey(), nullptr);
}

TEST(SSLCertificateText, LoadsTheFirstOfItsKindFromALongerText)
{
    const std::string pem = sharedRoot().getPEM();
    const struct {
        const char* label;
        std::string text;
    } rows[] = {
        {"text in front", "issued for the console\n" + pem},
        {"its key in front", sharedRoot().getPrivateKey()->getPEM() + pem},
        {"a chain", pem + trusted().root().getPEM()},
        {"no newline at the end", pem.substr(0, pem.size() - 1)},
        {"an older first line", "-----BEGIN X509 CERTIFICATE-----\n" + pem.substr(28, pem.rfind("-----END") - 28) +
                                    "-----END X509 CERTIFICATE-----\n"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.label);
        EXPECT_EQ(SSLCertificate(row.text).getPEM(), pem);
    }
}

TEST(SSLCertificateText, RefusesATextWithoutACertificate)
{
    const std::string pem = sharedRoot().getPEM();
    std::string spoilt = pem;
    spoilt[pem.size() / 2] = '!';
    std::string trustedForm = writtenBy([](BIO* bio) { return PEM_write_bio_X509_AUX(bio, sharedRoot().get()); });
    ASSERT_THAT(trustedForm, StartsWith("-----BEGIN TRUSTED CERTIFICATE-----"));
    const struct {
        const char* label;
        std::string text;
    } rows[] = {
        {"empty", ""},
        {"other text", "not a certificate\n"},
        {"cut in the middle", pem.substr(0, pem.size() / 2)},
        {"not base64", spoilt},
        {"base64 of something else", "-----BEGIN CERTIFICATE-----\nAAAA\n-----END CERTIFICATE-----\n"},
        {"with rules of trust", trustedForm},
        {"key", sharedRoot().getPrivateKey()->getPEM()},
        {"request", trusted().clientRequest().getPEM()},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.label);
        const CapturedLog log;
        EXPECT_THAT([&] { SSLCertificate certificate(row.text); }, ThrowsMessage<SSLException>(StrEq(kBadFormat)));
        EXPECT_EQ(ERR_peek_error(), 0UL);
        EXPECT_THAT(log.lines(), AllOf(Not(IsEmpty()), Each(StartsWith("E: [libssl] "))));
        EXPECT_THAT([&] { SSLCertificate certificate(row.text, rootKey()); },
                    ThrowsMessage<SSLException>(StrEq(kBadFormat)));
    }
}

TEST(SSLCertificateText, IsRefusedAlsoWhenTheErrorQueueIsEmpty)
{
    EXPECT_THAT([] { SSLCertificate certificate("-----BEGIN CERTIFICATE-----\n-----END CERTIFICATE-----\n"); },
                ThrowsMessage<SSLException>(StrEq(kBadFormat)));
}

TEST(SSLCertificateText, EveryTruncationIsRefused)
{
    const std::string pem = sharedRoot().getPEM();
    const std::string lastLine = "-----END CERTIFICATE-----";
    for (std::size_t length = 0; length < pem.rfind(lastLine) + lastLine.size(); length += 7) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { SSLCertificate certificate(pem.substr(0, length)); },
                    ThrowsMessage<SSLException>(StrEq(kBadFormat)));
    }
}

TEST(SSLCertificateText, ReportsEveryFailure)
{
    const std::string pem = sharedRoot().getPEM();
    EXPECT_EQ(expectEveryFailureIsReported([] { sharedRoot().getPEM(); }), 2U);
    EXPECT_EQ(expectEveryFailureIsReported([&] { SSLCertificate certificate(pem); }, {"PEM_read_bio_X509"}), 1U);
}

// --- with a key

TEST(SSLCertificateWithKey, HoldsACopyOfIt)
{
    const SSLCertificate certificate(sharedRoot().getPEM(), *sharedRoot().getPrivateKey());
    ASSERT_NE(certificate.getPrivateKey(), nullptr);
    EXPECT_NE(certificate.getPrivateKey()->get(), sharedRoot().getPrivateKey()->get());
    EXPECT_EQ(certificate.getPrivateKey()->getPEM(), sharedRoot().getPrivateKey()->getPEM());
    EXPECT_EQ(certificate.getPEM(), sharedRoot().getPEM());
}

TEST(SSLCertificateWithKey, CanSign)
{
    const SSLCertificate loaded(sharedRoot().getPEM(), RSAPrivateKey(sharedRoot().getPrivateKey()->getPEM()));
    SSLCertificateRequest request = copyOf(trusted().clientRequest());
    EXPECT_TRUE(isSignedBy(loaded.sign(request, kPeriod), *sharedRoot().getPrivateKey()));
}

TEST(SSLCertificateWithKey, RefusesTheKeyOfAnother)
{
    const CapturedLog log;
    expectSSLErrorAt(kFile, [] { SSLCertificate(sharedRoot().getPEM(), rootKey()); });
    EXPECT_THAT(log.lines(), AllOf(Not(IsEmpty()), Each(StartsWith("E: [libssl] "))));
}

TEST(SSLCertificateWithKey, RefusesAKeyThatWasMovedFrom)
{
    RSAPrivateKey from(rootKey());
    const RSAPrivateKey to(std::move(from));
    expectSSLErrorAt("RSAPrivateKey.cpp", [&] { SSLCertificate(trusted().root().getPEM(), from); });
}

TEST(SSLCertificateWithKey, ReportsEveryFailure)
{
    const std::string pem = sharedRoot().getPEM();
    EXPECT_EQ(expectEveryFailureIsReported([&] { SSLCertificate(pem, *sharedRoot().getPrivateKey()); },
                                           {"PEM_read_bio_X509"}),
              6U);
}

// --- copies

TEST(SSLCertificateCopy, SharesNoHandle)
{
    const SSLCertificate copy(sharedRoot());
    EXPECT_NE(copy.get(), sharedRoot().get());
    EXPECT_EQ(copy.getPEM(), sharedRoot().getPEM());
    ASSERT_NE(copy.getPrivateKey(), nullptr);
    EXPECT_NE(copy.getPrivateKey(), sharedRoot().getPrivateKey());
    EXPECT_NE(copy.getPrivateKey()->get(), sharedRoot().getPrivateKey()->get());
    EXPECT_EQ(copy.getPrivateKey()->getPEM(), sharedRoot().getPrivateKey()->getPEM());
}

TEST(SSLCertificateCopy, OutlivesTheOriginal)
{
    auto original = std::make_unique<SSLCertificate>(sharedRoot());
    const SSLCertificate copy(*original);
    original.reset();
    EXPECT_EQ(copy.getPEM(), sharedRoot().getPEM());
    EXPECT_TRUE(holdsKey(copy, *copy.getPrivateKey()));
}

TEST(SSLCertificateCopy, ReplacesCertificateAndKey)
{
    SSLCertificate certificate(trusted().root());
    certificate = sharedRoot();
    EXPECT_NE(certificate.get(), sharedRoot().get());
    EXPECT_EQ(certificate.getPEM(), sharedRoot().getPEM());
    EXPECT_EQ(certificate.getPrivateKey()->getPEM(), sharedRoot().getPrivateKey()->getPEM());

    certificate = SSLCertificate(trusted().root().getPEM()); // without key
    EXPECT_EQ(certificate.getPEM(), trusted().root().getPEM());
    EXPECT_EQ(certificate.getPrivateKey(), nullptr);
}

TEST(SSLCertificateCopy, ReplacesItself)
{
    SSLCertificate certificate(sharedRoot());
    const SSLCertificate& alias = certificate;
    certificate = alias;
    EXPECT_EQ(certificate.getPEM(), sharedRoot().getPEM());
    EXPECT_TRUE(holdsKey(certificate, *certificate.getPrivateKey()));
}

TEST(SSLCertificateCopy, ReportsEveryFailure)
{
    EXPECT_EQ(expectEveryFailureIsReported([] { const SSLCertificate copy(sharedRoot()); }), 5U);
}

TEST(SSLCertificateCopy, LeavesTheOldOneWhenItFails)
{
    const SSLCertificate& other = sharedRoot();
    SSLCertificate certificate(trusted().root());
    for (const char* name : {"X509_dup", "RSAPrivateKey_dup"}) {
        SCOPED_TRACE(name);
        OpenSSLCalls watch;
        watch.failNext(name);
        EXPECT_THROW(certificate = other, SSLException);
        EXPECT_TRUE(watch.hasFailed());
        EXPECT_EQ(certificate.getPEM(), trusted().root().getPEM());
        EXPECT_EQ(certificate.getPrivateKey()->getPEM(), rootKey().getPEM());
    }
}

TEST(SSLCertificateMove, TakesHandleAndKey)
{
    SSLCertificate from(sharedRoot());
    X509* const handle = from.get();
    const RSAPrivateKey* const key = from.getPrivateKey();
    SSLCertificate to(std::move(from));
    EXPECT_EQ(to.get(), handle);
    EXPECT_EQ(to.getPrivateKey(), key);
    EXPECT_EQ(from.get(), nullptr); // NOLINT(bugprone-use-after-move)
    EXPECT_EQ(from.getPrivateKey(), nullptr);

    SSLCertificate third(trusted().root());
    third = std::move(to);
    EXPECT_EQ(third.get(), handle);
    EXPECT_EQ(third.getPrivateKey(), key);
}

TEST(SSLCertificateMove, LeavesAnObjectThatTakesANewCertificate)
{
    SSLCertificate from(sharedRoot());
    const SSLCertificate to(std::move(from));
    expectSSLErrorAt(kFile, [&] { from.getPEM(); });
    expectSSLErrorAt(kFile, [&] { const SSLCertificate copy(from); });
    from = trusted().root();
    EXPECT_EQ(from.getPEM(), trusted().root().getPEM());
}

// --- a public key of a kind that OpenSSL does not know

/// The text of the shared root with an unknown algorithm in place of rsaEncryption for its key.
std::string textWithUnknownKey()
{
    unsigned char* bytes = nullptr;
    const int length = i2d_X509(sharedRoot().get(), &bytes);
    std::string der(bytes, bytes + length);
    OPENSSL_free(bytes);
    const std::string rsaEncryption = "\x06\x09\x2A\x86\x48\x86\xF7\x0D\x01\x01\x01";
    const std::size_t position = der.find(rsaEncryption);
    EXPECT_NE(position, std::string::npos);
    der[position + rsaEncryption.size() - 1] = '\x7F';
    const auto* next = reinterpret_cast<const unsigned char*>(der.data());
    const X509_PTR certificate(d2i_X509(nullptr, &next, static_cast<long>(der.size())));
    EXPECT_EQ(X509_get0_pubkey(certificate.get()), nullptr);
    ERR_clear_error();
    return writtenBy([&](BIO* bio) { return PEM_write_bio_X509(bio, certificate.get()); });
}

TEST(SSLCertificateOfUnknownKind, CanBePrintedAndCopied)
{
    const std::string pem = textWithUnknownKey();
    const SSLCertificate certificate(pem);
    EXPECT_EQ(certificate.getPEM(), pem);
    const SSLCertificate copy(certificate);
    EXPECT_NE(copy.get(), certificate.get());
    EXPECT_EQ(copy.getPEM(), pem);
    SSLCertificate assigned(sharedRoot());
    assigned = certificate;
    EXPECT_EQ(assigned.getPEM(), pem);
    EXPECT_EQ(assigned.getPrivateKey(), nullptr);
    EXPECT_EQ(certificate.getSubject(), sharedRoot().getSubject());
    EXPECT_EQ(ERR_peek_error(), 0U);
}

TEST(SSLCertificateOfUnknownKind, MatchesNoKey)
{
    expectSSLErrorAt(kFile, [] { SSLCertificate(textWithUnknownKey(), rootKey()); });
}

// --- of a request

TEST(SSLCertificateOfRequest, CarriesACopyOfTheKeyAndNothingElse)
{
    const SSLCertificate started(trusted().clientRequest());
    ASSERT_NE(started.getPrivateKey(), nullptr);
    EXPECT_NE(started.getPrivateKey()->get(), trusted().clientRequest().getPrivateKey()->get());
    EXPECT_EQ(started.getPrivateKey()->getPEM(), trusted().clientRequest().getPrivateKey()->getPEM());
    ASSERT_NE(started.get(), nullptr);
    EXPECT_EQ(X509_NAME_entry_count(X509_get_subject_name(started.get())), 0);
    EXPECT_EQ(X509_get0_pubkey(started.get()), nullptr);
    ERR_clear_error();
}

TEST(SSLCertificateOfRequest, CarriesNoKeyWhenTheRequestHasNone)
{
    const SSLCertificate started(SSLCertificateRequest(trusted().clientRequest().getPEM()));
    EXPECT_EQ(started.getPrivateKey(), nullptr);
}

TEST(SSLCertificateOfRequest, IsEmptyAndCannotBeUsed)
{
    const SSLCertificate started(trusted().clientRequest());
    SSLCertificate other(sharedRoot());
    expectSSLErrorAt(kFile, [&] { started.getPEM(); });
    expectSSLErrorAt(kFile, [&] { const SSLCertificate copy(started); });
    expectSSLErrorAt(kFile, [&] { other = started; });
    expectSSLErrorAt(kFile, [&] { started.getValidityPeriod(); });
    EXPECT_EQ(other.getPEM(), sharedRoot().getPEM());
}

TEST(SSLCertificateOfRequest, ReportsEveryFailure)
{
    const SSLCertificateRequest& request = trusted().clientRequest();
    EXPECT_EQ(expectEveryFailureIsReported([&] { const SSLCertificate started(request); }), 5U);
}

} // namespace
} // namespace qel
