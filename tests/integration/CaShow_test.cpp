// Reading certificates and requests with "qel ca show" and "qel ca check".

#include <qel/common/security/CertificateFacts.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLCertificateRequest.hpp>
#include <qel/protocol/CertificateState.hpp>

#include "integration/CaKit.hpp"

#include <filesystem>
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>
#include <openssl/x509.h>

namespace qel::test {

namespace {

namespace fs = std::filesystem;

using std::chrono::hours;
using std::chrono::seconds;
using testing::HasSubstr;
using testing::Not;
using Clock = SSLValidityPeriod::Clock;
using Json = nlohmann::ordered_json;

constexpr const char* kTime = "[0-9]{4}-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}Z";
constexpr const char* kFingerprint = "([0-9A-F]{2}:){31}[0-9A-F]{2}";

TEST_F(Ca, ShowPrintsACertificate)
{
    const std::string name = shared() + "/server.crt";
    const SSLCertificate server(readShared("server.crt"));
    const auto facts = factsOf(server);
    const auto result = runCa({"show", name});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.errors, "");
    EXPECT_EQ(result.output, "kind:        certificate\n"
                             "subject:     CN=server\n"
                             "issuer:      CN=Our root,O=Example\n"
                             "serial:      " +
                                 server.getSerialNumber() + "\n" +
                                 "valid from:  " + protocol::isoTime(facts.validity.getNotBefore()) + "\n" +
                                 "valid until: " + protocol::isoTime(facts.validity.getNotAfter()) + "\n" +
                                 "key type:    RSA\n"
                                 "key bits:    2048\n"
                                 "SHA-256:     " +
                                 facts.fingerprint + "\n");
    EXPECT_THAT(result.output, testing::ContainsRegex(std::string("valid until: ") + kTime));
    EXPECT_THAT(result.output, testing::ContainsRegex(std::string("SHA-256:     ") + kFingerprint));
}

TEST_F(Ca, ShowPrintsACertificateAsJson)
{
    const SSLCertificate server(readShared("server.crt"));
    const auto facts = factsOf(server);
    const auto result = runCa({"show", "--json", shared() + "/server.crt"});
    EXPECT_EQ(result.exitStatus, 0);
    const Json expected{
        {"kind", "certificate"},
        {"subject", "CN=server"},
        {"subjectFields", Json::array({{{"name", "CN"}, {"value", "server"}}})},
        {"issuer", "CN=Our root,O=Example"},
        {"issuerFields", Json::array({{{"name", "CN"}, {"value", "Our root"}}, {{"name", "O"}, {"value", "Example"}}})},
        {"serial", server.getSerialNumber()},
        {"notBefore", protocol::isoTime(facts.validity.getNotBefore())},
        {"notAfter", protocol::isoTime(facts.validity.getNotAfter())},
        {"keyType", "RSA"},
        {"keyBits", 2048},
        {"sha256", facts.fingerprint},
    };
    EXPECT_EQ(Json::parse(result.output).dump(2), expected.dump(2));
}

TEST_F(Ca, ShowPrintsARequest)
{
    const SSLCertificateRequest request(readShared("server.csr"));
    const auto result = runCa({"show", shared() + "/server.csr"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.output, "kind:      request\n"
                             "subject:   CN=server\n"
                             "signature: valid\n"
                             "key type:  RSA\n"
                             "key bits:  2048\n"
                             "SHA-256:   " +
                                 factsOf(request).fingerprint + "\n");

    SSLCertificateRequest changed(request);
    const RSAPrivateKey root(readShared("root.key"));
    ASSERT_EQ(X509_REQ_set_pubkey(changed.get(), root.get()), 1);
    write("changed.csr", changed.getPEM());
    const auto json = Json::parse(runCa({"show", file("changed.csr"), "--json"}).output);
    EXPECT_EQ(json["kind"], "request");
    EXPECT_EQ(json["subject"], "CN=server");
    EXPECT_EQ(json["signature"], "not valid");
    EXPECT_EQ(json["keyBits"], 2048);
}

TEST_F(Ca, ShowPrintsTheFirstOfSeveral)
{
    write("chain.pem",
          "a text in front\n" + readShared("server.key") + readShared("server.crt") + readShared("root.crt"));
    EXPECT_THAT(runCa({"show", file("chain.pem")}).output, HasSubstr("\nsubject:     CN=server\n"));
}

TEST_F(Ca, ShowRefusesOtherFiles)
{
    write("text", "hello\n");
    const auto text = runCa({"show", file("text")});
    EXPECT_EQ(text.exitStatus, 1);
    EXPECT_EQ(text.output, "");
    EXPECT_EQ(text.errors,
              "qel: " + file("text") + " holds neither a certificate nor a certificate request in PEM form\n");
    const auto key = runCa({"show", shared() + "/server.key"});
    EXPECT_EQ(key.exitStatus, 1);
    EXPECT_EQ(key.output, "");
    EXPECT_EQ(key.errors, "qel: " + shared() +
                              "/server.key holds a private key, neither a certificate nor a certificate request\n");
    write("broken", "-----BEGIN CERTIFICATE-----\nMIIB\n-----END CERTIFICATE-----\n");
    EXPECT_EQ(runCa({"show", file("broken")}).errors,
              "qel: " + file("broken") + ": X509 certificate string is not in a supported format\n");
    write("request", "-----BEGIN CERTIFICATE REQUEST-----\nMIIB\n-----END CERTIFICATE REQUEST-----\n");
    EXPECT_EQ(runCa({"show", file("request")}).errors,
              "qel: " + file("request") + ": X509 certificate request string is not in a supported format\n");
    fs::create_symlink("/dev/zero", file("endless"));
    EXPECT_EQ(runCa({"show", file("endless")}).errors, "qel: " + file("endless") + " is not a regular file\n");
    const auto directory = runCa({"show", shared()});
    EXPECT_EQ(directory.exitStatus, 1);
    EXPECT_EQ(directory.errors, "qel: " + shared() + " is not a regular file\n");
}

TEST_F(Ca, AMissingFileIsAUsageErrorAndAnUnreadableOneAFailure)
{
    fs::create_symlink("loop", file("loop"));
    for (const std::string command : {"show", "check"}) {
        SCOPED_TRACE(command);
        const auto missing = runCa({command, file("none")});
        EXPECT_EQ(missing.exitStatus, 2);
        EXPECT_THAT(missing.errors, HasSubstr("\"" + file("none") + "\" does not exist"));
        const auto unreadable = runCa({command, file("loop")});
        EXPECT_EQ(unreadable.exitStatus, 4);
        EXPECT_EQ(unreadable.errors, "qel: cannot open " + file("loop") + ": 40 (Too many levels of symbolic links)\n");
    }
}

TEST_F(Ca, CheckReportsByExitStatus)
{
    const Clock::time_point now = Clock::now();
    struct Row {
        const char* name;
        Clock::time_point from, until;
        std::vector<std::string> options;
        int status;
        const char* state;
    };
    const std::vector<Row> rows{
        {"a year left", now - hours(1), now + hours(365 * 24), {}, 0, "fine"},
        {"31 days left", now - hours(1), now + hours(31 * 24), {}, 0, "fine"},
        {"30 days left", now - hours(1), now + hours(30 * 24), {}, 10, "due"},
        {"31 days left, 32 asked", now - hours(1), now + hours(31 * 24), {"--within", "32d"}, 10, "due"},
        {"2 hours left, 1 asked", now - hours(1), now + hours(2), {"--within", "1h"}, 0, "fine"},
        {"2 hours left, 0 asked", now - hours(1), now + hours(2), {"--within", "0s"}, 0, "fine"},
        {"expired", now - hours(2), now - seconds(1), {}, 11, "expired"},
        {"expired long ago", now - hours(20000), now - hours(10000), {"--within", "52w"}, 11, "expired"},
        {"tomorrow", now + hours(24), now + hours(48), {}, 12, "not yet valid"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        writeCertificate("c.crt", row.from, row.until);
        std::vector<std::string> command{"check", file("c.crt")};
        command.insert(command.end(), row.options.begin(), row.options.end());
        const auto result = runCa(command);
        EXPECT_EQ(result.exitStatus, row.status);
        EXPECT_EQ(result.errors, "");
        EXPECT_EQ(result.output, std::string("state:       ") + row.state + "\n" +
                                     "valid from:  " + protocol::isoTime(row.from) + "\n" +
                                     "valid until: " + protocol::isoTime(row.until) + "\n");
    }
}

TEST_F(Ca, CheckPrintsJson)
{
    const Clock::time_point now = Clock::now();
    const Clock::time_point until = now + hours(24);
    writeCertificate("c.crt", now - hours(24), until);
    const auto result = runCa({"check", file("c.crt"), "--json"});
    const auto after = Clock::now();
    EXPECT_EQ(result.exitStatus, 10);
    const auto json = Json::parse(result.output);
    ASSERT_EQ(json.size(), 4U);
    EXPECT_EQ(json["state"], "due");
    EXPECT_EQ(json["notBefore"], protocol::isoTime(now - hours(24)));
    EXPECT_EQ(json["notAfter"], protocol::isoTime(until));
    EXPECT_LE(json["secondsLeft"].get<long long>(), 24 * 3600);
    EXPECT_GE(json["secondsLeft"].get<long long>(), (until - after).count());
}

TEST_F(Ca, CheckRefusesRequestsAndKeys)
{
    for (const auto& [name, kind] :
         {std::pair("/server.csr", "a certificate request"), std::pair("/server.key", "a private key")}) {
        const auto result = runCa({"check", shared() + name});
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_EQ(result.output, "");
        EXPECT_EQ(result.errors, "qel: " + shared() + name + " holds " + kind + ", not a certificate\n");
    }
}

TEST_F(Ca, LogsOpensslsReasonsOnlyOnRequest)
{
    write("broken", "-----BEGIN CERTIFICATE-----\nMIIB\n-----END CERTIFICATE-----\n");
    EXPECT_THAT(runCa({"show", file("broken")}).errors, Not(HasSubstr("[libssl]")));
    EXPECT_THAT(runCa({"show", file("broken"), "--log-level", "Error"}).errors, HasSubstr("[libssl] "));
}

} // namespace

} // namespace qel::test
