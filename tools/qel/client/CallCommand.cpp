#include "client/CallCommand.hpp"

#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "base/Failures.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/RefusalReason.hpp"
#include "client/CallRequests.hpp"
#include "client/ConnectOptions.hpp"

#include <chrono>
#include <functional>
#include <iostream>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <utility>

namespace qel::tool {

namespace {

struct CallOptions {
    ConnectOptions connect;
    LogOptions log;
    bool json = false;
};

/// The arguments of all requests; each request uses its own.
struct RequestArguments {
    std::string capabilities = std::string(QelCapabilities::size(), '1');
    std::uint32_t mode = 0;
    std::string mtms;
    std::string metadata;
    std::uint32_t broadcastType = 0;
    BroadcastAddress address;
    std::string broadcast;
};

struct Call {
    CallOptions options;
    RequestArguments arguments;
};

using TimePoint = std::chrono::steady_clock::time_point;
using RequestMaker = std::function<CallRequest(const RequestArguments&)>;

void print(const CallOptions& options, const CallRequest& request, const QelMessage& response)
{
    const Answer answer = request.describe(response);
    if (options.json) {
        auto document = jsonHead(request.name, response.getStatus(), response.getStatusDetail());
        document.update(answer.json());
        printJson(std::cout, document);
    } else if (answer.json().empty()) {
        std::cout << "done\n";
    } else {
        answer.print(std::cout);
    }
}

void printRefusal(const CallRequest& request, const QelMessage& response)
{
    auto document = jsonHead(request.name, response.getStatus(), response.getStatusDetail());
    document["refused"] = requestName(response);
    printJson(std::cout, document);
}

/// Sends the request and leaves.
/// @param end  for all of it
std::unique_ptr<QelMessage> callRequest(Console& console, const CallRequest& request, TimePoint end)
{
    if (request.message == nullptr) return console.version().clone();
    if (request.needsSession) console.openSession(timeLeft(end));
    auto response = console.exchange(*request.message, timeLeft(end));
    if (response->getStatus() != QelMessageStatusNoError) throw StatusError(*response, console.getServer());
    return response;
}

ExitStatus runCall(const CallOptions& options, const CallRequest& request)
{
    startLogging(options.log, "qel-call.log");
    const TimePoint end = TimeProvider::steady() + options.connect.timeout();
    std::optional<Console> console;
    try {
        console.emplace(connectConsole(options.connect));
        const auto response = callRequest(*console, request, end);
        console->leave();
        print(options, request, *response);
        return ExitStatus::Done;
    } catch (const StatusError& refusal) {
        if (console) console->leave();
        if (options.json) printRefusal(request, refusal.getResponse());
        flushOutput();
        throw;
    }
}

CLI::App& addRequest(CLI::App& command, Action& action, const std::shared_ptr<Call>& call, const char* name,
                     const char* description, RequestMaker make)
{
    CLI::App& request = addCommand(command, name, description);
    request.fallthrough(); // accept the options of "call" after the request too
    request.footer("The options of \"qel call\", such as --connect and --json, are accepted here too.");
    request.callback([&action, call, make = std::move(make)] {
        checkConnect(call->options.connect);
        action = [call, make] { return runCall(call->options, make(call->arguments)); };
    });
    return request;
}

void addPlainRequests(CLI::App& command, Action& action, const std::shared_ptr<Call>& call)
{
    const auto add = [&](const char* name, const char* description, CallRequest (*make)()) {
        addRequest(command, action, call, name, description, [make](const RequestArguments&) { return make(); });
    };
    add("version", "Identity and interface version of the server", versionRequest);
    add("limits", "Maximum sizes of commands, number of consoles", limitsRequest);
    add("time", "Time of day of the server", timeRequest);
    add("max-sessions", "Maximum number of virtual serial sessions", maxSessionsRequest);
    add("get-mode", "The global mode attribute", getModeRequest);
    add("get-metadata", "The metadata of the global save area", getMetadataRequest);
}

void addCapabilities(CLI::App& command, Action& action, const std::shared_ptr<Call>& call)
{
    CLI::App& request = addRequest(
        command, action, call, "capabilities", "Exchange capabilities",
        [](const RequestArguments& arguments) { return capabilitiesRequest(QelCapabilities(arguments.capabilities)); });
    request.add_option("bits", call->arguments.capabilities, "Capabilities to offer, bit 0 first (default: all)")
        ->type_name("BITS")
        ->check(capabilityValidator());
}

void addSetMode(CLI::App& command, Action& action, const std::shared_ptr<Call>& call)
{
    CLI::App& request = addRequest(command, action, call, "set-mode", "Set the global mode attribute",
                                   [](const RequestArguments& arguments) {
                                       return setModeRequest(static_cast<std::uint8_t>(arguments.mode), arguments.mtms);
                                   });
    request.add_option("mode", call->arguments.mode, "0 to 255")->required()->transform(integerIn(0, 255));
    request.add_option("mtms", call->arguments.mtms, "Machine type, model and serial")->check(textUpTo(kMaxMtms));
}

void addSetMetadata(CLI::App& command, Action& action, const std::shared_ptr<Call>& call)
{
    CLI::App& request =
        addRequest(command, action, call, "set-metadata", "Set the metadata of the global save area",
                   [](const RequestArguments& arguments) { return setMetadataRequest(arguments.metadata); });
    request.add_option("metadata", call->arguments.metadata, "Any text")->required()->check(textUpTo(kMaxMetadata));
}

CallRequest makeBroadcast(const RequestArguments& arguments)
{
    BroadcastAddress address = arguments.address;
    address.type = static_cast<std::uint8_t>(arguments.broadcastType);
    return broadcastRequest(address, arguments.broadcast);
}

void addBroadcast(CLI::App& command, Action& action, const std::shared_ptr<Call>& call)
{
    RequestArguments& arguments = call->arguments;
    CLI::App& request =
        addRequest(command, action, call, "broadcast", "Send text to the other consoles", makeBroadcast);
    request.add_option("text", arguments.broadcast, "Text to send")->required()->check(textUpTo(kMaxBroadcast));
    CLI::Option* const type =
        request.add_option("--type", arguments.broadcastType, "Broadcast type; type 1 goes to a single console")
            ->transform(integerIn(0, 255))
            ->capture_default_str();
    request.add_option("--to-type", arguments.address.toolType, "Tool type of the addressed console")
        ->transform(integerIn(0, std::numeric_limits<std::uint32_t>::max()))
        ->needs(type);
    request.add_option("--to-id", arguments.address.toolId, "Tool id of the addressed console")
        ->needs(type)
        ->check(textUpTo(32));
    // The library refuses to build a type 1 broadcast without a tool id; here that is a usage error.
    request.parse_complete_callback([&arguments] {
        if (arguments.broadcastType == 1 && arguments.address.toolId.empty()) {
            throw CLI::ValidationError("--type 1 needs --to-id");
        }
    });
}

} // namespace

CLI::App& addCallCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "call", "Send one request to a server and print the response");
    const auto call = std::make_shared<Call>();
    addConnectOptions(command, call->options.connect);
    addJsonOption(command, call->options.json);
    call->options.log.usual = LogLevel::Warn;
    call->options.log.quiet = true;
    addLogOptions(command, call->options.log);
    command.require_subcommand(1);

    addPlainRequests(command, action, call);
    addCapabilities(command, action, call);
    addSetMode(command, action, call);
    addSetMetadata(command, action, call);
    addBroadcast(command, action, call);
    return command;
}

} // namespace qel::tool
