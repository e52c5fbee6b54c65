#include "serve/ServeMachine.hpp"

#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Logging.hpp>

#include "serve/AuditLog.hpp"

#include <iterator>
#include <utility>

namespace qel::tool {

ServeMachine::ServeMachine(MachineInfo machine, const QelCapabilities& capabilities, ServePolicy policy)
    : Hypervisor(std::move(machine), capabilities), mPolicy(std::move(policy))
{}

void ServeMachine::setPolicy(ServePolicy policy)
{
    const MutexLock lock(mMutex);
    mPolicy = std::move(policy);
}

QelMessageStatusCodes ServeMachine::mayRequest(const Peer& peer, const QelMessage& request)
{
    const MutexLock lock(mMutex);
    return pDecideLocked(peer, request);
}

QelMessageStatusCodes ServeMachine::pDecideLocked(const Peer& peer, const QelMessage& request)
{
    const bool introduces = dynamic_cast<const QelMessageGetEnclTypeAndInterfaceVersionReq*>(&request) != nullptr;
    if (introduces && mPolicy.maxPerCertificate > 0 && !peer.fingerprint.empty()) {
        const auto found = mConsoles.find(peer.fingerprint);
        if (found != mConsoles.end() && found->second >= mPolicy.maxPerCertificate) {
            mRefusedBy = "max-consoles-per-certificate";
            return QelMessageStatusTooManyConnections;
        }
    }
    const QelMessageStatusCodes decision = mPolicy.rules.decide(peer, request);
    if (decision != QelMessageStatusNoError) {
        mRefusedBy = "rules";
        return decision;
    }
    const bool isMuted = mPolicy.mutesBroadcasts && dynamic_cast<const QelMessageDaxBroadcastReq*>(&request) != nullptr;
    if (!isMuted) return QelMessageStatusNoError;
    mRefusedBy = "no-broadcasts";
    return QelMessageStatusInvalidOperation;
}

bool ServeMachine::mayOpen(const Peer& peer, std::uint16_t partition)
{
    const MutexLock lock(mMutex);
    const bool mayOpen = mPolicy.rules.mayOpen(peer, partition);
    if (!mayOpen) mRefusedBy = "rules";
    return mayOpen;
}

std::vector<ServeMachine::SessionPlace> ServeMachine::sessionsToEnd() const
{
    const MutexLock lock(mMutex);
    std::vector<SessionPlace> places;
    for (const auto& session : mSessions) {
        const SessionPlace place = session.first;
        if (!mPolicy.rules.mayUse(session.second, place.first, place.second)) places.push_back(place);
    }
    return places;
}

void ServeMachine::onAnswered(const Peer& peer, const QelMessage& request, QelMessageStatusCodes status)
{
    const MutexLock lock(mMutex);
    const char* const by = std::exchange(mRefusedBy, "");
    const std::string line = auditAnswered(peer, request, status, by);
    if (!line.empty()) logLine(LogLevel::Info, line);
    if (status != QelMessageStatusNoError) return;
    if (const auto* open = dynamic_cast<const QelMessageVirtualSerialOpenReq*>(&request)) {
        mSessions.insert_or_assign(SessionPlace(open->getLpId(), open->getVssConnectionNumber()), peer);
    } else if (const auto* close = dynamic_cast<const QelMessageVirtualSerialCloseReq*>(&request)) {
        mSessions.erase(SessionPlace(close->getLpId(), close->getVssConnectionNumber()));
    } else if (dynamic_cast<const QelMessageInterfaceCmpCloseKrogSessionReq*>(&request) != nullptr) {
        pForgetSessionsLocked(peer);
    }
}

void ServeMachine::onConnected(const Peer& peer)
{
    logLine(LogLevel::Info, auditConnected(peer));
    const MutexLock lock(mMutex);
    if (!peer.fingerprint.empty()) ++mConsoles[peer.fingerprint];
}

void ServeMachine::onDisconnected(const Peer& peer, DisconnectReason why)
{
    logLine(LogLevel::Info, auditLeft(peer, why));
    const MutexLock lock(mMutex);
    pForgetSessionsLocked(peer);
    const auto found = mConsoles.find(peer.fingerprint);
    if (found != mConsoles.end() && --found->second == 0) mConsoles.erase(found);
}

void ServeMachine::pForgetSessionsLocked(const Peer& peer)
{
    for (auto next = mSessions.begin(); next != mSessions.end();)
        next = next->second.id == peer.id ? mSessions.erase(next) : std::next(next);
}

} // namespace qel::tool
