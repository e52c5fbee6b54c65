#pragma once

#include <qel/common/util/Poll.hpp>

#include "hypervisor/ChildReaper.hpp"
#include "hypervisor/PtyPort.hpp"

#include <array>
#include <chrono>
#include <cstdint>
#include <gtest/gtest.h>
#include <memory>
#include <string>

namespace qel::test {

/// Pseudo-terminals with real commands on them.
class PtyFixture : public ::testing::Test {
protected:
    using LineState = protocol::SerialLine::LineState;

    static constexpr std::uint16_t kPartition = 7;

    static void await(protocol::SerialLine& port)
    {
        const PollFd fd(port.descriptor(), PollEvents::Read);
        ASSERT_TRUE(PollSet(fd).wait(std::chrono::seconds(20)).anyReady()) << "nothing came";
    }

    /// Reads until the text has come. @return all that was read
    static std::string readUntil(protocol::SerialLine& port, const std::string& text)
    {
        std::string all;
        while (all.find(text) == std::string::npos) {
            if (readSome(port, all) == LineState::Ended) {
                ADD_FAILURE() << "ended after: " << all;
                break;
            }
        }
        return all;
    }

    static std::string readUntilEnd(protocol::SerialLine& port)
    {
        std::string all;
        while (readSome(port, all) != LineState::Ended)
            continue;
        return all;
    }

    std::string outputOf(const std::string& command)
    {
        protocol::PtyPort port(command, reaper);
        port.start(kPartition);
        return readUntilEnd(port);
    }

    /// The process id in a line like "pid=42".
    static pid_t pidIn(const std::string& text) { return std::stoi(text.substr(text.find("pid=") + 4)); }

    static LineState readSome(protocol::SerialLine& port, std::string& all)
    {
        await(port);
        if (HasFatalFailure()) return LineState::Ended;
        std::array<char, 100> buffer;
        const auto result = port.read(buffer.data(), buffer.size());
        all.append(buffer.data(), result.length);
        return result.state;
    }

    const std::shared_ptr<protocol::ChildReaper> reaper =
        std::make_shared<protocol::ChildReaper>(std::chrono::milliseconds(50));
};

} // namespace qel::test
