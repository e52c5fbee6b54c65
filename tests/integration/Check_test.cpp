// "qel check server" as a process: what it prints, writes and exits with.

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/net/Listen.hpp>

#include "integration/TlsTest.hpp"
#include "integration/WrongServer.hpp"
#include "support/TemporaryDirectory.hpp"

#include <fstream>
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>
#include <sstream>
#include <thread>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;

Process::Result check(const std::string& endpoint, const Arguments& more, const Arguments& transport = {"--plain"})
{
    return runQel(Arguments{"check", "server", "--connect", endpoint} + transport + more);
}

std::string contentOf(const std::string& file)
{
    std::ifstream stream(file);
    std::ostringstream text;
    text << stream.rdbuf();
    return text.str();
}

TEST(Check, PrintsALineForEachCaseAndExitsWith0)
{
    ServeProcess server;
    const auto result = check(server.endpoint(), {"--only", "session/open*", "--parallel", "1"});
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    EXPECT_THAT(result.output, StartsWith("ok       session/open\n"
                                          "ok       session/open/twice\n"
                                          "ok       session/open/with-payload\n"
                                          "ok       session/open/old-header\n"
                                          "ok       session/open/again\n"
                                          "\n5 cases: 5 hold, 0 fail, 0 skipped, in "));
    EXPECT_THAT(result.errors, IsEmpty());
}

TEST(Check, RunsOverTlsAndSaysThatNoPinIsSet)
{
    const CredentialDirectory directory;
    ServeProcess server({}, "127.0.0.1:0", directory.options("server"));
    const auto result = check(server.endpoint(), {"--only", "tls/certificate/*", "--only", "response/time"},
                              directory.options("client"));
    EXPECT_EQ(result.exitStatus, 0) << result.output;
    EXPECT_THAT(result.output, HasSubstr("\n4 cases: 4 hold, 0 fail, 0 skipped, in "));
    EXPECT_THAT(result.errors, StartsWith("qel: note: any certificate of the root may be the server"));
}

TEST(Check, SkipsWithReasonsAndStillExitsWith0)
{
    ServeProcess server;
    const auto result = check(server.endpoint(), {"--only", "data/order", "--only", "tls/upgrade/once"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, AllOf(HasSubstr("skipped  data/order: needs --echo-partition\n"),
                                     HasSubstr("skipped  tls/upgrade/once: needs TLS\n"),
                                     HasSubstr("\n2 cases: 0 hold, 0 fail, 2 skipped, in ")));
}

/// Answers the version request, and every other request with status 6. The first connection is the one by which the
/// tester finds out whether there is a peer.
TEST(Check, ShowsAFailureAndExitsWith1)
{
    Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 8);
    const std::string endpoint = listener.getSocketName().str();
    std::thread server([&listener] {
        for (int i = 0; i < 2; ++i) {
            SocketStream stream(listener.accept());
            stream.setReadDeadline(Process::kDeadline);
            LoopbackMessages messages(stream);
            try {
                const auto version = messages.receive();
                messages.send(
                    QelMessageGetEnclTypeAndInterfaceVersionRsp(version->getCallerId(), 'Q', 1, 0, "QEL", "1"));
                const auto request = messages.receive();
                QelMessageGeneric response(request->getCallerId(), request->getFunction(), request->getOperation(),
                                           MsgResponse);
                response.setStatus(QelMessageStatusCmdFailed);
                messages.send(response);
                static_cast<void>(messages.isClosed());
            } catch (const std::exception&) { // the tester has left
            }
        }
    });
    const auto result = check(endpoint, {"--only", "session/open", "--hex"});
    server.join();
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_THAT(result.output,
                AllOf(StartsWith("FAILED   session/open: expected the response to 0x6003/0x0102 OpenKrogSession with "
                                 "status 0 (QelMessageStatusNoError), seen status 6 (QelMessageStatusCmdFailed)\n"
                                 "\nsession/open (rule)\n"
                                 "  required  The session opens.\n"
                                 "            docs/connection.md#the-requests\n"),
                      HasSubstr("| response 0x6003/0x0102 OpenKrogSession, id 0x00000102, status 6, 32 bytes\n"),
                      HasSubstr("|   0010  00 00 00 00 01 02 00 06 00 00 00 00 00 00 00 00\n"),
                      HasSubstr("\n1 case: 0 hold, 1 fail, 0 skipped, in ")));
    EXPECT_THAT(result.errors, IsEmpty());
}

TEST(Check, ExitsWith3WhenThePeerIsNotThere)
{
    const std::string endpoint = listenOn(IPEndpoint("127.0.0.1:0"), 1).getSocketName().str(); // closed again
    const auto result = check(endpoint, {});
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_THAT(result.errors, StartsWith("qel: cannot connect to " + endpoint + ": "));
    EXPECT_THAT(result.output, IsEmpty());
}

TEST(Check, RefusesAPatternThatMatchesNoCase)
{
    const auto result = check("127.0.0.1:1", {"--only", "frames/*"});
    EXPECT_EQ(result.exitStatus, 2);
    EXPECT_EQ(result.errors, "qel: no case matches: --list prints all\n");
}

TEST(Check, RefusesAWrongCommandLine)
{
    const auto errorsOf = [](const Arguments& arguments) {
        const auto result = runQel(Arguments{"check"} + arguments);
        EXPECT_EQ(result.exitStatus, 2);
        return result.errors;
    };
    EXPECT_EQ(errorsOf({}), "qel: a subcommand is missing: server; see \"qel check --help\"\n");
    EXPECT_EQ(errorsOf({"server"}), "qel: --connect is required\n");
    EXPECT_THAT(errorsOf({"server", "--connect", "127.0.0.1:1"}), StartsWith("qel: credentials are missing: "));
    EXPECT_EQ(errorsOf({"server", "--connect", "192.0.2.1:1", "--plain"}),
              "qel: --plain is refused for 192.0.2.1:1: it is not a loopback address\n");
    EXPECT_THAT(errorsOf({"server", "--list", "--level", "rules"}), HasSubstr("did you mean \"rule\"?"));
    EXPECT_THAT(errorsOf({"server", "--markdown"}), HasSubstr("--list"));
    EXPECT_THAT(errorsOf({"server", "--list", "--parallel", "0"}), HasSubstr("is not an integer in [1, 16]"));
    EXPECT_EQ(errorsOf({"server", "--connect", "127.0.0.1:1", "--plain", "--tool-id", std::string(21, 'x')}),
              "qel: --tool-id: longer than 20 bytes: each console adds its number\n");
}

TEST(Check, ListsCasesWithoutAPeer)
{
    const auto text = runQel({"check", "server", "--list", "--only", "session/open/t*"});
    EXPECT_EQ(text.exitStatus, 0);
    EXPECT_EQ(text.output, "session/open/twice  rule    A second open session gets status 23.\n");

    const auto robust = runQel({"check", "server", "--list", "--level", "robust", "--json"});
    const auto json = nlohmann::json::parse(robust.output);
    EXPECT_GT(json.size(), 15U);
    for (const auto& aCase : json)
        EXPECT_EQ(aCase["level"], "robust");

    const auto table = runQel({"check", "server", "--list", "--markdown", "--only", "time/*"});
    EXPECT_THAT(table.output, StartsWith("### time\n\n| Case | Level | Requirement |\n|---|---|---|\n| [`time/utc`]("));
}

TEST(Check, PrintsOneDocumentWithJson)
{
    ServeProcess server;
    const auto result = check(server.endpoint(), {"--only", "capabilities/*", "--json"});
    EXPECT_EQ(result.exitStatus, 0);
    const auto json = nlohmann::json::parse(result.output);
    EXPECT_EQ(json["peer"], server.endpoint());
    EXPECT_EQ(json["fails"], 0);
    EXPECT_EQ(json["cases"].size(), json["holds"]);
    EXPECT_EQ(json["cases"][0]["id"], "capabilities/none");
    EXPECT_EQ(json["cases"][0]["result"], "holds");
}

TEST(Check, WritesAJunitFileBesideItsOutput)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("results.xml");
    ServeProcess server;
    const auto result = check(server.endpoint(), {"--only", "time/utc", "--junit", file});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.output, StartsWith("ok       time/utc\n"));
    EXPECT_THAT(contentOf(file),
                AllOf(StartsWith("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<testsuites tests=\"1\" failures=\"0\" "),
                      HasSubstr("<testcase classname=\"time\" name=\"time/utc\" time=\"")));
}

TEST(Check, ExitsWith4WhenTheJunitFileCannotBeWritten)
{
    const TemporaryDirectory directory;
    ServeProcess server;
    const auto result =
        check(server.endpoint(), {"--only", "time/utc", "--junit", directory.file("absent/results.xml")});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_THAT(result.errors, AllOf(HasSubstr("cannot write "), HasSubstr("No such file or directory")));
}

TEST(Check, PutsTheModeAndTheMetadataBack)
{
    ServeProcess server;
    ASSERT_EQ(server.call({"set-mode", "7", "as it was"}).exitStatus, 0);
    ASSERT_EQ(server.call({"set-metadata", "as they were"}).exitStatus, 0);
    const auto result = check(server.endpoint(), {"--only", "mode/*", "--only", "metadata/*"});
    EXPECT_EQ(result.exitStatus, 0) << result.output;
    EXPECT_THAT(result.output, Not(HasSubstr("skipped ")));
    EXPECT_THAT(server.call({"get-mode"}).output, AllOf(HasSubstr("7"), HasSubstr("as it was")));
    EXPECT_THAT(server.call({"get-metadata"}).output, HasSubstr("as they were"));
}

} // namespace

} // namespace qel::test
