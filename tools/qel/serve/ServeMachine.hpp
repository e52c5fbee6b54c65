#pragma once

#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/Hypervisor.hpp>

#include "base/Library.hpp"
#include "serve/AccessRules.hpp"

#include <cstddef>
#include <map>
#include <string>

namespace qel::tool {

/// The hypervisor of "qel serve": the library's, with rules for who may do what.
/// Thread safety: as Hypervisor; setRules() from any thread.
class ServeMachine : public Hypervisor {
public:
    /// @param maxPerCertificate  consoles that may be connected with one certificate; 0: any number
    ServeMachine(MachineInfo machine, const QelCapabilities& capabilities, AccessRules rules,
                 std::size_t maxPerCertificate);

    /// Replaces the rules for everything that is asked from now on.
    void setRules(AccessRules rules);

    QelMessageStatusCodes mayRequest(const Peer& peer, const QelMessage& request) override;
    bool mayOpen(const Peer& peer, std::uint16_t partition) override;
    void onConnected(const Peer& peer) override;
    void onDisconnected(const Peer& peer) override;

private:
    const std::size_t mMaxPerCertificate;

    Mutex mMutex; ///< a leaf
    AccessRules mRules QEL_GUARDED_BY(mMutex);
    std::map<std::string, std::size_t> mConsoles QEL_GUARDED_BY(mMutex); ///< connected ones, by fingerprint
};

} // namespace qel::tool
