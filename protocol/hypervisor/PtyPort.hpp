#pragma once

#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/SerialLine.hpp>

#include "hypervisor/ChildReaper.hpp"

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace qel::protocol {

/// The serial line of a partition whose command runs on this machine, on a pseudo-terminal of 24 rows by 80 columns.
/// start() runs "/bin/sh -c COMMAND" in a session of its own, with the terminal as its controlling terminal; stop()
/// hangs up and hands the command to the reaper.
///
/// Sources: pty(7), posix_spawn(3), credentials(7).
class PtyPort final : public SerialLine {
public:
    /// @param reaper  ends and reaps the command; not null
    /// @param environment  the environment of the command, one "NAME=value" each; QEL_PARTITION is added
    PtyPort(std::string command, std::shared_ptr<ChildReaper> reaper, std::vector<std::string> environment = {});
    ~PtyPort() override;
    PtyPort(const PtyPort&) = delete;
    PtyPort& operator=(const PtyPort&) = delete;

    void start(std::uint16_t partition) override;
    void stop() override;
    ReadResult read(char* buffer, std::size_t length) override;
    std::size_t write(const char* data, std::size_t length) override;
    int descriptor() const override;
    std::optional<CommandEnd> commandEnd() override;

private:
    const std::string mCommand;
    const std::vector<std::string> mEnvironment;
    const std::shared_ptr<ChildReaper> mReaper;
    UniqueFd mMaster;
    pid_t mLeader = -1; ///< the command's shell, not yet reaped; -1: none
};

} // namespace qel::protocol
