#include "server/Admission.hpp"

#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/Logging.hpp>

#include <algorithm>
#include <utility>

namespace qel::protocol {

Admission::Admission(const HypervisorEngine& hypervisor, std::unique_ptr<SocketStream> stream, std::string peer,
                     SSLServerContext& context, PeerPins pins, std::chrono::steady_clock::time_point end,
                     std::function<void()> onEnd)
    : mHypervisor(hypervisor), mPeer(std::move(peer)), mPins(std::move(pins)), mEnd(end), mOnEnd(std::move(onEnd)),
      mSocket(*stream), mStream(std::make_unique<SSLStream>(context, std::move(stream)))
{}

Admission::~Admission()
{
    if (!mThread.joinable()) return;
    if (!mEnded) stop();
    mThread.join();
}

void Admission::start()
{
    mThread = std::thread([this] { pRun(); });
}

void Admission::stop()
{
    {
        const MutexLock lock(mMutex);
        mStopping = true;
        if (mHasBegun) mStream->close();
    }
    mWake.interrupt();
}

Admission::Admitted Admission::release()
{
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(PollDeadline::time_point(mEnd) - TimeProvider::steady());
    const int descriptor = mSocket.getSocket().getFd();
    if (!mAdmitted) mStream.reset();
    return {std::move(mStream), descriptor, mPeer, std::max(left, std::chrono::milliseconds(1))};
}

void Admission::pRun() noexcept
{
    try {
        pShakeHands();
    } catch (const Error& error) {
        logLine(LogLevel::Warn, mPeer, ": refused: ", error.what());
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, mPeer, ": ", explain(error));
    }
    if (!mAdmitted) mStream->close();
    mEnded = true;
    mOnEnd();
}

void Admission::pShakeHands()
{
    if (!pAwaitFirstByte() || !pBegin()) {
        limitTo(mSocket, mEnd);
        abortHandshake(mSocket);
        throw TurnedAway("the server stops");
    }
    limitTo(mSocket, mEnd);
    awaitUpgrade(mSocket, mSocket.getSocket().getFd());
    limitTo(mSocket, mEnd);
    if (!mHypervisor.takesConsoles()) {
        abortHandshake(mSocket);
        throw TurnedAway("no more consoles are taken");
    }
    grantUpgrade(mSocket);
    startTls(*mStream);
    const PeerIdentity peer = identityOf(*mStream);
    checkPeer(peer, mPins);
    mStream->clearWriteDeadline();
    logLine(LogLevel::Info, mPeer, ": over TLS: ", describePeer(peer));
    mAdmitted = true;
}

/// @return false: the server stops
bool Admission::pAwaitFirstByte()
{
    const PollFd socket = mSocket.getSocket().getPollFd(PollEvents::Read);
    for (;;) {
        const auto now = TimeProvider::steady();
        if (mEnd.isExpired(now)) {
            throw DeadlinePassed("the peer did not ask for TLS in time");
        }
        const PollResult result = PollSet{socket, mWake.getPollFd()}.wait(mEnd.getTimeout(now));
        if (result.contains(mWake.getPollFd())) return false;
        if (result.contains(socket)) return true;
    }
}

/// From here on the thread may wait in the stream. @return false: the server stops
bool Admission::pBegin()
{
    const MutexLock lock(mMutex);
    mHasBegun = !mStopping;
    return mHasBegun;
}

} // namespace qel::protocol
