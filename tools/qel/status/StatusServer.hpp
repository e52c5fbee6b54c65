#pragma once

#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "base/Library.hpp"
#include "status/StatusSocket.hpp"

#include <chrono>
#include <cstddef>
#include <functional>
#include <list>
#include <string>
#include <sys/types.h>
#include <thread>

namespace qel::tool {

/// Answers requests over a status socket, on a thread of its own: a line in, a line out, and the connection is closed.
///
/// Only processes of the same user and of root are answered. No client can hold the others up, nor cost much: a request
/// has at most kLineBytes, a connection at most kTime, and when kMostClients are connected, the oldest makes room.
///
/// Lifetime: the handler is called until the destructor has returned. Thread safety: one thread owns it.
class StatusServer {
public:
    static constexpr std::size_t kLineBytes = 512;
    static constexpr std::size_t kMostClients = 16;
    static constexpr std::chrono::seconds kTime{5};

    /// Makes the answer to a request, on the server's thread. What it throws closes the connection, and is logged.
    /// @param line  without its line feed: untrusted
    /// @param user  who asks
    using Handler = std::function<std::string(const std::string& line, uid_t user)>;

    /// @throws CommandFailure  as StatusSocket
    /// @throws PosixError, std::system_error  no descriptor or thread is left
    StatusServer(const std::string& path, Handler handler);

    /// Stops answering, and removes the socket.
    ~StatusServer();

    StatusServer(const StatusServer&) = delete;
    StatusServer& operator=(const StatusServer&) = delete;

    const std::string& path() const noexcept { return mSocket.path(); }

private:
    struct Client {
        UniqueFd fd;
        uid_t user;
        PollDeadline end;
        std::string line;   ///< received so far
        std::string answer; ///< left to send; empty: the request has not arrived
    };

    void pRun() noexcept;
    bool pRunOnce();
    void pAccept();
    bool pServe(Client& client);
    bool pReceive(Client& client);
    static bool pSend(Client& client);

    StatusSocket mSocket;
    const Handler mHandler;
    WakeUp mStop;
    std::list<Client> mClients; ///< of the thread, oldest first
    bool mIsFailing = false;    ///< of the thread: the last turn has failed
    std::thread mThread;
};

} // namespace qel::tool
