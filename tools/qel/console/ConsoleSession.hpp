#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Poll.hpp>

#include "base/ExitStatus.hpp"
#include "client/ClientConnection.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// Why a virtual serial session is over.
enum class SessionEnd {
    None,             ///< it is not
    CommandEnded,     ///< read failure: nothing more can come from the partition, and everything that came is here
    Taken,            ///< force close: another console has it, or closed it
    ShutDown,         ///< the hypervisor side goes down
    WriteFailure,     ///< the partition takes no more input
    Unknown,          ///< the notice gave no reason that is known here
    ConnectionClosed, ///< the hypervisor closes the connection
};

/// What happened, in words, the reason of the notice first.
const char* describe(SessionEnd end);

/// The exit status of a command whose session has ended that way: Done for the end of the command and while there is no
/// end, Refused when it was taken, ClosedByPeer otherwise.
ExitStatus exitStatusOf(SessionEnd end);

/// One virtual serial session, as the console sees it: opens it, moves its data, closes it.
///
/// Every wait for the hypervisor has a limit: from its first byte to its last a message has the time given here, and so
/// has the answer to each request; open() has what the connection's deadline leaves.
///
/// What the hypervisor sends without being asked goes to the receiver from within receive(), open() and close(). What
/// belongs to another session is ignored; a notice that is known but cannot be understood breaks the protocol.
///
/// Lifetime: borrows connection and receiver, which must outlive it; is the connection's notice handler meanwhile.
/// Thread safety: one thread.
class ConsoleSession {
public:
    /// Where a session leads to.
    struct Address {
        std::uint16_t partition = 0;
        std::uint16_t connection = 0; ///< number of the serial connection within the partition
    };

    /// Takes what comes.
    class Receiver {
    public:
        virtual ~Receiver() = default;

        /// What the partition put out. @param data  `length` bytes, borrowed for the call
        virtual void onOutput(const char* data, std::size_t length) = 0;

        /// A broadcast of another console. Everything in it is as that console chose it.
        virtual void onBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast) = 0;
    };

    /// Bytes that one data message can carry in a frame that a stream accepts.
    static constexpr std::size_t kMostData =
        QelMessage::MtuMax - QelMessage::MaxHeaderSize - sizeof(QelMessageVirtualSerialDataToOsAsync::Data);

    /// @param timeout  what one message, or the answer to one request, may take
    ConsoleSession(ClientConnection& connection, Address address, std::chrono::milliseconds timeout,
                   Receiver& receiver);
    ~ConsoleSession();
    ConsoleSession(const ConsoleSession&) = delete;
    ConsoleSession& operator=(const ConsoleSession&) = delete;

    const Address& getAddress() const noexcept { return mAddress; }

    /// Opens the hypervisor session, then the virtual serial session, and lets its data flow.
    /// @param force  take the session from the console that holds it
    /// @throws RequestRefused, and what ClientConnection::require() throws
    void open(bool force);

    /// Sends the first bytes of what was typed as one message.
    /// @param typed  not empty; loses what was sent, at most kMostData bytes
    /// @throws StreamIOException
    void send(std::string& typed);

    /// Takes one message; waits until one has begun to come.
    /// @throws CommandFailure  ProtocolBroken: one that has no place here
    /// @throws StreamIOException, QelMessageValidationException
    void receive();

    /// Why the session is over; None while it is not.
    SessionEnd getEnd() const noexcept { return mEnd; }

    /// Closes what is open: the virtual serial session, then the hypervisor session.
    /// @throws RequestRefused, and what ClientConnection::require() throws
    void close();

    /// For waiting on messages, or for a message to be taken.
    PollFd getPollFd(PollEvents events) const { return mConnection.getPollFd(events); }

    /// Whether to receive() without waiting, and whether that still makes sense when send() has failed.
    bool hasPending() const { return mConnection.hasPending(); }
    bool outlivesFailedSend() const noexcept { return !mConnection.isProtected(); }

private:
    void pHandle(const QelMessage& message);
    void pHandleNotice(const QelMessage& message);
    void pEnd(const QelMessageVirtualSerialSessionClosedAsync& notice);
    template <typename T>
    bool pIsOurs(const T& notice) const;

    ClientConnection& mConnection;
    const Address mAddress;
    const std::chrono::milliseconds mTimeout;
    Receiver& mReceiver;
    bool mIsSerialOpen = false;
    SessionEnd mEnd = SessionEnd::None;
};

} // namespace qel::tool
