#include "server/LastWords.hpp"

#include <array>
#include <sys/socket.h>

namespace qel::protocol {

namespace {

/// The peer may go on sending, so there is an end to it. More than fits the receive buffer of a fresh connection.
constexpr int kMaxReads = 64;

} // namespace

void endSending(int descriptor) noexcept
{
    if (descriptor < 0) return;
    static_cast<void>(::shutdown(descriptor, SHUT_WR)); // fails if the peer has reset the connection, which ends it too
    std::array<char, 4096> dropped;
    for (int read = 0; read < kMaxReads; ++read) {
        if (::recv(descriptor, dropped.data(), dropped.size(), MSG_DONTWAIT) <= 0) return;
    }
}

} // namespace qel::protocol
