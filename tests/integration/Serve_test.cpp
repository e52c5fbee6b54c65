// The hypervisor end as a process, with real connections and real commands behind its partitions.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/Utilities.hpp>

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"
#include "support/TemporaryDirectory.hpp"

#include <atomic>
#include <cerrno>
#include <csignal>
#include <fstream>
#include <gmock/gmock.h>
#include <sstream>
#include <stdexcept>
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

/// Waits until a console takes nothing any more: broadcasts to it are refused, again and again.
void awaitStuck(TestConsole& other, const std::string& toolId, std::uint32_t toolType)
{
    for (int refusals = 0; refusals < 1000;) {
        const unsigned int status = other.statusOf(QelMessageDaxBroadcastReq(1, 1, toolType, toolId, "x"));
        refusals = status == 6 ? refusals + 1 : 0;
    }
}

TEST(Serve, ItPrintsTheEndpointItListensOnAndNothingElse)
{
    ServeProcess server;
    EXPECT_THAT(server.endpoint(), MatchesRegex("127\\.0\\.0\\.1:[1-9][0-9]*"));
    TestConsole console(server.endpoint());
    console.introduce("a");
    EXPECT_EQ(server.stop().output, server.endpoint() + "\n");
}

TEST(Serve, ItListensOnIPv6Loopback)
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

TEST(Serve, WhatIsTypedReachesTheShellAndItsOutputComesBack)
{
    ServeProcess server(partition("7=/bin/sh"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(7);
    console.type(7, "echo $((6 * 7))\n");
    console.readUntil(7, "42\r\n");
    server.stop();
}

TEST(Serve, SeveralConsolesHaveSessionsAtATime)
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

TEST(Serve, TwoConsolesAreServedUnlessSaidOtherwise)
{
    ServeProcess server;
    TestConsole first(server.endpoint());
    TestConsole second(server.endpoint());
    TestConsole third(server.endpoint());
    first.introduce("a");
    second.introduce("b");
    EXPECT_EQ(third.statusOf(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 1, "c")), 18U);
    EXPECT_TRUE(third.messages().isClosed());
    second.vanish();
    server.process().awaitErrors("console 2 disconnected");
    TestConsole(server.endpoint()).introduce("c");
    server.stop();
}

TEST(Serve, TheNumberOfConsolesCanBeSaid)
{
    ServeProcess server({"--max-consoles", "1"});
    TestConsole first(server.endpoint());
    first.introduce("a");
    TestConsole second(server.endpoint());
    EXPECT_EQ(second.statusOf(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 1, "b")), 18U);
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

TEST(Serve, WhenTheCommandEndsTheConsoleHearsItAndMayOpenAgain)
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

TEST(Serve, WhatACommandPutsOutWithoutASessionWaitsForTheNextOne)
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

TEST(Serve, AConsoleThatDoesNotReadHoldsUpNobodyElse)
{
    ServeProcess server({"--partition", "1=yes", "--partition", "2=cat"});
    TestConsole slow(server.endpoint());
    TestConsole other(server.endpoint());
    slow.openSession("slow");
    ASSERT_EQ(slow.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 0U);
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0)); // and nothing is read from here on
    other.openSession("other");
    awaitStuck(other, "slow", 5);
    other.openSerial(2);
    for (int i = 0; i < 50; ++i) {
        const std::string line = "line " + std::to_string(i);
        other.type(2, line + "\n");
        other.readUntil(2, line + "\r\n" + line + "\r\n");
    }
    EXPECT_EQ(server.call({"--tool-id", "third", "time"}).exitStatus, 1); // two consoles are there
    server.stop();
}

TEST(Serve, AConsoleThatFallsBehindLosesNothing)
{
    ServeProcess server({"--partition", "1=seq 1 300000; echo done", "--log-level", "warn"});
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1); // two million bytes fill every buffer while nobody reads
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

TEST(Serve, WithoutTlsThereIsNothingToLoadAgain)
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

TEST(Serve, BeingAskedToStopMoreThanOnceChangesNothing)
{
    ServeProcess server(partition("1=trap '' HUP; echo ready; sleep 1000; sleep 1000")); // takes its time to end
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

TEST(Serve, AConsoleThatDoesNotReadDoesNotKeepItFromStopping)
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

// What is known about the queues.

std::size_t count(const std::string& text, const std::string& what)
{
    std::size_t found = 0;
    for (std::size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1))
        ++found;
    return found;
}

/// Asks a server for its statistics. @return what it has logged since, with as many dumps as asked for
std::string statisticsOf(ServeProcess& server, std::size_t queues = 1)
{
    const std::size_t before = server.process().errors().size();
    server.process().signal(SIGUSR1);
    std::string text;
    const bool told = comesTrue([&] {
        text = server.process().errors().substr(before);
        return count(text, "[qel]     10+s:") == queues;
    });
    if (!told) throw std::runtime_error("no statistics: " + server.process().errors());
    // What was logged before the signal may come after it was sent.
    return text.substr(text.rfind('\n', text.find("[qel] Queue of ")) + 1);
}

/// The lines that the program itself wrote to a log, without what stands in front of them.
std::string bare(const std::string& log)
{
    std::istringstream lines(log);
    std::string texts;
    for (std::string line; std::getline(lines, line);) {
        const std::size_t head = line.find("[qel] ");
        if (head != std::string::npos) texts += line.substr(head + 6) + "\n";
    }
    return texts;
}

/// The number of bytes that a line of the statistics begins with or has in parentheses.
unsigned long bytesIn(const std::string& statistics, const std::string& label)
{
    const std::size_t line = statistics.find(label);
    if (line == std::string::npos) throw std::runtime_error("no " + label + " in " + statistics);
    const std::string text = statistics.substr(line + label.size(), statistics.find('\n', line) - line - label.size());
    const std::size_t open = text.find('(');
    return std::stoul(open == std::string::npos ? text : text.substr(open + 1));
}

/// A whole dump of a queue through which only fast messages went, and in which none waits.
const char* const kDump = "Queue of console 1, 127\\.0\\.0\\.1:[0-9]+:\n"
                          "  Limits:         131072/262144\n"
                          "  Max Size \\(HWM\\): 8[0-9] B\n"
                          "  Pending:        0 \\(0 B\\)\n"
                          "  Dropped:        0 \\(0 B\\)\n"
                          "  Completed:      1 \\(8[0-9] B\\)\n"
                          "  Throughput:     [0-9]+ m/s \\([0-9]+ B/s\\)\n"
                          "  Latency Buckets:\n"
                          "                Enqueue      Dequeue      E2E         \n"
                          "    0-1ms:      [01]            [01]            [01]           \n"
                          "    1-10ms:     [01]            [01]            [01]           \n"
                          "    10-100ms:   [01]            [01]            [01]           \n"
                          "    100-1000ms: [01]            [01]            [01]           \n"
                          "    1-10s:      0            0            0           \n"
                          "    10\\+s:       0            0            0           \n"
                          "(  Maximum Latency:\n.*)?"; // when this machine has other things to do for a while

TEST(ServeStatistics, ASignalAsksForThemAndServiceGoesOn)
{
    ServeProcess server;
    TestConsole console(server.endpoint());
    console.introduce("a");
    EXPECT_THAT(bare(statisticsOf(server)), MatchesRegex(kDump));
    EXPECT_EQ(console.statusOf(QelMessageGetQelTodReq()), 0U);
    EXPECT_THAT(bare(statisticsOf(server)), HasSubstr("\n  Completed:      2 ("));
    EXPECT_EQ(server.stop().output, server.endpoint() + "\n");
}

TEST(ServeStatistics, TheyComeAtTheEndToo)
{
    ServeProcess server;
    TestConsole console(server.endpoint());
    console.introduce("a");
    const std::string log = bare(server.stop().errors);
    EXPECT_THAT(log.substr(log.find("stopping: ")), MatchesRegex(std::string("stopping: signal 15\n") + kDump + ".*"));
}

TEST(ServeStatistics, EachQueueHasItsOwnInTheOrderOfConnecting)
{
    ServeProcess server;
    TestConsole first(server.endpoint());
    TestConsole second(server.endpoint());
    first.introduce("a");
    second.introduce("b");
    const std::string log = bare(statisticsOf(server, 2));
    EXPECT_THAT(log, MatchesRegex("Queue of console 1, .*\nQueue of console 2, .*"));
    server.stop();
}

TEST(ServeStatistics, WithoutConsolesItSaysSo)
{
    ServeProcess server;
    server.process().signal(SIGUSR1);
    server.process().awaitErrors("(I): [qel] No console is connected.\n");
    EXPECT_EQ(count(server.stop().errors, "No console is connected."), 2U); // and at the end
}

TEST(ServeStatistics, TheyBelongToTheLogAndItsLevel)
{
    const TemporaryDirectory directory;
    ServeProcess server({"--log-dir", directory.path(), "--log-level", "info"});
    TestConsole console(server.endpoint());
    console.introduce("a");
    EXPECT_THAT(server.stop().errors, IsEmpty());
    EXPECT_THAT(Utilities::readFile(directory.file("qel-serve.log")),
                HasSubstr("[qel] Queue of console 1, 127.0.0.1:"));
    ServeProcess quiet({"--log-level", "warn"});
    quiet.process().signal(SIGUSR1);
    EXPECT_THAT(quiet.stop().errors, IsEmpty());
}

TEST(ServeStatistics, AskingAgainAndAgainDisturbsNothing)
{
    ServeProcess server(partition("1=stty raw -echo; echo go; read x; seq 1 50000; echo done"));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    console.readUntil(1, "go\n");
    console.type(1, "\n");
    std::atomic<bool> stop{false};
    std::thread asker([&] {
        while (!stop) {
            server.process().signal(SIGUSR1);
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        }
    });
    std::string expected;
    for (int i = 1; i <= 50000; ++i)
        expected += std::to_string(i) + "\n";
    EXPECT_TRUE(console.readUntil(1, "done\n") == expected + "done\n"); // too long to be printed
    stop = true;
    asker.join();
    server.stop();
}

// The limits of the queues.

TEST(ServeQueue, APartitionThatPrintsWithoutEndIsHeldBack)
{
    ServeProcess server({"--partition", "1=yes"});
    TestConsole slow(server.endpoint());
    slow.openSession("slow");
    ASSERT_EQ(slow.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 0U);
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0)); // and nothing is read from here on
    constexpr unsigned long kHalf = 131072;
    std::string statistics = bare(statisticsOf(server));
    while (bytesIn(statistics, "Pending:        ") < kHalf)
        statistics = bare(statisticsOf(server));
    const std::size_t resident = server.process().residentBytes();
    for (int i = 0; i < 100; ++i)
        statistics = bare(statisticsOf(server));
    EXPECT_LE(bytesIn(statistics, "Max Size (HWM): "), kHalf + 4096 + 100);
    EXPECT_LE(server.process().residentBytes(), resident + 8UL * 1024 * 1024); // and yes(1) would go on for ever
    server.stop();
}

TEST(ServeQueue, WhatIsNoSerialDataStillFindsRoom)
{
    ServeProcess server({"--partition", "1=yes"});
    TestConsole slow(server.endpoint());
    slow.openSession("slow");
    ASSERT_EQ(slow.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 0U);
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0));
    while (bytesIn(bare(statisticsOf(server)), "Pending:        ") < 131072)
        continue;
    TestConsole other(server.endpoint());
    other.introduce("other");
    for (int i = 0; i < 10; ++i)
        EXPECT_EQ(other.statusOf(QelMessageDaxBroadcastReq(1, 1, 5, "slow", "x")), 0U);
    // And once it reads again, its requests are answered in the middle of it all.
    for (int i = 0; i < 10; ++i)
        EXPECT_EQ(slow.statusOf(QelMessageGetQelTodReq()), 0U);
    server.stop();
}

TEST(ServeQueue, AForcedOpenNeedNotWaitForAHolderThatDoesNotRead)
{
    ServeProcess server({"--partition", "1=yes"});
    TestConsole slow(server.endpoint());
    slow.openSession("slow");
    ASSERT_EQ(slow.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 0U);
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0));
    while (bytesIn(bare(statisticsOf(server)), "Pending:        ") < 131072)
        continue;
    TestConsole other(server.endpoint());
    other.openSession("other");
    ASSERT_EQ(other.statusOf(QelMessageVirtualSerialOpenReq(1, 0, true)), 0U);
    ASSERT_EQ(other.statusOf(QelMessageVirtualSerialSetupSessionReq(1, 0)), 0U);
    other.readUntil(1, "y\r\n");

    // The response to the set-up, then all of the data, then the notice.
    EXPECT_EQ(slow.messages().receive()->getOperation(), QelMessageOpSetupVirtualSerialSession);
    EXPECT_EQ(slow.awaitClosed(1), 2U);
    const QelMessageGetQelTodReq request;
    slow.messages().send(request);
    EXPECT_EQ(slow.messages().receive()->getCallerId(), request.getCallerId()); // and no data behind it
    server.stop();
}

TEST(ServeQueue, BroadcastsOverTheLimitAreDroppedAndCounted)
{
    ServeProcess server({"--partition", "1=yes", "--queue-limit", "10000"});
    TestConsole slow(server.endpoint());
    slow.openSession("slow");
    slow.messages().send(QelMessageVirtualSerialOpenReq(1, 0, false));
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0));
    TestConsole other(server.endpoint());
    other.introduce("other");
    awaitStuck(other, "slow", 5);
    EXPECT_EQ(other.statusOf(QelMessageDaxBroadcastReq(0, 1, 0, "", "x")), 0U);
    server.process().awaitErrors("(W): [qel] console 1: too slow for a broadcast of console 2\n");
    const std::string statistics = bare(statisticsOf(server, 2));
    EXPECT_THAT(statistics, HasSubstr("\n  Limits:         5000/10000\n"));
    EXPECT_GE(bytesIn(statistics, "Dropped:        "), 1001 * 75UL);
    EXPECT_GE(bytesIn(statistics, "Pending:        "), 10000UL);
    EXPECT_LT(bytesIn(statistics, "Max Size (HWM): "), 10000UL + 4096 + 100);
    server.stop();
}

TEST(ServeQueue, WithTheSmallestLimitNothingIsLost)
{
    ServeProcess server({"--partition", "1=seq 1 20000; echo done", "--queue-limit", "1"});
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    std::string expected;
    for (int i = 1; i <= 20000; ++i)
        expected += std::to_string(i) + "\r\n";
    EXPECT_TRUE(console.readUntil(1, "done\r\n") == expected + "done\r\n"); // too long to be printed
    EXPECT_EQ(console.awaitClosed(1), 4U);
    EXPECT_THAT(bare(statisticsOf(server)), HasSubstr("\n  Limits:         1/1\n"));
    server.stop();
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

TEST(Serve, TheLogLevelSaysHowMuch)
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

} // namespace

} // namespace qel::test
