// Connecting again: when, how often, and how it is interrupted.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "console/CloseSwitch.hpp"
#include "protocol/console/OtherEnd.hpp"
#include "support/CapturedLog.hpp"
#include "support/Errors.hpp"
#include "support/Loopback.hpp"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <gmock/gmock.h>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;
using ::testing::Contains;
using ::testing::MatchesRegex;

/// A server on loopback that treats each connection as the test says, one after the other. The last way is used for all
/// further connections.
class FakeServer {
public:
    using Way = std::function<void(LoopbackMessages&)>;

    explicit FakeServer(std::vector<Way> ways, Cover cover = Cover::Plain)
        : mWays(std::move(ways)), mCover(cover), mListener(makeListener()), mThread([this] { pServe(); })
    {}
    ~FakeServer()
    {
        mStopping = true;
        Socket wake(IPFamily::IPv4, SOCK_STREAM | SOCK_CLOEXEC, 0);
        wake.connect(mListener.getSocketName(), Loopback::kDeadline);
        mThread.join();
    }

    std::string address() const { return mListener.getSocketName().str(); }
    unsigned int connections() const { return mConnections; }
    void awaitConnections(unsigned int count) const
    {
        while (mConnections < count)
            std::this_thread::yield();
    }

private:
    void pServe()
    {
        for (;;) {
            auto socket = std::make_unique<SocketStream>(mListener.accept());
            if (mStopping) return;
            const unsigned int number = mConnections++;
            socket->setReadDeadline(Loopback::kDeadline);
            const int descriptor = socket->getSocket().getFd();
            try {
                const auto stream = takeCover(mCover, std::move(socket), descriptor);
                LoopbackMessages messages(*stream);
                mWays[std::min<std::size_t>(number, mWays.size() - 1)](messages);
            } catch (const std::exception&) { // the console has gone
            }
        }
    }

    const std::vector<Way> mWays;
    const Cover mCover;
    std::atomic<unsigned int> mConnections{0};
    std::atomic<bool> mStopping{false};
    Socket mListener;
    std::thread mThread;
};

void closeAtOnce(LoopbackMessages&) {}

void serveUntilTheEnd(LoopbackMessages& messages)
{
    welcome(messages);
    for (;;) {
        const auto request = messages.receive();
        messages.send(
            QelMessageGeneric(request->getCallerId(), request->getFunction(), request->getOperation(), MsgResponse));
    }
}

FakeServer::Way refuseWith(QelMessageStatusCodes status)
{
    return [status](LoopbackMessages& messages) {
        const auto request = messages.receive();
        QelMessageGeneric response(request->getCallerId(), request->getFunction(), request->getOperation(),
                                   MsgResponse);
        response.setStatus(status);
        messages.send(response);
        messages.isClosed();
    };
}

ConsoleOptions impatientOptions(const FakeServer& server)
{
    ConsoleOptions options = consoleOptions(Cover::Plain, server.address());
    options.retry = Backoff();
    options.retry->first = milliseconds(1);
    options.retry->longest = milliseconds(2);
    return options;
}

// When.

TEST(Retry, GoesOnWhereWaitingMayHelp)
{
    const CapturedLog log(LogLevel::Info);
    const FakeServer server({closeAtOnce, refuseWith(QelMessageStatusTooManyConnections),
                             refuseWith(QelMessageStatusDaxAlreadyConnected),
                             [](LoopbackMessages& messages) {
                                 messages.receive();
                                 messages.send(QelMessageKrogConnectionClosedAsync());
                             },
                             serveUntilTheEnd});
    Console console(impatientOptions(server));
    EXPECT_EQ(server.connections(), 5U);
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
    EXPECT_THAT(log.lines(), Contains(MatchesRegex("I: \\[qel\\] connection lost: .*; next attempt in [12] ms")));
}

TEST(Retry, GoesOnWhenAServerIsGoneInTheIntroductionOverTls)
{
    const CapturedLog log(LogLevel::Info);
    const FakeServer server({closeAtOnce, [](LoopbackMessages& messages) { messages.receive(); }, serveUntilTheEnd},
                            Cover::Tls);
    ConsoleOptions options = impatientOptions(server);
    options.plain = false;
    options.credentials = consoleCredentials();
    Console console(options);
    EXPECT_EQ(server.connections(), 3U);
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
}

TEST(Retry, EndsWhereWaitingDoesNotHelp)
{
    struct Row {
        const char* name;
        FakeServer::Way way;
        std::function<void(const std::function<void()>&)> expect;
    };
    const std::vector<Row> rows{
        {"broken protocol",
         [](LoopbackMessages& messages) {
             messages.receive();
             messages.sendBytes(std::string(64, 'x'));
             messages.isClosed();
         },
         [](const auto& work) { EXPECT_THROW(work(), ProtocolBroken); }},
        {"only TLS",
         [](LoopbackMessages& messages) {
             messages.receive();
             messages.send(QelMessageGeneric(1, 0x6001, 0x0002, NoFlagSet));
         },
         [](const auto& work) { EXPECT_THROW(work(), TurnedAway); }},
        {"refused", refuseWith(QelMessageStatusInvalidData),
         [](const auto& work) { EXPECT_THROW(work(), StatusError); }},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        const FakeServer server({row.way});
        row.expect([&] { Console console(impatientOptions(server)); });
        EXPECT_EQ(server.connections(), 1U);
    }
}

TEST(Retry, IsNotDoneUnlessAskedFor)
{
    const FakeServer server({closeAtOnce});
    EXPECT_THROW(Console(consoleOptions(Cover::Plain, server.address())), ClosedByPeer);
    EXPECT_EQ(server.connections(), 1U);
}

TEST(Retry, EndsAfterTheLastAttemptWithTheLastFailure)
{
    const FakeServer server({closeAtOnce, closeAtOnce, refuseWith(QelMessageStatusTooManyConnections)});
    ConsoleOptions options = impatientOptions(server);
    options.retry->attempts = 3;
    EXPECT_THROW(Console{options}, StatusError);
    EXPECT_EQ(server.connections(), 3U);
}

TEST(Retry, DoesNotWaitBeyondTheDeadline)
{
    const FakeServer server({closeAtOnce});
    ConsoleOptions options = impatientOptions(server);
    options.retry->first = options.retry->longest = std::chrono::hours(1);
    const auto before = std::chrono::steady_clock::now();
    EXPECT_THROW(Console(options, std::chrono::seconds(20)), ClosedByPeer);
    EXPECT_LT(std::chrono::steady_clock::now() - before, std::chrono::seconds(10));
    EXPECT_EQ(server.connections(), 1U);
}

TEST(Retry, FindsAServerThatStartsLater)
{
    const Socket refusing = makeRefusingSocket();
    ConsoleOptions options = consoleOptions(Cover::Plain, refusing.getSocketName().str());
    options.retry = Backoff();
    options.retry->first = milliseconds(1);
    options.retry->attempts = 4;
    EXPECT_THROW(Console{options}, CannotConnect);
}

// Again.

TEST(Reconnect, MakesANewConnectionAndKeepsTheHandlers)
{
    const FakeServer server({[](LoopbackMessages& messages) {
                                 welcome(messages);
                                 messages.receive();
                             },
                             [](LoopbackMessages& messages) {
                                 welcome(messages);
                                 messages.send(QelMessageDaxBroadcastOutboundAsync(1, 1, "them", "x"));
                                 messages.isClosed();
                             }});
    Console console(impatientOptions(server));
    std::string heard;
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>(
        [&](const auto& notice) { heard = notice.getSenderToolId(); });
    EXPECT_THROW(console.request(QelMessageGetQelTodReq()), ClosedByPeer);
    EXPECT_THROW(console.process(), ClosedByPeer);
    console.reconnect(std::chrono::seconds(10));
    EXPECT_TRUE(console.process(std::chrono::seconds(10)));
    EXPECT_EQ(heard, "them");
    EXPECT_EQ(server.connections(), 2U);
}

TEST(Reconnect, EndsWhatBelongedToTheOldConnection)
{
    const FakeServer server({serveUntilTheEnd});
    Console console(impatientOptions(server));
    SerialSession session = console.openSerial(1);
    auto pending = console.start(QelMessageGetQelTodReq());
    console.reconnect(std::chrono::seconds(10));
    EXPECT_EQ(session.getEnd(), SessionEnd::ConnectionClosed);
    char byte = 0;
    EXPECT_EQ(session.read(&byte, 1), 0U);
    EXPECT_EQ(session.write("x"), 0U);
    EXPECT_TRUE(pending.isReady());
    EXPECT_THAT([&] { pending.get(); }, failsWith<ClosedByPeer>("the connection has been replaced by another one"));
    const SerialSession again = console.openSerial(1); // with a hypervisor session of its own
    EXPECT_EQ(again.getEnd(), SessionEnd::None);
}

TEST(Reconnect, MayBeDoneByTheHandlerOfTheConnectionClosedNotice)
{
    const FakeServer server({[](LoopbackMessages& messages) {
                                 welcome(messages);
                                 messages.receive();
                                 messages.send(QelMessageKrogConnectionClosedAsync());
                                 messages.isClosed();
                             },
                             serveUntilTheEnd});
    Console console(impatientOptions(server));
    console.onNotice<QelMessageKrogConnectionClosedAsync>(
        [&](const auto&) { console.reconnect(std::chrono::seconds(10)); });
    EXPECT_THAT([&] { console.exchange(QelMessageGetQelTodReq()); },
                failsWith<ClosedByPeer>("the server closed the connection"));
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
    EXPECT_EQ(server.connections(), 2U);
}

TEST(Reconnect, MayBeDoneByAHandlerWhileARequestWaitsToBeSent)
{
    std::promise<void> mayTake;
    const FakeServer server({[&](LoopbackMessages& messages) {
                                 welcome(messages);
                                 messages.send(QelMessageDaxBroadcastOutboundAsync(1, 1, "them", "x"));
                                 mayTake.get_future().wait();
                                 for (;;)
                                     messages.receive();
                             },
                             serveUntilTheEnd});
    Console console(impatientOptions(server));
    bool isReplaced = false;
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>([&](const auto&) {
        mayTake.set_value();
        console.reconnect(std::chrono::seconds(10));
        isReplaced = true;
    });
    std::vector<PendingResponse<QelMessageSetGlobalSaveAreaMetadataRsp>> pending;
    while (!isReplaced)
        pending.push_back(console.start(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16000, 'x'))));
    EXPECT_THAT([&] { pending.back().get(); },
                failsWith<ClosedByPeer>("the connection has been replaced by another one"));
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
}

TEST(Reconnect, IsNotBegunAgainByAHandlerThatItCalls)
{
    const FakeServer server({serveUntilTheEnd,
                             [](LoopbackMessages& messages) {
                                 messages.receive();
                                 messages.send(QelMessageKrogConnectionClosedAsync());
                                 messages.isClosed();
                             },
                             serveUntilTheEnd});
    Console console(impatientOptions(server));
    int calls = 0;
    console.onNotice<QelMessageKrogConnectionClosedAsync>([&](const auto&) {
        ++calls;
        console.reconnect(std::chrono::seconds(10));
    });
    console.reconnect(std::chrono::seconds(10));
    EXPECT_EQ(calls, 1);
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
    EXPECT_EQ(server.connections(), 3U);
}

TEST(Reconnect, LeavesPolitelyFirst)
{
    std::promise<bool> hasLeft;
    const FakeServer server({[&](LoopbackMessages& messages) {
                                 welcome(messages);
                                 hasLeft.set_value(messages.isClosed());
                             },
                             serveUntilTheEnd});
    Console console(impatientOptions(server));
    console.reconnect(std::chrono::seconds(10));
    EXPECT_TRUE(hasLeft.get_future().get());
}

TEST(Reconnect, AfterAFailureEveryCallFailsUntilTheNext)
{
    const FakeServer server({serveUntilTheEnd, refuseWith(QelMessageStatusInvalidData), serveUntilTheEnd});
    Console console(impatientOptions(server));
    EXPECT_THROW(console.reconnect(std::chrono::seconds(10)), StatusError);
    EXPECT_THROW(console.exchange(QelMessageGetQelTodReq()), StatusError);
    EXPECT_THROW(console.process(), StatusError);
    EXPECT_EQ(console.getPollFd(PollEvents::Read).mFd.fd, -1);
    EXPECT_FALSE(console.hasPending());
    EXPECT_EQ(console.version().getSystemMachineType(), "type") << "that of the connection before";
    console.leave();
    console.reconnect(std::chrono::seconds(10));
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
}

TEST(Reconnect, IsPossibleAfterLeavingButNotAfterClosing)
{
    const FakeServer server({serveUntilTheEnd});
    Console console(impatientOptions(server));
    console.leave();
    console.reconnect(std::chrono::seconds(10));
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq()));
    console.close();
    EXPECT_THAT([&] { console.reconnect(std::chrono::seconds(10)); }, failsWith<Error>("this console is closed"));
}

TEST(Reconnect, CloseEndsTheWaitForTheNextAttempt)
{
    const FakeServer server({serveUntilTheEnd, closeAtOnce});
    ConsoleOptions options = impatientOptions(server);
    options.retry->first = options.retry->longest = std::chrono::hours(1);
    Console console(options);
    std::thread other([&] {
        server.awaitConnections(2);
        console.close();
    });
    EXPECT_THAT([&] { console.reconnect(milliseconds(-1)); }, failsWith<Error>("this console is closed"));
    other.join();
}

TEST(Reconnect, CloseEndsAnAttemptThatWaitsForTheServer)
{
    const FakeServer server({serveUntilTheEnd, [](LoopbackMessages& messages) {
                                 messages.receive();
                                 messages.isClosed();
                             }});
    Console console(impatientOptions(server));
    std::thread other([&] {
        server.awaitConnections(2);
        console.close();
    });
    EXPECT_THAT([&] { console.reconnect(milliseconds(-1)); }, failsWith<Error>("this console is closed"));
    other.join();
}

TEST(CloseSwitch, ClosesTheStreamThatIsWatchedNowOrLater)
{
    auto first = makeMemoryStreams();
    auto second = makeMemoryStreams();
    CloseSwitch closeSwitch;
    closeSwitch.watch(first.first.get());
    EXPECT_FALSE(closeSwitch.isClosed());
    closeSwitch.close();
    EXPECT_TRUE(closeSwitch.isClosed());
    char byte = 0;
    EXPECT_EQ(first.second->read(&byte, 1), 0U);
    closeSwitch.watch(second.first.get());
    EXPECT_EQ(second.second->read(&byte, 1), 0U);
    closeSwitch.watch(nullptr);
    closeSwitch.close();
}

TEST(CloseSwitch, TheWaitEndsAtItsTimeOrWhenItIsClosed)
{
    CloseSwitch closeSwitch;
    const auto now = std::chrono::steady_clock::now();
    EXPECT_TRUE(closeSwitch.sleepUntil(now));
    EXPECT_TRUE(closeSwitch.sleepUntil(now + milliseconds(2)));
    EXPECT_GE(std::chrono::steady_clock::now(), now + milliseconds(2));
    std::thread other([&] { closeSwitch.close(); });
    EXPECT_FALSE(closeSwitch.sleepUntil(now + std::chrono::hours(1)));
    other.join();
    EXPECT_FALSE(closeSwitch.sleepUntil(now));
}

} // namespace

} // namespace qel::test
