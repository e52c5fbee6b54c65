#include <qel/common/net/Listen.hpp>

#include <netinet/in.h>
#include <sys/socket.h>

namespace qel {

Socket listenOn(const IPEndpoint& endpoint, int backlog)
{
    Socket listener(endpoint.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
    listener.setSocketOption(SOL_SOCKET, SO_REUSEADDR, 1);
    if (endpoint.getFamily() == IPFamily::IPv6) listener.setSocketOption(IPPROTO_IPV6, IPV6_V6ONLY, 1);
    listener.bind(endpoint);
    listener.listen(backlog);
    return listener;
}

} // namespace qel
