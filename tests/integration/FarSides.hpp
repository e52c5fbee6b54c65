#pragma once

#include "support/Process.hpp"
#include "support/Pty.hpp"
#include "support/TemporaryDirectory.hpp"

#include <csignal>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

/// @file
/// Other people's programs as the far sides of lines. Everything stays inside this machine.

namespace qel::test {

/// Where a program is, as a shell finds it; /usr/sbin as well. @return empty: it is not installed
std::string pathOfProgram(const std::string& name);

/// Ends the test as skipped when a program is not installed.
#define QEL_SKIP_WITHOUT(program)                                                                                      \
    if (qel::test::pathOfProgram(program).empty()) GTEST_SKIP() << program " is not installed: see script/setup"

/// socat between two of its addresses. Ends with this object.
class Socat {
public:
    /// Starts it, and waits until it has said so many notices that contain the text.
    Socat(const std::string& first, const std::string& second, const std::string& notice, std::size_t notices = 1);

    /// A socket at a path that echoes; for one connection at a time, or `forever`.
    static Socat unixEcho(const std::string& path, bool forever = true);
    /// The same on a port of 127.0.0.1 that the system chooses.
    static Socat tcpEcho(bool forever = true);
    /// Two terminals that are connected, at two paths.
    static Socat terminals(const std::string& first, const std::string& second);

    /// The port that it listens on.
    std::uint16_t port() const;

    void kill() { mProcess->signal(SIGKILL); }

private:
    std::unique_ptr<Process> mProcess;
};

/// ser2net as a terminal server for one port, over telnet with RFC 2217. Ends with this object.
class Ser2Net {
public:
    /// Starts it, and waits until it listens.
    /// @param device  of the port
    explicit Ser2Net(const std::string& device);

    /// "127.0.0.1:PORT"
    const std::string& address() const { return mAddress; }

private:
    bool start(std::uint16_t port);

    TemporaryDirectory mDirectory;
    std::string mDevice;
    std::string mAddress;
    std::unique_ptr<Process> mProcess;
};

} // namespace qel::test
