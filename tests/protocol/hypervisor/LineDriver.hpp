#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/protocol/SerialLine.hpp>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstddef>
#include <stdexcept>
#include <string>

namespace qel::test {

/// Drives a line as the thread for serial data does: waits for its descriptor, then calls it. Each wait has a limit.
class LineDriver {
public:
    using LineState = protocol::SerialLine::LineState;

    explicit LineDriver(protocol::SerialLine& line) : mLine(line) {}

    /// Starts the line and takes it up. What the line throws passes.
    void bringUp()
    {
        mLine.start(7);
        while (!mLine.advance())
            await(PollEvents::Read);
    }

    /// Waits until the descriptor is ready for the event, or for what the line itself wants to write.
    void await(PollEvents events)
    {
        PollFd fd(mLine.descriptor(), events);
        if (mLine.wantsToWrite()) fd.mFd.events |= static_cast<short>(PollEvents::Write);
        if (!PollSet(fd).wait(std::chrono::seconds(20)).anyReady()) throw std::runtime_error("the line is stuck");
    }

    /// Reads until so many bytes have come, or the line ends.
    std::string read(std::size_t length)
    {
        std::string all;
        while (pReadSome(all, length - all.size()) && all.size() < length)
            await(PollEvents::Read);
        return all;
    }

    /// Reads until the line ends.
    std::string readUntilEnd()
    {
        std::string all;
        while (pReadSome(all, 4096))
            await(PollEvents::Read);
        return all;
    }

    /// Writes all of the text, waiting while the line takes nothing.
    void write(const std::string& text)
    {
        std::size_t taken = 0;
        while (taken < text.size()) {
            taken += mLine.write(text.data() + taken, text.size() - taken);
            if (taken < text.size()) await(PollEvents::Write);
        }
    }

    /// Writes until the line takes nothing. @return how many bytes it took
    std::size_t fill()
    {
        const std::string chunk(65536, 'x');
        std::size_t taken = 0;
        while (const std::size_t count = mLine.write(chunk.data(), chunk.size())) {
            taken += count;
            if (taken > 1000U * 1000 * 1000) throw std::runtime_error("the line takes everything");
        }
        return taken;
    }

private:
    /// @return false: the line has ended
    bool pReadSome(std::string& all, std::size_t length)
    {
        std::array<char, 4096> buffer;
        static_cast<void>(mLine.advance());
        const auto result = mLine.read(buffer.data(), std::min(length, buffer.size()));
        all.append(buffer.data(), result.length);
        return result.state != LineState::Ended;
    }

    protocol::SerialLine& mLine;
};

/// All 256 byte values.
inline std::string everyByte()
{
    std::string bytes;
    for (int value = 0; value < 256; ++value)
        bytes.push_back(static_cast<char>(value));
    return bytes;
}

} // namespace qel::test
