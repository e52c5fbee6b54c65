#include "proxy/ProxyCommand.hpp"

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/SignalWatch.hpp"
#include "proxy/FrameLines.hpp"
#include "proxy/PcapngWriter.hpp"
#include "proxy/Proxy.hpp"
#include "proxy/ReplayRun.hpp"
#include "transport/TransportOptions.hpp"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <fstream>
#include <initializer_list>
#include <iostream>
#include <limits>
#include <memory>
#include <optional>
#include <random>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

constexpr std::initializer_list<int> kStopSignals{SIGINT, SIGTERM, SIGHUP};
constexpr std::size_t kMaxConnections = 1000;

/// The options as they are given.
struct ProxyInput {
    std::vector<std::string> listen{"127.0.0.1:0"};
    std::string server;
    TransportOptions transport;
    bool passThrough = false;
    std::string consoleDirectory;
    std::string consoleName;
    PeerPins consolePins;
    bool consolePlain = false;
    bool serverPlain = false;
    std::size_t maxConnections = ProxyOptions().maxConnections;

    std::vector<std::string> faults;
    std::vector<std::string> faultFiles;
    std::optional<std::uint64_t> seed;

    bool json = false;
    bool dump = false;
    bool quiet = false;
    std::string stamps = "iso";
    std::vector<std::string> filters;
    std::string capture;
    std::string capturedSides = "server";
    std::string recording;
    double answerSeconds = 10;
    LogOptions log;
};

void addSideOptions(CLI::App& command, ProxyInput& input)
{
    command
        .add_option("--listen", input.listen,
                    "Where consoles connect to; port 0 lets the system choose one; may be repeated")
        ->type_name("ADDRESS")
        ->allow_extra_args(false)
        ->transform(defaultPort())
        ->check(endpointValidator())
        ->default_str(input.listen.front());
    command
        .add_option("--connect", input.server,
                    "Server to connect to: NAME:PORT, 127.0.0.1:PORT or [::1]:PORT; port " +
                        std::to_string(kDefaultPort) + " if there is none")
        ->required()
        ->type_name("SERVER")
        ->transform(defaultPort())
        ->check(serverValidator());
    addTransportOptions(command, input.transport);
    describeOption(command, "--plain", "Use no TLS on either side; for loopback addresses only");
    describeOption(command, "--credentials",
                   "Use TLS on both sides with NAME.crt, NAME.key and root.crt from this directory");
    describeOption(command, "--peer-name",
                   "Accept only a server whose certificate has this common name; may be repeated");
    describeOption(command, "--peer-fingerprint",
                   "Accept only a server whose certificate has this SHA-256 fingerprint; may be repeated");
    describeOption(command, "--handshake-timeout", "Seconds for connecting to the server and both TLS handshakes");
    CLI::Option* const directory =
        command
            .add_option("--console-credentials", input.consoleDirectory,
                        "Other credentials towards consoles: NAME.crt, NAME.key and root.crt from this directory")
            ->type_name("DIR");
    CLI::Option* const name =
        command.add_option("--console-name", input.consoleName, "Which certificate and key in that directory")
            ->type_name("NAME")
            ->check(credentialNameValidator());
    directory->needs(name);
    name->needs(directory);
    command
        .add_option("--console-peer-name", input.consolePins.names,
                    "Accept only consoles whose certificate has this common name; may be repeated")
        ->type_name("CN")
        ->allow_extra_args(false);
    CLI::Option* const consolePlain =
        command.add_flag("--console-plain", input.consolePlain, "No TLS towards consoles; loopback only")
            ->excludes(directory);
    command.add_flag("--server-plain", input.serverPlain, "No TLS towards the server; loopback only")
        ->excludes(consolePlain);
    command.add_flag("--pass-through", input.passThrough,
                     "No TLS of its own: when the peers change to TLS, their bytes pass unchanged and are not shown");
    command.add_option("--max-connections", input.maxConnections, "How many connections may be open at a time")
        ->transform(integerIn(1, kMaxConnections))
        ->capture_default_str();
}

void addFaultOptions(CLI::App& command, ProxyInput& input)
{
    command
        .add_option(
            "--fault", input.faults,
            "A rule such as \"to-server frame=3 delay=10-50ms\" or \"op=GetQelTod corrupt=mStatus p=0.1\"; may be "
            "repeated")
        ->type_name("RULE")
        ->allow_extra_args(false);
    command.add_option("--faults", input.faultFiles, "A file of rules, one on each line; # begins a comment")
        ->type_name("FILE")
        ->allow_extra_args(false)
        ->check(fileValidator());
    command.add_option("--seed", input.seed, "Decides about chance: the same seed makes the same faults")
        ->transform(integerIn(0, std::numeric_limits<std::uint64_t>::max()))
        ->type_name("INT");
}

void addOutputOptions(CLI::App& command, ProxyInput& input)
{
    command.add_flag("--json", input.json, "Print a JSON object for each thing that happens, one on each line");
    command.add_flag("--dump", input.dump, "Show the contents of each frame, as \"qel decode\" does");
    command.add_flag("--quiet", input.quiet, "Print no lines about frames");
    command
        .add_option("--timestamps", input.stamps, "The time in front of each line: in UTC, or since the line before")
        ->type_name("iso|delta|off")
        ->check(oneOf({"iso", "delta", "off"}))
        ->capture_default_str();
    command
        .add_option("--filter", input.filters,
                    "Show these frames only, such as \"to-server op=GetQelTod\" or \"function=VirtualSerial\"; may be "
                    "repeated")
        ->type_name("MATCH")
        ->allow_extra_args(false);
}

void addCaptureOptions(CLI::App& command, ProxyInput& input)
{
    CLI::Option* const file =
        command
            .add_option("--write", input.capture,
                        "Write what passes to this file, as a capture in pcapng form; TLS is decrypted")
            ->type_name("FILE");
    command
        .add_option("--write-side", input.capturedSides,
                    "Which connections the capture holds: those with the server, with the consoles, or both")
        ->type_name("server|console|both")
        ->check(oneOf({"server", "console", "both"}))
        ->capture_default_str()
        ->needs(file);
}

void addReplayOptions(CLI::App& command, ProxyInput& input)
{
    CLI::Option* const replay =
        command
            .add_option(
                "--replay", input.recording,
                "Instead of listening: send the console's frames of this recording to the server and compare its "
                "answers. A capture, raw frames or hexadecimal text")
            ->type_name("FILE")
            ->check(fileValidator());
    for (const char* name : {"listen", "pass-through", "console-credentials", "console-peer-name", "console-plain",
                             "server-plain", "fault", "faults", "seed", "filter", "write", "dump", "quiet"})
        replay->excludes(findOption(command, name));
    command.add_option("--answer-timeout", input.answerSeconds, "With --replay: seconds for each answer")
        ->type_name("SECONDS")
        ->check(numberIn(0.001, 86400))
        ->capture_default_str()
        ->needs(replay);
}

CapturedSides sidesOf(const std::string& text)
{
    if (text == "both") return CapturedSides::Both;
    return text == "console" ? CapturedSides::Console : CapturedSides::Server;
}

TimeStamps::Style styleOf(const std::string& text)
{
    if (text == "off") return TimeStamps::Style::Off;
    return text == "delta" ? TimeStamps::Style::Delta : TimeStamps::Style::Iso;
}

/// What the options mean. Everything that can be checked without a connection has been.
struct ProxyPlan {
    ProxyInput input;
    FaultPlan faults;
    FrameLinesOptions lines;
    std::optional<TransportOptions> console; ///< towards consoles; none: no TLS
    std::optional<TransportOptions> server;
};

std::vector<FaultRule> readRules(const ProxyInput& input)
{
    std::vector<FaultRule> rules;
    for (const std::string& text : input.faults)
        rules.push_back(parseFaultRule({text, "--fault"}));
    for (const std::string& name : input.faultFiles) {
        std::ifstream file(name);
        if (!file) throw std::invalid_argument("--faults: cannot open " + name + ": " + PosixError(errno).what());
        const std::vector<FaultRule> more = readFaultRules(file, name);
        rules.insert(rules.end(), more.begin(), more.end());
    }
    return rules;
}

void checkLoopback(const ProxyInput& input, bool consoles, bool server)
{
    for (const std::string& endpoint : input.listen) {
        if (consoles && !isLoopback(IPEndpoint(endpoint).getAddress()))
            throw CLI::ValidationError(plainRefusal(endpoint));
    }
    if (!server) return;
    try {
        const IPEndpoint endpoint(input.server);
        if (!isLoopback(endpoint.getAddress())) throw CLI::ValidationError(plainRefusal(input.server));
    } catch (const std::invalid_argument&) { // a name: its addresses are checked when they are known
    }
}

void planTransport(ProxyPlan& plan)
{
    const ProxyInput& input = plan.input;
    const TransportOptions& transport = input.transport;
    const bool hasCredentials = !transport.directory.empty() || !transport.files.certificate.empty();
    const bool hasSides = !input.consoleDirectory.empty() || input.consolePlain || input.serverPlain;
    if (input.passThrough) {
        if (transport.plain || hasCredentials || hasSides)
            throw CLI::ValidationError("--pass-through takes no credentials and no --plain: the peers decide");
        return;
    }
    checkCredentials(transport);
    if (transport.plain && hasSides)
        throw CLI::ValidationError("--plain concerns both sides: it excludes --console-... and --server-plain");
    checkLoopback(input, transport.plain || input.consolePlain, transport.plain || input.serverPlain);
    if (transport.plain) return;
    if (!input.serverPlain) plan.server = transport;
    if (input.consolePlain) return;
    plan.console = transport;
    plan.console->pins = input.consolePins;
    if (input.consoleDirectory.empty()) return;
    plan.console->directory = input.consoleDirectory;
    plan.console->name = input.consoleName;
}

ProxyPlan planOf(const ProxyInput& input)
{
    ProxyPlan plan{input, {}, {}, {}, {}};
    try {
        plan.faults.rules = readRules(input);
        for (const std::string& filter : input.filters)
            plan.lines.filter.add(filter);
    } catch (const std::invalid_argument& error) {
        throw CLI::ValidationError(error.what());
    }
    plan.faults.seed = input.seed ? *input.seed : std::random_device()();
    plan.lines.json = input.json;
    plan.lines.dump = input.dump;
    plan.lines.quiet = input.quiet;
    plan.lines.stamps = styleOf(input.stamps);
    planTransport(plan);
    return plan;
}

ReplayPlan replayOf(const ProxyInput& input)
{
    checkLoopback(input, false, input.transport.plain);
    ReplayPlan plan;
    plan.file = input.recording;
    plan.server = input.server;
    plan.transport = input.transport;
    plan.timeout =
        std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(input.answerSeconds));
    plan.json = input.json;
    return plan;
}

ProxyOptions optionsOf(const ProxyPlan& plan)
{
    const ProxyInput& input = plan.input;
    ProxyOptions options;
    options.listen.clear();
    for (const std::string& endpoint : input.listen)
        options.listen.emplace_back(endpoint);
    options.maxConnections = input.maxConnections;
    options.plan = plan.faults;
    ProxyTarget& target = options.target;
    target.timeout = input.transport.handshakeTimeout();
    target.endpoints = resolve(ServerAddress::parse(input.server), TimeProvider::steady() + target.timeout);
    const bool isPlain = input.transport.plain || input.serverPlain;
    const bool isLocal = std::all_of(target.endpoints.begin(), target.endpoints.end(),
                                     [](const IPEndpoint& one) { return isLoopback(one.getAddress()); });
    if (isPlain && !isLocal) throw CommandFailure(ExitStatus::Usage, plainRefusal(input.server));
    if (plan.console) {
        target.consoleContext = loadCredentials(*plan.console)->makeServerContext();
        target.consolePins = plan.console->pins;
    }
    if (plan.server) {
        target.serverContext = loadCredentials(*plan.server)->makeClientContext();
        target.serverPins = plan.server->pins;
    }
    return options;
}

void printLines(const std::string& lines)
{
    std::cout.write(lines.data(), static_cast<std::streamsize>(lines.size()));
    flushOutput();
}

/// Tells the lines, and the capture if there is one.
class Listeners final : public ProxyObserver {
public:
    Listeners(FrameLines& lines, PcapngWriter* capture) : mLines(lines), mCapture(capture) {}

    void onFrame(const FlowPlace& place, std::uint64_t number, const FrameView& frame) override
    {
        mLines.onFrame(place, number, frame);
    }
    void onFault(const FlowPlace& place, std::uint64_t number, const FaultRule& rule, const std::string& what) override
    {
        mLines.onFault(place, number, rule, what);
        if (mCapture != nullptr) mCapture->onFault(place, number, rule, what);
    }
    void onNote(const FlowPlace& place, const std::string& text) override { mLines.onNote(place, text); }
    void onOpened(std::uint64_t connection, const ProxyAddresses& addresses) override
    {
        mLines.onOpened(connection, addresses);
        if (mCapture != nullptr) mCapture->onOpened(connection, addresses);
    }
    void onConnectionNote(std::uint64_t connection, const std::string& text) override
    {
        mLines.onConnectionNote(connection, text);
    }
    void onBytes(std::uint64_t connection, ProxySide side, Way way, std::string_view bytes) override
    {
        if (mCapture != nullptr) mCapture->onBytes(connection, side, way, bytes);
    }
    void onEnd(const FlowPlace& place) override
    {
        mLines.onEnd(place);
        if (mCapture != nullptr) mCapture->onEnd(place);
    }
    void onClosed(std::uint64_t connection, const std::string& why, const FrameFlow& toServer,
                  const FrameFlow& toConsole) override
    {
        mLines.onClosed(connection, why, toServer, toConsole);
        if (mCapture != nullptr) mCapture->onClosed(connection, why, toServer, toConsole);
    }
    void onRefused(std::uint64_t connection, const std::string& why) override { mLines.onRefused(connection, why); }
    void onIdle() override
    {
        mLines.onIdle();
        if (mCapture == nullptr) return;
        mCapture->onIdle();
        const std::string failure = mCapture->takeFailure();
        if (!failure.empty()) std::cerr << "qel: " << failure << std::endl;
    }

private:
    FrameLines& mLines;
    PcapngWriter* const mCapture;
};

ExitStatus runProxy(const ProxyPlan& plan)
{
    startLogging(plan.input.log, "qel-proxy.log");
    static_cast<void>(std::signal(SIGPIPE, SIG_IGN)); // a reader of the lines that goes away is reported
    SignalWatch signals(kStopSignals);
    FrameLines lines(plan.lines, printLines);
    std::unique_ptr<PcapngWriter> capture;
    if (!plan.input.capture.empty())
        capture = std::make_unique<PcapngWriter>(plan.input.capture, sidesOf(plan.input.capturedSides));
    Listeners listeners(lines, capture.get());
    Proxy proxy(optionsOf(plan), listeners);
    if (!plan.faults.rules.empty() && !plan.input.seed)
        std::cerr << "qel: note: --seed " << plan.faults.seed << " repeats this run" << std::endl;
    lines.listening(proxy.endpoints(), plan.input.server, plan.faults.seed);
    proxy.run(signals.getPollFd());
    static_cast<void>(signals.take());
    proxy.finish();
    lines.summary(proxy.acceptedCount());
    return ExitStatus::Done;
}

} // namespace

CLI::App& addProxyCommand(CLI::App& parent, Action& action)
{
    CLI::App& command =
        addCommand(parent, "proxy", "Stand between two peers: show what they say, and disturb it by rules");
    const auto input = std::make_shared<ProxyInput>();
    addSideOptions(command, *input);
    addFaultOptions(command, *input);
    addOutputOptions(command, *input);
    addCaptureOptions(command, *input);
    addReplayOptions(command, *input);
    input->log.usual = LogLevel::Error;
    input->log.quiet = true;
    addLogOptions(command, input->log);
    command.callback([&action, input] {
        if (input->recording.empty()) {
            action = [plan = planOf(*input)] { return runProxy(plan); };
        } else {
            checkCredentials(input->transport);
            action = [plan = replayOf(*input), log = input->log] {
                startLogging(log, "qel-proxy.log");
                return runReplay(plan);
            };
        }
    });
    return command;
}

} // namespace qel::tool
