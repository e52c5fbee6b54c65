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
#include <gmock/gmock.h>
#include <memory>
#include <sstream>
#include <string>
#include <sys/ioctl.h>
#include <thread>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::ClientConnection;
using tool::CommandFailure;
using tool::ConsoleLoop;
using tool::ConsoleManners;
using tool::ConsoleScreen;
using tool::ConsoleSession;
using tool::ExitStatus;
using tool::SessionEnd;
using tool::SignalWatch;
using tool::TerminalMode;
using tool::UniqueFd;
using Departure = ConsoleLoop::Departure;

using ClosedNotice = QelMessageVirtualSerialSessionClosedAsync;
using DataNotice = QelMessageVirtualSerialDataToDaxAsync;

constexpr std::uint16_t kPartition = 1;
constexpr std::size_t kPipeBytes = 65536; // that a pipe holds: see pipe(7)

/// An open session, played by the test, between an input and an output that the test holds the other ends of.
class ConsoleLoopTest : public ::testing::Test {
protected:
    ConsoleLoopTest()
    {
        makePipe(inputRead, inputWrite);
        makePipe(outputRead, outputWrite);
        auto owned = std::make_unique<FakeHypervisorEnd>();
        end = owned.get();
        connection = std::make_unique<ClientConnection>(std::move(owned), end->descriptor());
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
    ConsoleLoop::Outcome run(const ConsoleManners& manners = ConsoleManners(), const Pty* pty = nullptr)
    {
        SignalWatch signals{SIGUSR1, SIGUSR2, SIGCONT};
        const int input = pty == nullptr ? inputRead.get() : pty->slave();
        TerminalMode mode(input);
        ConsoleScreen screen(pty == nullptr ? outputWrite.get() : pty->slave(), errors, pty != nullptr, mode);
        current = &screen;
        ConsoleLoop loop(*session, screen, input, mode, signals, manners);
        const ConsoleLoop::Outcome outcome = loop.run();
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
        end->push(DataNotice(kPartition, 0, static_cast<std::uint16_t>(text.size()), text.data()));
    }
    void closeSession(ClosedNotice::CloseReason reason = ClosedNotice::CloseReasonReadFailure)
    {
        end->push(ClosedNotice(kPartition, 0, reason));
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
    struct Forward : ConsoleSession::Receiver {
        explicit Forward(ConsoleScreen*& to) : screen(to) {}
        void onOutput(const char* data, std::size_t length) override { screen->onOutput(data, length); }
        void onBroadcast(const QelMessageDaxBroadcastOutboundAsync& message) override { screen->onBroadcast(message); }
        ConsoleScreen*& screen;
    };

    CapturedLog log{LogLevel::Warn};
    UniqueFd inputRead, inputWrite, outputRead, outputWrite;
    std::ostringstream errors;
    ConsoleScreen* current = nullptr;
    Forward receiver{current};
    FakeHypervisorEnd* end = nullptr; // owned by the connection
    std::unique_ptr<ClientConnection> connection;
    std::unique_ptr<ConsoleSession> session;
    std::string sent; // serial data
    std::atomic<bool> hasSent{false};
    unsigned int dataMessages = 0;

    void SetUp() override
    {
        session = std::make_unique<ConsoleSession>(*connection, ConsoleSession::Address{kPartition, 0},
                                                   std::chrono::seconds(10), receiver);
    }
};

// Input that is no terminal.

TEST_F(ConsoleLoopTest, InputIsSentAsItIsThenThePartitionIsToldOfItsEnd)
{
    const std::string input("~.\r\0\xFF uname\n", 12);
    open([&](const std::string& all) {
        if (all.back() == '\x04') closeSession();
    });
    typeAll(input);
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(sent, input + '\x04');
    EXPECT_EQ(session->getEnd(), SessionEnd::CommandEnded);
    EXPECT_EQ(errors.str(), "");
}

TEST_F(ConsoleLoopTest, OutputThatComesAfterTheEndOfTheInputIsWritten)
{
    open([&](const std::string& all) {
        if (all != "x\x04") return;
        output("one ");
        output("two");
        closeSession();
    });
    typeAll("x");
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(written(), "one two");
}

TEST_F(ConsoleLoopTest, OutputThatCameBeforeTheEndOfTheSessionIsWritten)
{
    open([](const std::string&) {});
    for (int i = 0; i < 10; ++i)
        output(std::string(4096, static_cast<char>('0' + i)));
    closeSession();
    EXPECT_EQ(run().departure, Departure::Ended);
    const std::string all = written();
    EXPECT_EQ(all.size(), 40960U);
    EXPECT_EQ(all.front(), '0');
    EXPECT_EQ(all.back(), '9');
}

TEST_F(ConsoleLoopTest, LargeInputIsSentInPiecesThatFitAFrame)
{
    const std::string input(40000, 'x');
    open([&](const std::string& all) {
        if (all.back() == '\x04') closeSession();
    });
    typeAll(input);
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(sent, input + '\x04');
    EXPECT_EQ(dataMessages, 4U); // two full ones, the rest, the end
}

TEST_F(ConsoleLoopTest, ThePartitionIsToldAgainAfterEverySecondOfSilence)
{
    SettableClock clock;
    unsigned int times = 0;
    open([&](const std::string&) {
        if (++times == 4) return closeSession();
        clock.advance(ConsoleLoop::kTellAgain);
    });
    inputWrite.reset();
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(sent, "\x04\x04\x04\x04");
}

TEST_F(ConsoleLoopTest, EachSecondOfSilenceIsCountedFromTheLastTime)
{
    SettableClock clock;
    std::thread other;
    open([&](const std::string& all) {
        if (all == "\x04") return clock.advance(ConsoleLoop::kTellAgain);
        ASSERT_EQ(all, "\x04\x04");
        clock.advance(ConsoleLoop::kTellAgain - std::chrono::nanoseconds(1));
        other = std::thread([&, before = clock.steadyReads()] {
            while (clock.steadyReads() < before + 10)
                std::this_thread::yield(); // it looks, and nothing has happened
            closeSession();
        });
    });
    inputWrite.reset();
    EXPECT_EQ(run().departure, Departure::Ended);
    ASSERT_TRUE(other.joinable());
    other.join();
    EXPECT_EQ(sent, "\x04\x04");
}

TEST_F(ConsoleLoopTest, OutputIsNoSilence)
{
    constexpr auto kAlmost = ConsoleLoop::kTellAgain - std::chrono::nanoseconds(1);
    SettableClock clock;
    open([&](const std::string&) {
        clock.advance(kAlmost);
        output("one");
    });
    std::thread reader([&] {
        EXPECT_EQ(readOutput(3), "one");
        clock.advance(kAlmost); // almost two seconds after the end of the input was told
        output("two");
        EXPECT_EQ(readOutput(3), "two");
        closeSession();
    });
    inputWrite.reset();
    EXPECT_EQ(run().departure, Departure::Ended);
    reader.join();
    EXPECT_EQ(sent, "\x04");
}

TEST_F(ConsoleLoopTest, WhoeverDoesNotTellTheEndWaitsForTheSessionToEnd)
{
    open([&](const std::string& all) {
        EXPECT_EQ(all, "x");
        closeSession();
    });
    ConsoleManners manners;
    manners.tellsEnd = false;
    typeAll("x");
    EXPECT_EQ(run(manners).departure, Departure::Ended);
    EXPECT_EQ(sent, "x");
}

TEST_F(ConsoleLoopTest, AfterTheLingerTimeOfSilenceTheSessionIsLeft)
{
    SettableClock clock;
    ConsoleManners manners;
    manners.linger = std::chrono::seconds(5);
    open([&](const std::string& all) {
        if (all != "x\x04") return;
        output("y"); // is there in time
        clock.advance(std::chrono::seconds(5));
    });
    std::thread reader([&] {
        EXPECT_EQ(readOutput(1), "y");
        clock.advance(std::chrono::seconds(5));
        end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi")); // makes the loop look at the clock
    });
    typeAll("x");
    EXPECT_EQ(run(manners).departure, Departure::Lingered);
    reader.join();
    EXPECT_EQ(sent, "x\x04") << "the end is told once";
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
}

TEST_F(ConsoleLoopTest, TheLingerTimeDoesNotRunWhileOutputWaits)
{
    SettableClock clock;
    ConsoleManners manners;
    manners.linger = std::chrono::seconds(5);
    fillOutput();
    open([&](const std::string& all) {
        if (all != "\x04") return;
        clock.advance(std::chrono::seconds(5));
        output("one");
    });
    std::thread reader([&] {
        while (!hasSent || unreadBytes() != 0)
            std::this_thread::yield();
        EXPECT_EQ(readOutput(kPipeBytes), std::string(kPipeBytes, '-'));
        EXPECT_EQ(readOutput(3), "one");
        output("two");
        EXPECT_EQ(readOutput(3), "two");
        clock.advance(std::chrono::seconds(5));
        end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi")); // makes the loop look at the clock
    });
    inputWrite.reset();
    EXPECT_EQ(run(manners).departure, Departure::Lingered);
    reader.join();
}

TEST_F(ConsoleLoopTest, NoLingerTimeLeavesAtOnce)
{
    open([](const std::string&) {});
    ConsoleManners manners;
    manners.linger = std::chrono::milliseconds(0);
    manners.tellsEnd = false;
    typeAll("x");
    EXPECT_EQ(run(manners).departure, Departure::Lingered);
    EXPECT_EQ(sent, "x");
}

TEST_F(ConsoleLoopTest, TheLingerTimeDoesNotRunBeforeTheEndOfTheInput)
{
    SettableClock clock;
    open([&](const std::string& all) {
        clock.advance(std::chrono::hours(1));
        if (all == "x") inputWrite.reset();
        if (all == "x\x04") closeSession();
    });
    ConsoleManners manners;
    manners.linger = std::chrono::hours(2);
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    EXPECT_EQ(run(manners).departure, Departure::Ended);
}

TEST_F(ConsoleLoopTest, InputThatCannotBeReadIsAnError)
{
    open([](const std::string&) {});
    inputRead = UniqueFd(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    EXPECT_THAT([&] { run(); }, ThrowsMessage<PosixError>(StrEq("cannot read standard input: 21 (Is a directory)")));
}

TEST_F(ConsoleLoopTest, InputFromADescriptorWithNothingToReadYetIsWaitedFor)
{
    ASSERT_EQ(::fcntl(inputRead.get(), F_SETFL, O_NONBLOCK), 0); // as whoever started the program left it
    open([&](const std::string& all) {
        if (all == "a") typeAll("b");
        if (all == "ab\x04") closeSession();
    });
    ASSERT_EQ(::write(inputWrite.get(), "a", 1), 1);
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(sent, "ab\x04");
}

// Neither direction waits for the other.

TEST_F(ConsoleLoopTest, OutputIsReadWhileTheConnectionTakesNoInput)
{
    open([&](const std::string& all) {
        if (all == "x\x04") closeSession();
    });
    end->stopTaking();
    output("while it is stuck");
    typeAll("x");
    std::thread reader([&] {
        EXPECT_EQ(readOutput(17), "while it is stuck");
        end->takeAgain();
    });
    EXPECT_EQ(run().departure, Departure::Ended);
    reader.join();
    EXPECT_EQ(sent, "x\x04");
}

TEST_F(ConsoleLoopTest, NoMoreInputIsReadThanIsSent)
{
    const TemporaryDirectory directory; // a file is ready at all times
    const std::string path = directory.file("input");
    std::ofstream(path) << std::string(1000000, 'i');
    inputRead = UniqueFd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    open([&](const std::string& all) {
        if (all.back() == '\x04') closeSession();
    });
    end->stopTaking();
    output("a");
    std::thread reader([&] {
        EXPECT_EQ(readOutput(1), "a");
        output("b");
        EXPECT_EQ(readOutput(1), "b"); // the loop has gone round several times
        EXPECT_EQ(::lseek(inputRead.get(), 0, SEEK_CUR), static_cast<off_t>(ConsoleSession::kMostData));
        end->takeAgain();
    });
    EXPECT_EQ(run().departure, Departure::Ended);
    reader.join();
    EXPECT_EQ(sent.size(), 1000001U);
}

TEST_F(ConsoleLoopTest, InputIsSentWhileTheOutputTakesNothing)
{
    fillOutput();
    std::thread reader;
    open([&](const std::string& all) {
        if (all != "x\x04") return;
        closeSession();
        reader = std::thread([this] { EXPECT_EQ(readOutput(kPipeBytes), std::string(kPipeBytes, '-')); });
    });
    output("stuck");
    typeAll("x");
    EXPECT_EQ(run().departure, Departure::Ended);
    ASSERT_TRUE(reader.joinable());
    reader.join();
    EXPECT_EQ(written(), "stuck");
}

TEST_F(ConsoleLoopTest, NoMoreOutputIsTakenThanThereIsRoomFor)
{
    constexpr int kMessages = 20;
    constexpr int kThatFit = 8; // of 8 KiB each
    const std::string chunk(8192, 'o');
    constexpr int kFrameBytes = 32 + 6 + 8192;
    fillOutput();

    // A file is ready at all times: each turn of the loop sends one message, and takes one while there is room.
    const TemporaryDirectory directory;
    const std::string path = directory.file("input");
    std::ofstream(path) << std::string(15 * ConsoleSession::kMostData, 'i');
    inputRead = UniqueFd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));

    std::thread reader;
    std::string all;
    open([&](const std::string&) {
        if (dataMessages != 15) return;
        EXPECT_EQ(unreadBytes(), (kMessages - kThatFit) * kFrameBytes);
        closeSession();
        reader = std::thread([&] { all = readOutput(kPipeBytes + kMessages * chunk.size()); });
    });
    for (int i = 0; i < kMessages; ++i)
        output(chunk);
    EXPECT_EQ(run().departure, Departure::Ended);
    ASSERT_TRUE(reader.joinable());
    reader.join();
    EXPECT_EQ(all, std::string(kPipeBytes, '-') + std::string(kMessages * chunk.size(), 'o'));
}

// The connection.

TEST_F(ConsoleLoopTest, WhatCameBeforeTheConnectionBrokeIsWritten)
{
    open([](const std::string&) {});
    output("last words");
    end->end();
    EXPECT_THAT([&] { run(); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
    EXPECT_EQ(written(), "last words");
}

TEST_F(ConsoleLoopTest, ABrokenProtocolIsAnError)
{
    open([](const std::string&) {});
    output("before");
    end->push(QelMessageGeneric(1, 0x6003, 0x0107, MsgResponse));
    EXPECT_THAT([&] { run(); }, ThrowsMessage<CommandFailure>(StrEq("response to a request that was not made")));
    EXPECT_EQ(written(), "before");
}

TEST_F(ConsoleLoopTest, AHypervisorThatTakesNothingMoreMayHaveSaidWhy)
{
    open([](const std::string&) {});
    end->failWrites([&] {
        // The connection is reset; what came before is still there to be read.
        output("last words");
        closeSession(ClosedNotice::CloseReasonQelShutdown);
        throw StreamIOException("socket stream send failure");
    });
    typeAll("x");
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(session->getEnd(), SessionEnd::ShutDown);
    EXPECT_EQ(written(), "last words");
}

TEST_F(ConsoleLoopTest, NobodyLingersOnAConnectionThatTakesNothingMore)
{
    std::atomic<bool> isBroken{false};
    open([](const std::string&) {});
    end->failWrites([&] {
        isBroken = true;
        throw StreamIOException("socket stream send failure");
    });
    ConsoleManners manners;
    manners.linger = std::chrono::milliseconds(0);
    std::thread reader([&] {
        while (!isBroken)
            std::this_thread::yield();
        for (const char* const text : {"a", "b", "c"}) {
            output(text);
            EXPECT_EQ(readOutput(1), text);
        }
        closeSession();
    });
    inputWrite.reset();
    EXPECT_EQ(run(manners).departure, Departure::Ended);
    reader.join();
}

TEST_F(ConsoleLoopTest, AHypervisorThatTakesNothingMoreMayHaveSaidNothing)
{
    open([](const std::string&) {});
    end->failWrites([&] {
        end->end();
        throw StreamIOException("socket stream send failure");
    });
    typeAll("x");
    EXPECT_THAT([&] { run(); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

TEST_F(ConsoleLoopTest, AHypervisorThatStopsInTheMiddleOfTakingIsNotWaitedFor)
{
    open([](const std::string&) {});
    end->failWrites([] { throw StreamIOException("I/O deadline"); });
    typeAll("x");
    EXPECT_THAT([&] { run(); }, ThrowsMessage<StreamIOException>(StrEq("I/O deadline")));
}

TEST_F(ConsoleLoopTest, TheEndOfTheConnectionEndsTheSession)
{
    open([](const std::string&) {});
    end->push(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(session->getEnd(), SessionEnd::ConnectionClosed);
}

TEST_F(ConsoleLoopTest, AReaderOfTheOutputThatIsGoneIsAnError)
{
    const auto before = std::signal(SIGPIPE, SIG_IGN);
    open([](const std::string&) {});
    outputRead.reset();
    output("x");
    EXPECT_THAT([&] { run(); }, ThrowsMessage<PosixError>(StrEq("cannot write to standard output: 32 (Broken pipe)")));
    static_cast<void>(std::signal(SIGPIPE, before));
}

TEST_F(ConsoleLoopTest, BroadcastsAreShown)
{
    open([](const std::string&) {});
    end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
    closeSession();
    EXPECT_EQ(run().departure, Departure::Ended);
    EXPECT_EQ(errors.str(), "qel: broadcast from tool type 1, \"them\": hi\n");
}

// Signals. They are raised while the loop watches for them.

TEST_F(ConsoleLoopTest, ASignalEndsIt)
{
    open([](const std::string&) { ::raise(SIGUSR1); });
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    const ConsoleLoop::Outcome outcome = run();
    EXPECT_EQ(outcome.departure, Departure::Signal);
    EXPECT_EQ(outcome.signal, SIGUSR1);
}

TEST_F(ConsoleLoopTest, ASignalThatThisProcessIgnoresIsIgnored)
{
    const auto before = std::signal(SIGUSR2, SIG_IGN);
    open([&](const std::string&) {
        ::raise(SIGUSR2);
        closeSession();
    });
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    const ConsoleLoop::Outcome outcome = run();
    static_cast<void>(std::signal(SIGUSR2, before));
    EXPECT_EQ(outcome.departure, Departure::Ended);
    EXPECT_EQ(outcome.signal, 0);
}

TEST_F(ConsoleLoopTest, ASignalDoesNotWaitForAnOutputThatTakesNothing)
{
    fillOutput();
    open([&](const std::string&) { closeSession(); });
    output("stuck");
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    const pthread_t self = ::pthread_self();
    std::thread other([&] {
        // The session has ended and only the output is left to wait for once nothing is left to be read.
        while (unreadBytes() != 0)
            std::this_thread::yield();
        ::pthread_kill(self, SIGUSR1);
    });
    const ConsoleLoop::Outcome outcome = run();
    other.join();
    EXPECT_EQ(outcome.departure, Departure::Signal);
    EXPECT_EQ(outcome.signal, SIGUSR1);
}

// A terminal.

TEST_F(ConsoleLoopTest, ATerminalIsInRawModeMeanwhile)
{
    const Pty pty;
    const termios before = pty.attributes();
    open([](const std::string&) {});
    output("$ ");
    std::thread person([&] {
        EXPECT_EQ(pty.read(2), "$ ");
        EXPECT_TRUE(isRaw(pty.attributes()));
        pty.type("~.");
    });
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Left);
    person.join();
    EXPECT_TRUE(pty.attributes() == before);
}

TEST_F(ConsoleLoopTest, APersonTypesAndLeaves)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw(); // so that what is typed before the loop begins is there to be read
    open([](const std::string&) {});
    pty.type("ls\r~~\r~.typed too late");
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Left);
    EXPECT_EQ(sent, "ls\r~\r");
    EXPECT_EQ(errors.str(), "qel: connected; ~? at the start of a line lists the commands\r\n");
}

TEST_F(ConsoleLoopTest, APersonCanLeaveAConnectionThatTakesNothing)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([](const std::string&) { ADD_FAILURE() << "sent"; });
    end->stopTaking();
    pty.type("ls\r~.");
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Left);
}

TEST_F(ConsoleLoopTest, HelpIsShown)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([](const std::string&) {});
    pty.type("~?~.");
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Left);
    EXPECT_THAT(errors.str(), HasSubstr("\r\nqel: at the start of a line:\r\n  ~.   leave\r\n"));
    EXPECT_EQ(sent, "");
}

TEST_F(ConsoleLoopTest, WithoutAnEscapeCharacterEverythingIsSent)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([&](const std::string& all) {
        if (all == "~.") closeSession();
    });
    pty.type("~.");
    ConsoleManners manners;
    manners.escape.reset();
    EXPECT_EQ(run(manners, &pty).departure, Departure::Ended);
    EXPECT_EQ(errors.str(), "");
}

TEST_F(ConsoleLoopTest, ControlDOfAPersonIsNoEnd)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([&](const std::string& all) {
        EXPECT_EQ(all, "\x04");
        closeSession();
    });
    pty.type("\x04");
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Ended);
}

TEST_F(ConsoleLoopTest, OutputAndLinesShareATerminal)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([](const std::string&) {});
    output("$ ");
    end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
    closeSession();
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Ended);
    EXPECT_THAT(errors.str(), StartsWith("qel: connected"));
    EXPECT_THAT(errors.str(), HasSubstr("\r\n\r\nqel: broadcast from tool type 1, \"them\": hi\r\n"));
    EXPECT_EQ(pty.read(2), "$ ");
}

TEST_F(ConsoleLoopTest, AnExceptionPutsTheTerminalBack)
{
    const Pty pty;
    const termios before = pty.attributes();
    open([](const std::string&) {});
    end->end();
    EXPECT_THROW(run(ConsoleManners(), &pty), StreamIOException);
    EXPECT_TRUE(pty.attributes() == before);
}

TEST_F(ConsoleLoopTest, ATerminalThatHasGoneIsLikeLeaving)
{
    Pty pty;
    open([&](const std::string&) { pty.hangUp(); });
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    pty.type("x");
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Left);
}

TEST_F(ConsoleLoopTest, GoingOnEntersRawModeAgain)
{
    const Pty pty;
    TerminalMode raw(pty.slave());
    raw.enterRaw();
    open([&](const std::string& all) {
        if (all == "x") {
            raw.restore(); // as a shell does while the process is stopped
            ::raise(SIGCONT);
            output("going on");
        } else {
            EXPECT_TRUE(isRaw(pty.attributes()));
            closeSession();
        }
    });
    pty.type("x");
    std::thread person([&] {
        EXPECT_EQ(pty.read(8), "going on");
        pty.type("y\r"); // a whole line, so that it comes in any mode
    });
    EXPECT_EQ(run(ConsoleManners(), &pty).departure, Departure::Ended);
    person.join();
    EXPECT_EQ(sent, "xy\r");
}

} // namespace

} // namespace qel::test
