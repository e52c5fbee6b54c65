#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLValidityPeriod.hpp>

#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <memory>
#include <string>
#include <utility>

namespace qel::tool::check {

namespace {

using namespace anchors;

/// Takes the answer to the first message.
void requireAnswer(Wire& wire, unsigned int operation)
{
    const Frame answer = wire.receive("the message " + messageName(kHandshake, operation));
    Trial::require(answer.isNotice() && answer.is(kHandshake, operation),
                   "the message " + messageName(kHandshake, operation), describeFrame(answer.bytes));
}

/// A first message that must be answered with the upgrade message.
Case isGranted(const char* name, const char* requirement, const char* anchor, Draft first)
{
    return {std::string("tls/upgrade/") + name,
            requirement,
            anchor,
            Level::Wire,
            kTls,
            [first = std::move(first)](Trial& trial) {
                Wire& wire = trial.connectTcp();
                wire.send(first);
                requireAnswer(wire, kUpgrade);
            }};
}

/// A first message that must be answered with the abort message and the end of the connection.
Case isAborted(const char* name, const char* requirement, Draft first)
{
    return {std::string("tls/first/") + name,
            requirement,
            kBeforeFirst,
            Level::Wire,
            kTls,
            [first = std::move(first)](Trial& trial) {
                Wire& wire = trial.connectTcp();
                wire.send(first);
                requireAnswer(wire, kAbort);
                wire.expectEndWithoutFrame();
            }};
}

/// First bytes that are no message: the connection must end, and never be granted TLS.
Case isCut(const char* name, const char* requirement, const char* anchor, std::string bytes)
{
    return {std::string("tls/first/") + name,
            requirement,
            anchor,
            Level::Wire,
            kTls,
            [bytes = std::move(bytes)](Trial& trial) {
                Wire& wire = trial.connectTcp();
                wire.send(bytes);
                wire.endSending();
                Trial::require(wire.drain().find("\x60\x01") == std::string::npos, "the end of the connection",
                               "an answer");
            }};
}

/// What a TLS client sends first, in a version of TLS from 1.0 to 1.2 that offers no newer one.
std::string oldClientHello()
{
    const std::string random(32, '\x5A');
    const std::string suites = std::string("\xC0\x2F\xC0\x30\x00\x9C", 6);
    std::string hello = "\x03\x03" + random + std::string(1, '\0') + bigEndian16(6) + suites + std::string("\x01\0", 2);
    const std::string signatures = bigEndian16(0x000D) + bigEndian16(4) + bigEndian16(2) + "\x04\x01";
    const std::string groups = bigEndian16(0x000A) + bigEndian16(4) + bigEndian16(2) + bigEndian16(0x0017);
    hello += bigEndian16(static_cast<unsigned int>(signatures.size() + groups.size())) + signatures + groups;
    const std::string handshake =
        std::string("\x01\0", 2) + bigEndian16(static_cast<unsigned int>(hello.size())) + hello;
    return "\x16\x03\x01" + bigEndian16(static_cast<unsigned int>(handshake.size())) + handshake;
}

/// Whether bytes begin with a handshake record of TLS, such as that of a server that goes on.
bool isTlsHandshake(const std::string& bytes) { return !bytes.empty() && bytes.front() == '\x16'; }

Cases upgradeCases()
{
    return {
        isGranted("granted", "The request for TLS is answered with the same message.", kBeforeFirst, upgradeNotice()),
        isGranted("old-header", "The request for TLS may have the old header.", kHeader, upgradeNotice().old()),
        isGranted("padded", "The request for TLS may have a pad.", kPad, upgradeNotice().pad(4)),
        isGranted("with-payload", "A payload of the request for TLS is ignored.", kMessages,
                  upgradeNotice().payload("payload")),
        {"tls/upgrade/byte-by-byte", "The request for TLS may come byte by byte.", kBeforeFirst, Level::Wire, kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.sendByteByByte(upgradeNotice().bytes());
             requireAnswer(wire, kUpgrade);
         }},
        {"tls/upgrade/form", "The answer to the request for TLS has the documented form.", kUpgradeAsync, Level::Wire,
         kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             const Frame answer = wire.receive("the upgrade message");
             requireNoticeHeader(answer);
             requirePayload(answer, 0);
         }},
        {"tls/upgrade/once", "The answer to the request for TLS comes once, and nothing follows it.", kBeforeFirst,
         Level::Wire, kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             requireAnswer(wire, kUpgrade);
             trial.console().fence(); // the peer has had time to say more
             Trial::require(wire.isQuiet(), "the peer to wait for TLS", "more bytes");
         }},
        {"tls/upgrade/data-before-answer",
         "When more bytes have come with the request for TLS, the connection is closed without an answer.",
         kBeforeFirst, Level::Wire, kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice().bytes() + timeRequest().bytes());
             wire.expectEndWithoutFrame();
         }},
        {"tls/upgrade/clear-after-answer",
         "A message in the clear instead of TLS ends the connection and is not answered.", kBeforeFirst, Level::Wire,
         kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             requireAnswer(wire, kUpgrade);
             wire.send(versionRequest(trial.toolType(), trial.newToolId()));
             Trial::require(wire.drain().find("\xDE\xCA\xFF") == std::string::npos, "no message in the clear", "one");
         }},
        {"tls/upgrade/twice", "A second request for TLS in the clear ends the connection and is not answered.",
         kBeforeFirst, Level::Wire, kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             requireAnswer(wire, kUpgrade);
             wire.send(upgradeNotice());
             Trial::require(wire.drain().find("\xDE\xCA\xFF") == std::string::npos, "no message in the clear", "one");
         }},
    };
}

Cases firstCases()
{
    return {
        isAborted("version-request", "A version request in the clear gets the abort message and the end.",
                  versionRequest(1, "early")),
        isAborted("abort", "An abort message gets the abort message and the end.", Draft::notice(kHandshake, kAbort)),
        isAborted("upgrade-as-request", "The upgrade operation as a request gets the abort message and the end.",
                  Draft::request(kHandshake, kUpgrade)),
        isAborted("upgrade-as-response", "The upgrade operation as a response gets the abort message and the end.",
                  Draft::response(kHandshake, kUpgrade)),
        isAborted("unknown", "A message of an unknown function gets the abort message and the end.",
                  Draft::notice(0x9999, 1)),
        isCut("tls-without-asking", "TLS without the request for it ends the connection.", kTlsFailures,
              oldClientHello()),
        isCut("text", "Bytes that are no message end the connection.", kTlsFailures, "GET / HTTP/1.1\r\n\r\n"),
        isCut("wrong-eyecatcher", "A request for TLS with a wrong eyecatcher ends the connection.", kFrameChecks,
              upgradeNotice().byte(0, 0).bytes()),
        isCut("length-8", "A request for TLS with the length 8 ends the connection.", kStreamChecks,
              upgradeNotice().msgLength(8).bytes()),
        isCut("cut", "A stream that ends inside the request for TLS ends the connection.", kBeforeFirst,
              upgradeNotice().bytes().substr(0, 31)),
        isCut("nothing", "A stream that ends before the request for TLS ends the connection.", kBeforeFirst, ""),
        {"tls/first/abort-form", "The abort message has the documented form.", kAbortAsync, Level::Wire, kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(versionRequest(1, "early"));
             const Frame answer = wire.receive("the abort message");
             requireNoticeHeader(answer);
             requirePayload(answer, 0);
         }},
    };
}

/// Writes each byte by itself.
class ByteStream : public Stream {
public:
    explicit ByteStream(std::unique_ptr<Stream> stream) : mStream(std::move(stream)) {}
    void close() override { mStream->close(); }
    void setReadDeadline(std::chrono::milliseconds timeout) override { mStream->setReadDeadline(timeout); }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mStream->setWriteDeadline(timeout); }
    std::size_t read(char* buffer, std::size_t length) override { return mStream->read(buffer, length); }
    void write(const char* buffer, std::size_t length) override
    {
        for (std::size_t i = 0; i < length; ++i)
            mStream->write(buffer + i, 1);
    }

private:
    const std::unique_ptr<Stream> mStream;
};

/// A client that trusts a root and has no certificate of its own.
class AnonymousContext : public SSLClientContext {
public:
    explicit AnonymousContext(const std::string& root)
    {
        SSLCertificate certificate(root);
        pSetRootCA(certificate);
    }
};

/// The TLS handshake with these credentials must fail, or the connection must end before the version request is
/// answered: a console may see the refusal only after its own side of the handshake is complete.
void requireRefused(Trial& trial, SSLClientContext& context)
{
    int descriptor = -1;
    auto stream = trial.upgraded(descriptor);
    Wire* wire = nullptr;
    try {
        wire = &trial.protect(std::move(stream), descriptor, context);
    } catch (const Failure&) {
        return;
    }
    wire->send(versionRequest(trial.toolType(), trial.newToolId()));
    wire->expectEndWithoutFrame();
}

/// A certificate that no root of the peer has issued. Made once: keys take their time.
const SSLCredentials& strangersCredentials()
{
    static const SSLCredentials credentials = [] {
        const SSLCertificate root(SSLSubject{{"CN", "stranger"}}, SSLValidityPeriod::days(2));
        SSLCredentials texts;
        texts.mCert = root.getPEM();
        texts.mKey = root.getPrivateKey()->getPEM();
        return texts;
    }();
    return credentials;
}

Cases certificateCases()
{
    return {
        {"tls/certificate/none", "A console without a certificate is refused.", kTlsProfile, Level::Wire, kTls,
         [](Trial& trial) {
             AnonymousContext context(trial.target().credentials.mRootCA);
             requireRefused(trial, context);
         }},
        {"tls/certificate/other-root", "A console whose certificate is of another root is refused.", kTlsProfile,
         Level::Wire, kTls,
         [](Trial& trial) {
             SSLCredentials credentials = strangersCredentials();
             credentials.mRootCA = trial.target().credentials.mRootCA;
             SSLClientContext context;
             context.setCredentials(credentials);
             requireRefused(trial, context);
         }},
        {"tls/certificate/of-the-server", "The server's certificate is one of the root that the console trusts.",
         kTlsProfile, Level::Wire, kTls, [](Trial& trial) { trial.connect(); }},
        {"tls/version/1.2", "A console that offers no newer version than TLS 1.2 is refused.", kTlsProfile, Level::Wire,
         kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             requireAnswer(wire, kUpgrade);
             wire.send(oldClientHello());
             Trial::require(!isTlsHandshake(wire.drain()), "the end of the connection", "a handshake of TLS 1.2");
         }},
        {"tls/split/every-byte", "TLS may come byte by byte.", kTlsProfile, Level::Wire, kTls,
         [](Trial& trial) {
             int descriptor = -1;
             auto stream = std::make_unique<ByteStream>(trial.upgraded(descriptor));
             Wire& wire = trial.protect(std::move(stream), descriptor, *trial.target().context);
             wire.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), 0);
             wire.fence();
         }},
        {"tls/cut/in-the-handshake", "A stream that ends inside the TLS handshake ends the connection.", kBeforeFirst,
         Level::Wire, kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             requireAnswer(wire, kUpgrade);
             wire.send(oldClientHello().substr(0, 40));
             wire.endSending();
             wire.drain();
         }},
        {"tls/garbage/in-the-handshake", "Bytes that are not TLS end the connection.", kBeforeFirst, Level::Wire, kTls,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             requireAnswer(wire, kUpgrade);
             wire.send(std::string(200, '\x55'));
             Trial::require(!isTlsHandshake(wire.drain()), "the end of the connection", "a handshake of TLS");
         }},
        {"tls/others/are-served", "Connections that stop in the steps to TLS hold up no other one.", kBeforeFirst,
         Level::Robust, kTls | kShared,
         [](Trial& trial) {
             for (int i = 0; i < 10; ++i) {
                 Wire& wire = trial.connectTcp();
                 wire.send(upgradeNotice());
                 requireAnswer(wire, kUpgrade);
             }
             trial.console().fence();
         }},
        {"tls/deadline/in-the-handshake",
         "A connection that stops in the TLS handshake is ended when its time is over.", kBeforeFirst, Level::Robust,
         kTls | kDeadline,
         [](Trial& trial) {
             Wire& wire = trial.connectTcp();
             wire.send(upgradeNotice());
             requireAnswer(wire, kUpgrade);
             wire.setTimeout(*trial.target().deadline * 2 + trial.target().timeout);
             wire.drain();
         }},
    };
}

/// The request for TLS on a connection where it is too late for it: abort, and the end.
void requireAborted(Wire& wire)
{
    wire.send(upgradeNotice());
    requireAnswer(wire, kAbort);
    wire.expectEndWithoutFrame();
}

Cases insideCases()
{
    return {
        {"tls/inside/upgrade", "A request for TLS inside TLS gets the abort message and the end.", kAnswered,
         Level::Rule, kTls, [](Trial& trial) { requireAborted(trial.console()); }},
        {"tls/inside/upgrade-first",
         "A request for TLS as the first message inside TLS gets the abort message and the end.", kAnswered,
         Level::Rule, kTls, [](Trial& trial) { requireAborted(trial.connect()); }},
    };
}

} // namespace

Cases tlsCases() { return joined(upgradeCases, firstCases, certificateCases, insideCases); }

Cases plainCases()
{
    return {
        {"plain/upgrade/first", "Without TLS, a request for it gets the abort message and the end.", kBeforeFirst,
         Level::Wire, kPlain, [](Trial& trial) { requireAborted(trial.connect()); }},
        {"plain/upgrade/later", "Without TLS, a request for it gets the abort message and the end at any time.",
         kAnswered, Level::Rule, kPlain, [](Trial& trial) { requireAborted(trial.session()); }},
        {"plain/upgrade/form", "The abort message has the documented form, without TLS as well.", kAbortAsync,
         Level::Wire, kPlain,
         [](Trial& trial) {
             Wire& wire = trial.connect();
             wire.send(upgradeNotice());
             const Frame answer = wire.receive("the abort message");
             requireNoticeHeader(answer);
             requirePayload(answer, 0);
         }},
        {"plain/tls-without-asking", "TLS on a connection without it ends the connection.", kStreamChecks, Level::Wire,
         kPlain,
         [](Trial& trial) {
             Wire& wire = trial.connect();
             wire.send(oldClientHello());
             Trial::require(!isTlsHandshake(wire.drain()), "the end of the connection", "a handshake of TLS");
         }},
    };
}

} // namespace qel::tool::check
