// TLS streams over streams that deliver in pieces, stall, or break at any byte of the handshake.

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "support/CapturedLog.hpp"
#include "support/HookedStream.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/SettableClock.hpp"
#include "support/TlsKit.hpp"

#include <algorithm>
#include <chrono>
#include <exception>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <tuple>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using test::clientContext;
using test::failureOf;
using test::HookedStream;
using test::kEOF;
using test::MemoryStreamPair;
using test::nameOf;
using test::Outcome;
using test::Outcomes;
using test::pattern;
using test::readExactly;
using test::readSome;
using test::runEnds;
using test::serverContext;
using test::TlsTest;
using test::writeText;
using ::testing::AnyOf;

// Underlying streams that deliver slowly

class SSLStreamInPieces : public TlsTest, public ::testing::WithParamInterface<std::size_t> {};

INSTANTIATE_TEST_SUITE_P(Of, SSLStreamInPieces, ::testing::Values(1, 2, 3, 5, 23, 100, 8191),
                         ::testing::PrintToStringParamName());

TEST_P(SSLStreamInPieces, HandshakeAndDataArriveWhole)
{
    MemoryStreamPair memory(1 << 20);
    memory.client().deliverAtMost(GetParam());
    memory.server().deliverAtMost(GetParam());
    SSLStream client(clientContext(), memory.takeClient());
    SSLStream server(serverContext(), memory.takeServer());
    encrypt(client, server);
    for (const std::size_t length : {1U, 8U, 20000U}) {
        SCOPED_TRACE(length);
        writeText(client, pattern(length));
        EXPECT_EQ(readExactly(server, length), pattern(length));
        writeText(server, pattern(length));
        EXPECT_EQ(readExactly(client, length), pattern(length));
    }
}

class SSLStreamInMemory : public TlsTest {
protected:
    SSLStreamInMemory()
        : mMemory(1 << 20), mClient(clientContext(), mMemory.takeClient()),
          mServer(serverContext(), mMemory.takeServer())
    {}

    MemoryStreamPair mMemory;
    SSLStream mClient;
    SSLStream mServer;
};

TEST(SSLStreamRoom, RoomForTheVersionByteIsEnough)
{
    // Both ends send their version before they read the peer's, so the connection must have room for its record.
    constexpr std::size_t versionBytes = 23;
    const test::CapturedLog log;
    MemoryStreamPair memory(versionBytes);
    SSLStream client(clientContext(), memory.takeClient());
    SSLStream server(serverContext(), memory.takeServer());
    const Outcomes outcomes = runEnds(
        log,
        [&client] {
            client.handshake();
            writeText(client, pattern(20000));
            EXPECT_EQ(readExactly(client, 20000), pattern(20000));
        },
        [&server] {
            server.handshake();
            EXPECT_EQ(readExactly(server, 20000), pattern(20000));
            writeText(server, pattern(20000));
        });
    EXPECT_EQ(outcomes.client.failure, "");
    EXPECT_EQ(outcomes.server.failure, "");
}

TEST_F(SSLStreamInMemory, AStalledHandshakeContinuesWithTheStream)
{
    mMemory.client().stallReads();
    mMemory.server().stallWrites();
    auto client = std::async(std::launch::async, [this] { return failureOf([this] { mClient.handshake(); }); });
    auto server = std::async(std::launch::async, [this] { return failureOf([this] { mServer.handshake(); }); });
    mMemory.client().awaitReader();
    mMemory.server().awaitWriter();
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_UNENCRYPTED);
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_UNENCRYPTED);
    mMemory.server().resume();
    mMemory.server().awaitReader(); // it has sent everything
    mMemory.client().resume();
    EXPECT_EQ(client.get(), "");
    EXPECT_EQ(server.get(), "");
}

TEST_F(SSLStreamInMemory, AStalledHandshakeIsClosedFromAnotherThread)
{
    mMemory.client().stallReads();
    mMemory.server().stallWrites();
    auto client = std::async(std::launch::async, [this] { return failureOf([this] { mClient.handshake(); }); });
    auto server = std::async(std::launch::async, [this] { return failureOf([this] { mServer.handshake(); }); });
    mMemory.client().awaitReader();
    mMemory.server().awaitWriter();
    mServer.close();
    EXPECT_EQ(server.get(), "StreamIOException: memory stream closed");
    mClient.close();
    EXPECT_EQ(client.get(), kEOF);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(SSLStreamInMemory, AStalledHandshakeEndsWithTheDeadline)
{
    mMemory.client().stallReads();
    mClient.setReadDeadline(milliseconds(20));
    mMemory.server().stallWrites();
    mServer.setWriteDeadline(milliseconds(20));
    const Outcomes outcomes = shakeHands(mClient, mServer);
    EXPECT_EQ(outcomes.client.failure, "StreamIOException: memory stream deadline");
    EXPECT_THAT(outcomes.server.failure, AnyOf("StreamIOException: memory stream deadline", kEOF));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(SSLStreamInMemory, TheDeadlineCoversASlowHandshake)
{
    test::SettableClock clock;
    HookedStream::Hooks hooks;
    MemoryStreamPair memory;
    SSLStream server(serverContext(), std::make_unique<HookedStream>(memory.takeServer(), hooks));
    memory.server().deliver(std::string("\x16\x03\x01\x02\x00\x01\x00\x01\xFC\x03\x03", 11) + std::string(100, '\0'));
    memory.server().deliverAtMost(1);
    server.setReadDeadline(milliseconds(100));
    hooks.afterRead = [&clock] { clock.advance(milliseconds(10)); };
    const Outcome outcome = here([&server] { server.handshake(); });
    EXPECT_EQ(outcome.failure, "StreamIOException: I/O deadline");
    EXPECT_EQ(memory.server().bytesRead(), 11U); // the last one at the very deadline
    EXPECT_EQ(server.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(SSLStreamInMemory, StalledDataArrivesLater)
{
    encrypt(mClient, mServer);
    mMemory.server().stallReads();
    writeText(mClient, "hello");
    auto reader = std::async(std::launch::async, [this] { return readSome(mServer, 10); });
    mMemory.server().awaitReader();
    writeText(mServer, "meanwhile"); // the other direction continues
    EXPECT_EQ(readSome(mClient, 10), "meanwhile");
    mMemory.server().resume();
    EXPECT_EQ(reader.get(), "hello");
}

TEST_F(SSLStreamInMemory, ClosingWakesAReaderAndAWriterThatWait)
{
    encrypt(mClient, mServer);
    mMemory.client().stallWrites();
    auto reader =
        std::async(std::launch::async, [this] { return failureOf([this] { EXPECT_EQ(readSome(mClient, 1), ""); }); });
    auto writer = std::async(std::launch::async, [this] { return failureOf([this] { writeText(mClient, "x"); }); });
    mMemory.client().awaitReader();
    mMemory.client().awaitWriter();
    mClient.close();
    EXPECT_EQ(reader.get(), "");
    EXPECT_EQ(writer.get(), "StreamIOException: memory stream closed");
    EXPECT_EQ(mMemory.client().closeCount(), 2U); // by the test and by the failed writer
}

// Every byte of a handshake

enum class Fault { EndRead, FailRead, FailWrite };

std::string nameOf(Fault fault)
{
    if (fault == Fault::EndRead) return "EndRead";
    return fault == Fault::FailRead ? "FailRead" : "FailWrite";
}

/// Handshakes over connections that break at one byte, for each byte of a handshake.
class SSLStreamAtEveryByte : public TlsTest, public ::testing::WithParamInterface<std::tuple<bool, Fault>> {
protected:
    struct Ends {
        Ends() : client(clientContext(), memory.takeClient()), server(serverContext(), memory.takeServer()) {}
        MemoryStreamPair memory;
        SSLStream client;
        SSLStream server;
        std::string clientFailure;
        std::string serverFailure;
    };

    static bool ofClient() { return std::get<0>(GetParam()); }
    static Fault fault() { return std::get<1>(GetParam()); }
    static test::MemoryStreamEnd& faultyEnd(Ends& ends)
    {
        return ofClient() ? ends.memory.client() : ends.memory.server();
    }

    /// @return the number of bytes of a handshake in the direction of the fault
    std::size_t handshakeBytes()
    {
        Ends ends;
        encrypt(ends.client, ends.server);
        return fault() == Fault::FailWrite ? faultyEnd(ends).bytesWritten() : faultyEnd(ends).bytesRead();
    }

    static std::unique_ptr<Ends> brokenAt(std::size_t position)
    {
        auto ends = std::make_unique<Ends>();
        const auto failure = std::make_exception_ptr(StreamIOException("broken"));
        if (fault() == Fault::EndRead) faultyEnd(*ends).endReadAt(position);
        if (fault() == Fault::FailRead) faultyEnd(*ends).failReadAt(position, failure);
        if (fault() == Fault::FailWrite) faultyEnd(*ends).failWriteAt(position, failure);
        return ends;
    }

    static void check(const Ends& ends)
    {
        EXPECT_EQ(ofClient() ? ends.clientFailure : ends.serverFailure,
                  fault() == Fault::EndRead ? kEOF : "StreamIOException: broken");
        EXPECT_EQ((ofClient() ? ends.client : ends.server).getStatus(), SSLStream::STATUS_CLOSED);
        // The peer may have everything it needs by then.
        const std::string& other = ofClient() ? ends.serverFailure : ends.clientFailure;
        EXPECT_THAT(other, AnyOf("", kEOF));
        EXPECT_EQ((ofClient() ? ends.server : ends.client).getStatus(),
                  other.empty() ? SSLStream::STATUS_ENCRYPTED : SSLStream::STATUS_CLOSED);
    }
};

INSTANTIATE_TEST_SUITE_P(Of, SSLStreamAtEveryByte,
                         ::testing::Combine(::testing::Bool(),
                                            ::testing::Values(Fault::EndRead, Fault::FailRead, Fault::FailWrite)),
                         [](const auto& row) {
                             return std::string(std::get<0>(row.param) ? "Client" : "Server") +
                                    nameOf(std::get<1>(row.param));
                         });

TEST_P(SSLStreamAtEveryByte, TheHandshakeFailsCleanly)
{
    constexpr std::size_t batch = 64; // threads cost more than handshakes
    const std::size_t bytes = handshakeBytes();
    ASSERT_GT(bytes, 1000U);
    for (std::size_t first = 0; first < bytes; first += batch) {
        std::vector<std::unique_ptr<Ends>> all;
        for (std::size_t position = first; position < std::min(first + batch, bytes); ++position) {
            all.push_back(brokenAt(position));
        }
        runEnds(
            mLog,
            [&all] {
                for (auto& ends : all)
                    ends->clientFailure = failureOf([&ends] { ends->client.handshake(); });
            },
            [&all] {
                for (auto& ends : all)
                    ends->serverFailure = failureOf([&ends] { ends->server.handshake(); });
            });
        for (std::size_t i = 0; i < all.size(); ++i) {
            SCOPED_TRACE("at byte " + std::to_string(first + i));
            check(*all[i]);
        }
        if (HasFailure()) return;
        mLog.clear();
    }
}

} // namespace
} // namespace qel
