#include "server/Server.hpp"

#include <qel/common/net/SocketStream.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Logging.hpp>

#include <cerrno>
#include <fcntl.h>
#include <utility>

namespace qel::protocol {

namespace {

/// Before the next attempt when a connection could not be accepted for want of descriptors or memory. The end of
/// another connection ends the pause early.
constexpr std::chrono::milliseconds kPause(1000);

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

Server::Server(HypervisorEngine& hypervisor, Socket listener, ConnectionLimits limits,
               std::unique_ptr<SSLServerContext> context, PeerPins pins)
    : mHypervisor(hypervisor), mListener(std::move(listener)), mLimits(limits), mContext(std::move(context)),
      mPins(std::move(pins))
{
    // A connection may vanish between poll() and accept(), which must not block until the next one then.
    mListener.setFlags(mListener.getFlags() | O_NONBLOCK);
}

Server::~Server() = default;

void Server::run(const PollFd& stop)
{
    for (;;) {
        const auto now = TimeProvider::steady();
        if (mPausedUntil.isExpired(now)) mPausedUntil = PollDeadline();
        PollSet set{stop, mConnectionEnded.getPollFd()};
        const PollFd listener = mListener.getPollFd(PollEvents::Read);
        if (mPausedUntil.isDisabled()) set += listener;
        const PollResult result = set.wait(mPausedUntil.getTimeout(now));
        if (result.contains(stop)) return;
        if (result.contains(mConnectionEnded.getPollFd())) pDropEnded();
        if (result.contains(listener)) pAccept();
    }
}

void Server::dumpStatistics(std::ostream& os)
{
    pDropEnded();
    if (mConnections.empty()) os << "No console is connected.\n";
    for (const auto& connection : mConnections)
        connection->dumpStatistics(os);
}

void Server::finish()
{
    mListener = Socket(-1);
    mStopping = true;
    for (const auto& admission : mAdmissions)
        admission->stop();
    const PollDeadline deadline(TimeProvider::steady() + mLimits.linger);
    for (;;) {
        pDropEnded();
        const auto now = TimeProvider::steady();
        if ((mAdmissions.empty() && mConnections.empty()) || deadline.isExpired(now)) break;
        static_cast<void>(PollSet(mConnectionEnded.getPollFd()).wait(deadline.getTimeout(now)));
    }
    for (const auto& connection : mConnections)
        connection->abort();
    mConnections.clear();
    mAdmissions.clear();
}

void Server::pAccept()
{
    try {
        pServe(mListener.accept());
    } catch (const PosixError& error) {
        if (!isTransient(error.getErrorCode().getCode())) pPause(error);
    } catch (const std::exception& error) {
        pPause(error);
    }
}

void Server::pServe(Socket socket)
{
    std::string peer;
    std::unique_ptr<SocketStream> stream;
    try {
        peer = socket.getPeerName().str();
        stream = std::make_unique<SocketStream>(std::move(socket));
    } catch (const PosixError& error) {
        logLine(LogLevel::Info, "a connection ended before it was served: ", error.what());
        return;
    }
    const int descriptor = stream->getSocket().getFd();
    if (mContext != nullptr) return pAdmit(std::move(stream), peer);
    pConnect(std::move(stream), descriptor, peer, mLimits);
}

void Server::pAdmit(std::unique_ptr<SocketStream> stream, const std::string& peer)
{
    auto admission = std::make_unique<Admission>(mHypervisor, std::move(stream), peer, *mContext, mPins,
                                                 TimeProvider::steady() + mLimits.handshake,
                                                 [this] { mConnectionEnded.interrupt(); });
    admission->start();
    mAdmissions.push_back(std::move(admission));
}

void Server::pConnect(std::unique_ptr<Stream> stream, int descriptor, const std::string& peer, ConnectionLimits limits)
{
    auto connection = std::make_unique<Connection>(mHypervisor, std::move(stream), descriptor, peer, limits,
                                                   [this] { mConnectionEnded.interrupt(); });
    connection->start();
    mConnections.push_back(std::move(connection));
}

void Server::pPause(const std::exception& reason)
{
    logLine(LogLevel::Error, "cannot accept a connection: ", explain(reason));
    mPausedUntil = TimeProvider::steady() + kPause;
}

void Server::pDropEnded()
{
    mConnectionEnded.eoi();
    const std::size_t before = mConnections.size() + mAdmissions.size();
    mConnections.remove_if([](const std::unique_ptr<Connection>& connection) { return connection->hasEnded(); });
    std::vector<Admission::Admitted> ended;
    mAdmissions.remove_if([&ended](const std::unique_ptr<Admission>& admission) {
        if (!admission->hasEnded()) return false;
        ended.push_back(admission->release());
        return true;
    });
    for (Admission::Admitted& admitted : ended)
        pOnAdmitted(std::move(admitted));
    if (mConnections.size() + mAdmissions.size() < before) mPausedUntil = PollDeadline(); // descriptors are free again
}

void Server::pOnAdmitted(Admission::Admitted admitted)
{
    if (admitted.stream == nullptr || mStopping) return;
    ConnectionLimits limits = mLimits;
    limits.handshake = admitted.timeLeft;
    try {
        pConnect(std::move(admitted.stream), admitted.descriptor, admitted.peer, limits);
    } catch (const std::exception& error) {
        pPause(error);
    }
}

} // namespace qel::protocol
