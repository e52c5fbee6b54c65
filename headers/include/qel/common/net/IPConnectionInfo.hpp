#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/net/IPEndpoint.hpp>

#include <iosfwd>

namespace qel {

/// The two endpoints of a connection.
/// Thread safety: a plain value.
class QEL_EXPORT IPConnectionInfo {
public:
    /// @param client  of the side that connected
    /// @param server  of the side that accepted
    IPConnectionInfo(const IPEndpoint& client, const IPEndpoint& server) noexcept;

    /// @return the endpoint, owned by this object
    const IPEndpoint& getClient() const noexcept { return mClient; }
    /// @return the endpoint, owned by this object
    const IPEndpoint& getServer() const noexcept { return mServer; }

private:
    IPEndpoint mClient;
    IPEndpoint mServer;
};

/// Prints both endpoints, as in [10.0.0.2:40000 -> 10.0.0.1:80].
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const IPConnectionInfo& connection);

} // namespace qel
