#include "support/Errors.hpp"
#include "tools/console/ConsoleLoopFixture.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::StrEq;
using ::testing::ThrowsMessage;
using tool::ConsoleLoop;
using tool::InputOptions;
using tool::SerialSession;
using tool::SessionEnd;
using ExitReason = ConsoleLoop::ExitReason;

using ClosedNotice = QelMessageVirtualSerialSessionClosedAsync;

// Input that is not a terminal.

TEST_F(ConsoleLoopTest, InputIsSentUnchangedAndFollowedByAnEndOfFile)
{
    const std::string input("~.\r\0\xFF uname\n", 12);
    open([&](const std::string& all) {
        if (all.back() == '\x04') closeSession();
    });
    typeAll(input);
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(sent, input + '\x04');
    EXPECT_EQ(session->getEnd(), SessionEnd::CommandEnded);
    EXPECT_EQ(errors.str(), "");
}

TEST_F(ConsoleLoopTest, OutputAfterTheEndOfTheInputIsWritten)
{
    open([&](const std::string& all) {
        if (all != "x\x04") return;
        output("one ");
        output("two");
        closeSession();
    });
    typeAll("x");
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(written(), "one two");
}

TEST_F(ConsoleLoopTest, OutputBeforeTheEndOfTheSessionIsWritten)
{
    open([](const std::string&) {});
    for (int i = 0; i < 10; ++i)
        output(std::string(4096, static_cast<char>('0' + i)));
    closeSession();
    EXPECT_EQ(run().reason, ExitReason::Ended);
    const std::string all = written();
    EXPECT_EQ(all.size(), 40960U);
    EXPECT_EQ(all.front(), '0');
    EXPECT_EQ(all.back(), '9');
}

TEST_F(ConsoleLoopTest, LargeInputIsSplitIntoFrames)
{
    const std::string input(40000, 'x');
    open([&](const std::string& all) {
        if (all.back() == '\x04') closeSession();
    });
    typeAll(input);
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(sent, input + '\x04');
    EXPECT_EQ(dataMessages, 4U); // two full ones, the rest, the end
}

TEST_F(ConsoleLoopTest, EndOfFileIsRepeatedAfterEachSecondWithoutOutput)
{
    SettableClock clock;
    unsigned int times = 0;
    open([&](const std::string&) {
        if (++times == 4) return closeSession();
        clock.advance(ConsoleLoop::kEndRepeat);
    });
    inputWrite.reset();
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(sent, "\x04\x04\x04\x04");
}

TEST_F(ConsoleLoopTest, RepetitionIsTimedFromTheLastEndOfFile)
{
    SettableClock clock;
    std::thread other;
    open([&](const std::string& all) {
        if (all == "\x04") return clock.advance(ConsoleLoop::kEndRepeat);
        ASSERT_EQ(all, "\x04\x04");
        clock.advance(ConsoleLoop::kEndRepeat - std::chrono::nanoseconds(1));
        other = std::thread([&, before = clock.steadyReads()] {
            while (clock.steadyReads() < before + 10)
                std::this_thread::yield(); // it looks, and nothing has happened
            closeSession();
        });
    });
    inputWrite.reset();
    EXPECT_EQ(run().reason, ExitReason::Ended);
    ASSERT_TRUE(other.joinable());
    other.join();
    EXPECT_EQ(sent, "\x04\x04");
}

TEST_F(ConsoleLoopTest, OutputPostponesTheRepetition)
{
    constexpr auto kAlmost = ConsoleLoop::kEndRepeat - std::chrono::nanoseconds(1);
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
    EXPECT_EQ(run().reason, ExitReason::Ended);
    reader.join();
    EXPECT_EQ(sent, "\x04");
}

TEST_F(ConsoleLoopTest, WithoutEndOfFileTheLoopWaitsForTheSessionToEnd)
{
    open([&](const std::string& all) {
        EXPECT_EQ(all, "x");
        closeSession();
    });
    InputOptions options;
    options.sendsEnd = false;
    typeAll("x");
    EXPECT_EQ(run(options).reason, ExitReason::Ended);
    EXPECT_EQ(sent, "x");
}

TEST_F(ConsoleLoopTest, LeavesAfterTheLingerTimeWithoutOutput)
{
    SettableClock clock;
    InputOptions options;
    options.linger = std::chrono::seconds(5);
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
    EXPECT_EQ(run(options).reason, ExitReason::Lingered);
    reader.join();
    EXPECT_EQ(sent, "x\x04") << "the end-of-file character is sent once";
    EXPECT_EQ(session->getEnd(), SessionEnd::None);
}

TEST_F(ConsoleLoopTest, LingerTimeDoesNotRunWhileOutputIsPending)
{
    SettableClock clock;
    InputOptions options;
    options.linger = std::chrono::seconds(5);
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
    EXPECT_EQ(run(options).reason, ExitReason::Lingered);
    reader.join();
}

TEST_F(ConsoleLoopTest, LingerTimeOfZeroLeavesAtOnce)
{
    open([](const std::string&) {});
    InputOptions options;
    options.linger = std::chrono::milliseconds(0);
    options.sendsEnd = false;
    typeAll("x");
    EXPECT_EQ(run(options).reason, ExitReason::Lingered);
    EXPECT_EQ(sent, "x");
}

TEST_F(ConsoleLoopTest, LingerTimeStartsAtTheEndOfTheInput)
{
    SettableClock clock;
    open([&](const std::string& all) {
        clock.advance(std::chrono::hours(1));
        if (all == "x") inputWrite.reset();
        if (all == "x\x04") closeSession();
    });
    InputOptions options;
    options.linger = std::chrono::hours(2);
    ASSERT_EQ(::write(inputWrite.get(), "x", 1), 1);
    EXPECT_EQ(run(options).reason, ExitReason::Ended);
}

TEST_F(ConsoleLoopTest, ThrowsWhenTheInputCannotBeRead)
{
    open([](const std::string&) {});
    inputRead = UniqueFd(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    EXPECT_THAT([&] { run(); }, ThrowsMessage<PosixError>(StrEq("cannot read standard input: 21 (Is a directory)")));
}

TEST_F(ConsoleLoopTest, WaitsForInputFromANonBlockingDescriptor)
{
    ASSERT_EQ(::fcntl(inputRead.get(), F_SETFL, O_NONBLOCK), 0); // as the parent process left it
    open([&](const std::string& all) {
        if (all == "a") typeAll("b");
        if (all == "ab\x04") closeSession();
    });
    ASSERT_EQ(::write(inputWrite.get(), "a", 1), 1);
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(sent, "ab\x04");
}

// Neither direction waits for the other.

TEST_F(ConsoleLoopTest, ReceivesOutputWhileTheConnectionTakesNoInput)
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
    EXPECT_EQ(run().reason, ExitReason::Ended);
    reader.join();
    EXPECT_EQ(sent, "x\x04");
}

TEST_F(ConsoleLoopTest, StopsReadingInputWhileNothingIsSent)
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
        EXPECT_EQ(::lseek(inputRead.get(), 0, SEEK_CUR), static_cast<off_t>(SerialSession::kMaxData));
        end->takeAgain();
    });
    EXPECT_EQ(run().reason, ExitReason::Ended);
    reader.join();
    EXPECT_EQ(sent.size(), 1000001U);
}

TEST_F(ConsoleLoopTest, SendsInputWhileTheScreenTakesNoOutput)
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
    EXPECT_EQ(run().reason, ExitReason::Ended);
    ASSERT_TRUE(reader.joinable());
    reader.join();
    EXPECT_EQ(written(), "stuck");
}

TEST_F(ConsoleLoopTest, StopsReceivingWhileTheOutputBufferIsFull)
{
    constexpr int kMessages = 20;
    constexpr int kThatFit = 8; // of 8 KiB each
    const std::string chunk(8192, 'o');
    constexpr int kFrameBytes = 32 + 6 + 8192;
    fillOutput();

    // A file is ready at all times: each turn of the loop sends one message, and takes one while there is room.
    const TemporaryDirectory directory;
    const std::string path = directory.file("input");
    std::ofstream(path) << std::string(15 * SerialSession::kMaxData, 'i');
    inputRead = UniqueFd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));

    std::thread reader;
    std::string all;
    open([&](const std::string&) {
        if (dataMessages != 15) return;
        const int rest = (kMessages - kThatFit) * kFrameBytes;
        EXPECT_LE(unreadBytes(), rest);
        EXPECT_GT(unreadBytes(), rest - static_cast<int>(QelMessage::MtuMax)) << "the console reads a little ahead";
        closeSession();
        reader = std::thread([&] { all = readOutput(kPipeBytes + kMessages * chunk.size()); });
    });
    for (int i = 0; i < kMessages; ++i)
        output(chunk);
    EXPECT_EQ(run().reason, ExitReason::Ended);
    ASSERT_TRUE(reader.joinable());
    reader.join();
    EXPECT_EQ(all, std::string(kPipeBytes, '-') + std::string(kMessages * chunk.size(), 'o'));
}

// The connection.

TEST_F(ConsoleLoopTest, WritesOutputReceivedBeforeTheConnectionBroke)
{
    open([](const std::string&) {});
    output("last words");
    end->end();
    EXPECT_THAT([&] { run(); }, failsWith<tool::ClosedByPeer>("connection lost: EOF"));
    EXPECT_EQ(written(), "last words");
}

TEST_F(ConsoleLoopTest, ThrowsOnABrokenProtocol)
{
    open([](const std::string&) {});
    output("before");
    end->push(QelMessageGeneric(1, 0x6003, 0x0107, MsgResponse));
    EXPECT_THAT([&] { run(); }, failsWith<tool::ProtocolBroken>(
                                    "the peer broke the protocol: a response to a request that was not sent"));
    EXPECT_EQ(written(), "before");
}

TEST_F(ConsoleLoopTest, ReadsTheReasonAfterSendingFailed)
{
    open([](const std::string&) {});
    end->failWrites([&] {
        // The connection is reset; what came before is still there to be read.
        output("last words");
        closeSession(ClosedNotice::CloseReasonQelShutdown);
        throw StreamIOException("socket stream send failure");
    });
    typeAll("x");
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(session->getEnd(), SessionEnd::ShutDown);
    EXPECT_EQ(written(), "last words");
}

TEST_F(ConsoleLoopTest, DoesNotLingerAfterSendingFailed)
{
    std::atomic<bool> isBroken{false};
    open([](const std::string&) {});
    end->failWrites([&] {
        isBroken = true;
        throw StreamIOException("socket stream send failure");
    });
    InputOptions options;
    options.linger = std::chrono::milliseconds(0);
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
    EXPECT_EQ(run(options).reason, ExitReason::Ended);
    reader.join();
}

TEST_F(ConsoleLoopTest, ThrowsWhenSendingFailedAndNoReasonFollows)
{
    open([](const std::string&) {});
    end->failWrites([&] {
        end->end();
        throw StreamIOException("socket stream send failure");
    });
    typeAll("x");
    EXPECT_THAT([&] { run(); }, failsWith<tool::ClosedByPeer>("connection lost: EOF"));
}

TEST_F(ConsoleLoopTest, ThrowsWhenSendingTimesOut)
{
    open([](const std::string&) {});
    end->failWrites([] { throw StreamIOException("I/O deadline"); });
    typeAll("x");
    EXPECT_THAT([&] { run(); }, failsWith<tool::DeadlinePassed>("the peer did not answer in time: I/O deadline"));
}

TEST_F(ConsoleLoopTest, EndOfTheConnectionEndsTheSession)
{
    open([](const std::string&) {});
    end->push(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(session->getEnd(), SessionEnd::ConnectionClosed);
}

TEST_F(ConsoleLoopTest, ThrowsWhenTheReaderOfTheOutputIsGone)
{
    const auto before = std::signal(SIGPIPE, SIG_IGN);
    open([](const std::string&) {});
    outputRead.reset();
    output("x");
    EXPECT_THAT([&] { run(); }, ThrowsMessage<PosixError>(StrEq("cannot write to standard output: 32 (Broken pipe)")));
    static_cast<void>(std::signal(SIGPIPE, before));
}

TEST_F(ConsoleLoopTest, PrintsBroadcasts)
{
    open([](const std::string&) {});
    end->push(QelMessageDaxBroadcastOutboundAsync(2, 1, "them", "hi"));
    closeSession();
    EXPECT_EQ(run().reason, ExitReason::Ended);
    EXPECT_EQ(errors.str(), "qel: broadcast from tool type 1, \"them\": hi\n");
}

TEST_F(ConsoleLoopTest, InputThatIsNoTerminalWaitsForTheNextSession)
{
    typeAll("later");
    tool::SignalWatch signals{SIGUSR1};
    tool::TerminalMode mode(inputRead.get());
    tool::ConsoleScreen screen(outputWrite.get(), errors, false, mode);
    ConsoleLoop loop(screen, inputRead.get(), mode, signals, InputOptions());
    EXPECT_EQ(loop.wait(std::chrono::milliseconds(10)).reason, ExitReason::None);
    int bytes = 0;
    ASSERT_EQ(::ioctl(inputRead.get(), FIONREAD, &bytes), 0);
    EXPECT_EQ(bytes, 5);
    EXPECT_EQ(errors.str(), "");
}

} // namespace

} // namespace qel::test
