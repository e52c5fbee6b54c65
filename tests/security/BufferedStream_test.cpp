// A buffered stream over TLS: it reads ahead what is decrypted and nothing else, and gathers what is encrypted.

#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "support/Allocations.hpp"
#include "support/FrameTraffic.hpp"
#include "support/HookedStream.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/RawTlsPeer.hpp"
#include "support/TlsKit.hpp"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::Allocations;
using test::CapturedLog;
using test::clientContext;
using test::echoFrames;
using test::exchangeFrames;
using test::HookedStream;
using test::Identity;
using test::MemoryStreamPair;
using test::numberFromEnvironment;
using test::RandomFrames;
using test::randomOptions;
using test::RawTlsPeer;
using test::serverContext;
using ::testing::ElementsAre;
using ::testing::SizeIs;

constexpr std::size_t kPlenty = 1 << 20; // bytes in transit: no write in these tests waits for a reader

std::string readSome(Stream& stream, std::size_t length) { return test::readSome(stream, length); }

/// Two TLS streams of ours.
class BufferedStreamOverTls : public ::testing::Test {
protected:
    explicit BufferedStreamOverTls(std::size_t capacity = kPlenty)
        : mMemory(capacity), mClient(std::make_unique<SSLStream>(
                                 clientContext(), std::make_unique<HookedStream>(mMemory.takeClient(), mHooks))),
          mServer(std::make_unique<SSLStream>(serverContext(), mMemory.takeServer()))
    {
        const auto outcomes = test::runEnds(
            mLog, [this] { mClient->handshake(); }, [this] { mServer->handshake(); });
        EXPECT_EQ(outcomes.client.failure + outcomes.server.failure, "");
    }

    CapturedLog mLog{LogLevel::Error};
    HookedStream::Hooks mHooks;
    MemoryStreamPair mMemory;
    std::unique_ptr<SSLStream> mClient;
    std::unique_ptr<SSLStream> mServer;
};

TEST_F(BufferedStreamOverTls, ManyWritesAreOneRecord)
{
    BufferedStream stream(*mClient);
    mMemory.client().record();
    for (int i = 0; i < 100; ++i)
        stream.write("0123456789", 10);
    EXPECT_THAT(mMemory.client().writes(), SizeIs(0));
    stream.flush();
    EXPECT_THAT(mMemory.client().writes(), ElementsAre(1000 + 22U)); // the header, the type and the tag of a record
    EXPECT_EQ(readSome(*mServer, 2000).size(), 1000U);
}

TEST_F(BufferedStreamOverTls, ManyReadsAreOneReadOfTheConnection)
{
    BufferedStream stream(*mServer);
    test::writeText(*mClient, "0123456789");
    mMemory.server().record();
    for (char digit = '0'; digit <= '9'; ++digit) {
        EXPECT_EQ(readSome(stream, 1), std::string(1, digit));
        EXPECT_EQ(mServer->getReadableBytes(), 0U); // taken with the first
        EXPECT_EQ(stream.hasPending(), digit != '9');
    }
    EXPECT_THAT(mMemory.server().reads(), SizeIs(1));
}

TEST_F(BufferedStreamOverTls, ReadableBytesAreTheRestOfTheDecryptedRecord)
{
    EXPECT_EQ(mServer->getReadableBytes(), 0U);
    test::writeText(*mClient, "0123456789");
    test::writeText(*mClient, "abc");
    EXPECT_EQ(mServer->getReadableBytes(), 0U); // still encrypted
    EXPECT_EQ(readSome(*mServer, 4), "0123");
    EXPECT_EQ(mServer->getReadableBytes(), 6U);
    EXPECT_EQ(readSome(*mServer, 6), "456789");
    EXPECT_EQ(mServer->getReadableBytes(), 0U);
    EXPECT_TRUE(mServer->hasPending());
    EXPECT_EQ(readSome(*mServer, 1), "a");
    EXPECT_EQ(mServer->getReadableBytes(), 2U);
    mServer->close();
    EXPECT_EQ(mServer->getReadableBytes(), 0U);
}

TEST_F(BufferedStreamOverTls, HasPendingBytesThatAreStillEncrypted)
{
    BufferedStream stream(*mServer);
    test::writeText(*mClient, "ab");
    test::writeText(*mClient, "cd");
    EXPECT_FALSE(stream.hasPending());
    EXPECT_EQ(readSome(stream, 2), "ab");
    EXPECT_TRUE(stream.hasPending()); // arrived with the first record
    EXPECT_EQ(readSome(stream, 2), "cd");
    EXPECT_FALSE(stream.hasPending());
}

TEST_F(BufferedStreamOverTls, WithoutReadAheadTakesWhatTheCallerRequests)
{
    BufferedStreamOptions options;
    options.readAheadBytes = 0;
    BufferedStream stream(*mServer, options);
    test::writeText(*mClient, "0123456789");
    EXPECT_EQ(readSome(stream, 4), "0123");
    EXPECT_EQ(mServer->getReadableBytes(), 6U);
}

TEST_F(BufferedStreamOverTls, ACloseByAnotherThreadDuringAReadKeepsWhatTheReadGot)
{
    BufferedStream stream(*mClient);
    test::writeText(*mServer, "0123456789");
    mHooks.afterRead = [this] { test::elsewhere([this] { mClient->close(); }); };
    EXPECT_EQ(readSome(stream, 4), "0123");
    EXPECT_EQ(test::failureOf([&] { readSome(stream, 1); }), test::kInvalidState);
}

TEST_F(BufferedStreamOverTls, WhatWasReadAheadOutlivesTheConnection)
{
    BufferedStream stream(*mServer);
    test::writeText(*mClient, "0123456789");
    EXPECT_EQ(readSome(stream, 4), "0123");
    stream.close();
    EXPECT_EQ(readSome(stream, 100), "456789");
    EXPECT_EQ(test::failureOf([&] { readSome(stream, 1); }), test::kInvalidState);
    stream.write("gathered", 8);
    EXPECT_EQ(test::failureOf([&] { stream.flush(); }), test::kInvalidState);
}

// The end of TLS

/// How the peer ends right after its last data.
struct Ending {
    const char* name;
    void (*end)(RawTlsPeer& peer);
};

void PrintTo(const Ending& ending, std::ostream* os) { *os << ending.name; }

class BufferedStreamAtTheEndOfTls : public ::testing::TestWithParam<Ending> {
protected:
    /// @return the frames that a reader gets when the peer sends `records` and ends, a line each, and the failure
    std::string storyOf(const std::vector<std::string>& records, bool buffered) const
    {
        MemoryStreamPair memory(kPlenty);
        SSLStream server(serverContext(), memory.takeServer());
        RawTlsPeer::Options options;
        options.credentials = &test::credentialsOf(Identity::Client);
        RawTlsPeer peer(RawTlsPeer::Client, options, memory.takeClient());
        const auto outcomes = test::runEnds(
            mLog, [&] { peer.handshake(), peer.exchangeVersions(); }, [&] { server.handshake(); });
        EXPECT_EQ(outcomes.server.failure, "");

        // All of it has arrived before this end reads.
        for (const std::string& record : records)
            peer.write(record);
        GetParam().end(peer);
        BufferedStream over(server);
        return framesOf(buffered ? static_cast<Stream&>(over) : server);
    }

    static std::string framesOf(Stream& stream)
    {
        QelMessageRegistry registry;
        QelMessageStream messages(stream, registry);
        std::string story;
        const std::string failure = test::failureOf([&] {
            for (;;) {
                const std::unique_ptr<QelMessage> message = messages.read();
                story += std::string(message->serialize(), message->msgLength()) + '\n';
            }
        });
        return story + failure;
    }

    CapturedLog mLog{LogLevel::Error};
};

INSTANTIATE_TEST_SUITE_P(By, BufferedStreamAtTheEndOfTls,
                         ::testing::Values(Ending{"CloseNotify", [](RawTlsPeer& peer) { peer.closeNotify(); }},
                                           Ending{"InvalidRecord",
                                                  [](RawTlsPeer& peer) { peer.sendBytes("no record of TLS"); }},
                                           Ending{"Cut", [](RawTlsPeer& peer) { peer.stream().close(); }}),
                         [](const auto& row) { return row.param.name; });

TEST_P(BufferedStreamAtTheEndOfTls, FramesThatArriveTogetherWithItAreDelivered)
{
    RandomFrames random(1);
    const std::string first = random.next();
    const std::string second = random.next();
    const std::string expected = first + '\n' + second + '\n';
    for (const auto& records : {std::vector<std::string>{first + second}, std::vector<std::string>{first, second}}) {
        const std::string story = storyOf(records, true);
        EXPECT_EQ(story.substr(0, expected.size()), expected);
        EXPECT_EQ(story, storyOf(records, false));
    }
}

TEST_P(BufferedStreamAtTheEndOfTls, InsideAFrameIsWhatItIsWithoutBuffer)
{
    RandomFrames random(1);
    const std::string first = random.next();
    const std::string second = random.next();
    for (const std::size_t cut : {std::size_t(1), std::size_t(7), std::size_t(8), std::size_t(9), second.size() - 1}) {
        SCOPED_TRACE(cut);
        const std::vector<std::string> records = {first + second.substr(0, cut)};
        const std::string story = storyOf(records, true);
        EXPECT_EQ(story.substr(0, first.size()), first);
        EXPECT_EQ(story, storyOf(records, false));
    }
}

// Random frames

constexpr std::size_t kRounds = 6;

class BufferedStreamTlsSweep : public BufferedStreamOverTls, public ::testing::WithParamInterface<std::uint32_t> {
protected:
    BufferedStreamTlsSweep() : BufferedStreamOverTls(20000 + 10000 * GetParam())
    {
        mMemory.client().deliverAtMost(1 + mRandom.below(20000));
        mMemory.server().deliverAtMost(1 + mRandom.below(20000));
    }

    const std::uint32_t mSeed =
        static_cast<std::uint32_t>(numberFromEnvironment("QEL_TEST_SEED", 1)) * 1000 + GetParam();
    const std::size_t mFrames = numberFromEnvironment("QEL_TEST_FRAMES", 3000) / kRounds / 2;
    RandomFrames mRandom{mSeed};
};

INSTANTIATE_TEST_SUITE_P(Rounds, BufferedStreamTlsSweep, ::testing::Range(0U, static_cast<std::uint32_t>(kRounds)));

TEST_P(BufferedStreamTlsSweep, LosesAndAltersNothingInBothDirectionsAtOnce)
{
    BufferedStream client(std::move(mClient), randomOptions(mRandom));
    BufferedStream server(std::move(mServer), randomOptions(mRandom));
    EXPECT_EQ(exchangeFrames(client, server, mSeed, mFrames), "");
}

class BufferedStreamTlsEcho : public BufferedStreamOverTls {};

TEST_F(BufferedStreamTlsEcho, OneThreadAtEachEndNeedsNoFlush)
{
    BufferedStreamOptions options;
    options.flushBeforeRead = true;
    BufferedStream client(std::move(mClient), options);
    BufferedStream server(std::move(mServer), options);
    EXPECT_EQ(echoFrames(client, server, 1, 500), "");
}

} // namespace
} // namespace qel
