#pragma once

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"
#include "console/ConsoleLoop.hpp"
#include "support/CapturedLog.hpp"
#include "support/Pty.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"
#include "tools/client/FakeHypervisorEnd.hpp"

#include <array>
#include <atomic>
#include <csignal>
#include <fcntl.h>
#include <fstream>
#include <functional>
#include <gtest/gtest.h>
#include <memory>
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
        auto owned = std::make_unique<FakeHypervisorEnd>();
        end = owned.get();
        connection = std::make_unique<tool::ClientConnection>(std::move(owned), end->descriptor());
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
        session->open(false);
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
        current = &screen;
        tool::ConsoleLoop loop(*session, screen, input, mode, signals, options);
        const tool::ConsoleLoop::Outcome outcome = loop.run();
        current = nullptr;
        return outcome;
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

    /// Hands on to the screen of the moment.
    struct Forward : tool::ConsoleSession::Receiver {
        explicit Forward(tool::ConsoleScreen*& to) : screen(to) {}
        void onOutput(const char* data, std::size_t length) override { screen->onOutput(data, length); }
        void onBroadcast(const QelMessageDaxBroadcastOutboundAsync& message) override { screen->onBroadcast(message); }
        tool::ConsoleScreen*& screen;
    };

    CapturedLog log{LogLevel::Warn};
    UniqueFd inputRead, inputWrite, outputRead, outputWrite;
    std::ostringstream errors;
    tool::ConsoleScreen* current = nullptr;
    Forward receiver{current};
    FakeHypervisorEnd* end = nullptr; // owned by the connection
    std::unique_ptr<tool::ClientConnection> connection;
    std::unique_ptr<tool::ConsoleSession> session;
    std::string sent; // serial data
    std::atomic<bool> hasSent{false};
    unsigned int dataMessages = 0;

    void SetUp() override
    {
        session = std::make_unique<tool::ConsoleSession>(*connection, tool::ConsoleSession::Address{kPartition, 0},
                                                         std::chrono::seconds(10), receiver);
    }
};

} // namespace qel::test
