#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "support/Allocations.hpp"
#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/ScriptedStream.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <exception>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <new>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <type_traits>
#include <typeinfo>
#include <unistd.h>
#include <utility>
#include <vector>

using qel::QelInternalMessageRegistry;
using qel::QelMessage;
using qel::QelMessageGeneric;
using qel::QelMessageRegistry;
using qel::QelMessageStream;
using qel::QelMessageUpgradeConnectionAsync;
using qel::QelMessageValidationException;
using qel::Stream;
using qel::StreamIOException;
using qel::test::Allocations;
using qel::test::bytes;
using qel::test::CapturedLog;
using qel::test::hex;
using qel::test::ScriptedStream;
using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;
using testing::StrEq;
using testing::ThrowsMessage;

using Bytes = std::vector<char>;

namespace {

void putLength(Bytes& frame, std::uint32_t length)
{
    for (std::size_t i = 0; i < 4; ++i)
        frame[4 + i] = static_cast<char>(length >> (24 - 8 * i));
}

// The first 8 bytes of a frame whose length field is `length`.
Bytes prefixOf(std::uint32_t length)
{
    Bytes prefix = bytes({0xDE, 0xCA, 0xFF, 0x20, 0, 0, 0, 0});
    putLength(prefix, length);
    return prefix;
}

// A correct frame with a 32-byte header, of a function without a registration; the payload counts 0, 1, 2 ... 255, 0
// ...
Bytes frameOf(std::size_t length)
{
    Bytes frame = bytes({0xDE, 0xCA, 0xFF, 0x20, 0, 0, 0, 0, 0x11, 0x22, 0x33, 0x44, 0x7F, 0x01, 0x80, 0,
                         0,    0,    0,    0,    1, 2, 0, 0, 0,    0,    0,    0,    0,    0,    0,    0});
    const auto dataLength = static_cast<std::uint32_t>(length - frame.size());
    for (std::size_t i = 0; i < 4; ++i)
        frame[16 + i] = static_cast<char>(dataLength >> (24 - 8 * i));
    putLength(frame, static_cast<std::uint32_t>(length));
    for (std::size_t i = 0; i < dataLength; ++i)
        frame.push_back(static_cast<char>(i));
    return frame;
}

// The shortest correct frame with a 24-byte header: no payload, 16 bytes of padding.
Bytes oldFrame()
{
    return bytes({0xDE, 0xCA, 0xFF, 0x00, 0, 0, 0, 40, 0, 0, 0, 9, 0x7F, 0x01, 0x80, 16, 0, 0, 0, 0,
                  1,    2,    0,    0,    0, 0, 0, 0,  0, 0, 0, 0, 0,    0,    0,    0,  0, 0, 0, 0});
}

// The connection upgrade notice, which the internal registry knows.
Bytes upgradeFrame()
{
    const QelMessageUpgradeConnectionAsync message(0x01020304U);
    return {message.serialize(), message.serialize() + message.msgLength()};
}

const std::type_info& classOf(const QelMessage& message) { return typeid(message); }

std::string hexOf(const QelMessage& message) { return hex(message.serialize(), message.msgLength()); }

class QelMessageStreamTest : public testing::Test {
protected:
    CapturedLog mLog;
    ScriptedStream mStream;
    QelMessageRegistry mRegistry;
    QelMessageStream mMessages{mStream, mRegistry};
};

using QelMessageStreamRead = QelMessageStreamTest;
using QelMessageStreamWrite = QelMessageStreamTest;

TEST_F(QelMessageStreamRead, ReturnsAFrame)
{
    mStream.deliver(frameOf(100));
    const std::unique_ptr<QelMessage> message = mMessages.read();
    ASSERT_NE(message, nullptr);
    EXPECT_EQ(hexOf(*message), hex(frameOf(100)));
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(QelMessageStreamRead, AsksTheRegistryForTheType)
{
    QelMessageStream internal(mStream, QelInternalMessageRegistry::getInstance());
    mStream.deliver(upgradeFrame()).deliver(upgradeFrame());

    const std::unique_ptr<QelMessage> typed = internal.read();
    EXPECT_EQ(classOf(*typed), typeid(QelMessageUpgradeConnectionAsync));
    EXPECT_EQ(hexOf(*typed), hex(upgradeFrame()));

    const std::unique_ptr<QelMessage> plain = mMessages.read();
    EXPECT_EQ(classOf(*plain), typeid(QelMessage));
    EXPECT_EQ(hexOf(*plain), hex(upgradeFrame()));
}

TEST_F(QelMessageStreamRead, PassesTheWholeFrameToTheFactoryOnce)
{
    std::vector<std::string> seen;
    QelMessageRegistry registry{
        {QelMessageUpgradeConnectionAsync::getMessageID(), [&seen](const char* buffer, unsigned int length) {
             seen.push_back(hex(buffer, length));
             return std::make_unique<QelMessage>(buffer, length);
         }}};
    mStream.deliver(upgradeFrame());
    QelMessageStream(mStream, registry).read();
    EXPECT_THAT(seen, ElementsAre(hex(upgradeFrame())));
}

TEST_F(QelMessageStreamRead, FillsTheFirstEightBytesThenTheRest)
{
    mStream.deliver(frameOf(100));
    mMessages.read();
    EXPECT_THAT(mStream.fills(), ElementsAre(8U, 92U));
    EXPECT_THAT(mStream.reads(), ElementsAre(8U, 92U));
}

TEST_F(QelMessageStreamRead, ReadsAFrameWithAnOldHeaderInAFillOf8AndOneOf32)
{
    mStream.deliver(oldFrame());
    const std::unique_ptr<QelMessage> message = mMessages.read();
    EXPECT_EQ(hexOf(*message), hex(oldFrame()));
    EXPECT_EQ(message->msgLength(), 40U);
    EXPECT_THAT(mStream.fills(), ElementsAre(8U, 32U));
    EXPECT_EQ(mStream.bytesRead(), 40U);
}

TEST_F(QelMessageStreamRead, ReadsNoByteOfTheNextFrame)
{
    Bytes both = frameOf(50);
    const Bytes second = frameOf(33);
    both.insert(both.end(), second.begin(), second.end());
    mStream.deliver(both).end();

    EXPECT_EQ(hexOf(*mMessages.read()), hex(frameOf(50)));
    EXPECT_EQ(mStream.bytesRead(), 50U);
    EXPECT_EQ(hexOf(*mMessages.read()), hex(second));
    EXPECT_EQ(mStream.bytesLeft(), 0U);
}

TEST_F(QelMessageStreamRead, ReadsAFrameThatArrivesByteByByte)
{
    mStream.deliverOneByOne(frameOf(100)).deliverOneByOne(oldFrame()).deliverOneByOne(frameOf(32));
    EXPECT_EQ(hexOf(*mMessages.read()), hex(frameOf(100)));
    EXPECT_THAT(mStream.fills(), ElementsAre(8U, 92U));
    EXPECT_THAT(mStream.reads(), SizeIs(100));
    EXPECT_EQ(hexOf(*mMessages.read()), hex(oldFrame()));
    EXPECT_EQ(hexOf(*mMessages.read()), hex(frameOf(32)));
}

TEST_F(QelMessageStreamRead, ReadsAFrameSplitInTwoAtEveryByte)
{
    const Bytes frame = frameOf(64);
    for (std::size_t cut = 1; cut < frame.size(); ++cut) {
        SCOPED_TRACE(cut);
        const auto border = frame.begin() + static_cast<Bytes::difference_type>(cut);
        mStream.deliver({frame.begin(), border}).deliver({border, frame.end()});
        EXPECT_EQ(hexOf(*mMessages.read()), hex(frame));
    }
}

TEST_F(QelMessageStreamRead, EndOfStreamAtEveryByteIsEOF)
{
    const Bytes frame = frameOf(64);
    for (std::size_t there = 0; there < frame.size(); ++there) { // 0: end between two frames, with the same text
        SCOPED_TRACE(there);
        ScriptedStream stream;
        if (there > 0) stream.deliver({frame.begin(), frame.begin() + static_cast<Bytes::difference_type>(there)});
        stream.end();
        QelMessageStream messages(stream, mRegistry);
        EXPECT_THAT([&] { messages.read(); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
        EXPECT_EQ(stream.bytesRead(), there);
    }
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(QelMessageStreamRead, FailureAtEveryBytePassesUnchangedAndNoPartIsKept)
{
    const Bytes frame = frameOf(64);
    for (const char* text : {"the cable is out", "I/O deadline"}) {
        for (std::size_t there = 0; there < frame.size(); ++there) {
            SCOPED_TRACE(std::string(text) + " after " + std::to_string(there));
            if (there > 0) mStream.deliver({frame.begin(), frame.begin() + static_cast<Bytes::difference_type>(there)});
            mStream.fail(text);
            const std::size_t readsBefore = mStream.reads().size();
            EXPECT_THAT([&] { mMessages.read(); }, ThrowsMessage<StreamIOException>(StrEq(text)));
            EXPECT_LE(mStream.reads().size() - readsBefore, 3U); // not retried

            // The next call starts with a new frame.
            mStream.deliver(frameOf(40));
            EXPECT_EQ(hexOf(*mMessages.read()), hex(frameOf(40)));
        }
    }
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(QelMessageStreamRead, NestedCauseOfTheStreamReachesTheCaller)
{
    class Failing : public Stream {
    public:
        void close() override {}
        void write(const char*, std::size_t) override {}
        std::size_t read(char*, std::size_t) override
        {
            try {
                throw std::out_of_range("the cause");
            } catch (...) {
                std::throw_with_nested(StreamIOException("the failure"));
            }
        }
    };
    Failing stream;
    QelMessageStream messages(stream, mRegistry);
    bool caught = false;
    try {
        messages.read();
    } catch (const StreamIOException& failure) {
        caught = true;
        EXPECT_STREQ(failure.what(), "the failure");
        EXPECT_THAT([&] { std::rethrow_if_nested(failure); }, ThrowsMessage<std::out_of_range>(StrEq("the cause")));
    }
    EXPECT_TRUE(caught);
}

TEST_F(QelMessageStreamRead, ReadsTheLongestFrame)
{
    mStream.deliver(frameOf(16384));
    const std::unique_ptr<QelMessage> message = mMessages.read();
    EXPECT_EQ(message->msgLength(), 16384U);
    EXPECT_EQ(hexOf(*message), hex(frameOf(16384)));
    EXPECT_THAT(mStream.fills(), ElementsAre(8U, 16376U));
}

TEST_F(QelMessageStreamRead, LengthsOutsideTheLimitsAreRefusedAfterEightBytes)
{
    struct Row {
        std::uint32_t length;
        const char* decimal;
    };
    const Row rows[] = {{0, "0"},
                        {1, "1"},
                        {2, "2"},
                        {3, "3"},
                        {4, "4"},
                        {5, "5"},
                        {6, "6"},
                        {7, "7"},
                        {8, "8"},
                        {16385, "16385"},
                        {65536, "65536"},
                        {0x7FFFFFFF, "2147483647"},
                        {0x80000000, "2147483648"},
                        {0xFFFFFFFF, "4294967295"}};
    for (const Row& row : rows) {
        SCOPED_TRACE(row.length);
        mLog.clear();
        ScriptedStream stream;
        stream.deliver(prefixOf(row.length)).deliver(Bytes(100, '\0'));
        QelMessageStream messages(stream, mRegistry);
        EXPECT_THAT([&] { messages.read(); }, ThrowsMessage<QelMessageValidationException>(StrEq("Invalid length")));
        EXPECT_EQ(stream.bytesRead(), 8U);
        EXPECT_THAT(stream.fills(), ElementsAre(8U));
        EXPECT_THAT(
            mLog.lines(),
            ElementsAre(std::string("E: QEL message stream cannot deserialize message: invalid message length ") +
                        row.decimal));
    }
}

TEST_F(QelMessageStreamRead, ChecksTheLengthBeforeTheFirstFourBytes)
{
    Bytes prefix(4, 'x');
    prefix.resize(8, '\0');
    mStream.deliver(prefix);
    EXPECT_THAT([&] { mMessages.read(); }, ThrowsMessage<QelMessageValidationException>(StrEq("Invalid length")));
    EXPECT_THAT(mLog.lines(),
                ElementsAre("E: QEL message stream cannot deserialize message: invalid message length 0"));
}

TEST_F(QelMessageStreamRead, RefusesABadEyecatcherAfterTheWholeFrameAndStaysInStep)
{
    Bytes bad = frameOf(40);
    bad[0] = 'x';
    mStream.deliver(bad).deliver(frameOf(50));
    EXPECT_THAT([&] { mMessages.read(); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer bad eyecatcher")));
    EXPECT_EQ(mStream.bytesRead(), 40U);
    EXPECT_EQ(hexOf(*mMessages.read()), hex(frameOf(50)));
}

TEST_F(QelMessageStreamRead, LengthsFrom9To21AreReadAndRefusedByTheRegistry)
{
    for (std::uint32_t length = 9; length <= 21; ++length) {
        SCOPED_TRACE(length);
        mLog.clear();
        ScriptedStream stream;
        stream.deliver(prefixOf(length)).deliver(Bytes(length - 8, '\0')).end();
        QelMessageStream messages(stream, mRegistry);
        EXPECT_THAT([&] { messages.read(); }, ThrowsMessage<QelMessageValidationException>(StrEq("length")));
        EXPECT_THAT(stream.fills(), ElementsAre(8U, length - 8));
        EXPECT_EQ(stream.bytesLeft(), 0U);
        EXPECT_THAT(mLog.lines(), ElementsAre("E: Encountered message with invalid length"));
    }
}

TEST_F(QelMessageStreamRead, Lengths22And23AreReadAndRefusedByTheFrameCheck)
{
    for (std::uint32_t length = 22; length <= 23; ++length) {
        SCOPED_TRACE(length);
        ScriptedStream stream;
        stream.deliver(prefixOf(length)).deliver(Bytes(length - 8, '\0')).end();
        QelMessageStream messages(stream, mRegistry);
        EXPECT_THAT([&] { messages.read(); },
                    ThrowsMessage<QelMessageValidationException>(StrEq("i_length shorter than old header")));
        EXPECT_EQ(stream.bytesLeft(), 0U);
    }
}

TEST_F(QelMessageStreamRead, OtherExceptionsOfAFactoryPassUnchanged)
{
    QelMessageRegistry registry{
        {QelMessageUpgradeConnectionAsync::getMessageID(),
         [](const char*, unsigned int) -> std::unique_ptr<QelMessage> { throw std::bad_alloc(); }}};
    mStream.deliver(upgradeFrame());
    QelMessageStream messages(mStream, registry);
    EXPECT_THROW(messages.read(), std::bad_alloc);
}

// A stream over one block of bytes that does not allocate.
class BlockStream : public Stream {
public:
    explicit BlockStream(const Bytes& block) : mBlock(block) {}
    void close() override {}
    std::size_t read(char* buffer, std::size_t length) override
    {
        std::memcpy(buffer, mBlock.data() + mOffset, length);
        mOffset += length;
        return length;
    }
    void write(const char*, std::size_t length) override { mWritten += length; }

    std::size_t mWritten = 0;

private:
    const Bytes& mBlock;
    std::size_t mOffset = 0;
};

TEST_F(QelMessageStreamRead, AllocatesTheObjectAndItsBytesOnly)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const Bytes plainFrame = frameOf(16384);
    const Bytes typedFrame = upgradeFrame();
    BlockStream plainStream(plainFrame);
    BlockStream typedStream(typedFrame);
    QelMessageStream plainMessages(plainStream, mRegistry);
    QelMessageStream typedMessages(typedStream, QelInternalMessageRegistry::getInstance());

    std::unique_ptr<QelMessage> plain;
    std::unique_ptr<QelMessage> typed;
    {
        const Allocations allocations;
        plain = plainMessages.read();
        EXPECT_EQ(allocations.count(), 2U);
    }
    {
        const Allocations allocations;
        typed = typedMessages.read();
        EXPECT_EQ(allocations.count(), 2U);
    }
    EXPECT_EQ(hexOf(*plain), hex(plainFrame));
    EXPECT_EQ(hexOf(*typed), hex(typedFrame));
}

TEST_F(QelMessageStreamWrite, IsExactlyOneCallWithTheWholeFrame)
{
    for (const Bytes& frame : {oldFrame(), frameOf(32), frameOf(100), frameOf(16384)}) {
        SCOPED_TRACE(frame.size());
        ScriptedStream stream;
        QelMessageStream messages(stream, mRegistry);
        const QelMessage message(frame.data(), static_cast<unsigned int>(frame.size()));
        messages.write(message);
        ASSERT_THAT(stream.writes(), SizeIs(1));
        EXPECT_EQ(hex(stream.writes()[0]), hex(frame));
        EXPECT_THAT(stream.reads(), IsEmpty());
    }
}

TEST_F(QelMessageStreamWrite, FramesFollowEachOtherBackToBack)
{
    const QelMessageUpgradeConnectionAsync first(1);
    const QelMessageUpgradeConnectionAsync second(2);
    mMessages.write(first);
    mMessages.write(second);
    EXPECT_THAT(mStream.writes(), SizeIs(2));
    EXPECT_EQ(hex(mStream.written()), hexOf(first) + hexOf(second));
}

TEST_F(QelMessageStreamWrite, DoesNotAllocate)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const Bytes nothing;
    BlockStream stream(nothing);
    QelMessageStream messages(stream, mRegistry);
    const QelMessageUpgradeConnectionAsync message(1);
    const Allocations allocations;
    messages.write(message);
    EXPECT_EQ(allocations.count(), 0U);
    EXPECT_EQ(stream.mWritten, 32U);
}

TEST_F(QelMessageStreamWrite, FailureAtEveryBytePassesUnchangedAndIsNotRetried)
{
    const Bytes frame = upgradeFrame();
    const QelMessage message(frame.data(), static_cast<unsigned int>(frame.size()));
    for (std::size_t position = 0; position < frame.size(); ++position) {
        SCOPED_TRACE(position);
        ScriptedStream stream;
        stream.failWriteAt(position, "the peer is gone");
        QelMessageStream messages(stream, mRegistry);
        EXPECT_THAT([&] { messages.write(message); }, ThrowsMessage<StreamIOException>(StrEq("the peer is gone")));
        EXPECT_THAT(stream.writes(), SizeIs(1));
        EXPECT_EQ(hex(stream.written()), hex(frame.data(), position));
    }
}

TEST_F(QelMessageStreamWrite, DoesNotLimitTheFrameWhichTheReceiverThenRefuses)
{
    for (const unsigned int payload : {16353U, 65535U}) {
        SCOPED_TRACE(payload);
        QelMessageGeneric tooLong;
        tooLong.setData(Bytes(payload, 'x').data(), payload);
        ScriptedStream sent;
        QelMessageStream(sent, mRegistry).write(tooLong);
        ASSERT_THAT(sent.writes(), SizeIs(1));
        EXPECT_EQ(sent.writes()[0].size(), payload + 32);

        ScriptedStream received;
        received.deliver(sent.writes()[0]);
        QelMessageStream messages(received, mRegistry);
        EXPECT_THAT([&] { messages.read(); }, ThrowsMessage<QelMessageValidationException>(StrEq("Invalid length")));
    }
}

TEST_F(QelMessageStreamTest, WhatWasWrittenIsReadBack)
{
    const QelMessageUpgradeConnectionAsync message;
    mMessages.write(message);
    mStream.deliver(mStream.written());
    EXPECT_EQ(hexOf(*mMessages.read()), hexOf(message));
}

TEST_F(QelMessageStreamTest, LeavesTheStreamOpenAndItsDeadlinesUnchanged)
{
    mStream.deliver(frameOf(40));
    {
        QelMessageStream messages(mStream, mRegistry);
        messages.read();
        messages.write(QelMessage());
    }
    EXPECT_EQ(mStream.closeCount(), 0U);
    EXPECT_THAT(mStream.readDeadlines(), IsEmpty());
    EXPECT_THAT(mStream.writeDeadlines(), IsEmpty());
}

TEST(QelMessageStreamHeader, IsTheFirstEightBytesOfAFrame)
{
    EXPECT_EQ(sizeof(QelMessageStream::MessageHeader), 8U);
    EXPECT_EQ(offsetof(QelMessageStream::MessageHeader, mReserved), 0U);
    EXPECT_EQ(offsetof(QelMessageStream::MessageHeader, mMsgLength), 4U);
    EXPECT_TRUE((std::is_nothrow_constructible<QelMessageStream, Stream&, QelMessageRegistry&>::value));
}

// One end of a pair of connected local sockets.
class PairEnd : public Stream {
public:
    explicit PairEnd(int fd) : mFd(fd) {}
    ~PairEnd() override { ::close(mFd); }
    void close() override { ::shutdown(mFd, SHUT_RDWR); }
    std::size_t read(char* buffer, std::size_t length) override
    {
        const ssize_t count = ::read(mFd, buffer, length);
        if (count < 0) throw StreamIOException("read");
        return static_cast<std::size_t>(count);
    }
    void write(const char* buffer, std::size_t length) override
    {
        while (length > 0) {
            const ssize_t count = ::send(mFd, buffer, length, MSG_NOSIGNAL);
            if (count < 0) throw StreamIOException("write");
            buffer += count;
            length -= static_cast<std::size_t>(count);
        }
    }

private:
    int mFd;
};

TEST(QelMessageStreamThreads, AReaderAndAWriterWorkAtOnceOnEachSide)
{
    int fds[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    PairEnd leftEnd(fds[0]);
    PairEnd rightEnd(fds[1]);
    QelMessageRegistry registry;
    QelMessageStream left(leftEnd, registry);
    QelMessageStream right(rightEnd, registry);
    constexpr unsigned int kMessages = 200;

    const auto sendAll = [](QelMessageStream& stream) {
        for (unsigned int id = 1; id <= kMessages; ++id) {
            QelMessageGeneric message(id, 0x7F01, 0x0102, qel::NoFlagSet);
            message.setData(Bytes(id * 50, static_cast<char>(id)).data(), id * 50);
            stream.write(message);
        }
    };
    const auto receiveAll = [](QelMessageStream& stream, unsigned int& good) {
        for (unsigned int id = 1; id <= kMessages; ++id) {
            const std::unique_ptr<QelMessage> message = stream.read();
            if (message->getCallerId() == id && message->dataLength() == id * 50) ++good;
        }
    };
    unsigned int leftGood = 0;
    unsigned int rightGood = 0;
    std::thread leftWriter([&] { sendAll(left); });
    std::thread rightWriter([&] { sendAll(right); });
    std::thread leftReader([&] { receiveAll(left, leftGood); });
    receiveAll(right, rightGood);
    leftReader.join();
    leftWriter.join();
    rightWriter.join();
    EXPECT_EQ(leftGood, kMessages);
    EXPECT_EQ(rightGood, kMessages);
}

} // namespace
