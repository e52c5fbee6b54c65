// TLS streams over a connection in memory: construction, handshake, states and data.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "security/StreamKit.hpp"
#include "support/Allocations.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/TlsCalls.hpp"
#include "support/TlsKit.hpp"

#include <atomic>
#include <climits>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::clientContext;
using test::decryptedLine;
using test::encryptedLine;
using test::EncryptedPair;
using test::failureOf;
using test::foreignFailure;
using test::handshakeLines;
using test::Identity;
using test::kInvalidState;
using test::kLibssl;
using test::kSSLError1;
using test::MemoryStreamPair;
using test::Outcome;
using test::Outcomes;
using test::pattern;
using test::readExactly;
using test::readSome;
using test::serverContext;
using test::spoilErrorQueue;
using test::SSLStreamPair;
using test::SSLStreamTest;
using test::TlsCalls;
using test::writeText;
using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Le;
using ::testing::MatchesRegex;
using ::testing::Not;

static_assert(std::is_base_of<Stream, SSLStream>::value, "");
static_assert(!std::is_copy_constructible<SSLStream>::value && !std::is_move_constructible<SSLStream>::value, "");
static_assert(std::is_same<std::underlying_type_t<SSLStream::Status>, unsigned int>::value, "");
static_assert(std::is_same<std::underlying_type_t<SSLStream::ProtocolVersion>, unsigned int>::value, "");
static_assert(sizeof(unsigned int) == 4, "");
static_assert(SSLStream::STATUS_UNENCRYPTED == 0, "");
static_assert(SSLStream::STATUS_ENCRYPTED == 1, "");
static_assert(SSLStream::STATUS_CLOSED == 2, "");
static_assert(SSLStream::PROTOCOL_VERSION_0 == 0, "");
static_assert(noexcept(std::declval<SSLStream&>().close()), "");

// Construction

TEST_F(SSLStreamPair, StartsUnencryptedAndSendsNothing)
{
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_UNENCRYPTED);
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_UNENCRYPTED);
    EXPECT_EQ(mMemory.client().bytesWritten(), 0U);
    EXPECT_EQ(mMemory.server().bytesWritten(), 0U);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(SSLStreamTest, OwnsTheUnderlyingStream)
{
    MemoryStreamPair memory;
    std::unique_ptr<Stream> stream = std::make_unique<SSLStream>(clientContext(), memory.takeClient());
    EXPECT_FALSE(memory.client().destroyed());
    stream.reset(); // through its base
    EXPECT_TRUE(memory.client().destroyed());
    EXPECT_EQ(memory.client().closeCount(), 0U);
}

TEST_F(SSLStreamTest, OutlivesItsContext)
{
    MemoryStreamPair memory;
    auto context = std::make_unique<SSLClientContext>();
    context->setCredentials(test::credentialsOf(Identity::Client));
    SSLStream client(*context, memory.takeClient());
    context.reset();
    SSLStream server(serverContext(), memory.takeServer());
    encrypt(client, server);
}

TEST_F(SSLStreamTest, ManyThreadsShakeHandsWithTheSameContexts)
{
    constexpr int threads = 4;
    constexpr int rounds = 5;
    SSLClientContext& clientSide = clientContext();
    SSLServerContext& serverSide = serverContext();
    std::atomic<int> done{0};
    const auto shakeMany = [&] {
        for (int round = 0; round < rounds; ++round) {
            MemoryStreamPair memory;
            SSLStream client(clientSide, memory.takeClient());
            SSLStream server(serverSide, memory.takeServer());
            std::thread other([&server] { EXPECT_EQ(failureOf([&server] { server.handshake(); }), ""); });
            EXPECT_EQ(failureOf([&client] { client.handshake(); }), "");
            other.join();
            if (server.getStatus() == SSLStream::STATUS_ENCRYPTED) ++done;
        }
    };
    std::vector<std::thread> all;
    for (int i = 0; i < threads; ++i)
        all.emplace_back(shakeMany);
    for (std::thread& thread : all)
        thread.join();
    EXPECT_EQ(done, threads * rounds);
}

TEST_F(SSLStreamTest, ConstructionFailsWithoutBuffers)
{
    MemoryStreamPair memory;
    TlsCalls calls;
    calls.BIO_new_bio_pair = [](BIO** first, std::size_t firstBytes, BIO** second, std::size_t secondBytes) {
        EXPECT_EQ(firstBytes, 8192U);
        EXPECT_EQ(secondBytes, 8192U);
        *first = nullptr;
        *second = nullptr;
        spoilErrorQueue();
        return 0;
    };
    const Outcome outcome = here([&memory] { SSLStream(clientContext(), memory.takeClient()); });
    EXPECT_THAT(outcome.failure,
                MatchesRegex("SSLException: An SSL error occurred at .*common/security/SSLStream.cpp:[0-9]+"));
    EXPECT_THAT(outcome.log, ElementsAre(kLibssl));
    EXPECT_TRUE(memory.client().destroyed());
}

// The handshake

TEST_F(SSLStreamPair, AHandshakeEncryptsBothEnds)
{
    const Outcomes outcomes = shakeHands(mClient, mServer);
    EXPECT_EQ(outcomes.client.failure, "");
    EXPECT_EQ(outcomes.server.failure, "");
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_ENCRYPTED);
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_ENCRYPTED);
    EXPECT_THAT(outcomes.client.log, ElementsAreArray(handshakeLines()));
    EXPECT_THAT(outcomes.server.log, ElementsAreArray(handshakeLines()));
    EXPECT_EQ(mMemory.client().closeCount(), 0U);
    EXPECT_EQ(mMemory.server().closeCount(), 0U);
}

TEST_F(SSLStreamPair, TheVersionByteIsARecordOfItsOwn)
{
    mMemory.client().record();
    mMemory.server().record();
    encrypt();
    // 5 bytes of header, 1 of data, 1 for the type, 16 of tag.
    EXPECT_EQ(mMemory.client().writes().back(), 23U);
    EXPECT_EQ(mMemory.server().writes().back(), 23U);
}

TEST_F(SSLStreamPair, NoTransferIsLongerThan8192Bytes)
{
    mMemory.client().record();
    mMemory.server().record();
    encrypt();
    writeText(mClient, pattern(100000));
    EXPECT_EQ(readExactly(mServer, 100000), pattern(100000));
    EXPECT_THAT(mMemory.client().writes(), Each(Le(8192U)));
    EXPECT_THAT(mMemory.server().reads(), Each(Le(8192U)));
    EXPECT_THAT(mMemory.server().reads(), Contains(8192U));
}

TEST_F(SSLStreamPair, TheHandshakeOfAClosedStreamIsRefused)
{
    mClient.close();
    const Outcome outcome = here([this] { mClient.handshake(); });
    EXPECT_EQ(outcome.failure, kInvalidState);
    EXPECT_THAT(outcome.log, IsEmpty());
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().bytesWritten(), 0U);
}

TEST_F(EncryptedPair, ASecondHandshakeEndsTheConnection)
{
    const Outcome outcome = here([this] { mClient.handshake(); });
    EXPECT_EQ(outcome.failure, kInvalidState);
    EXPECT_THAT(outcome.log, IsEmpty());
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_GE(mMemory.client().closeCount(), 1U);
    EXPECT_EQ(readSome(mServer, 10), "");
}

// States

TEST_F(SSLStreamPair, RefusesReadAndWriteBeforeTheHandshake)
{
    char byte = 0;
    EXPECT_EQ(here([&] { mClient.read(&byte, 1); }).failure, kInvalidState);
    EXPECT_EQ(here([&] { mClient.read(&byte, 0); }).failure, kInvalidState);
    EXPECT_EQ(here([&] { mClient.write(&byte, 1); }).failure, kInvalidState);
    EXPECT_EQ(here([&] { mClient.write(&byte, 0); }).failure, kInvalidState);
    EXPECT_THAT(mLog.lines(), IsEmpty());
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_UNENCRYPTED);
    EXPECT_EQ(mMemory.client().closeCount(), 0U);
    encrypt();
}

TEST_F(EncryptedPair, RefusesReadAndWriteAfterTheClose)
{
    const std::size_t sent = mMemory.client().bytesWritten();
    mClient.close();
    char byte = 0;
    EXPECT_EQ(here([&] { mClient.read(&byte, 1); }).failure, kInvalidState);
    EXPECT_EQ(here([&] { mClient.read(&byte, 0); }).failure, kInvalidState);
    EXPECT_EQ(here([&] { mClient.write(&byte, 1); }).failure, kInvalidState);
    EXPECT_EQ(here([&] { mClient.write(&byte, 0); }).failure, kInvalidState);
    EXPECT_EQ(here([&] { mClient.handshake(); }).failure, kInvalidState);
    EXPECT_EQ(mMemory.client().bytesWritten(), sent);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(EncryptedPair, ClosingSendsNoAlert)
{
    const std::size_t sent = mMemory.client().bytesWritten();
    const Outcome outcome = here([this] { mClient.close(); });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_THAT(outcome.log, IsEmpty());
    EXPECT_EQ(mMemory.client().bytesWritten(), sent);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
    EXPECT_EQ(readSome(mServer, 1), "");
}

TEST_F(SSLStreamPair, ClosingTwiceIsHarmless)
{
    mClient.close();
    mClient.close();
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(SSLStreamPair, CloseDropsExceptionsOfTheUnderlyingStream)
{
    mMemory.client().failClose(foreignFailure());
    mClient.close();
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
}

TEST_F(SSLStreamTest, DestroyingOneEndEndsTheStreamOfThePeer)
{
    MemoryStreamPair memory;
    SSLStream server(serverContext(), memory.takeServer());
    {
        SSLStream client(clientContext(), memory.takeClient());
        encrypt(client, server);
    }
    EXPECT_EQ(readSome(server, 1), "");
    EXPECT_EQ(here([&server] { writeText(server, "x"); }).failure,
              "StreamIOException: memory stream: the peer has gone");
    EXPECT_EQ(server.getStatus(), SSLStream::STATUS_CLOSED);
}

// Data

TEST_F(EncryptedPair, CarriesDataBothWays)
{
    for (const std::size_t length : {1U, 2U, 8U, 4096U, 8169U, 8170U, 8171U, 16383U, 16384U, 16385U, 100000U}) {
        SCOPED_TRACE(length);
        const std::string data = pattern(length);
        writeText(mClient, data);
        EXPECT_EQ(readExactly(mServer, length), data);
        writeText(mServer, data);
        EXPECT_EQ(readExactly(mClient, length), data);
    }
    EXPECT_EQ(mMemory.client().bytesLeft(), 0U);
    EXPECT_EQ(mMemory.server().bytesLeft(), 0U);
}

TEST_F(EncryptedPair, TheUnderlyingStreamCarriesNoPlaintext)
{
    mMemory.client().record();
    const std::string secret = "a secret that must stay hidden!";
    writeText(mClient, secret);
    EXPECT_THAT(mMemory.client().written(), Not(HasSubstr(secret.substr(0, 8))));
    EXPECT_THAT(mMemory.client().written(), Not(HasSubstr(secret.substr(16, 8))));
}

TEST_F(EncryptedPair, CarriesFrames)
{
    QelInternalMessageRegistry registry;
    QelMessageStream sender(mClient, registry);
    QelMessageStream receiver(mServer, registry);
    const QelMessageUpgradeConnectionAsync notice(0x01020304U);
    mMemory.server().record();
    sender.write(notice);
    const std::unique_ptr<QelMessage> received = receiver.read();
    ASSERT_EQ(received->msgLength(), notice.msgLength());
    EXPECT_EQ(std::string(received->serialize(), received->msgLength()),
              std::string(notice.serialize(), notice.msgLength()));
    // A frame is read in two pieces; one transfer brings both.
    EXPECT_THAT(mMemory.server().reads(), ElementsAre(8192U));
}

TEST_F(EncryptedPair, AWriteGoesOutInChunksOf8192BytesAndIsLoggedOnce)
{
    const std::vector<std::pair<std::size_t, std::vector<std::size_t>>> rows = {
        {1, {23}},
        {8169, {8191}},
        {8170, {8192}},
        {8171, {8192, 1}},
        {16384, {8192, 8192, 22}},
        {16385, {8192, 8192, 45}},
        {20000, {8192, 8192, 3660}},
        {100000, {8192, 8192, 8192, 8192, 8192, 8192, 8192, 8192, 8192, 8192, 8192, 8192, 1850}},
    };
    mMemory.client().record();
    std::vector<std::size_t> linesAtEachTransfer;
    mHooks.afterWrite = [&] { linesAtEachTransfer.push_back(mLog.lines().size()); };
    for (const auto& [length, chunks] : rows) {
        SCOPED_TRACE(length);
        mLog.clear();
        linesAtEachTransfer.clear();
        const std::size_t writesBefore = mMemory.client().writes().size();
        writeText(mClient, pattern(length));
        std::vector<std::size_t> writes = mMemory.client().writes();
        writes.erase(writes.begin(), writes.begin() + static_cast<std::ptrdiff_t>(writesBefore));
        EXPECT_EQ(writes, chunks);
        EXPECT_THAT(mLog.lines(), ElementsAre(encryptedLine(length)));
        EXPECT_THAT(linesAtEachTransfer, Each(0U)) << "the line follows the last transfer";
        EXPECT_EQ(readExactly(mServer, length), pattern(length));
    }
}

TEST_F(EncryptedPair, LengthZeroTransfersNothing)
{
    mMemory.client().record();
    char byte = 'x';
    const Outcome outcome = here([&] {
        mClient.write(&byte, 0);
        EXPECT_EQ(mClient.read(&byte, 0), 0U);
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_THAT(outcome.log, IsEmpty());
    EXPECT_THAT(mMemory.client().writes(), IsEmpty());
    EXPECT_THAT(mMemory.client().reads(), IsEmpty());
    EXPECT_EQ(byte, 'x');
}

TEST_F(EncryptedPair, AReadReturnsAsSoonAsOneRecordIsThere)
{
    writeText(mClient, "hello");
    mMemory.server().record();
    EXPECT_EQ(readSome(mServer, 100000), "hello");
    EXPECT_THAT(mMemory.server().reads(), ElementsAre(8192U));
}

TEST_F(EncryptedPair, AReadDeliversAllDataOfOneTransfer)
{
    writeText(mClient, "he");
    writeText(mClient, "llo");
    mMemory.server().record();
    const Outcome outcome = here([this] { EXPECT_EQ(readSome(mServer, 100), "hello"); });
    EXPECT_THAT(outcome.log, ElementsAre(decryptedLine(2), decryptedLine(3)));
    EXPECT_THAT(mMemory.server().reads(), ElementsAre(8192U));
}

TEST_F(EncryptedPair, AReadDoesNotWaitForTheRestOfARecordOnceItHasData)
{
    writeText(mClient, "hello");
    const std::size_t first = mMemory.server().bytesLeft();
    writeText(mClient, "world");
    mMemory.server().deliverAtMost(first + 1); // a record and the first byte of the next
    EXPECT_EQ(readSome(mServer, 100), "hello");
    EXPECT_EQ(mMemory.server().bytesLeft(), first - 1);
    EXPECT_EQ(readSome(mServer, 100), "world");
}

TEST_F(EncryptedPair, DataThatDoesNotFitStaysForTheNextRead)
{
    writeText(mClient, "hello");
    EXPECT_EQ(readSome(mServer, 2), "he");
    mMemory.server().record();
    EXPECT_EQ(readSome(mServer, 2), "ll");
    EXPECT_EQ(readSome(mServer, 2), "o");
    EXPECT_THAT(mMemory.server().reads(), IsEmpty());
}

TEST_F(EncryptedPair, TheEndOfTheUnderlyingStreamIsTheEnd)
{
    writeText(mClient, "bye");
    mClient.close();
    const Outcome outcome = here([this] {
        EXPECT_EQ(readSome(mServer, 10), "bye");
        EXPECT_EQ(readSome(mServer, 10), "");
        EXPECT_EQ(readSome(mServer, 10), "");
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_THAT(outcome.log, ElementsAre(decryptedLine(3)));
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_ENCRYPTED);
    EXPECT_EQ(mMemory.server().closeCount(), 0U);
}

TEST_F(EncryptedPair, CanWriteAndCloseAfterTheEnd)
{
    mMemory.server().endReadAt(mMemory.server().bytesRead());
    EXPECT_EQ(readSome(mServer, 10), "");
    writeText(mServer, "still here");
    EXPECT_EQ(readExactly(mClient, 10), "still here");
    mServer.close();
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(EncryptedPair, ATruncatedRecordReadsAsTheEnd)
{
    writeText(mClient, "hello");
    mMemory.server().endReadAt(mMemory.server().bytesRead() + 10);
    EXPECT_EQ(readSome(mServer, 10), "");
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_F(EncryptedPair, LengthsAreCappedToInt)
{
    std::vector<int> lengths;
    TlsCalls calls;
    calls.SSL_read = calls.SSL_write = [&lengths](SSL*, const void*, int length) {
        lengths.push_back(length);
        return -1;
    };
    calls.SSL_get_error = [](const SSL*, int) { return SSL_ERROR_SSL; };
    char byte = 0;
    const std::size_t longest = INT_MAX;
    EXPECT_EQ(here([&] { mClient.write(&byte, longest + 1); }).failure, kSSLError1);
    EXPECT_EQ(here([&] { mServer.read(&byte, longest * 4); }).failure, kSSLError1);
    EXPECT_THAT(lengths, ElementsAre(INT_MAX, INT_MAX));
}

TEST_F(EncryptedPair, SteadyReadingAndWritingAllocateNothing)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    QelLogger::get().setLevel(LogLevel::Info); // lines are made of strings
    const std::string data = pattern(16384);
    std::vector<char> buffer(data.size());
    std::size_t count = 1;
    {
        const test::Allocations allocations;
        for (const std::size_t length : {1U, 64U, 8192U, 16384U, 1U, 64U, 8192U, 16384U}) {
            mClient.write(data.data(), length);
            mServer.fill(buffer.data(), length);
            mServer.write(data.data(), length);
            mClient.fill(buffer.data(), length);
        }
        count = allocations.count();
    }
    EXPECT_EQ(count, 0U);
    EXPECT_EQ(std::string(buffer.data(), buffer.size()), data);
}

} // namespace
} // namespace qel
