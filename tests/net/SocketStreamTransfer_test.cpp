#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "net/SocketStreamKit.hpp"
#include "support/Loopback.hpp"
#include "support/SignalStorm.hpp"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstddef>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <sys/socket.h>
#include <unistd.h>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using test::kReadRetried;
using test::kWriteRetried;
using test::throwsReceiveFailure;
using test::throwsSendFailure;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StrEq;

using SocketStreamTransfer = test::SocketStreamPair;

// Reading

TEST_F(SocketStreamTransfer, ReadsWhatHasArrived)
{
    peerSends("hello");
    EXPECT_EQ(read(16), "hello");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream read 5 bytes of data"));
}

TEST_F(SocketStreamTransfer, ReadsNoMoreThanTheLength)
{
    peerSends("hello");
    EXPECT_EQ(read(2), "he");
    EXPECT_EQ(read(3), "llo");
    EXPECT_THAT(mLog.lines(),
                ElementsAre("D: socket stream read 2 bytes of data", "D: socket stream read 3 bytes of data"));
}

TEST_F(SocketStreamTransfer, EndOfStreamReturnsZeroAndLogs)
{
    peerSends("bye");
    peerCloses();
    EXPECT_EQ(read(), "bye");
    mLog.clear();
    EXPECT_EQ(read(), "");
    EXPECT_EQ(read(), "");
    EXPECT_THAT(mLog.lines(), ElementsAre("I: socket stream was closed by partner (EOF)",
                                          "I: socket stream was closed by partner (EOF)"));
}

TEST_F(SocketStreamTransfer, AReadOfLengthZeroReturnsZeroLikeEndOfStream)
{
    int reads = 0;
    mCalls.read = [&](int descriptor, void* buffer, std::size_t length) {
        ++reads;
        return ::read(descriptor, buffer, length);
    };
    peerSends("x");
    EXPECT_EQ(mStream.read(nullptr, 0), 0U);
    EXPECT_EQ(reads, 1);
    EXPECT_THAT(mLog.lines(), ElementsAre("I: socket stream was closed by partner (EOF)"));
}

TEST_F(SocketStreamTransfer, FillReadsUntilAllBytesHaveArrived)
{
    mCalls.read = [](int descriptor, void* buffer, std::size_t length) {
        return ::read(descriptor, buffer, std::min<std::size_t>(length, 3));
    };
    peerSends("abcdefgh");
    std::string text(8, '\0');
    mStream.fill(&text[0], text.size());
    EXPECT_EQ(text, "abcdefgh");
    EXPECT_THAT(mLog.lines(),
                ElementsAre("D: socket stream read 3 bytes of data", "D: socket stream read 3 bytes of data",
                            "D: socket stream read 2 bytes of data"));
    mLog.clear();
    mStream.fill(nullptr, 0);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(SocketStreamTransfer, FillThrowsWhenTheStreamEndsEarly)
{
    peerSends("abc");
    peerCloses();
    char buffer[8];
    EXPECT_THAT([&] { mStream.fill(buffer, sizeof(buffer)); },
                ::testing::ThrowsMessage<StreamIOException>(StrEq("EOF")));
}

TEST_F(SocketStreamTransfer, AReadOfAResetConnectionThrowsWithTheErrorNested)
{
    peerResets();
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(ECONNRESET, "socket stream failed to receive: 104 (Connection reset by peer)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: socket stream failed to receive: 104 (Connection reset by peer)"));
}

TEST_F(SocketStreamTransfer, AReadThatFailsThrowsWithTheErrorNested)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    mCalls.read = [](int, void*, std::size_t) -> ssize_t {
        errno = EIO;
        return -1;
    };
    EXPECT_THAT([this] { read(); },
                throwsReceiveFailure(EIO, "socket stream failed to receive: 5 (Input/output error)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("E: socket stream failed to receive: 5 (Input/output error)"));
}

TEST_F(SocketStreamTransfer, RetriesAReadAfterASignal)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    int signals = 3;
    mCalls.read = [&](int descriptor, void* buffer, std::size_t length) -> ssize_t {
        if (signals-- == 0) return ::read(descriptor, buffer, length);
        errno = EINTR;
        return -1;
    };
    peerSends("on");
    EXPECT_EQ(read(), "on");
    EXPECT_THAT(mLog.lines(),
                ElementsAre(kReadRetried, kReadRetried, kReadRetried, "D: socket stream read 2 bytes of data"));
    EXPECT_THAT(mRecorded.options(), IsEmpty()) << "without a deadline no option is set";
}

// Writing

TEST_F(SocketStreamTransfer, WritesAllBytes)
{
    write("hello");
    EXPECT_EQ(peerReads(5), "hello");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 5 bytes of data"));
}

TEST_F(SocketStreamTransfer, ContinuesAfterShortWrites)
{
    std::vector<std::size_t> lengths;
    mCalls.send = [&](int descriptor, const void* buffer, std::size_t length, int flags) {
        lengths.push_back(length);
        EXPECT_EQ(flags, MSG_NOSIGNAL);
        return ::send(descriptor, buffer, std::min<std::size_t>(length, 4), flags);
    };
    write("abcdefghij");
    EXPECT_EQ(peerReads(10), "abcdefghij");
    EXPECT_THAT(lengths, ElementsAre(10, 6, 2));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 10 bytes of data")) << "once for the whole call";
}

TEST_F(SocketStreamTransfer, RetriesAWriteThatSendsNothing)
{
    int calls = 0;
    mCalls.send = [&](int descriptor, const void* buffer, std::size_t length, int flags) -> ssize_t {
        return ++calls == 1 ? 0 : ::send(descriptor, buffer, length, flags);
    };
    write("abc");
    EXPECT_EQ(peerReads(3), "abc");
    EXPECT_EQ(calls, 2);
}

TEST_F(SocketStreamTransfer, AWriteOfLengthZeroOnlyLogs)
{
    mCalls.send = [](int, const void*, std::size_t, int) -> ssize_t {
        ADD_FAILURE() << "sends";
        return 0;
    };
    mStream.setWriteDeadline(milliseconds(0));
    mStream.write(nullptr, 0);
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 0 bytes of data"));
    EXPECT_THAT(mRecorded.options(), IsEmpty());
}

TEST_F(SocketStreamTransfer, AWriteToAClosedPeerThrowsWithoutASignal)
{
    peerResets();
    // The first write may fail with the reset; later ones fail with EPIPE.
    try {
        write("x");
    } catch (const StreamIOException&) {
    }
    mLog.clear();
    EXPECT_THAT([this] { write("x"); }, throwsSendFailure(EPIPE, "socket stream send failure: 32 (Broken pipe)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 1 bytes of data",
                                          "E: socket stream send failure: 32 (Broken pipe)"));
}

TEST_F(SocketStreamTransfer, AnErrorAfterAShortWriteIsNested)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    int calls = 0;
    mCalls.send = [&](int, const void*, std::size_t, int) -> ssize_t {
        if (++calls == 1) return 4;
        errno = ENETUNREACH;
        return -1;
    };
    EXPECT_THAT([this] { write("abcdefgh"); },
                throwsSendFailure(ENETUNREACH, "socket stream send failure: 101 (Network is unreachable)"));
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 8 bytes of data",
                                          "E: socket stream send failure: 101 (Network is unreachable)"));
}

TEST_F(SocketStreamTransfer, RetriesAWriteAfterASignal)
{
    QelLogger::get().addBackend(std::make_shared<test::ErrnoSpoilingLogBackend>());
    int calls = 0;
    mCalls.send = [&](int descriptor, const void* buffer, std::size_t length, int flags) -> ssize_t {
        if (++calls % 2 == 0) return ::send(descriptor, buffer, std::min<std::size_t>(length, 2), flags);
        errno = EINTR;
        return -1;
    };
    write("abcd");
    EXPECT_EQ(peerReads(4), "abcd");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream sending 4 bytes of data", kWriteRetried, kWriteRetried));
}

TEST_F(SocketStreamTransfer, WritesNoLinesOfDisabledLevels)
{
    QelLogger::get().setLevel(LogLevel::Warn);
    write("x");
    EXPECT_EQ(peerReads(1), "x");
    peerSends("y");
    EXPECT_EQ(read(), "y");
    peerCloses();
    EXPECT_EQ(read(), "");
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

// Real signals

TEST_F(SocketStreamTransfer, SignalsDoNotEndARead)
{
    std::string text;
    const int signals = test::callUnderSignals(
        0, [&] { text = read(); },
        [&] {
            const std::vector<std::string> lines = mLog.lines();
            if (std::count(lines.begin(), lines.end(), kReadRetried) < 2) return true;
            peerSends("at last");
            return false;
        });
    EXPECT_EQ(text, "at last");
    EXPECT_GE(signals, 2);
}

TEST_F(SocketStreamTransfer, TheKernelRestartsAReadWithoutADeadline)
{
    int sent = 0;
    std::string text;
    test::callUnderSignals(
        SA_RESTART, [&] { text = read(); },
        [&] {
            if (++sent <= 20) return true;
            peerSends("at last");
            return false;
        });
    EXPECT_EQ(text, "at last");
    EXPECT_THAT(mLog.lines(), ElementsAre("D: socket stream read 7 bytes of data"));
}

TEST_F(SocketStreamTransfer, SignalsDoNotEndAWrite)
{
    const std::string tooMuch(4 * 1024 * 1024, 'x');
    std::future<std::string> received;
    test::callUnderSignals(
        0, [&] { write(tooMuch); },
        [&] {
            const std::vector<std::string> lines = mLog.lines();
            if (std::find(lines.begin(), lines.end(), kWriteRetried) == lines.end()) return true;
            received = std::async(std::launch::async, [&] { return peerReads(tooMuch.size()); });
            return false;
        });
    EXPECT_EQ(received.get(), tooMuch);
}

} // namespace
} // namespace qel
