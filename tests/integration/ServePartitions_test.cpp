// How partitions are served while no console looks: output, starts and restarts, and what sessions leave behind.

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"
#include "support/TemporaryDirectory.hpp"

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <sstream>

namespace qel::test {

namespace {

using ::testing::EndsWith;

std::vector<std::string> partition(const std::string& command, std::vector<std::string> more = {})
{
    more.insert(more.end(), {"--partition", "1=" + command});
    return more;
}

std::string contentsOf(const std::string& file)
{
    std::ostringstream text;
    text << std::ifstream(file).rdbuf();
    return text.str();
}

TEST(ServePartitions, ACommandThatNobodyWatchesRunsToItsEndAndTheNextConsoleReadsItsLastWords)
{
    const TemporaryDirectory directory;
    const std::string done = directory.file("done");
    const std::string command = "stty -onlcr; read line; seq 1 100000; echo >" + done + "; exit 3";
    ServeProcess server(partition(command, {"--replay", "20000"}));
    {
        TestConsole console(server.endpoint());
        console.openSession("a");
        console.openSerial(1);
        console.type(1, "\n");
        ASSERT_EQ(console.statusOf(QelMessageVirtualSerialCloseReq(1, 0, false)), 0U);
    }
    ASSERT_TRUE(comesTrue([&] { return !contentsOf(done).empty(); })); // it did not stall on its terminal
    server.process().awaitErrors("partition 1: the command exited with status 3, with no session open");
    TestConsole console(server.endpoint());
    console.openSession("b");
    console.openSerial(1);
    const std::string end = "\n99999\n100000\n\r\n[qel: the command exited with status 3]\r\n";
    const std::string replay = console.readUntil(1, end);
    EXPECT_EQ(replay.size(), 20000U);
    server.stop();
}

TEST(ServePartitions, WithWhenUnattendedWaitACommandWaitsForAConsole)
{
    const TemporaryDirectory directory;
    const std::string done = directory.file("done");
    const std::string command = "stty -onlcr -echo; read line; seq 1 100000; echo >" + done + "; exit 3";
    ServeProcess server(partition(command, {"--when-unattended", "wait", "--replay", "0"}));
    TestConsole console(server.endpoint());
    console.openSession("a");
    console.openSerial(1);
    console.type(1, "\n");
    ASSERT_EQ(console.statusOf(QelMessageVirtualSerialCloseReq(1, 0, false)), 0U);
    static_cast<void>(console.statusOf(QelMessageGetQelTodReq()));
    EXPECT_EQ(contentsOf(done), "");
    console.openSerial(1);
    EXPECT_THAT(console.readUntil(1, "\n100000\n"), EndsWith("\n99999\n100000\n"));
    ASSERT_TRUE(comesTrue([&] { return !contentsOf(done).empty(); }));
    server.stop();
}

TEST(ServePartitions, StartBootStartsCommandsWithoutAConsole)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("started");
    ServeProcess server(partition("echo >" + file + "; cat", {"--start", "boot"}));
    EXPECT_TRUE(comesTrue([&] { return !contentsOf(file).empty(); }));
    server.stop();
}

TEST(ServePartitions, RestartFailureStartsAFailedCommandAgainUntilItSucceeds)
{
    const TemporaryDirectory directory;
    const std::string file = directory.file("runs");
    const std::string command = "echo run >>" + file + "; [ $(wc -l <" + file + ") = 2 ]";
    ServeProcess server(partition(command, {"--start", "boot", "--restart", "failure"}));
    server.process().awaitErrors("partition 1: the command exited with status 1");
    server.process().awaitErrors("partition 1: the command exited with status 0");
    EXPECT_EQ(contentsOf(file), "run\nrun\n");
    server.stop();
}

TEST(ServePartitions, LineLogHasTheBytesAndTheLinesOfEachPartition)
{
    const TemporaryDirectory directory;
    ServeProcess server({"--start", "boot", "--line-log", directory.path(), "--partition",
                         "1=stty -onlcr; printf '\\033[1mhello\\033[m\\n'; exit 3", "--partition", "2=cat"});
    const auto text = [&] { return contentsOf(directory.file("partition-1.log")); };
    ASSERT_TRUE(comesTrue([&] { return text().find("exited with status 3]\n") != std::string::npos; }));
    EXPECT_EQ(contentsOf(directory.file("partition-1.raw")), "\x1B[1mhello\x1B[m\n");
    const std::string time = "2[0-9]{3}-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}\\.[0-9]{3}Z ";
    EXPECT_THAT(text(), ::testing::MatchesRegex(time + "\\[qel: the log begins]\n" + time + "hello\n" + time +
                                                "\\[qel: the command exited with status 3]\n"));
    server.process().signal(SIGHUP);
    ASSERT_TRUE(comesTrue([&] { return text().empty(); }));
    EXPECT_EQ(contentsOf(directory.file("partition-1.raw.1")), "\x1B[1mhello\x1B[m\n");
    server.stop();
    EXPECT_THAT(text(), ::testing::MatchesRegex(time + "\\[qel: the log ends]\n"));
}

TEST(ServePartitions, ALineLogThatCannotBeWrittenEndsTheStart)
{
    const TemporaryDirectory directory;
    std::filesystem::create_directory(directory.file("partition-1.raw"));
    const auto result = runQel({"serve", "--plain", "--line-log", directory.path(), "--partition", "1=cat"});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_THAT(result.errors, ::testing::HasSubstr("qel: cannot write the line log " +
                                                    directory.file("partition-1.raw") + ": 21 (Is a directory)\n"));
}

// What sessions and partitions cost.

std::size_t entriesOf(const std::string& directory)
{
    const auto begin = std::filesystem::directory_iterator(directory);
    return static_cast<std::size_t>(std::distance(begin, std::filesystem::directory_iterator()));
}

/// Whether the resident memory of a process is its own: a sanitizer adds much.
#ifdef QEL_SANITIZES
constexpr bool kMeasuresMemory = false;
#else
constexpr bool kMeasuresMemory = true;
#endif

struct Held {
    std::size_t descriptors;
    std::string children;
    std::size_t residentKiB;
};

Held heldBy(ServeProcess& server)
{
    const std::string process = "/proc/" + std::to_string(server.process().pid());
    Held held{entriesOf(process + "/fd"), {}, 0};
    for (const auto& task : std::filesystem::directory_iterator(process + "/task"))
        held.children += contentsOf(task.path().string() + "/children");
    std::istringstream status(contentsOf(process + "/status"));
    for (std::string word; status >> word;) {
        if (word == "VmRSS:") status >> held.residentKiB;
    }
    return held;
}

/// Opens, sets up and closes sessions, each with a command of its own.
void runSessions(TestConsole& console, int count)
{
    for (int session = 0; session < count; ++session) {
        console.openSerial(1);
        console.type(1, "\n");
        EXPECT_EQ(console.awaitClosed(1), 4U);
    }
}

TEST(ServePartitions, AThousandSessionsLeaveNothingBehind)
{
    constexpr std::size_t kMostKiB = 2048; // allocators keep a little; a leak of 4 KiB a session would be twice that
    ServeProcess server({"--partition", "1=read line", "--partition", "2=cat"});
    TestConsole console(server.endpoint());
    console.openSession("a");
    runSessions(console, 50); // commands that come and go
    Held before{};
    ASSERT_TRUE(comesTrue([&] {
        before = heldBy(server);
        return before.children.empty();
    }));
    for (int session = 0; session < 1000; ++session) { // sessions of one command
        ASSERT_EQ(console.statusOf(QelMessageVirtualSerialOpenReq(2, 0, false)), 0U);
        ASSERT_EQ(console.statusOf(QelMessageVirtualSerialSetupSessionReq(2, 0)), 0U);
        ASSERT_EQ(console.statusOf(QelMessageVirtualSerialCloseReq(2, 0, false)), 0U);
    }
    runSessions(console, 50);
    Held after{};
    EXPECT_TRUE(comesTrue([&] { // the last command is reaped a moment after its end
        after = heldBy(server);
        return after.descriptors == before.descriptors + 1 && // the terminal of partition 2
               std::count(after.children.begin(), after.children.end(), ' ') == 1;
    })) << after.descriptors
        << " descriptors; children: " << after.children;
    if (kMeasuresMemory) {
        EXPECT_LE(after.residentKiB, before.residentKiB + kMostKiB);
    }
    server.stop();
}

TEST(ServePartitions, AnIdlePartitionTakesAtMost80KiB)
{
    if (!kMeasuresMemory) GTEST_SKIP() << "this build has a sanitizer, which takes memory of its own";
    constexpr std::size_t kMore = 63;
    const auto serve = [](std::size_t count) {
        std::vector<std::string> options{"--start", "boot"};
        for (std::size_t id = 1; id <= count; ++id)
            options.insert(options.end(), {"--partition", std::to_string(id) + "=exec cat"});
        ServeProcess server(options);
        Held held{};
        EXPECT_TRUE(comesTrue([&] {
            held = heldBy(server);
            return std::count(held.children.begin(), held.children.end(), ' ') == static_cast<std::ptrdiff_t>(count);
        }));
        server.stop();
        return held.residentKiB;
    };
    const std::size_t one = serve(1);
    const std::size_t many = serve(1 + kMore);
    RecordProperty("kib_for_each_partition", std::to_string((many - std::min(one, many)) / kMore));
    EXPECT_LE(many, one + 80 * kMore);
}

} // namespace

} // namespace qel::test
