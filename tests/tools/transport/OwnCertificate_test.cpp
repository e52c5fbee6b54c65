#include "base/Failures.hpp"
#include "certificates/CertificateState.hpp"
#include "support/Authority.hpp"
#include "transport/OwnCertificate.hpp"

#include <gmock/gmock.h>
#include <openssl/x509.h>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::Property;
using ::testing::StrEq;
using ::testing::Throws;
using tool::checkOwnCertificate;
using tool::CommandFailure;
using tool::ExitStatus;
using tool::isoTime;
using Clock = SSLValidityPeriod::Clock;

constexpr std::chrono::seconds kSecond(1);

auto refusal(const std::string& text)
{
    return Throws<CommandFailure>(AllOf(Property("status", &CommandFailure::getExitStatus, ExitStatus::Refused),
                                        Property("text", &CommandFailure::what, StrEq(text))));
}

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
