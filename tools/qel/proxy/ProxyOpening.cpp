#include "proxy/ProxyOpening.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/PeerIdentity.hpp>

#include "base/Failures.hpp"

#include <cerrno>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <utility>

namespace qel::tool {

namespace {

constexpr int kMaxSegmentBytes = 16384; // as connectTo() announces

std::string describe(const char* side, const SSLStream& stream, const PeerIdentity& peer)
{
    return std::string("TLS with ") + side + ": " + describePeer(peer) + ", " + stream.getCipher();
}

} // namespace

ProxyOpening::ProxyOpening(std::uint64_t number, Socket console, const ProxyTarget& target, PollInterrupt& done,
                           TimePoint now)
    : mNumber(number), mTarget(target), mDone(done), mEnd(now + target.timeout),
      mConsole(std::make_unique<ProxyEnd>(std::move(console)))
{
    pConnect();
}

ProxyOpening::~ProxyOpening() { static_cast<void>(breakOff()); }

std::string ProxyOpening::breakOff()
{
    constexpr const char* kReason = "the proxy ends";
    if (!mThread.joinable()) return kReason;
    const bool hasFailed = mIsComplete;
    if (mConsole != nullptr) mConsole->cancel();
    if (mServer != nullptr) mServer->cancel();
    mThread.join();
    return hasFailed && !mWhy.empty() ? mWhy : kReason;
}

/// Starts to connect to the next endpoint. Leaves no socket when there is none.
void ProxyOpening::pConnect()
{
    mServer.reset();
    while (mNext < mTarget.endpoints.size()) {
        const IPEndpoint& endpoint = mTarget.endpoints[mNext++];
        try {
            Socket socket(endpoint.getFamily(), SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
            socket.setSocketOption(IPPROTO_TCP, TCP_MAXSEG, kMaxSegmentBytes);
            auto server = std::make_unique<ProxyEnd>(std::move(socket));
            const sockaddr_storage address = endpoint.getSockaddr();
            const socklen_t length =
                endpoint.getFamily() == IPFamily::IPv4 ? sizeof(sockaddr_in) : sizeof(sockaddr_in6);
            const int result = ::connect(server->descriptor(), reinterpret_cast<const sockaddr*>(&address), length);
            const int error = errno;
            if (result == 0 || error == EINPROGRESS) {
                mServer = std::move(server);
                return;
            }
            mWhy = "cannot connect to " + endpoint.str() + ": " + PosixError(error).what();
        } catch (const PosixError& error) {
            mWhy = "cannot connect to " + endpoint.str() + ": " + error.what();
        }
    }
}

ProxyOpening::State ProxyOpening::pFail(const std::string& why)
{
    mWhy = why;
    return State::Failed;
}

PollFd ProxyOpening::pollFd() const
{
    const bool waits = !mIsProtecting && mServer != nullptr;
    return waits ? PollFd(mServer->descriptor(), PollEvents::Write) : PollFd::Ignore;
}

ProxyOpening::State ProxyOpening::advance(TimePoint now)
{
    if (mIsProtecting) {
        if (!mIsComplete) return State::Protecting;
        mThread.join();
        return mWhy.empty() ? State::Ready : State::Failed;
    }
    if (mServer == nullptr) return State::Failed;
    if (now >= mEnd) return pFail("cannot connect to " + mTarget.endpoints[mNext - 1].str() + " in time");
    return pCheckConnected();
}

ProxyOpening::State ProxyOpening::pCheckConnected()
{
    const PollResult result = PollSet(pollFd()).poll();
    if (!result.anyReady()) return State::Connecting;
    const int error = mServer->takeError();
    if (error != 0) {
        mWhy = "cannot connect to " + mTarget.endpoints[mNext - 1].str() + ": " + PosixError(error).what();
        pConnect();
        return mServer == nullptr ? State::Failed : State::Connecting;
    }
    mWhy.clear();
    if (mTarget.consoleContext == nullptr && mTarget.serverContext == nullptr) return State::Ready;
    mIsProtecting = true;
    mThread = std::thread([this] { pProtect(); });
    return State::Protecting;
}

/// On its own thread: the steps that wait for the peers.
void ProxyOpening::pProtect()
{
    bool mayTellConsole = false;
    try {
        if (mTarget.consoleContext != nullptr) {
            limitTo(mConsole->clear(), mEnd);
            awaitUpgrade(mConsole->clear(), mConsole->descriptor());
            mayTellConsole = true;
        }
        if (mTarget.serverContext != nullptr) pProtectServer();
        mayTellConsole = false;
        if (mTarget.consoleContext != nullptr) pProtectConsole();
        mConsole->stopWaiting();
        mServer->stopWaiting();
    } catch (const std::exception& error) {
        mWhy = userMessage(error);
    }
    mIsComplete = true; // what is left takes no time: the message finds room
    try {
        if (mayTellConsole && !mWhy.empty()) abortHandshake(mConsole->clear());
    } catch (const std::exception&) { // it is gone too
    }
    mDone.interrupt();
}

void ProxyOpening::pProtectServer()
{
    Stream& clear = mServer->clear();
    limitTo(clear, mEnd);
    requestUpgrade(clear, mServer->descriptor());
    SSLStream& tls = mServer->protect(*mTarget.serverContext);
    startTls(tls);
    const PeerIdentity peer = identityOf(tls);
    checkPeer(peer, mTarget.serverPins);
    mNotes.push_back(describe("the server", tls, peer));
}

void ProxyOpening::pProtectConsole()
{
    limitTo(mConsole->clear(), mEnd);
    grantUpgrade(mConsole->clear());
    SSLStream& tls = mConsole->protect(*mTarget.consoleContext);
    startTls(tls);
    const PeerIdentity peer = identityOf(tls);
    checkPeer(peer, mTarget.consolePins);
    mNotes.push_back(describe("the console", tls, peer));
}

} // namespace qel::tool
