// TLS streams: the peer, pending data, deadlines and the lock.

#include <qel/common/LogBackend.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "security/StreamKit.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/RawTlsPeer.hpp"
#include "support/TlsKit.hpp"

#include <atomic>
#include <chrono>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using test::clientContext;
using test::EncryptedPair;
using test::Identity;
using test::kInvalidState;
using test::MemoryStreamPair;
using test::Outcomes;
using test::pattern;
using test::readExactly;
using test::readSome;
using test::serverContext;
using test::SSLStreamPair;
using test::SSLStreamTest;
using test::writeText;
using ::testing::ElementsAre;
using ::testing::Pair;

// Who the peer is

TEST_F(SSLStreamPair, ReturnsThePeersCertificateFromTheHandshakeUntilTheClose)
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

TEST_F(SSLStreamTest, ReportsWhyThePeersCertificateWasRefused)
{
    MemoryStreamPair memory;
    SSLStream client(clientContext(Identity::Expired), memory.takeClient());
    SSLStream server(serverContext(), memory.takeServer());
    shakeHands(client, server);
    EXPECT_EQ(server.getVerificationFailure(), "certificate has expired");
    EXPECT_EQ(client.getVerificationFailure(), "");
    EXPECT_EQ(server.getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_F(SSLStreamTest, KnowsTheAlertOfThePeer)
{
    MemoryStreamPair memory;
    SSLStream client(clientContext(Identity::Client), memory.takeClient());
    const SSLCredentials credentials = test::credentialsOf(Identity::Server);
    test::RawTlsPeer::Options options;
    options.credentials = &credentials;
    test::RawTlsPeer server(test::RawTlsPeer::Server, options, memory.takeServer());
    std::thread thread([&] {
        server.handshake();
        server.exchangeVersions();
        server.sendBytes(server.protectedRecord(21, "\x02\x31"));
    });
    client.handshake();
    EXPECT_EQ(client.getPeerAlert(), 0);
    char byte = 0;
    EXPECT_THROW(client.read(&byte, 1), StreamIOException);
    EXPECT_EQ(client.getPeerAlert(), 49);
    EXPECT_EQ(client.getStatus(), SSLStream::STATUS_CLOSED);
    thread.join();
}

TEST_F(SSLStreamTest, AFailureOfItsOwnIsNoAlertOfThePeer)
{
    MemoryStreamPair memory;
    SSLStream client(clientContext(Identity::Expired), memory.takeClient());
    SSLStream server(serverContext(), memory.takeServer());
    shakeHands(client, server);
    EXPECT_EQ(server.getPeerAlert(), 0);
    EXPECT_EQ(client.getPeerAlert(), 0) << "this class sends none";
}

TEST_F(SSLStreamPair, HasNoVerificationFailureBeforeAndAfterAGoodHandshake)
{
    EXPECT_EQ(mClient.getVerificationFailure(), "");
    encrypt();
    EXPECT_EQ(mClient.getVerificationFailure(), "");
    mClient.close();
    EXPECT_EQ(mClient.getVerificationFailure(), "");
}

// Pending data

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

TEST_F(EncryptedPair, BytesReadAheadArePendingUntilTheyAreRead)
{
    writeText(mClient, "ab");
    writeText(mClient, "c");
    EXPECT_FALSE(mServer.hasPending()) << "it is still in the underlying stream";
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

/// Records the deadlines that are set.
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
    // The line is written with the lock held: if setting a deadline took the lock, this would deadlock.
    const auto setter = std::make_shared<DeadlineSetter>(mClient);
    QelLogger::get().addBackend(setter);
    writeText(mClient, "x");
    EXPECT_EQ(setter->count(), 1);
}

TEST_F(SSLStreamPair, TheLockIsFreeWhileTheUnderlyingStreamWaits)
{
    // On this thread: if the lock were held, each of these would deadlock.
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
    // Mainly for the thread sanitizer: nothing changes the status without the lock, not even the end of the stream.
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

TEST_F(EncryptedPair, AWaitingReaderDoesNotBlockAWriter)
{
    mHooks.beforeRead = [this] {
        writeText(mClient, "ping");
        EXPECT_EQ(readExactly(mServer, 4), "ping");
        writeText(mServer, "pong");
    };
    EXPECT_EQ(readSome(mClient, 10), "pong");
}

TEST_F(EncryptedPair, AWaitingWriterDoesNotBlockAReader)
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

TEST_F(EncryptedPair, DataInTimeMeetsTheDeadline)
{
    mClient.setReadDeadline(milliseconds(0));
    writeText(mServer, "in time");
    EXPECT_EQ(readSome(mClient, 10), "in time");
    EXPECT_EQ(mClient.getStatus(), SSLStream::STATUS_ENCRYPTED);
}

} // namespace
} // namespace qel
