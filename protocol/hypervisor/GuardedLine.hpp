#pragma once

#include <qel/protocol/SerialLine.hpp>

#include <cstddef>
#include <cstdint>
#include <optional>

namespace qel::protocol {

/// A partition's line behind a guard: the line may be the user's, so what it throws is logged at Error, and a length
/// that it returns is checked. Either makes the operation fail. Operations as those of SerialLine.
/// Lifetime: borrows the line. Thread safety: that of the line.
class GuardedLine {
public:
    GuardedLine(std::uint16_t partition, SerialLine& line) : mPartition(partition), mLine(line) {}

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

private:
    template <typename Result, typename Operation>
    Result pCall(const Result& failed, Operation&& operation) const noexcept;

    std::uint16_t mPartition;
    SerialLine& mLine;
};

} // namespace qel::protocol
