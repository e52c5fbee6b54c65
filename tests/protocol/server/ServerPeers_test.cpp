// Peers that close the connection or stop at any byte of what they have to send.

#include <qel/common/QelMessageDax.hpp>

#include "protocol/server/ServerFixture.hpp"
#include "support/ComesTrue.hpp"

#include <algorithm>
#include <filesystem>
#include <gmock/gmock.h>
#include <sstream>

namespace qel::test {

namespace {

using protocol::ServerOptions;
using ::testing::Contains;

constexpr std::size_t kAll = 1024 * 1024;

/// Sends so many bytes, and then closes the connection or drops the rest.
class CutStream : public Stream {
public:
    enum class Then { Close, Stall };

    CutStream(std::unique_ptr<Stream> stream, std::size_t bytes, Then then)
        : mStream(std::move(stream)), mThen(then), mLeft(bytes)
    {}

    std::size_t sent() const { return mSent; }
    /// Sends so many bytes from now on.
    void cutAfter(std::size_t bytes) { mLeft = bytes; }

    void close() override { mStream->close(); }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mStream->setReadDeadline(timeout); }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mStream->setWriteDeadline(timeout); }
    std::size_t read(char* buffer, std::size_t length) override { return mStream->read(buffer, length); }
    void write(const char* buffer, std::size_t length) override
    {
        const std::size_t count = std::min(length, mLeft);
        if (count > 0) mStream->write(buffer, count);
        mLeft -= count;
        mSent += count;
        if (count < length && mThen == Then::Close) mStream->close();
    }

private:
    const std::unique_ptr<Stream> mStream;
    const Then mThen;
    std::size_t mLeft;
    std::size_t mSent = 0;
};

class ServerPeers : public ServerFixture {
protected:
    static constexpr std::chrono::milliseconds kTime{100}; // of what is to pass

    void make(ServerOptions options)
    {
        options.listen = {};
        ServerFixture::make(options);
        mThreads = threads();
    }

    std::unique_ptr<CutStream> connectCut(std::size_t bytes, CutStream::Then then)
    {
        return std::make_unique<CutStream>(connectInMemory("a peer"), bytes, then);
    }

    /// Introduces itself, asks for the limits, and leaves. @return how many bytes that took, or as many as were sent
    std::size_t talkPlain(std::size_t bytes, CutStream::Then then)
    {
        const auto stream = connectCut(bytes, then);
        return talk(*stream, *stream);
    }
    std::size_t talkTls(std::size_t bytes, CutStream::Then then)
    {
        auto stream = connectCut(bytes, then);
        CutStream& below = *stream;
        try {
            askForTls(*stream);
            SSLStream tls(clientContext(), std::move(stream));
            tls.handshake();
            return talk(tls, below);
        } catch (const StreamIOException&) {
            return bytes;
        }
    }

    static std::size_t talk(Stream& stream, const CutStream& below)
    {
        try {
            EXPECT_EQ(introduce(stream, "the peer"), 0U);
            LoopbackMessages(stream).ask(QelMessageGetInterfaceLimitsReq());
        } catch (const StreamIOException&) { // NOLINT(bugprone-empty-catch): what the test is about
        }
        return below.sent();
    }

    /// Nothing is left of a connection: neither its identity nor a thread.
    void expectForgotten()
    {
        EXPECT_TRUE(comesTrue([&] {
            std::ostringstream text;
            server->dumpStatistics(text); // drops what has ended
            return text.str() == "No console is connected.\n" && threads() <= mThreads;
        }));
    }

private:
    static std::size_t threads()
    {
        namespace fs = std::filesystem;
        return static_cast<std::size_t>(std::distance(fs::directory_iterator("/proc/self/task"), {}));
    }

    std::size_t mThreads = 0; // without connections; some of an earlier test may still be ending
};

TEST_F(ServerPeers, MayCloseAfterAnyByte)
{
    make(plainOptions());
    const std::size_t all = talkPlain(kAll, CutStream::Then::Close);
    ASSERT_EQ(all, 112U);
    for (std::size_t bytes = 0; bytes < all; ++bytes) {
        SCOPED_TRACE(bytes);
        talkPlain(bytes, CutStream::Then::Close);
        expectForgotten(); // so the next one may have the same identity
    }
    EXPECT_EQ(talkPlain(kAll, CutStream::Then::Close), all);
}

TEST_F(ServerPeers, MayCloseAfterAnyByteOfTls)
{
    make(tlsOptions());
    const std::size_t all = talkTls(kAll, CutStream::Then::Close);
    ASSERT_GT(all, 1000U);
    for (std::size_t bytes = 0; bytes < all; bytes += 41) {
        SCOPED_TRACE(bytes);
        talkTls(bytes, CutStream::Then::Close);
        expectForgotten();
    }
    EXPECT_NEAR(static_cast<double>(talkTls(kAll, CutStream::Then::Close)), static_cast<double>(all), 20); // signatures
}

TEST_F(ServerPeers, AreClosedWhenTheyStopBeforeTheyAreIdentified)
{
    ServerOptions options = plainOptions();
    options.handshakeTimeout = kTime;
    make(options);
    for (const std::size_t bytes : {0U, 1U, 8U, 31U, 79U}) {
        SCOPED_TRACE(bytes);
        EXPECT_EQ(talkPlain(bytes, CutStream::Then::Stall), bytes);
        expectForgotten();
    }
    EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not introduce itself in time"));
}

TEST_F(ServerPeers, AreClosedWhenTheyStopInTheStepsToTls)
{
    make(tlsOptions());
    const std::size_t all = talkTls(kAll, CutStream::Then::Close);
    ServerOptions options = tlsOptions();
    options.handshakeTimeout = kTime;
    make(options);
    for (const std::size_t bytes :
         {std::size_t{0}, std::size_t{31}, std::size_t{32}, std::size_t{33}, std::size_t{300}, all / 2, all - 200}) {
        SCOPED_TRACE(bytes);
        talkTls(bytes, CutStream::Then::Stall);
        expectForgotten();
    }
}

TEST_F(ServerPeers, AreClosedWhenTheyStopInsideATlsRecord)
{
    for (const std::size_t bytes : {1U, 4U, 5U, 20U}) {
        SCOPED_TRACE(bytes);
        ServerOptions options = tlsOptions();
        options.frameTimeout = kTime;
        make(options);
        auto below = connectCut(kAll, CutStream::Then::Stall);
        CutStream& cut = *below;
        askForTls(cut);
        SSLStream console(clientContext(), std::move(below));
        console.handshake();
        EXPECT_EQ(introduce(console, "x"), 0U);
        cut.cutAfter(bytes);
        LoopbackMessages messages(console);
        messages.send(QelMessageGetQelTodReq());
        EXPECT_TRUE(messages.isClosed());
        expectForgotten();
        EXPECT_THAT(log.lines(), Contains("W: [qel] console 1: closed, it did not finish a message in time"));
        log.clear();
    }
}

} // namespace

} // namespace qel::test
