#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "base/TimeLeft.hpp"
#include "transport/Lookup.hpp"

#include <algorithm>
#include <cctype>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <optional>
#include <stdexcept>
#include <sys/socket.h>
#include <utility>

namespace qel::protocol {

namespace {

constexpr std::size_t kMaxHostLength = 255; // RFC 1123, 2.1
constexpr int kMaxSegmentBytes = 16384;

[[noreturn]] void refuse(const std::string& text, const char* reason)
{
    throw std::invalid_argument("server: \"" + text + "\" " + reason);
}

bool isHostCharacter(char c)
{
    return std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '-' || c == '_' || c == '.';
}

bool isHostName(const std::string& host)
{
    return !host.empty() && host.size() <= kMaxHostLength && host.front() != '-' &&
           std::all_of(host.begin(), host.end(), isHostCharacter);
}

std::uint16_t parsePort(const std::string& text, const std::string& port)
{
    constexpr unsigned long kMaxPort = 65535;
    constexpr std::size_t kMaxDigits = 5;
    const bool isNumber = !port.empty() && port.size() <= kMaxDigits &&
                          std::all_of(port.begin(), port.end(), [](char c) { return c >= '0' && c <= '9'; });
    const unsigned long number = isNumber ? std::stoul(port) : 0;
    if (number == 0 || number > kMaxPort) refuse(text, "has no port from 1 to 65535 after its last colon");
    return static_cast<std::uint16_t>(number);
}

std::optional<IPEndpoint> numericEndpoint(const std::string& text)
{
    try {
        return IPEndpoint(text);
    } catch (const std::exception&) {
        return std::nullopt;
    }
}

} // namespace

ServerAddress ServerAddress::parse(const std::string& text)
{
    const std::size_t colon = text.rfind(':');
    if (colon == std::string::npos) refuse(text, "has no port from 1 to 65535 after its last colon");
    const std::uint16_t port = parsePort(text, text.substr(colon + 1));
    std::string host = text.substr(0, colon);
    if (!numericEndpoint(text) && !isHostName(host)) refuse(text, "does not begin with a host name or an IP address");
    const bool isBracketed = host.size() > 2 && host.front() == '[' && host.back() == ']';
    if (isBracketed) host = host.substr(1, host.size() - 2);
    return ServerAddress(std::move(host), port);
}

ServerAddress::ServerAddress(std::string host, std::uint16_t port) : mHost(std::move(host)), mPort(port) {}

std::string ServerAddress::str() const
{
    const bool needsBrackets = mHost.find(':') != std::string::npos;
    return (needsBrackets ? "[" + mHost + "]" : mHost) + ":" + std::to_string(mPort);
}

bool isLoopback(const IPAddress& address)
{
    constexpr unsigned char kLoopbackNet = 127;
    if (address.getFamily() == IPFamily::IPv4) return address.getIPv4().bytes()[0] == kLoopbackNet;
    const IPv6Address& ipv6 = address.getIPv6();
    if (ipv6.isIPv4Mapped()) return ipv6.bytes()[12] == kLoopbackNet;
    return ipv6.str() == "::1";
}

std::vector<IPEndpoint> resolve(const ServerAddress& server, TimePoint deadline)
{
    if (const auto endpoint = numericEndpoint(server.str())) return {*endpoint};
    return lookUp(server.getHost(), server.getPort(), deadline);
}

Socket connectTo(const ServerAddress& server, const std::vector<IPEndpoint>& endpoints, TimePoint deadline)
{
    std::size_t attemptsLeft = endpoints.size();
    for (const IPEndpoint& endpoint : endpoints) {
        const auto timeLeft = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - TimeProvider::steady());
        const auto share = std::max(timeLeft / static_cast<int>(attemptsLeft), kShortestWait);
        --attemptsLeft;
        try {
            Socket socket(endpoint.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
            // Over loopback a segment could be as long as the receive buffer of a SocketStream. TCP sends no part of
            // it, so a server that has more to send than there is room for would wait until a timer of 200 ms.
            socket.setSocketOption(IPPROTO_TCP, TCP_MAXSEG, kMaxSegmentBytes);
            socket.connect(endpoint, share);
            return socket;
        } catch (const PosixError& error) {
            if (attemptsLeft != 0) continue;
            std::throw_with_nested(
                CannotConnect("cannot connect to " + server.str() + ": " + error.what(), server.str()));
        }
    }
    throw CannotConnect("cannot connect to " + server.str() + ": it has no address", server.str());
}

} // namespace qel::protocol
