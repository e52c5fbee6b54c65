#include "bench/BenchCommand.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/ProgressBar.hpp"
#include "base/SignalWatch.hpp"
#include "bench/BenchReport.hpp"
#include "bench/BenchRun.hpp"
#include "client/CallRequests.hpp"
#include "client/ConnectOptions.hpp"

#include <algorithm>
#include <csignal>
#include <initializer_list>
#include <iostream>
#include <memory>
#include <string>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

constexpr unsigned int kMaxConnections = 254; // a server takes at most 255 consoles
constexpr std::size_t kMaxToolId = 28;        // of 32: a dash and the connection number follow
constexpr double kMaxRate = 1e6;
constexpr std::uint64_t kMaxMessages = 1'000'000'000'000;
constexpr double kDefaultSeconds = 10;
constexpr double kMaxSeconds = 7 * 24 * 60 * 60;

constexpr std::initializer_list<int> kStopSignals{SIGINT, SIGTERM, SIGHUP};
constexpr std::chrono::milliseconds kProgressInterval(200);
constexpr std::chrono::milliseconds kGrace(1000); // for messages in flight when the run is interrupted

struct BenchOptions {
    ConnectOptions connect;
    LogOptions log;
    unsigned int connections = 2;
    std::size_t bytes = BenchLoad().bytes;
    double rate = 0;
    std::uint64_t count = 0;
    double seconds = 0;
    bool json = false;
};

BenchLoad makeLoad(const BenchOptions& options)
{
    BenchLoad load;
    load.pairs = options.connections / 2;
    load.bytes = options.bytes;
    load.rate = options.rate;
    load.count = options.count;
    const bool unlimited = options.count == 0 && options.seconds <= 0;
    const std::chrono::duration<double> time(unlimited ? kDefaultSeconds : options.seconds);
    load.time = std::chrono::duration_cast<std::chrono::nanoseconds>(time);
    return load;
}

/// Connects one console. Its tool id ends with its number, because the server refuses a second console with the same
/// id.
/// @param number  from 1 on
BenchConsole connectNumber(const BenchOptions& options, unsigned int number)
{
    ConnectOptions own = options.connect;
    own.identity = completeIdentity(options.connect.identity);
    own.identity.toolId += "-" + std::to_string(number);
    try {
        return {own.identity, connectConsole(own)};
    } catch (const CredentialsUnusable&) {
        throw; // the same for every connection
    } catch (const std::exception& error) {
        if (exitStatusOf(error) != ExitStatus::Refused) throw;
        throw CommandFailure(ExitStatus::Refused, "connection " + std::to_string(number) + " of " +
                                                      std::to_string(options.connections) + ": " + userMessage(error));
    }
}

std::vector<std::unique_ptr<BenchPair>> connectPairs(const BenchOptions& options)
{
    std::vector<std::unique_ptr<BenchPair>> pairs;
    for (unsigned int number = 1; number < options.connections; number += 2) {
        BenchConsole first = connectNumber(options, number);
        BenchConsole second = connectNumber(options, number + 1);
        pairs.push_back(
            std::make_unique<BenchPair>(std::move(first), std::move(second), options.bytes, options.connect.timeout()));
    }
    return pairs;
}

void showProgress(ProgressBar& bar, const BenchLoad& load, const BenchRun& run)
{
    const double seconds = std::chrono::duration<double>(run.elapsed()).count();
    const auto done = static_cast<double>(run.done());
    double fraction = 0;
    if (load.count > 0) fraction = done / static_cast<double>(load.count);
    if (load.time.count() > 0) {
        fraction = std::max(fraction, seconds / std::chrono::duration<double>(load.time).count());
    }
    const auto perSecond = static_cast<std::uint64_t>(seconds > 0 ? done / seconds : 0);
    bar.update(fraction, std::to_string(run.done()) + " messages, " + std::to_string(perSecond) + " a second");
}

/// Waits until the run ends or a signal interrupts it.
void watchRun(BenchRun& run, const BenchLoad& load, SignalWatch& signals)
{
    ProgressBar bar(STDERR_FILENO);
    for (;;) {
        const auto interval = bar.isShown() ? kProgressInterval : PollSet::TIMEOUT_INFINITE;
        const PollResult result = PollSet{signals.getPollFd(), run.getPollFd()}.wait(interval);
        if (result.contains(run.getPollFd())) return;
        if (result.contains(signals.getPollFd())) break;
        showProgress(bar, load, run);
    }
    static_cast<void>(signals.take());
    run.stop();
    const PollResult result = PollSet{signals.getPollFd(), run.getPollFd()}.wait(kGrace);
    if (!result.contains(run.getPollFd())) run.cut();
}

ExitStatus runBench(const BenchOptions& options, const BenchLoad& load)
{
    startLogging(options.log, "qel-bench.log");
    auto pairs = connectPairs(options);
    SignalWatch signals(kStopSignals);
    BenchRun run(std::move(pairs), load);
    logLine(LogLevel::Info, options.connections, " connections are open; the run begins");
    watchRun(run, load, signals);
    const BenchFigures figures = run.finish();
    if (options.json) {
        printJson(std::cout, reportJson(options.connect.server, load, figures));
    } else {
        printReport(std::cout, options.connect.server, load, figures);
    }
    flushOutput();
    while (signals.take() != 0)
        continue; // a signal after the end of the run must not end the process: the result is complete
    return ExitStatus::Done;
}

std::string checkEven(std::string& text)
{
    const auto number = parseInteger(text);
    const bool isEven = number && *number % 2 == 0;
    return isEven ? std::string() : tool::quoted(text) + " is not even: a message needs two consoles";
}

void addLoadOptions(CLI::App& command, BenchOptions& options)
{
    command
        .add_option("--connections", options.connections,
                    "Number of consoles; each two form a pair that exchanges messages")
        ->transform(integerIn(2, kMaxConnections))
        ->check(CLI::Validator(checkEven, ""))
        ->capture_default_str();
    command.add_option("--size", options.bytes, "Payload of a message in bytes")
        ->type_name("BYTES")
        ->transform(integerIn(1, kMaxBroadcast))
        ->capture_default_str();
    command
        .add_option("--rate", options.rate,
                    "Messages per second, all connections together (default: as fast as possible)")
        ->check(numberIn(0.001, kMaxRate));
    CLI::Option* const count =
        command.add_option("--count", options.count, "Number of messages, all connections together")
            ->transform(integerIn(1, kMaxMessages));
    command.add_option("--seconds", options.seconds, "Duration of the run (default: 10, or until --count is reached)")
        ->check(numberIn(0.001, kMaxSeconds))
        ->excludes(count);
}

} // namespace

CLI::App& addBenchCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "bench", "Put load on a server and measure its latency");
    const auto options = std::make_shared<BenchOptions>();
    addConnectOptions(command, options->connect);
    describeOption(command, "--timeout", "Timeout in seconds: for each connection to be made, then for each message");
    describeOption(command, "--tool-id",
                   "Prefix of the consoles' tool ids, at most 28 bytes; a dash and a number follow (default: "
                   "qel-<process id>)");
    addLoadOptions(command, *options);
    addJsonOption(command, options->json);
    options->log.usual = LogLevel::Warn;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    command.callback([&action, options] {
        checkConnect(options->connect);
        if (options->connect.identity.toolId.size() > kMaxToolId) {
            throw CLI::ValidationError("--tool-id", "longer than 28 bytes: each connection adds its number");
        }
        action = [options] { return runBench(*options, makeLoad(*options)); };
    });
    return command;
}

} // namespace qel::tool
