#pragma once

#include "protocol/hypervisor/VirtualSerialFixture.hpp"
#include "support/Allocations.hpp"
#include "support/SettableClock.hpp"

#include <chrono>
#include <functional>
#include <gtest/gtest.h>
#include <string>
#include <vector>

namespace qel::test {

/// A tap that keeps what it hears.
class RecordingTap : public protocol::SerialTap {
public:
    void onOutput(std::uint16_t partition, const char* data, std::size_t length) noexcept override
    {
        const Allocations::Exempt exempt;
        calls.push_back(std::to_string(partition) + " output " + std::string(data, length));
    }
    void onEvent(std::uint16_t partition, const std::string& text) noexcept override
    {
        const Allocations::Exempt exempt;
        calls.push_back(std::to_string(partition) + " event " + text);
        if (onCall) onCall();
    }

    std::vector<std::string> calls;
    std::function<void()> onCall;
};

/// Lines that are brought up without a console, with a clock that the test moves.
class LineLifeFixture : public VirtualSerialFixture {
protected:
    using CommandEnd = protocol::CommandEnd;
    using PartitionOptions = protocol::PartitionOptions;
    using RestartLine = protocol::RestartLine;
    using StartLine = protocol::StartLine;
    using Kind = CommandEnd::Kind;
    using milliseconds = std::chrono::milliseconds;

    static PartitionOptions boot(RestartLine restart = RestartLine::Never)
    {
        PartitionOptions options;
        options.start = StartLine::Boot;
        options.restart = restart;
        return options;
    }
    static PartitionOptions connection()
    {
        PartitionOptions options;
        options.keepsSession = true;
        return options;
    }

    /// Lets the command of partition 1 end.
    void endCommand(CommandEnd end)
    {
        port1->ended = true;
        port1->end = end;
        hypervisor->serviceSerial(1);
        hypervisor->serviceLines();
        port1->ended = false;
    }

    /// Moves the clock to just before a pause is over and expects nothing, then over it.
    void expectStartAfter(milliseconds pause)
    {
        const unsigned started = port1->started;
        clock.advance(pause - milliseconds(1));
        EXPECT_EQ(hypervisor->serviceLines(), milliseconds(1));
        EXPECT_EQ(port1->started, started);
        clock.advance(milliseconds(1));
        hypervisor->serviceLines();
        EXPECT_EQ(port1->started, started + 1);
    }

    SettableClock clock;
};

} // namespace qel::test
