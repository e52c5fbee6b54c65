// A module to preload into a program (LD_PRELOAD, see ld.so(8)) that binds its sockets to all addresses and has no
// option for another one: it binds them to the loopback address instead.

#include <arpa/inet.h>
#include <cstring>
#include <dlfcn.h>
#include <netinet/in.h>
#include <sys/socket.h>

namespace {

/// @return whether the address is of the family and complete
template <typename Address>
bool isA(sa_family_t family, const sockaddr* address, socklen_t length)
{
    return length >= sizeof(Address) && address->sa_family == family;
}

} // namespace

extern "C" {

int bind(int socket, const sockaddr* address, socklen_t length)
{
    static const auto sOriginal = reinterpret_cast<decltype(&::bind)>(::dlsym(RTLD_NEXT, "bind"));
    sockaddr_storage changed{};
    if (isA<sockaddr_in>(AF_INET, address, length)) {
        auto& own = reinterpret_cast<sockaddr_in&>(changed);
        std::memcpy(&own, address, sizeof(own));
        if (own.sin_addr.s_addr == htonl(INADDR_ANY)) own.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        return sOriginal(socket, reinterpret_cast<const sockaddr*>(&changed), sizeof(own));
    }
    if (isA<sockaddr_in6>(AF_INET6, address, length)) {
        auto& own = reinterpret_cast<sockaddr_in6&>(changed);
        std::memcpy(&own, address, sizeof(own));
        if (IN6_IS_ADDR_UNSPECIFIED(&own.sin6_addr)) own.sin6_addr = in6addr_loopback;
        return sOriginal(socket, reinterpret_cast<const sockaddr*>(&changed), sizeof(own));
    }
    return sOriginal(socket, address, length);
}

} // extern "C"
