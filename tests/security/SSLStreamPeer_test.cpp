// TLS streams in both roles against a peer made of OpenSSL alone, over a connection in memory and over TCP.

#include <qel/common/security/SSLStream.hpp>

#include "security/StreamExpectations.hpp"
#include "support/HookedStream.hpp"
#include "support/RawTlsPeer.hpp"
#include "support/TlsKit.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

namespace qel {
namespace {

using test::clientContext;
using test::connectStreams;
using test::decryptedLine;
using test::elsewhere;
using test::endedAfterHandshake;
using test::failsClosed;
using test::handshakeLines;
using test::HookedStream;
using test::Identity;
using test::kEOF;
using test::kEOFInHandshake;
using test::kInvalidState;
using test::kLibssl;
using test::kRefusal;
using test::kSSLError1;
using test::kSSLError6;
using test::kUnrecoverable1;
using test::kUnrecoverable6;
using test::Lines;
using test::nameOf;
using test::Outcome;
using test::Outcomes;
using test::pattern;
using test::RawTlsPeer;
using test::readExactly;
using test::readSome;
using test::runEnds;
using test::serverContext;
using test::StreamPair;
using test::TlsTest;
using test::Transport;
using test::writeText;
using ::testing::AnyOf;

// Our stream in either role against OpenSSL alone

class SSLStreamAgainst : public TlsTest, public ::testing::WithParamInterface<std::tuple<RawTlsPeer::Role, Transport>> {
protected:
    bool weAreClient() const { return std::get<0>(GetParam()) == RawTlsPeer::Server; }
    Transport transport() const { return std::get<1>(GetParam()); }

    RawTlsPeer::Options usualOptions() const
    {
        RawTlsPeer::Options options;
        options.credentials = &test::credentialsOf(weAreClient() ? Identity::Server : Identity::Client);
        return options;
    }

    /// @return the stream of the peer
    std::unique_ptr<Stream> makeOurEnd()
    {
        mPeer.reset();
        mStream.reset();
        StreamPair streams = connectStreams(transport());
        if (!weAreClient()) std::swap(streams.client, streams.server);
        SSLContext& client = clientContext();
        SSLContext& server = serverContext();
        mStream = std::make_unique<SSLStream>(weAreClient() ? client : server,
                                              std::make_unique<HookedStream>(std::move(streams.client), mHooks));
        return std::move(streams.server);
    }

    void make(const RawTlsPeer::Options& options)
    {
        std::unique_ptr<Stream> theirs = makeOurEnd();
        mPeer = std::make_unique<RawTlsPeer>(std::get<0>(GetParam()), options, std::move(theirs));
    }
    void make() { make(usualOptions()); }

    /// Our stream performs its handshake while the peer acts. @return the outcome of ours
    Outcome shakeHands(const std::function<void()>& peer)
    {
        const auto ours = [this] { mStream->handshake(); };
        const Outcomes outcomes = weAreClient() ? runEnds(mLog, ours, peer) : runEnds(mLog, peer, ours);
        EXPECT_EQ((weAreClient() ? outcomes.server : outcomes.client).failure, "");
        return weAreClient() ? outcomes.client : outcomes.server;
    }

    /// Encrypts both ends and clears the log.
    void connect(const RawTlsPeer::Options& options)
    {
        make(options);
        const Outcome outcome = shakeHands([this] {
            ASSERT_TRUE(mPeer->handshake());
            mPeer->exchangeVersions();
        });
        ASSERT_EQ(outcome.failure, "");
        mLog.clear();
    }
    void connect() { connect(usualOptions()); }

    /// Expects that the handshake failed like this.
    void expectFailed(const Outcome& outcome, const std::string& failure, const Lines& log)
    {
        EXPECT_EQ(outcome.failure, failure);
        EXPECT_EQ(outcome.log, log);
        EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_CLOSED);
        EXPECT_EQ(here([this] { mStream->handshake(); }).failure, kInvalidState);
    }

    /// Expects that the received bytes close the connection and that no alert is sent.
    void expectFatalRead(const std::string& failure, const Lines& log)
    {
        const Outcome outcome = here([this] { readSome(*mStream, 100); });
        EXPECT_EQ(outcome.failure, failure);
        EXPECT_EQ(outcome.log, log);
        EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_CLOSED);
        EXPECT_EQ(here([this] { readSome(*mStream, 1); }).failure, kInvalidState);
        EXPECT_EQ(here([this] { writeText(*mStream, "x"); }).failure, kInvalidState);
        EXPECT_EQ(readSome(mPeer->stream(), 100), "") << "an alert was sent";
    }

    HookedStream::Hooks mHooks; // of our end
    std::unique_ptr<SSLStream> mStream;
    std::unique_ptr<RawTlsPeer> mPeer;
};

INSTANTIATE_TEST_SUITE_P(Matrix, SSLStreamAgainst,
                         ::testing::Combine(::testing::Values(RawTlsPeer::Server, RawTlsPeer::Client),
                                            ::testing::Values(Transport::Memory, Transport::Tcp)),
                         [](const auto& row) {
                             return (std::get<0>(row.param) == RawTlsPeer::Server ? "Server" : "Client") +
                                    nameOf(std::get<1>(row.param));
                         });

// Peers with the wrong version or without a certificate

TEST_P(SSLStreamAgainst, APeerThatOffersOnlyTLS12IsRefused)
{
    RawTlsPeer::Options options = usualOptions();
    options.minimumVersion = TLS1_2_VERSION;
    options.maximumVersion = TLS1_2_VERSION;
    make(options);
    const Outcome outcome = shakeHands([this] { EXPECT_FALSE(mPeer->handshake()); });
    expectFailed(outcome, kSSLError1, kRefusal);
}

TEST_P(SSLStreamAgainst, APeerThatAlsoOffersTLS12GetsTLS13)
{
    RawTlsPeer::Options options = usualOptions();
    options.minimumVersion = TLS1_2_VERSION;
    make(options);
    const Outcome outcome = shakeHands([this] {
        ASSERT_TRUE(mPeer->handshake());
        mPeer->exchangeVersions();
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_EQ(outcome.log, handshakeLines());
}

TEST_P(SSLStreamAgainst, APeerWithoutACertificateIsRefused)
{
    RawTlsPeer::Options options;
    options.verifiesPeer = false;
    make(options);
    // A client has completed its TLS handshake when it is refused. A server cannot begin, and fails.
    const Outcome outcome = shakeHands([this] { EXPECT_EQ(mPeer->handshake(), !weAreClient()); });
    expectFailed(outcome, kSSLError1, kRefusal);
}

TEST_P(SSLStreamAgainst, APeerThatDoesNotVerifyIsServed)
{
    RawTlsPeer::Options options = usualOptions();
    options.verifiesPeer = weAreClient(); // a server must request our certificate, a client need not verify ours
    connect(options);
    writeText(*mStream, "hello");
    EXPECT_EQ(mPeer->read(5), "hello");
}

// Peers that send invalid TLS

TEST_P(SSLStreamAgainst, AnAbsentPeerIsTheEndOfTheStream)
{
    const std::unique_ptr<Stream> peer = makeOurEnd();
    peer->close();
    expectFailed(here([this] { mStream->handshake(); }), kEOF, {kEOFInHandshake});
}

TEST_P(SSLStreamAgainst, BytesThatAreNotTLSAreRefused)
{
    const std::vector<std::pair<std::string, std::string>> rows = {
        {"letters", std::string(100, 'x')},
        {"zeros", std::string(100, '\0')},
        {"a request of HTTP", "GET / HTTP/1.1\r\n\r\n"},
        {"a frame", std::string("\xDE\xCA\xFF\x20\0\0\0\x20", 8) + std::string(24, '\0')},
        {"a record of unknown type", std::string("\x63\x03\x01\x00\x05hello", 10)},
        {"a record too long", "\x16\x03\x03\xFF\xFF" + std::string(100, '\1')},
        {"a record just too long", "\x16\x03\x03\x41\x01" + std::string(0x4101, '\1')},
        {"a record of another version", std::string("\x16\x05\x00\x00\x05\x01\x00\x00\x01\x00", 10)},
        {"data in the clear", std::string("\x17\x03\x03\x00\x05hello", 10)},
        {"a fatal alert", std::string("\x15\x03\x03\x00\x02\x02\x28", 7)},
        {"a finished", std::string("\x16\x03\x03\x00\x04\x14\x00\x00\x00", 9)},
    };
    for (const auto& [name, bytes] : rows) {
        SCOPED_TRACE(name);
        const std::unique_ptr<Stream> peer = makeOurEnd();
        writeText(*peer, bytes);
        expectFailed(here([this] { mStream->handshake(); }), kSSLError1, kRefusal);
        // Nothing follows but what a client has said first.
        const std::string answer = readSome(*peer, 10000);
        EXPECT_EQ(answer.empty(), !weAreClient());
        if (!answer.empty()) {
            EXPECT_EQ(readSome(*peer, 1), "");
        }
    }
}

TEST_P(SSLStreamAgainst, ATruncatedRecordInTheHandshakeIsTheEnd)
{
    for (const std::string& bytes : {std::string("\x16"), std::string("\x16\x03\x03\x00\x7A"),
                                     std::string("\x16\x03\x03\x00\x7A\x02\x00\x00", 8)}) {
        SCOPED_TRACE(bytes.size());
        const std::unique_ptr<Stream> peer = makeOurEnd();
        writeText(*peer, bytes);
        peer->close();
        expectFailed(here([this] { mStream->handshake(); }), kEOF, {kEOFInHandshake});
    }
}

TEST_P(SSLStreamAgainst, APeerThatClosesDuringTheHandshakeIsTheEnd)
{
    make();
    const Outcome outcome = shakeHands([this] {
        mPeer->beginHandshake();
        EXPECT_NE(readSome(mPeer->stream(), 10000), ""); // the offer, or the answer to it
        mPeer->stream().close();
    });
    expectFailed(outcome, kEOF, {kEOFInHandshake});
}

TEST_P(SSLStreamAgainst, APeerThatClosesBeforeItsVersionIsTheEnd)
{
    make();
    const Outcome outcome = shakeHands([this] {
        ASSERT_TRUE(mPeer->handshake());
        mPeer->stream().close();
    });
    expectFailed(outcome, kEOF, endedAfterHandshake());
}

// The protocol versions

TEST_P(SSLStreamAgainst, SendsVersion0AndAcceptsAnyVersion)
{
    for (const char version : {'\0', '\x01', '\x7F', '\xFF'}) {
        SCOPED_TRACE(static_cast<int>(version));
        make();
        std::string received;
        const Outcome outcome = shakeHands([this, version, &received] {
            ASSERT_TRUE(mPeer->handshake());
            mPeer->write(std::string(1, version));
            received = mPeer->read(1);
        });
        EXPECT_EQ(outcome.failure, "");
        EXPECT_EQ(outcome.log, handshakeLines());
        EXPECT_EQ(received, std::string(1, '\0'));
        EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_ENCRYPTED);
    }
}

TEST_P(SSLStreamAgainst, ReadsOneByteWhenTheVersionSharesItsRecordWithData)
{
    make();
    const Outcome outcome = shakeHands([this] {
        ASSERT_TRUE(mPeer->handshake());
        mPeer->write("\x7Fhello");
        mPeer->read(1);
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_EQ(readSome(*mStream, 100), "hello");
}

TEST_P(SSLStreamAgainst, StaysClosedWhenItIsClosedAtTheEndOfTheHandshake)
{
    make();
    // The handshake only waits for the peer's version, which arrives. Another thread closes just before.
    mHooks.afterRead = [this] {
        for (const std::string& line : mLog.lines()) {
            if (line == "D: SSLStream: protocol init write complete") elsewhere([this] { mStream->close(); });
        }
    };
    const Outcome outcome = shakeHands([this] {
        ASSERT_TRUE(mPeer->handshake());
        ASSERT_EQ(mPeer->read(1), std::string(1, '\0'));
        mPeer->write("v");
    });
    Lines expected = handshakeLines();
    expected.resize(4); // all but the last, which says that it is complete
    EXPECT_EQ(outcome.failure, kInvalidState);
    EXPECT_EQ(outcome.log, expected);
    EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_P(SSLStreamAgainst, ReturnsNoPeerCertificateDuringTheHandshake)
{
    make();
    // At the last transfer the peer's certificate is known, but the handshake is not complete.
    unsigned looks = 0;
    mHooks.afterRead = mHooks.beforeRead = [this, &looks] {
        ++looks;
        EXPECT_EQ(mStream->getPeerCertificate(), nullptr);
        EXPECT_EQ(mStream->getCipher(), "");
    };
    const Outcome outcome = shakeHands([this] {
        ASSERT_TRUE(mPeer->handshake());
        mPeer->exchangeVersions();
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_GE(looks, 2U);
}

// What a peer may send after the handshake

TEST_P(SSLStreamAgainst, CloseNotifyIsAFailure)
{
    connect();
    mPeer->closeNotify();
    expectFatalRead(kSSLError6, {kUnrecoverable6});
}

TEST_P(SSLStreamAgainst, DataBeforeCloseNotifyIsDeliveredToAnExactRead)
{
    connect();
    mPeer->hold();
    mPeer->write("hello");
    mPeer->closeNotify();
    mPeer->release();
    EXPECT_EQ(readSome(*mStream, 5), "hello");
    mLog.clear();
    expectFatalRead(kSSLError6, {kUnrecoverable6});
}

TEST_P(SSLStreamAgainst, DataBeforeCloseNotifyIsLostToALongerRead)
{
    connect();
    mPeer->hold();
    mPeer->write("hello");
    mPeer->closeNotify();
    mPeer->release();
    expectFatalRead(kSSLError6, {decryptedLine(5), kUnrecoverable6});
}

TEST_P(SSLStreamAgainst, DataBeforeABadRecordIsLostToALongerRead)
{
    connect();
    const std::string hello = mPeer->protectedRecord(23, "hello");
    mPeer->sendBytes(hello + std::string(100, 'x'));
    expectFatalRead(kSSLError1, {decryptedLine(5), kUnrecoverable1, kLibssl});
}

TEST_P(SSLStreamAgainst, TheEndOfTheUnderlyingStreamIsTheEnd)
{
    connect();
    mPeer->write("bye");
    mPeer->stream().close();
    const Outcome outcome = here([this] {
        EXPECT_EQ(readExactly(*mStream, 3), "bye");
        EXPECT_EQ(readSome(*mStream, 10), "");
        EXPECT_EQ(readSome(*mStream, 10), "");
    });
    EXPECT_EQ(outcome.failure, "");
    EXPECT_EQ(outcome.log, Lines{decryptedLine(3)});
    EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_P(SSLStreamAgainst, ATruncatedRecordReadsAsTheEnd)
{
    connect();
    const std::string record = mPeer->protectedRecord(23, "hello");
    mPeer->sendBytes(record.substr(0, record.size() - 1));
    mPeer->stream().close();
    EXPECT_EQ(readSome(*mStream, 10), "");
    EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_P(SSLStreamAgainst, AKeyUpdateOfThePeerChangesNothingElse)
{
    connect();
    for (const bool answered : {false, true, false, true}) {
        SCOPED_TRACE(answered);
        mPeer->write("old keys");
        mPeer->updateKeys(answered);
        mPeer->write("new keys");
        EXPECT_EQ(readExactly(*mStream, 16), "old keysnew keys");
        // The answer that was asked for goes out with the next write.
        writeText(*mStream, "and back");
        EXPECT_EQ(mPeer->read(8), "and back");
    }
    EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_P(SSLStreamAgainst, AReaderDoesNotAnswerAKeyUpdate)
{
    connect();
    mHooks.beforeWrite = [] { ADD_FAILURE() << "something is sent"; };
    mPeer->updateKeys(true);
    mPeer->write("x");
    EXPECT_EQ(readSome(*mStream, 10), "x");
}

TEST_P(SSLStreamAgainst, OneKeyUpdateRequestDuringAWriteIsAnswered)
{
    connect();
    bool read = false;
    mHooks.beforeWrite = [this, &read] {
        if (std::exchange(read, true)) return;
        mPeer->updateKeys(true);
        mPeer->write("x");
        EXPECT_EQ(readSome(*mStream, 10), "x");
    };
    writeText(*mStream, pattern(20000));
    EXPECT_EQ(mPeer->read(20000), pattern(20000));
    writeText(*mStream, "new keys");
    EXPECT_EQ(mPeer->read(8), "new keys");
}

TEST_P(SSLStreamAgainst, TwoKeyUpdateRequestsDuringAWriteAreFatal)
{
    connect();
    bool read = false;
    mHooks.beforeWrite = [this, &read] {
        if (std::exchange(read, true)) return;
        mPeer->updateKeys(true);
        mPeer->updateKeys(true);
        mPeer->write("x");
        const Outcome reader = here([this] { readSome(*mStream, 10); });
        EXPECT_EQ(reader.failure, kSSLError1);
        EXPECT_EQ(reader.log, kRefusal);
    };
    EXPECT_THAT(here([this] { writeText(*mStream, pattern(20000)); }).failure,
                AnyOf(failsClosed(), "StreamIOException: SSL error 5"));
    EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_CLOSED);
}

TEST_P(SSLStreamAgainst, TicketsOfAServerAreAccepted)
{
    RawTlsPeer::Options options = usualOptions();
    options.tickets = 2;
    connect(options);
    mPeer->write("hello");
    EXPECT_EQ(readExactly(*mStream, 5), "hello");
}

/// A message of the TLS handshake: its type, its length and its content (RFC 8446, 4).
std::string handshakeMessage(char type, const std::string& content)
{
    return std::string({type, '\0', '\0', static_cast<char>(content.size())}) + content;
}

TEST_P(SSLStreamAgainst, HandshakeMessagesAfterTheHandshakeAreFatal)
{
    std::vector<std::pair<std::string, std::string>> rows = {
        {"hello request", handshakeMessage(0, "")},
        {"client hello", handshakeMessage(1, "\x03\x03" + std::string(40, '\0'))},
        {"server hello", handshakeMessage(2, "\x03\x03" + std::string(40, '\0'))},
        {"certificate request", handshakeMessage(13, std::string(3, '\0'))},
        {"finished", handshakeMessage(20, std::string(48, '\0'))},
    };
    if (!weAreClient()) rows.emplace_back("ticket for a server", handshakeMessage(4, std::string(20, '\0')));
    for (const auto& [name, message] : rows) {
        SCOPED_TRACE(name);
        connect();
        mPeer->sendBytes(mPeer->protectedRecord(22, message));
        expectFatalRead(kSSLError1, kRefusal);
    }
}

TEST_P(SSLStreamAgainst, InvalidRecordsAreFatal)
{
    const auto spoiled = [this](std::size_t at) {
        std::string record = mPeer->protectedRecord(23, "hello");
        record.at(at) = static_cast<char>(record.at(at) ^ 1);
        return record;
    };
    const std::vector<std::pair<std::string, std::function<std::string()>>> rows = {
        {"garbage", [] { return std::string(100, 'x'); }},
        {"wrong version in the header", [&] { return spoiled(2); }},
        {"spoiled ciphertext", [&] { return spoiled(5); }},
        {"spoiled tag", [&] { return spoiled(5 + 6); }},
        {"longest length", [] { return "\x17\x03\x03\xFF\xFF" + std::string(100, 'x'); }},
        {"length just too long", [] { return "\x17\x03\x03\x41\x01" + std::string(0x4101, 'x'); }},
        {"too short for a tag", [] { return std::string("\x17\x03\x03\x00\x05hello", 10); }},
        {"too much data", [this] { return mPeer->protectedRecord(23, pattern(16385)); }},
        {"unknown type", [this] { return mPeer->protectedRecord(99, "hello"); }},
        {"no type", [this] { return mPeer->protectedRecord(0, std::string(5, '\0')); }},
        {"not encrypted", [] { return std::string("\x16\x03\x03\x00\x04\x00\x00\x00\x00", 9); }},
        {"fatal alert", [this] { return mPeer->protectedRecord(21, "\x02\x28"); }},
        {"record out of turn",
         [this] {
             mPeer->protectedRecord(23, "first");
             return mPeer->protectedRecord(23, "second");
         }},
    };
    for (const auto& [name, bytes] : rows) {
        SCOPED_TRACE(name);
        connect();
        mPeer->sendBytes(bytes());
        expectFatalRead(kSSLError1, kRefusal);
    }
}

TEST_P(SSLStreamAgainst, ValidHandMadeRecordsAreRead)
{
    connect();
    mPeer->sendBytes(mPeer->protectedRecord(23, "hello"));
    EXPECT_EQ(readExactly(*mStream, 5), "hello");
    mPeer->sendBytes(mPeer->protectedRecord(23, std::string())); // no data at all
    mPeer->sendBytes(mPeer->protectedRecord(23, pattern(16384)));
    EXPECT_EQ(readExactly(*mStream, 16384), pattern(16384));
}

} // namespace
} // namespace qel
