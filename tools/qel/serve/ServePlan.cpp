#include "serve/ServePlan.hpp"

#include <qel/common/QelCapabilities.hpp>

#include "base/OptionChecks.hpp"
#include "lines/LineLogs.hpp"
#include "lines/LineText.hpp"
#include "serve/PartitionChoices.hpp"

#include <algorithm>
#include <cctype>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <utility>

namespace qel::tool {

namespace {

constexpr std::size_t kMaxPartitions = 255; // the maximum-sessions response has one byte for them
constexpr std::size_t kMaxNameBytes = 16;
constexpr std::size_t kMaxQueueBytes = 1024 * 1024 * 1024;
constexpr std::uint64_t kMaxHandshakes = 65535;
constexpr double kMinFrameSeconds = 0.001;
constexpr double kMaxFrameSeconds = 24 * 60 * 60;
constexpr std::uint64_t kMaxKeepAliveSeconds = 32767; // of TCP
constexpr std::uint64_t kMaxIdleSeconds = 24 * 60 * 60;

} // namespace

struct ServeInput::Options {
    ServerOptions server;
    TransportOptions transport;
    std::vector<std::string> partitions; ///< "ID=LINE"
    std::string term = "vt220";
    PartitionChoices serving;
    LineLogOptions lineLog;
    std::string statusSocket;
    std::uint32_t maxConsoles = ServerOptions().maxConsoles;
    std::uint32_t maxPerCertificate = 0;
    std::uint32_t idleSeconds = 0;
    bool mutesBroadcasts = false;
    std::uint32_t warnDays = 30;
    double frameSeconds = std::chrono::duration<double>(ServerOptions().frameTimeout).count();
    std::uint32_t keepAliveSeconds = static_cast<std::uint32_t>(ServerOptions().keepAlive.count());
    std::string family;
    std::string version;
    std::string capabilities = std::string(QelCapabilities::size(), '1');
    MachineInfo machine{'Q', 1, 0, "QEL-SERVE", "0000001"};
    LogOptions log;
    bool checkConfig = false;
    bool printConfig = false;
};

namespace {

using Options = ServeInput::Options;

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

/// Why a text is not a line; empty: it is one.
std::string lineProblem(const std::string& text)
{
    try {
        static_cast<void>(makeLine(text));
        return {};
    } catch (const std::invalid_argument& error) {
        return error.what();
    }
}

std::map<std::uint16_t, PlannedPartition> parsePartitions(const Options& options)
{
    const PartitionOptions serving = options.serving.options();
    std::map<std::uint16_t, PlannedPartition> partitions;
    for (const std::string& text : options.partitions) {
        const std::size_t equals = text.find('=');
        if (equals == std::string::npos || equals + 1 == text.size()) refuse("--partition", "takes ID=LINE");
        const std::uint16_t id = parseUint16(text.substr(0, equals), 1, "--partition");
        const std::string line = text.substr(equals + 1);
        const std::string problem = lineProblem(line);
        if (!problem.empty()) refuse("--partition", problem);
        if (!partitions.emplace(id, PlannedPartition{line, serving, options.lineLog.directory}).second) {
            refuse("--partition", "partition " + std::to_string(id) + " is given twice");
        }
    }
    return partitions;
}

/// How a partition of the file is served: as the options say, unless its own keys say otherwise.
PartitionOptions servingOf(const PartitionConfig& partition, PartitionChoices choices)
{
    CLI::App checks;
    addPartitionChoices(checks, choices);
    for (CLI::Option* option : checks.get_options()) {
        const TomlEntry* const entry = partition.entry.value.find(keyOf(*option));
        if (entry != nullptr) applyEntry(*option, *entry);
    }
    PartitionOptions options = choices.options();
    options.name = partition.name;
    options.description = partition.description;
    return options;
}

/// Where the line of a partition of the file is logged: with all others, unless its own key says otherwise.
std::string logDirectoryOf(const PartitionConfig& partition, const std::string& common)
{
    const TomlEntry* const entry = partition.entry.value.find("log");
    if (entry == nullptr) return common;
    const TomlPlace& place = entry->value.place;
    if (entry->value.kind == TomlValue::Kind::Boolean) {
        if (!flagOf(*entry)) return {};
        if (common.empty()) failAt(place, "log: line-log names no directory; name one here");
        return common;
    }
    if (entry->value.kind != TomlValue::Kind::Text) {
        failAt(place, std::string("log takes true, false or a directory, not ") + kindName(entry->value.kind));
    }
    const std::string problem = directoryProblem(entry->value.text);
    if (!problem.empty()) failAt(place, "log: " + problem);
    return entry->value.text;
}

/// Adds the partitions of the file to those of the command line.
void addPartitions(std::map<std::uint16_t, PlannedPartition>& partitions, const ServeConfig& config,
                   const Options& options)
{
    for (const PartitionConfig& partition : config.partitions) {
        const std::string problem = lineProblem(partition.line);
        if (!problem.empty()) failAt(partition.entry.value.find("line")->value.place, problem);
        const PlannedPartition planned{partition.line, servingOf(partition, options.serving),
                                       logDirectoryOf(partition, options.lineLog.directory)};
        if (partitions.emplace(partition.id, planned).second) continue;
        failAt(partition.entry.place, "partition " + std::to_string(partition.id) + " is given by --partition too");
    }
    if (partitions.size() > kMaxPartitions) throw CLI::ValidationError("more than 255 partitions");
}

void parseVersion(const std::string& text, MachineInfo& machine)
{
    const std::size_t dot = text.find('.');
    if (dot == std::string::npos) refuse("--interface-version", "takes MAJOR.MINOR");
    machine.majorVersion = parseUint16(text.substr(0, dot), 0, "--interface-version");
    machine.minorVersion = parseUint16(text.substr(dot + 1), 0, "--interface-version");
}

MachineInfo parseMachine(const Options& options)
{
    MachineInfo machine = options.machine;
    if (options.family.size() > 1) refuse("--interface-family", "takes one character");
    if (!options.family.empty()) machine.interfaceFamily = options.family.front();
    if (!options.version.empty()) parseVersion(options.version, machine);
    return machine;
}

ServerOptions parseServer(const Options& options)
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
    server.idleTimeout = std::chrono::seconds(options.idleSeconds);
    return server;
}

void addIdentityOptions(CLI::App& command, Options& options)
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

void addLimitOptions(CLI::App& command, Options& options)
{
    command.add_option("--max-consoles", options.maxConsoles, "Consoles that may be connected at a time, 1 to 255")
        ->transform(integerIn(1, 255))
        ->capture_default_str();
    command
        .add_option("--max-consoles-per-certificate", options.maxPerCertificate,
                    "Consoles that may be connected with one certificate at a time; 0: as many as all")
        ->transform(integerIn(0, 255))
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
    command
        .add_option("--warn-expiry", options.warnDays,
                    "Warn in the log, once a day, when an own certificate expires within this many days; 0: never")
        ->type_name("DAYS")
        ->transform(integerIn(0, 3650))
        ->capture_default_str();
    command.add_option("--frame-timeout", options.frameSeconds, "Seconds from the first byte of a message to its last")
        ->type_name("SECONDS")
        ->check(numberIn(kMinFrameSeconds, kMaxFrameSeconds))
        ->capture_default_str();
    command.add_option("--keepalive", options.keepAliveSeconds, "Seconds until an idle peer that is gone is noticed")
        ->type_name("SECONDS")
        ->transform(integerIn(1, kMaxKeepAliveSeconds))
        ->capture_default_str();
    command
        .add_option("--idle-timeout", options.idleSeconds,
                    "Seconds after which a console that says nothing is let go; 0: never")
        ->type_name("SECONDS")
        ->transform(integerIn(0, kMaxIdleSeconds))
        ->capture_default_str();
    command.add_flag("--no-broadcasts", options.mutesBroadcasts, "Refuse messages between consoles");
}

} // namespace

ServeInput::ServeInput(CLI::App& command)
    : mOptions(std::make_unique<Options>()), mSources(command, {"config", "check-config", "print-config", "partition"})
{
    Options& options = *mOptions;
    pAddConfigOptions(command);
    command
        .add_option("--listen", options.server.listen,
                    "Where to listen; port 0 lets the system choose one; may be repeated")
        ->type_name("ENDPOINT")
        ->allow_extra_args(false)
        ->transform(defaultPort())
        ->check(endpointValidator())
        ->default_str(options.server.listen.front());
    addTransportOptions(command, options.transport);
    command
        .add_option("--partition", options.partitions,
                    "A partition: its id, and the line of its serial console: a shell command, which starts when a "
                    "console opens it, "
                    "or unix:PATH, tcp:HOST:PORT, telnet:HOST:PORT, tty:DEVICE[,115200n8]; may be repeated")
        ->type_name("ID=LINE")
        ->allow_extra_args(false);
    command.add_option("--term", options.term, "Terminal type of the partitions' commands: their TERM")
        ->type_name("NAME")
        ->check(CLI::Validator(checkTerm, ""))
        ->capture_default_str();
    addPartitionChoices(command, options.serving);
    addLineLogOptions(command, options.lineLog);
    command
        .add_option(
            "--status-socket", options.statusSocket,
            "Answer qel status over this Unix socket; none: do not; by default $XDG_RUNTIME_DIR/qel-status.sock, "
            "if there is such a directory")
        ->type_name("PATH");
    addLimitOptions(command, options);
    addIdentityOptions(command, options);
    addLogOptions(command, options.log);
}

ServeInput::~ServeInput() = default;

/// --config comes first: CLI11 calls the options' callbacks in this order, and before it checks what they require.
void ServeInput::pAddConfigOptions(CLI::App& command)
{
    command
        .add_option_function<std::string>(
            "--config", [this, &command](const std::string& path) { pApplySources(command, path); },
            "Read options, partitions and rules from this file (TOML); the command line comes before variables such "
            "as QEL_LISTEN, and they come before the file")
        ->type_name("FILE")
        ->force_callback();
    CLI::Option* const check = command.add_flag("--check-config", mOptions->checkConfig,
                                                "Check the configuration, with the credentials, and exit: 0 or 2");
    command
        .add_flag("--print-config", mOptions->printConfig,
                  "Print the configuration as a file, with the origin of each value, and exit")
        ->excludes(check);
}

void ServeInput::pApplySources(const CLI::App& command, const std::string& path)
{
    // CLI11 calls the callbacks of all subcommands.
    const bool asksForHelp = command.get_help_ptr() != nullptr && command.get_help_ptr()->count() > 0;
    if (!command.parsed() || asksForHelp) return;
    const char* const variable = std::getenv(variableOf("config").c_str());
    mFile = !path.empty() || variable == nullptr ? path : variable;
    if (mFile.empty()) return mSources.apply(nullptr);
    const TomlValue file = readToml(mFile);
    mConfig = readServeConfig(file, mSources.keys());
    mSources.apply(&file);
}

ServePlan ServeInput::plan() const
{
    const Options& options = *mOptions;
    ServePlan plan;
    plan.server = parseServer(options);
    plan.transport = options.transport;
    plan.partitions = parsePartitions(options);
    addPartitions(plan.partitions, mConfig, options);
    plan.policy = {AccessRules(mConfig.rules), options.maxPerCertificate, options.mutesBroadcasts};
    if (options.transport.plain && plan.policy.rules.size() > 0) {
        throw CLI::ValidationError("rules and access need certificates, and --plain has none");
    }
    plan.warnExpiry = std::chrono::hours(24) * options.warnDays;
    plan.term = options.term;
    plan.lineLogBytes = options.lineLog.fileBytes;
    plan.statusSocket = options.statusSocket;
    plan.machine = parseMachine(options);
    plan.capabilities = QelCapabilities(options.capabilities);
    plan.log = options.log;
    plan.checkOnly = options.checkConfig;
    plan.printOnly = options.printConfig;
    plan.file = mFile;
    plan.config = mConfig;
    plan.settings = mSources.settings();
    plan.words = mSources.words();
    return plan;
}

ServePlan planAgain(const std::vector<std::string>& words)
{
    CLI::App command("", "serve");
    const ServeInput input(command);
    command.parse(std::vector<std::string>(words.rbegin(), words.rend())); // CLI11 takes them from the back
    return input.plan();
}

void printPlan(std::ostream& os, const ServePlan& plan)
{
    printSettings(os, plan.settings);
    for (const auto& entry : plan.partitions) {
        if (!entry.second.options.name.empty()) continue; // of the file
        const std::string id = std::to_string(entry.first);
        os << "\n[partition.p" << id << "]  # option\n";
        printSettings(os, {{"id", id, "option"}, {"line", tomlQuoted(entry.second.line), "option"}});
    }
    printServeConfig(os, plan.config);
}

} // namespace qel::tool
