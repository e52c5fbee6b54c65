#include "serve/AccessRules.hpp"

#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include <algorithm>
#include <utility>

namespace qel::tool {

namespace {

using qel::operator|;
using qel::operator|=;
using qel::operator&;

constexpr const char* kEverybody = "*";
constexpr AccessRight kAll = static_cast<AccessRight>(31);

bool has(AccessRight rights, AccessRight right) { return (rights & right) != AccessRight::None; }

template <typename T>
bool is(const QelMessage& message)
{
    return dynamic_cast<const T*>(&message) != nullptr;
}

bool matchesName(const AccessRule& rule, const PeerIdentity& peer)
{
    return std::any_of(rule.names.begin(), rule.names.end(), [&peer](const std::string& name) {
        // A certificate without a common name is not the one of an empty name.
        return name == kEverybody || (!peer.commonName.empty() && name == peer.commonName);
    });
}

bool isFor(const AccessRule& rule, const PeerIdentity& peer)
{
    if (peer.fingerprint.empty()) return false; // no certificate
    if (rule.names.empty() && rule.fingerprints.empty()) return false;
    if (!rule.names.empty() && !matchesName(rule, peer)) return false;
    if (rule.fingerprints.empty()) return true;
    return std::find(rule.fingerprints.begin(), rule.fingerprints.end(), peer.fingerprint) != rule.fingerprints.end();
}

bool covers(const AccessRule& rule, std::uint16_t partition)
{
    return rule.allPartitions ||
           std::any_of(rule.partitions.begin(), rule.partitions.end(), [partition](const AccessRule::Range& range) {
               return range.first <= partition && partition <= range.last;
           });
}

} // namespace

AccessRules::AccessRules(std::vector<AccessRule> rules) : mRules(std::move(rules)) {}

QelMessageStatusCodes AccessRules::decide(const PeerIdentity& peer, const QelMessage& request) const
{
    if (mRules.empty()) return QelMessageStatusNoError;
    if (!pIsKnown(peer)) return QelMessageStatusTooManyConnections;
    const auto* open = dynamic_cast<const QelMessageVirtualSerialOpenReq*>(&request);
    if (open != nullptr) {
        return pDecideOpen(peer, open->getLpId(), open->getVssConnectionNumber(), open->isForceOpen());
    }
    const auto* close = dynamic_cast<const QelMessageVirtualSerialCloseReq*>(&request);
    if (close != nullptr && close->isForceClose() && !has(pRightsOn(peer, close->getLpId()), AccessRight::Force)) {
        return QelMessageStatusInvalidOperation;
    }
    if (is<QelMessageDaxBroadcastReq>(request) && !pMay(peer, AccessRight::Broadcast)) {
        return QelMessageStatusInvalidOperation;
    }
    const bool setsAttributes =
        is<QelMessageSetGlobalModeAttributeReq>(request) || is<QelMessageSetGlobalSaveAreaMetadataReq>(request);
    if (setsAttributes && !pMay(peer, AccessRight::Attributes)) return QelMessageStatusInvalidOperation;
    return QelMessageStatusNoError;
}

bool AccessRules::mayOpen(const PeerIdentity& peer, std::uint16_t partition) const
{
    return has(pRightsOn(peer, partition), AccessRight::Watch | AccessRight::Type);
}

bool AccessRules::mayUse(const PeerIdentity& peer, std::uint16_t partition, std::uint16_t connection) const
{
    return connection == 0 ? has(pRightsOn(peer, partition), AccessRight::Type) : mayOpen(peer, partition);
}

bool AccessRules::pIsKnown(const PeerIdentity& peer) const
{
    return std::any_of(mRules.begin(), mRules.end(), [&peer](const AccessRule& rule) { return isFor(rule, peer); });
}

AccessRight AccessRules::pRightsOn(const PeerIdentity& peer, std::uint16_t partition) const
{
    if (mRules.empty()) return kAll;
    AccessRight rights = AccessRight::None;
    for (const AccessRule& rule : mRules) {
        if (isFor(rule, peer) && covers(rule, partition)) rights |= rule.rights;
    }
    return rights;
}

/// For the rights that are not about a partition.
bool AccessRules::pMay(const PeerIdentity& peer, AccessRight right) const
{
    return std::any_of(mRules.begin(), mRules.end(),
                       [&](const AccessRule& rule) { return isFor(rule, peer) && has(rule.rights, right); });
}

QelMessageStatusCodes AccessRules::pDecideOpen(const PeerIdentity& peer, std::uint16_t partition,
                                               std::uint16_t connection, bool force) const
{
    if (!mayOpen(peer, partition)) return QelMessageStatusInvalidLparId;
    if (!mayUse(peer, partition, connection)) return QelMessageStatusInvalidOperation;
    if (force && !has(pRightsOn(peer, partition), AccessRight::Force)) return QelMessageStatusInvalidOperation;
    return QelMessageStatusNoError;
}

} // namespace qel::tool
