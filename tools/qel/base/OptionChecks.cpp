#include "base/OptionChecks.hpp"

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/net/IPEndpoint.hpp>

#include <charconv>
#include <cmath>
#include <exception>
#include <filesystem>
#include <string>
#include <system_error>

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

} // namespace qel::tool
