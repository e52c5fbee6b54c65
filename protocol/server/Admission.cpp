#include "server/Admission.hpp"

#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Handshake.hpp>

#include "server/LastWords.hpp"

namespace qel::protocol {

Admission::Admission(const HypervisorEngine& hypervisor, Stream& clear, int descriptor, SSLStream& tls,
                     PollInterrupt& wake, const PeerPins& pins)
    : mHypervisor(hypervisor), mClear(clear), mDescriptor(descriptor), mTls(tls), mWake(wake), mPins(pins)
{}

PeerIdentity Admission::run(PollDeadline::time_point end)
{
    if (!pAwaitFirstByte(end) || !pEnterStream()) {
        pTurnAway(end);
        throw NoMoreConsoles("the server stops");
    }
    limitTo(mClear, end);
    awaitUpgrade(mClear, mDescriptor);
    if (!mHypervisor.takesConsoles()) {
        pTurnAway(end);
        throw NoMoreConsoles("no more consoles are taken");
    }
    limitTo(mClear, end);
    grantUpgrade(mClear);
    startTls(mTls);
    PeerIdentity peer = identityOf(mTls);
    checkPeer(peer, mPins);
    pLeaveStream();
    return peer;
}

void Admission::stop()
{
    {
        const MutexLock lock(mMutex);
        mStopping = true;
        if (mIsInStream) mTls.close();
    }
    mWake.interrupt();
}

/// @return false: the server stops. A stream without a descriptor is not waited for
bool Admission::pAwaitFirstByte(const PollDeadline& end)
{
    if (mDescriptor < 0) return true;
    const PollFd socket(mDescriptor, PollEvents::Read);
    for (;;) {
        const auto now = TimeProvider::steady();
        if (end.isExpired(now)) throw DeadlinePassed("the peer did not ask for TLS in time");
        const PollResult result = PollSet{socket, mWake.getPollFd()}.wait(end.getTimeout(now));
        if (result.contains(mWake.getPollFd())) return false;
        if (result.contains(socket)) return true;
    }
}

/// @return false: the server stops
bool Admission::pEnterStream()
{
    const MutexLock lock(mMutex);
    mIsInStream = !mStopping;
    return mIsInStream;
}

void Admission::pTurnAway(PollDeadline::time_point end)
{
    limitTo(mClear, end);
    abortHandshake(mClear);
    endSending(mDescriptor);
}

/// From here on the hypervisor ends the connection.
void Admission::pLeaveStream()
{
    const MutexLock lock(mMutex);
    mIsInStream = false;
}

} // namespace qel::protocol
