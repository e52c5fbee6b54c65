// TLS streams whose underlying stream, TLS engine, or log fails.

#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "security/StreamKit.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/ThrowingClock.hpp"
#include "support/TlsCalls.hpp"
#include "support/TlsKit.hpp"

#include <cerrno>
#include <exception>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <string>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::clientContext;
using test::EncryptedPair;
using test::expectNestedFailure;
using test::ForeignFailure;
using test::foreignFailure;
using test::kInvalidState;
using test::kLibssl;
using test::kPlenty;
using test::kRenegotiation;
using test::kSSLError1;
using test::kUnrecoverable1;
using test::MemoryStreamPair;
using test::nestedFailure;
using test::Outcome;
using test::Outcomes;
using test::pattern;
using test::readExactly;
using test::readSome;
using test::runEnds;
using test::serverContext;
using test::spoilErrorQueue;
using test::SSLStreamPair;
using test::SSLStreamTest;
using test::ThrowingClock;
using test::TlsCalls;
using test::writeText;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::Not;
using ::testing::StartsWith;

// Failures of the underlying stream

TEST_F(EncryptedPair, AnExceptionOfTheUnderlyingReadPropagatesAndCloses)
{
    mMemory.client().failReadAt(mMemory.client().bytesRead(), foreignFailure());
    EXPECT_THROW(readSome(mClient, 1), ForeignFailure);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(EncryptedPair, AnExceptionOfTheUnderlyingWritePropagatesAndCloses)
{
    mMemory.client().failWriteAt(mMemory.client().bytesWritten(), foreignFailure());
    EXPECT_THROW(writeText(mClient, "x"), ForeignFailure);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(mMemory.client().closeCount(), 1U);
    EXPECT_THAT(mLog.lines(), IsEmpty());
}

TEST_F(EncryptedPair, ReadAndWriteKeepANestedCause)
{
    mMemory.client().failReadAt(mMemory.client().bytesRead(), nestedFailure());
    expectNestedFailure([this] { readSome(mClient, 1); });
    mMemory.server().failWriteAt(mMemory.server().bytesWritten(), nestedFailure());
    expectNestedFailure([this] { writeText(mServer, "x"); });
}

TEST_F(SSLStreamPair, TheHandshakeKeepsANestedCause)
{
    mMemory.client().failReadAt(0, nestedFailure());
    expectNestedFailure([this] { mClient.handshake(); });
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_GE(mMemory.client().closeCount(), 1U);
}

TEST_F(SSLStreamPair, TheHandshakeClosesAfterAnExceptionOfAnyType)
{
    mMemory.client().failWriteAt(0, foreignFailure());
    EXPECT_THROW(mClient.handshake(), ForeignFailure);
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { mClient.handshake(); }).failure, kInvalidState);
}

TEST_F(SSLStreamPair, AnExceptionOfCloseDoesNotReplaceTheFailure)
{
    mMemory.client().failReadAt(0, nestedFailure());
    mMemory.client().failClose(foreignFailure());
    expectNestedFailure([this] { mClient.handshake(); });
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_CLOSED);
}

// Failures of TLS

TEST_F(EncryptedPair, AFatalErrorOfTheReaderFailsTheWriter)
{
    mMemory.client().deliver(std::string(100, 'x'));
    bool readerFailed = false;
    // The first chunk has been sent when the reader meets an invalid record.
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

TEST_F(EncryptedPair, ASystemErrorIsSavedBeforeOtherCalls)
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

TEST_F(EncryptedPair, AFailedBioReadIsFatal)
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

TEST_F(EncryptedPair, AFailedBioWriteIsFatal)
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

TEST_F(EncryptedPair, ReadsNoMoreThanTheBufferHasRoomFor)
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

TEST_F(EncryptedPair, APeerCertificateThatCannotBeWrittenIsReported)
{
    TlsCalls calls;
    calls.PEM_write_bio_X509 = [](BIO* bio, test::WrittenCertificate certificate) {
        EXPECT_EQ(PEM_write_bio_X509(bio, certificate), 1); // writes the text but reports a failure
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
    void expectClosedBy(const std::function<void()>& work, const std::string& failure)
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

TEST_F(SSLStreamPair, StaleEntriesOfTheErrorQueueAffectNoCall)
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
    // They are removed and logged first.
    EXPECT_EQ(outcomes.client.log.front(), kLibssl);

    writeText(mServer, "hello");
    mLog.clear();
    spoilErrorQueue();
    EXPECT_EQ(here([this] { EXPECT_EQ(readSome(mClient, 5), "hello"); }).failure, "");
    EXPECT_THAT(mLog.lines(), Contains(StartsWith("E: [libssl] ")));
    spoilErrorQueue();
    const Outcome outcome = here([this] {
        writeText(mClient, pattern(20000));
        ERR_clear_error(); // the entry of the last transfer
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_EQ(readExactly(mServer, 20000), pattern(20000));
}

} // namespace
} // namespace qel
