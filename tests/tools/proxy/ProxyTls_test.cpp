#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Handshake.hpp>
#include <qel/protocol/PeerIdentity.hpp>

#include "proxy/Proxy.hpp"
#include "support/Authority.hpp"
#include "support/CapturedLog.hpp"
#include "tools/proxy/ProxyKit.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using protocol::Credentials;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StartsWith;

const std::string kOne = frameOf(1, "one");
const std::string kTwo = frameOf(2, "two");

Credentials ofServer() { return Credentials::fromTexts(Authority::trusted().serverCredentials()); }
Credentials ofClient() { return Credentials::fromTexts(Authority::trusted().clientCredentials()); }

/// Both sides with TLS: to the server the proxy is "client", to the console it is "server".
tool::ProxyOptions tlsOptions()
{
    tool::ProxyOptions options;
    options.target.consoleContext = ofServer().makeServerContext();
    options.target.serverContext = ofClient().makeClientContext();
    return options;
}

std::unique_ptr<SSLStream> consoleTls(std::unique_ptr<SocketStream> stream)
{
    protocol::requestUpgrade(*stream, stream->getSocket().getFd());
    const auto context = ofClient().makeClientContext();
    auto tls = std::make_unique<SSLStream>(*context, std::move(stream));
    protocol::startTls(*tls);
    return tls;
}

std::unique_ptr<SSLStream> serverTls(std::unique_ptr<SocketStream> stream)
{
    protocol::awaitUpgrade(*stream, stream->getSocket().getFd());
    protocol::grantUpgrade(*stream);
    const auto context = ofServer().makeServerContext();
    auto tls = std::make_unique<SSLStream>(*context, std::move(stream));
    protocol::startTls(*tls);
    return tls;
}

class ProxyTls : public ::testing::Test {
protected:
    /// Connects both sides through the proxy.
    void connect(ProxyFixture& proxy)
    {
        auto socket = proxy.connect();
        std::thread thread([&] { server = serverTls(proxy.accept()); });
        console = consoleTls(std::move(socket));
        thread.join();
    }

    CapturedLog log{LogLevel::Critical};
    std::unique_ptr<SSLStream> console;
    std::unique_ptr<SSLStream> server;
};

TEST_F(ProxyTls, EachSideHasItsOwnTlsAndFramesAreSeenInBetween)
{
    ProxyFixture proxy({"to-server corrupt=mStatus value=5"}, tlsOptions());
    connect(proxy);
    send(*console, kOne);
    std::string changed = kOne;
    changed[23] = 5;
    EXPECT_EQ(receive(*server, kOne.size()), changed);
    send(*server, kTwo);
    EXPECT_EQ(receive(*console, kTwo.size()), kTwo);
    EXPECT_EQ(protocol::identityOf(*console).commonName, "server");
    EXPECT_EQ(protocol::identityOf(*server).commonName, "client");
    EXPECT_THAT(proxy.stop(), ElementsAre(StartsWith("TLS with the server: \"CN=server\", SHA-256 "),
                                          StartsWith("TLS with the console: \"CN=client\", SHA-256 "),
                                          "fault: mStatus changed from 0000 to 0005", "closed: the proxy ends"));
}

TEST_F(ProxyTls, ManyBytesInBothDirectionsStayAsTheyAre)
{
    ProxyFixture proxy({}, tlsOptions());
    connect(proxy);
    std::string up;
    for (unsigned int i = 0; i < 1500; ++i)
        up += frameOf(i, std::string(i % 900, static_cast<char>('a' + i % 26)));
    const std::string down = up.substr(0, up.size() / 2);
    std::thread sender([&] { send(*console, up); });
    std::thread other([&] { send(*server, down); });
    std::string got;
    std::thread reader([&] { got = receive(*console, down.size()); });
    EXPECT_TRUE(receive(*server, up.size()) == up);
    sender.join();
    other.join();
    reader.join();
    EXPECT_TRUE(got == down);
}

TEST_F(ProxyTls, TheEndOfADirectionPasses)
{
    ProxyFixture proxy({}, tlsOptions());
    connect(proxy);
    send(*server, kTwo);
    server.reset();
    EXPECT_EQ(receive(*console, kTwo.size()), kTwo);
    EXPECT_TRUE(isAtEnd(*console));
}

TEST_F(ProxyTls, OneSideMayBePlain)
{
    tool::ProxyOptions options = tlsOptions();
    options.target.consoleContext = nullptr;
    ProxyFixture proxy({}, options);
    const auto plain = proxy.connect();
    server = serverTls(proxy.accept());
    send(*plain, kOne);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    send(*server, kTwo);
    EXPECT_EQ(receive(*plain, kTwo.size()), kTwo);
}

TEST_F(ProxyTls, AServerThatTurnsTheProxyAwayTurnsTheConsoleAway)
{
    ProxyFixture proxy({}, tlsOptions());
    auto socket = proxy.connect();
    std::thread thread([&] {
        const auto stream = proxy.accept();
        protocol::awaitUpgrade(*stream, -1);
        protocol::abortHandshake(*stream);
    });
    EXPECT_THROW(consoleTls(std::move(socket)), protocol::TurnedAway);
    thread.join();
    EXPECT_THAT(proxy.stop(), ElementsAre(StartsWith("refused: the server refused this console")));
}

TEST_F(ProxyTls, AServerThatDoesNotMatchThePinIsRefused)
{
    tool::ProxyOptions options = tlsOptions();
    options.target.serverPins.names = {"another"};
    ProxyFixture proxy({}, options);
    auto socket = proxy.connect();
    std::thread thread([&] { EXPECT_NO_THROW(server = serverTls(proxy.accept())); });
    EXPECT_THROW(consoleTls(std::move(socket)), protocol::TurnedAway);
    thread.join();
    EXPECT_THAT(proxy.stop(), ElementsAre("refused: wrong peer: the name \"server\" does not match --peer-name"));
}

TEST_F(ProxyTls, StoppingBreaksOffAHandshake)
{
    ProxyFixture proxy({}, tlsOptions());
    const auto silent = proxy.connect();
    const auto accepted = proxy.accept();
    const auto begin = std::chrono::steady_clock::now();
    proxy.stop();
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(5)); // the handshake has ten
}

TEST_F(ProxyTls, PassThroughLeavesTlsToThePeers)
{
    ProxyFixture proxy({"to-server op=GetQelTod drop"});
    connect(proxy);
    send(*console, kOne);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    console.reset();
    EXPECT_TRUE(isAtEnd(*server));
    EXPECT_THAT(proxy.stop(), Contains("TLS begins: bytes pass unchanged from here on and are not shown").Times(2));
}

} // namespace

} // namespace qel::test
