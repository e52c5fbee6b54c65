// What a self-signed root holds: fields of its subject, serial number and validity.

#include <qel/common/security/SSLCertificate.hpp>

#include "security/CertificateKit.hpp"
#include "support/Authority.hpp"
#include "support/CalendarTime.hpp"
#include "support/CapturedLog.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <cstdlib>
#include <ctime>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <openssl/objects.h>
#include <openssl/x509_vfy.h>
#include <set>
#include <string>

namespace qel {
namespace {

using test::Authority;
using test::CalendarTime;
using test::CapturedLog;
using test::changed;
using test::expectEveryFailureIsReported;
using test::expectSSLErrorAt;
using test::holdsKey;
using test::isSignedBy;
using test::issuerOf;
using test::kDay;
using test::kNow;
using test::kPeriod;
using test::OpenSSLCalls;
using test::QuickKeys;
using test::rootKey;
using test::serialOf;
using test::sharedRoot;
using test::subjectOf;
using test::trusted;
using test::verificationOf;
using test::withSerial;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;
using Clock = SSLValidityPeriod::Clock;

const char* const kFile = "SSLCertificate.cpp";

// --- a self-signed root

TEST(SSLCertificateRoot, IsOfVersionOneWithoutExtensions)
{
    EXPECT_EQ(X509_get_version(sharedRoot().get()), 0);
    EXPECT_EQ(X509_get_ext_count(sharedRoot().get()), 0);
}

TEST(SSLCertificateRoot, NamesItsFieldsInTheOrderOfTheirKeys)
{
    EXPECT_EQ(subjectOf(sharedRoot()), "/C=US/CN=root/O=Org");
    EXPECT_EQ(issuerOf(sharedRoot()), "/C=US/CN=root/O=Org");
}

TEST(SSLCertificateRoot, CarriesItsNewKey)
{
    ASSERT_NE(sharedRoot().getPrivateKey(), nullptr);
    EXPECT_EQ(EVP_PKEY_bits(sharedRoot().getPrivateKey()->get()), 2048);
    EXPECT_TRUE(holdsKey(sharedRoot(), *sharedRoot().getPrivateKey()));
    EXPECT_FALSE(holdsKey(sharedRoot(), rootKey()));
}

TEST(SSLCertificateRoot, IsSignedByItselfWithSha256)
{
    EXPECT_TRUE(isSignedBy(sharedRoot(), *sharedRoot().getPrivateKey()));
    EXPECT_FALSE(isSignedBy(sharedRoot(), rootKey()));
    EXPECT_EQ(X509_get_signature_nid(sharedRoot().get()), NID_sha256WithRSAEncryption);
}

TEST(SSLCertificateRoot, IsValidForThePeriod)
{
    EXPECT_EQ(sharedRoot().getValidityPeriod().getNotBefore(), kPeriod.getNotBefore());
    EXPECT_EQ(sharedRoot().getValidityPeriod().getNotAfter(), kPeriod.getNotAfter());
}

TEST(SSLCertificateRoot, IsAcceptedAsAnAnchor)
{
    EXPECT_EQ(verificationOf(trusted().root(), trusted().root()), X509_V_OK);
}

TEST(SSLCertificateRoot, HasAnEmptyNameWhenNoFieldIsGiven)
{
    const SSLCertificate root(SSLSubject{}, SSLValidityPeriod::days(1));
    EXPECT_EQ(X509_NAME_entry_count(X509_get_subject_name(root.get())), 0);
    EXPECT_EQ(X509_NAME_entry_count(X509_get_issuer_name(root.get())), 0);
    EXPECT_THAT(root.getSubject(), IsEmpty());
    EXPECT_THAT(root.getIssuer(), IsEmpty());
    EXPECT_EQ(SSLCertificate(root.getPEM()).getPEM(), root.getPEM());
}

TEST(SSLCertificateRoot, TakesItsStepsInOrder)
{
    const OpenSSLCalls watch;
    const SSLCertificate root(SSLSubject{{"CN", "root"}, {"O", "Org"}}, kPeriod);
    EXPECT_THAT(watch.calls(),
                ElementsAre("EVP_PKEY_new()", "BN_new()", "BN_set_word(65537)", "RSA_new()",
                            "RSA_generate_key_ex(2048)", "EVP_PKEY_set1_RSA()", // the key
                            "X509_new()", "X509_set_version(0)",                //
                            "X509_NAME_add_entry_by_txt(4097, -1, -1, 0)",      //
                            "X509_NAME_add_entry_by_txt(4097, -1, -1, 0)",      //
                            "X509_set_pubkey()", "X509_set_issuer_name()",      //
                            "ASN1_TIME_set(1500000000)", "ASN1_TIME_set(2000000000)", "BN_new()", "BN_rand(128, -1, 0)",
                            "BN_to_ASN1_INTEGER()", "X509_set_serialNumber()", "X509_sign()"));
}

TEST(SSLCertificateRoot, ReportsEveryFailure)
{
    const QuickKeys quick;
    EXPECT_EQ(expectEveryFailureIsReported([] {
                  const SSLCertificate root(SSLSubject{{"CN", "root"}}, kPeriod);
              }),
              18U);
}

// --- subject fields

TEST(SSLCertificateSubject, TakesShortAndLongNamesAndNumbers)
{
    const QuickKeys quick;
    const struct {
        const char* label;
        SSLSubject fields;
        const char* name;
        SSLSubject readBack;
    } rows[] = {
        {"short", {{"CN", "a"}}, "/CN=a", {{"CN", "a"}}},
        {"long", {{"commonName", "a"}}, "/CN=a", {{"CN", "a"}}},
        {"numbers", {{"2.5.4.3", "a"}}, "/CN=a", {{"CN", "a"}}},
        {"an unknown number", {{"1.2.3.4.5", "a"}}, "/1.2.3.4.5=a", {{"1.2.3.4.5", "a"}}},
        {"country", {{"countryName", "DE"}}, "/C=DE", {{"C", "DE"}}},
        {"several",
         {{"O", "Org"}, {"ST", "State"}, {"L", "Place"}, {"OU", "Unit"}, {"CN", "name"}},
         "/CN=name/L=Place/O=Org/OU=Unit/ST=State",
         {{"CN", "name"}, {"L", "Place"}, {"O", "Org"}, {"OU", "Unit"}, {"ST", "State"}}},
        {"blanks and signs", {{"CN", " a, b = \"c\" "}}, "/CN= a, b = \"c\" ", {{"CN", " a, b = \"c\" "}}},
        {"cut at a NUL", {{"CN", std::string("ab\0cd", 5)}}, "/CN=ab", {{"CN", "ab"}}},
        {"longest common name", {{"CN", std::string(64, 'x')}}, nullptr, {{"CN", std::string(64, 'x')}}},
        {"UTF-8 taken as Latin-1", {{"CN", "Z\xC3\xBCrich"}}, nullptr, {{"CN", "Z\xC3\x83\xC2\xBCrich"}}},
        {"Latin-1", {{"CN", "Z\xFCrich"}}, nullptr, {{"CN", "Z\xC3\xBCrich"}}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.label);
        const SSLCertificate certificate(row.fields, kPeriod);
        if (row.name != nullptr) {
            EXPECT_EQ(subjectOf(certificate), row.name);
        }
        EXPECT_EQ(certificate.getSubject(), row.readBack);
        EXPECT_EQ(certificate.getIssuer(), row.readBack);
    }
}

TEST(SSLCertificateSubject, RefusesInvalidFieldsAndValues)
{
    const QuickKeys quick;
    const struct {
        const char* label;
        SSLSubject fields;
    } rows[] = {
        {"unknown field", {{"noSuchField", "a"}}},
        {"field without name", {{"", "a"}}},
        {"empty value", {{"CN", ""}}},
        {"nothing before a NUL", {{"CN", std::string("\0a", 2)}}},
        {"common name too long", {{"CN", std::string(65, 'x')}}},
        {"country too short", {{"C", "D"}}},
        {"country too long", {{"C", "DEU"}}},
        {"country not printable", {{"C", "D_"}}},
        {"a bad one among good ones", {{"CN", "a"}, {"O", ""}, {"OU", "b"}}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.label);
        const CapturedLog log;
        expectSSLErrorAt("X509Name.cpp", [&] { SSLCertificate(row.fields, kPeriod); });
        EXPECT_THAT(log.lines(), AllOf(Not(IsEmpty()), Each(StartsWith("E: [libssl] "))));
    }
}

TEST(SSLCertificateSubject, JoinsTheValuesOfRepeatedFields)
{
    const SSLCertificate certificate = changed([](X509* x509) {
        X509_NAME* const name = X509_get_subject_name(x509);
        for (const char* text : {"first", "second"}) {
            const auto* const value = reinterpret_cast<const unsigned char*>(text);
            ASSERT_EQ(X509_NAME_add_entry_by_txt(name, "OU", MBSTRING_ASC, value, -1, -1, 0), 1);
        }
    });
    EXPECT_EQ(certificate.getSubject(),
              (SSLSubject{{"C", "US"}, {"CN", "root"}, {"O", "Org"}, {"OU", "first\nsecond"}}));
    EXPECT_EQ(certificate.getIssuer(), (SSLSubject{{"C", "US"}, {"CN", "root"}, {"O", "Org"}}));
}

TEST(SSLCertificateSubject, ReadsOtherKindsOfTextAsUtf8)
{
    const SSLCertificate certificate = changed([](X509* x509) {
        X509_NAME* const name = X509_get_subject_name(x509);
        const unsigned char wide[] = {0x00, 'Z', 0x00, 0xFC, 0x20, 0xAC}; // two bytes a character
        ASSERT_EQ(X509_NAME_add_entry_by_txt(name, "OU", V_ASN1_BMPSTRING, wide, sizeof(wide), -1, 0), 1);
        const unsigned char withNul[] = {'a', 0, 'b'};
        ASSERT_EQ(X509_NAME_add_entry_by_txt(name, "L", V_ASN1_UTF8STRING, withNul, sizeof(withNul), -1, 0), 1);
    });
    EXPECT_EQ(certificate.getSubject().at("OU"), "Z\xC3\xBC\xE2\x82\xAC");
    EXPECT_EQ(certificate.getSubject().at("L"), std::string("a\0b", 3));
}

TEST(SSLCertificateSubject, ReadsAFieldWithALongNumber)
{
    std::string numbers = "1.2";
    for (int i = 0; i < 60; ++i)
        numbers += ".123456";
    const SSLCertificate certificate(SSLSubject{{numbers, "a"}}, kPeriod);
    EXPECT_EQ(certificate.getSubject(), (SSLSubject{{numbers, "a"}}));
}

TEST(SSLCertificateSubject, ReadsAFieldThatHasNoShortName)
{
    const char* const numbers = "1.2.3.4.6";
    static const int nid = OBJ_create(numbers, nullptr, "a long name only"); // stays for the rest of the program
    ASSERT_NE(nid, NID_undef);
    const SSLCertificate certificate(SSLSubject{{numbers, "a"}}, kPeriod);
    EXPECT_EQ(certificate.getSubject(), (SSLSubject{{numbers, "a"}}));
}

TEST(SSLCertificateSubject, ReportsAValueThatIsNotText)
{
    const SSLCertificate certificate = changed([](X509* x509) {
        const unsigned char bits[] = {1, 2, 3};
        X509_NAME* const name = X509_get_subject_name(x509);
        ASSERT_EQ(X509_NAME_add_entry_by_txt(name, "OU", V_ASN1_BIT_STRING, bits, sizeof(bits), -1, 0), 1);
    });
    expectSSLErrorAt("X509Name.cpp", [&] { certificate.getSubject(); });
    EXPECT_EQ(certificate.getIssuer().size(), 3U);
}

TEST(SSLCertificateSubject, ReportsEveryFailureOfReading)
{
    const SSLCertificate certificate(SSLSubject{{"1.2.3.4.5", "a"}}, kPeriod);
    for (const char* name : {"ASN1_STRING_to_UTF8", "OBJ_obj2txt"}) {
        SCOPED_TRACE(name);
        for (const bool ofIssuer : {false, true}) {
            const CapturedLog log;
            OpenSSLCalls watch;
            watch.failNext(name, -1);
            expectSSLErrorAt("X509Name.cpp", [&] { ofIssuer ? certificate.getIssuer() : certificate.getSubject(); });
            EXPECT_TRUE(watch.hasFailed());
            EXPECT_THAT(log.lines(), ElementsAre(OpenSSLCalls::injectedErrorLine()));
        }
    }
}

// --- serial numbers

TEST(SSLCertificateSerial, IsRandomWithUpTo128Bits)
{
    // The first 64 of 128 random bits are all zero once in 10^19 times.
    std::set<std::string> serials;
    for (const SSLCertificate* certificate :
         {&sharedRoot(), &trusted().root(), &trusted().server(), &trusted().client(), &Authority::stranger().root()}) {
        const BN_PTR serial = serialOf(*certificate);
        EXPECT_LE(BN_num_bits(serial.get()), 128);
        EXPECT_GT(BN_num_bits(serial.get()), 64);
        EXPECT_FALSE(BN_is_negative(serial.get()));
        serials.insert(certificate->getSerialNumber());
    }
    EXPECT_EQ(serials.size(), 5U);
}

TEST(SSLCertificateSerial, DiffersBetweenTwoCertificatesOfOneRequest)
{
    const SSLCertificate first = trusted().issue(trusted().clientRequest(), kPeriod);
    const SSLCertificate second = trusted().issue(trusted().clientRequest(), kPeriod);
    EXPECT_NE(first.getSerialNumber(), second.getSerialNumber());
}

TEST(SSLCertificateSerial, ForcesNeitherTheFirstNorTheLastBit)
{
    // Sixty random bits are all equal once in 10^18 times.
    bool topBit[2] = {false, false};
    bool bottomBit[2] = {false, false};
    for (int i = 0; i < 60; ++i) {
        const BN_PTR serial = serialOf(trusted().issue(trusted().clientRequest(), kPeriod));
        topBit[BN_is_bit_set(serial.get(), 127)] = true;
        bottomBit[BN_is_bit_set(serial.get(), 0)] = true;
    }
    EXPECT_TRUE(topBit[0] && topBit[1]);
    EXPECT_TRUE(bottomBit[0] && bottomBit[1]);
}

TEST(SSLCertificateSerial, IsPrintedInHexadecimal)
{
    const struct {
        const char* decimal;
        const char* told;
    } rows[] = {
        {"0", "0"},
        {"1", "01"},
        {"255", "FF"},
        {"256", "0100"},
        {"-171", "-AB"},
        {"340282366920938463463374607431768211455", "FFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFF"},
        {"1461501637330902918203684832716283019655932542975", "FFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFFF"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.decimal);
        EXPECT_EQ(withSerial(row.decimal).getSerialNumber(), row.told);
    }
}

TEST(SSLCertificateSerial, ReportsEveryFailureOfReading)
{
    EXPECT_EQ(expectEveryFailureIsReported([] { sharedRoot().getSerialNumber(); }), 2U);
}

// --- validity

TEST(SSLCertificateValidity, BeginsADayBeforeItIsMade)
{
    trusted(); // made before time is stopped
    const CalendarTime calendar(kNow);
    const SSLCertificate certificate = trusted().issue(trusted().clientRequest(), SSLValidityPeriod::days(365));
    const SSLValidityPeriod period = certificate.getValidityPeriod();
    EXPECT_EQ(Clock::to_time_t(period.getNotBefore()), kNow - kDay);
    EXPECT_EQ(Clock::to_time_t(period.getNotAfter()), kNow + 365 * kDay);
}

TEST(SSLCertificateValidity, IsReadToTheSecond)
{
    const struct {
        const char* label;
        std::time_t notBefore;
        std::time_t notAfter;
    } rows[] = {
        {"around now", kNow, kNow + 1},
        {"the same", kNow, kNow},
        {"the wrong way round", kNow, kNow - 1},
        {"the beginning", 0, 1},
        {"before the beginning", -1, 0},
        {"first year of the short form", -631152000, kNow}, // 1950-01-01 00:00:00
        {"last year before it", -631152001, kNow},          // 1949-12-31 23:59:59
        {"last second of the short form", 0, 2524607999},   // 2049-12-31 23:59:59
        {"first second of the long form", 0, 2524608000},   // 2050-01-01 00:00:00
        {"a leap day", 1709164800, 1709251199},             // 2024-02-29
        {"the last year of four digits", 0, 253402300799},  // 9999-12-31 23:59:59
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.label);
        const SSLValidityPeriod period(Clock::from_time_t(row.notBefore), Clock::from_time_t(row.notAfter));
        const SSLCertificate issued = trusted().issue(trusted().clientRequest(), period);
        const SSLCertificate loaded(issued.getPEM());
        EXPECT_EQ(Clock::to_time_t(loaded.getValidityPeriod().getNotBefore()), row.notBefore);
        EXPECT_EQ(Clock::to_time_t(loaded.getValidityPeriod().getNotAfter()), row.notAfter);
    }
}

TEST(SSLCertificateValidity, IsInUtcInEveryTimeZone)
{
    const SSLCertificate& root = sharedRoot();
    const char* const zone = std::getenv("TZ");
    const std::string before = zone != nullptr ? zone : "";
    ASSERT_EQ(::setenv("TZ", "Test+11:30", 1), 0);
    ::tzset();
    EXPECT_EQ(root.getValidityPeriod().getNotAfter(), kPeriod.getNotAfter());
    if (zone != nullptr) {
        ::setenv("TZ", before.c_str(), 1);
    } else {
        ::unsetenv("TZ");
    }
    ::tzset();
}

TEST(SSLCertificateValidity, CannotBeInfinite)
{
    expectSSLErrorAt(kFile, [] { SSLCertificate(SSLSubject{{"CN", "root"}}, SSLValidityPeriod::Infinite); });
    expectSSLErrorAt(kFile, [] { trusted().issue(trusted().clientRequest(), SSLValidityPeriod::Infinite); });
    const SSLValidityPeriod noEnd(Clock::from_time_t(0), (Clock::max)());
    expectSSLErrorAt(kFile, [&] { trusted().issue(trusted().clientRequest(), noEnd); });
}

TEST(SSLCertificateValidity, ReportsEveryFailureOfReading)
{
    EXPECT_EQ(expectEveryFailureIsReported([] { sharedRoot().getValidityPeriod(); }), 2U);
}

} // namespace
} // namespace qel
