#include "hypervisor/GuardedLine.hpp"

#include "base/Guard.hpp"

#include <stdexcept>

namespace qel::protocol {

namespace {

void require(bool condition, const char* what)
{
    if (!condition) throw std::length_error(what);
}

} // namespace

/// @return what the operation returns, or `failed` when it throws
template <typename Result, typename Operation>
Result GuardedLine::pCall(const Result& failed, Operation&& operation) const noexcept
{
    try {
        return operation();
    } catch (...) {
        logCurrent("partition ", mPartition);
        return failed;
    }
}

bool GuardedLine::start() noexcept
{
    return runGuarded([this] { mLine.start(mPartition); }, "partition ", mPartition);
}

void GuardedLine::stop() noexcept
{
    static_cast<void>(runGuarded([this] { mLine.stop(); }, "partition ", mPartition));
}

SerialLine::ReadResult GuardedLine::read(char* buffer, std::size_t length) noexcept
{
    using LineState = SerialLine::LineState;
    return pCall(SerialLine::ReadResult{LineState::Ended, 0}, [&] {
        SerialLine::ReadResult result = mLine.read(buffer, length);
        require(result.length <= length, "the line says it has read more than there was room for");
        if (result.state == LineState::Data && result.length == 0) result.state = LineState::Idle;
        return result;
    });
}

std::optional<std::size_t> GuardedLine::write(const char* data, std::size_t length) noexcept
{
    return pCall(std::optional<std::size_t>(), [&] {
        const std::size_t taken = mLine.write(data, length);
        require(taken <= length, "the line says it has taken more than there was");
        return std::optional<std::size_t>(taken);
    });
}

int GuardedLine::descriptor() const noexcept
{
    return pCall(-1, [this] { return mLine.descriptor(); });
}

bool GuardedLine::hasHungUp() const noexcept
{
    return pCall(true, [this] { return mLine.hasHungUp(); });
}

std::optional<CommandEnd> GuardedLine::commandEnd() noexcept
{
    return pCall(std::optional<CommandEnd>(CommandEnd()), [this] { return mLine.commandEnd(); });
}

} // namespace qel::protocol
