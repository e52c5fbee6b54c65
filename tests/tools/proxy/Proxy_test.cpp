#include "proxy/Proxy.hpp"
#include "tools/proxy/ProxyKit.hpp"

#include <atomic>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::StartsWith;

const std::string kOne = frameOf(1, "one");
const std::string kTwo = frameOf(2, "two");

TEST(Proxy, PassesBothDirections)
{
    ProxyFixture proxy;
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    send(*console, kOne);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    send(*server, kTwo);
    EXPECT_EQ(receive(*console, kTwo.size()), kTwo);
}

TEST(Proxy, KeepsConnectionsApart)
{
    ProxyFixture proxy;
    const auto first = proxy.connect();
    const auto firstServer = proxy.accept();
    const auto second = proxy.connect();
    const auto secondServer = proxy.accept();
    send(*second, kTwo);
    send(*first, kOne);
    EXPECT_EQ(receive(*firstServer, kOne.size()), kOne);
    EXPECT_EQ(receive(*secondServer, kTwo.size()), kTwo);
}

TEST(Proxy, TheEndOfADirectionPassesAndTheOtherGoesOn)
{
    ProxyFixture proxy;
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    send(*console, kOne);
    endWriting(*console);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    EXPECT_TRUE(isAtEnd(*server));
    send(*server, kTwo);
    EXPECT_EQ(receive(*console, kTwo.size()), kTwo);
    endWriting(*server);
    EXPECT_TRUE(isAtEnd(*console));
    EXPECT_THAT(proxy.stop(), ElementsAre("to-server end", "to-console end", "closed: both sides have ended it"));
}

TEST(Proxy, AResetPassesInBothDirections)
{
    for (const bool byConsole : {true, false}) {
        SCOPED_TRACE(byConsole);
        ProxyFixture proxy;
        auto console = proxy.connect();
        auto server = proxy.accept();
        send(*console, kOne);
        EXPECT_EQ(receive(*server, kOne.size()), kOne);
        resetStream(std::move(byConsole ? console : server));
        EXPECT_TRUE(isReset(byConsole ? *server : *console));
        EXPECT_THAT(proxy.stop(),
                    ElementsAre(byConsole ? "closed: the console has reset it" : "closed: the server has reset it"));
    }
}

TEST(Proxy, ASideThatDoesNotReadStopsTheOtherAndLosesNothing)
{
    for (const char* rule : {"", "frame=999999 drop"}) {
        SCOPED_TRACE(rule);
        ProxyFixture proxy(*rule == '\0' ? std::vector<std::string>() : std::vector<std::string>{rule});
        const auto console = proxy.connect();
        const auto server = proxy.accept();
        const int descriptor = console->getSocket().getFd();
        const std::string frame = frameOf(1, std::string(16000, 'x'));
        const std::string many = [&frame] {
            std::string all;
            for (int i = 0; i < 64; ++i)
                all += frame;
            return all;
        }();
        // Until nothing has moved for a while: the kernel's buffers and those of the proxy are full.
        std::size_t sent = 0;
        const auto room = [descriptor] {
            return PollSet(PollFd(descriptor, PollEvents::Write)).wait(std::chrono::milliseconds(300)).anyReady();
        };
        constexpr std::size_t kBound = 16 * 1024 * 1024;
        while (sent < kBound && room()) {
            const std::size_t at = sent % many.size();
            const ssize_t count = ::send(descriptor, many.data() + at, many.size() - at, MSG_DONTWAIT);
            ASSERT_GT(count, 0);
            sent += static_cast<std::size_t>(count);
        }
        EXPECT_LT(sent, kBound);
        // The other direction is not stopped.
        send(*server, kTwo);
        EXPECT_EQ(receive(*console, kTwo.size()), kTwo);
        endWriting(*console);
        std::size_t arrived = 0;
        bool isSame = true;
        std::string buffer(64 * 1024, '\0');
        for (;;) {
            const std::size_t count = server->read(buffer.data(), buffer.size());
            if (count == 0) break;
            for (std::size_t i = 0; i < count; ++i)
                isSame = isSame && buffer[i] == many[(arrived + i) % many.size()];
            arrived += count;
        }
        EXPECT_EQ(arrived, sent);
        EXPECT_TRUE(isSame);
    }
}

TEST(Proxy, ManyBytesInBothDirectionsStayAsTheyAre)
{
    ProxyFixture proxy({"frame=999999 drop"});
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    const std::size_t kFrames = 3000;
    const auto stream = [](unsigned int from) {
        std::string all;
        for (unsigned int i = 0; i < kFrames; ++i)
            all += frameOf(from + i, std::string(i % 700, static_cast<char>('a' + i % 26)));
        return all;
    };
    const std::string up = stream(1);
    const std::string down = stream(100000);
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

TEST(Proxy, AServerThatIsNotThereResetsTheConsole)
{
    tool::ProxyOptions options;
    {
        const Socket gone = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        options.target.endpoints = {gone.getSocketName()};
    }
    const std::string server = options.target.endpoints[0].str();
    ProxyFixture proxy({}, options);
    EXPECT_TRUE(proxy.resetsNewConnection());
    EXPECT_THAT(proxy.stop(), ElementsAre("refused: cannot connect to " + server + ": 111 (Connection refused)"));
}

TEST(Proxy, TriesEachAddressOfTheServer)
{
    tool::ProxyOptions options;
    Socket second = listenOn(IPEndpoint("127.0.0.1:0"), 1);
    {
        const Socket gone = listenOn(IPEndpoint("127.0.0.1:0"), 1);
        options.target.endpoints = {gone.getSocketName(), second.getSocketName()};
    }
    ProxyFixture proxy({}, options);
    const auto console = proxy.connect();
    SocketStream server(second.accept());
    send(*console, kOne);
    EXPECT_EQ(receive(server, kOne.size()), kOne);
}

TEST(Proxy, RefusesMoreConnectionsThanItMayHave)
{
    tool::ProxyOptions options;
    options.maxConnections = 1;
    ProxyFixture proxy({}, options);
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    EXPECT_TRUE(proxy.resetsNewConnection());
    send(*console, kOne);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    EXPECT_THAT(proxy.stop(), Contains("refused: 1 connections are open"));
}

TEST(Proxy, ACutIsTheEndForBothSidesAndNoReset)
{
    ProxyFixture proxy({"to-server cut after frames=1"});
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    send(*console, kOne + kTwo);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    EXPECT_TRUE(isAtEnd(*server));
    EXPECT_TRUE(isAtEnd(*console));
}

TEST(Proxy, ARuleResetsBothSides)
{
    ProxyFixture proxy({"to-server frame=2 reset"});
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    send(*console, kOne);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    send(*console, kTwo);
    EXPECT_TRUE(isReset(*server));
    EXPECT_TRUE(isReset(*console));
    EXPECT_THAT(proxy.stop(), ElementsAre("fault: both sides are reset", "closed: a rule has reset it"));
}

TEST(Proxy, ARuleHalfClosesOneDirection)
{
    ProxyFixture proxy({"to-server half-close after frames=1"});
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    send(*console, kOne + kTwo);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    EXPECT_TRUE(isAtEnd(*server));
    send(*server, kTwo);
    EXPECT_EQ(receive(*console, kTwo.size()), kTwo);
}

TEST(Proxy, ADelayedFrameArrivesByItself)
{
    ProxyFixture proxy({"to-server delay=20ms"});
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    const auto begin = std::chrono::steady_clock::now();
    send(*console, kOne);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    EXPECT_GE(std::chrono::steady_clock::now() - begin, std::chrono::milliseconds(20));
}

TEST(Proxy, StopReadingStopsOneDirection)
{
    ProxyFixture proxy({"to-server stop-reading after frames=1"});
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    send(*console, kOne + kTwo);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    send(*server, kTwo);
    EXPECT_EQ(receive(*console, kTwo.size()), kTwo);
    char byte = 0;
    server->setReadDeadline(std::chrono::milliseconds(50));
    EXPECT_THROW(static_cast<void>(server->read(&byte, 1)), StreamIOException);
}

TEST(Proxy, FinishClosesWhatIsOpen)
{
    ProxyFixture proxy;
    const auto console = proxy.connect();
    const auto server = proxy.accept();
    send(*console, kOne);
    EXPECT_EQ(receive(*server, kOne.size()), kOne);
    EXPECT_THAT(proxy.stop(), ElementsAre("closed: the proxy ends"));
    EXPECT_TRUE(isAtEnd(*console));
    EXPECT_TRUE(isAtEnd(*server));
}

} // namespace

} // namespace qel::test
