#include "serve/ServeCommand.hpp"

#include <qel/protocol/Hypervisor.hpp>
#include <qel/protocol/Server.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/SignalWatch.hpp"
#include "lines/LineText.hpp"
#include "serve/PartitionChoices.hpp"
#include "transport/TransportOptions.hpp"

#include <algorithm>
#include <cctype>
#include <chrono>
#include <csignal>
#include <cstring>
#include <initializer_list>
#include <iostream>
#include <map>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

constexpr std::size_t kMaxPartitions = 255; // the maximum-sessions response has one byte for them
constexpr std::size_t kMaxNameBytes = 16;
constexpr std::size_t kMaxQueueBytes = 1024 * 1024 * 1024;
constexpr std::uint64_t kMaxHandshakes = 65535;
constexpr double kMinFrameSeconds = 0.001;
constexpr double kMaxFrameSeconds = 24 * 60 * 60;
constexpr std::uint64_t kMaxKeepAliveSeconds = 32767; // of TCP

constexpr std::initializer_list<int> kSignals{SIGTERM, SIGINT, SIGHUP, SIGUSR1};

struct ServeOptions {
    ServerOptions server;
    TransportOptions transport;
    std::vector<std::string> partitions; ///< "ID=LINE"
    std::string term = "vt220";
    PartitionChoices serving;
    std::uint32_t maxConsoles = ServerOptions().maxConsoles;
    double frameSeconds = std::chrono::duration<double>(ServerOptions().frameTimeout).count();
    std::uint32_t keepAliveSeconds = static_cast<std::uint32_t>(ServerOptions().keepAlive.count());
    std::string family;
    std::string version;
    std::string capabilities = std::string(QelCapabilities::size(), '1');
    MachineInfo machine{'Q', 1, 0, "QEL-SERVE", "0000001"};
    LogOptions log;
};

[[noreturn]] void refuse(const std::string& option, const std::string& reason)
{
    throw CLI::ValidationError(option, reason);
}

/// An integer in [min, 65535]. @throws CLI::ValidationError
std::uint16_t parseUint16(const std::string& text, std::uint64_t min, const std::string& option)
{
    constexpr std::uint64_t kMax = 65535;
    const auto number = parseInteger(text);
    if (!number || *number < min || *number > kMax) refuse(option, notAnIntegerIn(text, min, kMax));
    return static_cast<std::uint16_t>(*number);
}

/// The characters that names of terminal types consist of: see term(7).
std::string checkTerm(const std::string& name)
{
    const bool isName = !name.empty() && std::all_of(name.begin(), name.end(), [](unsigned char character) {
        return std::isalnum(character) != 0 || std::strchr("+-._", character) != nullptr;
    });
    return isName ? std::string() : "\"" + name + "\" is not a terminal type, such as vt220";
}

/// Making a line opens nothing, so it is made once to find out that it can be.
void checkLine(const std::string& text)
{
    try {
        static_cast<void>(makeLine(text));
    } catch (const std::invalid_argument& error) {
        refuse("--partition", error.what());
    }
}

std::map<std::uint16_t, std::string> parsePartitions(const std::vector<std::string>& texts)
{
    std::map<std::uint16_t, std::string> lines;
    for (const std::string& text : texts) {
        const std::size_t equals = text.find('=');
        if (equals == std::string::npos || equals + 1 == text.size()) refuse("--partition", "takes ID=LINE");
        const std::uint16_t id = parseUint16(text.substr(0, equals), 1, "--partition");
        const std::string line = text.substr(equals + 1);
        checkLine(line);
        if (!lines.emplace(id, line).second) {
            refuse("--partition", "partition " + std::to_string(id) + " is given twice");
        }
    }
    if (lines.size() > kMaxPartitions) refuse("--partition", "more than 255 partitions");
    return lines;
}

void parseVersion(const std::string& text, MachineInfo& machine)
{
    const std::size_t dot = text.find('.');
    if (dot == std::string::npos) refuse("--interface-version", "takes MAJOR.MINOR");
    machine.majorVersion = parseUint16(text.substr(0, dot), 0, "--interface-version");
    machine.minorVersion = parseUint16(text.substr(dot + 1), 0, "--interface-version");
}

MachineInfo parseMachine(const ServeOptions& options)
{
    MachineInfo machine = options.machine;
    if (options.family.size() > 1) refuse("--interface-family", "takes one character");
    if (!options.family.empty()) machine.interfaceFamily = options.family.front();
    if (!options.version.empty()) parseVersion(options.version, machine);
    return machine;
}

/// The options, parsed.
struct ServePlan {
    ServerOptions server;                       ///< without the credentials, which are loaded when it starts
    std::map<std::uint16_t, std::string> lines; ///< as texts, by the ids of their partitions
    std::string term;
    PartitionOptions serving; ///< of all partitions
    MachineInfo machine;
    QelCapabilities capabilities;
    TransportOptions transport;
    LogOptions log;
};

void addPartitions(Hypervisor& machine, const ServePlan& plan)
{
    for (const auto& entry : plan.lines) {
        MadeLine made = makeLine(entry.second, {plan.term, {}});
        PartitionOptions options = plan.serving;
        options.keepsSession = made.options.keepsSession;
        machine.addPartition(entry.first, std::move(made.line), std::move(options));
    }
}

ServerOptions parseServer(const ServeOptions& options)
{
    for (const std::string& endpoint : options.server.listen)
        checkTransport(options.transport, endpoint);
    ServerOptions server = options.server;
    server.plain = options.transport.plain;
    server.pins = options.transport.pins;
    server.maxConsoles = static_cast<std::uint8_t>(options.maxConsoles);
    server.handshakeTimeout = options.transport.handshakeTimeout();
    server.frameTimeout =
        std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(options.frameSeconds));
    server.keepAlive = std::chrono::seconds(options.keepAliveSeconds);
    return server;
}

ServePlan makePlan(const ServeOptions& options)
{
    ServePlan plan;
    plan.server = parseServer(options);
    plan.transport = options.transport;
    plan.lines = parsePartitions(options.partitions);
    plan.term = options.term;
    plan.serving = options.serving.options();
    plan.machine = parseMachine(options);
    plan.capabilities = QelCapabilities(options.capabilities);
    plan.log = options.log;
    return plan;
}

/// The key leaves the memory when the server has been made.
std::unique_ptr<Server> makeServer(Hypervisor& machine, const ServePlan& plan)
{
    ServerOptions options = plan.server;
    options.credentials = loadCredentials(plan.transport);
    return std::make_unique<Server>(machine, options);
}

void announce(const Server& server)
{
    const std::vector<IPEndpoint> endpoints = server.endpoints();
    for (const IPEndpoint& endpoint : endpoints)
        std::cout << endpoint << '\n';
    std::cout << std::flush;
    flushOutput();
    for (const IPEndpoint& endpoint : endpoints)
        logLine(LogLevel::Info, "listening on ", endpoint);
}

/// On SIGHUP: loads the credentials from their files again, for new connections.
void reload(Server& server, const TransportOptions& transport)
{
    if (transport.plain) return logLine(LogLevel::Info, "SIGHUP: connections are plain, there is nothing to load");
    try {
        server.setCredentials(*loadCredentials(transport));
        logLine(LogLevel::Info, "SIGHUP: loaded ", transport.paths().certificate, " for new connections");
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "SIGHUP: the credentials stay as they were: ", userMessage(error));
    }
}

/// On SIGUSR1 and at the end: logs the statistics of the queues.
void logStatistics(Server& server)
{
    std::ostringstream text;
    server.dumpStatistics(text);
    logLines(LogLevel::Info, text.str());
}

/// @return the signal that ended it
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
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // a log pipe without a reader must not end the server
    static_cast<void>(std::signal(SIGCHLD, SIG_DFL)); // ignored, as a parent may leave it, it hides how commands end
    SignalWatch signals(kSignals);
    Hypervisor machine(plan.machine, plan.capabilities);
    addPartitions(machine, plan);
    const auto server = makeServer(machine, plan);
    announce(*server);
    const int signal = serveUntilStopped(*server, signals, plan.transport);

    logLine(LogLevel::Info, "stopping: signal ", signal);
    logStatistics(*server);
    for (const int number : kSignals)
        static_cast<void>(std::signal(number, SIG_IGN)); // a second one must not cut the shutdown short
    server->finish();
    return ExitStatus::Done;
}

void addIdentityOptions(CLI::App& command, ServeOptions& options)
{
    const CLI::Validator shortName = textUpTo(kMaxNameBytes);
    command.add_option("--system-type", options.machine.machineType, "Machine type to report, at most 16 bytes")
        ->check(shortName)
        ->capture_default_str();
    command.add_option("--system-serial", options.machine.serialNumber, "Serial number to report, at most 16 bytes")
        ->check(shortName)
        ->capture_default_str();
    command.add_option("--interface-family", options.family, "Interface family to report, one character; Q by default");
    command.add_option("--interface-version", options.version, "Interface version to report; 1.0 by default")
        ->type_name("MAJOR.MINOR");
    command
        .add_option("--capabilities", options.capabilities,
                    "Capabilities to offer, a 0 or 1 for each, bit 0 first; all 32 by default")
        ->type_name("BITS")
        ->check(capabilityValidator());
}

void addLimitOptions(CLI::App& command, ServeOptions& options)
{
    command.add_option("--max-consoles", options.maxConsoles, "Consoles that may be connected at a time, 1 to 255")
        ->transform(integerIn(1, 255))
        ->capture_default_str();
    command
        .add_option("--max-handshakes", options.server.maxHandshakes,
                    "Connections that may be in their handshake at a time")
        ->transform(integerIn(1, kMaxHandshakes))
        ->capture_default_str();
    command
        .add_option("--max-handshakes-per-address", options.server.maxHandshakesPerAddress,
                    "The same from one IPv4 address, or from one IPv6 network of 64 bits")
        ->transform(integerIn(1, kMaxHandshakes))
        ->capture_default_str();
    command
        .add_option("--queue-limit", options.server.queueBytes,
                    "Bytes that may be queued for a console, half of them serial data")
        ->type_name("BYTES")
        ->transform(integerIn(1, kMaxQueueBytes))
        ->capture_default_str();
    command.add_option("--frame-timeout", options.frameSeconds, "Seconds from the first byte of a message to its last")
        ->type_name("SECONDS")
        ->check(numberIn(kMinFrameSeconds, kMaxFrameSeconds))
        ->capture_default_str();
    command.add_option("--keepalive", options.keepAliveSeconds, "Seconds until an idle peer that is gone is noticed")
        ->type_name("SECONDS")
        ->transform(integerIn(1, kMaxKeepAliveSeconds))
        ->capture_default_str();
}

} // namespace

CLI::App& addServeCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "serve", "Run the hypervisor end: serve consoles until a signal stops it");
    const auto options = std::make_shared<ServeOptions>();
    command
        .add_option("--listen", options->server.listen,
                    "Where to listen; port 0 lets the system choose one; may be repeated")
        ->type_name("ENDPOINT")
        ->allow_extra_args(false)
        ->check(endpointValidator())
        ->default_str(options->server.listen.front());
    addTransportOptions(command, options->transport);
    command
        .add_option(
            "--partition", options->partitions,
            "A partition: its id, and its serial line: a shell command (pty:COMMAND or the command alone), unix:PATH, "
            "tcp:HOST:PORT, telnet:HOST:PORT[,SETTINGS] or tty:DEVICE[,SETTINGS] with settings such as 115200n8,rtscts")
        ->type_name("ID=LINE")
        ->allow_extra_args(false);
    command.add_option("--term", options->term, "Terminal type of the partitions' commands: their TERM")
        ->type_name("NAME")
        ->check(CLI::Validator(checkTerm, ""))
        ->capture_default_str();
    addPartitionChoices(command, options->serving);
    addLimitOptions(command, *options);
    addIdentityOptions(command, *options);
    addLogOptions(command, options->log);
    command.callback([&action, options] { action = [plan = makePlan(*options)] { return runServe(plan); }; });
    return command;
}

} // namespace qel::tool
