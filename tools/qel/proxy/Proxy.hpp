#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "base/Library.hpp"
#include "proxy/ProxyConnection.hpp"
#include "proxy/ProxyObserver.hpp"
#include "proxy/ProxyOpening.hpp"

#include <cstdint>
#include <list>
#include <memory>
#include <vector>

namespace qel::tool {

/// Where a proxy listens, where it connects to, and what it does in between.
struct ProxyOptions {
    std::vector<IPEndpoint> listen{IPEndpoint("127.0.0.1:0")}; ///< port 0 lets the system choose one
    ProxyTarget target;
    std::size_t maxConnections = 64; ///< a further one is refused
    FaultPlan plan;
};

/// Accepts consoles, connects each to the server, and passes on what they say, with the faults of a plan. The engine of
/// "qel proxy", and of tests that put a connection under stress:
///
///     ProxyOptions options;
///     options.target.endpoints = {server.endpoint()};
///     options.plan.rules = {parseFaultRule({"to-server frame=3 drop", "test"})};
///     ProxyObserver nobody;
///     Proxy proxy(options, nobody);      // listens; proxy.endpoints() says where
///     std::thread thread([&] { proxy.run(stop.getPollFd()); });
///
/// One thread serves all connections and waits for none. A TLS handshake has a thread of its own.
/// Lifetime: borrows the observer. Thread safety: one thread; endpoints() from any.
class Proxy {
public:
    /// Listens. @throws CannotListen  "cannot listen on ENDPOINT: ..."; PosixError
    Proxy(ProxyOptions options, ProxyObserver& observer);
    /// Closes all connections.
    ~Proxy();
    Proxy(const Proxy&) = delete;
    Proxy& operator=(const Proxy&) = delete;

    /// In the order of the options, with the ports that the system has chosen.
    const std::vector<IPEndpoint>& endpoints() const noexcept { return mEndpoints; }

    /// Serves until the descriptor is readable. May be called again: connections stay.
    /// @throws what the observer throws
    void run(const PollFd& stop);

    /// Closes all connections, and tells the observer.
    void finish();

    /// Connections that have been accepted.
    std::uint64_t acceptedCount() const noexcept { return mAccepted; }

private:
    using TimePoint = FrameFlow::TimePoint;

    PollSet pPollSet(TimePoint now, const PollFd& stop);
    std::chrono::milliseconds pTimeout(TimePoint now) const;
    void pAccept(Socket& listener, TimePoint now);
    void pServe(const std::vector<PollFd>& results, TimePoint now);
    void pAdvance(ProxyOpening& opening, TimePoint now);

    const ProxyOptions mOptions;
    ProxyObserver& mObserver;
    std::vector<Socket> mListeners;
    std::vector<IPEndpoint> mEndpoints;
    TimePoint mAcceptAt = TimePoint::min(); // later, after descriptors have run out
    WakeUp mWake;                           // a handshake is complete
    std::list<ProxyOpening> mOpenings;
    std::list<ProxyConnection> mConnections;
    std::uint64_t mAccepted = 0;
};

} // namespace qel::tool
