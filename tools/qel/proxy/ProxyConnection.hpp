#pragma once

#include <qel/common/util/Poll.hpp>

#include "proxy/ProxyEnd.hpp"
#include "proxy/ProxyObserver.hpp"

#include <cstdint>
#include <memory>
#include <string>

namespace qel::tool {

/// One connection through the proxy: two sides, and a flow in each direction. Moves what can be moved without waiting,
/// and says what to wait for.
///
/// The end of a direction, a reset and a side that does not read have the same effect on the other side as without the
/// proxy.
/// Lifetime: borrows the plan and the observer. Thread safety: one thread.
class ProxyConnection {
public:
    using TimePoint = FrameFlow::TimePoint;

    ProxyConnection(std::uint64_t number, std::unique_ptr<ProxyEnd> console, std::unique_ptr<ProxyEnd> server,
                    const FaultPlan& plan, ProxyObserver& observer);

    /// What to wait for at the console's side, and at the server's.
    PollFd consoleFd(TimePoint now) { return pPollFd(mConsole, now); }
    PollFd serverFd(TimePoint now) { return pPollFd(mServer, now); }

    /// When to come back although neither is ready; FrameFlow::kNever: not before.
    TimePoint wakeAt(TimePoint now) const;

    /// Moves what can be moved. @param consoleReady, serverReady  what has been waited for, with the events seen
    void serve(const PollFd& consoleReady, const PollFd& serverReady, TimePoint now);

    /// True when nothing is left to do: the connection can be destroyed, which closes both sides.
    bool isDone() const noexcept { return mIsDone; }

    /// Ends it at once. @param why  for the observer
    void abort(const std::string& why);

private:
    struct End {
        std::unique_ptr<ProxyEnd> socket;
        ProxySide side;
        FrameFlow from; // what comes from it
        bool isReadable = true;
        bool isBlocked = false; // has no room
        bool isEnded = false;   // towards it
        bool isGone = false;    // hung up: nothing to wait for unless it is read
        bool hasEnded = false;  // it has ended its direction
    };

    PollFd pPollFd(End& end, TimePoint now);
    FrameFlow& pFlowTo(const End& end) noexcept { return &end == &mConsole ? mServer.from : mConsole.from; }
    void pNote(End& end, const PollFd& ready, TimePoint now);
    bool pRead(End& end, TimePoint now);
    bool pSend(End& end, TimePoint now);
    void pDrain(End& end);
    void pCheckEndings();
    void pCheckFlow(FrameFlow& flow, End& to);
    void pReset(const std::string& why);
    void pFinish(const std::string& why);

    const std::uint64_t mNumber;
    ProxyObserver& mObserver;
    End mConsole;
    End mServer;
    bool mIsCut = false; // by a rule: what arrives is dropped until both sides have ended
    TimePoint mCutUntil = FrameFlow::kNever;
    std::string mWhy;
    bool mIsDone = false;
};

} // namespace qel::tool
