#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/PeerPins.hpp>

#include "base/Library.hpp"
#include "proxy/FrameFlow.hpp"
#include "proxy/ProxyEnd.hpp"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace qel::tool {

/// Where a proxy connects to, and how both sides are protected.
struct ProxyTarget {
    std::vector<IPEndpoint> endpoints;                ///< of the server, tried in turn; at least one
    std::shared_ptr<SSLServerContext> consoleContext; ///< towards consoles; null: no TLS
    std::shared_ptr<SSLClientContext> serverContext;  ///< towards the server; null: no TLS
    PeerPins consolePins;
    PeerPins serverPins;
    std::chrono::milliseconds timeout{10000}; ///< for connecting, and the handshakes, together
};

/// A connection that comes about: the proxy connects to the server and performs the steps before TLS and the handshakes
/// with both sides, those on a thread of its own.
/// Lifetime: borrows the target and the wake-up. Thread safety: one thread.
class ProxyOpening {
public:
    using TimePoint = FrameFlow::TimePoint;
    enum class State { Connecting, Protecting, Ready, Failed };

    /// Starts to connect.
    /// @param done  is made pending when the handshakes are complete
    ProxyOpening(std::uint64_t number, Socket console, const ProxyTarget& target, PollInterrupt& done, TimePoint now);
    /// Breaks off what goes on.
    ~ProxyOpening();
    ProxyOpening(const ProxyOpening&) = delete;
    ProxyOpening& operator=(const ProxyOpening&) = delete;

    /// Ends it. @return why it does not come about, in one line
    std::string breakOff();

    std::uint64_t number() const noexcept { return mNumber; }

    /// Goes on as far as it does without waiting.
    State advance(TimePoint now);

    /// What to wait for.
    PollFd pollFd() const;
    TimePoint wakeAt() const noexcept { return mIsProtecting ? FrameFlow::kNever : mEnd; }

    /// Of a failed one: why, in one line. The console's side has been told or will be reset.
    const std::string& why() const noexcept { return mWhy; }

    /// Of one that is ready: who the peers are, in one line for each side with TLS.
    const std::vector<std::string>& notes() const noexcept { return mNotes; }
    std::unique_ptr<ProxyEnd> takeConsole() { return std::move(mConsole); }
    std::unique_ptr<ProxyEnd> takeServer() { return std::move(mServer); }

private:
    void pConnect();
    State pFail(const std::string& why);
    State pCheckConnected();
    void pProtect();
    void pProtectServer();
    void pProtectConsole();

    const std::uint64_t mNumber;
    const ProxyTarget& mTarget;
    PollInterrupt& mDone;
    const TimePoint mEnd; // for all of it
    std::unique_ptr<ProxyEnd> mConsole;
    std::unique_ptr<ProxyEnd> mServer;
    std::size_t mNext = 0; // the endpoint to try
    std::string mWhy;
    std::vector<std::string> mNotes;
    bool mIsProtecting = false;
    std::atomic<bool> mIsComplete{false}; // set by the thread: what it wrote can be read
    std::thread mThread;
};

} // namespace qel::tool
