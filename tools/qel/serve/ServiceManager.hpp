#pragma once

#include <qel/common/util/UniqueFd.hpp>

#include "base/Library.hpp"

#include <chrono>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <vector>

namespace qel::tool {

/// The program that manages this one as a service, such as systemd: is told in datagrams when the server is ready,
/// reloads, stops, and that it is alive. Without such a program every operation does nothing.
///
/// No operation waits. The newest state that the manager has not taken is told again with the next feedWatchdog();
/// otherwise what it does not take is lost. The first time is logged.
/// Thread safety: one thread.
class ServiceManager {
public:
    /// What NOTIFY_SOCKET, WATCHDOG_USEC and WATCHDOG_PID say. A wrong value is logged and counts as none.
    static ServiceManager fromEnvironment();

    /// @param address  path of a socket; "@NAME" is one in the abstract namespace; empty: there is no manager
    /// @param watchdog  how often the manager wants to hear that the server is alive; zero: it does not
    ServiceManager(const std::string& address, std::chrono::microseconds watchdog);

    /// How often to call feedWatchdog(): half of what the manager asks for. Zero: never.
    std::chrono::microseconds watchdogInterval() const noexcept { return mWatchdog / 2; }

    /// The server serves, for the first time or after reloading(). @param status  a line for people
    void ready(const std::string& status);

    /// The server reads its configuration again; ready() follows.
    void reloading();

    /// The server ends.
    void stopping();

    /// The server is alive.
    void feedWatchdog();

private:
    void pTell(std::string message);
    void pTellOwed() noexcept;
    bool pSend(const std::string& message) noexcept;

    std::string mAddress;
    std::chrono::microseconds mWatchdog;
    sockaddr_un mTo{};
    socklen_t mToLength = 0;
    UniqueFd mSocket;  ///< none: there is no manager
    std::string mOwed; ///< the newest state, while the manager has not taken it
    bool mHasFailed = false;
};

/// Takes the sockets that the service manager listens on in place of this process, and hands over: what LISTEN_FDS and
/// LISTEN_PID say. They are closed when other programs are started. Call it before anything else opens descriptors.
/// @return empty: there are none
/// @throws CommandFailure  Usage: LISTEN_FDS has a wrong value; CannotConnect: a descriptor is not open
std::vector<UniqueFd> takeHandedSockets();

} // namespace qel::tool
