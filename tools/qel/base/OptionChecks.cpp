#include "base/OptionChecks.hpp"

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/protocol/ServerAddress.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "base/UsageErrors.hpp"

#include <algorithm>
#include <charconv>
#include <exception>
#include <filesystem>
#include <iomanip>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <string>
#include <system_error>
#include <utility>

namespace qel::tool {

namespace {

bool isEndpoint(const std::string& text)
{
    try {
        static_cast<void>(IPEndpoint(text));
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

/// Why a text is not an endpoint. The library's own message does not help here: it takes any host that is not an IPv4
/// address for an IPv6 address, and has no text for a missing port.
std::string endpointProblem(const std::string& endpoint)
{
    const std::size_t colon = endpoint.rfind(':');
    const bool endsWithHost = colon == std::string::npos || endpoint.back() == ']';
    if (endsWithHost) return "the port is missing";
    if (colon + 1 == endpoint.size()) return "the port after the last ':' is missing";
    const std::string port = endpoint.substr(colon + 1);
    if (!isEndpoint("0.0.0.0:" + port)) return tool::quoted(port) + " is not a port in [0, 65535]";
    const std::string host = endpoint.substr(0, colon);
    if (isEndpoint("[" + host + "]:0")) return "write an IPv6 address in brackets";
    return tool::quoted(host) + " is not an IP address (names are not looked up)";
}

std::string checkEndpoint(std::string& text)
{
    if (isEndpoint(text)) return {};
    return tool::quoted(text) + " is not an endpoint such as 127.0.0.1:4711 or [::1]:4711: " + endpointProblem(text);
}

bool isServer(const std::string& text)
{
    try {
        static_cast<void>(ServerAddress::parse(text));
        return true;
    } catch (const std::invalid_argument&) {
        return false;
    }
}

std::string addDefaultPort(std::string& text)
{
    const std::string withPort = text + ":" + std::to_string(kDefaultPort);
    if (!isServer(text) && !isEndpoint(text) && isServer(withPort)) text = withPort;
    return {};
}

std::string checkServer(std::string& text)
{
    try {
        static_cast<void>(ServerAddress::parse(text));
        return {};
    } catch (const std::invalid_argument& error) {
        if (isEndpoint("[" + text + "]:0"))
            return tool::quoted(text) + ": write an IPv6 address in brackets, such as [::1] or [::1]:4717";
        const std::string prefix = "server: "; // the parser names the option itself
        const std::string reason = error.what();
        return reason.compare(0, prefix.size(), prefix) == 0 ? reason.substr(prefix.size()) : reason;
    }
}

std::string checkCapabilities(std::string& text)
{
    if (text.find_first_not_of("01") != std::string::npos) {
        return tool::quoted(text) + " is not a capability set: write each bit as 0 or 1";
    }
    if (text.size() > QelCapabilities::size()) return "longer than 32 bits";
    return {};
}

std::string checkFile(std::string& name)
{
    std::error_code error; // ignored: opening the file reports everything but its absence
    const bool isMissing = std::filesystem::status(name, error).type() == std::filesystem::file_type::not_found;
    return isMissing ? tool::quoted(name) + " does not exist" : std::string();
}

/// A number as a person writes it: 0.5, 86400, 1000000.
std::string plainNumber(double number)
{
    std::ostringstream text;
    text << std::setprecision(std::numeric_limits<double>::digits10) << number;
    return text.str();
}

} // namespace

std::optional<std::uint64_t> parseInteger(const std::string& text)
{
    const bool isHexadecimal = text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
    const char* const begin = text.data() + (isHexadecimal ? 2 : 0);
    const char* const end = text.data() + text.size();
    std::uint64_t number = 0;
    const auto result = std::from_chars(begin, end, number, isHexadecimal ? 16 : 10);
    if (result.ec != std::errc() || result.ptr != end) return std::nullopt;
    return number;
}

CLI::Validator integerIn(std::uint64_t min, std::uint64_t max)
{
    return CLI::Validator(
        [min, max](std::string& text) {
            const auto number = parseInteger(text);
            if (!number || *number < min || *number > max) return notAnIntegerIn(text, min, max);
            text = std::to_string(*number);
            return std::string();
        },
        "INT in [" + std::to_string(min) + ", " + std::to_string(max) + "]");
}

std::string notAnIntegerIn(const std::string& text, std::uint64_t min, std::uint64_t max)
{
    return tool::quoted(text) + " is not an integer in [" + std::to_string(min) + ", " + std::to_string(max) + "]";
}

CLI::Validator numberIn(double min, double max)
{
    const std::string range = "[" + plainNumber(min) + ", " + plainNumber(max) + "]";
    return CLI::Validator(
        [min, max, range](std::string& text) {
            double number = 0;
            // NaN compares false with both limits, so it is refused too.
            const bool isInRange = CLI::detail::lexical_cast(text, number) && number >= min && number <= max;
            return isInRange ? std::string() : tool::quoted(text) + " is not a number in " + range;
        },
        "FLOAT in " + range);
}

CLI::Validator oneOf(std::vector<std::string> words)
{
    return CLI::Validator(
        [words = std::move(words)](std::string& text) {
            if (std::find(words.begin(), words.end(), text) != words.end()) return std::string();
            std::string all;
            for (const std::string& word : words)
                all += (all.empty() ? "" : ", ") + word;
            const std::string guess = nearestWord(text, words);
            return tool::quoted(text) + " is none of " + all +
                   (guess.empty() ? "" : "; did you mean " + tool::quoted(guess) + "?");
        },
        "");
}

CLI::Validator textUpTo(std::size_t bytes)
{
    return CLI::Validator(
        [bytes](std::string& text) {
            return text.size() <= bytes ? std::string() : "longer than " + std::to_string(bytes) + " bytes";
        },
        "");
}

CLI::Validator endpointValidator() { return CLI::Validator(checkEndpoint, ""); }

CLI::Validator defaultPort() { return CLI::Validator(addDefaultPort, ""); }

CLI::Validator serverValidator() { return CLI::Validator(checkServer, ""); }

CLI::Validator capabilityValidator() { return CLI::Validator(checkCapabilities, ""); }

CLI::Validator fileValidator() { return CLI::Validator(checkFile, ""); }

CLI::Option* findOption(CLI::App& command, const std::string& name)
{
    for (CLI::Option* option : command.get_options()) {
        if (option->check_lname(name)) return option;
    }
    return nullptr;
}

void describeOption(CLI::App& command, const std::string& name, const std::string& description)
{
    for (CLI::Option* option : command.get_options()) {
        if (option->get_name() == name) option->description(description);
    }
}

} // namespace qel::tool
