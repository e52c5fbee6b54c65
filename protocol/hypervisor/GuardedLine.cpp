#include "hypervisor/GuardedLine.hpp"

#include "base/Guard.hpp"

#include <algorithm>
#include <stdexcept>
#include <utility>

namespace qel::protocol {

namespace {

void require(bool condition, const char* what)
{
    if (!condition) throw std::length_error(what);
}

/// Keeps what the exception that is being handled says, if there is memory for it.
void keepCurrent(std::string& text) noexcept
{
    try {
        text = explainCurrent();
    } catch (...) {
        text.clear();
    }
}

/// A text that goes to terminals and logs: control characters of a line's peer must not.
std::string printable(std::string text)
{
    std::replace_if(
        text.begin(), text.end(), [](unsigned char character) { return character < 0x20 || character == 0x7F; }, '?');
    return text;
}

} // namespace

/// @return what the operation returns, or `failed` when it throws
template <typename Result, typename Operation>
Result GuardedLine::pCall(const Result& failed, Operation&& operation) const noexcept
{
    try {
        return operation();
    } catch (...) {
        if (mLogs) logCurrent("partition ", mPartition);
        keepCurrent(mThrown);
        return failed;
    }
}

bool GuardedLine::start() noexcept
{
    mThrown.clear();
    return pCall(false, [this] {
        mLine.start(mPartition);
        return true;
    });
}

void GuardedLine::stop() noexcept
{
    static_cast<void>(pCall(false, [this] {
        mLine.stop();
        return true;
    }));
}

SerialLine::ReadResult GuardedLine::read(char* buffer, std::size_t length) noexcept
{
    using LineState = SerialLine::LineState;
    mThrown.clear();
    return pCall(SerialLine::ReadResult{LineState::Ended, 0}, [&] {
        SerialLine::ReadResult result = mLine.read(buffer, length);
        require(result.length <= length, "the line says it has read more than there was room for");
        if (result.state == LineState::Data && result.length == 0) result.state = LineState::Idle;
        return result;
    });
}

std::optional<std::size_t> GuardedLine::write(const char* data, std::size_t length) noexcept
{
    mThrown.clear();
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

GuardedLine::Progress GuardedLine::advance() noexcept
{
    return pCall(Progress::Failed, [this] { return mLine.advance() ? Progress::Up : Progress::ComingUp; });
}

bool GuardedLine::wantsToWrite() const noexcept
{
    return pCall(false, [this] { return mLine.wantsToWrite(); });
}

PollDeadline GuardedLine::advanceAt() const noexcept
{
    return pCall(PollDeadline(), [this] { return mLine.advanceAt(); });
}

/// What it throws is logged whatever the line is: the line goes on, so failure() never tells it.
bool GuardedLine::sendBreak() noexcept
{
    try {
        return mLine.sendBreak();
    } catch (...) {
        logCurrent("partition ", mPartition);
        return false;
    }
}

std::string GuardedLine::failure() const
{
    constexpr std::size_t kMost = 200;
    std::string text;
    static_cast<void>(pCall(false, [&] {
        text = mLine.endReason();
        return true;
    }));
    if (text.empty()) text = mThrown;
    return printable(text.substr(0, kMost));
}

} // namespace qel::protocol
