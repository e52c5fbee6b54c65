#include "server/CheckedOptions.hpp"

#include <qel/protocol/ServerAddress.hpp>

#include <stdexcept>
#include <string>

namespace qel::protocol {

namespace {

/// TCP takes keep-alive times up to this; half of it counts.
constexpr std::chrono::seconds kMaxKeepAlive{32767};

/// Times up to this can be added to any time of the clock, and fit the timeout of poll(2).
constexpr std::chrono::hours kMaxTime{24};

void require(bool condition, const char* text)
{
    if (!condition) throw std::invalid_argument(text);
}

IPEndpoint parseEndpoint(const std::string& text)
{
    try {
        return IPEndpoint(text);
    } catch (const std::exception&) {
        throw std::invalid_argument("listen: \"" + text + "\" is not an IP address and port");
    }
}

void checkLimits(const ServerOptions& options)
{
    require(options.maxConsoles > 0, "maxConsoles: at least 1");
    require(options.maxHandshakes > 0, "maxHandshakes: at least 1");
    require(options.maxHandshakesPerAddress > 0, "maxHandshakesPerAddress: at least 1");
    require(options.queueBytes > 0, "queueBytes: at least 1");
    require(options.handshakeTimeout.count() > 0, "handshakeTimeout: more than 0");
    require(options.handshakeTimeout <= kMaxTime, "handshakeTimeout: at most 24 hours");
    require(options.frameTimeout.count() > 0, "frameTimeout: more than 0");
    require(options.frameTimeout <= kMaxTime, "frameTimeout: at most 24 hours");
    require(options.keepAlive.count() > 0 && options.keepAlive <= kMaxKeepAlive, "keepAlive: 1 to 32767 seconds");
    require(options.idleTimeout.count() >= 0 && options.idleTimeout <= kMaxTime, "idleTimeout: 0 to 24 hours");
    require(options.linger.count() >= 0, "linger: 0 or more");
    require(options.linger <= kMaxTime, "linger: at most 24 hours");
}

} // namespace

std::vector<IPEndpoint> checkOptions(const ServerOptions& options)
{
    checkLimits(options);
    require(options.plain || options.credentials, "credentials: give credentials, or ask for plain connections");
    require(!options.plain || !options.credentials, "plain: connections with credentials are not plain");
    require(!options.plain || (options.pins.names.empty() && options.pins.fingerprints.empty()),
            "pins: plain connections have no certificate to compare with");
    std::vector<IPEndpoint> endpoints;
    for (const std::string& text : options.listen) {
        endpoints.push_back(parseEndpoint(text));
        require(!options.plain || isLoopback(endpoints.back().getAddress()), "plain: for loopback addresses only");
    }
    return endpoints;
}

} // namespace qel::protocol
