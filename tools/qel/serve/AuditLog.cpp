#include "serve/AuditLog.hpp"

#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/RefusalReason.hpp"

#include <cstdint>

namespace qel::tool {

namespace {

std::string line(const char* event, const Peer& peer)
{
    return std::string("audit: ") + event + " console=" + std::to_string(peer.id) + " name=" + quoted(peer.commonName) +
           " fingerprint=" + (peer.fingerprint.empty() ? "-" : peer.fingerprint) + " address=" + peer.address;
}

const char* wordFor(DisconnectReason why)
{
    switch (why) {
    case DisconnectReason::Closed:
        return "closed";
    case DisconnectReason::Lost:
        return "lost";
    case DisconnectReason::Protocol:
        return "protocol";
    case DisconnectReason::Timeout:
        return "timeout";
    case DisconnectReason::Idle:
        return "idle";
    case DisconnectReason::Shutdown:
        return "shutdown";
    case DisconnectReason::Failure:
        break;
    }
    return "failure";
}

std::string place(std::uint16_t partition, std::uint16_t connection)
{
    return " partition=" + std::to_string(partition) + " connection=" + std::to_string(connection);
}

/// " partition=1 connection=0" for a request about a session; otherwise empty.
std::string placeOf(const QelMessage& request)
{
    if (const auto* open = dynamic_cast<const QelMessageVirtualSerialOpenReq*>(&request)) {
        return place(open->getLpId(), open->getVssConnectionNumber());
    }
    if (const auto* close = dynamic_cast<const QelMessageVirtualSerialCloseReq*>(&request)) {
        return place(close->getLpId(), close->getVssConnectionNumber());
    }
    if (const auto* setUp = dynamic_cast<const QelMessageVirtualSerialSetupSessionReq*>(&request)) {
        return place(setUp->getLpId(), setUp->getVssConnectionNumber());
    }
    return {};
}

std::string refused(const Peer& peer, const QelMessage& request, QelMessageStatusCodes status, const std::string& by)
{
    const std::string name = requestName(request);
    return line("refused", peer) + placeOf(request) + " request=" + quoted(name.empty() ? "unknown" : name) +
           " status=" + std::to_string(static_cast<unsigned int>(status)) + " why=" + statusName(status) +
           (by.empty() ? "" : " by=" + by);
}

} // namespace

std::string auditConnected(const Peer& peer)
{
    return line("connected", peer) + " tool=" + std::to_string(peer.toolType) + "," + quoted(peer.toolId);
}

std::string auditLeft(const Peer& peer, DisconnectReason why) { return line("left", peer) + " why=" + wordFor(why); }

std::string auditEnded(const Peer& peer, std::uint16_t partition, std::uint16_t connection, uid_t user)
{
    return line("ended", peer) + place(partition, connection) + " uid=" + std::to_string(user);
}

std::string auditBreak(std::uint16_t partition, uid_t user)
{
    return "audit: break partition=" + std::to_string(partition) + " uid=" + std::to_string(user);
}

std::string auditAnswered(const Peer& peer, const QelMessage& request, QelMessageStatusCodes status,
                          const std::string& by)
{
    if (status != QelMessageStatusNoError) return refused(peer, request, status, by);
    if (const auto* open = dynamic_cast<const QelMessageVirtualSerialOpenReq*>(&request)) {
        const bool types = open->getVssConnectionNumber() == 0;
        return line(open->isForceOpen() ? "forced" : (types ? "opened" : "watched"), peer) + placeOf(request);
    }
    if (const auto* close = dynamic_cast<const QelMessageVirtualSerialCloseReq*>(&request)) {
        return line("closed", peer) + placeOf(request) + (close->isForceClose() ? " force=yes" : "");
    }
    return {};
}

} // namespace qel::tool
