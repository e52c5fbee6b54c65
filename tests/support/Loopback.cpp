#include "support/Loopback.hpp"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

namespace qel::test {

namespace {

IPAddress loopbackAddress(IPFamily family)
{
    if (family == IPFamily::IPv6) return IPv6Address{0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1};
    return IPv4Address{127, 0, 0, 1};
}

} // namespace

IPEndpoint loopback(IPFamily family) { return IPEndpoint(loopbackAddress(family), 0); }

Socket makeListener(IPFamily family, int backlog)
{
    Socket listener(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    listener.bind(loopback(family));
    listener.listen(backlog);
    return listener;
}

TcpPair makeTcpPair(IPFamily family)
{
    Socket listener = makeListener(family);
    Socket client(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    client.connect(listener.getSocketName(), std::chrono::seconds(10));
    Socket server = listener.accept();
    return TcpPair{std::move(client), std::move(server)};
}

SilentEndpoint::SilentEndpoint(IPFamily family) : mHolder(-1), mListener(-1)
{
    for (Socket* socket : {&mHolder, &mListener}) {
        *socket = Socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
        socket->setSocketOption(SOL_SOCKET, SO_REUSEADDR, 1);
    }
    mHolder.bind(loopback(family));
    mEndpoint = mHolder.getSocketName();
    mListener.bind(mEndpoint);
    mListener.listen(0);
    // A queue of length 0 holds one connection.
    mWaiting.emplace_back(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    mWaiting.back().connect(mEndpoint, std::chrono::seconds(10));
}

Socket makeRefusingSocket(IPFamily family)
{
    Socket socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    socket.bind(loopback(family));
    return socket;
}

unsigned int backlogOf(const Socket& listener)
{
    tcp_info info{};
    std::size_t length = sizeof(info);
    listener.getSocketOption(IPPROTO_TCP, TCP_INFO, &info, length);
    return info.tcpi_sacked; // of a listener: the most connections that may wait
}

std::string whyNoLoopback(IPFamily family)
{
    const IPEndpoint endpoint = loopback(family);
    const int fd = ::socket(IPFamilyUtils::toUNIXAddressFamily(family), SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return "no sockets of this family: " + std::string(std::strerror(errno));
    const sockaddr_storage address = endpoint.getSockaddr();
    const int result = ::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address));
    const int error = errno;
    ::close(fd);
    return result == 0 ? "" : "this machine has no " + endpoint.getAddress().str() + ": " + std::strerror(error);
}

NoMoreDescriptors::NoMoreDescriptors(rlim_t limit)
{
    if (::getrlimit(RLIMIT_NOFILE, &mBefore) != 0) ADD_FAILURE() << std::strerror(errno);
    rlimit none = mBefore;
    none.rlim_cur = limit;
    if (::setrlimit(RLIMIT_NOFILE, &none) != 0) ADD_FAILURE() << std::strerror(errno);
}

NoMoreDescriptors::~NoMoreDescriptors()
{
    const int error = errno;
    if (::setrlimit(RLIMIT_NOFILE, &mBefore) != 0) ADD_FAILURE() << std::strerror(errno);
    errno = error;
}

} // namespace qel::test
