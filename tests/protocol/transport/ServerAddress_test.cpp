#include <qel/common/net/Listen.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "support/Errors.hpp"
#include "transport/Lookup.hpp"

#include <cerrno>
#include <future>
#include <gmock/gmock.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <pthread.h>
#include <stdexcept>
#include <sys/socket.h>
#include <system_error>

namespace qel::test {

namespace {

using protocol::connectTo;
using protocol::LookupResult;
using protocol::resolve;
using protocol::ServerAddress;
using testing::ElementsAre;
using testing::MatchesRegex;
using testing::StrEq;
using testing::ThrowsMessage;

/// From construction to destruction no thread can be started: there is no room for a stack of this size.
class NoThreads {
public:
    NoThreads()
    {
        EXPECT_EQ(::pthread_getattr_default_np(&mBefore), 0);
        pthread_attr_t attributes;
        ::pthread_attr_init(&attributes);
        EXPECT_EQ(::pthread_attr_setstacksize(&attributes, std::size_t{1} << 60), 0);
        EXPECT_EQ(::pthread_setattr_default_np(&attributes), 0);
        ::pthread_attr_destroy(&attributes);
    }
    ~NoThreads()
    {
        ::pthread_setattr_default_np(&mBefore);
        ::pthread_attr_destroy(&mBefore);
    }
    NoThreads(const NoThreads&) = delete;
    NoThreads& operator=(const NoThreads&) = delete;

private:
    pthread_attr_t mBefore;
};

std::chrono::steady_clock::time_point soon() { return TimeProvider::steady() + std::chrono::seconds(20); }

/// An endpoint of loopback on which nothing listens: the port of a socket that is bound but does not listen.
class RefusingEndpoint {
public:
    RefusingEndpoint() : mSocket(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0)
    {
        mSocket.bind(IPEndpoint("127.0.0.1:0"));
    }
    IPEndpoint get() const { return mSocket.getSocketName(); }

private:
    Socket mSocket;
};

TEST(ServerAddress, IsAHostAndAPort)
{
    struct Row {
        const char* text;
        const char* host;
        std::uint16_t port;
    };
    const Row rows[] = {
        {"hypervisor.example:4711", "hypervisor.example", 4711},
        {"localhost:1", "localhost", 1},
        {"a-b_c.d.:65535", "a-b_c.d.", 65535},
        {"127.0.0.1:80", "127.0.0.1", 80},
        {"[::1]:80", "::1", 80},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.text);
        const ServerAddress address = ServerAddress::parse(row.text);
        EXPECT_EQ(address.getHost(), row.host);
        EXPECT_EQ(address.getPort(), row.port);
        EXPECT_EQ(address.str(), row.text);
    }
}

TEST(ServerAddress, RefusesATextWithoutAPort)
{
    for (const char* text : {"", "host", "host:", "host:0", "host:65536", "host:99999999999", "host:-1", "host: 1",
                             "host:1x", "host:0x50", "127.0.0.1", "[::1]"}) {
        EXPECT_THAT([&] { ServerAddress::parse(text); },
                    ThrowsMessage<std::invalid_argument>(StrEq("server: \"" + std::string(text) +
                                                               "\" has no port from 1 to 65535 after its last colon")))
            << text;
    }
}

TEST(ServerAddress, RefusesATextWithoutAHost)
{
    for (const std::string& text : {std::string(":1"), std::string("-x:1"), std::string("a b:1"), std::string("::1:80"),
                                    std::string("[x]:80"), std::string("user@host:1"), std::string(256, 'a') + ":1"}) {
        EXPECT_THAT([&] { ServerAddress::parse(text); },
                    ThrowsMessage<std::invalid_argument>(
                        StrEq("server: \"" + text + "\" does not begin with a host name or an IP address")))
            << text;
    }
    EXPECT_NO_THROW(ServerAddress::parse(std::string(255, 'a') + ":1"));
}

TEST(IsLoopback, IsTrueForTheWholeLoopbackNetAlone)
{
    for (const char* text : {"127.0.0.1:1", "127.255.0.9:1", "[::1]:1", "[::ffff:127.0.0.1]:1"})
        EXPECT_TRUE(protocol::isLoopback(IPEndpoint(text).getAddress())) << text;
    for (const char* text : {"128.0.0.1:1", "0.0.0.0:1", "[::]:1", "[::2]:1", "[::ffff:10.0.0.1]:1"})
        EXPECT_FALSE(protocol::isLoopback(IPEndpoint(text).getAddress())) << text;
}

TEST(Resolve, ANumericHostIsNotLookedUp)
{
    const auto past = TimeProvider::steady() - std::chrono::hours(1); // a look-up would be too late
    EXPECT_THAT(resolve(ServerAddress::parse("127.0.0.1:80"), past), ElementsAre(IPEndpoint("127.0.0.1:80")));
    EXPECT_THAT(resolve(ServerAddress::parse("[::1]:80"), past), ElementsAre(IPEndpoint("[::1]:80")));
}

TEST(Resolve, FindsTheLoopbackAddressOfThisMachine)
{
    for (const IPEndpoint& endpoint : resolve(ServerAddress::parse("localhost:80"), soon())) {
        EXPECT_TRUE(protocol::isLoopback(endpoint.getAddress())) << endpoint;
        EXPECT_EQ(endpoint.getPort(), 80);
    }
}

TEST(Resolve, AnUnknownNameIsAnError)
{
    // ".invalid" never has an address: RFC 6761, 6.4.
    EXPECT_THAT([] { resolve(ServerAddress::parse("name.invalid:80"), soon()); },
                failsWith<protocol::NameNotResolved>(MatchesRegex("cannot resolve the name name.invalid: .+")));
}

TEST(LookUp, ReturnsWhatTheResolverFound)
{
    const auto found = protocol::lookUp("h", 7, soon(), [](const std::string& host, std::uint16_t port) {
        EXPECT_EQ(host, "h");
        EXPECT_EQ(port, 7);
        return LookupResult{{IPEndpoint("10.0.0.1:7"), IPEndpoint("10.0.0.2:7")}, {}};
    });
    EXPECT_THAT(found, ElementsAre(IPEndpoint("10.0.0.1:7"), IPEndpoint("10.0.0.2:7")));
}

TEST(LookUp, NamesTheErrorOfTheResolver)
{
    const auto fails = [](const std::string&, std::uint16_t) { return LookupResult{{}, "Name or service not known"}; };
    EXPECT_THAT([&] { protocol::lookUp("h", 7, soon(), fails); },
                failsWith<protocol::NameNotResolved>("cannot resolve the name h: Name or service not known"));
    const auto none = [](const std::string&, std::uint16_t) { return LookupResult(); };
    EXPECT_THAT([&] { protocol::lookUp("h", 7, soon(), none); },
                failsWith<protocol::NameNotResolved>("cannot resolve the name h: it has no address"));
}

TEST(LookUp, AResolverThatThrowsHasFailed)
{
    const auto throws = [](const std::string&, std::uint16_t) -> LookupResult { throw std::bad_alloc(); };
    EXPECT_THAT([&] { protocol::lookUp("h", 7, soon(), throws); },
                failsWith<protocol::NameNotResolved>("cannot resolve the name h: it has no address"));
}

TEST(LookUp, WithoutAThreadNoNameIsResolved)
{
    const NoThreads noThreads;
    const auto unused = [](const std::string&, std::uint16_t) { return LookupResult(); };
    try {
        protocol::lookUp("h", 7, soon(), unused);
        ADD_FAILURE() << "resolved";
    } catch (const protocol::NameNotResolved& error) {
        EXPECT_STREQ(error.what(), "cannot resolve the name h: no thread for it: Resource temporarily unavailable");
        EXPECT_THROW(std::rethrow_if_nested(error), std::system_error);
    }
}

TEST(LookUp, AResolverThatHangsDoesNotHoldTheCallerBeyondTheDeadline)
{
    auto released = std::make_shared<std::promise<void>>();
    auto ended = std::make_shared<std::promise<void>>();
    auto release = std::make_shared<std::shared_future<void>>(released->get_future());
    const auto hangs = [release, ended](const std::string&, std::uint16_t) {
        release->wait();
        ended->set_value();
        return LookupResult();
    };
    const auto deadline = TimeProvider::steady() + std::chrono::milliseconds(20);
    EXPECT_THAT([&] { protocol::lookUp("h", 7, deadline, hangs); },
                failsWith<protocol::DeadlinePassed>("the name h was not resolved in time"));
    EXPECT_GE(TimeProvider::steady(), deadline);
    released->set_value(); // the late thread ends by itself
    EXPECT_EQ(ended->get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready);
}

TEST(ConnectTo, TakesTheFirstAddressThatAccepts)
{
    const RefusingEndpoint refusing;
    Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 2);
    const auto server = ServerAddress::parse("host:1");
    const Socket socket = connectTo(server, {refusing.get(), listener.getSocketName()}, soon());
    EXPECT_EQ(socket.getPeerName(), listener.getSocketName());
}

TEST(ConnectTo, ALongSegmentDoesNotFillAReceiveBuffer)
{
    // Over loopback segments have 64 KiB unless one end announces less; the peer never sends a longer one.
    Socket listener = listenOn(IPEndpoint("127.0.0.1:0"), 1);
    const Socket near = connectTo(ServerAddress::parse("h:1"), {listener.getSocketName()}, soon());
    const Socket far = listener.accept();
    int bytes = 0;
    socklen_t length = sizeof(bytes);
    ASSERT_EQ(::getsockopt(far.getFd(), IPPROTO_TCP, TCP_MAXSEG, &bytes, &length), 0);
    EXPECT_LE(bytes, 16384);
    EXPECT_GT(bytes, 16000) << "without the options of TCP";
}

TEST(ConnectTo, ReportsTheFailureOfTheLastAddressUnderTheNameOfTheServer)
{
    const RefusingEndpoint refusing;
    try {
        connectTo(ServerAddress::parse("host:1"), {refusing.get(), refusing.get()}, soon());
        FAIL() << "something accepted";
    } catch (const protocol::CannotConnect& error) {
        EXPECT_THAT(error.what(), MatchesRegex("cannot connect to host:1: .*111 \\(Connection refused\\)"));
        EXPECT_EQ(error.getPeer(), "host:1");
        EXPECT_THROW(std::rethrow_if_nested(error), PosixError);
    }
}

} // namespace

} // namespace qel::test
