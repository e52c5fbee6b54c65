// "qel serve" under faults: malformed frames, consoles that vanish, no descriptors.

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"

#include <algorithm>
#include <filesystem>
#include <gmock/gmock.h>
#include <random>
#include <sstream>
#include <sys/resource.h>
#include <thread>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

std::size_t count(const std::string& text, const std::string& part)
{
    std::size_t found = 0;
    for (std::size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1))
        ++found;
    return found;
}

/// The same of lines, with those that the log counts instead of repeating them.
std::size_t told(const std::string& log, const std::string& part)
{
    const std::string sum = " more lines like this one: ";
    std::size_t found = 0;
    std::istringstream lines(log);
    for (std::string line; std::getline(lines, line);) {
        if (line.find(part) == std::string::npos) continue;
        const std::size_t end = line.find(sum);
        found += end == std::string::npos ? 1 : std::stoul(line.substr(line.rfind(' ', end - 1) + 1));
    }
    return found;
}

/// Lowers the descriptor limit of a process until release() or destruction.
class DescriptorLimit {
public:
    DescriptorLimit(pid_t pid, std::size_t descriptors) : mPid(pid)
    {
        ::prlimit(mPid, RLIMIT_NOFILE, nullptr, &mBefore);
        rlimit low = mBefore;
        low.rlim_cur = descriptors;
        if (::prlimit(mPid, RLIMIT_NOFILE, &low, nullptr) != 0) throw std::runtime_error("prlimit");
    }
    ~DescriptorLimit() { release(); }
    void release() { ::prlimit(mPid, RLIMIT_NOFILE, &mBefore, nullptr); }
    DescriptorLimit(const DescriptorLimit&) = delete;
    DescriptorLimit& operator=(const DescriptorLimit&) = delete;

private:
    pid_t mPid;
    rlimit mBefore{};
};

/// @return the limit under which the server can open exactly `more` descriptors
std::size_t descriptorsFor(ServeProcess& server, std::size_t more)
{
    const std::string directory = "/proc/" + std::to_string(server.process().pid()) + "/fd/";
    std::size_t limit = 0;
    for (std::size_t free = 0;; ++limit) {
        if (std::filesystem::is_symlink(directory + std::to_string(limit))) continue;
        if (free == more) return limit;
        ++free;
    }
}

TEST(ServeFaults, GarbageEndsItsOwnConnectionOnly)
{
    ServeProcess server({"--log-level", "warn", "--partition", "1=cat"});
    TestConsole good(server.endpoint());
    good.openSession("good");
    good.openSerial(1);
    std::mt19937 random(4711);
    for (int round = 0; round < 50; ++round) {
        SCOPED_TRACE(round);
        TestConsole bad(server.endpoint());
        std::string garbage(8 + random() % 200, '\0');
        std::generate(garbage.begin(), garbage.end(), [&] { return static_cast<char>(random()); });
        garbage[4] = '\x01'; // a length above the maximum, so that the server does not wait for more
        bad.messages().sendBytes(garbage);
        EXPECT_TRUE(bad.messages().isClosed());
        const std::string line = "round " + std::to_string(round);
        good.type(1, line + "\n");
        good.readUntil(1, line + "\r\n" + line + "\r\n");
    }
    const auto result = server.stop();
    EXPECT_EQ(told(result.errors, "closed for a malformed frame: Invalid length"), 50U);
    EXPECT_LT(count(result.errors, "closed for a malformed frame: Invalid length"), 50U); // they do not fill the log
}

TEST(ServeFaults, SurvivesPeersThatDoWrong)
{
    ServeProcess server({"--log-level", "critical", "--partition", "1=cat"});
    const auto result = runQel({"check", "server", "--connect", server.endpoint(), "--plain", "--partition", "1",
                                "--level", "robust", "--timeout", "20"});
    EXPECT_EQ(result.exitStatus, 0) << result.output;
    EXPECT_THAT(result.output, HasSubstr("ok       robust/every-byte/cut\n"));
    EXPECT_THAT(result.output, HasSubstr("ok       robust/every-byte/corrupt\n"));
    server.stop();
}

TEST(ServeFaults, VanishedConsolesLeakNothing)
{
    ServeProcess server({"--max-consoles", "200", "--partition", "1=cat", "--log-level", "critical"});
    const std::size_t threads = server.threads();
    const std::size_t descriptors = server.process().descriptors() + 1; // and the terminal of the command
    // A connection is closed a moment after its threads have ended.
    const auto quiet = [&] { return server.threads() == threads && server.process().descriptors() == descriptors; };
    {
        TestConsole first(server.endpoint());
        first.openSession("first");
        first.openSerial(1); // so that the command runs before and after
    }
    ASSERT_TRUE(comesTrue(quiet));
    for (int round = 0; round < 20; ++round) {
        std::vector<std::unique_ptr<TestConsole>> consoles;
        for (int i = 0; i < 5; ++i) {
            consoles.push_back(std::make_unique<TestConsole>(server.endpoint()));
            if (i > 0) consoles.back()->openSession(std::to_string(round) + "/" + std::to_string(i));
        }
        ASSERT_TRUE(comesTrue([&] {
            return consoles[1]->statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)) == 0; // the session is free again
        }));
        consoles[1]->messages().send(QelMessageVirtualSerialSetupSessionReq(1, 0));
        consoles[2]->messages().sendBytes("\xDE\xCA\xFF");
        for (std::size_t i = 0; i < consoles.size(); ++i) {
            if (i % 2 == 0) {
                consoles[i]->reset();
            } else {
                consoles[i]->vanish();
            }
        }
    }
    EXPECT_TRUE(comesTrue(quiet));
    EXPECT_EQ(server.process().children(), 1U); // the command goes on
    server.stop();
}

TEST(ServeFaults, EndedCommandsLeakNothing)
{
    ServeProcess server({"--partition", "1=exit 0", "--log-level", "critical"});
    TestConsole console(server.endpoint());
    console.openSession("a");
    const std::size_t before = server.process().descriptors();
    for (int round = 0; round < 30; ++round) {
        console.openSerial(1);
        ASSERT_EQ(console.awaitClosed(1), 4U);
    }
    // The notice goes out before the terminal is closed.
    EXPECT_TRUE(comesTrue([&] { return server.process().descriptors() == before; }));
    EXPECT_TRUE(comesTrue([&] { return server.process().children() == 0; }));
    server.stop();
}

/// Servers that run out of descriptors.
class ServeDescriptors : public ::testing::Test {
protected:
    void SetUp() override
    {
#ifdef QEL_SANITIZES_UNDEFINED
        GTEST_SKIP() << "the sanitizer needs descriptors for its check of object types and sees errors without them";
#endif
    }
};

TEST_F(ServeDescriptors, NewConnectionsWaitForDescriptorsWhileOthersContinue)
{
    ServeProcess server({"--log-level", "warn", "--partition", "1=cat"});
    TestConsole present(server.endpoint());
    present.openSession("present");
    present.openSerial(1);
    DescriptorLimit limit(server.process().pid(), descriptorsFor(server, 0));
    TestConsole late(server.endpoint()); // the system completes the connection, the server cannot take it
    late.messages().send(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 1, "late"));
    server.process().awaitErrors("(E): [qel] cannot accept a connection: 24 (Too many open files)");
    present.type(1, "still served\n");
    present.readUntil(1, "still served\r\nstill served\r\n");
    // It tries at most once a second.
    const auto begin = std::chrono::steady_clock::now();
    ASSERT_TRUE(comesTrue([&] { return count(server.process().errors(), "cannot accept") >= 2; }));
    const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() - begin);
    EXPECT_LE(count(server.process().errors(), "cannot accept"), static_cast<std::size_t>(seconds.count()) + 3);

    limit.release();
    EXPECT_EQ(late.messages().receive()->getStatus(), 0U);
    server.stop();
}

TEST_F(ServeDescriptors, AClosedConnectionLetsAWaitingOneIn)
{
    ServeProcess server({"--log-level", "warn"});
    auto present = std::make_unique<TestConsole>(server.endpoint());
    present->introduce("present");
    const DescriptorLimit limit(server.process().pid(), descriptorsFor(server, 0));
    TestConsole late(server.endpoint());
    late.messages().send(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 1, "late"));
    server.process().awaitErrors("cannot accept a connection");
    present.reset();
    EXPECT_EQ(late.messages().receive()->getStatus(), 0U);
    server.stop();
}

TEST_F(ServeDescriptors, AConnectionThatCannotBeServedIsClosed)
{
    ServeProcess server({"--log-level", "warn"});
    DescriptorLimit limit(server.process().pid(), descriptorsFor(server, 1)); // the socket, but no wake-up
    TestConsole unlucky(server.endpoint());
    EXPECT_TRUE(unlucky.messages().isClosed());
    server.process().awaitErrors("cannot accept a connection: cannot open a wake-up: 24 (Too many open files)");
    limit.release();
    TestConsole(server.endpoint()).introduce("lucky");
    server.stop();
}

TEST_F(ServeDescriptors, APartitionThatCannotStartRefusesTheOpenRequest)
{
    ServeProcess server({"--log-level", "error", "--partition", "1=echo hello; cat"});
    TestConsole console(server.endpoint());
    console.openSession("a");
    {
        const DescriptorLimit limit(server.process().pid(), descriptorsFor(server, 0));
        EXPECT_EQ(console.statusOf(QelMessageVirtualSerialOpenReq(1, 0, false)), 6U);
    }
    console.openSerial(1);
    console.readUntil(1, "hello");
    EXPECT_THAT(server.stop().errors,
                HasSubstr("partition 1: cannot open a pseudo-terminal: 24 (Too many open files)"));
}

TEST(ServeFaults, ASilentConsoleIsClosed)
{
    ServeProcess server({"--handshake-timeout", "0.05", "--log-level", "warn"});
    TestConsole silent(server.endpoint());
    EXPECT_TRUE(silent.messages().isClosed());
    EXPECT_THAT(server.stop().errors, HasSubstr("console 1: closed, it did not introduce itself in time"));
}

TEST(ServeFaults, ManyConnectionsAtOnceAreServed)
{
    ServeProcess server({"--max-consoles", "60", "--log-level", "warn"});
    std::vector<std::unique_ptr<TestConsole>> consoles;
    for (int i = 0; i < 50; ++i) {
        consoles.push_back(std::make_unique<TestConsole>(server.endpoint()));
        consoles.back()->messages().send(
            QelMessageGetEnclTypeAndInterfaceVersionReq(1, 1, 1, 1, "console " + std::to_string(i)));
    }
    for (const auto& console : consoles)
        EXPECT_EQ(console->messages().receive()->getStatus(), 0U);
    for (const auto& console : consoles)
        EXPECT_EQ(console->statusOf(QelMessageGetQelTodReq()), 0U);
    server.stop();
}

TEST(ServeFaults, AnEndpointInUseIsRefused)
{
    ServeProcess server;
    const auto second = runQel({"serve", "--plain", "--listen", server.endpoint()});
    EXPECT_EQ(second.exitStatus, 3);
    EXPECT_THAT(second.errors, HasSubstr("qel: cannot listen on " + server.endpoint() +
                                         ": socket bind failed: 98 (Address already in use)\n"));
    EXPECT_EQ(second.output, "");
    server.stop();
}

TEST(ServeFaults, ExitsWhenItCannotPrintItsEndpoint)
{
    const auto result = run({"/bin/sh", "-c", "exec \"$0\" serve --plain > /dev/full", QEL_PROGRAM});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_THAT(result.errors, HasSubstr("qel: cannot write to standard output\n"));
}

TEST(ServeFaults, AClosedLogPipeDoesNotEndTheServer)
{
    // Standard error is a pipe whose reader ends at once; standard output is that of the test.
    Process shell(
        {"/bin/sh", "-c",
         "exec 3>&1; sh -c 'echo $$ >&3; exec \"$0\" serve --plain --max-consoles 2 --log-level debug >&3 3>&-' "
         "\"$0\" 2>&1 | true",
         QEL_PROGRAM});
    const pid_t server = std::stoi(shell.readLine());
    const std::string endpoint = shell.readLine();
    for (int i = 0; i < 5; ++i) {
        TestConsole console(endpoint);
        console.introduce(std::to_string(i));
        EXPECT_EQ(console.statusOf(QelMessageGetQelTodReq()), 0U);
        if (i == 4) break;
        console.reset();
        // The next round needs a free place: wait for it with a call.
        ASSERT_TRUE(comesTrue([&] {
            const auto call = runQel(
                {"call", "--connect", endpoint, "--plain", "--tool-id", std::to_string(i), "--tool-type", "5", "time"});
            return call.exitStatus == 0;
        }));
    }
    ::kill(server, SIGTERM);
    EXPECT_EQ(shell.wait().exitStatus, 0);
}

} // namespace

} // namespace qel::test
