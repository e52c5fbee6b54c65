#pragma once

#include "base/UniqueFd.hpp"
#include "serve/ChildReaper.hpp"
#include "serve/SerialPort.hpp"

#include <string>

namespace qel::tool {

/// The serial line of a partition that is a command of this machine: a pseudo-terminal with the command on its other
/// side. start() runs "/bin/sh -c COMMAND" in a session of its own with the terminal as its controlling one, 24 rows by
/// 80 columns; stop() hangs up and hands the command to the reaper.
///
/// Sources: pty(7), posix_spawn(3), credentials(7).
class PtyPort final : public SerialPort {
public:
    /// @param reaper  borrowed; must outlive this object
    PtyPort(std::string command, ChildReaper& reaper);
    ~PtyPort() override;
    PtyPort(const PtyPort&) = delete;
    PtyPort& operator=(const PtyPort&) = delete;

    void start() override;
    bool isRunning() const override;
    bool hasHungUp() const override;
    ReadResult read(char* buffer, std::size_t length) override;
    std::size_t write(const char* data, std::size_t length) override;
    int descriptor() const override;
    void stop() override;

private:
    bool pHasCommandEnded();

    const std::string mCommand;
    ChildReaper& mReaper;
    UniqueFd mMaster;
    pid_t mLeader = -1; ///< the command's shell; -1: none, or reaped
};

} // namespace qel::tool
