#include "console/Connector.hpp"

#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLException.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/Logging.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include <algorithm>
#include <cerrno>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <stdexcept>
#include <sys/socket.h>
#include <utility>
#include <vector>

namespace qel::protocol {

namespace {

void require(bool isGood, const char* option, const char* reason)
{
    if (!isGood) throw std::invalid_argument(std::string(option) + ": " + reason);
}

void checkOptions(const ConsoleOptions& options)
{
    const std::chrono::milliseconds none(0);
    require(options.plain || options.credentials, "credentials", "neither credentials nor plain are given");
    require(!options.plain || !options.credentials, "plain", "it contradicts credentials");
    require(!options.plain || (options.pins.names.empty() && options.pins.fingerprints.empty()), "pins",
            "a plain connection has no certificates");
    require(options.identity.toolId.size() <= Identity::kMaxToolIdBytes, "identity.toolId", "longer than 32 bytes");
    require(options.handshakeTimeout > none, "handshakeTimeout", "not positive");
    require(options.requestTimeout != none, "requestTimeout", "zero");
    require(options.frameTimeout > none, "frameTimeout", "not positive");
    if (!options.retry) return;
    require(options.retry->first > none, "retry", "the first wait is not positive");
    require(options.retry->longest >= options.retry->first, "retry", "the first wait is longer than the longest");
    require(options.retry->factor >= 1, "retry", "the factor is below 1");
}

/// A plain connection must not leave this machine.
void requireLoopback(const std::vector<IPEndpoint>& endpoints, const std::string& server)
{
    const bool isLocal = std::all_of(endpoints.begin(), endpoints.end(),
                                     [](const IPEndpoint& endpoint) { return isLoopback(endpoint.getAddress()); });
    if (!isLocal) throw std::invalid_argument("plain: " + server + " is not a loopback address");
}

std::unique_ptr<SocketStream> tuneSocket(Socket socket, const std::string& server)
{
    try {
        return std::make_unique<SocketStream>(std::move(socket));
    } catch (const PosixError& error) {
        std::throw_with_nested(CannotConnect("cannot use connection to " + server + ": " + error.what(), server));
    }
}

/// Lets a server take any time to read. A SocketStream has a user timeout, which cuts a peer that answers and has no
/// room for data, such as a partition that is stopped while somebody types: see tcp(7). Without it data that nobody
/// acknowledges has the system's retransmission limits; the keep-alive of the stream finds an idle server that is gone.
void removeUserTimeout(const Stream& stream, const std::string& server)
{
    const auto* const socket = dynamic_cast<const SocketStream*>(&stream);
    if (socket == nullptr) return;
    const int none = 0;
    const int result = ::setsockopt(socket->getSocket().getFd(), IPPROTO_TCP, TCP_USER_TIMEOUT, &none, sizeof(none));
    if (result != 0)
        throw CannotConnect("cannot use connection to " + server + ": " + PosixError(errno).what(), server);
}

PeerPins normalizedPins(const PeerPins& pins)
{
    PeerPins normalized = pins;
    for (std::string& fingerprint : normalized.fingerprints) {
        fingerprint = normalizedFingerprint(fingerprint);
        require(!fingerprint.empty(), "pins", "not a SHA-256 fingerprint: 64 hexadecimal digits");
    }
    return normalized;
}

/// The descriptor of a stream that has one.
int descriptorOf(const Stream& stream)
{
    const auto* const socket = dynamic_cast<const SocketStream*>(&stream);
    return socket == nullptr ? -1 : socket->getSocket().getFd();
}

} // namespace

Connector::Connector(const ConsoleOptions& options, bool needsAddress)
    : mServer(options.server), mPins(normalizedPins(options.pins)),
      mHandshakeTimeout(std::min(options.handshakeTimeout, kLongestWait))
{
    checkOptions(options);
    if (needsAddress) static_cast<void>(ServerAddress::parse(options.server));
    if (options.credentials) mContext = options.credentials->makeClientContext();
}

ConnectedStream Connector::connect(TimePoint end, CloseSwitch& closeSwitch, TimePoint& handshakeEnd)
{
    const ServerAddress server = ServerAddress::parse(mServer);
    const std::vector<IPEndpoint> endpoints = resolve(server, end);
    if (mContext == nullptr) requireLoopback(endpoints, mServer);
    auto socket = tuneSocket(connectTo(server, endpoints, end), mServer);
    const int descriptor = socket->getSocket().getFd();
    return adopt(std::move(socket), descriptor, end, closeSwitch, handshakeEnd);
}

ConnectedStream Connector::adopt(std::unique_ptr<Stream> stream, int descriptor, TimePoint end,
                                 CloseSwitch& closeSwitch, TimePoint& handshakeEnd)
{
    removeUserTimeout(*stream, mServer);
    if (descriptor < 0) descriptor = descriptorOf(*stream);
    handshakeEnd = std::min(end, deadlineIn(mHandshakeTimeout));
    auto* const readiness = descriptor < 0 ? dynamic_cast<Readiness*>(stream.get()) : nullptr;
    ConnectedStream connected{std::move(stream), nullptr, descriptor, readiness, {}};
    closeSwitch.watch(connected.stream.get());
    try {
        if (mContext != nullptr) pProtect(connected, handshakeEnd, closeSwitch);
    } catch (...) {
        closeSwitch.watch(nullptr); // before the stream is destroyed
        throw;
    }
    closeSwitch.watch(nullptr);
    return connected;
}

/// Upgrades a plain connection to TLS and checks the peer.
void Connector::pProtect(ConnectedStream& connected, TimePoint end, CloseSwitch& closeSwitch)
{
    const std::string attempt = "no protected connection to " + mServer + ": ";
    try {
        limitTo(*connected.stream, end);
        requestUpgrade(*connected.stream, connected.descriptor);
        closeSwitch.watch(nullptr); // the plain stream moves into the protected one
        auto readAhead = std::make_unique<ReadAhead>(std::move(connected.stream));
        connected.readAhead = readAhead.get();
        auto owned = std::make_unique<SSLStream>(*mContext, std::move(readAhead));
        SSLStream& tls = *owned;
        connected.stream = std::move(owned);
        closeSwitch.watch(&tls);
        startTls(tls);
        connected.peer = identityOf(tls);
        checkPeer(connected.peer, mPins);
        logLine(LogLevel::Info, "connected over TLS to ", describePeer(connected.peer));
    } catch (Error& error) {
        error.addContext(attempt, mServer);
        throw;
    } catch (const SSLException& error) { // out of memory, as a rule
        std::throw_with_nested(Error(attempt + error.what(), mServer));
    }
}

} // namespace qel::protocol
