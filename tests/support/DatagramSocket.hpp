#pragma once

#include <qel/common/util/UniqueFd.hpp>

#include <array>
#include <chrono>
#include <cstddef>
#include <cstring>
#include <poll.h>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>

namespace qel::test {

/// A datagram socket with an address in this machine, as a service manager has one.
class DatagramSocket {
public:
    /// @param address  a path, or "@NAME" in the abstract namespace
    explicit DatagramSocket(const std::string& address)
        : mSocket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0))
    {
        sockaddr_un at{};
        at.sun_family = AF_UNIX;
        std::memcpy(at.sun_path, address.data(), address.size());
        if (address[0] == '@') at.sun_path[0] = '\0';
        const auto length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + address.size());
        if (::bind(mSocket.get(), reinterpret_cast<const sockaddr*>(&at), length) != 0) {
            throw std::runtime_error("cannot bind " + address);
        }
    }

    /// @return the next datagram; empty: there is none
    std::string take() const
    {
        std::array<char, 4096> buffer;
        const ssize_t count = ::recv(mSocket.get(), buffer.data(), buffer.size(), 0);
        return count < 0 ? std::string() : std::string(buffer.data(), static_cast<std::size_t>(count));
    }

    /// The same, and waits for it. @throws std::runtime_error  it does not come
    std::string await(std::chrono::milliseconds deadline = std::chrono::seconds(20)) const
    {
        pollfd fd{mSocket.get(), POLLIN, 0};
        if (::poll(&fd, 1, static_cast<int>(deadline.count())) <= 0) throw std::runtime_error("no datagram came");
        return take();
    }

private:
    UniqueFd mSocket;
};

} // namespace qel::test
