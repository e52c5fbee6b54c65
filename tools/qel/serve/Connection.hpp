#pragma once

#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/Poll.hpp>

#include "base/WakeUp.hpp"
#include "serve/ConsoleLink.hpp"
#include "serve/Hypervisor.hpp"
#include "serve/Outbox.hpp"

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <ostream>
#include <string>
#include <thread>

namespace qel::tool {

/// What a connection of the hypervisor end allows its console.
struct ConnectionLimits {
    std::chrono::milliseconds handshake{10000};     ///< from connecting to a granted version request
    std::chrono::milliseconds linger{2000};         ///< to take what is still queued when the connection ends
    std::size_t queueBytes = Outbox::kDefaultLimit; ///< of frames that may be queued for it; more than 0
};

/// One connection of the hypervisor end: a thread that reads messages and hands them to the hypervisor, a thread that
/// writes what the hypervisor has for this console, and one that waits for room in the queue between the two, so that
/// nobody else has to. None waits for another connection.
///
/// The reader does not read while the hypervisor says that the next message has to wait; then it watches for the
/// console to go away, so that a console which is gone does not hold its sessions.
///
/// Thread safety: one thread owns it (constructor, start(), destructor); the other operations may come from any.
class Connection final : private ConsoleLink {
public:
    /// @param hypervisor  borrowed; must outlive this object
    /// @param stream  connected; not null
    /// @param descriptor  of the stream's socket, watched for the console to hang up; -1: there is none
    /// @param peer  where the console is, for the log
    /// @param onEnd  called once, on a thread of this connection, when hasEnded() has become true
    /// @throws PosixError  no descriptor is left for the reader's wake-up
    Connection(Hypervisor& hypervisor, std::unique_ptr<Stream> stream, int descriptor, std::string peer,
               ConnectionLimits limits, std::function<void()> onEnd);

    /// Aborts the connection if need be and waits for its threads.
    ~Connection() override;

    /// Starts the threads. @throws std::system_error  there can be no more threads; the connection has ended
    void start();

    /// Both directions are cut at once; what is queued is lost.
    void abort();

    /// True once the threads have nothing left to do.
    bool hasEnded() const noexcept { return mEnded; }

    /// Prints a line that says whose queue it is, and the statistics of the queue, indented.
    void dumpStatistics(std::ostream& os) const;

private:
    void post(std::unique_ptr<QelMessage> message) override;
    void postSerial(std::unique_ptr<QelMessage> message) override;
    bool offer(std::unique_ptr<QelMessage> message) override;
    bool hasRoom() const override;
    bool hasSerialRoom() const override;
    void resumeReading() override;
    void finish() override;

    void pRead() noexcept;
    void pFeed() noexcept;
    void pTellRoom();
    void pWrite() noexcept;
    void pReceiveAll();
    bool pWaitForTurn();
    void pSendAll();
    void pEnd();
    void pReport(const StreamIOException& error) const;
    void pCloseStream() noexcept;

    Hypervisor& mHypervisor;
    const std::unique_ptr<Stream> mStream;
    PollFd mHangUp;
    const std::string mPeer;
    const ConnectionLimits mLimits;
    const std::function<void()> mOnEnd;
    QelMessageStream mMessages;
    Outbox mOutbox;
    WakeUp mWake;      // of the reader while it waits for its turn
    ConsoleId mId = 0; // set before the threads start
    PollDeadline mHandshake;
    std::atomic<bool> mEnded{false};
    std::thread mReader;
    std::thread mFeeder;
    std::thread mWriter;
};

} // namespace qel::tool
