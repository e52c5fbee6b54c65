#pragma once

#include <qel/common/net/Socket.hpp>
#include <qel/common/util/Poll.hpp>

#include "Connection.hpp"
#include "Hypervisor.hpp"
#include "WakeUp.hpp"

#include <chrono>
#include <list>
#include <memory>

namespace qel::tool {

/// Accepts connections for a hypervisor and keeps them until they end.
/// Thread safety: one thread owns it; its connections have threads of their own.
class Server {
public:
    /// @param hypervisor  borrowed; must outlive this object
    /// @param listener  listens already
    Server(Hypervisor& hypervisor, Socket listener, ConnectionTimes times);

    /// Cuts what is left of the connections.
    ~Server();

    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;

    /// Accepts connections until `stop` becomes readable.
    void run(const PollFd& stop);

    /// Accepts no more, waits for all connections to end and cuts those that have not in time. To be called after
    /// Hypervisor::shutDown(), which makes them end.
    void finish();

private:
    void pAccept();
    void pTakeIn(Socket socket);
    void pPause(const std::exception& reason);
    void pDropEnded();

    Hypervisor& mHypervisor;
    Socket mListener;
    const ConnectionTimes mTimes;
    WakeUp mConnectionEnded;
    PollDeadline mPausedUntil; // no connection is accepted before; disabled: not paused
    std::list<std::unique_ptr<Connection>> mConnections;
};

} // namespace qel::tool
