#include "serve/ServeMachine.hpp"

#include <qel/common/QelMessageInterfaceComponent.hpp>

#include <utility>

namespace qel::tool {

ServeMachine::ServeMachine(MachineInfo machine, const QelCapabilities& capabilities, AccessRules rules,
                           std::size_t maxPerCertificate)
    : Hypervisor(std::move(machine), capabilities), mMaxPerCertificate(maxPerCertificate), mRules(std::move(rules))
{}

void ServeMachine::setRules(AccessRules rules)
{
    const MutexLock lock(mMutex);
    mRules = std::move(rules);
}

QelMessageStatusCodes ServeMachine::mayRequest(const Peer& peer, const QelMessage& request)
{
    const MutexLock lock(mMutex);
    const bool introduces = dynamic_cast<const QelMessageGetEnclTypeAndInterfaceVersionReq*>(&request) != nullptr;
    if (introduces && mMaxPerCertificate > 0 && !peer.fingerprint.empty()) {
        const auto found = mConsoles.find(peer.fingerprint);
        if (found != mConsoles.end() && found->second >= mMaxPerCertificate) return QelMessageStatusTooManyConnections;
    }
    return mRules.decide(peer, request);
}

bool ServeMachine::mayOpen(const Peer& peer, std::uint16_t partition)
{
    const MutexLock lock(mMutex);
    return mRules.mayOpen(peer, partition);
}

void ServeMachine::onConnected(const Peer& peer)
{
    const MutexLock lock(mMutex);
    if (!peer.fingerprint.empty()) ++mConsoles[peer.fingerprint];
}

void ServeMachine::onDisconnected(const Peer& peer)
{
    const MutexLock lock(mMutex);
    const auto found = mConsoles.find(peer.fingerprint);
    if (found != mConsoles.end() && --found->second == 0) mConsoles.erase(found);
}

} // namespace qel::tool
