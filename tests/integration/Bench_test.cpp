// "qel bench" as a process, against the real server and against one that goes away.

#include "integration/TestConsole.hpp"
#include "support/ComesTrue.hpp"
#include "support/CredentialDirectory.hpp"
#include "support/PtyProcess.hpp"

#include <chrono>
#include <csignal>
#include <functional>
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>
#include <regex>
#include <thread>

namespace qel::test {

namespace {

using nlohmann::json;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::StartsWith;

std::vector<std::string> benchCommand(const std::string& endpoint, const std::vector<std::string>& options)
{
    std::vector<std::string> command{"bench", "--connect", endpoint, "--plain"};
    command.insert(command.end(), options.begin(), options.end());
    return qelCommand(command);
}

Process::Result bench(const ServeProcess& server, const std::vector<std::string>& options)
{
    return run(benchCommand(server.endpoint(), options));
}

json parse(const Process::Result& result)
{
    EXPECT_EQ(result.exitStatus, 0) << result.errors << "signal " << result.signal;
    return json::parse(result.output);
}

/// Waits until the run begins; the log says so at Info.
void awaitStart(const Process& process) { process.awaitErrors("(I): [qel] 2 connections are open; the run begins\n"); }

std::uint64_t messagesIn(const json& histogram)
{
    std::uint64_t sum = 0;
    for (const json& row : histogram)
        sum += row["messages"].get<std::uint64_t>();
    return sum;
}

TEST(Bench, PrintsTheResult)
{
    const ServeProcess server;
    const auto result = bench(server, {"--count", "500", "--size", "100"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.errors, IsEmpty()); // a progress bar needs a terminal
    EXPECT_THAT(result.output,
                MatchesRegex("Broadcasts of 100 bytes between 1 pair of consoles of 127\\.0\\.0\\.1:[0-9]+, flat out\n"
                             "Messages:    500\n"
                             "Elapsed:     [0-9]+\\.[0-9]+ s\n"
                             "Throughput:  [0-9]+ m/s \\([0-9]+ B/s\\)\n"
                             "Latency:\n"
                             "  p50:        +[0-9]+\\.[0-9] us\n"
                             "  p90:        +[0-9]+\\.[0-9] us\n"
                             "  p99:        +[0-9]+\\.[0-9] us\n"
                             "  p99\\.9:      +[0-9]+\\.[0-9] us\n"
                             "  max:        +[0-9]+\\.[0-9] us\n"
                             "Histogram:\n"
                             "(  to [0-9]+ [um]?s +[0-9]+(  #+)?\n)+"));
}

TEST(Bench, HistogramAndCountsAddUp)
{
    ServeProcess server({"--max-consoles", "6"});
    const json document = parse(bench(server, {"--json", "--connections", "6", "--count", "1000", "--size", "16306"}));
    EXPECT_EQ(document["endpoint"], server.endpoint());
    EXPECT_EQ(document["connections"], 6);
    EXPECT_EQ(document["messageBytes"], 16306);
    EXPECT_TRUE(document["rate"].is_null());
    EXPECT_EQ(document["interrupted"], false);
    EXPECT_EQ(document["messages"], 1000);
    EXPECT_EQ(document["unsent"], 0);
    EXPECT_EQ(messagesIn(document["histogram"]), 1000U);
    const double seconds = document["seconds"];
    const double perSecond = document["messagesPerSecond"];
    EXPECT_GT(seconds, 0);
    EXPECT_NEAR(perSecond * seconds, 1000, seconds);
    const json& latency = document["latencyNanoseconds"];
    EXPECT_GT(latency["p50"], 0);
    EXPECT_LE(latency["p50"], latency["p90"]);
    EXPECT_LE(latency["p90"], latency["p99"]);
    EXPECT_LE(latency["p99"], latency["p99.9"]);
    EXPECT_LE(latency["p99.9"], latency["max"]);
    server.stop();
}

TEST(Bench, SecondsEndTheRun)
{
    const ServeProcess server;
    const json document = parse(bench(server, {"--json", "--seconds", "0.2"}));
    EXPECT_GE(document["seconds"], 0.2);
    EXPECT_GT(document["messages"], 0);
}

TEST(Bench, RateLimitsTheMessages)
{
    const ServeProcess server;
    const json document = parse(bench(server, {"--json", "--rate", "100", "--count", "21"}));
    EXPECT_EQ(document["rate"], 100);
    EXPECT_EQ(document["messages"], 21);
    EXPECT_GE(document["seconds"], 0.2); // the last one is due after 0.2 s
}

TEST(Bench, MessagesThatTheServerIsTooSlowForAreUnsent)
{
    const ServeProcess server;
    const json document = parse(bench(server, {"--json", "--rate", "1000000", "--seconds", "0.1"}));
    EXPECT_GT(document["unsent"], 0);
    EXPECT_EQ(document["messages"].get<int>() + document["unsent"].get<int>(), 100000);
}

TEST(Bench, LeavesNoConsoleBehind)
{
    const ServeProcess server({"--max-consoles", "2"});
    for (int i = 0; i < 5; ++i) // all places are taken each time
        EXPECT_EQ(bench(server, {"--count", "1", "--tool-id", "always the same"}).exitStatus, 0);
    EXPECT_EQ(server.call({"get-metadata"}).output, "Metadata: \n");
}

TEST(Bench, OtherConsolesReceiveNothing)
{
    ServeProcess server({"--max-consoles", "3"});
    TestConsole other(server.endpoint());
    other.introduce("other");
    EXPECT_EQ(bench(server, {"--count", "10"}).exitStatus, 0);
    const QelMessageGetQelTodReq request;
    other.messages().send(request);
    EXPECT_EQ(other.messages().receive()->getCallerId(), request.getCallerId()); // nothing came before
    server.stop();
}

TEST(Bench, TheServersQueuesCountTheMessages)
{
    ServeProcess server;
    Process process(benchCommand(server.endpoint(), {"--rate", "20", "--seconds", "60", "--log-level", "info"}));
    awaitStart(process);
    const std::regex many("Completed:      [0-9][0-9]+ ");
    EXPECT_TRUE(comesTrue([&] {
        server.process().signal(SIGUSR1);
        return std::regex_search(server.process().errors(), many);
    }));
    process.signal(SIGINT);
    EXPECT_EQ(process.wait().exitStatus, 0);
    server.stop();
}

// Over TLS.

class BenchTls : public ::testing::Test {
protected:
    Process::Result bench(const ServeProcess& server, const std::vector<std::string>& options) const
    {
        std::vector<std::string> command{"bench", "--connect", server.endpoint()};
        const auto transport = directory.options("client");
        command.insert(command.end(), transport.begin(), transport.end());
        command.insert(command.end(), options.begin(), options.end());
        return runQel(command);
    }

    CredentialDirectory directory;
};

TEST_F(BenchTls, WorksOverTls)
{
    ServeProcess server({"--max-consoles", "4"}, "127.0.0.1:0", directory.options("server"));
    const json document = parse(bench(server, {"--json", "--connections", "4", "--count", "200", "--size", "16306"}));
    EXPECT_EQ(document["messages"], 200);
    EXPECT_EQ(messagesIn(document["histogram"]), 200U);
    EXPECT_THAT(server.stop().errors, HasSubstr(": over TLS: \"CN=client\""));
}

TEST_F(BenchTls, MoreConnectionsThanTheServerTakesAreRefused)
{
    const ServeProcess server({"--max-consoles", "3"}, "127.0.0.1:0", directory.options("server"));
    const auto result = bench(server, {"--connections", "4", "--count", "1"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.output, "");
    EXPECT_THAT(result.errors, HasSubstr("qel: connection 4 of 4: no protected connection to "));
    EXPECT_THAT(result.errors, HasSubstr(": it admits no more consoles, is stopping, or does not use TLS"));
}

// Ending early.

class BenchStop : public ::testing::TestWithParam<int> {};

TEST_P(BenchStop, ASignalEndsTheRunWithTheResultSoFar)
{
    ServeProcess server;
    Process process(benchCommand(server.endpoint(), {"--json", "--seconds", "600", "--log-level", "info"}));
    awaitStart(process);
    process.signal(GetParam());
    const json document = parse(process.wait());
    EXPECT_EQ(document["interrupted"], true);
    EXPECT_LT(document["seconds"], 60);
    EXPECT_EQ(messagesIn(document["histogram"]), document["messages"]);
    server.stop();
}

INSTANTIATE_TEST_SUITE_P(Signals, BenchStop, ::testing::Values(SIGINT, SIGTERM, SIGHUP));

TEST(BenchEnd, ASignalDoesNotWaitForTheNextMessage)
{
    ServeProcess server;
    Process process(
        benchCommand(server.endpoint(), {"--json", "--rate", "0.1", "--seconds", "600", "--log-level", "info"}));
    awaitStart(process);
    process.signal(SIGINT);
    EXPECT_LE(parse(process.wait())["messages"], 1);
    server.stop();
}

TEST(BenchEnd, ASignalEndsTheRunWithoutAResponse)
{
    ServeProcess server;
    Process process(
        benchCommand(server.endpoint(), {"--json", "--seconds", "600", "--timeout", "600", "--log-level", "info"}));
    awaitStart(process);
    server.process().signal(SIGSTOP);
    process.signal(SIGINT);
    const json document = parse(process.wait());
    EXPECT_EQ(document["interrupted"], true);
    EXPECT_EQ(messagesIn(document["histogram"]), document["messages"]);
    server.process().signal(SIGCONT);
    server.stop();
}

TEST(BenchProgress, ATerminalShowsAProgressBar)
{
    const ServeProcess server;
    PtyProcess process(benchCommand(server.endpoint(), {"--seconds", "1.5"}));
    process.await("\r\x1B[K[#");
    process.await(" a second");
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THAT(result.screen, HasSubstr(" a second\r\x1B[KBroadcasts of ")); // gone before the figures come
}

// Refusals and failures.

TEST(BenchFaults, MoreConnectionsThanTheServerTakesAreRefused)
{
    const ServeProcess server({"--max-consoles", "3"});
    const auto result = bench(server, {"--connections", "4", "--count", "1"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.output, "");
    EXPECT_EQ(
        result.errors,
        "qel: connection 4 of 4: the server takes no more consoles, or its rules do not let this certificate in; its "
        "log says which: 0x00000012 (QelMessageStatusTooManyConnections)\n");
}

TEST(BenchFaults, AToolIdInUseIsRefused)
{
    ServeProcess server;
    TestConsole other(server.endpoint());
    other.introduce("mine-2", 1);
    const auto result = bench(server, {"--tool-id", "mine", "--count", "1"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.errors,
              "qel: connection 2 of 2: a console with this tool type and id is connected already; choose another "
              "--tool-id: 0x00000025 (QelMessageStatusDaxAlreadyConnected)\n");
    server.stop();
}

TEST(BenchFaults, ARefusedConnectionIsExitStatusThree)
{
    std::string endpoint;
    {
        const Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        endpoint = listener.getSocketName().str();
    }
    const auto result = run(benchCommand(endpoint, {"--count", "1"}));
    EXPECT_EQ(result.exitStatus, 3);
    EXPECT_THAT(result.errors, StartsWith("qel: cannot connect to " + endpoint + ": "));
}

TEST(BenchFaults, AServerShutdownIsExitStatusSeven)
{
    ServeProcess server;
    Process process(benchCommand(server.endpoint(), {"--seconds", "600", "--log-level", "info"}));
    awaitStart(process);
    server.stop();
    const auto result = process.wait();
    EXPECT_EQ(result.exitStatus, 7);
    EXPECT_THAT(result.output, IsEmpty());
    EXPECT_THAT(result.errors, Not(IsEmpty()));
}

TEST(BenchFaults, AServerThatDoesNotAnswerIsExitStatusSix)
{
    ServeProcess server;
    Process process(benchCommand(server.endpoint(), {"--seconds", "600", "--timeout", "2", "--log-level", "info"}));
    awaitStart(process);
    server.process().signal(SIGSTOP);
    EXPECT_EQ(process.wait().exitStatus, 6);
    server.process().signal(SIGCONT);
    server.stop();
}

TEST(BenchFaults, OutputThatCannotBeWrittenIsAFailure)
{
    const ServeProcess server;
    const auto result = run({"/bin/sh", "-c", "exec \"$0\" bench --connect \"$1\" --plain --count 1 > /dev/full",
                             QEL_PROGRAM, server.endpoint()});
    EXPECT_EQ(result.exitStatus, 4);
    EXPECT_EQ(result.errors, "qel: cannot write to standard output\n");
}

} // namespace

} // namespace qel::test
