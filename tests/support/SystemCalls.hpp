#pragma once

#include <cstddef>
#include <functional>
#include <poll.h>
#include <sys/socket.h>
#include <sys/types.h>

namespace qel::test {

/// Replaces system calls of the library, so that a test can make one fail, shorten a transfer, deliver a signal at an
/// exact moment, or check the arguments. A test program that links SystemCalls.cpp defines these functions of the C
/// library, and the library then calls those.
///
/// A call goes to the member of its name if that is set, otherwise to the system. A replacement sets errno itself. It
/// is disabled while it runs, so it may make the real call.
///
/// In force for the thread that constructs it, from construction to destruction. Objects nest.
class SystemCalls {
public:
    SystemCalls();
    ~SystemCalls();
    SystemCalls(const SystemCalls&) = delete;
    SystemCalls& operator=(const SystemCalls&) = delete;

    std::function<ssize_t(int fd, void* buffer, std::size_t length)> read;
    std::function<ssize_t(int fd, const void* buffer, std::size_t length, int flags)> send;
    std::function<int(pollfd* fds, nfds_t count, int timeout)> poll;
    std::function<int(int family, int type, int protocol)> socket;
    std::function<int(int fd, const sockaddr* address, socklen_t length)> connect;
    std::function<int(int fd, const sockaddr* address, socklen_t length)> bind;
    std::function<int(int fd, sockaddr* address, socklen_t* length, int flags)> accept4;
    std::function<int(int fd, sockaddr* address, socklen_t* length)> getsockname;
    std::function<int(int fd, sockaddr* address, socklen_t* length)> getpeername;
    std::function<int(int fd, int level, int name, void* value, socklen_t* length)> getsockopt;
    std::function<int(int fd, int level, int name, const void* value, socklen_t length)> setsockopt;
    std::function<int(unsigned int count, int flags)> eventfd;
    std::function<int(int fd)> close;

private:
    SystemCalls* const mOuter; // in force again when this one ends
};

} // namespace qel::test
