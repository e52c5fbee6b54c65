#pragma once

#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "hypervisor/HypervisorEngine.hpp"
#include "server/Outbox.hpp"

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <ostream>
#include <string>
#include <thread>

namespace qel::protocol {

/// The limits of one connection.
struct ConnectionLimits {
    std::chrono::milliseconds handshake{10000};     ///< from connecting to a granted version request
    std::chrono::milliseconds linger{2000};         ///< for the queued messages to go out when the connection ends
    std::size_t queueBytes = Outbox::kDefaultLimit; ///< queue limit, in bytes of frames; more than 0
};

/// One connection of the hypervisor end, and the hypervisor's link to its console, with two threads: the reader hands
/// received messages to the hypervisor, and the writer sends the queued messages. Neither waits for another connection.
///
/// While HypervisorEngine::mayReceive() is false the reader does not read. It watches for the console to hang up
/// instead, so that a console that has disconnected does not hold its sessions.
///
/// Thread safety: one thread owns it (constructor, start(), destructor); any thread may call the other operations.
class Connection final : private Outbox {
public:
    /// @param hypervisor  borrowed; must outlive this object
    /// @param stream  connected; not null
    /// @param descriptor  of the stream's socket, watched for a hang-up; -1: none
    /// @param peer  the console's address, for the log
    /// @param onEnd  called once, on a thread of this connection, when hasEnded() has become true
    /// @throws PosixError  there is no descriptor for the reader's wake-up
    Connection(HypervisorEngine& hypervisor, std::unique_ptr<Stream> stream, int descriptor, std::string peer,
               ConnectionLimits limits, std::function<void()> onEnd);

    /// Aborts the connection unless it has ended, and waits for its threads.
    ~Connection() override;

    /// Starts the threads. @throws std::system_error  the system allows no more threads; the connection has ended
    void start();

    /// Cuts both directions at once; queued messages are lost.
    void abort();

    /// True once the threads have nothing left to do.
    bool hasEnded() const noexcept { return mEnded; }

    /// Prints a line that names the console, and the statistics of its queue, indented.
    void dumpStatistics(std::ostream& os) const;

private:
    void resumeReading() override;
    void pOnRoom() override;

    void pRead() noexcept;
    void pWrite() noexcept;
    void pReceiveAll();
    bool pAwaitReceive();
    void pSendAll();
    void pFinish();
    void pReport(const StreamIOException& error) const;
    void pCloseStream() noexcept;

    HypervisorEngine& mHypervisor;
    const std::unique_ptr<Stream> mStream;
    PollFd mHangUp;
    const std::string mPeer;
    const ConnectionLimits mLimits;
    const std::function<void()> mOnEnd;
    QelMessageStream mMessages;
    WakeUp mWake;      // for the reader while mayReceive() is false
    ConsoleId mId = 0; // set before the threads start
    PollDeadline mHandshake;
    std::atomic<bool> mEnded{false};
    std::thread mReader;
    std::thread mWriter;
};

} // namespace qel::protocol
