#pragma once

#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "hypervisor/HypervisorEngine.hpp"

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>

namespace qel::protocol {

/// Takes one connection of the hypervisor end from TCP to TLS: a thread of its own runs the steps of Handshake.hpp and
/// checks the console's certificate. A connection that has not finished at the deadline is closed. No other connection
/// waits for it.
///
/// Thread safety: one thread owns it (constructor, start(), stop(), release(), destructor); hasEnded() may come from
/// any.
class Admission {
public:
    /// @param hypervisor  borrowed; must outlive this object
    /// @param stream  connected, not null
    /// @param peer  the console's address, for the log
    /// @param context  the server's credentials
    /// @param pins  which consoles are admitted
    /// @param end  the deadline of the whole handshake, the version request included
    /// @param onEnd  called once, on the thread of this admission, when hasEnded() has become true
    /// @throws PosixError, SSLException  descriptors or memory have run out
    Admission(const HypervisorEngine& hypervisor, std::unique_ptr<SocketStream> stream, std::string peer,
              SSLServerContext& context, PeerPins pins, std::chrono::steady_clock::time_point end,
              std::function<void()> onEnd);

    /// Cuts the connection unless it was released, and waits for the thread.
    ~Admission();
    Admission(const Admission&) = delete;
    Admission& operator=(const Admission&) = delete;

    /// Starts the thread. @throws std::system_error  the system allows no more threads
    void start();

    /// For the end of the server: sends the abort message to a console that has not asked for TLS, cuts any other.
    void stop();

    /// True once the thread has nothing left to do.
    bool hasEnded() const noexcept { return mEnded; }

    /// The outcome.
    struct Admitted {
        std::unique_ptr<Stream> stream;     ///< null: the console was not admitted; the connection is closed
        int descriptor;                     ///< of its socket
        std::string peer;                   ///< the console's address
        std::chrono::milliseconds timeLeft; ///< for the version request, at least one
    };

    /// Returns the outcome. Call it once, after hasEnded() has become true.
    Admitted release();

private:
    void pRun() noexcept;
    void pShakeHands();
    bool pAwaitFirstByte();
    bool pBegin();

    const HypervisorEngine& mHypervisor;
    const std::string mPeer;
    const PeerPins mPins;
    const PollDeadline mEnd;
    const std::function<void()> mOnEnd;
    SocketStream& mSocket; // owned by mStream; for the steps in the clear
    std::unique_ptr<SSLStream> mStream;
    WakeUp mWake; // for the thread, until the console's first byte

    // Guards the two flags by which stop() and the thread agree on who ends the connection.
    mutable Mutex mMutex;
    bool mStopping QEL_GUARDED_BY(mMutex) = false;
    bool mHasBegun QEL_GUARDED_BY(mMutex) = false; // the thread waits in the stream, no longer for mWake

    bool mAdmitted = false; // valid once mEnded is true
    std::atomic<bool> mEnded{false};
    std::thread mThread;
};

} // namespace qel::protocol
