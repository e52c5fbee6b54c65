#include "check/CheckCommand.hpp"

#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/ProgressBar.hpp"
#include "base/SignalWatch.hpp"
#include "check/CheckReport.hpp"
#include "check/server/ServerCases.hpp"
#include "client/ConnectOptions.hpp"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <fnmatch.h>
#include <fstream>
#include <iostream>
#include <memory>
#include <string>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

using namespace check;

constexpr std::size_t kMaxToolId = 20; // of 32: the numbers of the case and of the console follow
constexpr unsigned int kMaxParallel = 16;
constexpr double kMaxDeadline = 10;

struct CheckOptions {
    ConnectOptions connect;
    LogOptions log;
    std::vector<std::string> only;
    std::vector<std::string> levels;
    unsigned int parallel = 4;
    bool list = false;
    bool markdown = false;
    bool json = false;
    bool hex = false;
    std::string junit;
    std::uint16_t partition = 0; // 0 is a partition too: the options say whether it is given
    std::uint16_t echoPartition = 0;
    std::uint16_t endingPartition = 0;
    std::uint16_t absentPartition = 0xFFFF;
    double peerDeadline = 0;
    CLI::App* command = nullptr;

    bool has(const char* option) const { return findOption(*command, option)->count() > 0; }
};

bool isChosen(const Case& aCase, const CheckOptions& options)
{
    const auto matches = [&](const std::string& pattern) {
        return ::fnmatch(pattern.c_str(), aCase.id.c_str(), 0) == 0;
    };
    const bool byId = options.only.empty() || std::any_of(options.only.begin(), options.only.end(), matches);
    const bool byLevel = options.levels.empty() || std::count(options.levels.begin(), options.levels.end(),
                                                              std::string(levelName(aCase.level))) > 0;
    return byId && byLevel;
}

Cases chosenCases(const CheckOptions& options)
{
    Cases chosen;
    for (Case& aCase : serverCases()) {
        if (isChosen(aCase, options)) chosen.push_back(std::move(aCase));
    }
    if (chosen.empty()) throw CommandFailure(ExitStatus::Usage, "no case matches: --list prints all");
    return chosen;
}

/// The files of the credentials as texts: a case presents parts of them.
SSLCredentials readCredentials(const TransportOptions& transport)
{
    const CredentialPaths paths = transport.paths();
    SSLCredentials texts;
    texts.mRootCA = Utilities::readFile(paths.root);
    texts.mCert = Utilities::readFile(paths.certificate);
    texts.mKey = Utilities::readFile(paths.key);
    return texts;
}

/// Where the peer is, and how to talk to it. Connects once, so that a peer that is not there is reported at once.
Target makeTarget(const CheckOptions& options)
{
    const ConsoleOptions library = libraryOptions(options.connect);
    Target target(ServerAddress::parse(options.connect.server));
    target.timeout = options.connect.timeout();
    const auto end = TimeProvider::steady() + target.timeout;
    target.endpoints = resolve(target.address, end);
    for (const IPEndpoint& endpoint : target.endpoints) {
        if (library.plain && !isLoopback(endpoint.getAddress())) {
            throw CommandFailure(ExitStatus::Usage, plainRefusal(options.connect.server));
        }
    }
    static_cast<void>(connectTo(target.address, target.endpoints, end));
    if (library.credentials) {
        target.context = library.credentials->makeClientContext();
        target.credentials = readCredentials(options.connect.transport);
    }
    target.pins = library.pins;
    target.toolType = options.connect.identity.toolType;
    target.toolIdPrefix = options.connect.identity.toolId;
    if (target.toolIdPrefix.empty()) target.toolIdPrefix = "qel-check-" + std::to_string(::getpid());
    if (options.has("partition")) target.partition = options.partition;
    if (options.has("echo-partition")) target.echoPartition = options.echoPartition;
    if (options.has("ending-partition")) target.endingPartition = options.endingPartition;
    if (!target.partition) target.partition = target.echoPartition;
    target.absentPartition = options.absentPartition;
    if (options.has("peer-deadline")) {
        target.deadline =
            std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(options.peerDeadline));
    }
    return target;
}

void writeJunit(const std::string& file, const std::vector<Outcome>& outcomes, std::chrono::nanoseconds time)
{
    std::ofstream stream(file);
    if (stream) printJunit(stream, "qel check server", outcomes, time);
    stream.flush();
    if (stream) return;
    const PosixErrorCode error = errno;
    throw FileIOError(error, "cannot write " + file);
}

ExitStatus runCheck(const CheckOptions& options)
{
    startLogging(options.log, "qel-check.log");
    const Cases cases = chosenCases(options);
    const Target target = makeTarget(options);
    SignalWatch signals({SIGINT, SIGTERM, SIGHUP});
    const auto begin = TimeProvider::steady();
    std::vector<Outcome> outcomes;
    {
        ProgressBar bar(STDERR_FILENO);
        CheckRun run(cases, options.parallel,
                     [&target](const Case& aCase, unsigned int number) { return runCase(aCase, target, number); });
        outcomes = run.run([&](const Outcome& outcome, std::size_t done) {
            bar.clear();
            if (!options.json) std::cout << outcomeLine(outcome) << std::endl;
            bar.update(static_cast<double>(done) / static_cast<double>(cases.size()), outcome.test->id);
            return signals.take() == 0;
        });
    }
    const auto time = TimeProvider::steady() - begin;
    if (options.json) {
        printJson(std::cout, reportJson(options.connect.server, outcomes, time));
    } else {
        printFailures(std::cout, outcomes, time, options.hex);
    }
    flushOutput();
    if (!options.junit.empty()) writeJunit(options.junit, outcomes, time);
    const bool interrupted = std::any_of(outcomes.begin(), outcomes.end(), [](const Outcome& outcome) {
        return outcome.result == Result::Skipped && outcome.seen == "interrupted";
    });
    if (interrupted) throw CommandFailure(ExitStatus::Refused, "interrupted: not all cases were run");
    return countsOf(outcomes).fails == 0 ? ExitStatus::Done : ExitStatus::Refused;
}

ExitStatus listCases(const CheckOptions& options)
{
    const Cases cases = chosenCases(options);
    if (options.markdown) {
        printMarkdown(std::cout, cases);
    } else if (options.json) {
        printJson(std::cout, listJson(cases));
    } else {
        printList(std::cout, cases);
    }
    return ExitStatus::Done;
}

void addPartitionOptions(CLI::App& command, CheckOptions& options)
{
    constexpr std::uint64_t kMax = 0xFFFF;
    const auto add = [&](const char* name, std::uint16_t& partition, const char* description) {
        command.add_option(name, partition, description)->type_name("ID")->transform(integerIn(0, kMax));
    };
    add("--partition", options.partition,
        "A partition that cases may open, write to, and take from its holder by force (default: that of "
        "--echo-partition)");
    add("--echo-partition", options.echoPartition,
        "A partition whose line sends back every byte it gets, such as 'stty raw -echo; exec cat'");
    add("--ending-partition", options.endingPartition,
        "A partition whose command ends with exit status 3 when it gets a line, such as 'read x; exit 3'");
    add("--absent-partition", options.absentPartition, "A partition that does not exist (default: 65535)");
    command
        .add_option("--peer-deadline", options.peerDeadline,
                    "Seconds that the peer allows for its handshake and for a frame, at most 10: with it, cases wait "
                    "for this to pass")
        ->type_name("SECONDS")
        ->check(numberIn(0.001, kMaxDeadline));
}

void addRunOptions(CLI::App& command, CheckOptions& options)
{
    command.add_option("--only", options.only, "Only cases whose id matches, such as 'frame/*'; may be repeated")
        ->type_name("PATTERN")
        ->allow_extra_args(false);
    command.add_option("--level", options.levels, "Only cases of this level: wire, rule, robust; may be repeated")
        ->type_name("LEVEL")
        ->allow_extra_args(false)
        ->check(oneOf({"wire", "rule", "robust"}));
    command.add_option("--parallel", options.parallel, "How many cases run at a time")
        ->transform(integerIn(1, kMaxParallel))
        ->capture_default_str();
    CLI::Option* const list = command.add_flag("--list", options.list, "Print the cases instead of running them");
    command.add_flag("--markdown", options.markdown, "With --list: as tables for a document")->needs(list);
    addJsonOption(command, options.json);
    command.add_flag("--hex", options.hex, "Print the bytes of the frames of a failure");
    command.add_option("--junit", options.junit, "Write the results to this file in the XML form of JUnit")
        ->type_name("FILE");
}

void addServerCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "server", "Play a console and try every rule on a server");
    const auto options = std::make_shared<CheckOptions>();
    options->command = &command;
    options->connect.timeoutSeconds = 2;
    addConnectOptions(command, options->connect);
    findOption(command, "connect")->required(false); // --list needs none
    describeOption(command, "--timeout", "Timeout in seconds for each thing that the peer has to do");
    describeOption(
        command, "--tool-id",
        "Prefix of the consoles' tool ids, at most 20 bytes; numbers follow (default: qel-check-<process id>)");
    addPartitionOptions(command, *options);
    addRunOptions(command, *options);
    options->log.usual = LogLevel::Warn;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    command.callback([&action, options] {
        if (options->list) {
            action = [options] { return listCases(*options); };
            return;
        }
        checkConnect(options->connect);
        if (options->connect.identity.toolId.size() > kMaxToolId) {
            throw CLI::ValidationError("--tool-id", "longer than 20 bytes: each console adds its number");
        }
        action = [options] { return runCheck(*options); };
    });
}

} // namespace

CLI::App& addCheckCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "check", "Find out which rules of the protocol a peer breaks");
    command.require_subcommand(1);
    addServerCommand(command, action);
    return command;
}

} // namespace qel::tool
