#include "CommonOptions.hpp"

#include <qel/common/QelCapabilities.hpp>

#include <charconv>
#include <cmath>
#include <exception>
#include <filesystem>
#include <limits>
#include <system_error>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr std::size_t kToolIdBytes = 32;
constexpr double kShortestTimeout = 0.001;
constexpr double kLongestTimeout = 24 * 60 * 60;

bool isEndpoint(const std::string& text)
{
    try {
        static_cast<void>(IPEndpoint(text));
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

/// Why a text is no endpoint. What the library says is for those who know its parser: it takes any host that is no IPv4
/// address for an IPv6 address, and for a missing port it has no text of its own.
std::string reasonAgainst(const std::string& endpoint)
{
    const std::size_t colon = endpoint.rfind(':');
    const bool endsWithHost = colon == std::string::npos || endpoint.back() == ']';
    if (endsWithHost) return "the port is missing";
    if (colon + 1 == endpoint.size()) return "the port behind the last ':' is missing";
    const std::string port = endpoint.substr(colon + 1);
    if (!isEndpoint("0.0.0.0:" + port)) return "'" + port + "' is no port from 0 to 65535";
    const std::string host = endpoint.substr(0, colon);
    if (isEndpoint("[" + host + "]:0")) return "an IPv6 address stands in brackets";
    return "'" + host + "' is no IP address; names are not looked up";
}

std::string checkEndpoint(std::string& text)
{
    if (isEndpoint(text)) return {};
    return "'" + text + "' is no endpoint, such as 127.0.0.1:4711 or [::1]:4711: " + reasonAgainst(text);
}

std::string checkCapabilities(std::string& text)
{
    if (text.size() > QelCapabilities::size()) return "more than 32 capability bits";
    if (text.find_first_not_of("01") != std::string::npos) return "capability bits are written as 0 and 1";
    return {};
}

std::string checkFile(std::string& name)
{
    std::error_code error; // not looked at: whatever else is wrong with the file shows when it is opened
    const bool isMissing = std::filesystem::status(name, error).type() == std::filesystem::file_type::not_found;
    return isMissing ? "'" + name + "' does not exist" : std::string();
}

std::string checkToolId(std::string& text)
{
    return text.size() <= kToolIdBytes ? std::string() : "the tool id is longer than 32 bytes";
}

/// @return false: it is none, or has more digits than any number here
bool parseWholeNumber(const std::string& text, std::uint64_t& number)
{
    const bool isHexadecimal = text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
    const char* const begin = text.data() + (isHexadecimal ? 2 : 0);
    const char* const end = text.data() + text.size();
    const auto result = std::from_chars(begin, end, number, isHexadecimal ? 16 : 10);
    return result.ec == std::errc() && result.ptr == end;
}

} // namespace

std::chrono::milliseconds ConnectOptions::timeout() const
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(timeoutSeconds));
}

void addConnectOptions(CLI::App& app, ConnectOptions& options)
{
    app.add_option("--connect", options.endpoint, "The hypervisor end, as 127.0.0.1:PORT or [::1]:PORT")
        ->required()
        ->type_name("ENDPOINT")
        ->check(endpointValidator());
    addTransportOptions(app, options.transport);
    app.add_option("--timeout", options.timeoutSeconds, "Seconds for connecting and all answers together")
        ->type_name("SECONDS")
        ->check(numberBetween(kShortestTimeout, kLongestTimeout))
        ->capture_default_str();
    app.add_option("--tool-type", options.identity.toolType, "Type that this console introduces itself with")
        ->transform(wholeNumberBetween(0, std::numeric_limits<std::uint32_t>::max()))
        ->capture_default_str();
    app.add_option("--tool-id", options.identity.toolId,
                   "Id that this console introduces itself with, at most 32 bytes; qel-<process id> unless given")
        ->check(CLI::Validator(checkToolId, ""));
}

void addJsonOption(CLI::App& app, bool& json)
{
    app.add_flag("--json", json, "Print one JSON document instead of text for people");
}

CLI::Validator endpointValidator() { return CLI::Validator(checkEndpoint, ""); }

CLI::Validator capabilityValidator() { return CLI::Validator(checkCapabilities, ""); }

CLI::Validator fileValidator() { return CLI::Validator(checkFile, ""); }

CLI::Validator numberBetween(double least, double most)
{
    const CLI::Range range(least, most);
    return CLI::Validator(
        [range](std::string& text) {
            const std::string failure = range(text);
            double number = 0;
            // A NaN is neither below the one nor above the other, and passes for a number between them.
            const bool isNumber = CLI::detail::lexical_cast(text, number) && !std::isnan(number);
            return failure.empty() && !isNumber ? "'" + text + "' is no number" : failure;
        },
        range.get_description());
}

CLI::Validator wholeNumberBetween(std::uint64_t least, std::uint64_t most)
{
    const std::string from = std::to_string(least);
    const std::string to = std::to_string(most);
    return CLI::Validator(
        [least, most, from, to](std::string& text) {
            std::uint64_t number = 0;
            if (!parseWholeNumber(text, number) || number < least || number > most) {
                return "'" + text + "' is no whole number from " + from + " to " + to;
            }
            text = std::to_string(number);
            return std::string();
        },
        "INT in [" + from + " - " + to + "]");
}

bool isLoopback(const IPAddress& address)
{
    constexpr unsigned char kLoopbackNet = 127;
    if (address.getFamily() == IPFamily::IPv4) return address.getIPv4().bytes()[0] == kLoopbackNet;
    const IPv6Address& ipv6 = address.getIPv6();
    if (ipv6.isIPv4Mapped()) return ipv6.bytes()[12] == kLoopbackNet;
    return ipv6.str() == "::1";
}

IdentityOptions completeIdentity(const IdentityOptions& options)
{
    IdentityOptions identity = options;
    if (identity.toolId.empty()) identity.toolId = "qel-" + std::to_string(::getpid());
    return identity;
}

} // namespace qel::tool
