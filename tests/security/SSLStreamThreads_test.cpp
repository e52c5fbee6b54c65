// Two TLS streams, over a connection in memory and over TCP: closing from other threads, deadlines, readers and writers
// at the same time.

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "support/HookedStream.hpp"
#include "support/TlsKit.hpp"

#include <algorithm>
#include <chrono>
#include <functional>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using test::clientContext;
using test::connectStreams;
using test::elsewhere;
using test::encryptedLine;
using test::failsClosed;
using test::failureOf;
using test::handshakeLines;
using test::HookedStream;
using test::kEOF;
using test::kEOFInHandshake;
using test::kInvalidState;
using test::Lines;
using test::nameOf;
using test::Outcome;
using test::Outcomes;
using test::pattern;
using test::readSome;
using test::serverContext;
using test::StreamPair;
using test::TlsTest;
using test::Transport;
using test::writeText;
using ::testing::AnyOf;
using ::testing::Each;
using ::testing::IsEmpty;

// Two of our streams

class SSLStreamOver : public TlsTest, public ::testing::WithParamInterface<Transport> {
protected:
    void SetUp() override
    {
        StreamPair streams = connectStreams(GetParam());
        mClient = std::make_unique<SSLStream>(clientContext(),
                                              std::make_unique<HookedStream>(std::move(streams.client), mClientHooks));
        mServer = std::make_unique<SSLStream>(serverContext(),
                                              std::make_unique<HookedStream>(std::move(streams.server), mServerHooks));
    }

    void encrypt() { TlsTest::encrypt(*mClient, *mServer); }

    HookedStream::Hooks mClientHooks;
    HookedStream::Hooks mServerHooks;
    std::unique_ptr<SSLStream> mClient;
    std::unique_ptr<SSLStream> mServer;
};

INSTANTIATE_TEST_SUITE_P(Matrix, SSLStreamOver, ::testing::Values(Transport::Memory, Transport::Tcp),
                         [](const auto& row) { return nameOf(row.param); });

TEST_P(SSLStreamOver, AHandshakeEncryptsBothEnds)
{
    const Outcomes outcomes = shakeHands(*mClient, *mServer);
    EXPECT_EQ(outcomes.client.failure, "");
    EXPECT_EQ(outcomes.server.failure, "");
    EXPECT_EQ(outcomes.client.log, handshakeLines());
    EXPECT_EQ(outcomes.server.log, handshakeLines());
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_ENCRYPTED);
    EXPECT_EQ(mServer->getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_P(SSLStreamOver, ASecondHandshakeEndsTheConnection)
{
    for (const bool ofClient : {true, false}) {
        SCOPED_TRACE(ofClient ? "client" : "server");
        SetUp();
        encrypt();
        SSLStream& own = ofClient ? *mClient : *mServer;
        SSLStream& other = ofClient ? *mServer : *mClient;
        const Outcome outcome = here([&own] { own.handshake(); });
        EXPECT_EQ(outcome.failure, kInvalidState);
        EXPECT_THAT(outcome.log, IsEmpty());
        EXPECT_EQ(own.getStatus(), SSLStream::STATUS_CLOSED);
        EXPECT_EQ(readSome(other, 10), "");
        EXPECT_EQ(other.getStatus(), SSLStream::STATUS_ENCRYPTED);
    }
}

TEST_P(SSLStreamOver, ClosingFromAnotherThreadBeforeTheHandshake)
{
    elsewhere([this] { mClient->close(); });
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    const Outcome client = here([this] { mClient->handshake(); });
    EXPECT_EQ(client.failure, kInvalidState);
    EXPECT_THAT(client.log, IsEmpty());
    const Outcome server = here([this] { mServer->handshake(); });
    EXPECT_EQ(server.failure, kEOF);
    EXPECT_EQ(server.log, Lines{kEOFInHandshake});
    EXPECT_EQ(mServer->getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_P(SSLStreamOver, ClosingFromAnotherThreadWhileTheHandshakeReads)
{
    mClientHooks.beforeRead = [this] { elsewhere([this] { mClient->close(); }); };
    const Outcome outcome = here([this] { mClient->handshake(); });
    EXPECT_EQ(outcome.failure, kEOF);
    EXPECT_EQ(outcome.log, Lines{kEOFInHandshake});
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_P(SSLStreamOver, ClosingFromAnotherThreadWhileTheHandshakeWrites)
{
    mClientHooks.beforeWrite = [this] { elsewhere([this] { mClient->close(); }); };
    const Outcome outcome = here([this] { mClient->handshake(); });
    EXPECT_THAT(outcome.failure, failsClosed());
    EXPECT_THAT(outcome.log, IsEmpty());
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_P(SSLStreamOver, ClosingFromAnotherThreadWhileIdle)
{
    encrypt();
    elsewhere([this] { mClient->close(); });
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(readSome(*mServer, 1), "");
    elsewhere([this] { mClient->close(); });
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_P(SSLStreamOver, ClosingFromAnotherThreadWakesAReader)
{
    encrypt();
    std::promise<void> reading;
    mClientHooks.beforeRead = [&reading] { reading.set_value(); };
    auto reader =
        std::async(std::launch::async, [this] { return failureOf([this] { EXPECT_EQ(readSome(*mClient, 1), ""); }); });
    reading.get_future().wait();
    const Outcome closing = here([this] { mClient->close(); }); // does not wait for the reader
    EXPECT_EQ(closing.failure, "");
    EXPECT_THAT(closing.log, IsEmpty());
    EXPECT_EQ(reader.get(), "");
    EXPECT_EQ(readSome(*mServer, 1), "");
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { readSome(*mClient, 1); }).failure, kInvalidState);
}

TEST_P(SSLStreamOver, ClosingFromAnotherThreadWakesAWriter)
{
    encrypt();
    std::promise<void> writing;
    bool first = true;
    mClientHooks.beforeWrite = [&writing, &first] {
        if (std::exchange(first, false)) writing.set_value();
    };
    // The peer does not read, so the write blocks soon.
    auto writer =
        std::async(std::launch::async, [this] { return failureOf([this] { writeText(*mClient, pattern(8000000)); }); });
    writing.get_future().wait();
    mClient->close();
    EXPECT_THAT(writer.get(), failsClosed());
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { writeText(*mClient, "x"); }).failure, kInvalidState);
}

TEST_P(SSLStreamOver, ClosingFromAnotherThreadWakesReaderAndWriter)
{
    encrypt();
    std::promise<void> reading;
    std::promise<void> writing;
    bool first = true;
    mClientHooks.beforeRead = [&reading] { reading.set_value(); };
    mClientHooks.beforeWrite = [&writing, &first] {
        if (std::exchange(first, false)) writing.set_value();
    };
    auto reader =
        std::async(std::launch::async, [this] { return failureOf([this] { EXPECT_EQ(readSome(*mClient, 1), ""); }); });
    auto writer =
        std::async(std::launch::async, [this] { return failureOf([this] { writeText(*mClient, pattern(8000000)); }); });
    reading.get_future().wait();
    writing.get_future().wait();
    mClient->close();
    EXPECT_EQ(reader.get(), "");
    EXPECT_THAT(writer.get(), failsClosed());
}

TEST_P(SSLStreamOver, DestroyingAnEndWakesAPeerThatWrites)
{
    encrypt();
    std::promise<void> writing;
    bool first = true;
    mServerHooks.beforeWrite = [&writing, &first] {
        if (std::exchange(first, false)) writing.set_value();
    };
    auto writer =
        std::async(std::launch::async, [this] { return failureOf([this] { writeText(*mServer, pattern(8000000)); }); });
    writing.get_future().wait();
    mClient.reset();
    EXPECT_THAT(writer.get(), AnyOf("StreamIOException: memory stream: the peer has gone",
                                    "StreamIOException: socket stream send failure"));
    EXPECT_EQ(mServer->getStatus(), SSLStream::STATUS_CLOSED);
}

// Deadlines

auto passesReadDeadline()
{
    return AnyOf("StreamIOException: memory stream deadline", "StreamIOException: socket stream receive failure");
}

TEST_P(SSLStreamOver, AReadDeadlineEndsAHandshakeWithASilentPeer)
{
    mClient->setReadDeadline(milliseconds(0));
    const Outcome outcome = here([this] { mClient->handshake(); });
    EXPECT_THAT(outcome.failure, passesReadDeadline());
    EXPECT_THAT(outcome.log, IsEmpty());
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { mServer->handshake(); }).failure, kEOF);
}

TEST_P(SSLStreamOver, AReadDeadlineIsFatal)
{
    encrypt();
    mClient->setReadDeadline(milliseconds(20));
    const Outcome outcome = here([this] { readSome(*mClient, 1); });
    EXPECT_THAT(outcome.failure, passesReadDeadline());
    EXPECT_THAT(outcome.log, IsEmpty());
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { readSome(*mClient, 1); }).failure, kInvalidState);
    EXPECT_EQ(readSome(*mServer, 1), "");
}

TEST_P(SSLStreamOver, AWriteDeadlineIsFatal)
{
    encrypt();
    mClient->setWriteDeadline(milliseconds(20));
    const Outcome outcome = here([this] { writeText(*mClient, pattern(8000000)); });
    EXPECT_THAT(outcome.failure, AnyOf("StreamIOException: memory stream deadline", "StreamIOException: I/O deadline",
                                       "StreamIOException: socket stream send failure"));
    // Complete records may have been sent before; TLS itself logs nothing else.
    EXPECT_THAT(outcome.log, Each(encryptedLine(16384)));
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { writeText(*mClient, "x"); }).failure, kInvalidState);
}

// One reader and one writer at each end at the same time

constexpr std::size_t kLotsOfBytes = 24 * 1000 * 1000;
constexpr std::size_t kPeriod = 65521; // a prime, so that no length that matters is a multiple of it

/// Data with period kPeriod, twice: the bytes for position p begin at p % kPeriod.
const std::string& endlessData()
{
    static const std::string data = pattern(kPeriod) + pattern(kPeriod);
    return data;
}

void writeLots(SSLStream& stream, const std::vector<std::size_t>& lengths)
{
    std::size_t next = 0;
    for (std::size_t position = 0; position < kLotsOfBytes;) {
        const std::size_t length = std::min(lengths[next++ % lengths.size()], kLotsOfBytes - position);
        stream.write(endlessData().data() + position % kPeriod, length);
        position += length;
    }
}

void readLots(SSLStream& stream, const std::vector<std::size_t>& lengths)
{
    std::vector<char> buffer(*std::max_element(lengths.begin(), lengths.end()));
    std::size_t next = 0;
    for (std::size_t position = 0; position < kLotsOfBytes;) {
        const std::size_t room = std::min(lengths[next++ % lengths.size()], kLotsOfBytes - position);
        const std::size_t count = stream.read(buffer.data(), room);
        ASSERT_GT(count, 0U) << "at " << position;
        ASSERT_EQ(endlessData().compare(position % kPeriod, count, buffer.data(), count), 0) << "at " << position;
        position += count;
    }
}

TEST_P(SSLStreamOver, ReadersAndWritersWorkAtTheSameTime)
{
    encrypt();
    QelLogger::get().setLevel(LogLevel::Info);
    const auto start = [](const std::function<void()>& work) {
        return std::async(std::launch::async, [work] { return failureOf(work); });
    };
    auto clientWriter = start([this] { writeLots(*mClient, {1, 64, 1000, 8192, 16384, 40000}); });
    auto serverWriter = start([this] { writeLots(*mServer, {16384, 40000, 7, 20000}); });
    auto clientReader = start([this] { readLots(*mClient, {16384, 100, 60000, 8}); });
    auto serverReader = start([this] { readLots(*mServer, {8, 16376, 65000}); });
    EXPECT_EQ(clientWriter.get(), "");
    EXPECT_EQ(serverWriter.get(), "");
    EXPECT_EQ(clientReader.get(), "");
    EXPECT_EQ(serverReader.get(), "");
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_ENCRYPTED);
    EXPECT_EQ(mServer->getStatus(), SSLStream::STATUS_ENCRYPTED);
}

} // namespace
} // namespace qel
