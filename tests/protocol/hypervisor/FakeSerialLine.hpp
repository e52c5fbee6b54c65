#pragma once

#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/SerialLine.hpp>

#include "support/Allocations.hpp"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <deque>
#include <functional>
#include <limits>
#include <optional>
#include <stdexcept>
#include <string>

namespace qel::test {

/// A serial line that plays a script. Checks the caller's side of the contract: no reading or writing while it is down.
class FakeSerialLine : public protocol::SerialLine {
public:
    // The script.
    std::deque<std::string> output; ///< what comes out, one read() after the other
    bool ended = false;             ///< end of stream once `output` is empty
    /// How the command ended; empty: it still runs.
    std::optional<protocol::CommandEnd> end = protocol::CommandEnd{protocol::CommandEnd::Kind::Exited, 0};
    /// Bytes of input that will be taken; may be set while other threads use the port.
    std::atomic<std::size_t> takes{std::numeric_limits<std::size_t>::max()};
    bool failsToStart = false;
    bool goesDownWhenItFailsToStart = false;
    bool failsToWrite = false;
    std::function<void(const std::string& operation)> onCall; ///< called first by each operation; may throw
    std::deque<std::string> steps; ///< of coming up: what advance() throws, one after the other; "": not up yet
    protocol::SerialLine::LineState whenEnded = LineState::Ended; ///< what read() returns then
    std::string reason;                                           ///< endReason()
    bool wantsWriting = false;
    PollDeadline nextAdvance;
    bool hasBreak = false;
    std::optional<std::size_t> saysRead;  ///< what read() returns, be it true or not
    std::optional<std::size_t> saysTaken; ///< what write() returns, be it true or not

    // The calls.
    std::string input;           ///< all that was taken
    std::uint16_t partition = 0; ///< that it was started for
    unsigned started = 0;
    unsigned stopped = 0;
    unsigned reads = 0;
    unsigned advanced = 0;
    unsigned breaks = 0;

    void start(std::uint16_t id) override
    {
        called("start");
        partition = id;
        if (failsToStart) {
            if (goesDownWhenItFailsToStart) mRunning = false;
            throw PosixError(EMFILE, "start");
        }
        if (!mRunning) ++started;
        mRunning = true;
    }
    bool advance() override
    {
        called("advance");
        ++advanced;
        if (steps.empty()) return true;
        const std::string step = steps.front();
        steps.pop_front();
        if (!step.empty()) throw std::runtime_error(step);
        return false;
    }
    bool wantsToWrite() const override { return wantsWriting; }
    PollDeadline advanceAt() const override { return nextAdvance; }
    std::string endReason() const override { return reason; }
    bool sendBreak() override
    {
        called("sendBreak");
        requireRunning();
        if (hasBreak) ++breaks;
        return hasBreak;
    }
    bool hasHungUp() const override
    {
        called("hasHungUp");
        requireRunning();
        return ended;
    }
    std::optional<protocol::CommandEnd> commandEnd() override
    {
        called("commandEnd");
        return end;
    }
    ReadResult read(char* buffer, std::size_t length) override
    {
        const Allocations::Exempt exempt;
        called("read");
        requireRunning();
        ++reads;
        if (saysRead) return {LineState::Data, *saysRead};
        if (output.empty()) return {ended ? whenEnded : LineState::Idle, 0};
        const std::string chunk = output.front().substr(0, length);
        output.front().erase(0, chunk.size());
        if (output.front().empty()) output.pop_front();
        std::copy(chunk.begin(), chunk.end(), buffer);
        return {LineState::Data, chunk.size()};
    }
    std::size_t write(const char* data, std::size_t length) override
    {
        called("write");
        requireRunning();
        if (failsToWrite) throw PosixError(EIO, "write");
        if (saysTaken) return *saysTaken;
        const std::size_t taken = std::min(length, takes.load());
        takes -= taken;
        input.append(data, taken);
        return taken;
    }
    int descriptor() const override
    {
        called("descriptor");
        return mRunning ? fd : -1;
    }
    void stop() override
    {
        called("stop");
        if (mRunning) ++stopped;
        mRunning = false;
    }

    static constexpr int kDescriptor = 1000;
    int fd = kDescriptor; ///< while it is up

private:
    void called(const char* operation) const
    {
        if (onCall) onCall(operation);
    }
    void requireRunning() const
    {
        if (!mRunning) throw std::logic_error("the line is down");
    }

    bool mRunning = false;
};

} // namespace qel::test
