// Lines that are sockets, with real peers inside this machine.

#include <qel/common/net/Listen.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "hypervisor/SocketLine.hpp"
#include "protocol/hypervisor/LineDriver.hpp"
#include "support/Allocations.hpp"
#include "support/Loopback.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <future>
#include <gmock/gmock.h>
#include <memory>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <stdexcept>
#include <string>
#include <sys/socket.h>
#include <unistd.h>
#include <vector>

namespace qel::test {

namespace {

using protocol::LookupResult;
using protocol::SerialLine;
using protocol::ServerAddress;
using protocol::SocketLine;
using protocol::tcpLine;
using protocol::unixLine;
using ::testing::StrEq;
using ::testing::ThrowsMessage;
using LineState = SerialLine::LineState;

/// The far side of a connection, blocking.
class Peer {
public:
    explicit Peer(int fd) : mSocket(fd) {}

    void send(const std::string& bytes) const
    {
        std::size_t sent = 0;
        while (sent < bytes.size()) {
            const ssize_t count = ::send(mSocket.getFd(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
            ASSERT_GT(count, 0);
            sent += static_cast<std::size_t>(count);
        }
    }

    /// Reads exactly so many bytes.
    std::string receive(std::size_t length) const
    {
        std::string bytes(length, '\0');
        const ssize_t count = ::recv(mSocket.getFd(), bytes.data(), length, MSG_WAITALL);
        bytes.resize(count < 0 ? 0 : static_cast<std::size_t>(count));
        return bytes;
    }

    void stopReading() const { ASSERT_EQ(::shutdown(mSocket.getFd(), SHUT_RD), 0); }

    void close() { mSocket = Socket(-1); }

    /// Closes the connection with a reset.
    void reset()
    {
        const linger atOnce{1, 0};
        mSocket.setSocketOption(SOL_SOCKET, SO_LINGER, &atOnce, sizeof(atOnce));
        close();
    }

private:
    Socket mSocket;
};

/// A far side that listens at a path.
class UnixListener {
public:
    explicit UnixListener(const std::string& path, int backlog = 8)
        : mSocket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0))
    {
        const protocol::SocketAddress address = protocol::unixAddress(path);
        const auto* const plain = reinterpret_cast<const sockaddr*>(&address.storage);
        if (::bind(mSocket.getFd(), plain, address.length) != 0) throw PosixError(errno, "bind");
        mSocket.listen(backlog);
    }

    Peer accept() const { return Peer(::accept4(mSocket.getFd(), nullptr, nullptr, SOCK_CLOEXEC)); }

private:
    Socket mSocket;
};

class UnixLine : public ::testing::Test {
protected:
    TemporaryDirectory mDirectory;
    const std::string mPath = mDirectory.file("socket");
};

TEST_F(UnixLine, IsDownBeforeStartAndAfterStop)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    EXPECT_EQ(line->descriptor(), -1);
    line->stop();
    LineDriver(*line).bringUp();
    EXPECT_GE(line->descriptor(), 0);
    line->stop();
    EXPECT_EQ(line->descriptor(), -1);
}

TEST_F(UnixLine, CarriesAllByteValuesBothWays)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    driver.bringUp();
    const Peer peer = listener.accept();
    driver.write(everyByte());
    EXPECT_EQ(peer.receive(256), everyByte());
    peer.send(everyByte());
    EXPECT_EQ(driver.read(256), everyByte());
}

TEST_F(UnixLine, IsIdleWithNothingToRead)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver(*line).bringUp();
    char byte = 0;
    EXPECT_EQ(line->read(&byte, 1).state, LineState::Idle);
    EXPECT_FALSE(line->hasHungUp());
    EXPECT_FALSE(line->wantsToWrite());
    EXPECT_TRUE(line->advanceAt().isDisabled());
}

TEST_F(UnixLine, IsNotInheritedByCommands)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver(*line).bringUp();
    EXPECT_EQ(::fcntl(line->descriptor(), F_GETFD), FD_CLOEXEC);
}

TEST_F(UnixLine, StartingALineThatIsUpChangesNothing)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    driver.bringUp();
    const Peer peer = listener.accept();
    line->start(7);
    EXPECT_TRUE(line->advance());
    peer.send("same");
    EXPECT_EQ(driver.read(4), "same");
}

TEST_F(UnixLine, APathThatIsNotThereIsTheReason)
{
    const auto line = unixLine(mPath);
    const std::string reason = "cannot connect to " + mPath + ": No such file or directory";
    EXPECT_THAT([&] { LineDriver(*line).bringUp(); }, ThrowsMessage<std::runtime_error>(StrEq(reason)));
    EXPECT_EQ(line->endReason(), reason);
}

TEST_F(UnixLine, APathThatNobodyListensAtIsTheReason)
{
    {
        UnixListener listener(mPath);
    }
    const auto line = unixLine(mPath);
    EXPECT_THAT([&] { LineDriver(*line).bringUp(); },
                ThrowsMessage<std::runtime_error>(StrEq("cannot connect to " + mPath + ": Connection refused")));
}

TEST_F(UnixLine, AFullQueueIsTheReason)
{
    UnixListener listener(mPath, 0);
    const auto first = unixLine(mPath);
    LineDriver(*first).bringUp(); // the queue has room for one
    const auto second = unixLine(mPath);
    EXPECT_THAT([&] { LineDriver(*second).bringUp(); },
                ThrowsMessage<std::runtime_error>(
                    StrEq("cannot connect to " + mPath + ": too many connections wait for the peer")));
}

TEST_F(UnixLine, AllOutputIsReadBeforeTheEnd)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    driver.bringUp();
    Peer peer = listener.accept();
    peer.send("last words");
    peer.close();
    EXPECT_EQ(driver.readUntilEnd(), "last words");
    EXPECT_EQ(line->endReason(), "the peer has closed the connection");
}

TEST_F(UnixLine, InputForAPeerThatHasClosedIsDroppedAndItsOutputIsStillRead)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    driver.bringUp();
    Peer peer = listener.accept();
    peer.send("last words");
    peer.close();
    EXPECT_EQ(line->write("x", 1), 1U);
    EXPECT_TRUE(line->hasHungUp());
    EXPECT_EQ(driver.readUntilEnd(), "last words");
    EXPECT_EQ(line->endReason(), "the peer has closed the connection");
}

TEST_F(UnixLine, APeerThatOnlyNoLongerReadsEndsTheLineAtTheFirstInput)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    driver.bringUp();
    const Peer peer = listener.accept();
    peer.send("last words");
    peer.stopReading();
    EXPECT_FALSE(line->hasHungUp());
    EXPECT_EQ(line->write("typed", 5), 5U);
    EXPECT_TRUE(line->hasHungUp());
    EXPECT_EQ(driver.readUntilEnd(), "last words");
    EXPECT_EQ(line->endReason(), "the peer has closed the connection");
}

TEST_F(UnixLine, ConnectsAgainAfterTheEnd)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    driver.bringUp();
    listener.accept().close();
    EXPECT_EQ(driver.readUntilEnd(), "");
    driver.bringUp();
    EXPECT_EQ(line->endReason(), "");
    const Peer peer = listener.accept();
    peer.send("again");
    EXPECT_EQ(driver.read(5), "again");
}

TEST_F(UnixLine, ConnectsAgainAfterAFailure)
{
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    EXPECT_THROW(driver.bringUp(), std::runtime_error);
    line->stop();
    UnixListener listener(mPath);
    driver.bringUp();
    listener.accept().send("there");
    EXPECT_EQ(driver.read(5), "there");
}

TEST_F(UnixLine, APeerThatDoesNotReadStopsTheInputAndResumesIt)
{
    UnixListener listener(mPath);
    const auto line = unixLine(mPath);
    LineDriver driver(*line);
    driver.bringUp();
    const Peer peer = listener.accept();
    const std::size_t taken = driver.fill();
    EXPECT_GT(taken, 0U);
    EXPECT_FALSE(PollSet(PollFd(line->descriptor(), PollEvents::Write)).poll().anyReady());
    EXPECT_EQ(peer.receive(taken), std::string(taken, 'x'));
    driver.write("y");
    EXPECT_EQ(peer.receive(1), "y");
}

TEST_F(UnixLine, APathOf107BytesIsTakenAndOneOf108Refused)
{
    const std::string longest(107, 'p');
    EXPECT_NE(unixLine(longest), nullptr);
    EXPECT_THAT([&] { unixLine(longest + "p"); },
                ThrowsMessage<std::invalid_argument>(StrEq("path: it is longer than 107 bytes")));
}

TEST_F(UnixLine, RefusesAnEmptyPathAndANullCharacter)
{
    EXPECT_THAT([] { unixLine(""); }, ThrowsMessage<std::invalid_argument>(StrEq("path: it is empty")));
    EXPECT_THAT([] { unixLine(std::string("a\0b", 3)); },
                ThrowsMessage<std::invalid_argument>(StrEq("path: it contains a null character")));
}

class TcpLine : public EachFamily {};
QEL_TEST_OVER_EACH_FAMILY(TcpLine);

TEST_P(TcpLine, CarriesAllByteValuesBothWays)
{
    Socket listener = makeListener(GetParam());
    const auto line = tcpLine(listener.getSocketName().str());
    LineDriver driver(*line);
    driver.bringUp();
    Socket accepted = listener.accept();
    const Peer peer(::dup(accepted.getFd()));
    driver.write(everyByte());
    EXPECT_EQ(peer.receive(256), everyByte());
    peer.send(everyByte());
    EXPECT_EQ(driver.read(256), everyByte());
}

TEST_P(TcpLine, ARefusedConnectionIsTheReason)
{
    const Socket refusing = makeRefusingSocket(GetParam());
    const std::string address = refusing.getSocketName().str();
    const auto line = tcpLine(address);
    EXPECT_THAT([&] { LineDriver(*line).bringUp(); },
                ThrowsMessage<std::runtime_error>(StrEq("cannot connect to " + address + ": Connection refused")));
    EXPECT_EQ(line->endReason(), "cannot connect to " + address + ": Connection refused");
}

TEST_P(TcpLine, ConnectingThatHangsEndsAtItsDeadline)
{
    SettableClock clock;
    const SilentEndpoint silent(GetParam());
    const auto line = tcpLine(silent.endpoint().str());
    line->start(7);
    EXPECT_FALSE(line->advance());
    EXPECT_TRUE(line->wantsToWrite());
    EXPECT_EQ(line->advanceAt(), PollDeadline(clock.steady() + std::chrono::seconds(10)));
    clock.advance(std::chrono::nanoseconds(9999999999));
    EXPECT_FALSE(line->advance());
    clock.advance(std::chrono::nanoseconds(1));
    EXPECT_THAT([&] { line->advance(); }, ThrowsMessage<std::runtime_error>(
                                              StrEq("cannot connect to " + silent.endpoint().str() + ": timed out")));
    EXPECT_TRUE(line->advanceAt().isDisabled());
    EXPECT_FALSE(line->wantsToWrite());
}

TEST_P(TcpLine, AResetIsTheReason)
{
    Socket listener = makeListener(GetParam());
    const auto line = tcpLine(listener.getSocketName().str());
    LineDriver driver(*line);
    driver.bringUp();
    Peer peer(::dup(listener.accept().getFd()));
    peer.reset();
    EXPECT_EQ(driver.readUntilEnd(), "");
    EXPECT_EQ(line->endReason(), "Connection reset by peer");
}

TEST_P(TcpLine, HasTheOptionsThatTellThatAPeerIsGone)
{
    Socket listener = makeListener(GetParam());
    const auto line = tcpLine(listener.getSocketName().str());
    LineDriver(*line).bringUp();
    const Socket socket(::dup(line->descriptor()));
    const auto option = [&socket](int level, int name) {
        int value = -1;
        std::size_t length = sizeof(value);
        socket.getSocketOption(level, name, &value, length);
        return value;
    };
    EXPECT_EQ(option(SOL_SOCKET, SO_KEEPALIVE), 1);
    EXPECT_EQ(option(IPPROTO_TCP, TCP_KEEPIDLE) + option(IPPROTO_TCP, TCP_KEEPINTVL) * option(IPPROTO_TCP, TCP_KEEPCNT),
              60);
    EXPECT_EQ(option(IPPROTO_TCP, TCP_USER_TIMEOUT), 60000);
    EXPECT_EQ(option(IPPROTO_TCP, TCP_NODELAY), 1);
}

/// A line to a host that the test resolves.
std::unique_ptr<SocketLine> namedLine(protocol::BackgroundLookup::Resolver resolver)
{
    return std::make_unique<SocketLine>(ServerAddress::parse("terminals.example:4001"), std::move(resolver),
                                        SocketLine::Limits());
}

TEST(NamedTcpLine, ConnectsToTheFirstAddressThatAccepts)
{
    Socket refusing = makeRefusingSocket();
    Socket listener = makeListener();
    const LookupResult found{{refusing.getSocketName(), listener.getSocketName()}, ""};
    const auto line = namedLine([found](const std::string& host, std::uint16_t port) {
        EXPECT_EQ(host, "terminals.example");
        EXPECT_EQ(port, 4001);
        return found;
    });
    LineDriver driver(*line);
    driver.bringUp();
    const Peer peer(::dup(listener.accept().getFd()));
    peer.send("found");
    EXPECT_EQ(driver.read(5), "found");
}

TEST(NamedTcpLine, TheReasonIsThatOfTheLastAddress)
{
    Socket first = makeRefusingSocket();
    Socket second = makeRefusingSocket();
    const LookupResult found{{first.getSocketName(), second.getSocketName()}, ""};
    const auto line = namedLine([found](const std::string&, std::uint16_t) { return found; });
    EXPECT_THAT(
        [&] { LineDriver(*line).bringUp(); },
        ThrowsMessage<std::runtime_error>(StrEq("cannot connect to terminals.example:4001: Connection refused")));
}

TEST(NamedTcpLine, EachAddressHasItsShareOfTheTime)
{
    SettableClock clock;
    const SilentEndpoint silent;
    Socket listener = makeListener();
    const LookupResult found{{silent.endpoint(), listener.getSocketName()}, ""};
    const auto line = namedLine([found](const std::string&, std::uint16_t) { return found; });
    line->start(7);
    while (!line->wantsToWrite()) {
        LineDriver(*line).await(PollEvents::Read);
        ASSERT_FALSE(line->advance());
    }
    clock.advance(std::chrono::milliseconds(4999));
    EXPECT_FALSE(line->advance());
    clock.advance(std::chrono::milliseconds(1));
    while (!line->advance())
        LineDriver(*line).await(PollEvents::Read);
    listener.accept();
}

TEST(NamedTcpLine, ANameThatDoesNotResolveIsTheReason)
{
    const auto line = namedLine([](const std::string&, std::uint16_t) {
        return LookupResult{{}, "Name or service not known"};
    });
    EXPECT_THAT([&] { LineDriver(*line).bringUp(); },
                ThrowsMessage<std::runtime_error>(
                    StrEq("cannot resolve the name terminals.example: Name or service not known")));
}

TEST(NamedTcpLine, ANameWithoutAddressAndAResolverThatThrowsAreReasons)
{
    const std::string reason = "cannot resolve the name terminals.example: it has no address";
    const auto without = namedLine([](const std::string&, std::uint16_t) { return LookupResult(); });
    EXPECT_THAT([&] { LineDriver(*without).bringUp(); }, ThrowsMessage<std::runtime_error>(StrEq(reason)));
    const auto throwing = namedLine([](const std::string&, std::uint16_t) -> LookupResult { throw std::bad_alloc(); });
    EXPECT_THAT([&] { LineDriver(*throwing).bringUp(); }, ThrowsMessage<std::runtime_error>(StrEq(reason)));
}

TEST(NamedTcpLine, AResolverThatHangsEndsTheAttemptAndIsAskedOnlyOnce)
{
    SettableClock clock;
    std::promise<void> release;
    const std::shared_future<void> released = release.get_future().share();
    const auto asked = std::make_shared<std::atomic<int>>(0);
    const auto line = namedLine([released, asked](const std::string&, std::uint16_t) {
        ++*asked;
        released.wait();
        return LookupResult{{}, "at last"};
    });
    for (int attempt = 0; attempt < 3; ++attempt) {
        line->start(7);
        EXPECT_FALSE(line->advance());
        clock.advance(std::chrono::seconds(10));
        EXPECT_THAT([&] { line->advance(); },
                    ThrowsMessage<std::runtime_error>(StrEq("cannot resolve the name terminals.example: timed out")));
        line->stop();
    }
    release.set_value();
    EXPECT_THAT([&] { LineDriver(*line).bringUp(); },
                ThrowsMessage<std::runtime_error>(StrEq("cannot resolve the name terminals.example: at last")));
    EXPECT_EQ(*asked, 1);
}

TEST(NamedTcpLine, TheNameIsLookedUpForEachConnection)
{
    Socket listener = makeListener();
    const LookupResult found{{listener.getSocketName()}, ""};
    const auto asked = std::make_shared<std::atomic<int>>(0);
    const auto line = namedLine([found, asked](const std::string&, std::uint16_t) {
        ++*asked;
        return found;
    });
    LineDriver driver(*line);
    driver.bringUp();
    listener.accept();
    EXPECT_EQ(driver.readUntilEnd(), "");
    driver.bringUp();
    EXPECT_EQ(*asked, 2);
}

TEST(NamedTcpLine, AnAnswerThatThereIsNoMemoryForIsTakenLater)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    Socket listener = makeListener();
    const LookupResult found{{listener.getSocketName()}, ""};
    bool isUp = false;
    for (std::size_t allowed = 0; !isUp; ++allowed) {
        ASSERT_LT(allowed, 100U);
        const auto line = namedLine([found](const std::string&, std::uint16_t) { return found; });
        LineDriver driver(*line);
        line->start(7);
        driver.await(PollEvents::Read);
        bool failed = false;
        {
            Allocations allocations;
            allocations.failAfter(allowed);
            try {
                isUp = line->advance();
            } catch (const std::bad_alloc&) {
                failed = true;
            }
        }
        EXPECT_NE(::fcntl(line->descriptor(), F_GETFD), -1) << "it is still there, and open";
        if (!failed) break;
        while (!line->advance())
            driver.await(PollEvents::Read);
        listener.accept();
    }
}

TEST(NamedTcpLine, TheSystemResolvesLocalhost)
{
    Socket listener = makeListener();
    const auto line = tcpLine("localhost:" + std::to_string(listener.getSocketName().getPort()));
    LineDriver driver(*line);
    driver.bringUp();
    const Peer peer(::dup(listener.accept().getFd()));
    driver.write("hello");
    EXPECT_EQ(peer.receive(5), "hello");
}

TEST(TcpLineAddress, RefusesWhatIsNotAHostAndAPort)
{
    EXPECT_THAT([] { tcpLine("terminals.example"); },
                ThrowsMessage<std::invalid_argument>(
                    StrEq("server: \"terminals.example\" has no port from 1 to 65535 after its last colon")));
    EXPECT_THROW(tcpLine("terminals.example:0"), std::invalid_argument);
    EXPECT_THROW(tcpLine("terminals.example:65536"), std::invalid_argument);
    EXPECT_NE(tcpLine("terminals.example:65535"), nullptr);
}

TEST(SelfConnection, IsToldFromAConnectionToAPeer)
{
    Socket socket = makeRefusingSocket();
    socket.connect(socket.getSocketName(), std::chrono::seconds(10));
    EXPECT_TRUE(protocol::isSelfConnected(socket.getFd()));
    const TcpPair pair = makeTcpPair();
    EXPECT_FALSE(protocol::isSelfConnected(pair.client.getFd()));
    EXPECT_FALSE(protocol::isSelfConnected(-1));
}

} // namespace

} // namespace qel::test
