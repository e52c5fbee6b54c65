#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/Logging.hpp>
#include <qel/protocol/Server.hpp>
#include <qel/protocol/ServerAddress.hpp>
#include <qel/protocol/WakeUp.hpp>

#include "base/Guard.hpp"
#include "hypervisor/HypervisorEngine.hpp"
#include "server/CheckedOptions.hpp"
#include "server/Connection.hpp"
#include "server/HandshakePlaces.hpp"
#include "server/KeepAlive.hpp"
#include "server/LastWords.hpp"
#include "server/Listener.hpp"
#include "server/LogThrottle.hpp"
#include "server/QuietLog.hpp"
#include "server/RefusalCounts.hpp"
#include "server/SerialLoop.hpp"

#include <algorithm>
#include <atomic>
#include <iterator>
#include <list>
#include <map>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <thread>
#include <utility>

namespace qel::protocol {

namespace {

/// The pause of run() after a failure, before the next attempt.
constexpr std::chrono::milliseconds kPauseAfterFailure(100);

/// What a console may take to read the abort message that it did not ask for; it fits the buffer of any fresh
/// connection.
constexpr std::chrono::milliseconds kRefusalTime(10);

/// The descriptor of a stream that has one; -1: it has none.
int descriptorOf(const Stream& stream)
{
    const auto* const socket = dynamic_cast<const SocketStream*>(&stream);
    return socket == nullptr ? -1 : socket->getSocket().getFd();
}

ConnectionLimits limitsOf(const ServerOptions& options)
{
    return {options.handshakeTimeout, options.frameTimeout, options.linger, options.queueBytes};
}

/// Sockets that were made elsewhere may listen anywhere.
std::vector<IPEndpoint> checkEndpoints(std::vector<IPEndpoint> endpoints, bool isPlain)
{
    for (const IPEndpoint& endpoint : endpoints) {
        if (isPlain && !isLoopback(endpoint.getAddress())) {
            throw std::invalid_argument("plain: for loopback addresses only");
        }
    }
    return endpoints;
}

std::unique_ptr<SSLServerContext> contextOf(const ServerOptions& options)
{
    return options.credentials ? options.credentials->makeServerContext() : nullptr;
}

/// Adds what has passed on a connection to the sums. What is pending is not: it is lost when a connection ends.
void addTo(ServerState& sums, const ConnectedConsole& console)
{
    using Buckets = QelMessageLatencyBuckets;
    QueueState& queues = sums.queues;
    sums.received += console.received;
    queues.sent += console.queue.sent;
    queues.dropped += console.queue.dropped;
    queues.mostBytes = std::max(queues.mostBytes, console.queue.mostBytes);
    const auto& counts = console.queue.latency.getCounts();
    for (std::size_t i = 0; i < counts.size(); ++i) {
        constexpr std::size_t kLimits = std::size(Buckets::LIMITS);
        const auto latency = i < kLimits ? Buckets::LIMITS[i] : Buckets::LIMITS[kLimits - 1] * 2;
        queues.latency.increment(latency, counts[i]);
    }
}

} // namespace

struct Server::Impl {
    Impl(Hypervisor& hypervisor, const ServerOptions& options);
    ~Impl() { finish(); }

    const std::vector<IPEndpoint>& endpoints() const noexcept { return mEndpoints; }
    void run(const PollFd& stop);
    void serve(ServedStream stream, HandshakePlaces::Place place);
    void setCredentials(const Credentials& credentials);
    void countAccepted() noexcept { mAccepted.fetch_add(1, std::memory_order_relaxed); }
    ServerState state() const;
    void dumpStatistics(std::ostream& os);
    bool hasPulse();
    HypervisorEngine& engine() noexcept { return mEngine; }
    void finish() noexcept;

private:
    using Connections = std::list<std::unique_ptr<Connection>>;

    bool pRunOnce(const PollFd& stop);
    void pAccept(const PollResult& ready);
    void pServe(Socket socket);
    void pRefuse(SocketStream& stream, const ServedStream& served, const char* reason);
    void pAwaitEnd();
    bool pDropEnded();

    const std::vector<IPEndpoint> mListenAt;
    const std::chrono::seconds mKeepAlive;
    const PeerPins mPins;
    const bool mIsPlain;

    WakeUp mWake;       // for run() and finish(): a connection has ended, or log lines were held back
    WakeUp mSerialWake; // for the serial loop
    LogThrottle mThrottle{[this] { mWake.interrupt(); }};
    const std::string mAccepting = "new connections"; // for the throttle
    HandshakePlaces mPlaces;
    const std::chrono::system_clock::time_point mSince = TimeProvider::system();
    RefusalCounts mRefusals;
    std::atomic<std::uint64_t> mAccepted{0};
    HypervisorEngine mEngine;
    const ConnectionServices mServices;

    mutable Mutex mMutex;
    std::unique_ptr<SSLServerContext> mContext QEL_GUARDED_BY(mMutex); // null: connections are plain
    Connections mConnections QEL_GUARDED_BY(mMutex);
    ServerState mPast QEL_GUARDED_BY(mMutex); // the sums of the connections that are no longer in the list
    bool mFinished QEL_GUARDED_BY(mMutex) = false;

    std::optional<Listener> mListener; // empty after finish()
    const std::vector<IPEndpoint> mEndpoints;
    SerialLoop mSerialLoop;
    std::uint64_t mSeenTurns = 0; // of the serial loop, by hasPulse()
};

Server::Impl::Impl(Hypervisor& hypervisor, const ServerOptions& options)
    : mListenAt(checkOptions(options)), mKeepAlive(options.keepAlive), mPins(options.pins), mIsPlain(options.plain),
      mPlaces(options.maxHandshakes, options.maxHandshakesPerAddress),
      mEngine(hypervisor, options.maxConsoles, [this] { mSerialWake.interrupt(); },
              {options.idleTimeout, options.linger}),
      mServices{mEngine, mPins, limitsOf(options), mThrottle, mWake, mRefusals}, mContext(contextOf(options)),
      mListener(std::in_place, mListenAt, options.sockets),
      mEndpoints(checkEndpoints(mListener->endpoints(), mIsPlain)), mSerialLoop(mEngine, mSerialWake)
{}

void Server::Impl::run(const PollFd& stop)
{
    while (mListener) {
        try {
            if (pRunOnce(stop)) return;
        } catch (...) {
            logCurrent("the server");
            std::this_thread::sleep_for(kPauseAfterFailure);
        }
    }
}

/// @return true: `stop` is readable
bool Server::Impl::pRunOnce(const PollFd& stop)
{
    const auto now = TimeProvider::steady();
    if (mListener->pausedUntil().isExpired(now)) mListener->resume();
    PollSet set{stop, mWake.getPollFd()};
    mListener->addTo(set);
    const PollDeadline next = std::min(mListener->pausedUntil(), PollDeadline(mThrottle.getNextReport()));
    const PollResult result = set.wait(next.getTimeout(now));
    if (result.contains(stop)) return true;
    if (result.contains(mWake.getPollFd())) {
        mWake.eoi();
        if (pDropEnded()) mListener->resume(); // descriptors are free again
    }
    mThrottle.report();
    pAccept(result);
    return false;
}

void Server::Impl::pAccept(const PollResult& ready)
{
    const LogThrottle::Scope scope(mThrottle, mAccepting); // anybody can cause these lines, and nobody is to blame yet
    try {
        std::optional<Socket> socket = mListener->accept(ready);
        if (socket) pServe(std::move(*socket));
    } catch (const std::exception& error) {
        logQuietly(LogLevel::Error, "cannot accept a connection: ", Explained{error});
        mListener->pause();
    }
}

void Server::Impl::pServe(Socket socket)
{
    countAccepted();
    ServedStream served;
    std::unique_ptr<SocketStream> stream;
    try {
        const IPEndpoint peer = socket.getPeerName();
        served.address = peer.str();
        served.source = sourceOf(peer.getAddress());
        stream = std::make_unique<SocketStream>(std::move(socket));
        setKeepAlive(stream->getSocket(), mKeepAlive);
    } catch (const PosixError& error) {
        logLine(LogLevel::Info, "a connection ended before it was served: ", error.what());
        mRefusals.count(ConnectionRefusal::Left);
        return;
    }
    HandshakePlaces::Place place = mPlaces.take(served.source);
    if (!place) {
        mRefusals.count(place.getReason());
        return pRefuse(*stream, served, place.getRefusal());
    }
    served.descriptor = stream->getSocket().getFd();
    served.stream = std::move(stream);
    serve(std::move(served), std::move(place));
}

/// Closes a connection that finds no place. A console that uses TLS learns that it is turned away.
void Server::Impl::pRefuse(SocketStream& stream, const ServedStream& served, const char* reason)
{
    const LogThrottle::Scope scope(mThrottle, served.source);
    logLine(LogLevel::Warn, served.address, ": refused: ", reason);
    if (mIsPlain) return;
    try {
        limitTo(stream, TimeProvider::steady() + kRefusalTime);
        abortHandshake(stream);
        endSending(descriptorOf(stream));
    } catch (const Error&) { // NOLINT(bugprone-empty-catch): it is gone already
    }
}

void Server::Impl::serve(ServedStream stream, HandshakePlaces::Place place)
{
    static_cast<void>(pDropEnded()); // without run() nothing else does
    const MutexLock lock(mMutex);
    if (mFinished) return;
    auto connection = std::make_unique<Connection>(mServices, std::move(stream), mContext.get(), std::move(place));
    connection->start();
    mConnections.push_back(std::move(connection));
}

void Server::Impl::setCredentials(const Credentials& credentials)
{
    if (mIsPlain) throw std::logic_error("connections are plain");
    auto context = credentials.makeServerContext();
    const MutexLock lock(mMutex);
    mContext.swap(context);
}

ServerState Server::Impl::state() const
{
    std::map<ConsoleId, ConnectedConsole> known; // to the engine, whose lock comes after this one's
    for (ConnectedConsole& console : mEngine.consoles())
        known.emplace(console.peer.id, std::move(console));
    const MutexLock lock(mMutex);
    ServerState state = mPast;
    state.since = mSince;
    state.accepted = mAccepted.load(std::memory_order_relaxed);
    state.refused = mRefusals.get();
    for (const auto& connection : mConnections) {
        ConnectedConsole console = connection->state();
        addTo(state, console);
        const auto found = known.find(console.peer.id);
        if (found != known.end()) {
            console.peer = std::move(found->second.peer);
            console.isIdentified = found->second.isIdentified;
        } else if (console.peer.id != 0 || connection->hasEnded()) {
            continue; // it is on its way out
        }
        state.queues.pending += console.queue.pending;
        state.consoles.push_back(std::move(console));
    }
    return state;
}

bool Server::Impl::hasPulse()
{
    const std::uint64_t turns = mSerialLoop.turns();
    const bool isAlive = turns != mSeenTurns;
    mSeenTurns = turns;
    mSerialWake.interrupt();
    return isAlive;
}

void Server::Impl::dumpStatistics(std::ostream& os)
{
    static_cast<void>(pDropEnded());
    std::ostringstream text; // the stream may be slow, and consoles wait for the lock
    {
        const MutexLock lock(mMutex);
        bool any = false;
        for (const auto& connection : mConnections)
            any |= connection->dumpStatistics(text);
        if (!any) text << "No console is connected.\n";
    }
    os << text.str();
}

void Server::Impl::finish() noexcept
{
    {
        const MutexLock lock(mMutex);
        if (std::exchange(mFinished, true)) return; // from here on no connection is added
    }
    mListener.reset();
    runGuarded([this] { mEngine.shutDown(); }, "the end of the server");
    runGuarded([this] { pAwaitEnd(); }, "the end of the server");
    Connections left;
    {
        const MutexLock lock(mMutex);
        left.swap(mConnections);
    }
    for (const auto& connection : left)
        connection->abort();
    left.clear();
    runGuarded([this] { mThrottle.reportAll(); }, "the end of the server");
}

/// Waits for the connections to end, for the linger time.
void Server::Impl::pAwaitEnd()
{
    {
        const MutexLock lock(mMutex);
        for (const auto& connection : mConnections)
            connection->stop();
    }
    const PollDeadline deadline(TimeProvider::steady() + mServices.limits.linger);
    for (;;) {
        mWake.eoi();
        static_cast<void>(pDropEnded());
        {
            const MutexLock lock(mMutex);
            if (mConnections.empty()) return;
        }
        const auto now = TimeProvider::steady();
        if (deadline.isExpired(now)) return;
        static_cast<void>(PollSet(mWake.getPollFd()).wait(deadline.getTimeout(now)));
    }
}

/// Destroys the connections that have ended. @return whether there were any
bool Server::Impl::pDropEnded()
{
    Connections ended;
    {
        const MutexLock lock(mMutex);
        for (auto next = mConnections.begin(); next != mConnections.end();) {
            const auto connection = next++;
            if (!(*connection)->hasEnded()) continue;
            addTo(mPast, (*connection)->state());
            ended.splice(ended.end(), mConnections, connection);
        }
    }
    return !ended.empty(); // destroyed without the lock
}

Server::Server(Hypervisor& hypervisor, const ServerOptions& options)
    : mImpl(std::make_unique<Impl>(hypervisor, options))
{}

Server::~Server() = default;

std::vector<IPEndpoint> Server::endpoints() const { return mImpl->endpoints(); }

void Server::run(const PollFd& stop) { mImpl->run(stop); }

void Server::serve(std::unique_ptr<Stream> stream, const std::string& address)
{
    if (stream == nullptr) throw std::invalid_argument("stream");
    const int descriptor = descriptorOf(*stream);
    mImpl->countAccepted();
    mImpl->serve({std::move(stream), descriptor, address, address}, {});
}

void Server::setCredentials(const Credentials& credentials) { mImpl->setCredentials(credentials); }

void Server::addPartition(std::uint16_t id, std::unique_ptr<SerialLine> line, PartitionOptions options)
{
    mImpl->engine().addPartition(id, std::move(line), std::move(options));
}

bool Server::changePartition(std::uint16_t id, const PartitionOptions& options)
{
    return mImpl->engine().changePartition(id, options);
}

bool Server::removePartition(std::uint16_t id) { return mImpl->engine().removePartition(id); }

std::vector<PartitionState> Server::partitions() const { return mImpl->engine().partitions(); }

bool Server::closeSession(std::uint16_t partition, std::uint16_t number)
{
    return mImpl->engine().closeSession(partition, number);
}

bool Server::sendBreak(std::uint16_t partition) { return mImpl->engine().sendBreak(partition); }

ServerState Server::state() const { return mImpl->state(); }

bool Server::hasPulse() { return mImpl->hasPulse(); }

void Server::dumpStatistics(std::ostream& os) { mImpl->dumpStatistics(os); }

void Server::finish() noexcept { mImpl->finish(); }

} // namespace qel::protocol
