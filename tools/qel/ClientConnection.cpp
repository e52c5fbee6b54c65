#include "ClientConnection.hpp"

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "Failures.hpp"
#include "Logging.hpp"
#include "MessageRegistry.hpp"

#include <algorithm>
#include <array>
#include <sys/socket.h>
#include <utility>

namespace qel::tool {

namespace {

// What this console says it speaks. The hypervisor end carries the numbers as given.
constexpr std::uint32_t kInterfaceVersion = 1;
constexpr std::uint16_t kMajorVersion = 1;
constexpr std::uint16_t kMinorVersion = 0;

constexpr std::chrono::milliseconds kShortestWait(1);
constexpr std::chrono::milliseconds kLongestFarewell(1000);

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

template <typename T>
bool is(const QelMessage& message)
{
    return std::make_tuple(static_cast<unsigned short>(message.getFunction()),
                           static_cast<unsigned short>(message.getOperation()),
                           message.getClassification()) == T::getMessageID();
}

} // namespace

ClientConnection::ClientConnection(std::unique_ptr<Stream> stream, int descriptor)
    : mStream(std::move(stream)), mDescriptor(descriptor), mMessages(*mStream, messageRegistry())
{}

ClientConnection::~ClientConnection() = default;

std::unique_ptr<ClientConnection> ClientConnection::connect(const IPEndpoint& endpoint,
                                                            std::chrono::milliseconds timeout)
{
    const auto end = TimeProvider::steady() + timeout;
    auto stream = tuneSocket(connectSocket(endpoint, timeout), endpoint);
    const int descriptor = stream->getSocket().getFd();
    auto connection = std::make_unique<ClientConnection>(std::move(stream), descriptor);
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - TimeProvider::steady());
    connection->setDeadline(std::max(left, kShortestWait));
    return connection;
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

std::unique_ptr<QelMessage> ClientConnection::require(const std::string& step, const QelMessage& request)
{
    std::unique_ptr<QelMessage> response = exchange(request);
    if (response->getStatus() != QelMessageStatusNoError) throw RequestRefused(step, *response);
    return response;
}

void ClientConnection::send(const QelMessage& message) { mMessages.write(message); }

std::unique_ptr<QelMessage> ClientConnection::receive() { return mMessages.read(); }

PollFd ClientConnection::getPollFd(PollEvents events) const
{
    return mDescriptor < 0 ? PollFd::Ignore : PollFd(mDescriptor, events);
}

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
    mStream->setReadDeadline(kLongestFarewell);
    while (mStream->read(rest.data(), rest.size()) > 0)
        continue;
}

void ClientConnection::pCheckResponse(const QelMessage& request, const QelMessage& response) const
{
    if (response.getCallerId() != request.getCallerId()) {
        throw CommandFailure(ExitStatus::ProtocolBroken, "response to a request that was not made");
    }
    if (response.getFunction() != request.getFunction() || response.getOperation() != request.getOperation()) {
        throw CommandFailure(ExitStatus::ProtocolBroken, "response of another kind than its request");
    }
}

void ClientConnection::pHandleNotice(const QelMessage& message) const
{
    if (is<QelMessageKrogConnectionClosedAsync>(message)) {
        throw CommandFailure(ExitStatus::ClosedByPeer, "the hypervisor closed the connection");
    }
    logLine(LogLevel::Debug, "notice while waiting for a response: ", message.getLogID());
    if (mNoticeHandler) mNoticeHandler(message);
}

std::unique_ptr<ClientConnection> connectConsole(const ConnectOptions& options)
{
    auto connection = ClientConnection::connect(IPEndpoint(options.endpoint), options.timeout());
    static_cast<void>(introduce(*connection, options.identity));
    return connection;
}

std::unique_ptr<QelMessage> introduce(ClientConnection& connection, const IdentityOptions& identity)
{
    const IdentityOptions complete = completeIdentity(identity);
    return connection.require(
        "version request", QelMessageGetEnclTypeAndInterfaceVersionReq(kInterfaceVersion, complete.toolType,
                                                                       kMajorVersion, kMinorVersion, complete.toolId));
}

void openHypervisorSession(ClientConnection& connection)
{
    static_cast<void>(connection.require("open session", QelMessageInterfaceCmpOpenKrogSessionReq()));
}

} // namespace qel::tool
