#include <qel/common/LogBackend.hpp>
#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLException.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/Allocations.hpp"
#include "support/CapturedLog.hpp"
#include "support/HookedStream.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/ThrowingClock.hpp"
#include "support/TlsCalls.hpp"
#include "support/TlsKit.hpp"

#include <atomic>
#include <cerrno>
#include <chrono>
#include <climits>
#include <exception>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/err.h>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using test::CapturedLog;
using test::clientContext;
using test::decryptedLine;
using test::encryptedLine;
using test::failureOf;
using test::handshakeLines;
using test::HookedStream;
using test::Identity;
using test::MemoryStreamPair;
using test::Outcome;
using test::Outcomes;
using test::pattern;
using test::readExactly;
using test::readSome;
using test::runEnds;
using test::serverContext;
using test::ThrowingClock;
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
using ::testing::Pair;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

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

const char* const kInvalidState = "StreamIOException: Invalid state for SSL stream operation";
const char* const kSSLError1 = "StreamIOException: SSL error 1";
const char* const kUnrecoverable1 = "E: SSL stream encountered unrecoverable error code 0x00000001";
const char* const kRenegotiation = "SSL stream peer attempted renegotiation";
const char* const kLibssl = "E: [libssl]";

constexpr std::size_t kPlenty = 1 << 20; // bytes on their way: no write in these tests ever waits for a reader

/// What a stream underneath may throw: a type that nobody knows.
struct ForeignFailure {
    int number;
};

std::exception_ptr foreignFailure() { return std::make_exception_ptr(ForeignFailure{42}); }

/// StreamIOException "outside", with a PosixError "inside" nested in it.
std::exception_ptr nestedFailure()
{
    try {
        try {
            throw PosixError(EPIPE, "inside");
        } catch (const PosixError&) {
            std::throw_with_nested(StreamIOException("outside"));
        }
    } catch (...) {
        return std::current_exception();
    }
}

void expectNestedFailure(const std::function<void()>& work)
{
    try {
        work();
        ADD_FAILURE() << "no exception";
    } catch (const StreamIOException& outside) {
        EXPECT_STREQ(outside.what(), "outside");
        EXPECT_THAT([&outside] { std::rethrow_if_nested(outside); },
                    ThrowsMessage<PosixError>(StartsWith("inside: 32 (")));
    }
}

/// Leaves an entry in the error queue of this thread, as code of others may.
void spoilErrorQueue()
{
    BIO_new_mem_buf(nullptr, 0); // refuses, and says so
    ASSERT_NE(ERR_peek_error(), 0U);
}

class SSLStreamTest : public test::TlsTest {};

/// Two of our streams over a connection in memory.
class SSLStreamPair : public test::TlsTest {
protected:
    SSLStreamPair()
        : mMemory(kPlenty), mClient(clientContext(), pHooked()), mServer(serverContext(), mMemory.takeServer())
    {}

    void encrypt() { TlsTest::encrypt(mClient, mServer); }

    MemoryStreamPair mMemory;
    HookedStream::Hooks mHooks; // of the client
    SSLStream mClient;
    SSLStream mServer;

private:
    std::unique_ptr<Stream> pHooked() { return std::make_unique<HookedStream>(mMemory.takeClient(), mHooks); }
};

/// The same, encrypted.
class EncryptedPair : public SSLStreamPair {
protected:
    void SetUp() override { encrypt(); }
};

// Construction

TEST_F(SSLStreamPair, StartsUnencryptedAndSendsNothing)
{
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_UNENCRYPTED);
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_UNENCRYPTED);
    EXPECT_EQ(mMemory.client().bytesWritten(), 0U);
    EXPECT_EQ(mMemory.server().bytesWritten(), 0U);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(SSLStreamTest, OwnsTheStreamUnderneath)
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

TEST_F(SSLStreamTest, ThereIsNoStreamWithoutItsBuffers)
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

TEST_F(SSLStreamPair, BeforeTheHandshakeReadingAndWritingAreRefusedAndChangeNothing)
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

TEST_F(EncryptedPair, OnceClosedReadingAndWritingAreRefused)
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

TEST_F(SSLStreamPair, ClosingDropsWhatTheStreamUnderneathThrows)
{
    mMemory.client().failClose(foreignFailure());
    mClient.close();
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
}

TEST_F(SSLStreamTest, DestroyingOneEndIsTheEndForTheOther)
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

TEST_F(EncryptedPair, TheDataDoesNotShowUnderneath)
{
    mMemory.client().record();
    const std::string secret = "a secret that nobody shall see";
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
        EXPECT_THAT(linesAtEachTransfer, Each(0U)) << "the line comes behind the last transfer";
        EXPECT_EQ(readExactly(mServer, length), pattern(length));
    }
}

TEST_F(EncryptedPair, NoBytesAreNoTransfer)
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

TEST_F(EncryptedPair, AReadDeliversAllThatOneTransferHasBrought)
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

TEST_F(EncryptedPair, WhatDoesNotFitTheBufferStaysForTheNextRead)
{
    writeText(mClient, "hello");
    EXPECT_EQ(readSome(mServer, 2), "he");
    mMemory.server().record();
    EXPECT_EQ(readSome(mServer, 2), "ll");
    EXPECT_EQ(readSome(mServer, 2), "o");
    EXPECT_THAT(mMemory.server().reads(), IsEmpty());
}

TEST_F(EncryptedPair, TheEndOfTheStreamUnderneathIsTheEndAndNotAFailure)
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

TEST_F(EncryptedPair, AfterTheEndItCanStillWriteAndClose)
{
    mMemory.server().endReadAt(mMemory.server().bytesRead());
    EXPECT_EQ(readSome(mServer, 10), "");
    writeText(mServer, "still here");
    EXPECT_EQ(readExactly(mClient, 10), "still here");
    mServer.close();
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(EncryptedPair, ARecordThatIsCutOffReadsAsTheEnd)
{
    writeText(mClient, "hello");
    mMemory.server().endReadAt(mMemory.server().bytesRead() + 10);
    EXPECT_EQ(readSome(mServer, 10), "");
    EXPECT_EQ(mServer.getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_F(EncryptedPair, LengthsBeyondAnIntAreCutToWhatOpenSSLCanCount)
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

// Who the peer is

TEST_F(SSLStreamPair, KnowsThePeerFromTheHandshakeUntilItIsClosed)
{
    EXPECT_EQ(mClient.getPeerCertificate(), nullptr);
    EXPECT_EQ(mClient.getCipher(), "");
    encrypt();
    EXPECT_THAT(mClient.getPeerCertificate()->getSubject(), ElementsAre(Pair("CN", "server")));
    EXPECT_THAT(mServer.getPeerCertificate()->getSubject(), ElementsAre(Pair("CN", "client")));
    EXPECT_EQ(mClient.getPeerCertificate()->getPEM(), test::credentialsOf(Identity::Server).mCert);
    EXPECT_EQ(mClient.getPeerCertificate()->getPrivateKey(), nullptr);
    EXPECT_EQ(mClient.getCipher(), "TLS_AES_256_GCM_SHA384");
    EXPECT_EQ(mServer.getCipher(), "TLS_AES_256_GCM_SHA384");
    mClient.close();
    EXPECT_EQ(mClient.getPeerCertificate(), nullptr);
    EXPECT_EQ(mClient.getCipher(), "");
    EXPECT_NE(mServer.getPeerCertificate(), nullptr);
}

TEST_F(SSLStreamTest, TellsWhyThePeersCertificateWasRefused)
{
    MemoryStreamPair memory;
    SSLStream client(clientContext(Identity::Expired), memory.takeClient());
    SSLStream server(serverContext(), memory.takeServer());
    shakeHands(client, server);
    EXPECT_EQ(server.getVerificationFailure(), "certificate has expired");
    EXPECT_EQ(client.getVerificationFailure(), "");
    EXPECT_EQ(server.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(SSLStreamPair, HasNoVerificationFailureBeforeAndAfterAGoodHandshake)
{
    EXPECT_EQ(mClient.getVerificationFailure(), "");
    encrypt();
    EXPECT_EQ(mClient.getVerificationFailure(), "");
    mClient.close();
    EXPECT_EQ(mClient.getVerificationFailure(), "");
}

// What poll(2) cannot know

TEST_F(SSLStreamPair, HasNothingPendingUnlessItIsEncrypted)
{
    EXPECT_FALSE(mServer.hasPending());
    encrypt();
    EXPECT_FALSE(mClient.hasPending());
    EXPECT_FALSE(mServer.hasPending());
    writeText(mClient, "ab");
    EXPECT_EQ(readSome(mServer, 1), "a");
    EXPECT_TRUE(mServer.hasPending());
    mServer.close();
    EXPECT_FALSE(mServer.hasPending());
}

TEST_F(EncryptedPair, WhatTheStreamUnderneathHasGivenUpIsPendingUntilItIsRead)
{
    writeText(mClient, "ab");
    writeText(mClient, "c");
    EXPECT_FALSE(mServer.hasPending()) << "it is still underneath";
    EXPECT_EQ(readSome(mServer, 1), "a");
    EXPECT_TRUE(mServer.hasPending()) << "a part of a record and a whole one";
    EXPECT_EQ(readSome(mServer, 1), "b");
    EXPECT_TRUE(mServer.hasPending()) << "a whole record";
    EXPECT_EQ(readSome(mServer, 1), "c");
    EXPECT_FALSE(mServer.hasPending());
}

TEST_F(EncryptedPair, TheBeginningOfARecordIsPending)
{
    constexpr std::size_t kRecord = 24; // of two bytes
    for (const std::size_t begun : {1U, 4U, 5U, 6U, 23U}) {
        SCOPED_TRACE(begun);
        mMemory.server().deliverAtMost(kRecord + begun);
        writeText(mClient, "ab");
        writeText(mClient, "cd");
        EXPECT_EQ(readSome(mServer, 2), "ab");
        EXPECT_TRUE(mServer.hasPending());
        EXPECT_EQ(readSome(mServer, 3), "cd");
        EXPECT_FALSE(mServer.hasPending());
    }
}

// The lock and the deadlines

/// Remembers the deadlines that are set.
class DeadlineStream : public Stream {
public:
    explicit DeadlineStream(std::vector<std::string>& calls) : mCalls(calls) {}
    void close() override {}
    void setReadDeadline(milliseconds timeout) override { mCalls.push_back("read " + std::to_string(timeout.count())); }
    void setWriteDeadline(milliseconds timeout) override
    {
        mCalls.push_back("write " + std::to_string(timeout.count()));
    }
    std::size_t read(char*, std::size_t) override { return 0; }
    void write(const char*, std::size_t) override {}

private:
    std::vector<std::string>& mCalls;
};

TEST_F(SSLStreamTest, ForwardsDeadlinesUnchangedInEveryState)
{
    std::vector<std::string> calls;
    SSLStream stream(clientContext(), std::make_unique<DeadlineStream>(calls));
    stream.setReadDeadline(milliseconds(1500));
    stream.setWriteDeadline(milliseconds(0));
    stream.setReadDeadline(milliseconds(-7));
    stream.clearWriteDeadline();
    stream.close();
    stream.setReadDeadline(milliseconds(3));
    EXPECT_THAT(calls, ElementsAre("read 1500", "write 0", "read -7", "write -1", "read 3"));
}

/// Sets the deadlines of a stream with each line of log.
class DeadlineSetter : public LogBackend {
public:
    explicit DeadlineSetter(SSLStream& stream) : mStream(stream) {}
    void log(LogLevel::Level, const std::string&) override
    {
        mStream.setReadDeadline(milliseconds(60000));
        mStream.setWriteDeadline(milliseconds(60000));
        ++mCount;
    }
    int count() const { return mCount; }

private:
    SSLStream& mStream;
    int mCount = 0;
};

TEST_F(EncryptedPair, DeadlinesAreSetWithoutTheLock)
{
    // The line is written with the lock held: were it needed to set a deadline, this would wait for ever.
    const auto setter = std::make_shared<DeadlineSetter>(mClient);
    QelLogger::get().addBackend(setter);
    writeText(mClient, "x");
    EXPECT_EQ(setter->count(), 1);
}

TEST_F(SSLStreamPair, TheLockIsFreeWhileItWaitsUnderneath)
{
    // On this very thread: were the lock held, each of these would wait for ever.
    unsigned looks = 0;
    mHooks.beforeRead = mHooks.afterRead = mHooks.beforeWrite = mHooks.afterWrite = [this, &looks] {
        ++looks;
        static_cast<void>(mClient.getStatus());
    };
    encrypt();
    looks = 0;
    writeText(mClient, "ping");
    writeText(mServer, "pong");
    EXPECT_EQ(readSome(mClient, 10), "pong");
    EXPECT_EQ(looks, 4U);
}

TEST_F(SSLStreamPair, TheStatusMayBeAskedForAtAnyTime)
{
    // For the thread sanitizer above all: nothing changes the status without the lock, not even the end of the stream.
    mMemory.client().endReadAt(100);
    std::atomic<bool> done{false};
    std::thread asking([this, &done] {
        while (!done)
            static_cast<void>(mClient.getStatus());
    });
    const Outcomes outcomes = shakeHands(mClient, mServer);
    done = true;
    asking.join();
    EXPECT_EQ(outcomes.client.failure, "StreamIOException: EOF");
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(EncryptedPair, AReaderThatWaitsDoesNotStopAWriter)
{
    mHooks.beforeRead = [this] {
        writeText(mClient, "ping");
        EXPECT_EQ(readExactly(mServer, 4), "ping");
        writeText(mServer, "pong");
    };
    EXPECT_EQ(readSome(mClient, 10), "pong");
}

TEST_F(EncryptedPair, AWriterThatWaitsDoesNotStopAReader)
{
    writeText(mServer, "pong");
    std::string read;
    mHooks.beforeWrite = [this, &read] {
        if (read.empty()) read = readSome(mClient, 10);
    };
    writeText(mClient, pattern(20000));
    EXPECT_EQ(read, "pong");
    EXPECT_EQ(readExactly(mServer, 20000), pattern(20000));
}

TEST_F(EncryptedPair, AReadDeadlineThatPassesIsFatal)
{
    mClient.setReadDeadline(milliseconds(0));
    EXPECT_EQ(here([this] { readSome(mClient, 1); }).failure, "StreamIOException: memory stream deadline");
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { readSome(mClient, 1); }).failure, kInvalidState);
    EXPECT_EQ(readSome(mServer, 1), "");
}

TEST_F(EncryptedPair, AWriteDeadlineThatPassesIsFatal)
{
    mMemory.client().stallWrites();
    mClient.setWriteDeadline(milliseconds(0));
    EXPECT_EQ(here([this] { writeText(mClient, "x"); }).failure, "StreamIOException: memory stream deadline");
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(readSome(mServer, 1), "");
}

TEST_F(EncryptedPair, DataInTimeKeepsADeadlineAway)
{
    mClient.setReadDeadline(milliseconds(0));
    writeText(mServer, "in time");
    EXPECT_EQ(readSome(mClient, 10), "in time");
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_ENCRYPTED);
}

// Failures underneath

TEST_F(EncryptedPair, AnyExceptionOfAReadUnderneathComesThroughAndCloses)
{
    mMemory.client().failReadAt(mMemory.client().bytesRead(), foreignFailure());
    EXPECT_THROW(readSome(mClient, 1), ForeignFailure);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(EncryptedPair, AnyExceptionOfAWriteUnderneathComesThroughAndCloses)
{
    mMemory.client().failWriteAt(mMemory.client().bytesWritten(), foreignFailure());
    EXPECT_THROW(writeText(mClient, "x"), ForeignFailure);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(EncryptedPair, ReadingAndWritingKeepTheCauseInsideAnException)
{
    mMemory.client().failReadAt(mMemory.client().bytesRead(), nestedFailure());
    expectNestedFailure([this] { readSome(mClient, 1); });
    mMemory.server().failWriteAt(mMemory.server().bytesWritten(), nestedFailure());
    expectNestedFailure([this] { writeText(mServer, "x"); });
}

TEST_F(SSLStreamPair, TheHandshakeKeepsTheCauseInsideAnException)
{
    mMemory.client().failReadAt(0, nestedFailure());
    expectNestedFailure([this] { mClient.handshake(); });
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_GE(mMemory.client().closeCount(), 1U);
}

TEST_F(SSLStreamPair, TheHandshakeClosesForExceptionsOfAnyKind)
{
    mMemory.client().failWriteAt(0, foreignFailure());
    EXPECT_THROW(mClient.handshake(), ForeignFailure);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { mClient.handshake(); }).failure, kInvalidState);
}

TEST_F(SSLStreamPair, AnExceptionOfClosingDoesNotTakeThePlaceOfTheFailure)
{
    mMemory.client().failReadAt(0, nestedFailure());
    mMemory.client().failClose(foreignFailure());
    expectNestedFailure([this] { mClient.handshake(); });
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
}

// Failures of TLS

TEST_F(EncryptedPair, AWriterMeetsTheFatalErrorOfTheReader)
{
    mMemory.client().deliver(std::string(100, 'x'));
    bool readerFailed = false;
    // The first chunk is out when the reader comes across something that is no record.
    mHooks.afterWrite = [this, &readerFailed] {
        if (std::exchange(readerFailed, true)) return;
        EXPECT_EQ(here([this] { readSome(mClient, 1); }).failure, kSSLError1);
    };
    const Outcome outcome = here([this] { writeText(mClient, pattern(20000)); });
    EXPECT_EQ(outcome.failure, "StreamIOException: SSL error 5");
    EXPECT_THAT(outcome.log,
                ElementsAre(kUnrecoverable1, kLibssl, StartsWith("E: SSL stream encountered a fatal syscall error: ")));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(EncryptedPair, ASystemErrorIsSavedBeforeAnythingElseIsDone)
{
    TlsCalls calls;
    calls.SSL_read = [](SSL*, void*, int) {
        errno = EIO;
        return -1;
    };
    calls.SSL_get_error = [](const SSL*, int result) {
        EXPECT_EQ(result, -1);
        errno = ENOTTY;
        return SSL_ERROR_SYSCALL;
    };
    const Outcome outcome = here([this] { readSome(mClient, 1); });
    EXPECT_EQ(outcome.failure, "StreamIOException: SSL error 5");
    EXPECT_THAT(outcome.log, ElementsAre("E: SSL stream encountered a fatal syscall error: 5 (Input/output error)"));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(SSLStreamTest, EveryOtherErrorCodeIsFatal)
{
    for (const int code : {1, 4, 6, 7, 8, 9, 10, 11}) {
        SCOPED_TRACE(code);
        MemoryStreamPair memory(kPlenty);
        SSLStream client(clientContext(), memory.takeClient());
        SSLStream server(serverContext(), memory.takeServer());
        encrypt(client, server);
        TlsCalls calls;
        calls.SSL_write = [](SSL*, const void*, int) {
            spoilErrorQueue();
            return -1;
        };
        calls.SSL_get_error = [code](const SSL*, int) { return code; };
        const Outcome outcome = here([&client] { writeText(client, "x"); });
        EXPECT_EQ(outcome.failure, "StreamIOException: SSL error " + std::to_string(code));
        const char* const digits = "0123456789AB";
        EXPECT_THAT(
            outcome.log,
            ElementsAre(std::string("E: SSL stream encountered unrecoverable error code 0x0000000") + digits[code],
                        kLibssl));
        EXPECT_EQ(client.getStatus(), SSLStream::STATUS_CLOSED);
        EXPECT_EQ(memory.client().closeCount(), 1U);
    }
}

TEST_F(EncryptedPair, AReadRefusesRenegotiation)
{
    TlsCalls calls;
    calls.SSL_get_error = [](const SSL*, int) { return SSL_ERROR_WANT_WRITE; };
    const Outcome outcome = here([this] { readSome(mClient, 1); });
    EXPECT_EQ(outcome.failure, std::string("StreamIOException: ") + kRenegotiation);
    EXPECT_THAT(outcome.log, ElementsAre(std::string("E: ") + kRenegotiation));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
}

TEST_F(EncryptedPair, AWriteRefusesRenegotiation)
{
    const std::size_t sent = mMemory.client().bytesWritten();
    TlsCalls calls;
    calls.SSL_get_error = [](const SSL*, int) { return SSL_ERROR_WANT_READ; };
    const Outcome outcome = here([this] { writeText(mClient, "x"); });
    EXPECT_EQ(outcome.failure, std::string("StreamIOException: ") + kRenegotiation);
    EXPECT_THAT(outcome.log, ElementsAre(std::string("E: ") + kRenegotiation));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
    EXPECT_EQ(mMemory.client().bytesWritten(), sent);
}

TEST_F(EncryptedPair, AFailureToTakeCiphertextFromTheBufferIsFatal)
{
    TlsCalls calls;
    calls.BIO_read = [](BIO*, void*, int length) {
        EXPECT_EQ(length, 23);
        spoilErrorQueue();
        return -1;
    };
    const Outcome outcome = here([this] { writeText(mClient, "x"); });
    EXPECT_EQ(outcome.failure, "StreamIOException: BIO_read failed");
    EXPECT_THAT(outcome.log, ElementsAre(kLibssl, "E: SSL stream hit BIO_read failure: 0xFFFFFFFF"));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
}

TEST_F(EncryptedPair, AFailureToPutCiphertextIntoTheBufferIsFatal)
{
    writeText(mServer, "x");
    TlsCalls calls;
    calls.BIO_write = [](BIO*, const void*, int length) {
        spoilErrorQueue();
        return length - 1;
    };
    const Outcome outcome = here([this] { readSome(mClient, 1); });
    EXPECT_EQ(outcome.failure, "StreamIOException: BIO_write failed");
    EXPECT_THAT(outcome.log, ElementsAre(kLibssl, "E: SSLStream hit BIO_write failure: 0x00000016"));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
}

TEST_F(EncryptedPair, NoMoreIsTakenFromUnderneathThanTheBufferHasRoomFor)
{
    writeText(mServer, "hello");
    const std::size_t before = mMemory.client().bytesRead();
    std::vector<std::size_t> transfers;
    TlsCalls calls;
    calls.BIO_ctrl_get_write_guarantee = [](BIO*) -> std::size_t { return 10; };
    calls.BIO_write = [&transfers](BIO* bio, const void* data, int length) {
        transfers.push_back(static_cast<std::size_t>(length));
        return BIO_write(bio, data, length);
    };
    EXPECT_EQ(readSome(mClient, 5), "hello");
    EXPECT_THAT(transfers, ElementsAre(10, 10, 7)); // a record of 27 bytes
    EXPECT_EQ(mMemory.client().bytesRead(), before + 27);
}

TEST_F(EncryptedPair, ThePeersCertificateIsAllThereOrReportedAsAFailure)
{
    TlsCalls calls;
    calls.PEM_write_bio_X509 = [](BIO* bio, test::WrittenCertificate certificate) {
        EXPECT_EQ(PEM_write_bio_X509(bio, certificate), 1); // there is a text, but it is not said to be whole
        spoilErrorQueue();
        return 0;
    };
    const Outcome outcome = here([this] { mClient.getPeerCertificate(); });
    EXPECT_THAT(outcome.failure,
                MatchesRegex("SSLException: An SSL error occurred at .*common/security/SSLStream.cpp:[0-9]+"));
    EXPECT_THAT(outcome.log, ElementsAre(kLibssl));
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_ENCRYPTED);
}

// A clock that fails: log lines go out without their time

class SSLStreamWithoutClock : public EncryptedPair {
protected:
    /// The work throws its own failure, logs it, and leaves the client closed.
    void expectClosedBy(const std::function<void()>& work, const char* failure)
    {
        ThrowingClock clock;
        clock.failAfter(0);
        const Outcome outcome = here(work);
        clock.work();
        EXPECT_EQ(outcome.failure, failure);
        EXPECT_THAT(outcome.log, Not(IsEmpty()));
        EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
        EXPECT_EQ(mMemory.client().closeCount(), 1U);
        EXPECT_EQ(here([this] { readSome(mClient, 1); }).failure, kInvalidState);
    }
};

TEST_F(SSLStreamWithoutClock, AFatalErrorOfReadingClosesAllTheSame)
{
    mMemory.client().deliver(std::string(100, 'x'));
    expectClosedBy([this] { readSome(mClient, 1); }, kSSLError1);
}

TEST_F(SSLStreamWithoutClock, AFatalErrorOfWritingClosesAllTheSame)
{
    TlsCalls calls;
    calls.SSL_write = [](SSL*, const void*, int) {
        spoilErrorQueue();
        return -1;
    };
    calls.SSL_get_error = [](const SSL*, int) { return SSL_ERROR_SSL; };
    expectClosedBy([this] { writeText(mClient, "x"); }, kSSLError1);
}

TEST_F(SSLStreamWithoutClock, RefusingRenegotiationClosesAllTheSame)
{
    TlsCalls calls;
    calls.SSL_get_error = [](const SSL*, int) { return SSL_ERROR_WANT_READ; };
    expectClosedBy([this] { writeText(mClient, "x"); }, "StreamIOException: SSL stream peer attempted renegotiation");
}

TEST_F(SSLStreamWithoutClock, AFailureToTakeCiphertextFromTheBufferClosesAllTheSame)
{
    TlsCalls calls;
    calls.BIO_read = [](BIO*, void*, int) {
        spoilErrorQueue();
        spoilErrorQueue();
        return -1;
    };
    expectClosedBy([this] { writeText(mClient, "x"); }, "StreamIOException: BIO_read failed");
}

TEST_F(SSLStreamWithoutClock, DataArrivesAllTheSame)
{
    writeText(mServer, "hello");
    ThrowingClock clock;
    clock.failAfter(0);
    EXPECT_EQ(readSome(mClient, 10), "hello");
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_F(SSLStreamPair, AHandshakeThatFailsWithoutAClockLeavesNothingBehind)
{
    mMemory.client().deliver(std::string(100, 'x'));
    ThrowingClock clock;
    clock.failAfter(0);
    EXPECT_EQ(here([this] { mClient.handshake(); }).failure, kSSLError1);
    clock.work();
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_GE(mMemory.client().closeCount(), 1U);
}

// The error queue

TEST_F(SSLStreamPair, StaleEntriesOfTheErrorQueueAttachToNoCall)
{
    // Before the first call of each operation ...
    mHooks.beforeRead = mHooks.afterRead = mHooks.beforeWrite = mHooks.afterWrite = spoilErrorQueue; // and in between
    const Outcomes outcomes = runEnds(
        mLog,
        [this] {
            spoilErrorQueue();
            mClient.handshake();
        },
        [this] { mServer.handshake(); });
    EXPECT_EQ(outcomes.client.failure, "");
    EXPECT_EQ(outcomes.server.failure, "");
    // They are taken out and logged before anything else happens.
    EXPECT_EQ(outcomes.client.log.front(), kLibssl);

    writeText(mServer, "hello");
    mLog.clear();
    spoilErrorQueue();
    EXPECT_EQ(here([this] { EXPECT_EQ(readSome(mClient, 5), "hello"); }).failure, "");
    EXPECT_THAT(mLog.lines(), Contains(StartsWith("E: [libssl] ")));
    spoilErrorQueue();
    const Outcome outcome = here([this] {
        writeText(mClient, pattern(20000));
        ERR_clear_error(); // what the last transfer has left
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_EQ(readExactly(mServer, 20000), pattern(20000));
}

} // namespace
} // namespace qel
