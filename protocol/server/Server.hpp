#pragma once

#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "hypervisor/HypervisorEngine.hpp"
#include "server/Admission.hpp"
#include "server/Connection.hpp"

#include <chrono>
#include <list>
#include <memory>
#include <ostream>

namespace qel::protocol {

/// Accepts connections for a hypervisor and keeps them until they end.
/// Thread safety: one thread owns it; its connections have threads of their own.
class Server {
public:
    /// @param hypervisor  borrowed; must outlive this object
    /// @param listener  a listening socket
    /// @param context  the server's credentials for TLS; null: connections are plain
    /// @param pins  which consoles are admitted over TLS
    Server(HypervisorEngine& hypervisor, Socket listener, ConnectionLimits limits,
           std::unique_ptr<SSLServerContext> context = nullptr, PeerPins pins = {});

    /// Cuts the remaining connections.
    ~Server();

    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;

    /// Accepts connections until `stop` becomes readable. May be called again.
    void run(const PollFd& stop);

    /// Replaces the credentials for new connections. Present ones keep theirs.
    void setContext(std::unique_ptr<SSLServerContext> context) { mContext = std::move(context); }

    /// Prints the statistics of each connection's queue, in the order of connecting.
    void dumpStatistics(std::ostream& os);

    /// Stops listening, waits for all connections to end and cuts those that have not ended after the linger time.
    /// To be called after HypervisorEngine::shutDown(), which makes them end.
    void finish();

private:
    void pAccept();
    void pServe(Socket socket);
    void pAdmit(std::unique_ptr<SocketStream> stream, const std::string& peer);
    void pConnect(std::unique_ptr<Stream> stream, int descriptor, const std::string& peer, ConnectionLimits limits);
    void pPause(const std::exception& reason);
    void pDropEnded();
    void pOnAdmitted(Admission::Admitted admitted);

    HypervisorEngine& mHypervisor;
    Socket mListener;
    const ConnectionLimits mLimits;
    WakeUp mConnectionEnded;
    PollDeadline mPausedUntil;                  // when to accept connections again; disabled: not paused
    std::unique_ptr<SSLServerContext> mContext; // null: connections are plain
    const PeerPins mPins;
    bool mStopping = false;
    std::list<std::unique_ptr<Admission>> mAdmissions; // in their handshake
    std::list<std::unique_ptr<Connection>> mConnections;
};

} // namespace qel::protocol
