#pragma once

#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/SerialLine.hpp>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <deque>
#include <limits>
#include <optional>
#include <stdexcept>
#include <string>

namespace qel::test {

/// A serial line that plays a script. Checks the caller's side of the contract: no reading or writing while it is down.
class FakeSerialPort : public protocol::SerialLine {
public:
    // The script.
    std::deque<std::string> output; ///< what comes out, one read() after the other
    bool ended = false;             ///< end of stream once `output` is empty
    /// How the command ended; empty: it still runs.
    std::optional<protocol::CommandEnd> end = protocol::CommandEnd{protocol::CommandEnd::Kind::Exited, 0};
    /// Bytes of input that will be taken; may be set while other threads use the port.
    std::atomic<std::size_t> takes{std::numeric_limits<std::size_t>::max()};
    bool failsToStart = false;
    bool failsToWrite = false;

    // The calls.
    std::string input; ///< all that was taken
    unsigned started = 0;
    unsigned stopped = 0;
    unsigned reads = 0;

    void start() override
    {
        if (failsToStart) throw PosixError(EMFILE, "start");
        if (!mRunning) ++started;
        mRunning = true;
    }
    bool isRunning() const override { return mRunning; }
    bool hasHungUp() const override { return ended; }
    std::optional<protocol::CommandEnd> commandEnd() override { return end; }
    ReadResult read(char* buffer, std::size_t length) override
    {
        requireRunning();
        ++reads;
        if (output.empty()) return {ended ? LineState::Ended : LineState::Idle, 0};
        const std::string chunk = output.front().substr(0, length);
        output.front().erase(0, chunk.size());
        if (output.front().empty()) output.pop_front();
        std::copy(chunk.begin(), chunk.end(), buffer);
        return {LineState::Data, chunk.size()};
    }
    std::size_t write(const char* data, std::size_t length) override
    {
        requireRunning();
        if (failsToWrite) throw PosixError(EIO, "write");
        const std::size_t taken = std::min(length, takes.load());
        takes -= taken;
        input.append(data, taken);
        return taken;
    }
    int descriptor() const override
    {
        requireRunning();
        return kDescriptor;
    }
    void stop() override
    {
        if (mRunning) ++stopped;
        mRunning = false;
    }

    static constexpr int kDescriptor = 1000;

private:
    void requireRunning() const
    {
        if (!mRunning) throw std::logic_error("the line is down");
    }

    bool mRunning = false;
};

} // namespace qel::test
