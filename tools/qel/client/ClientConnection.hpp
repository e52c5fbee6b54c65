#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Poll.hpp>

#include "client/ConnectOptions.hpp"

#include <chrono>
#include <functional>
#include <memory>
#include <string>

namespace qel::tool {

/// One connection of a console to a hypervisor: sends requests, receives responses and notices.
///
/// Ownership: owns the stream. Thread safety: one thread may send while another receives; exchange() does both.
class ClientConnection {
public:
    /// Receives every notice that arrives while exchange() waits for a response. Borrows the message for the call.
    using NoticeHandler = std::function<void(const QelMessage&)>;

    /// @param stream  a connected stream, not null
    /// @param descriptor  of the stream, to wait on; -1 when it has none
    explicit ClientConnection(std::unique_ptr<Stream> stream, int descriptor = -1);
    ~ClientConnection();

    /// Connects over TCP and, unless the options ask for a plain connection, over TLS. Until onHandshakeDone() is
    /// called, the handshake timeout limits sending and receiving.
    /// @throws CommandFailure  CannotConnect; with TLS also what Handshake.hpp and PeerPins.hpp document
    /// @throws FileIOError, CommandFailure  the credentials cannot be used, see makeClientContext()
    static std::unique_ptr<ClientConnection> connect(const ConnectOptions& options);

    /// Ends the handshake timeout: from now on the deadline given to connect() limits sending and receiving. Does
    /// nothing for a connection that connect() did not make.
    void onHandshakeDone();

    /// Sets a timeout for all sending and one for all receiving from now on. Each starts with its first use.
    void setDeadline(std::chrono::milliseconds timeout);
    /// Removes both timeouts.
    void clearDeadline();

    /// Sets the handler for notices that arrive during exchange(); without one they are dropped.
    void setNoticeHandler(NoticeHandler handler);

    /// Sends a request and waits for its response: the message with the request's caller id.
    /// @return the response, whatever its status; a plain QelMessage when it carries a status instead of its payload
    /// @throws CommandFailure  ClosedByPeer: the hypervisor sent the connection-closed notice; ProtocolBroken: a
    ///         response to another request, or of another function or operation
    /// @throws StreamIOException, QelMessageValidationException  as QelMessageStream does
    std::unique_ptr<QelMessage> exchange(const QelMessage& request);

    /// exchange() for a request that must be granted.
    /// @param step, subject  as RequestRefused takes them
    /// @throws RequestRefused  the response carries a status other than zero; and what exchange() throws
    std::unique_ptr<QelMessage> require(const std::string& step, const QelMessage& request,
                                        const std::string& subject = {});

    /// Sends a message and returns. @throws StreamIOException
    void send(const QelMessage& message);

    /// Waits for the next message. @throws StreamIOException, QelMessageValidationException  as QelMessageStream does
    std::unique_ptr<QelMessage> receive();

    /// For waiting on this connection together with other descriptors. The descriptor is the socket's: call
    /// hasPending() before waiting for it to become readable.
    /// @return PollFd::Ignore for a stream without a descriptor
    PollFd getPollFd(PollEvents events) const;

    /// True when TLS holds bytes that it has already read from the socket.
    bool hasPending() const;

    /// True over TLS, where a failure in one direction ends both.
    bool isProtected() const noexcept { return mTls != nullptr; }

    /// Ends the connection gracefully: ends the outgoing stream and waits up to a second for the peer to do the same.
    /// After that the hypervisor has released this console's name and place, so that the next console does not collide
    /// with one that has left.
    void leave() noexcept;

    /// Ends both directions at once; a receive() that waits on another thread throws.
    void close();

private:
    void pAwaitEnd();
    void pCheckResponse(const QelMessage& request, const QelMessage& response) const;
    void pHandleNotice(const QelMessage& message) const;

    std::unique_ptr<Stream> mStream;
    const SSLStream* mTls; // points to *mStream; null for a plain connection
    int mDescriptor;
    QelMessageStream mMessages;
    NoticeHandler mNoticeHandler;
    PollDeadline mEnd; // the overall deadline from connect(); disabled: none
};

/// Connects and sends the version request: the first two steps of every command.
/// @throws what ClientConnection::connect() and require() throw
std::unique_ptr<ClientConnection> connectConsole(const ConnectOptions& options);

/// Sends the version request, which completes the handshake.
/// @return the response, whose status is zero
/// @throws CommandFailure  ClosedByPeer: over TLS, the hypervisor closes the connection when it does not accept this
///                         console's certificate; and what require() throws
std::unique_ptr<QelMessage> introduce(ClientConnection& connection, const IdentityOptions& identity);

/// Opens the hypervisor session, which all requests about virtual serial sessions need.
void openHypervisorSession(ClientConnection& connection);

} // namespace qel::tool
