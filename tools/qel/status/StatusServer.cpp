#include "status/StatusServer.hpp"

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Logging.hpp>

#include <algorithm>
#include <array>
#include <cerrno>
#include <exception>
#include <optional>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

/// After a failure, such as a want of descriptors, before the next attempt.
constexpr std::chrono::milliseconds kPauseAfterFailure(100);

/// @return none: the system does not say
std::optional<uid_t> userOf(int descriptor)
{
    ucred peer{};
    socklen_t length = sizeof(peer);
    if (::getsockopt(descriptor, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) return std::nullopt;
    return peer.uid;
}

bool isTransient(int error) { return error == EAGAIN || error == EWOULDBLOCK || error == EINTR; }

} // namespace

StatusServer::StatusServer(const std::string& path, Handler handler) : mSocket(path), mHandler(std::move(handler))
{
    mThread = std::thread([this] { pRun(); });
}

StatusServer::~StatusServer()
{
    mStop.interrupt();
    mThread.join();
}

void StatusServer::pRun() noexcept
{
    for (;;) {
        try {
            if (pRunOnce()) return;
            mIsFailing = false;
        } catch (const std::exception& error) {
            mClients.clear();
            try { // not each attempt: without descriptors that may go on for long
                if (!std::exchange(mIsFailing, true)) logLine(LogLevel::Error, "status socket: ", explain(error));
            } catch (...) { // NOLINT(bugprone-empty-catch): without memory nothing can be said
            }
            ::usleep(std::chrono::microseconds(kPauseAfterFailure).count());
        }
    }
}

/// @return true: it is to stop
bool StatusServer::pRunOnce()
{
    const PollFd listener(mSocket.descriptor(), PollEvents::Read);
    PollSet set{mStop.getPollFd(), listener};
    PollDeadline next;
    for (const Client& client : mClients) {
        set += PollFd(client.fd.get(), client.answer.empty() ? PollEvents::Read : PollEvents::Write);
        next = std::min(next, client.end);
    }
    const PollResult ready = set.wait(next.getTimeout(TimeProvider::steady()));
    if (ready.contains(mStop.getPollFd())) return true;
    const auto now = TimeProvider::steady();
    mClients.remove_if([&](Client& client) {
        if (client.end.isExpired(now)) return true;
        return ready.contains(PollFd(client.fd.get(), PollEvents::All)) && !pServe(client);
    });
    if (ready.contains(listener)) pAccept();
    return false;
}

void StatusServer::pAccept()
{
    UniqueFd fd(::accept4(mSocket.descriptor(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (fd.get() < 0) {
        if (errno != EMFILE && errno != ENFILE && errno != ENOBUFS && errno != ENOMEM) return; // it is gone already
        throw PosixError(errno, "cannot accept a connection");
    }
    const std::optional<uid_t> user = userOf(fd.get());
    if (!user || (*user != ::geteuid() && *user != 0)) {
        return logLine(LogLevel::Warn, "status socket: refused a process of another user");
    }
    if (mClients.size() >= kMostClients) mClients.pop_front();
    mClients.push_back({std::move(fd), *user, PollDeadline(TimeProvider::steady() + kTime), {}, {}});
}

/// @return false: it is done with
bool StatusServer::pServe(Client& client)
{
    if (client.answer.empty() && !pReceive(client)) return false;
    return client.answer.empty() || pSend(client);
}

/// Reads what there is of a request, and makes the answer when it has arrived. @return false: it is done with
bool StatusServer::pReceive(Client& client)
{
    std::array<char, kLineBytes> buffer;
    const ssize_t count = ::recv(client.fd.get(), buffer.data(), buffer.size() - client.line.size(), 0);
    if (count < 0) return isTransient(errno);
    if (count == 0) return false;
    client.line.append(buffer.data(), static_cast<std::size_t>(count));
    const std::size_t end = client.line.find('\n');
    if (end == std::string::npos) return client.line.size() < kLineBytes;
    client.answer = mHandler(client.line.substr(0, end), client.user) + '\n';
    return true;
}

/// @return false: it is done with
bool StatusServer::pSend(Client& client)
{
    const ssize_t count = ::send(client.fd.get(), client.answer.data(), client.answer.size(), MSG_NOSIGNAL);
    if (count < 0) return isTransient(errno);
    client.answer.erase(0, static_cast<std::size_t>(count));
    return !client.answer.empty();
}

} // namespace qel::tool
