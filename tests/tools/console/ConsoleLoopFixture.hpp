#pragma once

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"
#include "console/ConsoleLoop.hpp"
#include "protocol/console/FakeHypervisorEnd.hpp"
#include "support/CapturedLog.hpp"
#include "support/Pty.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"

#include <array>
#include <atomic>
#include <csignal>
#include <fcntl.h>
#include <fstream>
#include <functional>
#include <gtest/gtest.h>
#include <optional>
#include <sstream>
#include <string>
#include <sys/ioctl.h>
#include <thread>
#include <unistd.h>

namespace qel::test {

constexpr std::uint16_t kPartition = 1;
constexpr std::size_t kPipeBytes = 65536; // that a pipe holds: see pipe(7)

/// A console loop between pipes or a terminal and a session whose hypervisor the test plays.
class ConsoleLoopTest : public ::testing::Test {
protected:
    ConsoleLoopTest()
    {
        makePipe(inputRead, inputWrite);
        makePipe(outputRead, outputWrite);
    }

    ~ConsoleLoopTest() override
    {
        end->onMessage = [](const QelMessage&) {}; // the session is closed when it is destroyed
    }

    static void makePipe(UniqueFd& readEnd, UniqueFd& writeEnd)
    {
        std::array<int, 2> ends{};
        if (::pipe2(ends.data(), O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
        readEnd = UniqueFd(ends[0]);
        writeEnd = UniqueFd(ends[1]);
    }

    /// Opens the session; `onInput` is then told all bytes that have been sent, after each message.
    void open(std::function<void(const std::string&)> onInput)
    {
        session.emplace(console.openSerial(kPartition));
        end->onMessage = [this, onInput = std::move(onInput)](const QelMessage& message) {
            const auto* data = dynamic_cast<const QelMessageVirtualSerialDataToOsAsync*>(&message);
            ASSERT_NE(data, nullptr);
            ++dataMessages;
            sent.append(data->getSerialData(), data->getSerialDataLength());
            onInput(sent);
            hasSent = true;
        };
    }

    /// Joins the session to the pipes, or to the terminal.
    tool::ConsoleLoop::Outcome run(const tool::InputOptions& options = tool::InputOptions(), const Pty* pty = nullptr)
    {
        tool::SignalWatch signals{SIGUSR1, SIGUSR2, SIGCONT};
        const int input = pty == nullptr ? inputRead.get() : pty->slave();
        tool::TerminalMode mode(input);
        tool::ConsoleScreen screen(pty == nullptr ? outputWrite.get() : pty->slave(), errors, pty != nullptr, mode);
        console.onNotice<QelMessageDaxBroadcastOutboundAsync>(
            [&](const QelMessageDaxBroadcastOutboundAsync& broadcast) { screen.showBroadcast(broadcast); });
        screen.stamps() = tool::TimeStamps(stamps);
        for (tool::LogFile* logFile : tools.logs)
            screen.addTap(*logFile);
        if (tools.script != nullptr) screen.addTap(*tools.script);
        tool::ConsoleLoop loop(screen, input, mode, signals, options, tools);
        return loop.run(console, *session);
    }

    void typeAll(const std::string& text)
    {
        ASSERT_EQ(::write(inputWrite.get(), text.data(), text.size()), static_cast<ssize_t>(text.size()));
        inputWrite.reset();
    }
    void output(const std::string& text)
    {
        end->push(
            QelMessageVirtualSerialDataToDaxAsync(kPartition, 0, static_cast<std::uint16_t>(text.size()), text.data()));
    }
    void closeSession(QelMessageVirtualSerialSessionClosedAsync::CloseReason reason =
                          QelMessageVirtualSerialSessionClosedAsync::CloseReasonReadFailure)
    {
        end->push(QelMessageVirtualSerialSessionClosedAsync(kPartition, 0, reason));
    }
    /// Reads so many bytes from the pipe that the loop writes to; fewer when it ends, or when they do not come.
    std::string readOutput(std::size_t length) const
    {
        const PollSet output(PollFd(outputRead.get(), PollEvents::Read));
        std::string text(length, '\0');
        std::size_t there = 0;
        while (there < length && output.wait(std::chrono::seconds(20)).anyReady()) {
            const ssize_t count = ::read(outputRead.get(), text.data() + there, length - there);
            if (count <= 0) break;
            there += static_cast<std::size_t>(count);
        }
        return text.substr(0, there);
    }
    /// Reads the terminal's screen until it ends with the text. @return all that was read
    static std::string screenUntil(const Pty& pty, const std::string& text)
    {
        std::string screen;
        while (screen.size() < text.size() || screen.compare(screen.size() - text.size(), text.size(), text) != 0)
            screen += pty.read(1);
        return screen;
    }
    /// What the loop has written to the pipe.
    std::string written()
    {
        outputWrite.reset();
        return readOutput(1000000);
    }
    /// Leaves no room in the pipe.
    void fillOutput() const
    {
        const std::string filler(kPipeBytes, '-');
        ASSERT_EQ(::write(outputWrite.get(), filler.data(), filler.size()), static_cast<ssize_t>(kPipeBytes));
    }
    /// Of what the hypervisor has sent.
    int unreadBytes() const
    {
        int bytes = -1;
        ::ioctl(end->descriptor(), FIONREAD, &bytes);
        return bytes;
    }

    CapturedLog log{LogLevel::Warn};
    UniqueFd inputRead, inputWrite, outputRead, outputWrite;
    std::ostringstream errors;
    FakeHypervisorEnd* end = nullptr; // owned by the console
    protocol::Console console = FakeHypervisorEnd::makeConsole(end, FakeHypervisorEnd::plainOptions(), true);
    std::optional<protocol::SerialSession> session;
    tool::SessionTools tools;
    tool::TimeStamps::Style stamps = tool::TimeStamps::Style::Off;
    std::string sent; // serial data
    std::atomic<bool> hasSent{false};
    unsigned int dataMessages = 0;
};

} // namespace qel::test
