#pragma once

#include <qel/protocol/SerialLine.hpp>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

namespace qel::protocol {

/// A partition's line behind a guard: the line may be the user's, so what it throws is logged at Error, and a length
/// that it returns is checked. Either makes the operation fail. Operations as those of SerialLine.
/// Lifetime: borrows the line. Thread safety: that of the line.
class GuardedLine {
public:
    enum class Progress { Up, ComingUp, Failed };

    /// @param logs  false: what the line throws is not logged, except by sendBreak(); failure() has it
    GuardedLine(std::uint16_t partition, SerialLine& line, bool logs = true)
        : mPartition(partition), mLine(line), mLogs(logs)
    {}

    /// @return false: the line cannot be brought up
    bool start() noexcept;
    void stop() noexcept;
    /// @return Ended when the line fails; Data always has bytes
    SerialLine::ReadResult read(char* buffer, std::size_t length) noexcept;
    /// @return nothing when the line is broken
    std::optional<std::size_t> write(const char* data, std::size_t length) noexcept;
    /// @return -1 when the line fails
    int descriptor() const noexcept;
    /// @return true when the line fails
    bool hasHungUp() const noexcept;
    /// @return an unknown end when the line fails
    std::optional<CommandEnd> commandEnd() noexcept;
    Progress advance() noexcept;
    /// @return false when the line fails
    bool wantsToWrite() const noexcept;
    /// @return disabled when the line fails
    PollDeadline advanceAt() const noexcept;
    /// @return false: the line has no break, or it could not be sent
    bool sendBreak() noexcept;

    /// Why the line has ended or cannot be brought up, in printable characters: what the line says, else what it threw
    /// last since start(), read() or write(), else empty. @throws std::bad_alloc
    std::string failure() const;

private:
    template <typename Result, typename Operation>
    Result pCall(const Result& failed, Operation&& operation) const noexcept;

    std::uint16_t mPartition;
    SerialLine& mLine;
    bool mLogs;
    mutable std::string mThrown; ///< what the line threw last
};

} // namespace qel::protocol
