// TLS streams against each other and against peers of every kind, each case over a connection in memory and over one of
// TCP: what exactly fails, at which end, in which state that leaves it, and what stands in the log.

#include <qel/common/LogLevel.hpp>
#include <qel/common/QelLogger.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>

#include "support/CapturedLog.hpp"
#include "support/HookedStream.hpp"
#include "support/MemoryStreamPair.hpp"
#include "support/RawTlsPeer.hpp"
#include "support/SettableClock.hpp"
#include "support/TlsKit.hpp"

#include <algorithm>
#include <chrono>
#include <exception>
#include <functional>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <openssl/x509_vfy.h>
#include <ostream>
#include <string>
#include <thread>
#include <tuple>
#include <utility>
#include <vector>

namespace qel {
namespace {

using std::chrono::milliseconds;
using test::clientContext;
using test::connectStreams;
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
using ::testing::Each;
using ::testing::IsEmpty;

using Lines = std::vector<std::string>;

const std::string kInvalidState = "StreamIOException: Invalid state for SSL stream operation";
const std::string kSSLError1 = "StreamIOException: SSL error 1";
const std::string kSSLError6 = "StreamIOException: SSL error 6";
const std::string kEOF = "StreamIOException: EOF";

const std::string kUnrecoverable1 = "E: SSL stream encountered unrecoverable error code 0x00000001";
const std::string kUnrecoverable6 = "E: SSL stream encountered unrecoverable error code 0x00000006";
const std::string kEOFInHandshake = "E: SSLStream: EOF during handshake";
const std::string kLibssl = "E: [libssl]";

/// The lines of an end that takes what comes for no proper TLS.
const Lines kRefusal = {kUnrecoverable1, kLibssl};

/// The lines of an end that refuses the certificate of the other.
Lines refusedCertificate(long reason)
{
    return {kUnrecoverable1, kLibssl,
            std::string("E: SSL peer certificate verification failed: ") + X509_verify_cert_error_string(reason)};
}

/// The lines of an end whose peer goes away when the TLS handshake is done for this end.
Lines endedAfterHandshake()
{
    Lines lines = handshakeLines();
    lines.resize(3);
    lines.push_back(kEOFInHandshake);
    return lines;
}

std::string nameOf(Transport transport) { return transport == Transport::Memory ? "Memory" : "Tcp"; }

/// Lets another thread do something and waits for it.
void elsewhere(const std::function<void()>& work) { std::thread(work).join(); }

// Certificates

/// Two of our ends, and how they fail. An end without an identity has a context without credentials.
struct CredentialsRow {
    std::string name;
    const Identity* client;
    const Identity* server;
    std::string clientFailure;
    Lines clientLog;
    std::string serverFailure;
    Lines serverLog;
};

void PrintTo(const CredentialsRow& row, std::ostream* os) { *os << row.name; }

const Identity kClient = Identity::Client;
const Identity kServer = Identity::Server;
const Identity kExpired = Identity::Expired;
const Identity kNotYetValid = Identity::NotYetValid;
const Identity kOtherRoot = Identity::OtherRoot;
const Identity kWithSubjectOfRoot = Identity::WithSubjectOfRoot;
const Identity kWithKeyOfAnother = Identity::WithKeyOfAnother;
const Identity kStranger = Identity::Stranger;

/// The server refuses the client, for whom the TLS handshake is over by then.
CredentialsRow refusedClient(const std::string& name, const Identity* client, long reason)
{
    return {name, client, &kServer, kEOF, endedAfterHandshake(), kSSLError1, refusedCertificate(reason)};
}

CredentialsRow refusedServer(const std::string& name, const Identity* client, const Identity* server, long reason)
{
    return {name, client, server, kSSLError1, refusedCertificate(reason), kEOF, {kEOFInHandshake}};
}

std::vector<CredentialsRow> credentialsRows()
{
    return {
        refusedClient("ClientExpired", &kExpired, X509_V_ERR_CERT_HAS_EXPIRED),
        refusedClient("ClientNotYetValid", &kNotYetValid, X509_V_ERR_CERT_NOT_YET_VALID),
        refusedClient("ClientOfAnotherRoot", &kOtherRoot, X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT_LOCALLY),
        refusedClient("ClientWithSubjectOfRoot", &kWithSubjectOfRoot, X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT),
        refusedServer("ServerExpired", &kClient, &kExpired, X509_V_ERR_CERT_HAS_EXPIRED),
        refusedServer("ServerNotYetValid", &kClient, &kNotYetValid, X509_V_ERR_CERT_NOT_YET_VALID),
        refusedServer("ServerOfAnotherRoot", &kClient, &kOtherRoot, X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT_LOCALLY),
        refusedServer("ServerWithSubjectOfRoot", &kClient, &kWithSubjectOfRoot, X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT),
        refusedServer("BothExpired", &kExpired, &kExpired, X509_V_ERR_CERT_HAS_EXPIRED),
        // The server sends its root along, and the client trusts nobody.
        refusedServer("ClientWithoutCredentials", nullptr, &kServer, X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN),
        refusedServer("ClientOfAnotherAuthority", &kStranger, &kServer, X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN),
        // Their own credentials were refused. Nobody's certificate is, so no line says that one was.
        {"ClientWithoutCertificate", &kWithKeyOfAnother, &kServer, kEOF, endedAfterHandshake(), kSSLError1, kRefusal},
        {"ServerWithoutCertificate", &kClient, &kWithKeyOfAnother, kEOF, {kEOFInHandshake}, kSSLError1, kRefusal},
        {"ServerWithoutCredentials", &kClient, nullptr, kEOF, {kEOFInHandshake}, kSSLError1, kRefusal},
        {"NobodyHasCredentials", nullptr, nullptr, kEOF, {kEOFInHandshake}, kSSLError1, kRefusal},
    };
}

SSLContext& contextFor(const Identity* client)
{
    static SSLClientContext bare;
    if (client == nullptr) return bare;
    return clientContext(*client);
}

SSLContext& serverContextFor(const Identity* server)
{
    static SSLServerContext bare;
    if (server == nullptr) return bare;
    return serverContext(*server);
}

class SSLStreamCredentials : public TlsTest,
                             public ::testing::WithParamInterface<std::tuple<CredentialsRow, Transport>> {};

INSTANTIATE_TEST_SUITE_P(Matrix, SSLStreamCredentials,
                         ::testing::Combine(::testing::ValuesIn(credentialsRows()),
                                            ::testing::Values(Transport::Memory, Transport::Tcp)),
                         [](const auto& row) { return std::get<0>(row.param).name + nameOf(std::get<1>(row.param)); });

TEST_P(SSLStreamCredentials, AreRefused)
{
    const auto& [row, transport] = GetParam();
    StreamPair streams = connectStreams(transport);
    SSLStream client(contextFor(row.client), std::move(streams.client));
    SSLStream server(serverContextFor(row.server), std::move(streams.server));
    const Outcomes outcomes = shakeHands(client, server);

    EXPECT_EQ(outcomes.server.failure, row.serverFailure);
    EXPECT_EQ(outcomes.server.log, row.serverLog);
    EXPECT_EQ(server.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(server.getPeerCertificate(), nullptr);

    EXPECT_EQ(client.getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(client.getPeerCertificate(), nullptr);
    // A refused client may still be writing when the server is gone already.
    if (transport == Transport::Tcp && outcomes.client.failure == "StreamIOException: socket stream send failure")
        return;
    EXPECT_EQ(outcomes.client.failure, row.clientFailure);
    EXPECT_EQ(outcomes.client.log, row.clientLog);
}

/// "socket stream send failure" or what a stream in memory says: this end has been closed.
auto failsClosed()
{
    return AnyOf("StreamIOException: memory stream closed", "StreamIOException: socket stream send failure");
}

// Our end in either role against OpenSSL alone

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

    /// Our end does its handshake while the peer does its own part. @return how ours went
    Outcome shakeHands(const std::function<void()>& peer)
    {
        const auto ours = [this] { mStream->handshake(); };
        const Outcomes outcomes = weAreClient() ? runEnds(mLog, ours, peer) : runEnds(mLog, peer, ours);
        EXPECT_EQ((weAreClient() ? outcomes.server : outcomes.client).failure, "");
        return weAreClient() ? outcomes.client : outcomes.server;
    }

    /// Both ends are encrypted afterwards, and the log is empty.
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

    /// The handshake has failed like this.
    void expectFailed(const Outcome& outcome, const std::string& failure, const Lines& log)
    {
        EXPECT_EQ(outcome.failure, failure);
        EXPECT_EQ(outcome.log, log);
        EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_CLOSED);
        EXPECT_EQ(here([this] { mStream->handshake(); }).failure, kInvalidState);
    }

    /// What has arrived ends the connection, and nobody tells the peer why.
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

// A peer that offers the wrong thing

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
    // A client has done its TLS handshake by the time it is refused. A server cannot even begin, and says so.
    const Outcome outcome = shakeHands([this] { EXPECT_EQ(mPeer->handshake(), !weAreClient()); });
    expectFailed(outcome, kSSLError1, kRefusal);
}

TEST_P(SSLStreamAgainst, APeerThatDoesNotVerifyIsServedAllTheSame)
{
    RawTlsPeer::Options options = usualOptions();
    options.verifiesPeer = weAreClient(); // a server must ask for our certificate, a client need not look at it
    connect(options);
    writeText(*mStream, "hello");
    EXPECT_EQ(mPeer->read(5), "hello");
}

// A peer that talks no proper TLS

TEST_P(SSLStreamAgainst, APeerThatIsNotThereIsTheEnd)
{
    const std::unique_ptr<Stream> peer = makeOurEnd();
    peer->close();
    expectFailed(here([this] { mStream->handshake(); }), kEOF, {kEOFInHandshake});
}

TEST_P(SSLStreamAgainst, AnythingButTLSIsRefused)
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

TEST_P(SSLStreamAgainst, ARecordThatIsCutOffInTheHandshakeIsTheEnd)
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

TEST_P(SSLStreamAgainst, APeerThatGoesAwayInTheMiddleOfTheHandshakeIsTheEnd)
{
    make();
    const Outcome outcome = shakeHands([this] {
        mPeer->beginHandshake();
        EXPECT_NE(readSome(mPeer->stream(), 10000), ""); // the offer, or the answer to it
        mPeer->stream().close();
    });
    expectFailed(outcome, kEOF, {kEOFInHandshake});
}

TEST_P(SSLStreamAgainst, APeerThatGoesAwayBeforeItsVersionIsTheEnd)
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

TEST_P(SSLStreamAgainst, TakesOneByteWhenTheVersionSharesItsRecordWithData)
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
    // All that the handshake still waits for is the peer's version, and that arrives. In between somebody closes.
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

TEST_P(SSLStreamAgainst, NamesNoPeerInTheMiddleOfTheHandshake)
{
    make();
    // By the last transfer the peer's certificate is known; the handshake is not over, though.
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

TEST_P(SSLStreamAgainst, CloseNotifyIsAFailureAndNotTheEnd)
{
    connect();
    mPeer->closeNotify();
    expectFatalRead(kSSLError6, {kUnrecoverable6});
}

TEST_P(SSLStreamAgainst, DataInFrontOfCloseNotifyIsReadByWhoAsksForNoMore)
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

TEST_P(SSLStreamAgainst, DataInFrontOfCloseNotifyIsLostToWhoAsksForMore)
{
    connect();
    mPeer->hold();
    mPeer->write("hello");
    mPeer->closeNotify();
    mPeer->release();
    expectFatalRead(kSSLError6, {decryptedLine(5), kUnrecoverable6});
}

TEST_P(SSLStreamAgainst, DataInFrontOfABadRecordIsLostToWhoAsksForMore)
{
    connect();
    const std::string hello = mPeer->protectedRecord(23, "hello");
    mPeer->sendBytes(hello + std::string(100, 'x'));
    expectFatalRead(kSSLError1, {decryptedLine(5), kUnrecoverable1, kLibssl});
}

TEST_P(SSLStreamAgainst, TheEndOfTheStreamUnderneathIsTheEndAndNotAFailure)
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

TEST_P(SSLStreamAgainst, ARecordThatIsCutOffReadsAsTheEnd)
{
    connect();
    const std::string record = mPeer->protectedRecord(23, "hello");
    mPeer->sendBytes(record.substr(0, record.size() - 1));
    mPeer->stream().close();
    EXPECT_EQ(readSome(*mStream, 10), "");
    EXPECT_EQ(mStream->getStatus(), SSLStream::STATUS_ENCRYPTED);
}

TEST_P(SSLStreamAgainst, NewKeysOfThePeerChangeNothingElse)
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

TEST_P(SSLStreamAgainst, AReaderSendsNoAnswerToNewKeys)
{
    connect();
    mHooks.beforeWrite = [] { ADD_FAILURE() << "something is sent"; };
    mPeer->updateKeys(true);
    mPeer->write("x");
    EXPECT_EQ(readSome(*mStream, 10), "x");
}

TEST_P(SSLStreamAgainst, OneDemandForNewKeysInTheMiddleOfAWriteIsMet)
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

TEST_P(SSLStreamAgainst, TwoDemandsForNewKeysInTheMiddleOfAWriteAreFatal)
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

TEST_P(SSLStreamAgainst, RecordsThatAreNoneAreFatal)
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

TEST_P(SSLStreamAgainst, RecordsMadeByHandAreReadWhenTheyAreProper)
{
    connect();
    mPeer->sendBytes(mPeer->protectedRecord(23, "hello"));
    EXPECT_EQ(readExactly(*mStream, 5), "hello");
    mPeer->sendBytes(mPeer->protectedRecord(23, std::string())); // no data at all
    mPeer->sendBytes(mPeer->protectedRecord(23, pattern(16384)));
    EXPECT_EQ(readExactly(*mStream, 16384), pattern(16384));
}

// Two of our ends

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

TEST_P(SSLStreamOver, ClosingFromAnotherThreadWhileNobodyUsesIt)
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
    // Nobody reads, so it cannot get far.
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
    // Whole records may have gone out before; beyond that, nothing of TLS is to be said.
    EXPECT_THAT(outcome.log, Each(encryptedLine(16384)));
    EXPECT_EQ(mClient->getStatus(), SSLStream::STATUS_CLOSED);
    EXPECT_EQ(here([this] { writeText(*mClient, "x"); }).failure, kInvalidState);
}

// One reader and one writer at each end at once

constexpr std::size_t kLotsOfBytes = 24 * 1000 * 1000;
constexpr std::size_t kPeriod = 65521; // a prime, so that no length that matters is a multiple of it

/// Bytes of which any kPeriod in a row repeat themselves: what belongs at position p begins at p % kPeriod.
const std::string& endlessData()
{
    static const std::string data = pattern(kPeriod) + pattern(kPeriod);
    return data;
}

void writeLots(SSLStream& stream, const std::vector<std::size_t>& lengths)
{
    std::size_t turn = 0;
    for (std::size_t position = 0; position < kLotsOfBytes;) {
        const std::size_t length = std::min(lengths[turn++ % lengths.size()], kLotsOfBytes - position);
        stream.write(endlessData().data() + position % kPeriod, length);
        position += length;
    }
}

void readLots(SSLStream& stream, const std::vector<std::size_t>& lengths)
{
    std::vector<char> buffer(*std::max_element(lengths.begin(), lengths.end()));
    std::size_t turn = 0;
    for (std::size_t position = 0; position < kLotsOfBytes;) {
        const std::size_t room = std::min(lengths[turn++ % lengths.size()], kLotsOfBytes - position);
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

// Streams underneath that make it hard

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

TEST(SSLStreamRoom, AConnectionThatTakesTheVersionByteTakesEverything)
{
    // Both ends send their version before they read the other's, so its record must find room underneath.
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

TEST_F(SSLStreamInMemory, AHandshakeGoesOnWhenTheStreamDoes)
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
    mMemory.server().awaitReader(); // it has sent all it can
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

TEST_F(SSLStreamInMemory, ADeadlineCoversAllOfTheHandshakeHoweverSlowlyItArrives)
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
    writeText(mServer, "meanwhile"); // the other direction goes on
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
    EXPECT_EQ(mMemory.client().closeCount(), 2U); // by us and by the writer that failed
}

// Every byte of a handshake

enum class Fault { EndRead, FailRead, FailWrite };

std::string nameOf(Fault fault)
{
    if (fault == Fault::EndRead) return "EndRead";
    return fault == Fault::FailRead ? "FailRead" : "FailWrite";
}

/// Handshakes over connections that break at one byte, for each byte that a handshake moves.
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

    /// @return how many bytes a handshake moves in the direction of the fault
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
        // The other end may have all it needs by then.
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
