#include "proxy/Proxy.hpp"

#include <qel/common/net/Listen.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <limits>
#include <sys/socket.h>
#include <utility>

namespace qel::tool {

namespace {

constexpr int kBacklog = std::numeric_limits<int>::max(); // the system reduces it to what it allows
constexpr std::chrono::seconds kPause(1);                 // before the next try when descriptors have run out

Socket listenAt(const IPEndpoint& endpoint)
{
    try {
        Socket socket = listenOn(endpoint, kBacklog);
        socket.setFlags(socket.getFlags() | O_NONBLOCK);
        return socket;
    } catch (const PosixError& error) {
        std::throw_with_nested(CannotListen("cannot listen on " + endpoint.str() + ": " + error.what()));
    }
}

void resetNow(Socket socket)
{
    const linger atOnce{1, 0};
    static_cast<void>(::setsockopt(socket.getFd(), SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce)));
}

} // namespace

Proxy::Proxy(ProxyOptions options, ProxyObserver& observer) : mOptions(std::move(options)), mObserver(observer)
{
    for (const IPEndpoint& endpoint : mOptions.listen) {
        mListeners.push_back(listenAt(endpoint));
        mEndpoints.push_back(mListeners.back().getSocketName());
    }
}

Proxy::~Proxy() = default;

void Proxy::run(const PollFd& stop)
{
    for (;;) {
        mObserver.onIdle();
        TimePoint now = TimeProvider::steady();
        const PollSet set = pPollSet(now, stop);
        const PollResult ready = set.wait(pTimeout(now));
        now = TimeProvider::steady();
        const std::vector<PollFd>& results = ready.getResults();
        if (results.empty()) continue; // a signal
        if (results[0].mFd.revents != 0) return;
        pServe(results, now);
    }
}

/// Stop, wake-up, listeners; then one for each opening and two for each connection.
PollSet Proxy::pPollSet(TimePoint now, const PollFd& stop)
{
    PollSet set{stop, mWake.getPollFd()};
    for (const Socket& listener : mListeners)
        set += now >= mAcceptAt ? listener.getPollFd(PollEvents::Read) : PollFd::Ignore;
    for (const ProxyOpening& opening : mOpenings)
        set += opening.pollFd();
    for (ProxyConnection& connection : mConnections) {
        set += connection.consoleFd(now);
        set += connection.serverFd(now);
    }
    return set;
}

std::chrono::milliseconds Proxy::pTimeout(TimePoint now) const
{
    TimePoint wake = mAcceptAt > now ? mAcceptAt : FrameFlow::kNever;
    for (const ProxyOpening& opening : mOpenings)
        wake = std::min(wake, opening.wakeAt());
    for (const ProxyConnection& connection : mConnections)
        wake = std::min(wake, connection.wakeAt(now));
    if (wake == FrameFlow::kNever) return PollSet::TIMEOUT_INFINITE;
    // Rounded up: a wait that ends early would be followed by others that do not wait at all.
    return std::max(std::chrono::ceil<std::chrono::milliseconds>(wake - now), std::chrono::milliseconds(0));
}

void Proxy::pServe(const std::vector<PollFd>& results, TimePoint now)
{
    std::size_t at = 1;
    if (results[at++].mFd.revents != 0) mWake.eoi();
    const std::size_t listenersAt = at;
    at += mListeners.size() + mOpenings.size();
    for (auto connection = mConnections.begin(); connection != mConnections.end();) {
        connection->serve(results[at], results[at + 1], now);
        at += 2;
        connection = connection->isDone() ? mConnections.erase(connection) : std::next(connection);
    }
    for (auto opening = mOpenings.begin(); opening != mOpenings.end();) {
        const ProxyOpening::State state = opening->advance(now);
        const bool isOver = state == ProxyOpening::State::Ready || state == ProxyOpening::State::Failed;
        if (state == ProxyOpening::State::Ready) pAdvance(*opening, now);
        if (state == ProxyOpening::State::Failed) {
            mObserver.onRefused(opening->number(), opening->why());
            if (const auto console = opening->takeConsole()) console->reset();
        }
        opening = isOver ? mOpenings.erase(opening) : std::next(opening);
    }
    for (std::size_t i = 0; i < mListeners.size(); ++i) {
        if (results[listenersAt + i].mFd.revents != 0) pAccept(mListeners[i], now);
    }
}

/// An opening is complete.
void Proxy::pAdvance(ProxyOpening& opening, TimePoint now)
{
    auto console = opening.takeConsole();
    auto server = opening.takeServer();
    try {
        mObserver.onOpened(opening.number(), {console->peer(), console->here(), server->here(), server->peer()});
    } catch (const PosixError&) { // the console is gone
        mObserver.onRefused(opening.number(), "the console has gone");
        return;
    }
    for (const std::string& note : opening.notes())
        mObserver.onConnectionNote(opening.number(), note);
    mConnections.emplace_back(opening.number(), std::move(console), std::move(server), mOptions.plan, mObserver);
    mConnections.back().serve(PollFd::Ignore, PollFd::Ignore, now);
    if (mConnections.back().isDone()) mConnections.pop_back();
}

void Proxy::pAccept(Socket& listener, TimePoint now)
{
    try {
        Socket console = listener.accept();
        ++mAccepted;
        if (mConnections.size() + mOpenings.size() >= mOptions.maxConnections) {
            mObserver.onRefused(mAccepted, std::to_string(mOptions.maxConnections) + " connections are open");
            resetNow(std::move(console));
            return;
        }
        mOpenings.emplace_back(mAccepted, std::move(console), mOptions.target, mWake, now);
        mWake.interrupt(); // it may be connected already
    } catch (const PosixError& error) {
        const int code = error.getErrorCode().getCode();
        if (code == EMFILE || code == ENFILE || code == ENOBUFS || code == ENOMEM) mAcceptAt = now + kPause;
    }
}

void Proxy::finish()
{
    for (ProxyOpening& opening : mOpenings)
        mObserver.onRefused(opening.number(), opening.breakOff());
    mOpenings.clear();
    for (ProxyConnection& connection : mConnections)
        connection.abort("the proxy ends");
    mConnections.clear();
    mObserver.onIdle();
}

} // namespace qel::tool
