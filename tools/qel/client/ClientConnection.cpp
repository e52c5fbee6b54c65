#include "client/ClientConnection.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"

#include <algorithm>
#include <array>
#include <sys/socket.h>
#include <utility>

namespace qel::tool {

namespace {

// The versions that this console reports. The hypervisor does not check them.
constexpr std::uint32_t kInterfaceVersion = 1;
constexpr std::uint16_t kMajorVersion = 1;
constexpr std::uint16_t kMinorVersion = 0;

constexpr std::chrono::milliseconds kMaxFarewell(1000);

Socket connectSocket(const IPEndpoint& endpoint, std::chrono::milliseconds timeout)
{
    try {
        Socket socket(endpoint.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket.connect(endpoint, timeout);
        return socket;
    } catch (const PosixError& error) {
        throw CommandFailure(ExitStatus::CannotConnect, "cannot connect to " + endpoint.str() + ": " + error.what());
    }
}

std::unique_ptr<SocketStream> tuneSocket(Socket socket, const IPEndpoint& endpoint)
{
    try {
        return std::make_unique<SocketStream>(std::move(socket));
    } catch (const PosixError& error) {
        throw CommandFailure(ExitStatus::CannotConnect,
                             "cannot use connection to " + endpoint.str() + ": " + error.what());
    }
}

using TimePoint = std::chrono::steady_clock::time_point;

/// Upgrades a plain connection to TLS and checks the peer.
std::unique_ptr<Stream> protect(std::unique_ptr<Stream> stream, int descriptor, SSLClientContext& context,
                                const ConnectOptions& options, TimePoint end)
{
    try {
        limitTo(*stream, end);
        requestUpgrade(*stream, descriptor);
        auto tls = std::make_unique<SSLStream>(context, std::move(stream));
        startTls(*tls);
        const PeerIdentity peer = identityOf(*tls);
        checkPeer(peer, options.transport.pins);
        logLine(LogLevel::Info, "connected over TLS to ", describePeer(peer));
        return tls;
    } catch (Error& error) {
        error.addContext("no protected connection to " + options.endpoint + ": ", options.endpoint);
        throw;
    }
}

template <typename T>
bool is(const QelMessage& message)
{
    return std::make_tuple(static_cast<unsigned short>(message.getFunction()),
                           static_cast<unsigned short>(message.getOperation()),
                           message.getClassification()) == T::getMessageID();
}

} // namespace

ClientConnection::ClientConnection(std::unique_ptr<Stream> stream, int descriptor)
    : mStream(std::move(stream)), mTls(dynamic_cast<const SSLStream*>(mStream.get())), mDescriptor(descriptor),
      mMessages(*mStream, messageRegistry())
{}

ClientConnection::~ClientConnection() = default;

std::unique_ptr<ClientConnection> ClientConnection::connect(const ConnectOptions& options)
{
    const IPEndpoint endpoint(options.endpoint);
    const auto credentials = loadCredentials(options.transport);
    const auto context = credentials ? credentials->makeClientContext() : nullptr;
    const TimePoint end = TimeProvider::steady() + options.timeout();
    auto socket = tuneSocket(connectSocket(endpoint, options.timeout()), endpoint);
    const TimePoint handshakeEnd = std::min(end, TimeProvider::steady() + options.transport.handshakeTimeout());
    const int descriptor = socket->getSocket().getFd();
    std::unique_ptr<Stream> stream = std::move(socket);
    if (context != nullptr) stream = protect(std::move(stream), descriptor, *context, options, handshakeEnd);
    auto connection = std::make_unique<ClientConnection>(std::move(stream), descriptor);
    limitTo(*connection->mStream, handshakeEnd);
    connection->mEnd = end;
    return connection;
}

void ClientConnection::onHandshakeDone()
{
    if (!mEnd.isDisabled()) limitTo(*mStream, mEnd);
}

void ClientConnection::setDeadline(std::chrono::milliseconds timeout)
{
    mStream->setReadDeadline(timeout);
    mStream->setWriteDeadline(timeout);
}

void ClientConnection::clearDeadline()
{
    mStream->clearReadDeadline();
    mStream->clearWriteDeadline();
}

void ClientConnection::setNoticeHandler(NoticeHandler handler) { mNoticeHandler = std::move(handler); }

std::unique_ptr<QelMessage> ClientConnection::exchange(const QelMessage& request)
{
    send(request);
    for (;;) {
        std::unique_ptr<QelMessage> message = receive();
        if (message->getClassification() == QelMessageClassification::Response) {
            pCheckResponse(request, *message);
            return message;
        }
        pHandleNotice(*message);
    }
}

std::unique_ptr<QelMessage> ClientConnection::require(const std::string& step, const QelMessage& request,
                                                      const std::string& subject)
{
    std::unique_ptr<QelMessage> response = exchange(request);
    if (response->getStatus() != QelMessageStatusNoError) throw RequestRefused(step, *response, subject);
    return response;
}

void ClientConnection::send(const QelMessage& message) { mMessages.write(message); }

std::unique_ptr<QelMessage> ClientConnection::receive() { return mMessages.read(); }

PollFd ClientConnection::getPollFd(PollEvents events) const
{
    return mDescriptor < 0 ? PollFd::Ignore : PollFd(mDescriptor, events);
}

bool ClientConnection::hasPending() const { return mTls != nullptr && mTls->hasPending(); }

void ClientConnection::leave() noexcept
{
    try {
        if (mDescriptor >= 0) {
            static_cast<void>(::shutdown(mDescriptor, SHUT_WR));
            pAwaitEnd();
        }
        close();
    } catch (const std::exception& error) {
        logLine(LogLevel::Debug, "while leaving: ", explain(error));
    }
}

void ClientConnection::close() { mStream->close(); }

void ClientConnection::pAwaitEnd()
{
    std::array<char, 4096> rest;
    mStream->setReadDeadline(kMaxFarewell);
    while (mStream->read(rest.data(), rest.size()) > 0)
        continue;
}

void ClientConnection::pCheckResponse(const QelMessage& request, const QelMessage& response) const
{
    if (response.getCallerId() != request.getCallerId()) {
        throw CommandFailure(ExitStatus::ProtocolBroken,
                             "the peer broke the protocol: a response to a request that was not sent");
    }
    if (response.getFunction() != request.getFunction() || response.getOperation() != request.getOperation()) {
        throw CommandFailure(ExitStatus::ProtocolBroken,
                             "the peer broke the protocol: a response of another kind than its request");
    }
}

void ClientConnection::pHandleNotice(const QelMessage& message) const
{
    if (is<QelMessageKrogConnectionClosedAsync>(message)) {
        throw CommandFailure(ExitStatus::ClosedByPeer, "the server closed the connection");
    }
    if (is<QelMessageAbortHandshakeAsync>(message)) {
        throw CommandFailure(ExitStatus::Refused,
                             "the server refused the connection: it accepts only TLS; give credentials instead of "
                             "--plain");
    }
    logLine(LogLevel::Debug, "notice while waiting for a response: ", message.getLogID());
    if (mNoticeHandler) mNoticeHandler(message);
}

std::unique_ptr<ClientConnection> connectConsole(const ConnectOptions& options)
{
    auto connection = ClientConnection::connect(options);
    static_cast<void>(introduce(*connection, options.identity));
    return connection;
}

std::unique_ptr<QelMessage> introduce(ClientConnection& connection, const IdentityOptions& identity)
{
    const IdentityOptions complete = completeIdentity(identity);
    const QelMessageGetEnclTypeAndInterfaceVersionReq request(kInterfaceVersion, complete.toolType, kMajorVersion,
                                                              kMinorVersion, complete.toolId);
    try {
        auto response = connection.require("version request", request);
        connection.onHandshakeDone();
        return response;
    } catch (const StreamIOException& error) {
        if (!connection.isProtected() || exitStatusOf(error) != ExitStatus::ClosedByPeer) throw;
        throw CommandFailure(ExitStatus::ClosedByPeer, "the server closed the connection right after the TLS "
                                                       "handshake; it may not accept this console's certificate: " +
                                                           explain(error));
    }
}

void openHypervisorSession(ClientConnection& connection)
{
    static_cast<void>(connection.require("open session", QelMessageInterfaceCmpOpenKrogSessionReq()));
}

} // namespace qel::tool
