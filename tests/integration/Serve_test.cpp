// "qel serve" as a process, with real connections and real partition commands.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/Utilities.hpp>

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <csignal>
#include <fstream>
#include <gmock/gmock.h>
#include <thread>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::StartsWith;

bool exists(pid_t pid) { return ::kill(pid, 0) == 0 || errno != ESRCH; }

pid_t pidIn(const std::string& text) { return std::stoi(text.substr(text.find("pid=") + 4)); }

std::vector<std::string> partition(const std::string& text) { return {"--partition", text}; }

TEST(Serve, PrintsOnlyItsEndpoint)
{
    ServeProcess server;
    EXPECT_THAT(server.endpoint(), MatchesRegex("127\\.0\\.0\\.1:[1-9][0-9]*"));
    TestConsole console(server.endpoint());
    console.introduce("a");
    EXPECT_EQ(server.stop().output, server.endpoint() + "\n");
}

TEST(Serve, ListensOnIPv6Loopback)
{
    if (!std::ifstream("/proc/net/if_inet6").good()) GTEST_SKIP() << "no IPv6 here";
    ServeProcess server({}, "[::1]:0");
    EXPECT_THAT(server.endpoint(), StartsWith("[::1]:"));
    TestConsole(server.endpoint()).introduce("a");
    server.stop();
}

TEST(Serve, APartitionsCommandStartsWhenItIsFirstOpened)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("started");
    ServeProcess server(partition("1=echo > " + file + "; echo ready; cat"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    EXPECT_FALSE(std::ifstream(file).good());
    console.openSerial(1);
    console.readUntil(1, "ready\r\n");
    EXPECT_TRUE(std::ifstream(file).good());
    server.stop();
}

TEST(Serve, TypedInputReachesTheShellAndItsOutputReturns)
{
    ServeProcess server(partition("7=/bin/sh"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(7);
    console.type(7, "echo $((6 * 7))\n");
    console.readUntil(7, "42\r\n");
    server.stop();
}

TEST(Serve, SeveralConsolesHaveSessionsAtOnce)
{
    ServeProcess server({"--max-consoles", "5", "--partition", "1=echo one; cat", "--partition", "2=echo two; cat",
                         "--partition", "3=echo three; cat"});
    std::vector<std::unique_ptr<TestConsole>> consoles;
    const std::vector<std::string> names{"one", "two", "three"};
    for (std::size_t i = 0; i < names.size(); ++i) {
        consoles.push_back(std::make_unique<TestConsole>(server.endpoint()));
        consoles.back()->openSession(names[i]);
        consoles.back()->openSerial(static_cast<std::uint16_t>(i + 1));
    }
    for (std::size_t i = 0; i < names.size(); ++i) {
        const auto id = static_cast<std::uint16_t>(i + 1);
        EXPECT_EQ(consoles[i]->readUntil(id, "\r\n"), names[i] + "\r\n");
        consoles[i]->type(id, "to " + names[i] + "\n");
        EXPECT_EQ(consoles[i]->readUntil(id, names[i] + "\r\nto " + names[i] + "\r\n"),
                  "to " + names[i] + "\r\nto " + names[i] + "\r\n");
    }
    server.stop();
}

TEST(Serve, OneConsoleHasSeveralSessions)
{
    ServeProcess server({"--partition", "1=cat", "--partition", "2=echo two; cat"});
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    console.openSerial(2);
    console.readUntil(2, "two\r\n");
    server.stop();
}

TEST(Serve, ServesSixteenConsolesByDefault)
{
    ServeProcess server;
    std::vector<std::unique_ptr<TestConsole>> consoles;
    for (int i = 0; i < 16; ++i) {
        consoles.push_back(std::make_unique<TestConsole>(server.endpoint()));
        consoles.back()->introduce("console " + std::to_string(i));
    }
    TestConsole tooMany(server.endpoint());
    EXPECT_EQ(tooMany.statusOf(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 1, "one more")), 18U);
    EXPECT_TRUE(tooMany.messages().isClosed());
    consoles.back()->vanish();
    server.process().awaitErrors("console 16 disconnected");
    TestConsole(server.endpoint()).introduce("one more");
    server.stop();
}

TEST(Serve, RefusesConsolesAboveMaxConsoles)
{
    ServeProcess server({"--max-consoles", "2"});
    TestConsole first(server.endpoint());
    TestConsole second(server.endpoint());
    TestConsole third(server.endpoint());
    first.introduce("a");
    second.introduce("b");
    EXPECT_EQ(third.statusOf(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 1, "c")), 18U);
    server.stop();
}

TEST(Serve, ACallIsServedBesideTwoOpenSessions)
{
    ServeProcess server({"--partition", "1=cat", "--partition", "2=cat"});
    TestConsole first(server.endpoint());
    TestConsole second(server.endpoint());
    first.openSession("a");
    first.openSerial(1);
    second.openSession("b");
    second.openSerial(2);
    const auto call = server.call({"time"});
    EXPECT_EQ(call.exitStatus, 0) << call.errors;
    server.stop();
}

TEST(Serve, TheSessionOfAVanishedConsoleIsFreeAndItsCommandGoesOn)
{
    ServeProcess server(partition("1=echo pid=$$; cat"));
    TestConsole first(server.endpoint());
    first.openSession("a");
    first.openSerial(1);
    const pid_t pid = pidIn(first.readUntil(1, "\r\n"));
    first.reset();
    server.process().awaitErrors("console 1 disconnected");
    TestConsole second(server.endpoint());
    second.openSession("a");
    second.openSerial(1);
    second.type(1, "still there\n");
    second.readUntil(1, "still there\r\nstill there\r\n");
    EXPECT_TRUE(exists(pid));
    server.stop();
    EXPECT_FALSE(exists(pid));
}

TEST(Serve, AfterTheEndOfTheCommandTheConsoleCanOpenAgain)
{
    ServeProcess server(partition("1=echo pid=$$; read line; echo bye"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    const pid_t first = pidIn(console.readUntil(1, "\r\n"));
    console.type(1, "\n");
    console.readUntil(1, "bye\r\n");
    EXPECT_EQ(console.awaitClosed(1), 4U);
    console.openSerial(1);
    // What it has put out before comes first.
    EXPECT_EQ(pidIn(console.readUntil(1, "\r\n[qel: the command exited with status 0]\r\n")), first);
    EXPECT_NE(pidIn(console.readUntil(1, "\r\n")), first);
    server.stop();
}

TEST(Serve, ACommandThatClosesItsTerminalHasEnded)
{
    ServeProcess server(partition("1=echo pid=$$; read line; exec 0<&- 1>&- 2>&-; exec sleep 1000"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    const pid_t pid = pidIn(console.readUntil(1, "\r\n"));
    console.type(1, "\n");
    EXPECT_EQ(console.awaitClosed(1), 4U);
    server.stop();
    EXPECT_FALSE(exists(pid));
}

TEST(Serve, OutputWithoutASessionWaitsForTheNextOne)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("done");
    ServeProcess server(partition("1=stty -echo; echo ready; read line; echo meanwhile; echo > " + file + "; cat"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    console.readUntil(1, "ready\r\n");
    console.type(1, "\n");
    ASSERT_EQ(console.statusOf(QelMessageVirtualSerialCloseReq(1, 0, false)), 0U);
    ASSERT_TRUE(comesTrue([&] { return std::ifstream(file).good(); }));
    console.openSerial(1);
    console.readUntil(1, "meanwhile\r\n");
    server.stop();
}

TEST(Serve, AForcedOpenTakesTheSession)
{
    ServeProcess server(partition("1=cat"));
    TestConsole holder(server.endpoint());
    TestConsole other(server.endpoint());
    holder.openSession("a");
    holder.openSerial(1);
    other.openSession("b");
    EXPECT_EQ(other.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 19U);
    EXPECT_EQ(other.statusOf(QelMessageVirtualSerialOpenReq(1, 0, true)), 0U);
    EXPECT_EQ(holder.awaitClosed(1), 2U);
    EXPECT_EQ(other.statusOf(QelMessageVirtualSerialSetupSessionReq(1, 0)), 0U);
    other.type(1, "mine\n");
    other.readUntil(1, "mine\r\n");
    server.stop();
}

TEST(Serve, ABroadcastReachesTheOtherConsole)
{
    ServeProcess server;
    TestConsole listener(server.endpoint());
    listener.introduce("listener");
    const auto sent = server.call({"--tool-id", "speaker", "--tool-type", "9", "broadcast", "good morning"});
    EXPECT_EQ(sent.exitStatus, 0) << sent.errors;
    const auto notice = listener.messages().receive<QelMessageDaxBroadcastOutboundAsync>();
    EXPECT_EQ(notice->getSenderToolId(), "speaker");
    EXPECT_EQ(notice->getSenderToolType(), 9U);
    EXPECT_EQ(std::string(notice->getDaxPacket(), notice->getBroadcastMsgLen()), "good morning");
    server.stop();
}

TEST(Serve, NothingOfALongOutputIsLost)
{
    ServeProcess server(partition("1=stty raw -echo; echo go; read x; seq 1 200000; echo done"));
    std::string expected;
    for (int i = 1; i <= 200000; ++i)
        expected += std::to_string(i) + "\n";
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    console.readUntil(1, "go\n");
    console.type(1, "\n");
    const std::string all = console.readUntil(1, "done\n");

    EXPECT_TRUE(all == expected + "done\n"); // too long to be printed
    EXPECT_EQ(console.awaitClosed(1), 4U);
    server.stop();
}

TEST(Serve, NothingOfALongInputIsLost)
{
    ServeProcess server(partition("1=stty raw -echo; echo go; cat"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    console.readUntil(1, "go\n");
    std::string sent;
    for (int i = 0; sent.size() < 1000000; ++i)
        sent += std::to_string(i) + " ";
    std::thread typist([&] {
        for (std::size_t at = 0; at < sent.size(); at += 16000)
            console.type(1, sent.substr(at, 16000));
        console.type(1, "END");
    });
    EXPECT_TRUE(console.readUntil(1, "END") == sent + "END"); // too long to be printed
    typist.join();
    server.stop();
}

TEST(Serve, AConsoleThatDoesNotReadDelaysNoOther)
{
    ServeProcess server({"--partition", "1=yes", "--partition", "2=cat"});
    TestConsole slow(server.endpoint());
    TestConsole other(server.endpoint());
    slow.openSession("slow");
    ASSERT_EQ(slow.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 0U);
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0)); // it reads nothing from here on
    other.openSession("other");
    awaitStuck(other, "slow", 5);
    other.openSerial(2);
    for (int i = 0; i < 50; ++i) {
        const std::string line = "line " + std::to_string(i);
        other.type(2, line + "\n");
        other.readUntil(2, line + "\r\n" + line + "\r\n");
    }
    server.stop();
}

TEST(Serve, AConsoleThatFallsBehindLosesNothing)
{
    ServeProcess server({"--partition", "1=seq 1 300000; echo done", "--log-level", "warn"});
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1); // two million bytes fill every buffer while it does not read
    TestConsole other(server.endpoint());
    other.introduce("b");
    awaitStuck(other, "a", 5);
    const std::string all = console.readUntil(1, "done\r\n");
    std::string expected;
    for (int i = 1; i <= 300000; ++i)
        expected += std::to_string(i) + "\r\n";
    EXPECT_TRUE(all == expected + "done\r\n"); // too long to be printed
    server.stop();
}

class ServeStop : public ::testing::TestWithParam<int> {};

TEST_P(ServeStop, ASignalStopsItCleanly)
{
    ServeProcess server({"--partition", "1=echo pid=$$; cat", "--partition", "2=cat"});
    TestConsole console(server.endpoint());
    TestConsole other(server.endpoint());
    TestConsole silent(server.endpoint());
    server.process().awaitErrors("console 3 connected");
    console.openSession("a");
    console.openSerial(1);
    const pid_t pid = pidIn(console.readUntil(1, "\r\n"));
    ASSERT_EQ(console.statusOf(QelMessageVirtualSerialOpenReq(2, 0, false)), 0U); // open, not set up
    other.introduce("b");
    server.stop(GetParam());
    EXPECT_EQ(console.awaitClosed(1), 3U);
    EXPECT_EQ(console.awaitClosed(2), 3U);
    EXPECT_NE(console.messages().receive<QelMessageKrogConnectionClosedAsync>(), nullptr);
    EXPECT_TRUE(console.messages().isClosed());
    EXPECT_NE(other.messages().receive<QelMessageKrogConnectionClosedAsync>(), nullptr);
    EXPECT_TRUE(other.messages().isClosed());
    EXPECT_TRUE(silent.messages().isClosed());
    EXPECT_FALSE(exists(pid));
}

std::string nameOf(const ::testing::TestParamInfo<int>& info) { return info.param == SIGTERM ? "SIGTERM" : "SIGINT"; }

INSTANTIATE_TEST_SUITE_P(Signals, ServeStop, ::testing::Values(SIGTERM, SIGINT), nameOf);

TEST(Serve, SighupWithoutTlsLogsThatThereIsNothingToLoad)
{
    ServeProcess server;
    TestConsole console(server.endpoint());
    console.introduce("a");
    server.process().signal(SIGHUP);
    server.process().awaitErrors("(I): [qel] SIGHUP: connections are plain, there is nothing to load\n");
    EXPECT_EQ(console.statusOf(QelMessageGetQelTodReq()), 0U);
    TestConsole(server.endpoint()).introduce("b");
    server.stop();
}

TEST(Serve, FurtherStopSignalsChangeNothing)
{
    ServeProcess server(partition("1=trap '' HUP; echo ready; sleep 1000; sleep 1000")); // takes a second to end
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    console.readUntil(1, "ready");
    server.process().signal(SIGTERM);
    EXPECT_EQ(console.awaitClosed(1), 3U);
    server.process().signal(SIGTERM);
    server.process().signal(SIGINT);
    server.stop();
}

TEST(Serve, StopsWhileAConsoleDoesNotRead)
{
    ServeProcess server({"--partition", "1=yes", "--log-level", "info"});
    TestConsole slow(server.endpoint());
    slow.openSession("slow");
    slow.messages().send(QelMessageVirtualSerialOpenReq(1, 0, false));
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0));
    TestConsole other(server.endpoint());
    other.introduce("other");
    awaitStuck(other, "slow", 5);
    EXPECT_THAT(server.stop().errors, HasSubstr("console 1: socket stream send failure")); // it was cut
}

TEST(Serve, TheLogGoesToStandardError)
{
    ServeProcess server;
    TestConsole(server.endpoint()).introduce("a");
    const auto result = server.stop();
    EXPECT_THAT(result.errors, HasSubstr("(I): [qel] listening on " + server.endpoint() + "\n"));
    EXPECT_THAT(result.errors, HasSubstr("(I): [qel] console 1 connected from 127.0.0.1:"));
    EXPECT_THAT(result.errors, HasSubstr("(I): [qel] stopping: signal 15\n"));
    EXPECT_THAT(result.errors, Not(HasSubstr("(D): ")));
}

TEST(Serve, TheLogGoesToADirectory)
{
    const TemporaryDirectory directory;
    ServeProcess server({"--log-dir", directory.path(), "--log-level", "info"});
    TestConsole(server.endpoint()).introduce("a");
    EXPECT_THAT(server.stop().errors, IsEmpty());
    EXPECT_THAT(Utilities::readFile(directory.file("qel-serve.log")), HasSubstr("[qel] console 1 connected"));
}

TEST(Serve, TheLogLevelLimitsTheLog)
{
    ServeProcess quiet({"--log-level", "warn"});
    TestConsole(quiet.endpoint()).introduce("a");
    EXPECT_THAT(quiet.stop().errors, IsEmpty());
    ServeProcess loud({"--log-level", "debug"});
    TestConsole(loud.endpoint()).introduce("a");
    EXPECT_THAT(loud.stop().errors, HasSubstr("(D): "));
}

TEST(Serve, UnknownNoticesAreLoggedAndIgnored)
{
    ServeProcess server({"--log-level", "warn"});
    TestConsole console(server.endpoint());
    console.introduce("a");
    console.messages().send(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(console.statusOf(QelMessageGetQelTodReq()), 0U);
    EXPECT_THAT(server.stop().errors, HasSubstr("(W): [qel] console 1: ignored [CID: "));
}

TEST(ServeOptions, SeveralEndpointsArePrintedInOrderAndServed)
{
    ServeProcess server({"--listen", "[::1]:0"});
    const std::string second = server.process().readLine();
    EXPECT_THAT(server.endpoint(), StartsWith("127.0.0.1:"));
    EXPECT_THAT(second, StartsWith("[::1]:"));
    EXPECT_EQ(server.call({"time"}).exitStatus, 0);
    EXPECT_EQ(runQel({"call", "--connect", second, "--plain", "time"}).exitStatus, 0);
    server.stop();
}

TEST(ServeOptions, AMessageThatStopsEndsItsConnectionAfterTheFrameTimeout)
{
    ServeProcess server({"--frame-timeout", "0.05"});
    TestConsole console(server.endpoint());
    console.introduce("stops");
    const QelMessageGetQelTodReq request;
    console.messages().sendBytes(std::string(request.serialize(), request.msgLength() - 1));
    EXPECT_TRUE(console.messages().isClosed());
    server.process().awaitErrors("(W): [qel] console 1: closed, it did not finish a message in time\n");
    server.stop();
}

TEST(ServeOptions, TheLimitsOnHandshakesApply)
{
    ServeProcess server({"--max-handshakes", "2", "--max-handshakes-per-address", "1"});
    const TestConsole silent(server.endpoint());
    TestConsole refused(server.endpoint());
    EXPECT_TRUE(refused.messages().isClosed());
    server.process().awaitErrors(": refused: too many connections from its address are in their handshake\n");
    server.stop();
}

TEST(ServeOptions, TheLimitsAreChecked)
{
    const std::vector<std::vector<std::string>> refused{
        {"--max-handshakes", "0"}, {"--max-handshakes", "65536"}, {"--max-handshakes-per-address", "0"},
        {"--frame-timeout", "0"},  {"--frame-timeout", "86401"},  {"--keepalive", "0"},
        {"--keepalive", "32768"},  {"--listen", "localhost:0"},   {"--listen", "0.0.0.0:0"},
    };
    for (const auto& options : refused) {
        SCOPED_TRACE(options[0] + " " + options[1]);
        std::vector<std::string> command{"serve", "--listen", "127.0.0.1:0", "--plain"};
        command.insert(command.end(), options.begin(), options.end());
        EXPECT_EQ(runQel(command).exitStatus, 2);
    }
    ServeProcess accepted({"--max-handshakes", "65535", "--max-handshakes-per-address", "65535", "--frame-timeout",
                           "86400", "--keepalive", "32767"});
    accepted.stop();
}

} // namespace

} // namespace qel::test
