#include <qel/common/net/IPConnectionInfo.hpp>

#include <ostream>

namespace qel {

IPConnectionInfo::IPConnectionInfo(const IPEndpoint& client, const IPEndpoint& server) noexcept
    : mClient(client), mServer(server)
{}

std::ostream& operator<<(std::ostream& os, const IPConnectionInfo& connection)
{
    return os << '[' << connection.getClient() << " -> " << connection.getServer() << ']';
}

} // namespace qel
