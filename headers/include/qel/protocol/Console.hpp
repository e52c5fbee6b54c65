#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/ConsoleOptions.hpp>
#include <qel/protocol/PeerIdentity.hpp>
#include <qel/protocol/PendingResponse.hpp>
#include <qel/protocol/ProtocolExport.hpp>
#include <qel/protocol/ResponseOf.hpp>
#include <qel/protocol/SerialSession.hpp>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <utility>

namespace qel {
class QelMessageGetEnclTypeAndInterfaceVersionRsp;
}

namespace qel::protocol {

/// A console's connection to a hypervisor: connected, protected and introduced once it is constructed.
///
///     ConsoleOptions options("hypervisor.example:4711");
///     options.credentials = Credentials::fromDirectory("authority", "operator");
///     Console console(options, std::chrono::seconds(5));
///     const auto time = console.request(QelMessageGetQelTodReq());  // std::unique_ptr<QelMessageGetQelTodRsp>
///
/// **Receiving.** A console has no thread of its own: messages are received by the calls that wait, which are
/// request(), exchange(), PendingResponse::get(), process() and the calls of SerialSession. Each of them handles
/// whatever arrives: responses go to their requests, serial data to their sessions, notices to their handlers, which
/// are called then. A handler may use the console, connect it anew, and move or destroy it, its sessions and pending
/// responses; the call that waits then ends. An exception of a handler passes through the call and does no harm
/// to the console.
///
/// **Waiting together with other descriptors.** First take what other calls have received:
/// SerialSession::getAvailable() and PendingResponse::isReady(). Then wait until getPollFd() is ready, unless
/// hasPending() is true, and call process().
///
/// **Deadlines.** Every call that waits has a timeout; a negative one means no limit. A timeout that passes throws
/// DeadlinePassed. When no part of a message had been received by then, the console stays usable, and a response that
/// comes later is dropped; what it says about the sessions of this console is noted. Otherwise the connection is of no
/// use any more. A message that could not be sent in its time ends sending, since a part of it may have been sent;
/// SerialSession::write() begins a message only when there is room. A peer that goes on sending other messages extends
/// no deadline. Independently of that, a message has ConsoleOptions::frameTimeout from its first byte to its last. Over
/// TLS its first byte is the first one that is decrypted: a peer that updates its keys begins no message by that.
///
/// **Failures.** What the calls throw: StatusError, a response with a status other than zero; DeadlinePassed;
/// ClosedByPeer, the connection broke or the hypervisor closed it, with or without its notice; TurnedAway, the
/// hypervisor accepts only TLS, or sent its abort message inside TLS; ProtocolBroken, a malformed message, or a
/// response to no request or of another kind than its request; LimitReached, see below; Error, close() or leave() has
/// been called. PosixError, when the system cannot wait for a descriptor, passes unchanged. StatusError, LimitReached,
/// a harmless DeadlinePassed, and ProtocolBroken for a response whose payload alone is malformed leave the connection
/// as it was. After any other failure the connection is of no use: every call throws the same again, until reconnect().
/// There is one exception: on a connection without TLS, messages can still be received after sending has failed, as the
/// hypervisor may have sent the reason.
///
/// **Limits.** At most 4096 requests can be under way. A session keeps the output that is not read, up to
/// SerialOptions::maxUnread; beyond that the calls that receive throw LimitReached until it is read;
/// SerialSession::close() does not.
///
/// Lifetime: sessions and pending responses may outlive the console; they fail then. Movable, not copyable; a
/// moved-from console can only be destroyed or assigned to. The destructor closes the connection at once, and drops
/// requests that are still gathered: call leave() before it. Thread safety: one thread, except close(). Looking up a
/// host name uses a thread of its own, see resolve().
class QEL_PROTOCOL_EXPORT Console {
public:
    /// Receives a notice. Borrows the message for the call.
    using NoticeHandler = std::function<void(const QelMessage&)>;

    /// Connects over TCP, protects the connection unless the options ask for a plain one, checks the server against the
    /// pins, and sends the version request.
    ///
    /// With ConsoleOptions::retry it tries again after NameNotResolved, CannotConnect, TurnedAway, ClosedByPeer,
    /// DeadlinePassed, and after a StatusError that says that the server takes no more consoles or knows one with this
    /// identity. When the attempts or the time are used up, the last failure is thrown. A server that closes the
    /// connection in the handshake and says nothing may have crashed, and is tried again; a server of this library that
    /// does not accept the console's certificate closes in the same way.
    /// @param timeout  for all of it
    /// @throws std::invalid_argument  names the option: "server", "credentials" (neither credentials nor plain),
    ///         "plain" (also with credentials or for an address that is not a loopback address), "pins" (with plain),
    ///         "identity.toolId", "handshakeTimeout", "requestTimeout", "frameTimeout", "retry"
    /// @throws NameNotResolved, CannotConnect  no connection: "cannot connect to SERVER: ..."
    /// @throws CertificateRejected  ours by the server, which said so with a TLS alert; theirs by us, or by a pin
    /// @throws TurnedAway, DeadlinePassed, ClosedByPeer, ProtocolBroken  in the handshake: "no protected connection to
    ///         SERVER: ...", or in the introduction
    /// @throws StatusError  the response to the version request
    /// @throws Error  OpenSSL fails, as a rule for want of memory: "no protected connection to SERVER: ...";
    /// SSLException
    ///         is nested
    /// @throws SSLException  OpenSSL cannot use the credentials
    /// @throws PosixError  the system cannot wait for a descriptor
    explicit Console(const ConsoleOptions& options, std::chrono::milliseconds timeout = std::chrono::seconds(10));

    /// The same over a stream of one's own, such as one end of makeMemoryStreams(); it is protected as the options say.
    /// Here a plain connection is not limited to loopback addresses, and the server of the options is only the name for
    /// texts. Cannot reconnect().
    ///
    /// A stream without a descriptor, other than one of makeMemoryStreams(), cannot say what it could do at once. Over
    /// such a stream every message is sent when its turn comes, and the call waits in Stream::write(), where it
    /// receives nothing: a peer that sends all it has before it reads, such as one that echoes a long input, and this
    /// console then wait for each other until the write deadline ends the connection. leave() cannot wait for the peer
    /// either. Such a stream needs room for all that is under way, or a descriptor that poll(2) reports as readable and
    /// writable when the stream is.
    ///
    /// A SocketStream loses its user timeout of 60 s, as the sockets do that a console connects: a server that answers
    /// and takes no data, because nobody reads it, is not cut. A server that is gone is still found by the keep-alive,
    /// or by the system's retransmission limits while data waits for it.
    /// @param stream  connected, not yet protected, not null, with deadlines, and close() from any thread
    /// @param descriptor  of the stream, to wait on; -1: none. That of a SocketStream need not be given
    /// @throws std::invalid_argument  "stream: null"; and what the other constructor throws, except for the address
    Console(std::unique_ptr<Stream> stream, const ConsoleOptions& options,
            std::chrono::milliseconds timeout = std::chrono::seconds(10), int descriptor = -1);

    Console(Console&& other) noexcept;
    Console& operator=(Console&& other) noexcept;
    ~Console();

    // Who is connected.

    /// The server as the options name it.
    const std::string& getServer() const noexcept;
    /// Who the server is by its certificate; all empty without TLS. Valid until reconnect().
    const PeerIdentity& peer() const noexcept;
    bool isProtected() const noexcept;
    /// The response to the version request. Valid until reconnect().
    /// @throws ProtocolBroken  its payload is malformed; consoles that do not ask get along with such a server
    const QelMessageGetEnclTypeAndInterfaceVersionRsp& version() const;

    // Requests.

    /// Sends a request and waits for its response, for ConsoleOptions::requestTimeout. Include the header that defines
    /// the request; it defines the response too.
    /// @return the response, whose status is zero; never null
    /// @throws StatusError  the response has another status, which it carries
    /// @throws std::invalid_argument  "request": the message is not a request, or longer than a frame may be
    /// @throws ...  see the class
    template <typename Request>
    std::unique_ptr<ResponseTo<Request>> request(const Request& message)
    {
        const std::string server = getServer(); // a handler may destroy this console meanwhile
        return readResponse<ResponseTo<Request>>(pRequest(message), server);
    }
    /// The same with a timeout of its own.
    template <typename Request>
    std::unique_ptr<ResponseTo<Request>> request(const Request& message, std::chrono::milliseconds timeout)
    {
        const std::string server = getServer();
        return readResponse<ResponseTo<Request>>(pRequest(message, timeout), server);
    }

    /// Begins a request and returns. Short requests are gathered, up to 8 KiB, and go out in one write: as soon as this
    /// console sends anything else, or before it waits in any call, be it for another message. A program that waits by
    /// itself calls process() first; hasPending() reminds it. While the server takes nothing and other requests are
    /// under way, receives messages, so that neither side blocks the other.
    ///
    /// When gathered requests cannot be sent, the call that sends them throws, and so does their
    /// PendingResponse::get().
    template <typename Request>
    PendingResponse<ResponseTo<Request>> start(const Request& message)
    {
        return PendingResponse<ResponseTo<Request>>(pStart(message));
    }

    /// request() for a request whose class is not known at compile time.
    /// @return the response, whatever its status; a plain QelMessage when it has a status instead of its payload
    std::unique_ptr<QelMessage> exchange(const QelMessage& request);
    std::unique_ptr<QelMessage> exchange(const QelMessage& request, std::chrono::milliseconds timeout);

    /// Sends a notice. @throws std::invalid_argument  "notice": the message is a request or too long
    void send(const QelMessage& notice);

    // Notices.

    /// Sets the handler for the notices of a class; an empty one removes it. Data and closed notices of open serial
    /// sessions go to the sessions alone. When the hypervisor closes the connection or turns this console away, the
    /// handler is called after the sessions and the requests have ended.
    /// @tparam T  such as QelMessageDaxBroadcastOutboundAsync. A notice with the identity of T whose payload is
    ///         malformed throws ProtocolBroken.
    template <typename T>
    void onNotice(std::function<void(const T&)> handler)
    {
        std::function<bool(const QelMessage&)> untyped;
        if (handler) {
            untyped = [handler = std::move(handler)](const QelMessage& message) {
                const T* const typed = dynamic_cast<const T*>(&message);
                if (typed != nullptr) handler(*typed);
                return typed != nullptr;
            };
        }
        pOnNotice(T::getMessageID(), std::move(untyped));
    }
    /// Sets the handler for all other notices, requests of the peer included, which are not answered. The notices that
    /// end the connection and those for a session do not come here. Without it they
    /// are dropped, with a line at Debug.
    void onOtherNotice(NoticeHandler handler);

    // Sessions.

    /// Opens the hypervisor session, which all virtual serial requests need; does nothing while it is open.
    /// @param timeout  without it ConsoleOptions::requestTimeout; here and below
    /// @throws StatusError  the hypervisor refuses; here and below
    void openSession();
    void openSession(std::chrono::milliseconds timeout);
    /// Closes it, and with it all serial sessions; does nothing unless it is open.
    void closeSession();
    void closeSession(std::chrono::milliseconds timeout);

    /// Opens the virtual serial session of a partition and sets it up for data; opens the hypervisor session if needed.
    /// @param timeout  for all of it
    /// @throws std::invalid_argument  "maxUnread: zero"
    SerialSession openSerial(std::uint16_t partition, const SerialOptions& options = SerialOptions());
    SerialSession openSerial(std::uint16_t partition, const SerialOptions& options, std::chrono::milliseconds timeout);

    // Waiting.

    /// For waiting on this console together with other descriptors.
    /// @return PollFd::Ignore for a stream without a descriptor. Valid until the next call of this console: it waits
    /// for
    ///         room to send too, while the server does not take gathered requests
    PollFd getPollFd(PollEvents events) const;

    /// True when process() has something to do although the descriptor is not readable: bytes have been read ahead, or
    /// requests have been gathered.
    bool hasPending() const;

    /// Sends the requests that were gathered, if the server takes them; receives and handles one message.
    /// @param timeout  how long to wait for it to begin; 0: it must have begun. It then has the frame timeout
    /// @return false: none began in this time. Over TLS that may be so although the descriptor was readable: a part of
    /// a
    ///         record, or one without data, is no message
    bool process(std::chrono::milliseconds timeout = std::chrono::milliseconds(0));

    // The end.

    /// Connects anew with the same options, as the constructor does, and introduces this console again. The old
    /// connection is closed first; its requests fail with ClosedByPeer, its sessions end with
    /// SessionEnd::ConnectionClosed. Handlers stay. May be called in any state but after close(). A handler that this
    /// call itself calls in the introduction cannot begin another one: there it does nothing.
    /// @param timeout  for all of it
    /// @throws std::logic_error  the stream was given to the constructor
    void reconnect(std::chrono::milliseconds timeout);

    /// Ends the connection gracefully: ends the outgoing stream and waits up to a second for the peer to do the same.
    /// Over a stream that can neither be shut down nor tell what it can do (see the constructor), closes it at once.
    /// After that the hypervisor has released this console's name and place, so that the next console does not collide
    /// with one that has left.
    void leave() noexcept;

    /// Ends the connection at once and for good. A call that waits on the console's thread throws Error, also one that
    /// waits between two attempts to connect; a TCP connection or a name lookup in progress ends first.
    /// Thread safety: any thread, as long as the console is neither moved nor destroyed.
    void close() noexcept;

private:
    std::unique_ptr<QelMessage> pRequest(const QelMessage& message);
    std::unique_ptr<QelMessage> pRequest(const QelMessage& message, std::chrono::milliseconds timeout);
    detail::PendingExchange pStart(const QelMessage& message);
    void pOnNotice(const QelMessageRegistry::Identifier& identity, std::function<bool(const QelMessage&)> handler);

    std::shared_ptr<ConsoleCore> mCore;
};

} // namespace qel::protocol
