#pragma once

#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "hypervisor/HypervisorEngine.hpp"
#include "server/Admission.hpp"
#include "server/FrameStream.hpp"
#include "server/HandshakePlaces.hpp"
#include "server/LogThrottle.hpp"
#include "server/Outbox.hpp"
#include "server/RecordStream.hpp"
#include "server/RefusalCounts.hpp"
#include "server/WireStream.hpp"

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <thread>

namespace qel::protocol {

/// The limits of one connection.
struct ConnectionLimits {
    std::chrono::milliseconds handshake{10000};     ///< from connecting to a granted version request
    std::chrono::milliseconds frame{10000};         ///< for a message, once it has begun; from the granted request on
    std::chrono::milliseconds linger{2000};         ///< for the queued messages to go out when the connection ends
    std::size_t queueBytes = Outbox::kDefaultLimit; ///< queue limit, in bytes of frames; more than 0
};

/// What the connections of one server share. Borrowed by each of them.
struct ConnectionServices {
    HypervisorEngine& hypervisor;
    const PeerPins& pins; ///< which consoles are admitted over TLS
    ConnectionLimits limits;
    LogThrottle& throttle;
    PollInterrupt& ended; ///< interrupted when a connection has ended
    RefusalCounts& refusals;
};

/// A stream to a console, before anything has been transferred.
struct ServedStream {
    std::unique_ptr<Stream> stream; ///< not null
    int descriptor;                 ///< of its socket; -1: it has none, and a hang-up is noticed only by reading
    std::string address;            ///< of the console, for the log
    std::string source;             ///< as sourceOf() names it, for the log
};

/// One connection of the hypervisor end, and the hypervisor's link to its console, with two threads: the reader
/// hands received messages to the hypervisor, and sends what comes of them for this console as long as it does not have
/// to wait; the writer sends all else that is queued. Over TLS a third, the handshaker, comes first: it admits the
/// console and starts the reader. None waits for another connection.
///
/// The reader sends before it waits for the console, and not after each message: the responses to requests that have
/// arrived together go out together.
///
/// While the hypervisor takes no message, the reader does not read. It watches for the console to hang up instead, so
/// that a console that has disconnected does not hold its sessions.
///
/// Thread safety: one thread owns it (constructor, start(), destructor); any thread may call the other operations.
class Connection final : private Outbox {
public:
    /// @param services  what it refers to is borrowed
    /// @param context  the server's credentials, borrowed for the call; null: the connection is plain
    /// @throws PosixError, SSLException, std::bad_alloc  something has run out
    Connection(const ConnectionServices& services, ServedStream stream, SSLServerContext* context,
               HandshakePlaces::Place place = {});

    /// Aborts the connection unless it has ended, and waits for its threads.
    ~Connection() override;

    /// Starts the threads. @throws std::system_error  the system allows no more threads; the connection has ended
    void start();

    /// For the end of the server, which also ends the connection at the hypervisor's side: a handshake is ended.
    void stop();

    /// Cuts both directions at once; queued messages are lost.
    void abort() noexcept;

    /// True once the threads have nothing left to do.
    bool hasEnded() const noexcept { return mEnded; }

    /// What has passed so far. Of the peer only the id, 0 in the TLS handshake, and the address are set.
    ConnectedConsole state() const;

    /// Prints a line that names the console, and the statistics of its queue, indented; nothing in the handshake.
    /// @return whether something was printed
    bool dumpStatistics(std::ostream& os) const;

private:
    Connection(const ConnectionServices& services, ServedStream& stream, std::unique_ptr<WireStream> wire,
               SSLServerContext* context, HandshakePlaces::Place place);

    void resumeReading() override;
    void cut() override { abort(); }

    bool pNeedsNoWait() const override { return mWire.needsNoWait(); }
    void pBeginBatch(bool mayWait) override;
    void pGather(const QelMessage& message) override;
    bool pSendBatch() override;
    void pOnRoom() override;
    void pOnSendFailure() noexcept override;

    void pConnect(const PeerIdentity& identity);
    void pHandshake() noexcept;
    void pAdmit();
    void pStartReader();
    void pJoinHandshake() noexcept;
    void pRead() noexcept;
    void pReceiveAll();
    void pCountReceived(const QelMessage& message) noexcept;
    Received pHandOver(const QelMessage& message);
    void pOnIdentified();
    bool pAwaitReceive();
    void pFinish() noexcept;
    void pReportFailure() noexcept;
    void pCountRefusal(ConnectionRefusal reason) noexcept;
    void pReport(const StreamIOException& error) noexcept;
    DisconnectReason pReasonOf(const StreamIOException& error) const noexcept;

    void pWrite() noexcept;
    void pReportSendFailure() const noexcept;
    void pClose() noexcept;

    const ConnectionServices mServices;
    const std::chrono::system_clock::time_point mSince = TimeProvider::system();
    const std::string mAddress;
    const std::string mSource; // whom log lines count for until it is known who the console is
    std::string mBlamed;       // and afterwards: the source, and over TLS the certificate; set before there is a reader
    const PollFd mHangUp;
    HandshakePlaces::Place mPlace; // until the console has identified itself or the connection ends; of the reader
    WakeUp mWake;                  // for the reader while it does not read

    // From below to above.
    Stream& mClear;                   // the stream of the caller, without TLS; owned by mWire
    WireStream& mWire;                // owned by mStream
    RecordStream* mRecords = nullptr; // below TLS; owned by mStream; null: plain
    const std::unique_ptr<Stream> mStream;
    BufferedStream mBuffered;
    FrameStream mFrames;
    QelMessageStream mMessages;
    std::optional<Admission> mAdmission; // to TLS; empty: plain

    DisconnectReason mWhy = DisconnectReason::Closed; // of the thread that reads
    PollDeadline mHandshake;                          // disabled: the console has identified itself; of the reader
    bool mIsCounted = false;                          // as refused
    // Received so far. The reader alone writes them.
    std::atomic<std::uint64_t> mReceivedMessages{0};
    std::atomic<std::uint64_t> mReceivedBytes{0};
    std::atomic<ConsoleId> mId{0};      // 0: in the handshake
    std::string mName;                  // for the log, of its own threads: the address, later "console 1"
    std::atomic<bool> mHeldBack{false}; // the reader waits for the hypervisor to take another message
    std::atomic<bool> mClosed{false};   // the stream is of no use any more
    std::atomic<bool> mEnded{false};

    // Guards the thread objects while threads start and join each other.
    Mutex mThreadsMutex;
    std::thread mHandshaker QEL_GUARDED_BY(mThreadsMutex); // joined by the reader, if it comes to that
    std::thread mReader QEL_GUARDED_BY(mThreadsMutex);     // started by the handshaker or by start()
    std::thread mWriter;                                   // started by the reader
};

} // namespace qel::protocol
