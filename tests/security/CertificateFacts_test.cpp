#include <qel/common/security/CertificateFacts.hpp>

#include "support/Authority.hpp"

#include <gmock/gmock.h>
#include <openssl/x509.h>

namespace qel::test {

namespace {

using testing::MatchesRegex;

std::string textOf(const NameFields& fields)
{
    std::string text;
    for (const auto& field : fields)
        text += "[" + field.name + ":" + field.value + "]";
    return text;
}

// Unsigned: these tests only read the subject.
SSLCertificateRequest requestFor(const std::vector<std::pair<std::string, std::string>>& fields)
{
    SSLCertificateRequest request(Authority::trusted().clientRequest());
    const X509_REQ_PTR blank(X509_REQ_new());
    X509_REQ_set_subject_name(request.get(), X509_REQ_get_subject_name(blank.get()));
    X509_NAME* const name = X509_REQ_get_subject_name(request.get());
    for (const auto& field : fields) {
        const auto* const value = reinterpret_cast<const unsigned char*>(field.second.c_str());
        EXPECT_EQ(X509_NAME_add_entry_by_txt(name, field.first.c_str(), MBSTRING_UTF8, value, -1, -1, 0), 1);
    }
    return request;
}

TEST(CertificateView, ReportsTheFactsOfACertificate)
{
    const SSLCertificate& certificate = Authority::trusted().server();
    const auto facts = factsOf(certificate);
    EXPECT_EQ(textOf(facts.subject), "[CN:server]");
    EXPECT_EQ(textOf(facts.issuer), "[CN:QEL test root]");
    EXPECT_EQ(facts.serial, certificate.getSerialNumber());
    EXPECT_EQ(facts.validity.getNotBefore(), certificate.getValidityPeriod().getNotBefore());
    EXPECT_EQ(facts.validity.getNotAfter(), certificate.getValidityPeriod().getNotAfter());
    EXPECT_EQ(facts.key.type, "RSA");
    EXPECT_EQ(facts.key.bits, 2048);
    EXPECT_THAT(facts.fingerprint, MatchesRegex("([0-9A-F][0-9A-F]:){31}[0-9A-F][0-9A-F]"));
    EXPECT_EQ(facts.fingerprint, fingerprintOf(certificate));
}

TEST(CertificateView, AFingerprintNamesOneCertificate)
{
    const SSLCertificate& server = Authority::trusted().server();
    EXPECT_EQ(fingerprintOf(server), fingerprintOf(SSLCertificate(server.getPEM())));
    EXPECT_NE(fingerprintOf(server), fingerprintOf(Authority::trusted().client()));
}

TEST(CertificateView, ReportsTheFactsOfARequest)
{
    const auto facts = factsOf(Authority::trusted().clientRequest());
    EXPECT_EQ(textOf(facts.subject), "[CN:client]");
    EXPECT_EQ(facts.key.type, "RSA");
    EXPECT_EQ(facts.key.bits, 2048);
    EXPECT_TRUE(facts.isSignatureValid);
    EXPECT_THAT(facts.fingerprint, MatchesRegex("([0-9A-F][0-9A-F]:){31}[0-9A-F][0-9A-F]"));
}

TEST(CertificateView, ANameKeepsItsOrderItsRepetitionsAndItsUtf8)
{
    const auto request = requestFor({{"OU", "b"}, {"CN", "\xC3\xA9"}, {"OU", "a"}, {"1.2.3.4", "x"}});
    EXPECT_EQ(textOf(factsOf(request).subject), "[OU:b][CN:\xC3\xA9][OU:a][1.2.3.4:x]");
}

TEST(CertificateView, AValueThatIsNotTextIsPrintedInHex)
{
    SSLCertificateRequest request = requestFor({});
    const unsigned char bytes[] = {0x00, 0x1B, 0xFF};
    X509_NAME* const name = X509_REQ_get_subject_name(request.get());
    ASSERT_EQ(X509_NAME_add_entry_by_txt(name, "CN", V_ASN1_BIT_STRING, bytes, 3, -1, 0), 1);
    EXPECT_EQ(textOf(factsOf(request).subject), "[CN:#001bff]");
}

TEST(CertificateView, ARequestThatWasChangedHasNoValidSignature)
{
    const SSLCertificateRequest& request = Authority::trusted().clientRequest();
    EXPECT_TRUE(isSignatureValid(request));
    const auto changed = requestFor({{"CN", "server"}});
    EXPECT_FALSE(isSignatureValid(changed));
    EXPECT_FALSE(factsOf(changed).isSignatureValid);
}

TEST(CertificateView, ARequestWithTheKeyOfAnotherHasNoValidSignature)
{
    SSLCertificateRequest request(Authority::trusted().clientRequest());
    const RSAPrivateKey* const other = Authority::trusted().serverRequest().getPrivateKey();
    ASSERT_EQ(X509_REQ_set_pubkey(request.get(), other->get()), 1);
    EXPECT_FALSE(isSignatureValid(request));
}

TEST(CertificateView, SubjectsAreComparedAsPeersCompareThem)
{
    const SSLCertificate& root = Authority::trusted().root();
    EXPECT_TRUE(haveSameSubject(requestFor({{"CN", "QEL test root"}}), root));
    EXPECT_TRUE(haveSameSubject(requestFor({{"CN", "qel  TEST root "}}), root));
    EXPECT_FALSE(haveSameSubject(requestFor({{"CN", "QEL test root 2"}}), root));
    EXPECT_FALSE(haveSameSubject(requestFor({{"CN", "QEL test root"}, {"O", "x"}}), root));
    EXPECT_FALSE(haveSameSubject(requestFor({{"O", "QEL test root"}}), root));
    EXPECT_FALSE(haveSameSubject(requestFor({}), root));
}

TEST(CertificateView, AnAttributeHasOneName)
{
    EXPECT_EQ(attributeName("CN"), "CN");
    EXPECT_EQ(attributeName("commonName"), "CN");
    EXPECT_EQ(attributeName("2.5.4.3"), "CN");
    EXPECT_EQ(attributeName("1.2.3.4"), "1.2.3.4");
    EXPECT_EQ(attributeName("cn"), "");
    EXPECT_EQ(attributeName(""), "");
}

TEST(CertificateView, ReportsWhyAValueIsNotAllowed)
{
    EXPECT_EQ(objectionTo("CN", std::string(64, 'x')), "");
    EXPECT_EQ(objectionTo("CN", std::string(65, 'x')), "string too long");
    EXPECT_EQ(objectionTo("C", "X"), "string too short");
    EXPECT_NE(objectionTo("nonsense", "x"), "");
}

} // namespace

} // namespace qel::test
