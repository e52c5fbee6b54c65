// The program at both ends of a TLS connection: traffic, and pins.

#include <qel/common/security/CertificateFacts.hpp>

#include "integration/TlsTest.hpp"

#include <cctype>
#include <csignal>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::StartsWith;

TEST_F(Tls, CallWorksOverTls)
{
    const auto server = serve();
    const auto result = call(*server);
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_THAT(result.output, HasSubstr("16384"));
    EXPECT_EQ(result.errors, "");
    EXPECT_THAT(server->stop().errors, AllOf(HasSubstr("(I): SSLStream protocol init complete: TLSv1.3 "),
                                             HasSubstr(": over TLS: \"CN=client\", SHA-256 " +
                                                       fingerprintOf(Authority::trusted().client()) + "\n")));
}

TEST_F(Tls, ReadsCredentialsFromThreeFiles)
{
    const Arguments files{"--cert", directory.file("server.crt"), "--key", directory.file("server.key"),
                          "--root", directory.file("root.crt")};
    ServeProcess server({}, "127.0.0.1:0", files);
    const auto result = runQel({"call", "--connect", server.endpoint(), "--cert", directory.file("client.crt"), "--key",
                                directory.file("client.key"), "--root", directory.file("root.crt"), "time"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    server.stop();
}

TEST_F(Tls, TheConsoleReachesAPartition)
{
    const auto server = serve({"--partition", "1=PS1='$ ' exec /bin/sh"});
    const auto result = console(*server, "echo $((6 * 7)) is it\n", {"1"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_THAT(result.output, HasSubstr("42 is it\r\n"));
    server->stop();
}

TEST_F(Tls, DeliversALongOutputCompletely)
{
    const auto server = serve({"--partition", "1=stty raw -echo; seq 1 200000"});
    std::string expected;
    for (int i = 1; i <= 200000; ++i)
        expected += std::to_string(i) + "\n";
    const auto result = console(*server, "", {"--no-eof", "1"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_TRUE(result.output == expected); // too long to be printed
    server->stop();
}

TEST_F(Tls, DeliversALongInputCompletely)
{
    const auto server = serve({"--partition", "1=stty raw -echo; echo go; head -c 1000000"});
    std::string input;
    for (int i = 0; input.size() < 1000000; ++i)
        input += std::to_string(i) + " ";
    input.resize(1000000);
    Process process(qelCommand(Arguments{"console", "--connect", server->endpoint()} + directory.options("client") +
                               Arguments{"1"}));
    process.awaitOutput("go\n");
    process.writeInput(input);
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_TRUE(result.output == "go\n" + input); // too long to be printed
    server->stop();
}

TEST_F(Tls, ConsecutiveCallsSucceedWithOnePlace)
{
    const auto server = serve({"--max-consoles", "1", "--log-level", "warn"});
    for (int i = 0; i < 10; ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(call(*server, {"--tool-id", "always the same"}).exitStatus, 0);
    }
    server->stop();
}

TEST_F(Tls, AStoppingServerNotifiesTheConsole)
{
    const auto server = serve({"--partition", "1=echo ready; cat"});
    Process process(qelCommand(Arguments{"console", "--connect", server->endpoint()} + directory.options("client") +
                               Arguments{"1"}));
    process.awaitOutput("ready");
    server->stop();
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.errors, HasSubstr("session closed: the server shut down\n"));
}

TEST_F(Tls, AKilledServerEndsTheConsole)
{
    const auto server = serve({"--partition", "1=stty raw -echo; echo ready; cat"});
    Process process(qelCommand(Arguments{"console", "--connect", server->endpoint()} + directory.options("client") +
                               Arguments{"1"}));
    process.awaitOutput("ready\n");
    server->process().signal(SIGKILL);
    process.writeInput(std::string(100000, 'x'));
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.errors, HasSubstr("qel: connection lost: "));
}

// Pins.

TEST_F(Tls, CallChecksThePinsOfTheServer)
{
    const auto server = serve({"--log-level", "warn"});
    const std::string fingerprint = fingerprintOf(Authority::trusted().server());
    std::string bare;
    for (const char character : fingerprint) {
        if (character != ':') bare += static_cast<char>(std::tolower(static_cast<unsigned char>(character)));
    }
    for (const Arguments& pins : std::vector<Arguments>{{"--peer-name", "server"},
                                                        {"--peer-fingerprint", fingerprint},
                                                        {"--peer-fingerprint", bare},
                                                        {"--peer-name", "other", "--peer-name", "server"},
                                                        {"--peer-name", "server", "--peer-fingerprint", bare}}) {
        const auto result = call(*server, pins);
        EXPECT_EQ(result.exitStatus, 0) << result.errors;
    }
    const auto name = call(*server, {"--peer-name", "other"});
    EXPECT_EQ(name.exitStatus, 1);
    EXPECT_EQ(name.errors, prefix(server->endpoint()) + "wrong peer: the name \"server\" does not match --peer-name\n");
    bare.front() = bare.front() == '0' ? '1' : '0';
    const auto print = call(*server, {"--peer-fingerprint", bare});
    EXPECT_EQ(print.exitStatus, 1);
    EXPECT_EQ(print.errors, prefix(server->endpoint()) + "wrong peer: the fingerprint " + fingerprint +
                                " does not match --peer-fingerprint\n");
    server->stop();
}

TEST_F(Tls, ConsoleChecksThePinsOfTheServer)
{
    const auto server = serve({"--partition", "1=cat"});
    const auto result = console(*server, "", {"--peer-name", "other", "1"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.errors, HasSubstr("does not match --peer-name"));
    server->stop();
}

TEST_F(Tls, ServeChecksThePinsOfConsoles)
{
    const auto server = serve({"--peer-name", "client", "--peer-name", "operator", "--log-level", "warn"});
    EXPECT_EQ(call(*server).exitStatus, 0);
    // Any certificate of the root opens either role; here it does not.
    const auto result = call(*server, {}, "server");
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_EQ(result.output, "");
    EXPECT_THAT(
        result.errors,
        StartsWith("qel: the server closed the connection right after the TLS handshake; it may not accept this "
                   "console's certificate: "));
    EXPECT_THAT(server->stop().errors, HasSubstr(": refused: wrong peer: the name "
                                                 "\"server\" does not match the pinned names\n"));
}

} // namespace

} // namespace qel::test
