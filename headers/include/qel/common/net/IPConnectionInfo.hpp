#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPEndpoint.hpp>

#include <iosfwd>

namespace qel {

/// The two ends of one connection.
/// Thread safety: a plain value.
class QEL_EXPORT IPConnectionInfo {
public:
    /// @param client  the end that connected
    /// @param server  the end that accepted
    IPConnectionInfo(const IPEndpoint& client, const IPEndpoint& server) noexcept;

    const IPEndpoint& getClient() const noexcept { return mClient; }
    const IPEndpoint& getServer() const noexcept { return mServer; }

private:
    IPEndpoint mClient;
    IPEndpoint mServer;
};

/// Prints both ends, as in [10.0.0.2:40000 -> 10.0.0.1:80].
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const IPConnectionInfo& connection);

} // namespace qel
