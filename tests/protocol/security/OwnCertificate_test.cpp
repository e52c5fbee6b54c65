#include <qel/protocol/CertificateState.hpp>
#include <qel/protocol/Error.hpp>

#include "security/OwnCertificate.hpp"
#include "support/Authority.hpp"
#include "support/Errors.hpp"

#include <gmock/gmock.h>
#include <openssl/x509.h>

namespace qel::test {

namespace {

using protocol::checkOwnCertificate;
using protocol::isoTime;
using ::testing::StrEq;
using Clock = SSLValidityPeriod::Clock;

constexpr std::chrono::seconds kSecond(1);

auto refusal(const std::string& text) { return failsWith<protocol::CredentialsUnusable>(StrEq(text)); }

class OwnCertificate : public ::testing::Test {
protected:
    const SSLCertificate& certificate = Authority::trusted().server();
    const Clock::time_point first = certificate.getValidityPeriod().getNotBefore();
    const Clock::time_point last = certificate.getValidityPeriod().getNotAfter();
};

TEST_F(OwnCertificate, IsAcceptedFromItsFirstSecondToItsLast)
{
    EXPECT_NO_THROW(checkOwnCertificate("own certificate", "a.crt", certificate, first));
    EXPECT_NO_THROW(checkOwnCertificate("own certificate", "a.crt", certificate, last));
}

TEST_F(OwnCertificate, IsRefusedAfterItsLastSecond)
{
    EXPECT_THAT([&] { checkOwnCertificate("own certificate", "a.crt", certificate, last + kSecond); },
                refusal("own certificate a.crt expired at " + isoTime(last) + ": replace it"));
}

TEST_F(OwnCertificate, IsRefusedBeforeItsFirstSecond)
{
    EXPECT_THAT([&] { checkOwnCertificate("root certificate", "b.crt", certificate, first - kSecond); },
                refusal("root certificate b.crt is not valid before " + isoTime(first) +
                        ": replace it, or correct this machine's clock"));
}

TEST_F(OwnCertificate, IsRefusedWithAMalformedValidityPeriod)
{
    const SSLCertificate broken(certificate);
    constexpr char kNoTime[] = "not a time";
    ASSERT_EQ(ASN1_STRING_set(X509_getm_notAfter(broken.get()), kNoTime, sizeof(kNoTime) - 1), 1);
    EXPECT_THAT([&] { checkOwnCertificate("own certificate", "a.crt", broken, first); },
                refusal("a.crt: the validity period of the certificate is malformed"));
}

} // namespace

} // namespace qel::test
