#pragma once

#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/Poll.hpp>

#include "base/WakeUp.hpp"
#include "serve/Hypervisor.hpp"
#include "transport/PeerPins.hpp"

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>

namespace qel::tool {

/// The way of one connection of the hypervisor end from TCP to TLS: a thread of its own takes the steps of
/// Handshake.hpp and looks at who the console is. Whoever has not come through when the time is over is closed, so that
/// a console that is silent or slow holds nothing; and nobody else waits for it.
///
/// Thread safety: one thread owns it (constructor, start(), stop(), release(), destructor); hasEnded() may come from
/// any.
class Admission {
public:
    /// @param hypervisor  borrowed; must outlive this object
    /// @param stream  connected, not null
    /// @param peer  where the console is, for the log
    /// @param context  what this connection proves its identity with
    /// @param pins  who may come in
    /// @param end  of the time for the whole handshake, the version request included
    /// @param onEnd  called once, on the thread of this admission, when hasEnded() has become true
    /// @throws PosixError, SSLException  there is no descriptor or no memory left
    Admission(const Hypervisor& hypervisor, std::unique_ptr<SocketStream> stream, std::string peer,
              SSLServerContext& context, PeerPins pins, std::chrono::steady_clock::time_point end,
              std::function<void()> onEnd);

    /// Cuts the connection unless it was released, and waits for the thread.
    ~Admission();
    Admission(const Admission&) = delete;
    Admission& operator=(const Admission&) = delete;

    /// Starts the thread. @throws std::system_error  there can be no more threads
    void start();

    /// The server stops: a console that has not asked yet is turned away as soon as it can be, any other is cut.
    void stop();

    /// True once the thread has nothing left to do.
    bool hasEnded() const noexcept { return mEnded; }

    /// A connection that came through.
    struct Admitted {
        std::unique_ptr<Stream> stream;     ///< null: this one did not; it is closed
        int descriptor;                     ///< of its socket
        std::string peer;                   ///< where the console is
        std::chrono::milliseconds timeLeft; ///< for the version request, at least one
    };

    /// To be called once, when it has ended.
    Admitted release();

private:
    void pRun() noexcept;
    void pShakeHands();
    bool pAwaitFirstByte();
    bool pBegin();

    const Hypervisor& mHypervisor;
    const std::string mPeer;
    const PeerPins mPins;
    const PollDeadline mEnd;
    const std::function<void()> mOnEnd;
    SocketStream& mSocket; // what mStream owns; for the steps in the clear
    std::unique_ptr<SSLStream> mStream;
    WakeUp mWake; // of the thread while the console has said nothing yet

    // Guards the two flags by which stop() and the thread agree on who ends the connection.
    mutable Mutex mMutex;
    bool mStopping QEL_GUARDED_BY(mMutex) = false;
    bool mHasBegun QEL_GUARDED_BY(mMutex) = false; // the thread waits in the stream and not for mWake any more

    bool mAdmitted = false; // to be looked at once mEnded is true
    std::atomic<bool> mEnded{false};
    std::thread mThread;
};

} // namespace qel::tool
