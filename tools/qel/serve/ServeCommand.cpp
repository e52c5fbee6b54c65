#include "serve/ServeCommand.hpp"

#include <qel/common/net/Listen.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/SignalWatch.hpp"
#include "base/WakeUp.hpp"
#include "serve/ChildReaper.hpp"
#include "serve/Hypervisor.hpp"
#include "serve/PtyPort.hpp"
#include "serve/SerialLoop.hpp"
#include "serve/Server.hpp"
#include "transport/TransportOptions.hpp"

#include <csignal>
#include <initializer_list>
#include <iostream>
#include <map>
#include <memory>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

constexpr int kBacklog = 64;
constexpr std::size_t kMostPartitions = 255; // the maximum-sessions response has one byte for them
constexpr std::size_t kLongestName = 16;

constexpr std::size_t kLargestQueue = 1024 * 1024 * 1024;

constexpr std::initializer_list<int> kSignals{SIGTERM, SIGINT, SIGHUP, SIGUSR1};

struct ServeOptions {
    std::string endpoint = "127.0.0.1:0";
    TransportOptions transport;
    std::vector<std::string> partitions; ///< "ID=COMMAND"
    std::uint32_t maxConsoles = 0;
    std::size_t queueBytes = ConnectionLimits().queueBytes;
    std::string family;
    std::string version;
    std::string capabilities = std::string(QelCapabilities::size(), '1');
    HypervisorSettings settings;
    LogOptions log;
};

[[noreturn]] void refuse(const std::string& option, const std::string& reason)
{
    throw CLI::ValidationError(option, reason);
}

/// @throws CLI::ValidationError
std::uint16_t parseNumber(const std::string& text, std::uint64_t min, const std::string& option)
{
    constexpr std::uint64_t kMax = 65535;
    const auto number = parseInteger(text);
    if (!number || *number < min || *number > kMax) refuse(option, notAnIntegerIn(text, min, kMax));
    return static_cast<std::uint16_t>(*number);
}

std::map<std::uint16_t, std::string> parsePartitions(const std::vector<std::string>& texts)
{
    std::map<std::uint16_t, std::string> commands;
    for (const std::string& text : texts) {
        const std::size_t equals = text.find('=');
        if (equals == std::string::npos || equals + 1 == text.size()) refuse("--partition", "takes ID=COMMAND");
        const std::uint16_t id = parseNumber(text.substr(0, equals), 1, "--partition");
        if (!commands.emplace(id, text.substr(equals + 1)).second) {
            refuse("--partition", "partition " + std::to_string(id) + " is given twice");
        }
    }
    if (commands.size() > kMostPartitions) refuse("--partition", "more than 255 partitions");
    return commands;
}

void parseVersion(const std::string& text, HypervisorSettings& settings)
{
    const std::size_t dot = text.find('.');
    if (dot == std::string::npos) refuse("--interface-version", "takes MAJOR.MINOR");
    settings.majorVersion = parseNumber(text.substr(0, dot), 0, "--interface-version");
    settings.minorVersion = parseNumber(text.substr(dot + 1), 0, "--interface-version");
}

HypervisorSettings parseSettings(const ServeOptions& options)
{
    HypervisorSettings settings = options.settings;
    if (options.family.size() > 1) refuse("--interface-family", "takes one character");
    if (!options.family.empty()) settings.interfaceFamily = options.family.front();
    if (!options.version.empty()) parseVersion(options.version, settings);
    settings.capabilities = QelCapabilities(options.capabilities);
    settings.maxConsoles = static_cast<std::uint8_t>(options.maxConsoles);
    return settings;
}

Socket openListener(const IPEndpoint& endpoint)
{
    try {
        return listenOn(endpoint, kBacklog);
    } catch (const PosixError& error) {
        throw CommandFailure(ExitStatus::CannotConnect, "cannot listen on " + endpoint.str() + ": " + error.what());
    }
}

PartitionSet makePartitions(const std::map<std::uint16_t, std::string>& commands, ChildReaper& reaper)
{
    PartitionSet partitions;
    for (const auto& command : commands) {
        partitions.add(command.first, std::make_unique<PtyPort>(command.second, reaper));
    }
    return partitions;
}

/// What the command line says, understood.
struct ServePlan {
    IPEndpoint endpoint;
    std::map<std::uint16_t, std::string> commands;
    HypervisorSettings settings;
    TransportOptions transport;
    std::size_t queueBytes = 0;
    LogOptions log;
};

ServePlan makePlan(const ServeOptions& options)
{
    ServePlan plan;
    checkTransport(options.transport, options.endpoint);
    plan.endpoint = IPEndpoint(options.endpoint);
    plan.transport = options.transport;
    plan.commands = parsePartitions(options.partitions);
    plan.settings = parseSettings(options);
    plan.queueBytes = options.queueBytes;
    plan.log = options.log;
    return plan;
}

/// SIGHUP: gives the connections to come the credentials that the files hold now.
void reload(Server& server, const TransportOptions& transport)
{
    if (transport.plain) return logLine(LogLevel::Info, "SIGHUP: connections are plain, there is nothing to load");
    try {
        server.setContext(makeServerContext(transport));
        logLine(LogLevel::Info, "SIGHUP: loaded ", transport.paths().certificate, " for new connections");
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "SIGHUP: the credentials stay as they were: ", explain(error));
    }
}

/// SIGUSR1, and the end: tells what is known about the queues.
void logStatistics(Server& server)
{
    std::ostringstream text;
    server.dumpStatistics(text);
    logLines(LogLevel::Info, text.str());
}

/// @return the signal that asks to stop
int serveUntilStopped(Server& server, SignalWatch& signals, const TransportOptions& transport)
{
    for (;;) {
        server.run(signals.getPollFd());
        const int signal = signals.take();
        if (signal == SIGHUP) {
            reload(server, transport);
        } else if (signal == SIGUSR1) {
            logStatistics(server);
        } else if (signal != 0) {
            return signal;
        }
    }
}

ExitStatus runServe(const ServePlan& plan)
{
    startLogging(plan.log, "qel-serve.log");
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // a log that nobody reads any more must not end the server
    SignalWatch signals(kSignals);
    auto context = makeServerContext(plan.transport);
    Socket listener = openListener(plan.endpoint);
    const IPEndpoint listening = listener.getSocketName();

    ChildReaper reaper;
    WakeUp serialWake;
    Hypervisor hypervisor(plan.settings, makePartitions(plan.commands, reaper), [&] { serialWake.interrupt(); });
    ConnectionLimits limits;
    limits.handshake = plan.transport.handshakeTimeout();
    limits.queueBytes = plan.queueBytes;
    Server server(hypervisor, std::move(listener), limits, std::move(context), plan.transport.pins);
    SerialLoop serial(hypervisor, reaper, serialWake);

    std::cout << listening << std::endl;
    flushOutput();
    logLine(LogLevel::Info, "listening on ", listening);
    const int signal = serveUntilStopped(server, signals, plan.transport);

    logLine(LogLevel::Info, "stopping: signal ", signal);
    logStatistics(server);
    for (const int number : kSignals)
        static_cast<void>(std::signal(number, SIG_IGN)); // once is enough
    hypervisor.shutDown();
    server.finish();
    return ExitStatus::Done;
}

void addIdentityOptions(CLI::App& command, ServeOptions& options)
{
    const CLI::Validator shortName = textUpTo(kLongestName);
    command.add_option("--system-type", options.settings.machineType, "Machine type to report, at most 16 bytes")
        ->check(shortName)
        ->capture_default_str();
    command.add_option("--system-serial", options.settings.serialNumber, "Serial number to report, at most 16 bytes")
        ->check(shortName)
        ->capture_default_str();
    command.add_option("--interface-family", options.family,
                       "Interface family to report, one character; Q unless given");
    command.add_option("--interface-version", options.version, "Interface version to report; 1.0 unless given")
        ->type_name("MAJOR.MINOR");
    command
        .add_option("--capabilities", options.capabilities,
                    "Capabilities to offer, a 0 or 1 for each, bit 0 first; all 32 unless given")
        ->type_name("BITS")
        ->check(capabilityValidator());
}

} // namespace

CLI::App& addServeCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "serve", "Be the hypervisor end: serve consoles until told to stop");
    const auto options = std::make_shared<ServeOptions>();
    options->maxConsoles = options->settings.maxConsoles;
    command.add_option("--listen", options->endpoint, "Where to listen; port 0 lets the system choose one")
        ->type_name("ENDPOINT")
        ->check(endpointValidator())
        ->capture_default_str();
    addTransportOptions(command, options->transport);
    command
        .add_option(
            "--partition", options->partitions,
            "A partition: its id and the command behind its serial console, which starts when it is first opened")
        ->type_name("ID=COMMAND")
        ->allow_extra_args(false);
    command.add_option("--max-consoles", options->maxConsoles, "Consoles served at a time")
        ->transform(integerIn(1, 255))
        ->capture_default_str();
    command
        .add_option("--queue-limit", options->queueBytes,
                    "Bytes that may be queued for a console before it has to wait; half of it for serial data")
        ->type_name("BYTES")
        ->transform(integerIn(1, kLargestQueue))
        ->capture_default_str();
    addIdentityOptions(command, *options);
    addLogOptions(command, options->log);
    command.callback([&action, options] { action = [plan = makePlan(*options)] { return runServe(plan); }; });
    return command;
}

} // namespace qel::tool
