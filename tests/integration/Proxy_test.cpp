// "qel proxy" as a program, between "qel serve" and the commands of a console.

#include <qel/common/Utilities.hpp>

#include "integration/TestConsole.hpp"
#include "integration/TlsTest.hpp"
#include "support/TemporaryDirectory.hpp"

#include <csignal>
#include <fstream>
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>
#include <sstream>

namespace qel::test {

namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;

class ProxyProcess {
public:
    ProxyProcess(const std::string& server, const Arguments& options, const Arguments& transport = {"--plain"})
        : mProcess(qelCommand(Arguments{"proxy", "--connect", server} + transport + options)),
          mEndpoint(mProcess.readLine())
    {}

    const std::string& endpoint() const { return mEndpoint; }
    Process& process() { return mProcess; }
    Process::Result stop(int signal = SIGINT)
    {
        mProcess.signal(signal);
        return mProcess.wait();
    }

private:
    Process mProcess;
    std::string mEndpoint;
};

Process::Result callThrough(const ProxyProcess& proxy, const std::string& request)
{
    return runQel({"call", "--plain", "--connect", proxy.endpoint(), request});
}

TEST(ProxyProgram, ShowsACallAndEndsWithASummary)
{
    for (const int signal : {SIGINT, SIGTERM}) {
        ServeProcess server;
        ProxyProcess proxy(server.endpoint(), {"--timestamps", "off"});
        EXPECT_EQ(callThrough(proxy, "time").exitStatus, 0);
        proxy.process().awaitOutput("closed");
        const Process::Result result = proxy.stop(signal);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.errors, "");
        EXPECT_THAT(result.output, HasSubstr(" request  op=GetQelTod id="));
        EXPECT_THAT(result.output, HasSubstr("1 closed: both sides have ended it; to-server 2 frames, 112 bytes; "
                                             "to-console 2 frames, 120 bytes\n"));
        EXPECT_THAT(result.output, EndsWith("\n1 connection; to-server 2 frames, 112 bytes; to-console 2 frames, 120 "
                                            "bytes; 0 faults\n"));
    }
}

TEST(ProxyProgram, ARuleMakesAnAnswerARefusal)
{
    ServeProcess server;
    ProxyProcess proxy(server.endpoint(), {"--fault", "to-console op=GetQelTod corrupt=mStatus value=4"});
    const Process::Result call = callThrough(proxy, "time");
    EXPECT_EQ(call.exitStatus, 1);
    EXPECT_THAT(call.errors, HasSubstr("QelMessageStatusInvalidCmdSequence"));
    const Process::Result result = proxy.stop();
    EXPECT_THAT(result.output, HasSubstr("fault: mStatus changed from 0000 to 0004 (\"to-console op=GetQelTod "
                                         "corrupt=mStatus value=4\")\n"));
    EXPECT_THAT(result.errors, MatchesRegex("qel: note: --seed [0-9]+ repeats this run\n"));
}

TEST(ProxyProgram, AConsoleSessionPassesByteByByte)
{
    ServeProcess server({"--partition", "1=/bin/cat"});
    ProxyProcess proxy(server.endpoint(), {"--fault", "split=each-byte", "--quiet", "--seed", "1"});
    const Process::Result console =
        run(qelCommand({"console", "--plain", "--connect", proxy.endpoint(), "1"}), "hello\n");
    EXPECT_EQ(console.exitStatus, 0);
    EXPECT_THAT(console.output, HasSubstr("hello\r\nhello\r\n"));
    EXPECT_EQ(proxy.stop().errors, "");
}

TEST(ProxyProgram, ACutConnectionIsNoticed)
{
    ServeProcess server;
    ProxyProcess proxy(server.endpoint(), {"--fault", "to-console cut after bytes=90"});
    EXPECT_EQ(callThrough(proxy, "time").exitStatus, 7);
}

TEST(ProxyProgram, WritesACaptureThatDecodeReads)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("capture.pcapng");
    ServeProcess server;
    ProxyProcess proxy(server.endpoint(), {"--write", file});
    EXPECT_EQ(callThrough(proxy, "time").exitStatus, 0);
    proxy.stop();
    const Process::Result decoded = runQel({"decode", "--json", file});
    EXPECT_EQ(decoded.exitStatus, 0);
    EXPECT_EQ(nlohmann::json::parse(decoded.output)["frames"].size(), 4U);
}

TEST(ProxyProgram, ReplaysARecordingAndComparesTheAnswers)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("capture.pcapng");
    ServeProcess server;
    ProxyProcess proxy(server.endpoint(), {"--write", file});
    EXPECT_EQ(callThrough(proxy, "time").exitStatus, 0);
    EXPECT_EQ(callThrough(proxy, "limits").exitStatus, 0);
    proxy.stop();
    const auto replay = [&](const ServeProcess& to) {
        return runQel({"proxy", "--replay", file, "--plain", "--connect", to.endpoint()});
    };
    const Process::Result same = replay(server);
    EXPECT_EQ(same.exitStatus, 0);
    EXPECT_EQ(same.output, "frame 2 response op=GetEnclTypeAndInterfaceVersion: as recorded\n"
                           "frame 4 response op=GetQelTod: as recorded\n"
                           "frame 2 response op=GetEnclTypeAndInterfaceVersion: as recorded\n"
                           "frame 4 response op=GetInterfaceImplementationLimits: as recorded\n"
                           "sent 4, answers compared 4, different 0; notices recorded 0, seen 0\n");
    ServeProcess other({"--system-serial", "other"});
    const Process::Result different = replay(other);
    EXPECT_EQ(different.exitStatus, 1);
    EXPECT_THAT(different.output,
                HasSubstr("frame 2 response op=GetEnclTypeAndInterfaceVersion: payload differs from byte "));
}

TEST(ProxyProgram, JsonLinesAreObjects)
{
    ServeProcess server;
    Process proxy(qelCommand({"proxy", "--connect", server.endpoint(), "--plain", "--json"}));
    const auto first = nlohmann::json::parse(proxy.readLine());
    EXPECT_EQ(runQel({"call", "--plain", "--connect", first["address"].get<std::string>(), "time"}).exitStatus, 0);
    proxy.awaitOutput("\"closed\"");
    proxy.signal(SIGINT);
    std::istringstream lines(proxy.wait().output);
    std::string events;
    for (std::string line; std::getline(lines, line);)
        events += nlohmann::json::parse(line)["event"].get<std::string>() + " ";
    EXPECT_EQ(events, "listening open frame frame frame frame end end closed summary ");
}

TEST(ProxyProgram, MistakesAreUsage)
{
    const TemporaryDirectory directory;
    std::ofstream(directory.file("rules")) << "drop\nto-servr drop\n";
    const struct {
        Arguments options;
        std::string error;
    } rows[] = {
        {{"--plain", "--fault", "dorp"},
         "qel: --fault: unknown word \"dorp\"; did you mean \"drop\"? (column 1 of \"dorp\")\n"},
        {{"--plain", "--faults", directory.file("rules")},
         "qel: " + directory.file("rules") +
             ":2: unknown word \"to-servr\"; did you mean \"to-server\"? (column 1 of \"to-servr drop\")\n"},
        {{"--plain", "--filter", "op=GetQelTdo"},
         "qel: --filter: unknown operation \"GetQelTdo\"; did you mean \"GetQelTod\"? (column 1 of "
         "\"op=GetQelTdo\")\n"},
        {{},
         "qel: credentials are missing: give --credentials DIR --name NAME, or --cert, --key and --root, or --plain "
         "for a loopback address\n"},
        {{"--plain", "--pass-through"}, "qel: --pass-through takes no credentials and no --plain: the peers decide\n"},
        {{"--plain", "--listen", "0.0.0.0:0"}, "qel: --plain is refused for 0.0.0.0:0: it is not a loopback address\n"},
        {{"--plain", "--server-plain"},
         "qel: --plain concerns both sides: it excludes --console-... and --server-plain\n"},
    };
    for (const auto& row : rows) {
        const Process::Result result = runQel(Arguments{"proxy", "--connect", "127.0.0.1:1"} + row.options);
        EXPECT_EQ(result.exitStatus, 2);
        EXPECT_EQ(result.errors, row.error);
    }
}

TEST_F(Tls, AProxyWithCredentialsShowsWhatIsSaid)
{
    const auto server = serve();
    ProxyProcess proxy(server->endpoint(), {"--peer-name", "server"}, directory.options("client"));
    EXPECT_EQ(callTo(proxy.endpoint(), {"--peer-name", "client"}, "client", "time").exitStatus, 0);
    const Process::Result result = proxy.stop();
    EXPECT_THAT(result.output, HasSubstr("1 TLS with the server: \"CN=server\""));
    EXPECT_THAT(result.output, HasSubstr(" response op=GetQelTod id="));
}

TEST_F(Tls, AProxyPassesTlsThrough)
{
    const auto server = serve();
    ProxyProcess proxy(server->endpoint(), {}, {"--pass-through"});
    EXPECT_EQ(callTo(proxy.endpoint(), {"--peer-name", "server"}, "client", "time").exitStatus, 0);
    const Process::Result result = proxy.stop();
    EXPECT_THAT(result.output, HasSubstr(" notice   op=UpgradeConnection id="));
    EXPECT_THAT(result.output,
                HasSubstr("1 to-server  TLS begins: bytes pass unchanged from here on and are not shown\n"));
}

} // namespace

} // namespace qel::test
