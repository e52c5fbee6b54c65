// Frames through buffered streams in memory: random ones, and connections that end or break at any byte.

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "support/CapturedLog.hpp"
#include "support/FrameTraffic.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/SettableClock.hpp"

#include <chrono>
#include <cstddef>
#include <exception>
#include <functional>
#include <future>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <utility>
#include <vector>

using qel::BufferedStream;
using qel::BufferedStreamOptions;
using qel::Stream;
using qel::StreamIOException;
using qel::test::CapturedLog;
using qel::test::echoFrames;
using qel::test::exchangeFrames;
using qel::test::MemoryStreamEnd;
using qel::test::MemoryStreamPair;
using qel::test::numberFromEnvironment;
using qel::test::RandomFrames;
using qel::test::randomOptions;
using std::chrono::milliseconds;

namespace {

constexpr std::size_t kRounds = 8;

/// The seed of each round.
class BufferedStreamSweep : public testing::TestWithParam<std::uint32_t> {
protected:
    BufferedStreamSweep()
        : mSeed(static_cast<std::uint32_t>(numberFromEnvironment("QEL_TEST_SEED", 1)) * 1000 + GetParam()),
          mRandom(mSeed), mFrames(numberFromEnvironment("QEL_TEST_FRAMES", 4000) / kRounds / 2),
          mMemory(1 + mRandom.below(100000))
    {
        mMemory.client().deliverAtMost(1 + mRandom.below(20000));
        mMemory.server().deliverAtMost(1 + mRandom.below(20000));
    }

    const std::uint32_t mSeed;
    RandomFrames mRandom;
    const std::size_t mFrames;
    MemoryStreamPair mMemory;
};

INSTANTIATE_TEST_SUITE_P(Rounds, BufferedStreamSweep, testing::Range(0U, static_cast<std::uint32_t>(kRounds)));

TEST_P(BufferedStreamSweep, LosesAndAltersNothingInBothDirectionsAtOnce)
{
    BufferedStream client(mMemory.takeClient(), randomOptions(mRandom));
    BufferedStream server(mMemory.takeServer(), randomOptions(mRandom));
    EXPECT_EQ(exchangeFrames(client, server, mSeed, mFrames), "");
}

TEST_P(BufferedStreamSweep, OneThreadAtEachEndNeedsNoFlush)
{
    // Bursts must fit between the ends: each end writes all of one before it reads.
    MemoryStreamPair memory(1 << 19);
    BufferedStreamOptions options = randomOptions(mRandom);
    options.flushBeforeRead = true;
    BufferedStream client(memory.takeClient(), options);
    BufferedStream server(memory.takeServer(), options);
    EXPECT_EQ(echoFrames(client, server, mSeed, mFrames / 2), "");
}

// At every byte

const std::vector<std::size_t>& bufferSizes()
{
    static const std::vector<std::size_t> sSizes = {0, 1, 8, 31, 32, 33, 64, 100, 16384};
    return sSizes;
}

/// Three frames with little in them, and all their bytes.
struct ThreeFrames {
    ThreeFrames()
    {
        RandomFrames random(4711);
        while (frames.size() < 3) {
            const std::string frame = random.next();
            if (frame.size() > 80) continue;
            frames.push_back(frame);
            bytes += frame;
        }
    }

    std::vector<std::string> frames;
    std::string bytes;
};

/// What a reader of frames gets: a line for each, the failure last.
std::string storyOf(Stream& stream, const std::function<void(std::size_t)>& afterFrame = nullptr)
{
    qel::QelMessageRegistry registry;
    qel::QelMessageStream messages(stream, registry);
    std::string story;
    try {
        for (std::size_t count = 1;; ++count) {
            const std::unique_ptr<qel::QelMessage> message = messages.read();
            story += std::string(message->serialize(), message->msgLength()) + '\n';
            if (afterFrame) afterFrame(count);
        }
    } catch (const std::exception& e) {
        return story + e.what();
    }
}

/// Something that happens to a connection at some byte.
struct Event {
    const char* name;
    std::function<void(MemoryStreamEnd&, Stream&, std::size_t, const std::string&)> happen;
};

std::vector<Event> readEvents()
{
    const auto failure = std::make_exception_ptr(StreamIOException("the cable is out"));
    return {
        {"end", [](auto& end, auto&, std::size_t at, const auto& bytes) { end.endReadAt(at), end.deliver(bytes); }},
        {"error", [failure](auto& end, auto&, std::size_t at,
                            const auto& bytes) { end.failReadAt(at, failure), end.deliver(bytes); }},
        {"deadline",
         [](auto& end, Stream& stream, std::size_t at, const auto& bytes) {
             end.deliver(bytes.substr(0, at)), stream.setReadDeadline(milliseconds(0));
         }},
        {"close", [](auto& end, Stream& stream, std::size_t at,
                     const auto& bytes) { end.deliver(bytes.substr(0, at)), stream.close(); }},
    };
}

TEST(BufferedStreamAtEveryByte, AReaderGetsTheSameAsWithoutBuffer)
{
    const qel::test::SettableClock clock; // stands still: what has arrived is in time, what has not is not
    const CapturedLog log;
    const ThreeFrames three;
    for (const Event& event : readEvents()) {
        for (std::size_t at = 0; at <= three.bytes.size(); ++at) {
            MemoryStreamPair plain;
            const auto unbuffered = plain.takeClient();
            const auto peer = plain.takeServer();
            event.happen(plain.client(), *unbuffered, at, three.bytes);
            const std::string expected = storyOf(*unbuffered);
            for (const std::size_t size : bufferSizes()) {
                SCOPED_TRACE(std::string(event.name) + " at " + std::to_string(at) + ", " + std::to_string(size));
                MemoryStreamPair memory;
                const auto other = memory.takeServer();
                BufferedStreamOptions options;
                options.readAheadBytes = size;
                BufferedStream stream(memory.takeClient(), options);
                stream.write("gathered", 8);
                event.happen(memory.client(), stream, at, three.bytes);
                ASSERT_EQ(storyOf(stream), expected);
            }
        }
    }
}

TEST(BufferedStreamAtEveryByte, ACloseWhileBytesWaitInTheBufferLosesNoneOfThem)
{
    const CapturedLog log;
    const ThreeFrames three;
    std::string whole;
    for (const std::string& frame : three.frames)
        whole += frame + '\n';
    for (std::size_t after = 1; after <= 3; ++after) {
        for (const std::size_t size : bufferSizes()) {
            SCOPED_TRACE(std::to_string(after) + ", " + std::to_string(size));
            MemoryStreamPair memory;
            const auto peer = memory.takeServer();
            memory.client().deliver(three.bytes);
            BufferedStreamOptions options;
            options.readAheadBytes = size;
            BufferedStream stream(memory.takeClient(), options);
            const auto closeThen = [&](std::size_t count) {
                if (count == after) stream.close();
            };
            EXPECT_EQ(storyOf(stream, closeThen), whole + "EOF");
        }
    }
}

/// Writes the frames and flushes. @return how many writes and flushes failed, with the text of the first failure
std::string writeAll(BufferedStream& stream, const std::vector<std::string>& frames)
{
    for (const std::string& frame : frames) {
        try {
            stream.write(frame.data(), frame.size());
        } catch (const StreamIOException& e) {
            return e.what();
        }
    }
    try {
        stream.flush();
    } catch (const StreamIOException& e) {
        return e.what();
    }
    return "";
}

TEST(BufferedStreamAtEveryByte, AWriterThatFailsHasSentTheBytesBeforeAndNothingElse)
{
    const ThreeFrames three;
    for (std::size_t at = 0; at <= three.bytes.size(); ++at) {
        for (const std::size_t size : bufferSizes()) {
            SCOPED_TRACE(std::to_string(at) + ", " + std::to_string(size));
            MemoryStreamPair memory;
            const auto peer = memory.takeServer();
            memory.client().failWriteAt(at, std::make_exception_ptr(StreamIOException("the cable is out")));
            memory.client().deliver("read ahead");
            BufferedStreamOptions options;
            options.gatherBytes = size;
            BufferedStream stream(memory.takeClient(), options);
            char first = '?';
            EXPECT_EQ(stream.read(&first, 1), 1U);

            EXPECT_EQ(writeAll(stream, three.frames), at == three.bytes.size() ? "" : "the cable is out");
            EXPECT_EQ(memory.client().bytesWritten(), at);
            EXPECT_EQ(memory.server().bytesLeft(), at);
            EXPECT_NO_THROW(stream.flush()); // nothing is sent twice
            std::string arrived(at, '?');
            peer->fill(arrived.data(), at);
            EXPECT_EQ(arrived, three.bytes.substr(0, at));

            std::string ahead(9, '?');
            stream.fill(ahead.data(), ahead.size());
            EXPECT_EQ(first + ahead, "read ahead");
        }
    }
}

TEST(BufferedStreamAtEveryByte, AWriteDeadlineThatPassesHasSentTheBytesBeforeAndNothingElse)
{
    const qel::test::SettableClock clock;
    const ThreeFrames three;
    for (std::size_t at = 1; at <= three.bytes.size(); ++at) {
        for (const std::size_t size : bufferSizes()) {
            SCOPED_TRACE(std::to_string(at) + ", " + std::to_string(size));
            MemoryStreamPair memory(at); // the peer does not read
            const auto peer = memory.takeServer();
            BufferedStreamOptions options;
            options.gatherBytes = size;
            BufferedStream stream(memory.takeClient(), options);
            stream.setWriteDeadline(milliseconds(0));
            EXPECT_EQ(writeAll(stream, three.frames), at == three.bytes.size() ? "" : "memory stream deadline");
            std::string arrived(at, '?');
            peer->fill(arrived.data(), at);
            EXPECT_EQ(arrived, three.bytes.substr(0, at));
            EXPECT_NO_THROW(stream.flush());
            EXPECT_EQ(memory.server().bytesLeft(), 0U);
        }
    }
}

// A peer that stops

TEST(BufferedStreamWaiting, AWriterThatWaitsForThePeerDoesNotStopTheReaderAndEndsWithClose)
{
    const ThreeFrames three;
    MemoryStreamPair memory(50);
    const auto peer = memory.takeServer();
    BufferedStream stream(memory.takeClient());
    auto writer = std::async(std::launch::async, [&] { return writeAll(stream, three.frames); });
    memory.client().awaitWriter();

    memory.client().deliver("still here");
    std::string text(10, '?');
    stream.fill(text.data(), text.size());
    EXPECT_EQ(text, "still here");

    stream.close();
    EXPECT_EQ(writer.get(), "memory stream closed");
}

TEST(BufferedStreamWaiting, AReaderThatWaitsDoesNotStopTheWriterAndEndsWithClose)
{
    const ThreeFrames three;
    MemoryStreamPair memory;
    const auto peer = memory.takeServer();
    BufferedStream stream(memory.takeClient());
    auto reader = std::async(std::launch::async, [&] { return storyOf(stream); });
    memory.client().awaitReader();

    EXPECT_EQ(writeAll(stream, three.frames), "");
    std::string arrived(three.bytes.size(), '?');
    peer->fill(arrived.data(), arrived.size());
    EXPECT_EQ(arrived, three.bytes);

    stream.close();
    EXPECT_EQ(reader.get(), "EOF");
}

TEST(BufferedStreamWaiting, AWriterGoesOnWhenThePeerReadsAgain)
{
    const ThreeFrames three;
    MemoryStreamPair memory(50);
    const auto peer = memory.takeServer();
    BufferedStream stream(memory.takeClient());
    auto writer = std::async(std::launch::async, [&] { return writeAll(stream, three.frames); });
    memory.client().awaitWriter();
    std::string arrived(three.bytes.size(), '?');
    peer->fill(arrived.data(), arrived.size());
    EXPECT_EQ(writer.get(), "");
    EXPECT_EQ(arrived, three.bytes);
}

} // namespace
