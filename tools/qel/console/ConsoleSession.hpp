#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/CommandEnd.hpp>

#include "base/ExitStatus.hpp"
#include "base/Library.hpp"
#include "client/ClientConnection.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// Why a virtual serial session ended.
enum class SessionEnd {
    None,             ///< it has not ended
    CommandEnded,     ///< read failure: the partition's command ended, and all of its output has been received
    Taken,            ///< force close: another console took or closed the session
    ShutDown,         ///< the hypervisor shuts down
    WriteFailure,     ///< the partition takes no more input
    Unknown,          ///< the notice has an unknown reason
    ConnectionClosed, ///< the hypervisor closes the connection
};

/// The end in words, for the user.
const char* describe(SessionEnd end);

/// The exit status of a command whose session ended this way: Done for CommandEnded and None, Refused for Taken,
/// ClosedByPeer otherwise.
ExitStatus exitStatusOf(SessionEnd end);

/// The console's side of one virtual serial session: opens it, moves its data, closes it.
///
/// Every wait for the hypervisor is limited. The timeout given here applies to each message, from its first byte to its
/// last, and to each response. open() uses the deadline that the connection already has.
///
/// Notices go to the receiver from within receive(), open() and close(). Notices for other sessions are ignored; a
/// malformed notice breaks the protocol.
///
/// Lifetime: borrows connection and receiver, which must outlive it. Sets itself as the connection's notice handler.
/// Thread safety: one thread.
class ConsoleSession {
public:
    /// Which serial connection of which partition.
    struct Address {
        std::uint16_t partition = 0;
        std::uint16_t connection = 0; ///< number of the serial connection within the partition
    };

    /// Receives output and broadcasts.
    class Receiver {
    public:
        virtual ~Receiver() = default;

        /// Output of the partition. @param data  `length` bytes, borrowed for the call
        virtual void onOutput(const char* data, std::size_t length) = 0;

        /// A broadcast of another console. Its contents are untrusted.
        virtual void onBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast) = 0;
    };

    /// The most bytes that one data message can carry.
    static constexpr std::size_t kMaxData =
        QelMessage::MtuMax - QelMessage::MaxHeaderSize - sizeof(QelMessageVirtualSerialDataToOsAsync::Data);

    /// @param timeout  for one message, or for the response to one request
    ConsoleSession(ClientConnection& connection, Address address, std::chrono::milliseconds timeout,
                   Receiver& receiver);
    ~ConsoleSession();
    ConsoleSession(const ConsoleSession&) = delete;
    ConsoleSession& operator=(const ConsoleSession&) = delete;

    const Address& getAddress() const noexcept { return mAddress; }

    /// Opens the hypervisor session and the virtual serial session, and sets the latter up for data.
    /// @param force  take the session from the console that holds it
    /// @throws RequestRefused, and what ClientConnection::require() throws
    void open(bool force);

    /// Sends the beginning of the typed bytes as one message.
    /// @param typed  not empty; the bytes that were sent, at most kMaxData, are removed
    /// @throws StreamIOException
    void send(std::string& typed);

    /// Receives one message; waits without limit for its first byte.
    /// @throws CommandFailure  ProtocolBroken: an unexpected response or a malformed notice
    /// @throws StreamIOException, QelMessageValidationException
    void receive();

    /// Why the session ended; None while it is open.
    SessionEnd getEnd() const noexcept { return mEnd; }

    /// The same in words: describe(getEnd()), and how the command ended where the notice says so.
    std::string describeEnd() const;

    /// Closes the virtual serial session and the hypervisor session, as far as they are open.
    /// @throws RequestRefused, and what ClientConnection::require() throws
    void close();

    /// For waiting until the connection can be read from or written to.
    PollFd getPollFd(PollEvents events) const { return mConnection.getPollFd(events); }

    /// True when receive() has bytes to read although the socket has none.
    bool hasPending() const { return mConnection.hasPending(); }
    /// True when messages can still be received after send() has failed.
    bool outlivesFailedSend() const noexcept { return !mConnection.isProtected(); }

private:
    std::string pSubject() const;
    void pHandle(const QelMessage& message);
    void pHandleNotice(const QelMessage& message);
    void pEndSession(const QelMessageVirtualSerialSessionClosedAsync& notice);
    template <typename T>
    bool pIsOurs(const T& notice) const;

    ClientConnection& mConnection;
    const Address mAddress;
    const std::chrono::milliseconds mTimeout;
    Receiver& mReceiver;
    bool mIsSerialOpen = false;
    SessionEnd mEnd = SessionEnd::None;
    CommandEnd mCommandEnd; // with SessionEnd::CommandEnded
};

} // namespace qel::tool
