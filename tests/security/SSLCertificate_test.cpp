#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/common/security/SSLException.hpp>

#include "support/Authority.hpp"
#include "support/CalendarTime.hpp"
#include "support/CapturedLog.hpp"
#include "support/MemoryBio.hpp"
#include "support/OpenSSLCalls.hpp"
#include "support/SSLFailures.hpp"

#include <cstdlib>
#include <ctime>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <openssl/objects.h>
#include <openssl/pem.h>
#include <openssl/x509_vfy.h>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::Authority;
using test::CalendarTime;
using test::CapturedLog;
using test::expectEveryFailureIsReported;
using test::expectSSLErrorAt;
using test::OpenSSLCalls;
using test::QuickKeys;
using test::writtenBy;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using Clock = SSLValidityPeriod::Clock;

static_assert(std::is_same<SSLSubject, std::map<std::string, std::string>>::value, "");
static_assert(std::is_nothrow_move_constructible<SSLCertificate>::value, "");
static_assert(std::is_nothrow_move_assignable<SSLCertificate>::value, "");
static_assert(!std::is_convertible<std::string, SSLCertificate>::value, "a text is a certificate only when asked");
static_assert(!std::is_convertible<const SSLCertificateRequest&, SSLCertificate>::value, "nor is a request");
static_assert(sizeof(SSLCertificate) == sizeof(X509*) + sizeof(RSAPrivateKey*), "two members");

const char* const kBadFormat = "X509 certificate string is not in a supported format";
const char* const kFile = "SSLCertificate.cpp";

constexpr std::time_t kNow = 2000000000; // 2033-05-18 03:33:20 UTC
constexpr std::time_t kDay = 86400;

const SSLValidityPeriod kPeriod(Clock::from_time_t(1500000000), Clock::from_time_t(kNow));

const Authority& trusted() { return Authority::trusted(); }

const RSAPrivateKey& rootKey() { return *trusted().root().getPrivateKey(); }

// A root of its own, made once and shared; the tests must not change it.
const SSLCertificate& sharedRoot()
{
    static const SSLCertificate sRoot(SSLSubject{{"CN", "root"}, {"O", "Org"}, {"C", "US"}}, kPeriod);
    return sRoot;
}

std::string nameOf(const X509_NAME* name)
{
    char* const text = X509_NAME_oneline(name, nullptr, 0);
    const std::string result(text);
    OPENSSL_free(text);
    return result;
}

std::string subjectOf(const SSLCertificate& certificate) { return nameOf(X509_get_subject_name(certificate.get())); }
std::string issuerOf(const SSLCertificate& certificate) { return nameOf(X509_get_issuer_name(certificate.get())); }

BN_PTR serialOf(const SSLCertificate& certificate)
{
    return BN_PTR(ASN1_INTEGER_to_BN(X509_get0_serialNumber(certificate.get()), nullptr));
}

bool isSignedBy(const SSLCertificate& certificate, const RSAPrivateKey& key)
{
    const bool verified = X509_verify(certificate.get(), key.get()) == 1;
    ERR_clear_error();
    return verified;
}

bool holdsKey(const SSLCertificate& certificate, const RSAPrivateKey& key)
{
    return EVP_PKEY_cmp(X509_get0_pubkey(certificate.get()), key.get()) == 1;
}

// As a peer would check it that trusts the root alone. @return X509_V_OK or what is wrong
int verificationOf(const SSLCertificate& certificate, const SSLCertificate& root)
{
    using StoreContextPtr = std::unique_ptr<X509_STORE_CTX, CustomDeleter<X509_STORE_CTX, void, X509_STORE_CTX_free>>;
    const X509_STORE_PTR store(X509_STORE_new());
    EXPECT_EQ(X509_STORE_add_cert(store.get(), root.get()), 1);
    const StoreContextPtr context(X509_STORE_CTX_new());
    EXPECT_EQ(X509_STORE_CTX_init(context.get(), store.get(), certificate.get(), nullptr), 1);
    const int verified = X509_verify_cert(context.get());
    const int error = X509_STORE_CTX_get_error(context.get());
    EXPECT_EQ(verified == 1, error == X509_V_OK);
    ERR_clear_error();
    return error;
}

std::string textOf(X509* certificate)
{
    return writtenBy([&](BIO* bio) { return PEM_write_bio_X509(bio, certificate); });
}

// A certificate as somebody else may have made it: the shared root's with something changed.
template <typename Change>
SSLCertificate changed(const Change& change)
{
    const X509_PTR certificate(X509_dup(sharedRoot().get()));
    change(certificate.get());
    EXPECT_GT(X509_sign(certificate.get(), sharedRoot().getPrivateKey()->get(), nullptr), 0);
    return SSLCertificate(textOf(certificate.get()));
}

SSLCertificate withSerial(const char* decimal)
{
    return changed([&](X509* certificate) {
        BIGNUM* number = nullptr;
        EXPECT_GT(BN_dec2bn(&number, decimal), 0);
        const BN_PTR owner(number);
        const ASN1_INT_PTR serial(BN_to_ASN1_INTEGER(number, nullptr));
        EXPECT_EQ(X509_set_serialNumber(certificate, serial.get()), 1);
    });
}

SSLCertificateRequest copyOf(const SSLCertificateRequest& request) { return request; }

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
        {"numbers nobody knows", {{"1.2.3.4.5", "a"}}, "/1.2.3.4.5=a", {{"1.2.3.4.5", "a"}}},
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

TEST(SSLCertificateSubject, RefusesWhatCannotBeAName)
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

TEST(SSLCertificateSubject, JoinsFieldsThatStandThereSeveralTimes)
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

TEST(SSLCertificateSubject, ReadsAFieldOfManyNumbers)
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

TEST(SSLCertificateSubject, ReportsAValueThatIsNoText)
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
    // Of 128 random bits the first 64 are all zero once in 10^19 times.
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

TEST(SSLCertificateSerial, HasNeitherItsFirstNorItsLastBitForced)
{
    // Sixty coins that all fall the same way would come up once in 10^18 times.
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

TEST(SSLCertificateSerial, IsToldInHexadecimal)
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

TEST(SSLCertificateValidity, IsToldInUtcWhereverTheProgramRuns)
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

TEST(SSLCertificateText, MayHoldMore)
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

TEST(SSLCertificateText, IsRefusedWhenItHoldsNoCertificate)
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

TEST(SSLCertificateText, IsRefusedEvenWhenOpenSSLGivesNoReason)
{
    EXPECT_THAT([] { SSLCertificate certificate("-----BEGIN CERTIFICATE-----\n-----END CERTIFICATE-----\n"); },
                ThrowsMessage<SSLException>(StrEq(kBadFormat)));
}

TEST(SSLCertificateText, CutAtAnyPlaceIsRefused)
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

TEST(SSLCertificateSigning, TellsSubjectAndIssuer)
{
    EXPECT_EQ(trusted().client().getSubject(), (SSLSubject{{"CN", "client"}}));
    EXPECT_EQ(trusted().client().getIssuer(), (SSLSubject{{"CN", "QEL test root"}}));
    EXPECT_EQ(trusted().root().getSubject(), trusted().root().getIssuer());
}

TEST(SSLCertificateSigning, IssuesWhatPeersOfTheRootAccept)
{
    EXPECT_EQ(verificationOf(trusted().client(), trusted().root()), X509_V_OK);
    EXPECT_EQ(verificationOf(trusted().server(), trusted().root()), X509_V_OK);
    EXPECT_NE(verificationOf(trusted().client(), Authority::stranger().root()), X509_V_OK);
}

TEST(SSLCertificateSigning, TakesPeriodsIntoAccountWhenVerified)
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

// A limit to know of: such a certificate looks self-signed, so that no peer accepts it.
TEST(SSLCertificateSigning, OfTheRootsOwnSubjectIsNotAcceptedByPeers)
{
    const SSLCertificateRequest request(SSLSubject{{"CN", "QEL test root"}});
    const SSLCertificate issued = trusted().issue(request, SSLValidityPeriod::days(1));
    EXPECT_TRUE(isSignedBy(issued, rootKey()));
    EXPECT_NE(verificationOf(issued, trusted().root()), X509_V_OK);
}

TEST(SSLCertificateSigning, CarriesTheKeyOfTheRequestOver)
{
    SSLCertificateRequest request = copyOf(trusted().clientRequest());
    const SSLCertificate issued = sharedRoot().sign(request, kPeriod);
    ASSERT_NE(issued.getPrivateKey(), nullptr);
    EXPECT_NE(issued.getPrivateKey()->get(), request.getPrivateKey()->get());
    EXPECT_EQ(issued.getPrivateKey()->getPEM(), request.getPrivateKey()->getPEM());
}

TEST(SSLCertificateSigning, TakesARequestWithoutItsKey)
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

TEST(SSLCertificateSigning, IsDoneByManyThreadsAtTheSameTime)
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
    // Signed by one key, but asking for a certificate of another one.
    const X509_REQ_PTR forged(X509_REQ_dup(trusted().clientRequest().get()));
    ASSERT_EQ(X509_REQ_set_pubkey(forged.get(), rootKey().get()), 1);
    SSLCertificateRequest request(writtenBy([&](BIO* bio) { return PEM_write_bio_X509_REQ(bio, forged.get()); }));
    ASSERT_NE(X509_REQ_verify(request.get(), rootKey().get()), 1);
    ERR_clear_error();
    EXPECT_TRUE(holdsKey(sharedRoot().sign(request, kPeriod), rootKey()));
}

TEST(SSLCertificateSigning, MayBeDoneByAnIssuedCertificate)
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
