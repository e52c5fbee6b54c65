// The authority beside the program openssl: each takes what the other made.

#include "integration/CaKit.hpp"

#include <filesystem>
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>

namespace qel::test {

namespace {

using testing::AllOf;
using testing::ContainsRegex;
using testing::HasSubstr;
using testing::Not;
using Json = nlohmann::ordered_json;

class CaOpenssl : public CaTest {
protected:
    /// What openssl prints; it is to succeed.
    static std::string openssl(const std::vector<std::string>& arguments)
    {
        const auto result = runOpenssl(arguments);
        EXPECT_EQ(result.exitStatus, 0) << result.errors;
        return result.output + result.errors; // which of the two has changed between its versions
    }

    static Json show(const std::string& name) { return Json::parse(runCa({"show", "--json", name}).output); }

    /// The value after "name=" in openssl's output, without the line end.
    static std::string valueAfter(const std::string& name, const std::string& output)
    {
        const std::size_t start = output.find(name + "=") + name.size() + 1;
        return output.substr(start, output.find('\n', start) - start);
    }

    /// A key and a request for it, made by openssl. @param options  such as "-newkey", "rsa:2048"
    void makeRequest(const std::string& name, const std::string& subject, const std::vector<std::string>& options) const
    {
        std::vector<std::string> command{"req",
                                         "-new",
                                         "-nodes",
                                         "-batch",
                                         "-utf8",
                                         "-subj",
                                         subject,
                                         "-keyout",
                                         file(name + ".key"),
                                         "-out",
                                         file(name + ".csr")};
        command.insert(command.end(), options.begin(), options.end());
        openssl(command);
    }
};

TEST_F(CaOpenssl, VerifiesIssuedCertificates)
{
    EXPECT_THAT(openssl({"verify", "-CAfile", shared() + "/root.crt", shared() + "/server.crt"}), HasSubstr(": OK\n"));
    EXPECT_THAT(openssl({"verify", "-check_ss_sig", "-CAfile", shared() + "/root.crt", shared() + "/root.crt"}),
                HasSubstr(": OK\n"));
}

TEST_F(CaOpenssl, RefusesCertificatesOfAnotherRoot)
{
    ASSERT_EQ(runCa({"init", path(), "--subject", "CN=another"}).exitStatus, 0);
    EXPECT_NE(runOpenssl({"verify", "-CAfile", file("root.crt"), shared() + "/server.crt"}).exitStatus, 0);
}

TEST_F(CaOpenssl, PrintsTheSameFactsOfACertificate)
{
    const std::string server = shared() + "/server.crt";
    const Json ours = show(server);
    const std::string theirs = openssl({"x509", "-in", server, "-noout", "-serial", "-fingerprint", "-sha256"});
    EXPECT_EQ(ours["serial"], valueAfter("serial", theirs));
    EXPECT_EQ(ours["sha256"], valueAfter("ingerprint", theirs));
    const std::string text = openssl({"x509", "-in", server, "-noout", "-text"});
    EXPECT_THAT(text, AllOf(HasSubstr("Version: 1 (0x0)"), ContainsRegex("Subject: CN ?= ?server\n"),
                            ContainsRegex("Issuer: CN ?= ?Our root, O ?= ?Example\n"),
                            HasSubstr("sha256WithRSAEncryption"), HasSubstr("2048 bit"), HasSubstr("Exponent: 65537")));
    EXPECT_EQ(runOpenssl({"x509", "-in", server, "-noout", "-checkend", "86400"}).exitStatus, 0);
}

TEST_F(CaOpenssl, VerifiesARequest)
{
    EXPECT_THAT(openssl({"req", "-in", shared() + "/server.csr", "-noout", "-verify"}),
                ContainsRegex("verify OK|signature OK"));
}

TEST_F(CaOpenssl, ReadsAKey)
{
    EXPECT_THAT(openssl({"rsa", "-in", shared() + "/server.key", "-noout", "-check"}), HasSubstr("RSA key ok"));
}

TEST_F(CaOpenssl, MakesRequestsThatAreSigned)
{
    bringRoot();
    makeRequest("rsa", "/C=DE/O=Example/OU=one/OU=two/CN=a\xC3\xA9,b", {"-newkey", "rsa:2048"});
    makeRequest("ec", "/CN=curve", {"-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256"});
    makeRequest("extended", "/CN=extended", {"-key", shared() + "/server.key", "-addext", "subjectAltName=DNS:x"});

    const Json request = show(file("rsa.csr"));
    EXPECT_EQ(request["subject"], "C=DE,O=Example,OU=one,OU=two,CN=a\\xc3\\xa9\\,b");
    EXPECT_EQ(request["subjectFields"][4], (Json{{"name", "CN"}, {"value", "a\xC3\xA9,b"}}));
    EXPECT_EQ(request["signature"], "valid");
    EXPECT_EQ(request["keyBits"], 2048);

    for (const char* name : {"rsa", "extended"}) {
        SCOPED_TRACE(name);
        const auto signing = runCa({"sign", path(), name});
        EXPECT_EQ(signing.exitStatus, 0) << signing.errors;
        const std::string issued = file(std::string(name) + ".crt");
        EXPECT_THAT(openssl({"verify", "-CAfile", file("root.crt"), issued}), HasSubstr(": OK\n"));
        EXPECT_EQ(show(issued)["subject"], show(file(std::string(name) + ".csr"))["subject"]);
    }
    EXPECT_EQ(show(file("ec.csr"))["keyType"], "EC");
    EXPECT_EQ(show(file("ec.csr"))["keyBits"], 256);
    EXPECT_EQ(runCa({"sign", path(), "ec"}).exitStatus, 1);
    EXPECT_THAT(openssl({"x509", "-in", file("extended.crt"), "-noout", "-text"}), Not(HasSubstr("Alternative")));
}

TEST_F(CaOpenssl, MakesARequestWhoseSignatureIsNotThatOfItsKey)
{
    bringRoot();
    const std::string der = file("server.der");
    openssl({"req", "-in", shared() + "/server.csr", "-outform", "DER", "-out", der});
    std::string bytes = read("server.der");
    bytes.back() = static_cast<char>(bytes.back() ^ 1); // the signature is at the end
    write("server.der", bytes);
    openssl({"req", "-inform", "DER", "-in", der, "-out", file("server.csr")});
    EXPECT_EQ(show(file("server.csr"))["signature"], "not valid");
    const auto signing = runCa({"sign", path(), "server"});
    EXPECT_EQ(signing.exitStatus, 1);
    EXPECT_THAT(signing.errors, HasSubstr("the request of server is not signed with its own key"));
}

TEST_F(CaOpenssl, MakesARootThatSigns)
{
    openssl({"req", "-x509", "-newkey", "rsa:2048", "-nodes", "-batch", "-subj", "/CN=their root", "-days", "30",
             "-keyout", file("root.key"), "-out", file("root.crt")}); // the key in PKCS #8
    std::filesystem::permissions(file("root.key"), std::filesystem::perms::owner_read);
    bring({"server.csr"});
    const auto signing = runCa({"sign", path(), "server", "--days", "7"});
    EXPECT_EQ(signing.exitStatus, 0) << signing.errors;
    EXPECT_THAT(openssl({"verify", "-CAfile", file("root.crt"), file("server.crt")}), HasSubstr(": OK\n"));

    const Json root = show(file("root.crt"));
    EXPECT_EQ(root["subject"], "CN=their root");
    EXPECT_EQ(root["sha256"], valueAfter("ingerprint", openssl({"x509", "-in", file("root.crt"), "-noout",
                                                                "-fingerprint", "-sha256"})));
    EXPECT_EQ(runCa({"check", file("root.crt"), "--within", "29d"}).exitStatus, 0);
    EXPECT_EQ(runCa({"check", file("root.crt"), "--within", "30d"}).exitStatus, 10);
}

TEST_F(CaOpenssl, ShowRefusesADerCertificate)
{
    openssl({"x509", "-in", shared() + "/server.crt", "-outform", "DER", "-out", file("server.der")});
    EXPECT_EQ(runCa({"show", file("server.der")}).errors,
              "qel: " + file("server.der") + " holds neither a certificate nor a certificate request in PEM form\n");
}

} // namespace

} // namespace qel::test
