#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/util/BitmaskEnum.hpp>
#include <qel/protocol/PeerIdentity.hpp>

#include "base/Library.hpp"

#include <cstdint>
#include <string>
#include <vector>

namespace qel::tool {

/// What a console may do.
enum class AccessRight : std::uint8_t {
    None = 0,
    Watch = 1,      ///< open the connections 1 to 15 of a partition
    Type = 2,       ///< open connection 0 of a partition, and watch
    Force = 4,      ///< with the one of the two that is needed: take the connection from another console, or close it
    Broadcast = 8,  ///< send messages to other consoles
    Attributes = 16 ///< set the global mode and the metadata
};

/// What the holders of some certificates may do.
struct AccessRule {
    /// Partition ids in [first, last].
    struct Range {
        std::uint16_t first;
        std::uint16_t last;
    };

    // Whom the rule is for. A console must match each of the two lists that is not empty.
    std::vector<std::string> names;        ///< common names; "*" is every certificate of the root
    std::vector<std::string> fingerprints; ///< as normalizedFingerprint() returns them

    bool allPartitions = true;
    std::vector<Range> partitions; ///< used unless `allPartitions` is set
    AccessRight rights = AccessRight::None;
};

/// Who may do what. The rights of several rules that are for the same console add up.
///
/// Without any rule every console may do anything. With at least one, a console may do what a rule says, and no more:
/// | Not allowed | Status |
/// |---|---|
/// | to connect: no rule is for the console | 18, for the version request |
/// | to use a partition at all | 21, as if it did not exist |
/// | to type (connection 0), to force, to broadcast, to set attributes | 1 |
///
/// A plain value. Thread safety: that of one.
class AccessRules {
public:
    /// Allows everything.
    AccessRules() = default;

    explicit AccessRules(std::vector<AccessRule> rules);

    /// The number of rules.
    std::size_t size() const noexcept { return mRules.size(); }

    /// @return NoError: the request is allowed; otherwise the status of the refusal
    QelMessageStatusCodes decide(const PeerIdentity& peer, const QelMessage& request) const;

    /// Whether a console may use a partition in some way.
    bool mayOpen(const PeerIdentity& peer, std::uint16_t partition) const;

    /// Whether it may use one of the partition's connections.
    bool mayUse(const PeerIdentity& peer, std::uint16_t partition, std::uint16_t connection) const;

private:
    bool pIsKnown(const PeerIdentity& peer) const;
    /// What the console may do to the partition; everything without rules.
    AccessRight pRightsOn(const PeerIdentity& peer, std::uint16_t partition) const;
    bool pMay(const PeerIdentity& peer, AccessRight right) const;
    QelMessageStatusCodes pDecideOpen(const PeerIdentity& peer, std::uint16_t partition, std::uint16_t connection,
                                      bool force) const;

    std::vector<AccessRule> mRules;
};

} // namespace qel::tool

namespace qel {

template <>
struct is_bitmask_enum<tool::AccessRight> : std::true_type {};

} // namespace qel
