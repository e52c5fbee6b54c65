#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLException.hpp>

#include "security/CertificateKit.hpp"
#include "support/Authority.hpp"
#include "support/CalendarTime.hpp"
#include "support/MemoryBio.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <ctime>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <openssl/objects.h>
#include <openssl/pem.h>
#include <openssl/x509_vfy.h>
#include <string>
#include <thread>
#include <vector>

namespace qel {
namespace {

using test::Authority;
using test::CalendarTime;
using test::copyOf;
using test::expectEveryFailureIsReported;
using test::holdsKey;
using test::isSignedBy;
using test::issuerOf;
using test::kPeriod;
using test::OpenSSLCalls;
using test::rootKey;
using test::serialOf;
using test::sharedRoot;
using test::subjectOf;
using test::trusted;
using test::verificationOf;
using test::writtenBy;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using Clock = SSLValidityPeriod::Clock;

// --- signing

TEST(SSLCertificateSigning, IssuesForTheSubjectAndTheKeyOfTheRequest)
{
    SSLCertificateRequest request = copyOf(trusted().clientRequest());
    const SSLCertificate issued = sharedRoot().sign(request, kPeriod);
    EXPECT_EQ(X509_get_version(issued.get()), 0);
    EXPECT_EQ(X509_get_ext_count(issued.get()), 0);
    EXPECT_EQ(subjectOf(issued), "/CN=client");
    EXPECT_EQ(issuerOf(issued), "/C=US/CN=root/O=Org");
    EXPECT_TRUE(holdsKey(issued, *trusted().clientRequest().getPrivateKey()));
    EXPECT_TRUE(isSignedBy(issued, *sharedRoot().getPrivateKey()));
    EXPECT_FALSE(isSignedBy(issued, *trusted().clientRequest().getPrivateKey()));
    EXPECT_EQ(X509_get_signature_nid(issued.get()), NID_sha256WithRSAEncryption);
    EXPECT_EQ(issued.getValidityPeriod().getNotBefore(), kPeriod.getNotBefore());
    EXPECT_EQ(issued.getValidityPeriod().getNotAfter(), kPeriod.getNotAfter());
    EXPECT_LE(BN_num_bits(serialOf(issued).get()), 128);
}

TEST(SSLCertificateSigning, SetsSubjectAndIssuer)
{
    EXPECT_EQ(trusted().client().getSubject(), (SSLSubject{{"CN", "client"}}));
    EXPECT_EQ(trusted().client().getIssuer(), (SSLSubject{{"CN", "QEL test root"}}));
    EXPECT_EQ(trusted().root().getSubject(), trusted().root().getIssuer());
}

TEST(SSLCertificateSigning, IssuesCertificatesThatPeersOfTheRootAccept)
{
    EXPECT_EQ(verificationOf(trusted().client(), trusted().root()), X509_V_OK);
    EXPECT_EQ(verificationOf(trusted().server(), trusted().root()), X509_V_OK);
    EXPECT_NE(verificationOf(trusted().client(), Authority::stranger().root()), X509_V_OK);
}

TEST(SSLCertificateSigning, VerificationChecksThePeriod)
{
    trusted(); // made before time is stopped
    const std::time_t now = std::time(nullptr);
    const SSLValidityPeriod period(Clock::from_time_t(now - 100), Clock::from_time_t(now + 100));
    const SSLCertificate issued = trusted().issue(trusted().clientRequest(), period);
    CalendarTime calendar(now);
    EXPECT_EQ(verificationOf(issued, trusted().root()), X509_V_OK);
    calendar.set(now - 101);
    EXPECT_EQ(verificationOf(issued, trusted().root()), X509_V_ERR_CERT_NOT_YET_VALID);
    calendar.set(now + 101);
    EXPECT_EQ(verificationOf(issued, trusted().root()), X509_V_ERR_CERT_HAS_EXPIRED);
}

// Such a certificate looks self-signed, so no peer accepts it.
TEST(SSLCertificateSigning, PeersRefuseACertificateWithTheRootsSubject)
{
    const SSLCertificateRequest request(SSLSubject{{"CN", "QEL test root"}});
    const SSLCertificate issued = trusted().issue(request, SSLValidityPeriod::days(1));
    EXPECT_TRUE(isSignedBy(issued, rootKey()));
    EXPECT_NE(verificationOf(issued, trusted().root()), X509_V_OK);
}

TEST(SSLCertificateSigning, CopiesTheKeyOfTheRequest)
{
    SSLCertificateRequest request = copyOf(trusted().clientRequest());
    const SSLCertificate issued = sharedRoot().sign(request, kPeriod);
    ASSERT_NE(issued.getPrivateKey(), nullptr);
    EXPECT_NE(issued.getPrivateKey()->get(), request.getPrivateKey()->get());
    EXPECT_EQ(issued.getPrivateKey()->getPEM(), request.getPrivateKey()->getPEM());
}

TEST(SSLCertificateSigning, AcceptsARequestWithoutItsKey)
{
    SSLCertificateRequest request(trusted().clientRequest().getPEM());
    const SSLCertificate issued = sharedRoot().sign(request, kPeriod);
    EXPECT_EQ(issued.getPrivateKey(), nullptr);
    EXPECT_TRUE(holdsKey(issued, *trusted().clientRequest().getPrivateKey()));
}

TEST(SSLCertificateSigning, LeavesTheRequestAsItIs)
{
    SSLCertificateRequest request = copyOf(trusted().clientRequest());
    sharedRoot().sign(request, kPeriod);
    EXPECT_EQ(request.getPEM(), trusted().clientRequest().getPEM());
    EXPECT_EQ(request.getPrivateKey()->getPEM(), trusted().clientRequest().getPrivateKey()->getPEM());
}

TEST(SSLCertificateSigning, WorksInManyThreadsAtTheSameTime)
{
    constexpr int kThreads = 4;
    constexpr int kRounds = 10;
    SSLCertificateRequest request = copyOf(trusted().clientRequest()); // only read
    const SSLCertificate& root = sharedRoot();
    const std::string pem = root.getPEM();
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i)
        threads.emplace_back([&] {
            for (int round = 0; round < kRounds; ++round) {
                const SSLCertificate issued = root.sign(request, kPeriod);
                EXPECT_TRUE(isSignedBy(issued, *root.getPrivateKey()));
                EXPECT_EQ(SSLCertificate(root).getPEM(), pem);
                EXPECT_EQ(root.getSubject(), issued.getIssuer());
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(request.getPEM(), trusted().clientRequest().getPEM());
}

TEST(SSLCertificateSigning, NeedsAPrivateKey)
{
    const SSLCertificate withoutKey(sharedRoot().getPEM());
    SSLCertificateRequest request = copyOf(trusted().clientRequest());
    const OpenSSLCalls watch;
    EXPECT_THAT([&] { withoutKey.sign(request, kPeriod); },
                ThrowsMessage<SSLException>(
                    StrEq("Certificate cannot be used for signing - it does not have an associated private key")));
    EXPECT_THAT(watch.calls(), IsEmpty());
}

TEST(SSLCertificateSigning, DoesNotVerifyTheRequest)
{
    // Signed with one key, but requests a certificate for another.
    const X509_REQ_PTR forged(X509_REQ_dup(trusted().clientRequest().get()));
    ASSERT_EQ(X509_REQ_set_pubkey(forged.get(), rootKey().get()), 1);
    SSLCertificateRequest request(writtenBy([&](BIO* bio) { return PEM_write_bio_X509_REQ(bio, forged.get()); }));
    ASSERT_NE(X509_REQ_verify(request.get(), rootKey().get()), 1);
    ERR_clear_error();
    EXPECT_TRUE(holdsKey(sharedRoot().sign(request, kPeriod), rootKey()));
}

TEST(SSLCertificateSigning, WorksWithAnIssuedCertificate)
{
    SSLCertificateRequest request = copyOf(trusted().serverRequest());
    const SSLCertificate issued = trusted().client().sign(request, kPeriod);
    EXPECT_EQ(issuerOf(issued), "/CN=client");
    EXPECT_TRUE(isSignedBy(issued, *trusted().client().getPrivateKey()));
}

TEST(SSLCertificateSigning, TakesItsStepsInOrder)
{
    SSLCertificateRequest request(trusted().clientRequest().getPEM());
    const SSLCertificate& root = sharedRoot();
    const OpenSSLCalls watch;
    root.sign(request, kPeriod);
    EXPECT_THAT(watch.calls(),
                ElementsAre("X509_new()", "X509_set_version(0)", "X509_REQ_get_pubkey()", "X509_set_pubkey()",
                            "X509_set_subject_name()", "X509_set_issuer_name()", "ASN1_TIME_set(1500000000)",
                            "ASN1_TIME_set(2000000000)", "BN_new()", "BN_rand(128, -1, 0)", "BN_to_ASN1_INTEGER()",
                            "X509_set_serialNumber()", "X509_sign()"));
}

TEST(SSLCertificateSigning, ReportsEveryFailure)
{
    SSLCertificateRequest request = copyOf(trusted().clientRequest());
    const SSLCertificate& root = sharedRoot();
    EXPECT_EQ(expectEveryFailureIsReported([&] { root.sign(request, kPeriod); }), 17U);
    EXPECT_EQ(request.getPEM(), trusted().clientRequest().getPEM());
}

} // namespace
} // namespace qel
