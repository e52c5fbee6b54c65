// The queues of "qel serve": their limits and their statistics.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/Utilities.hpp>

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"
#include "support/TemporaryDirectory.hpp"

#include <atomic>
#include <csignal>
#include <gmock/gmock.h>
#include <sstream>
#include <stdexcept>
#include <thread>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;

std::size_t count(const std::string& text, const std::string& what)
{
    std::size_t found = 0;
    for (std::size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1))
        ++found;
    return found;
}

/// Asks a server for its statistics. @return what it has logged since, with the dumps of so many queues
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
    // Lines logged before the signal may arrive after it was sent.
    return text.substr(text.rfind('\n', text.find("[qel] Queue of ")) + 1);
}

/// The program's own lines of a log, without the time, ids and level at their beginning.
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

/// The number after a label of the statistics, or the one in parentheses if there is one.
unsigned long bytesIn(const std::string& statistics, const std::string& label)
{
    const std::size_t line = statistics.find(label);
    if (line == std::string::npos) throw std::runtime_error("no " + label + " in " + statistics);
    const std::string text = statistics.substr(line + label.size(), statistics.find('\n', line) - line - label.size());
    const std::size_t open = text.find('(');
    return std::stoul(open == std::string::npos ? text : text.substr(open + 1));
}

/// A whole dump of an empty queue through which one message has passed.
const char* const kDump = "Queue of console 1, 127\\.0\\.0\\.1:[0-9]+:\n"
                          "  In Front:       0 \\(0 B\\)\n"
                          "  Waited:         0, at most 0 us\n"
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
                          "(  Maximum Latency:\n.*)?"; // on a busy machine

TEST(ServeStatistics, Sigusr1LogsThemAndServiceGoesOn)
{
    ServeProcess server;
    TestConsole console(server.endpoint());
    console.introduce("a");
    EXPECT_THAT(bare(statisticsOf(server)), MatchesRegex(kDump));
    EXPECT_EQ(console.statusOf(QelMessageGetQelTodReq()), 0U);
    EXPECT_THAT(bare(statisticsOf(server)), HasSubstr("\n  Completed:      2 ("));
    EXPECT_EQ(server.stop().output, server.endpoint() + "\n");
}

TEST(ServeStatistics, AreLoggedAtTheEnd)
{
    ServeProcess server;
    TestConsole console(server.endpoint());
    console.introduce("a");
    const std::string log = bare(server.stop().errors);
    EXPECT_THAT(log.substr(log.find("stopping: ")), MatchesRegex(std::string("stopping: signal 15\n") + kDump + ".*"));
}

TEST(ServeStatistics, ListsTheQueuesInOrderOfConnecting)
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

TEST(ServeStatistics, SaysThatNoConsoleIsConnected)
{
    ServeProcess server;
    server.process().signal(SIGUSR1);
    server.process().awaitErrors("(I): [qel] No console is connected.\n");
    EXPECT_EQ(count(server.stop().errors, "No console is connected."), 2U); // and at the end
}

TEST(ServeStatistics, FollowTheLogDirectoryAndTheLogLevel)
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

TEST(ServeStatistics, RepeatedRequestsDoNotDisturbService)
{
    ServeProcess server({"--partition", "1=stty raw -echo; echo go; read x; seq 1 50000; echo done"});
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
    slow.messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0)); // it reads nothing from here on
    constexpr unsigned long kHalf = 131072;
    std::string statistics = bare(statisticsOf(server));
    while (bytesIn(statistics, "Pending:        ") < kHalf)
        statistics = bare(statisticsOf(server));
    const std::size_t resident = server.process().residentBytes();
    for (int i = 0; i < 100; ++i)
        statistics = bare(statisticsOf(server));
    EXPECT_LE(bytesIn(statistics, "Max Size (HWM): "), kHalf + 4096 + 100);
    EXPECT_LE(server.process().residentBytes(), resident + 8UL * 1024 * 1024); // yes(1) prints without end
    server.stop();
}

TEST(ServeQueue, OtherMessagesFindRoomBesideSerialData)
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
    // Once it reads again, its requests are answered among the serial data.
    for (int i = 0; i < 10; ++i)
        EXPECT_EQ(slow.statusOf(QelMessageGetQelTodReq()), 0U);
    server.stop();
}

TEST(ServeQueue, AForcedOpenDoesNotWaitForAHolderThatDoesNotRead)
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
    EXPECT_EQ(slow.messages().receive()->getCallerId(), request.getCallerId()); // and no data after it
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

} // namespace

} // namespace qel::test
