#include "server/KeepAlive.hpp"

#include <qel/common/util/PosixError.hpp>

#include <algorithm>
#include <cerrno>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

namespace qel::protocol {

namespace {

/// Probes after the idle time, so that a lost one does not matter.
constexpr int kProbes = 10;

void set(const Socket& socket, int level, int name, int value)
{
    if (::setsockopt(socket.getFd(), level, name, &value, sizeof(value)) == 0) return;
    throw PosixError(errno, "cannot set the keep-alive of a connection");
}

} // namespace

// Half of the time is idle, the other half is for the probes. The user timeout of the stream would not only replace
// their number. It also cuts a peer that answers and has no room for data, such as a console that is suspended: see
// tcp(7).
void setKeepAlive(const Socket& socket, std::chrono::seconds time)
{
    const int seconds = static_cast<int>(time.count());
    set(socket, SOL_SOCKET, SO_KEEPALIVE, 1);
    set(socket, IPPROTO_TCP, TCP_KEEPCNT, kProbes);
    set(socket, IPPROTO_TCP, TCP_KEEPIDLE, std::max(seconds / 2, 1));
    set(socket, IPPROTO_TCP, TCP_KEEPINTVL, std::max(seconds / 2 / kProbes, 1));
    set(socket, IPPROTO_TCP, TCP_USER_TIMEOUT, 0);
}

} // namespace qel::protocol
