// What goes out together, and in which order.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/MemoryStream.hpp>

#include "protocol/server/ServedFixture.hpp"
#include "support/Authority.hpp"
#include "support/LoopbackEnds.hpp"

#include <algorithm>
#include <array>
#include <future>
#include <gmock/gmock.h>
#include <random>
#include <sys/socket.h>
#include <thread>

namespace qel::test {

namespace {

using protocol::Connection;
using protocol::ConnectionLimits;

QelMessageDaxBroadcastReq broadcastTo(const std::string& toolId, const std::string& payload)
{
    return {1, static_cast<std::uint16_t>(payload.size()), 7, toolId, payload.data()};
}

std::string payloadOf(const QelMessageDaxBroadcastOutboundAsync& notice)
{
    return {notice.getDaxPacket(), notice.getBroadcastMsgLen()};
}

std::string bytesOf(const QelMessage& message) { return {message.serialize(), message.msgLength()}; }

/// One end of a connection that the test plays the console of.
struct Served {
    std::unique_ptr<Stream> stream; // of the console
    std::unique_ptr<Connection> connection;
    int descriptor = -1; // of the stream's socket; -1: it has none
};

class ConnectionBatches : public ServedFixture {
protected:
    enum class Transport { Memory, Socket, Tls };

    ConnectionBatches() { mServerContext.setCredentials(Authority::trusted().serverCredentials()); }

    Served connect(Transport transport, const ConnectionLimits& limits = {})
    {
        Served served;
        if (transport == Transport::Memory) {
            auto ends = protocol::makeMemoryStreams();
            ends.first->setReadDeadline(Loopback::kDeadline);
            served.stream = std::move(ends.first);
            served.connection = ServedFixture::serve(std::move(ends.second), -1, limits);
            served.connection->start();
            return served;
        }
        Loopback ends;
        const bool isTls = transport == Transport::Tls;
        served.connection = ServedFixture::serve(ends, limits, isTls ? &mServerContext : nullptr);
        served.connection->start();
        served.descriptor = ends.near->getSocket().getFd();
        served.stream = std::move(ends.near);
        if (isTls) served.stream = startTls(std::move(served.stream));
        return served;
    }

    Served connectAs(const std::string& toolId, Transport transport, const ConnectionLimits& limits = {})
    {
        Served served = connect(transport, limits);
        LoopbackMessages messages(*served.stream);
        EXPECT_EQ(messages.ask(versionRequest(toolId))->getStatus(), 0U);
        return served;
    }

private:
    std::unique_ptr<Stream> startTls(std::unique_ptr<Stream> clear)
    {
        LoopbackMessages(*clear).ask(QelMessageUpgradeConnectionAsync());
        SSLClientContext context;
        context.setCredentials(Authority::trusted().clientCredentials());
        auto tls = std::make_unique<SSLStream>(context, std::move(clear));
        tls->handshake();
        return tls;
    }

    SSLServerContext mServerContext;
};

class OnEachTransport : public ConnectionBatches, public ::testing::WithParamInterface<int> {
protected:
    Transport transport() const { return static_cast<Transport>(GetParam()); }
};

std::string nameOf(const ::testing::TestParamInfo<int>& tested)
{
    static const std::array<const char*, 3> names{"Memory", "Socket", "Tls"};
    return names.at(static_cast<std::size_t>(tested.param));
}

INSTANTIATE_TEST_SUITE_P(Transports, OnEachTransport, ::testing::Values(0, 1, 2), nameOf);

/// The responses go to the sender and the notices to the addressee, whatever the pieces are in which the bytes arrive.
TEST_P(OnEachTransport, RandomFramesInRandomPiecesArriveInOrderAndUnchanged)
{
    constexpr unsigned kFrames = 1500;
    ConnectionLimits limits;
    limits.queueBytes = 64 * 1024 * 1024; // none is dropped
    const Served sender = connectAs("sender", transport(), limits);
    const Served addressee = connectAs("addressee", transport(), limits);

    std::mt19937 random(4711);
    const auto below = [&](std::size_t limit) {
        return std::uniform_int_distribution<std::size_t>(0, limit - 1)(random);
    };
    std::string bytes;
    std::vector<std::string> payloads;
    std::vector<unsigned int> ids;
    for (unsigned i = 0; i < kFrames; ++i) {
        const std::size_t length = i % 50 == 0 ? 16306 : 1 + below(i % 5 == 0 ? 3000 : 100);
        payloads.emplace_back(length, static_cast<char>('a' + i % 26));
        const auto request = broadcastTo("addressee", payloads.back());
        ids.push_back(request.getCallerId());
        bytes += bytesOf(request);
    }
    std::vector<std::size_t> cuts;
    for (std::size_t at = 0; at < bytes.size(); at += cuts.back())
        cuts.push_back(std::min(1 + below(below(4) == 0 ? 20000 : 200), bytes.size() - at));

    auto answered = std::async(std::launch::async, [&] {
        std::vector<unsigned int> answers;
        LoopbackMessages messages(*sender.stream);
        while (answers.size() < kFrames) {
            const auto response = messages.receive();
            EXPECT_EQ(response->getStatus(), 0U);
            answers.push_back(response->getCallerId());
        }
        return answers;
    });
    auto taken = std::async(std::launch::async, [&] {
        std::vector<std::string> notices;
        LoopbackMessages messages(*addressee.stream);
        while (notices.size() < kFrames)
            notices.push_back(payloadOf(*messages.receive<QelMessageDaxBroadcastOutboundAsync>()));
        return notices;
    });
    std::size_t at = 0;
    for (const std::size_t cut : cuts) {
        sender.stream->write(bytes.data() + at, cut);
        at += cut;
    }
    EXPECT_EQ(answered.get(), ids);
    EXPECT_EQ(taken.get(), payloads);
}

TEST_P(OnEachTransport, ResponsesAndSerialDataGoOutInTheOrderInWhichTheyWereMade)
{
    constexpr unsigned kRounds = 300;
    const Served console = connectAs("a", transport());
    LoopbackMessages messages(*console.stream);
    messages.ask(QelMessageInterfaceCmpOpenKrogSessionReq());
    messages.ask(QelMessageVirtualSerialOpenReq(1, 0, false));
    messages.ask(QelMessageVirtualSerialSetupSessionReq(1, 0));
    std::string requests;
    std::vector<unsigned int> ids;
    for (unsigned i = 0; i < kRounds; ++i) {
        const QelMessageGetQelTodReq request;
        ids.push_back(request.getCallerId());
        requests += bytesOf(request);
    }
    std::thread partition([&] { // plays the serial thread
        for (unsigned i = 0; i < kRounds; ++i) {
            port1->output = {std::string(1 + i % 100, static_cast<char>('a' + i % 26))};
            hypervisor->serviceSerial(1);
        }
        port1->ended = true;
        hypervisor->serviceSerial(1);
    });
    console.stream->write(requests.data(), requests.size());
    std::vector<unsigned int> answers;
    std::string data;
    bool isClosed = false;
    while (answers.size() < kRounds || !isClosed) {
        const auto message = messages.receive();
        if (message->getClassification() == QelMessageClassification::Response) {
            answers.push_back(message->getCallerId());
        } else if (const auto* piece = dynamic_cast<QelMessageVirtualSerialDataToDaxAsync*>(message.get())) {
            EXPECT_FALSE(isClosed); // all output comes before the notice
            data.append(piece->getSerialData(), piece->getSerialDataLength());
        } else {
            EXPECT_NE(dynamic_cast<QelMessageVirtualSerialSessionClosedAsync*>(message.get()), nullptr);
            isClosed = true;
        }
    }
    partition.join();
    EXPECT_EQ(answers, ids);
    std::string printed;
    for (unsigned i = 0; i < kRounds; ++i)
        printed.append(1 + i % 100, static_cast<char>('a' + i % 26));
    EXPECT_EQ(data, printed);
}

TEST_P(OnEachTransport, ARequestIsAnsweredThoughTheNextOneHasOnlyBegun)
{
    const Served console = connectAs("a", transport());
    LoopbackMessages messages(*console.stream);
    const QelMessageGetQelTodReq request;
    const std::string bytes = bytesOf(request);
    for (std::size_t begun = 1; begun < bytes.size(); ++begun) {
        messages.sendBytes(bytes + bytes.substr(0, begun));
        EXPECT_EQ(messages.receive()->getCallerId(), request.getCallerId());
        messages.sendBytes(bytes.substr(begun));
        EXPECT_EQ(messages.receive()->getCallerId(), request.getCallerId());
    }
}

TEST_P(OnEachTransport, AnAddresseeThatDoesNotReadHoldsNobodyUpAndGetsWhatWasAccepted)
{
    const Served sender = connectAs("sender", transport());
    const Served addressee = connectAs("addressee", transport());
    LoopbackMessages messages(*sender.stream);
    std::vector<std::string> accepted;
    unsigned int status = 0;
    for (unsigned i = 0; status == 0; ++i) { // until the queue is full
        const std::string payload(16000 - i % 100, static_cast<char>('a' + i % 26));
        status = messages.ask(broadcastTo("addressee", payload))->getStatus();
        if (status == 0) accepted.push_back(payload);
    }
    EXPECT_EQ(status, 6U);
    EXPECT_EQ(messages.ask(QelMessageGetQelTodReq())->getStatus(), 0U);
    LoopbackMessages late(*addressee.stream);
    for (const std::string& payload : accepted)
        ASSERT_EQ(payloadOf(*late.receive<QelMessageDaxBroadcastOutboundAsync>()), payload);
    EXPECT_EQ(late.ask(QelMessageGetQelTodReq())->getStatus(), 0U);
}

TEST_P(OnEachTransport, AnAddresseeThatGoesAwayEndsAloneAndTheSenderGoesOn)
{
    const Served sender = connectAs("sender", transport());
    LoopbackMessages messages(*sender.stream);
    for (unsigned round = 0; round < 20; ++round) {
        Served addressee = connectAs("addressee", transport());
        std::thread leaving([&] { addressee.stream.reset(); });
        unsigned int status = 0;
        while (status == 0 || status == 6)
            status = messages.ask(broadcastTo("addressee", std::string(1000, 'x')))->getStatus();
        EXPECT_EQ(status, 19U); // not connected any more
        leaving.join();
        addressee.connection.reset();
    }
    EXPECT_EQ(messages.ask(QelMessageGetQelTodReq())->getStatus(), 0U);
}

TEST_P(OnEachTransport, AConsoleThatLeavesInTheMiddleOfABatchIsForgotten)
{
    std::string requests;
    for (unsigned i = 0; i < 500; ++i)
        requests += bytesOf(QelMessageGetQelTodReq());
    for (unsigned round = 0; round < 10; ++round) {
        Served console = connectAs("a", transport()); // the identity is free again each time
        ended.eoi();
        console.stream->write(requests.data(), requests.size());
        if (round % 2 == 0) static_cast<void>(LoopbackMessages(*console.stream).receive());
        console.stream.reset();
        awaitEnd(*console.connection);
    }
}

TEST_P(OnEachTransport, ResponsesToARequestInABatchBeforeAMalformedFrameAreSent)
{
    const Served console = connectAs("a", transport());
    std::string bytes;
    std::vector<unsigned int> ids;
    for (unsigned i = 0; i < 50; ++i) {
        const QelMessageGetQelTodReq request;
        ids.push_back(request.getCallerId());
        bytes += bytesOf(request);
    }
    bytes += std::string(16, 'x');
    console.stream->write(bytes.data(), bytes.size());
    LoopbackMessages messages(*console.stream);
    for (const unsigned int id : ids)
        EXPECT_EQ(messages.receive()->getCallerId(), id);
    EXPECT_TRUE(messages.isClosed());
}

TEST_P(OnEachTransport, AConsoleThatStopsInTheMiddleOfAFrameAfterABatchIsClosedInTime)
{
    ConnectionLimits limits;
    limits.frame = std::chrono::milliseconds(50);
    const Served console = connectAs("a", transport(), limits);
    const std::string request = bytesOf(QelMessageGetQelTodReq());
    LoopbackMessages messages(*console.stream);
    messages.sendBytes(request + request + request.substr(0, 20));
    static_cast<void>(messages.receive());
    static_cast<void>(messages.receive());
    EXPECT_TRUE(messages.isClosed());
}

TEST_P(OnEachTransport, TheNoticesOfTheEndComeAfterTheResponsesOfABatch)
{
    const Served console = connectAs("a", transport());
    std::string bytes;
    for (unsigned i = 0; i < 200; ++i)
        bytes += bytesOf(QelMessageGetQelTodReq());
    console.stream->write(bytes.data(), bytes.size());
    LoopbackMessages messages(*console.stream);
    static_cast<void>(messages.receive());
    hypervisor->shutDown();
    bool isOver = false;
    try {
        for (;;) {
            const auto message = messages.receive();
            EXPECT_FALSE(isOver);
            isOver = dynamic_cast<QelMessageKrogConnectionClosedAsync*>(message.get()) != nullptr;
        }
    } catch (const StreamIOException&) {
        EXPECT_TRUE(isOver); // the notice was the last message
    }
}

/// Identities are free again, whoever was sending to them when they left.
TEST_P(OnEachTransport, ConsolesThatComeAndGoWhileAllSendToOneAnotherAreForgotten)
{
    constexpr unsigned kConsoles = 4;
    const auto comeAndGo = [this](unsigned number) {
        std::mt19937 random(number);
        for (unsigned round = 0; round < 10; ++round) {
            Served console = connectAs(std::to_string(number), transport());
            std::string bytes;
            for (unsigned i = 0; i < 40; ++i) { // each has a response
                const std::string other = std::to_string(random() % kConsoles);
                bytes += bytesOf(broadcastTo(other, std::string(random() % 2000, 'x')));
            }
            console.stream->write(bytes.data(), bytes.size());
            LoopbackMessages messages(*console.stream);
            for (auto left = random() % 40; left > 0; --left)
                static_cast<void>(messages.receive());
            if (random() % 2 == 0) console.stream.reset(); // otherwise the connection ends first
            console.connection.reset();
        }
    };
    std::vector<std::thread> threads;
    for (unsigned number = 0; number < kConsoles; ++number)
        threads.emplace_back(comeAndGo, number);
    for (std::thread& thread : threads)
        thread.join();
    for (unsigned number = 0; number < kConsoles; ++number)
        static_cast<void>(connectAs(std::to_string(number), transport()));
}

class OnEachSocket : public OnEachTransport {};

INSTANTIATE_TEST_SUITE_P(Transports, OnEachSocket, ::testing::Values(1, 2), nameOf);

/// They are many batches, of which the reader of the connection sends at most one.
TEST_P(OnEachSocket, AConsoleThatHalfClosesGetsTheResponsesToAllItHasSent)
{
    const Served console = connectAs("a", transport());
    LoopbackMessages messages(*console.stream);
    ASSERT_EQ(messages.ask(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16000, 'm')))->getStatus(), 0U);
    std::string bytes;
    std::vector<unsigned int> ids;
    for (unsigned i = 0; i < 15; ++i) { // the queue has room for all responses
        const QelMessageGetGlobalSaveAreaMetadataReq request;
        ids.push_back(request.getCallerId());
        bytes += bytesOf(request);
    }
    messages.sendBytes(bytes);
    ASSERT_EQ(::shutdown(console.descriptor, SHUT_WR), 0);
    for (const unsigned int id : ids)
        ASSERT_EQ(messages.receive()->getCallerId(), id);
    EXPECT_TRUE(messages.isClosed());
}

} // namespace

} // namespace qel::test
