// From the options to an introduced console: wrong options, addresses, and peers that go wrong at each step of the
// handshake.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/OtherEnd.hpp"
#include "support/CapturedLog.hpp"
#include "support/Errors.hpp"
#include "support/Loopback.hpp"
#include "support/LoopbackEnds.hpp"
#include "support/RawTlsPeer.hpp"
#include "support/TlsCalls.hpp"

#include <cctype>
#include <chrono>
#include <functional>
#include <gmock/gmock.h>
#include <memory>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <optional>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;
using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::StartsWith;

// Options.

struct WrongOption {
    const char* name;
    std::function<void(ConsoleOptions&)> set;
    const char* text;
};

TEST(ConsoleOptions, AWrongOneIsNamed)
{
    const std::vector<WrongOption> rows{
        {"NoProtection", [](auto& options) { options.plain = false; },
         "credentials: neither credentials nor plain are given"},
        {"PlainAndCredentials", [](auto& options) { options.credentials = consoleCredentials(); },
         "plain: it contradicts credentials"},
        {"NamePinsWithPlain", [](auto& options) { options.pins.names = {"server"}; },
         "pins: a plain connection has no certificates"},
        {"FingerprintPinsWithPlain", [](auto& options) { options.pins.fingerprints = {std::string(64, 'a')}; },
         "pins: a plain connection has no certificates"},
        {"LongToolId", [](auto& options) { options.identity.toolId = std::string(33, 'x'); },
         "identity.toolId: longer than 32 bytes"},
        {"NoHandshakeTimeout", [](auto& options) { options.handshakeTimeout = milliseconds(0); },
         "handshakeTimeout: not positive"},
        {"NoRequestTimeout", [](auto& options) { options.requestTimeout = milliseconds(0); }, "requestTimeout: zero"},
        {"NoFrameTimeout", [](auto& options) { options.frameTimeout = milliseconds(-1); },
         "frameTimeout: not positive"},
        {"NegativeBackoff",
         [](auto& options) {
             options.retry = Backoff();
             options.retry->first = milliseconds(-1);
         },
         "retry: the first wait is not positive"},
        {"NoBackoff",
         [](auto& options) {
             options.retry = Backoff();
             options.retry->first = milliseconds(0);
         },
         "retry: the first wait is not positive"},
        {"BackoffBeyondTheLongest",
         [](auto& options) {
             options.retry = Backoff();
             options.retry->first = milliseconds(30001);
         },
         "retry: the first wait is longer than the longest"},
        {"ShrinkingBackoff",
         [](auto& options) {
             options.retry = Backoff();
             options.retry->factor = 0.99;
         },
         "retry: the factor is below 1"},
        {"NoPort", [](auto& options) { options.server = "127.0.0.1"; },
         "server: \"127.0.0.1\" has no port from 1 to 65535 after its last colon"},
        {"AnotherMachine", [](auto& options) { options.server = "192.0.2.1:1"; },
         "plain: 192.0.2.1:1 is not a loopback address"},
    };
    for (const WrongOption& row : rows) {
        SCOPED_TRACE(row.name);
        ConsoleOptions options = consoleOptions(Cover::Plain, "127.0.0.1:1");
        row.set(options);
        EXPECT_THAT([&] { Console console(options); },
                    ::testing::ThrowsMessage<std::invalid_argument>(::testing::StrEq(row.text)));
    }
}

TEST(ConsoleOptions, AFingerprintPinIsChecked)
{
    ConsoleOptions options = consoleOptions(Cover::Tls, "127.0.0.1:1");
    options.pins.fingerprints = {"not one"};
    EXPECT_THAT([&] { Console console(options); }, ::testing::ThrowsMessage<std::invalid_argument>(::testing::StrEq(
                                                       "pins: not a SHA-256 fingerprint: 64 hexadecimal digits")));
}

TEST(ConsoleOptions, AToolIdOf32BytesIsNotTooLong)
{
    OtherEnd end(Cover::Plain, stall);
    ConsoleOptions options = consoleOptions(Cover::Plain);
    options.identity.toolId = std::string(32, 'x');
    EXPECT_NO_THROW(Console(end.takeStream(), options));
}

// Addresses, with real sockets.

/// A server on 127.0.0.1 that welcomes one console.
class OneConsoleServer {
public:
    explicit OneConsoleServer(Cover cover = Cover::Plain)
        : mListener(makeListener()), mThread([this, cover] {
              try {
                  auto socket = std::make_unique<SocketStream>(mListener.accept());
                  socket->setReadDeadline(Loopback::kDeadline);
                  const int descriptor = socket->getSocket().getFd();
                  const auto stream = takeCover(cover, std::move(socket), descriptor);
                  LoopbackMessages messages(*stream);
                  welcome(messages);
                  stall(messages);
              } catch (const std::exception&) { // the console has gone
              }
          })
    {}
    ~OneConsoleServer() { mThread.join(); }

    std::string port() const { return std::to_string(mListener.getSocketName().getPort()); }

private:
    Socket mListener;
    std::thread mThread;
};

TEST(ConsoleConnect, ByAddress)
{
    const OneConsoleServer server;
    const Console console(consoleOptions(Cover::Plain, "127.0.0.1:" + server.port()));
    EXPECT_EQ(console.version().getSystemMachineType(), "type");
    EXPECT_FALSE(console.isProtected());
    EXPECT_GE(console.getPollFd(PollEvents::Read).mFd.fd, 0);
}

int tcpOption(const Console& console, int name)
{
    int value = -1;
    socklen_t length = sizeof(value);
    EXPECT_EQ(::getsockopt(console.getPollFd(PollEvents::Read).mFd.fd, IPPROTO_TCP, name, &value, &length), 0);
    return value;
}

TEST(ConsoleConnect, AServerMayTakeAnyTimeToRead)
{
    // A SocketStream would cut the connection when the server, which is alive, has had no room for data for 60 s.
    const OneConsoleServer server;
    const Console console(consoleOptions(Cover::Plain, "127.0.0.1:" + server.port()));
    EXPECT_EQ(tcpOption(console, TCP_USER_TIMEOUT), 0);
    EXPECT_EQ(tcpOption(console, TCP_KEEPIDLE), 30) << "a server that is gone is still found out";
}

TEST(ConsoleConnect, AServerMayTakeAnyTimeToReadFromASocketOfTheUsers)
{
    Loopback loopback;
    std::thread server([&] {
        LoopbackMessages messages(*loopback.far);
        welcome(messages);
    });
    const Console console(std::move(loopback.near), consoleOptions(Cover::Plain));
    server.join();
    EXPECT_EQ(tcpOption(console, TCP_USER_TIMEOUT), 0);
}

TEST(ConsoleConnect, ByNameWhereNotEveryAddressAnswers)
{
    const OneConsoleServer server; // on 127.0.0.1 only; the name may mean ::1 too
    const Console console(consoleOptions(Cover::Plain, "localhost:" + server.port()));
    EXPECT_EQ(console.getServer(), "localhost:" + server.port());
}

TEST(ConsoleConnect, OverTls)
{
    const OneConsoleServer server(Cover::Tls);
    const CapturedLog log(LogLevel::Info);
    ConsoleOptions options = consoleOptions(Cover::Tls, "localhost:" + server.port());
    options.pins.names = {"another", "server"};
    const Console console(options);
    EXPECT_TRUE(console.isProtected());
    EXPECT_EQ(console.peer().commonName, "server");
    EXPECT_EQ(console.peer().fingerprint.size(), 95U);
    EXPECT_THAT(log.lines(), ::testing::Contains("I: [qel] connected over TLS to \"CN=server\", SHA-256 " +
                                                 console.peer().fingerprint));
}

TEST(ConsoleConnect, WhereNothingListensThereIsNoConnection)
{
    const Socket refusing = makeRefusingSocket();
    const std::string server = refusing.getSocketName().str();
    try {
        const Console console(consoleOptions(Cover::Plain, server));
        ADD_FAILURE() << "connected";
    } catch (const CannotConnect& error) {
        EXPECT_THAT(error.what(),
                    AllOf(StartsWith("cannot connect to " + server + ": "), HasSubstr("111 (Connection refused)")));
        EXPECT_EQ(error.getPeer(), server);
        EXPECT_THROW(std::rethrow_if_nested(error), PosixError);
    }
}

TEST(ConsoleConnect, AServerThatDoesNotAnswerIsNotReachedInTime)
{
    const SilentEndpoint silent;
    const std::string server = silent.endpoint().str();
    ConsoleOptions options = consoleOptions(Cover::Plain, server);
    EXPECT_THAT([&] { Console(options, milliseconds(30)); },
                failsWith<CannotConnect>(StartsWith("cannot connect to " + server + ": socket connect timed out")));
}

TEST(ConsoleConnect, TheHandshakeTimeoutEndsWithTheIntroduction)
{
    OtherEnd end(Cover::Plain, [](LoopbackMessages& messages) {
        const auto request = messages.receive();
        stall(messages);
    });
    ConsoleOptions options = consoleOptions(Cover::Plain);
    options.handshakeTimeout = milliseconds(200);
    options.requestTimeout = milliseconds(300);
    Console console(end.takeStream(), options);
    const auto before = std::chrono::steady_clock::now();
    EXPECT_THROW(console.request(QelMessageGetQelTodReq()), DeadlinePassed);
    EXPECT_GE(std::chrono::steady_clock::now() - before, milliseconds(300));
}

// Peers that go wrong in the handshake. Over a stream in memory; the peer gets the bare stream.

struct Step {
    const char* name;
    OtherEnd::Play play;
    std::string text;
};

std::string frameOf(const QelMessage& message) { return std::string(message.serialize(), message.msgLength()); }
void send(Stream& stream, const std::string& bytes) { stream.write(bytes.data(), bytes.size()); }
void takeRequest(Stream& stream) { awaitUpgrade(stream, -1); }
void takeAll(Stream& stream)
{
    LoopbackMessages messages(stream);
    stall(messages);
}

class ConsoleHandshake : public ::testing::Test {
protected:
    /// Connects to a peer that does this.
    static void connect(const OtherEnd::Play& play, const std::function<void(ConsoleOptions&)>& change = {})
    {
        OtherEnd end(play);
        ConsoleOptions options = consoleOptions(Cover::Tls);
        options.handshakeTimeout = milliseconds(200);
        if (change) change(options);
        const Console console(end.takeStream(), options);
    }

    template <typename T>
    void expect(const std::vector<Step>& steps)
    {
        for (const Step& step : steps) {
            SCOPED_TRACE(step.name);
            EXPECT_THAT([&] { connect(step.play); },
                        failsWith<T>(MatchesRegex("no protected connection to memory:1: " + step.text)));
        }
    }

    const CapturedLog log{LogLevel::Critical};
};

TEST_F(ConsoleHandshake, APeerThatCloses)
{
    const std::string unanswered = "the peer did not answer the request for TLS but ended the connection: EOF";
    expect<ClosedByPeer>({
        {"at once", [](auto) {}, unanswered},
        {"instead of an answer", [](auto stream) { takeRequest(*stream); }, unanswered},
        {"within the answer",
         [](auto stream) {
             takeRequest(*stream);
             send(*stream, frameOf(QelMessageUpgradeConnectionAsync()).substr(0, 31));
         },
         unanswered},
        {"instead of TLS",
         [](auto stream) {
             takeRequest(*stream);
             grantUpgrade(*stream);
         },
         "the peer closed the connection in the TLS handshake, perhaps because it refuses this end's certificate: EOF"},
    });
}

TEST_F(ConsoleHandshake, APeerThatStalls)
{
    expect<DeadlinePassed>({
        {"at once", [](auto stream) { takeAll(*stream); }, "the peer did not answer the request for TLS in time"},
        {"within the answer",
         [](auto stream) {
             takeRequest(*stream);
             send(*stream, frameOf(QelMessageUpgradeConnectionAsync()).substr(0, 31));
             takeAll(*stream);
         },
         "the peer did not answer the request for TLS in time"},
        {"instead of TLS",
         [](auto stream) {
             takeRequest(*stream);
             grantUpgrade(*stream);
             takeAll(*stream);
         },
         "the TLS handshake did not finish in time"},
    });
}

TEST_F(ConsoleHandshake, APeerThatSendsSomethingElse)
{
    const std::string unanswered = "the peer did not answer the request for TLS but sent something else: ";
    expect<ProtocolBroken>({
        {"another message",
         [](auto stream) {
             takeRequest(*stream);
             send(*stream, frameOf(QelMessageGetQelTodReq()));
             takeAll(*stream);
         },
         unanswered + "\\[CID: .*"},
        {"garbage",
         [](auto stream) {
             takeRequest(*stream);
             send(*stream, std::string(64, 'x'));
             takeAll(*stream);
         },
         unanswered + "Invalid length"},
        {"garbage instead of TLS",
         [](auto stream) {
             takeRequest(*stream);
             grantUpgrade(*stream);
             send(*stream, std::string(64, 'x'));
             takeAll(*stream);
         },
         "the TLS handshake failed: SSL error 1"},
        {"a message in the clear instead of TLS",
         [](auto stream) {
             takeRequest(*stream);
             grantUpgrade(*stream);
             send(*stream, frameOf(QelMessageGetQelTodReq()));
             takeAll(*stream);
         },
         "the TLS handshake failed: SSL error 1"},
    });
}

TEST_F(ConsoleHandshake, TheAbortMessageTurnsTheConsoleAway)
{
    expect<TurnedAway>({{"abort",
                         [](auto stream) {
                             takeRequest(*stream);
                             abortHandshake(*stream);
                         },
                         "the server refused this console: it admits no more consoles, is stopping, or does not use "
                         "TLS"}});
}

/// The reason and the text of the certificate that was not accepted.
void expectRejection(const std::function<void()>& connect, CertificateRejected::Reason reason, const std::string& text)
{
    try {
        connect();
        ADD_FAILURE() << "connected";
    } catch (const CertificateRejected& error) {
        EXPECT_EQ(error.getReason(), reason) << error.what();
        EXPECT_THAT(error.what(), MatchesRegex(text));
        EXPECT_EQ(error.getPeer(), "memory:1");
    }
}

TEST_F(ConsoleHandshake, APeerThatClosesInsideTlsHasCrashedOrDoesNotAcceptOurCertificate)
{
    const std::string text = "the server closed the connection right after the TLS handshake; it may not accept this "
                             "console's certificate: EOF";
    EXPECT_THAT([&] { connect([](auto stream) { takeCover(Cover::Tls, std::move(stream)); }); },
                failsWith<ClosedByPeer>(text));
    const auto takingTheRequest = [](auto stream) {
        const auto tls = takeCover(Cover::Tls, std::move(stream));
        LoopbackMessages(*tls).receive();
    };
    EXPECT_THAT([&] { connect(takingTheRequest); }, failsWith<ClosedByPeer>(text));
}

TEST_F(ConsoleHandshake, AnAlertInTheTlsHandshakeRejectsOurCertificate)
{
    // In TLS 1.3 the console's handshake is complete when the server sees the certificate.
    SSLCredentials credentials = Authority::trusted().serverCredentials();
    credentials.mRootCA = Authority::stranger().serverCredentials().mRootCA;
    const auto refusing = [&credentials](auto stream) {
        takeRequest(*stream);
        grantUpgrade(*stream);
        RawTlsPeer::Options options;
        options.credentials = &credentials;
        RawTlsPeer peer(RawTlsPeer::Server, options, std::move(stream));
        EXPECT_FALSE(peer.handshake());
        takeAll(peer.stream());
    };
    expectRejection([&] { connect(refusing); }, CertificateRejected::Reason::OursByThem,
                    "no protected connection to memory:1: the peer refuses this end's certificate: unknown CA \\(TLS "
                    "alert 48\\)");
}

TEST_F(ConsoleHandshake, AnAlertInTheIntroductionRejectsOurCertificate)
{
    const SSLCredentials credentials = Authority::trusted().serverCredentials();
    const auto refusing = [&credentials](char alert) {
        return [&credentials, alert](auto stream) {
            takeRequest(*stream);
            grantUpgrade(*stream);
            RawTlsPeer::Options options;
            options.credentials = &credentials;
            RawTlsPeer peer(RawTlsPeer::Server, options, std::move(stream));
            EXPECT_TRUE(peer.handshake());
            peer.exchangeVersions();
            peer.sendBytes(peer.protectedRecord(21, {2, alert}));
            takeAll(peer.stream());
        };
    };
    constexpr char kAccessDenied = 49;
    constexpr char kInternalError = 80;
    expectRejection([&] { connect(refusing(kAccessDenied)); }, CertificateRejected::Reason::OursByThem,
                    "the server refuses this console's certificate: access denied \\(TLS alert 49\\)");
    EXPECT_THAT([&] { connect(refusing(kInternalError)); },
                failsWith<ClosedByPeer>("the server closed the connection right after the TLS handshake; it may not "
                                        "accept this console's certificate: SSL error 1"));
}

TEST_F(ConsoleHandshake, APeerThatAbortsInsideTlsTurnsTheConsoleAway)
{
    const auto aborting = [](auto stream) {
        const auto tls = takeCover(Cover::Tls, std::move(stream));
        LoopbackMessages messages(*tls);
        messages.receive();
        messages.send(QelMessageAbortHandshakeAsync());
    };
    EXPECT_THAT([&] { connect(aborting); }, failsWith<TurnedAway>("the server turned this console away inside TLS"));
}

TEST_F(ConsoleHandshake, AFailureOfOpenSslIsAnError)
{
    const OtherEnd::Play granting = [](auto stream) {
        takeRequest(*stream);
        grantUpgrade(*stream);
        takeAll(*stream);
    };
    TlsCalls calls;
    calls.BIO_new_bio_pair = [](BIO**, std::size_t, BIO**, std::size_t) { return 0; };
    EXPECT_THAT([&] { connect(granting); },
                failsWith<Error>(StartsWith("no protected connection to memory:1: An SSL error occurred at ")));
}

TEST_F(ConsoleHandshake, APeerThatSaysWhyItClosesInsideTlsIsBelieved)
{
    const auto closing = [](auto stream) {
        const auto tls = takeCover(Cover::Tls, std::move(stream));
        LoopbackMessages messages(*tls);
        messages.receive();
        messages.send(QelMessageKrogConnectionClosedAsync());
    };
    EXPECT_THAT([&] { connect(closing); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

TEST_F(ConsoleHandshake, APeerThatStallsInsideTlsPassesTheDeadline)
{
    const auto stalling = [](auto stream) {
        const auto tls = takeCover(Cover::Tls, std::move(stream));
        takeAll(*tls);
    };
    EXPECT_THAT([&] { connect(stalling); },
                failsWith<DeadlinePassed>("the peer did not answer in time: no response to request 0x6003/0x0101"));
}

TEST_F(ConsoleHandshake, ACertificateOfAnotherRootIsRejected)
{
    const auto credentials = Credentials::fromTexts(Authority::stranger().serverCredentials());
    const auto stranger = [&](auto stream) {
        takeRequest(*stream);
        grantUpgrade(*stream);
        const auto context = credentials.makeServerContext();
        SSLStream tls(*context, std::move(stream));
        startTls(tls);
    };
    expectRejection([&] { connect(stranger); }, CertificateRejected::Reason::TheirsByUs,
                    "no protected connection to memory:1: the peer's certificate is refused: .*");
}

TEST_F(ConsoleHandshake, OnlyAPinnedPeerIsAccepted)
{
    const auto server = [](auto stream) {
        const auto tls = takeCover(Cover::Tls, std::move(stream));
        LoopbackMessages messages(*tls);
        welcome(messages);
        stall(messages);
    };
    expectRejection([&] { connect(server, [](auto& options) {
                              options.pins.names = {"another", "root"};
                          }); },
                    CertificateRejected::Reason::NamePin,
                    "no protected connection to memory:1: wrong peer: the name \"server\" does not match the pinned "
                    "names");
    expectRejection(
        [&] { connect(server, [](auto& options) { options.pins.fingerprints = {std::string(64, 'a')}; }); },
        CertificateRejected::Reason::FingerprintPin,
        "no protected connection to memory:1: wrong peer: the fingerprint .* does not match the pinned fingerprints");
    const std::string fingerprint = [&] {
        OtherEnd end(server);
        return Console(end.takeStream(), consoleOptions(Cover::Tls)).peer().fingerprint;
    }();
    std::string digits;
    for (const char c : fingerprint) {
        if (c != ':') digits += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    }
    EXPECT_NO_THROW(connect(server, [&](auto& options) {
        options.pins.names = {"server"};
        options.pins.fingerprints = {digits};
        options.handshakeTimeout = std::chrono::seconds(10);
    }));
}

} // namespace

} // namespace qel::test
