#pragma once

#include <qel/common/net/Socket.hpp>

#include <chrono>
#include <cstddef>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

/// @file
/// What the tests of sockets share.

namespace qel::test {

constexpr std::chrono::seconds kLong(10); // a limit that is not reached unless something is wrong

inline bool isOpen(int fd) { return ::fcntl(fd, F_GETFD) != -1; }

inline bool isNonBlocking(int fd) { return (::fcntl(fd, F_GETFL) & O_NONBLOCK) != 0; }

inline int intOption(const Socket& socket, int level, int name)
{
    int value = -1;
    std::size_t length = sizeof(value);
    socket.getSocketOption(level, name, &value, length);
    EXPECT_EQ(length, sizeof(value));
    return value;
}

inline Socket tcpSocket(IPFamily family = IPFamily::IPv4) { return Socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0); }

} // namespace qel::test
