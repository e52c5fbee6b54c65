#pragma once

#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/Hypervisor.hpp>

#include "base/Library.hpp"
#include "serve/AccessRules.hpp"

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

/// What consoles may do, and how many.
struct ServePolicy {
    AccessRules rules;
    std::size_t maxPerCertificate = 0; ///< consoles that may be connected with one certificate; 0: any number
    bool mutesBroadcasts = false;      ///< no console may send messages to others, whatever the rules say
};

/// The hypervisor of "qel serve": the library's, with rules for who may do what, and with a log of who did what.
/// Thread safety: as Hypervisor; setPolicy() from any thread.
class ServeMachine : public Hypervisor {
public:
    ServeMachine(MachineInfo machine, const QelCapabilities& capabilities, ServePolicy policy);

    /// Replaces the policy for everything that is asked from now on.
    void setPolicy(ServePolicy policy);

    /// A session of a partition, by the partition's id and the number of the connection.
    using SessionPlace = std::pair<std::uint16_t, std::uint16_t>;

    /// The sessions that were opened and that the rules do not allow any more. Some of them may have ended since.
    std::vector<SessionPlace> sessionsToEnd() const;

    QelMessageStatusCodes mayRequest(const Peer& peer, const QelMessage& request) override;
    bool mayOpen(const Peer& peer, std::uint16_t partition) override;
    void onConnected(const Peer& peer) override;
    void onAnswered(const Peer& peer, const QelMessage& request, QelMessageStatusCodes status) override;
    void onDisconnected(const Peer& peer, DisconnectReason why) override;

private:
    QelMessageStatusCodes pDecideLocked(const Peer& peer, const QelMessage& request) QEL_REQUIRES(mMutex);
    void pForgetSessionsLocked(const Peer& peer) QEL_REQUIRES(mMutex);

    mutable Mutex mMutex; ///< guards what follows; only the logger's lock is taken under it
    ServePolicy mPolicy QEL_GUARDED_BY(mMutex);
    /// What has refused the request that is being decided about, for its line in the log; empty: nothing so far. The
    /// engine decides about one request at a time, and reports its answer before the next.
    const char* mRefusedBy QEL_GUARDED_BY(mMutex) = "";
    std::map<SessionPlace, Peer> mSessions QEL_GUARDED_BY(mMutex);       ///< see sessionsToEnd()
    std::map<std::string, std::size_t> mConsoles QEL_GUARDED_BY(mMutex); ///< connected ones, by fingerprint
};

} // namespace qel::tool
