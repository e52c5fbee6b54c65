#include "server/Listener.hpp"

#include <qel/common/net/Listen.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>

#include <cerrno>
#include <exception>
#include <fcntl.h>
#include <limits>
#include <string>
#include <sys/socket.h>

namespace qel::protocol {

namespace {

/// As many as the system allows, which reduces it to net.core.somaxconn: in a flood an honest connection must not wait
/// for its SYN to be sent again.
constexpr int kBacklog = std::numeric_limits<int>::max();

Socket listenAt(const IPEndpoint& endpoint)
{
    try {
        Socket socket = listenOn(endpoint, kBacklog);
        // A connection may vanish between poll() and accept(), which must not block until the next one then.
        socket.setFlags(socket.getFlags() | O_NONBLOCK);
        return socket;
    } catch (const PosixError& error) {
        std::throw_with_nested(CannotListen("cannot listen on " + endpoint.str() + ": " + error.what()));
    }
}

int optionOf(int descriptor, int name)
{
    int value = 0;
    socklen_t length = sizeof(value);
    if (::getsockopt(descriptor, SOL_SOCKET, name, &value, &length) != 0) throw PosixError(errno, "getsockopt");
    return value;
}

/// A socket of our own for one that was made elsewhere.
Socket adopt(int descriptor)
{
    const std::string failure = "cannot listen on descriptor " + std::to_string(descriptor) + ": ";
    try {
        const int family = optionOf(descriptor, SO_DOMAIN);
        if ((family != AF_INET && family != AF_INET6) || optionOf(descriptor, SO_TYPE) != SOCK_STREAM) {
            throw CannotListen(failure + "it is not a TCP socket");
        }
        if (optionOf(descriptor, SO_ACCEPTCONN) == 0) throw CannotListen(failure + "it does not listen");
        Socket socket(::fcntl(descriptor, F_DUPFD_CLOEXEC, 0));
        if (socket.getFd() < 0) throw PosixError(errno, "fcntl");
        socket.setFlags(socket.getFlags() | O_NONBLOCK); // see listenAt()
        return socket;
    } catch (const PosixError& error) {
        std::throw_with_nested(CannotListen(failure + error.what()));
    }
}

/// Failures of accept() that concern one connection only, or none: see accept(2).
bool isTransient(int error)
{
    switch (error) {
    case EAGAIN:
    case EINTR:
    case ECONNABORTED:
    case EPROTO:
    case ENETDOWN:
    case ENOPROTOOPT:
    case EHOSTDOWN:
    case ENONET:
    case EHOSTUNREACH:
    case ENETUNREACH:
        return true;
    default:
        return false;
    }
}

} // namespace

Listener::Listener(const std::vector<IPEndpoint>& endpoints, const std::vector<int>& descriptors)
{
    for (const IPEndpoint& endpoint : endpoints)
        mSockets.push_back(listenAt(endpoint));
    for (const int descriptor : descriptors)
        mSockets.push_back(adopt(descriptor));
}

Listener::~Listener() = default;

std::vector<IPEndpoint> Listener::endpoints() const
{
    std::vector<IPEndpoint> endpoints;
    for (const Socket& socket : mSockets)
        endpoints.push_back(socket.getSocketName());
    return endpoints;
}

void Listener::addTo(PollSet& set) const
{
    if (mPausedUntil.isExpired(TimeProvider::steady()) || mPausedUntil.isDisabled()) {
        for (const Socket& socket : mSockets)
            set += socket.getPollFd(PollEvents::Read);
    }
}

std::optional<Socket> Listener::accept(const PollResult& ready)
{
    for (std::size_t tried = 0; tried < mSockets.size(); ++tried) {
        Socket& socket = mSockets[mNext];
        mNext = (mNext + 1) % mSockets.size();
        if (!ready.contains(socket.getPollFd(PollEvents::Read))) continue;
        try {
            return socket.accept();
        } catch (const PosixError& error) {
            if (isTransient(error.getErrorCode().getCode())) return std::nullopt;
            pause();
            throw;
        }
    }
    return std::nullopt;
}

void Listener::pause() { mPausedUntil = TimeProvider::steady() + kPause; }

} // namespace qel::protocol
