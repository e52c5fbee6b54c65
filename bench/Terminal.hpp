#pragma once

#include "support/Process.hpp"
#include "support/Pty.hpp"

#include <chrono>
#include <cstddef>
#include <string>
#include <sys/types.h>
#include <vector>

/// @file
/// Programs that bring the terminal of another machine to this one, as their users run them.

namespace qel::bench {

/// Keeps the cores that the caller does not use busy with work of low priority, for as long as it exists.
///
/// The system moves the bytes of a pseudo-terminal with threads of its own. Where another core is idle, it wakes that
/// one for it, and how long this takes depends on how deep it sleeps, not on the programs that are measured.
class BusyCores {
public:
    /// To be made before the caller is pinned to its core, which is the last one.
    BusyCores();
    ~BusyCores();
    BusyCores(const BusyCores&) = delete;
    BusyCores& operator=(const BusyCores&) = delete;

private:
    std::vector<pid_t> mSpinners;
};

/// Runs a program with nothing to read, and counts what it writes.
/// @return seconds until it has written so many bytes and its output has ended
/// @throws std::runtime_error  it has written another number of bytes
double secondsToReceive(const std::vector<std::string>& command, std::size_t bytes);

/// A program on a terminal of its own, whose far end sends each key back.
class EchoedKeys {
public:
    /// Starts the program, and types until a key has come back. The far end may have been there before.
    /// @throws std::runtime_error  it does not come up
    explicit EchoedKeys(const std::vector<std::string>& command);
    ~EchoedKeys();
    EchoedKeys(const EchoedKeys&) = delete;
    EchoedKeys& operator=(const EchoedKeys&) = delete;

    /// @return microseconds from a key to its echo
    double type() const;

    /// A shell's command for the far end.
    static constexpr const char* kCommand = "stty raw -echo; exec cat";

private:
    void pAwaitSilence() const;

    test::Pty mTerminal;
    pid_t mPid = -1;
};

} // namespace qel::bench
