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

/// The console's end of one connection: requests out, responses and notices in.
///
/// Ownership: owns the stream. Thread safety: one thread that sends and one that receives; exchange() does both.
class ClientConnection {
public:
    /// Takes every message that arrives while a response is awaited and is none: notices of the hypervisor. Borrows the
    /// message for the call.
    using NoticeHandler = std::function<void(const QelMessage&)>;

    /// @param stream  a connected stream, not null
    /// @param descriptor  what to wait on for the stream to become readable; -1 when it has none
    explicit ClientConnection(std::unique_ptr<Stream> stream, int descriptor = -1);
    ~ClientConnection();

    /// Connects over TCP and, unless the options say that the connection is plain, over TLS. The time of the handshake
    /// then limits all sending and receiving, until letIn() is called.
    /// @throws CommandFailure  CannotConnect; with TLS also what Handshake.hpp and PeerPins.hpp say
    /// @throws FileIOError, CommandFailure  the credentials cannot be used, see makeClientContext()
    static std::unique_ptr<ClientConnection> connect(const ConnectOptions& options);

    /// The handshake is over. What is left of the time for everything now limits sending and receiving; for a
    /// connection that was not made by connect() nothing changes.
    void letIn();

    /// Limits the time that all sending and all receiving from now on may take together, each counted from its first
    /// use.
    void setDeadline(std::chrono::milliseconds timeout);
    /// Lets sending and receiving wait without limit, as a person's session needs it.
    void clearDeadline();

    /// Who is told of notices during exchange(); nobody unless set.
    void setNoticeHandler(NoticeHandler handler);

    /// Sends a request and waits for its response: the message with the request's caller id.
    /// @return the response, whatever its status; a plain QelMessage when it carries a status instead of its payload
    /// @throws CommandFailure  ClosedByPeer: the hypervisor says that it closes the connection; ProtocolBroken: a
    ///         response to another request, or of another function or operation
    /// @throws StreamIOException, QelMessageValidationException  as QelMessageStream does
    std::unique_ptr<QelMessage> exchange(const QelMessage& request);

    /// exchange() for a request that must be granted.
    /// @param step  what is asked for, as RequestRefused takes it
    /// @throws RequestRefused  the response carries a status other than zero; and what exchange() throws
    std::unique_ptr<QelMessage> require(const std::string& step, const QelMessage& request);

    /// Sends a message and does not wait for anything. @throws StreamIOException
    void send(const QelMessage& message);

    /// Waits for the next message. @throws StreamIOException, QelMessageValidationException  as QelMessageStream does
    std::unique_ptr<QelMessage> receive();

    /// For waiting on this connection together with something else. The descriptor is that of the socket: ask
    /// hasPending() before waiting for it to become readable.
    /// @return PollFd::Ignore for a stream without a descriptor
    PollFd getPollFd(PollEvents events) const;

    /// Whether a part of a message has come that the socket does not have any more: TLS has taken it from there.
    bool hasPending() const;

    /// Whether it goes over TLS, which ends both directions when something fails in one.
    bool isProtected() const noexcept { return mTls != nullptr; }

    /// Ends the connection politely: says that nothing more will come and waits, for a second at most, until the other
    /// end has ended it too. By then the hypervisor has forgotten this console, so that whoever connects next, under
    /// the same name or to a hypervisor that takes no more consoles, is not in the way of one that has left.
    void leave() noexcept;

    /// Ends both directions; a receive() that waits on another thread returns with an exception.
    void close();

private:
    void pAwaitEnd();
    void pCheckResponse(const QelMessage& request, const QelMessage& response) const;
    void pHandleNotice(const QelMessage& message) const;

    std::unique_ptr<Stream> mStream;
    const SSLStream* mTls; // the same; null for a plain connection
    int mDescriptor;
    QelMessageStream mMessages;
    NoticeHandler mNoticeHandler;
    PollDeadline mEnd; // of the time for everything; disabled: there is none
};

/// Connects and introduces this console: what every use of the hypervisor begins with.
/// @throws what ClientConnection::connect() and require() throw
std::unique_ptr<ClientConnection> connectConsole(const ConnectOptions& options);

/// Sends the version request. Step 1 of every connection, and the last one of the handshake.
/// @return the response, granted
/// @throws CommandFailure  ClosedByPeer: over TLS this is how a hypervisor end that does not know this console's
///                         certificate turns it away; and what require() throws
std::unique_ptr<QelMessage> introduce(ClientConnection& connection, const IdentityOptions& identity);

/// Opens the hypervisor session, which everything about virtual serial sessions needs.
void openHypervisorSession(ClientConnection& connection);

} // namespace qel::tool
