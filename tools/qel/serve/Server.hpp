#pragma once

#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/Poll.hpp>

#include "base/WakeUp.hpp"
#include "serve/Admission.hpp"
#include "serve/Connection.hpp"
#include "serve/Hypervisor.hpp"
#include "transport/PeerPins.hpp"

#include <chrono>
#include <list>
#include <memory>
#include <ostream>

namespace qel::tool {

/// Accepts connections for a hypervisor and keeps them until they end.
/// Thread safety: one thread owns it; its connections have threads of their own.
class Server {
public:
    /// @param hypervisor  borrowed; must outlive this object
    /// @param listener  listens already
    /// @param context  for TLS; null: connections are plain
    /// @param pins  who may come in over TLS
    Server(Hypervisor& hypervisor, Socket listener, ConnectionLimits limits,
           std::unique_ptr<SSLServerContext> context = nullptr, PeerPins pins = {});

    /// Cuts what is left of the connections.
    ~Server();

    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;

    /// Accepts connections until `stop` becomes readable. May be called again.
    void run(const PollFd& stop);

    /// From now on connections are made with this; those that are there keep what they have.
    void setContext(std::unique_ptr<SSLServerContext> context) { mContext = std::move(context); }

    /// Prints what is known about the queue of each connection, in the order in which they came.
    void dumpStatistics(std::ostream& os);

    /// Accepts no more, waits for all connections to end and cuts those that have not in time. To be called after
    /// Hypervisor::shutDown(), which makes them end.
    void finish();

private:
    void pAccept();
    void pTakeIn(Socket socket);
    void pAdmit(std::unique_ptr<SocketStream> stream, const std::string& peer);
    void pConnect(std::unique_ptr<Stream> stream, int descriptor, const std::string& peer, ConnectionLimits limits);
    void pPause(const std::exception& reason);
    void pDropEnded();
    void pLetIn(Admission::Admitted admitted);

    Hypervisor& mHypervisor;
    Socket mListener;
    const ConnectionLimits mLimits;
    WakeUp mConnectionEnded;
    PollDeadline mPausedUntil;                  // no connection is accepted before; disabled: not paused
    std::unique_ptr<SSLServerContext> mContext; // null: connections are plain
    const PeerPins mPins;
    bool mStopping = false;
    std::list<std::unique_ptr<Admission>> mAdmissions; // on their way to TLS
    std::list<std::unique_ptr<Connection>> mConnections;
};

} // namespace qel::tool
