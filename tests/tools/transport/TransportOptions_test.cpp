#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"
#include "support/CredentialDirectory.hpp"
#include "support/Errors.hpp"
#include "transport/TransportOptions.hpp"

#include <gmock/gmock.h>
#include <sys/stat.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::KeyPermissions;
using tool::TransportOptions;

const std::string kDigits = std::string(64, 'a');

struct Parsed {
    TransportOptions options;
    std::string failure;
};

Parsed parse(std::vector<std::string> arguments)
{
    Parsed parsed;
    CLI::App app;
    tool::addTransportOptions(app, parsed.options);
    try {
        app.parse(std::vector<std::string>(arguments.rbegin(), arguments.rend())); // the parser wants them reversed
    } catch (const CLI::ParseError& error) {
        parsed.failure = error.what();
    }
    return parsed;
}

// The command line.

TEST(TransportOptions, ReadsCredentialsFromADirectory)
{
    const Parsed parsed = parse({"--credentials", "/etc/qel", "--name", "server"});
    EXPECT_THAT(parsed.failure, IsEmpty());
    EXPECT_FALSE(parsed.options.plain);
    EXPECT_EQ(parsed.options.paths().certificate, "/etc/qel/server.crt");
    EXPECT_EQ(parsed.options.paths().key, "/etc/qel/server.key");
    EXPECT_EQ(parsed.options.paths().root, "/etc/qel/root.crt");
    EXPECT_EQ(parsed.options.permissions, KeyPermissions::OwnerOnly);
    EXPECT_EQ(parsed.options.handshakeTimeout(), std::chrono::seconds(10));
}

TEST(TransportOptions, ReadsCredentialsFromThreeFiles)
{
    const Parsed parsed = parse({"--cert", "a", "--key", "b", "--root", "c"});
    EXPECT_THAT(parsed.failure, IsEmpty());
    EXPECT_EQ(parsed.options.paths().certificate, "a");
    EXPECT_EQ(parsed.options.paths().key, "b");
    EXPECT_EQ(parsed.options.paths().root, "c");
}

TEST(TransportOptions, PinsTimeAndPermissionsAreRead)
{
    const Parsed parsed =
        parse({"--cert", "a", "--key", "b", "--root", "c", "--peer-name", "one", "--peer-name", "two",
               "--peer-fingerprint", kDigits, "--insecure-permissions", "--handshake-timeout", "0.25"});
    EXPECT_THAT(parsed.failure, IsEmpty());
    EXPECT_THAT(parsed.options.pins.names, ElementsAre("one", "two"));
    EXPECT_THAT(parsed.options.pins.fingerprints, ElementsAre(tool::normalizedFingerprint(kDigits)));
    EXPECT_EQ(parsed.options.permissions, KeyPermissions::Any);
    EXPECT_EQ(parsed.options.handshakeTimeout(), std::chrono::milliseconds(250));
}

TEST(TransportOptions, RefusesContradictingOptions)
{
    const std::vector<std::vector<std::string>> bad{
        {"--credentials", "d"},
        {"--name", "n"},
        {"--credentials", "d", "--name", "../n"},
        {"--credentials", "d", "--name", ""},
        {"--cert", "a"},
        {"--cert", "a", "--key", "b"},
        {"--cert", "a", "--root", "c"},
        {"--key", "b", "--root", "c"},
        {"--credentials", "d", "--name", "n", "--cert", "a", "--key", "b", "--root", "c"},
        {"--credentials", "d", "--name", "n", "--root", "c"},
        {"--credentials", "d", "--name", "n", "--plain"},
        {"--cert", "a", "--key", "b", "--root", "c", "--plain"},
        {"--plain", "--peer-name", "x"},
        {"--plain", "--peer-fingerprint", kDigits},
        {"--peer-fingerprint", "xyz"},
        {"--peer-fingerprint", std::string(63, 'a')},
        {"--handshake-timeout", "0"},
        {"--handshake-timeout", "86401"},
        {"--handshake-timeout", "soon"},
        {"--handshake-timeout", "nan"},
        {"--peer-name", "one", "two"}, // which would be an argument of its own
    };
    for (const auto& arguments : bad)
        EXPECT_NE(parse(arguments).failure, "") << CLI::detail::join(arguments, " ");
}

TEST(TransportOptions, RefusalsNameTheReason)
{
    EXPECT_EQ(parse({"--credentials", "d"}).failure, "--credentials requires --name");
    EXPECT_EQ(parse({"--plain", "--peer-name", "x"}).failure, "--plain excludes --peer-name");
    EXPECT_EQ(parse({"--peer-fingerprint", "xyz"}).failure,
              "--peer-fingerprint: 'xyz' is not a SHA-256 fingerprint: 64 hexadecimal digits");
}

TEST(TransportOptions, RequiresCredentialsOrPlain)
{
    EXPECT_THAT(
        [] { tool::checkTransport(TransportOptions(), "127.0.0.1:80"); },
        ThrowsMessage<CLI::ValidationError>(StrEq("credentials are missing: give --credentials DIR --name NAME, or "
                                                  "--cert, --key and --root, or --plain for a loopback address")));
    TransportOptions empty;
    empty.name = "n";
    EXPECT_THROW(tool::checkTransport(empty, "127.0.0.1:80"), CLI::ValidationError);
}

TEST(TransportOptions, PlainIsForLoopbackOnly)
{
    TransportOptions plain;
    plain.plain = true;
    EXPECT_NO_THROW(tool::checkTransport(plain, "127.0.0.1:80"));
    EXPECT_NO_THROW(tool::checkTransport(plain, "[::1]:80"));
    EXPECT_THAT(
        [&] { tool::checkTransport(plain, "10.0.0.1:80"); },
        ThrowsMessage<CLI::ValidationError>(StrEq("--plain is refused for 10.0.0.1:80: it is not a loopback address")));
    for (const Parsed& parsed :
         {parse({"--credentials", "d", "--name", "n"}), parse({"--cert", "a", "--key", "b", "--root", "c"})}) {
        EXPECT_NO_THROW(tool::checkTransport(parsed.options, "10.0.0.1:80"));
        EXPECT_NO_THROW(tool::checkTransport(parsed.options, "127.0.0.1:80"));
    }
}

// The files.

class TransportCredentials : public ::testing::Test {
protected:
    TransportOptions optionsOf(const std::string& name) const
    {
        TransportOptions options;
        options.directory = directory.path();
        options.name = name;
        return options;
    }

    static auto refusal(const std::string& text) { return failsWith<protocol::CredentialsUnusable>(HasSubstr(text)); }

    void overwrite(const std::string& name, const std::string& content) const
    {
        Utilities::writeFile(directory.file(name), content);
    }

    CredentialDirectory directory;
};

TEST_F(TransportCredentials, MakeContextsForBothEnds)
{
    EXPECT_NE(tool::loadCredentials(optionsOf("server"))->makeServerContext(), nullptr);
    EXPECT_NE(tool::loadCredentials(optionsOf("client"))->makeClientContext(), nullptr);
    TransportOptions files;
    files.files = tool::credentialPaths(directory.path(), "client");
    EXPECT_TRUE(tool::loadCredentials(files).has_value());
}

TEST_F(TransportCredentials, AreNotNeededForAPlainConnection)
{
    TransportOptions plain;
    plain.plain = true;
    EXPECT_FALSE(tool::loadCredentials(plain).has_value());
}

TEST_F(TransportCredentials, ReportMissingFiles)
{
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("nobody")); },
                ThrowsMessage<FileIOError>(HasSubstr("cannot open " + directory.file("nobody.crt"))));
}

TEST_F(TransportCredentials, ReportAFileWithTheWrongContent)
{
    overwrite("root.crt", "nonsense");
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("server")); },
                refusal(directory.file("root.crt") + ": X509 certificate string is not in a supported format"));
    overwrite("root.crt", Authority::trusted().root().getPEM());
    overwrite("server.crt", "nonsense");
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("server")); },
                refusal(directory.file("server.crt") + ": X509 certificate string is not in a supported format"));
    overwrite("server.crt", Authority::trusted().server().getPEM());
    overwrite("server.key", "nonsense");
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("server")); },
                refusal(directory.file("server.key") + ": RSA private key string is not in a supported format"));
}

TEST_F(TransportCredentials, RefuseAKeyThatDoesNotMatch)
{
    overwrite("server.crt", Authority::trusted().client().getPEM());
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("server")); },
                refusal(directory.file("server.crt") + " and " + directory.file("server.key") +
                        " cannot be used: they do not belong together"));
}

TEST_F(TransportCredentials, ReportTheKindOfObjectInTheWrongFile)
{
    overwrite("server.crt", Authority::trusted().server().getPrivateKey()->getPEM());
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("server")); },
                refusal(directory.file("server.crt") + " holds a private key, not a certificate"));
    overwrite("client.key", Authority::trusted().client().getPEM());
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("client")); },
                refusal(directory.file("client.key") + " holds a certificate, not a private key"));
}

TEST_F(TransportCredentials, AreRefusedOutsideTheirValidity)
{
    directory.put("old", expiredCredentials(Authority::trusted().serverRequest()));
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("old")); },
                refusal("own certificate " + directory.file("old.crt") + " expired at "));
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("old")); },
                refusal("own certificate " + directory.file("old.crt") + " expired at "));
    directory.put("young", futureCredentials(Authority::trusted().serverRequest()));
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("young")); },
                refusal("own certificate " + directory.file("young.crt") + " is not valid before "));
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("young")); },
                refusal("own certificate " + directory.file("young.crt") + " is not valid before "));
}

TEST_F(TransportCredentials, AreRefusedWithAnExpiredRoot)
{
    const auto now = SSLValidityPeriod::Clock::now();
    const SSLCertificate root(SSLSubject{{"CN", "old root"}},
                              SSLValidityPeriod(now - std::chrono::hours(48), now - std::chrono::hours(24)));
    overwrite("root.crt", root.getPEM());
    EXPECT_THAT([&] { tool::loadCredentials(optionsOf("client")); },
                refusal("root certificate " + directory.file("root.crt") + " expired at "));
}

TEST_F(TransportCredentials, RefusesAKeyThatOthersMayReadUnlessAllowed)
{
    ASSERT_EQ(::chmod(directory.file("server.key").c_str(), 0644), 0);
    TransportOptions options = optionsOf("server");
    EXPECT_THAT([&] { tool::loadCredentials(options); },
                refusal("others may read or write the private key " + directory.file("server.key") + " (mode 0644)"));
    options.permissions = KeyPermissions::Any;
    EXPECT_TRUE(tool::loadCredentials(options).has_value());
}

} // namespace

} // namespace qel::test
