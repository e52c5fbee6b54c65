// Requests that are gathered: when they go out, and what happens when they cannot.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "console/FrameLink.hpp"
#include "protocol/console/FakeHypervisorEnd.hpp"
#include "protocol/console/OtherEnd.hpp"
#include "support/CapturedLog.hpp"
#include "support/Errors.hpp"
#include "transport/Readiness.hpp"

#include <chrono>
#include <deque>
#include <functional>
#include <future>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;
using ::testing::IsEmpty;

using Request = QelMessageSetGlobalSaveAreaMetadataReq;
using Response = QelMessageSetGlobalSaveAreaMetadataRsp;

QelMessageGeneric answerTo(const QelMessage& request, const std::string& payload)
{
    QelMessageGeneric answer(request.getCallerId(), request.getFunction(), request.getOperation(), MsgResponse);
    answer.setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return answer;
}

std::string payloadOf(const QelMessage& message) { return std::string(message.getData(), message.dataLength()); }

/// A console, introduced, whose peer answers each request with the request's own metadata.
class ConsoleGathering : public ::testing::Test {
protected:
    void SetUp() override
    {
        end->onMessage = [this](const QelMessage& message) {
            const auto* const request = dynamic_cast<const Request*>(&message);
            if (request != nullptr) return end->push(answerTo(message, request->getMetadata()));
            end->grant(message);
        };
    }
    std::vector<unsigned int> operations() const
    {
        std::vector<unsigned int> all;
        for (const auto& message : end->received)
            all.push_back(message->getOperation());
        return all;
    }

    const CapturedLog log{LogLevel::Warn};
    FakeHypervisorEnd* end = nullptr; // owned by the console
    Console console = FakeHypervisorEnd::makeConsole(end, FakeHypervisorEnd::plainOptions(), true);
};

// When they go out.

TEST_F(ConsoleGathering, RequestsWaitForOneAnother)
{
    auto first = console.start(Request("1"));
    auto second = console.start(Request("2"));
    EXPECT_THAT(end->received, IsEmpty());
    EXPECT_TRUE(console.hasPending()) << "a loop must not wait now";
    EXPECT_EQ(payloadOf(*second.get()), "2");
    EXPECT_EQ(payloadOf(*first.get()), "1");
    EXPECT_EQ(end->writes, 1U);
    EXPECT_FALSE(console.hasPending());
}

TEST_F(ConsoleGathering, ProcessSendsThem)
{
    end->onMessage = [](const QelMessage&) {};
    auto pending = console.start(Request("1"));
    EXPECT_FALSE(console.process());
    EXPECT_EQ(end->received.size(), 1U);
    EXPECT_FALSE(console.hasPending());
}

TEST_F(ConsoleGathering, AnythingElseThatIsSentTakesThemAlong)
{
    auto first = console.start(Request("1"));
    console.exchange(QelMessageGetQelTodReq());
    EXPECT_EQ(end->writes, 1U);
    auto second = console.start(Request("2"));
    console.send(QelMessageKrogConnectionClosedAsync());
    EXPECT_EQ(end->writes, 2U);
    EXPECT_THAT(operations(), ::testing::ElementsAre(0x010AU, 0x0107U, 0x010AU, 0xA009U));
    EXPECT_EQ(payloadOf(*second.get()), "2");
}

TEST_F(ConsoleGathering, ALoneRequestIsSentAtOnce)
{
    console.exchange(QelMessageGetQelTodReq());
    EXPECT_EQ(end->writes, 1U);
    EXPECT_EQ(end->received.size(), 1U);
}

TEST_F(ConsoleGathering, WhatASessionWritesIsSentBeforeTheCallReturns)
{
    SerialSession session = console.openSerial(1);
    end->forget();
    auto pending = console.start(Request("1"));
    EXPECT_EQ(session.write("x"), 1U);
    EXPECT_EQ(end->writes, 1U);
    EXPECT_EQ(end->received.size(), 2U);
    EXPECT_EQ(session.write(std::string(SerialSession::kMaxData, 'x')), SerialSession::kMaxData);
    EXPECT_EQ(end->received.size(), 3U);
}

TEST_F(ConsoleGathering, LeavingSendsThem)
{
    end->onMessage = [](const QelMessage&) {};
    auto pending = console.start(Request("1"));
    end->end();
    console.leave();
    EXPECT_EQ(end->received.size(), 1U);
    EXPECT_THAT([&] { pending.get(); }, failsWith<Error>("this console has left"));
}

TEST_F(ConsoleGathering, WhatHasBeenReadAheadIsHandledFirst)
{
    auto first = console.start(Request("1"));
    auto second = console.start(Request("2"));
    EXPECT_EQ(payloadOf(*first.get()), "1");
    auto third = console.start(Request("3"));
    EXPECT_EQ(payloadOf(*second.get()), "2");
    EXPECT_EQ(end->received.size(), 2U) << "nothing had to be waited for";
    EXPECT_EQ(payloadOf(*third.get()), "3");
    EXPECT_EQ(end->writes, 2U);
}

TEST_F(ConsoleGathering, NoMoreThanTheLimitIsGathered)
{
    const std::size_t length = Request(std::string(1000, 'x')).msgLength();
    const std::size_t fitting = FrameLink::kGatherBytes / length;
    std::vector<PendingResponse<Response>> pending;
    for (std::size_t i = 0; i < fitting; ++i)
        pending.push_back(console.start(Request(std::string(1000, 'x'))));
    EXPECT_THAT(end->received, IsEmpty());
    pending.push_back(console.start(Request(std::string(1000, 'x'))));
    EXPECT_EQ(end->received.size(), fitting + 1);
    EXPECT_EQ(end->writes, 2U) << "the others first";
    pending.push_back(console.start(Request(std::string(12000, 'x'))));
    EXPECT_EQ(end->received.size(), fitting + 2) << "too long to be gathered";
    for (auto& response : pending)
        EXPECT_NE(response.get(), nullptr);
}

// A peer that takes nothing.

TEST_F(ConsoleGathering, WhileThePeerTakesNothingALoopWaitsForRoomToo)
{
    const SerialSession session = console.openSerial(1); // whose output may hinder the peer
    auto pending = console.start(Request("1"));
    end->stopTaking();
    EXPECT_TRUE(console.hasPending());
    EXPECT_FALSE(console.process());
    EXPECT_FALSE(console.hasPending()) << "a loop would not wait";
    EXPECT_FALSE(PollSet(console.getPollFd(PollEvents::Read)).poll().anyReady());
    end->takeAgain();
    EXPECT_TRUE(PollSet(console.getPollFd(PollEvents::Read)).poll().anyReady());
    EXPECT_TRUE(console.process());
    EXPECT_EQ(payloadOf(*pending.get()), "1");
    EXPECT_FALSE(PollSet(console.getPollFd(PollEvents::Read)).poll().anyReady()) << "there always is room again";
}

TEST_F(ConsoleGathering, WhileThePeerTakesNothingMessagesAreReceived)
{
    SerialSession session = console.openSerial(1);
    auto pending = console.start(Request("1"));
    end->stopTaking();
    end->push(QelMessageVirtualSerialDataToDaxAsync(1, 0, 3, "abc"));
    EXPECT_TRUE(console.process(std::chrono::seconds(10)));
    EXPECT_EQ(session.getAvailable(), 3U);
    EXPECT_THAT([&] { pending.get(milliseconds(5)); }, failsWith<DeadlinePassed>(::testing::_));
    end->takeAgain();
    EXPECT_EQ(payloadOf(*pending.get()), "1");
}

// What cannot be sent.

TEST_F(ConsoleGathering, RequestsThatCannotBeSentFail)
{
    auto sent = console.start(Request("1"));
    end->onMessage = [](const QelMessage&) {};
    EXPECT_FALSE(console.process());
    auto first = console.start(Request("2"));
    auto second = console.start(Request("3"));
    end->failWrites([] { throw StreamIOException("gone"); });
    EXPECT_FALSE(first.isReady());
    EXPECT_THAT([&] { second.get(); }, failsWith<ClosedByPeer>("connection lost: gone"));
    EXPECT_TRUE(first.isReady());
    EXPECT_THAT([&] { first.get(); }, failsWith<ClosedByPeer>("connection lost: gone"));
    EXPECT_FALSE(sent.isReady()) << "without TLS messages can still be received";
    EXPECT_FALSE(console.hasPending());
    end->push(answerTo(*end->received[0], "1"));
    EXPECT_EQ(payloadOf(*sent.get()), "1");
}

TEST_F(ConsoleGathering, RequestsThatWereGatheredFailWithTheOneThatTookThemAlong)
{
    auto gathered = console.start(Request("1"));
    end->failWrites([] { throw StreamIOException("gone"); });
    EXPECT_THAT([&] { console.exchange(QelMessageGetQelTodReq()); }, failsWith<ClosedByPeer>("connection lost: gone"));
    EXPECT_TRUE(gathered.isReady());
    EXPECT_THAT([&] { gathered.get(); }, failsWith<ClosedByPeer>("connection lost: gone"));
}

TEST_F(ConsoleGathering, TheConsoleThatIsDestroyedDropsThem)
{
    std::optional<Console> owned(std::move(console));
    auto pending = owned->start(Request("1"));
    owned.reset();
    EXPECT_THAT([&] { pending.get(); }, failsWith<Error>("this console is closed"));
    console = FakeHypervisorEnd::makeConsole(end);
}

// Random sizes and cuts, both ways.

/// A stream that is cut at random: a read returns a part of what has arrived.
class CuttingStream final : public Stream, public Readiness {
public:
    CuttingStream(std::unique_ptr<Stream> stream, unsigned int seed) : mStream(std::move(stream)), mRandom(seed) {}

    void close() override { mStream->close(); }
    void setReadDeadline(milliseconds timeout) override { mStream->setReadDeadline(timeout); }
    void setWriteDeadline(milliseconds timeout) override { mStream->setWriteDeadline(timeout); }
    std::size_t read(char* buffer, std::size_t length) override
    {
        return mStream->read(buffer, std::uniform_int_distribution<std::size_t>(1, length)(mRandom));
    }
    void write(const char* buffer, std::size_t length) override { mStream->write(buffer, length); }
    Ready awaitReady(bool wantsToReceive, milliseconds timeout) override
    {
        return below().awaitReady(wantsToReceive, timeout);
    }
    void endOutput() noexcept override { below().endOutput(); }

private:
    Readiness& below() { return dynamic_cast<Readiness&>(*mStream); }

    const std::unique_ptr<Stream> mStream;
    std::minstd_rand mRandom; // of the reader
};

class ConsoleCuts : public ::testing::TestWithParam<Cover> {};

INSTANTIATE_TEST_SUITE_P(Over, ConsoleCuts, ::testing::Values(Cover::Plain, Cover::Tls),
                         ::testing::PrintToStringParamName());

/// Answers each request with its metadata; sends a broadcast before some.
void echo(LoopbackMessages& messages)
{
    for (std::uint32_t number = 0;; ++number) {
        const auto message = messages.receive();
        if (number % 5 == 0) messages.send(QelMessageDaxBroadcastOutboundAsync(1, number, "them", "x"));
        messages.send(answerTo(*message, dynamic_cast<const Request&>(*message).getMetadata()));
    }
}

TEST_P(ConsoleCuts, NothingIsLostOrReordered)
{
    constexpr std::uint32_t kRequests = 3000;
    for (unsigned int seed = 1; seed <= 3; ++seed) {
        SCOPED_TRACE(seed);
        OtherEnd end(GetParam(), echo);
        Console console(std::make_unique<CuttingStream>(end.takeStream(), seed), consoleOptions(GetParam()));
        std::uint32_t nextNotice = 0;
        console.onNotice<QelMessageDaxBroadcastOutboundAsync>([&](const auto& notice) {
            EXPECT_EQ(notice.getSenderToolType(), nextNotice);
            nextNotice += 5;
        });
        std::minstd_rand random(seed);
        std::deque<std::pair<std::string, PendingResponse<Response>>> pending;
        for (std::uint32_t i = 0; i < kRequests; ++i) {
            const std::size_t length = random() % 50 == 0 ? random() % 9000 : random() % 200;
            std::string metadata = std::to_string(i) + std::string(length, static_cast<char>('a' + i % 26));
            auto response = console.start(Request(metadata));
            pending.emplace_back(std::move(metadata), std::move(response));
            while (!pending.empty() && random() % 8 == 0) {
                ASSERT_EQ(payloadOf(*pending.front().second.get()), pending.front().first);
                pending.pop_front();
            }
        }
        for (; !pending.empty(); pending.pop_front())
            ASSERT_EQ(payloadOf(*pending.front().second.get()), pending.front().first);
        EXPECT_EQ(nextNotice, kRequests);
    }
}

TEST_P(ConsoleCuts, TheEndAtAnyByteLosesNoWholeMessage)
{
    using Broadcast = QelMessageDaxBroadcastOutboundAsync;
    const Broadcast whole(1, 1, "them", "x");
    const std::string frame(whole.serialize(), whole.msgLength());
    for (std::size_t cut = 0; cut < frame.size(); ++cut) {
        SCOPED_TRACE(cut);
        OtherEnd end(GetParam(), [&](LoopbackMessages& messages) {
            messages.receive();
            messages.sendBytes(frame + frame + frame.substr(0, cut)); // and closes
        });
        Console console(end.takeStream(), consoleOptions(GetParam()));
        int notices = 0;
        console.onNotice<Broadcast>([&](const auto&) { ++notices; });
        auto first = console.start(Request("1"));
        EXPECT_TRUE(console.process(std::chrono::seconds(10)));
        auto gathered = console.start(Request("2"));
        EXPECT_THAT([&] { first.get(); }, failsWith<ClosedByPeer>(::testing::StartsWith("connection lost: ")));
        EXPECT_EQ(notices, 2);
        EXPECT_THAT([&] { gathered.get(); }, failsWith<ClosedByPeer>(::testing::StartsWith("connection lost: ")));
    }
}

TEST_P(ConsoleCuts, ADeadlineWithinAMessageComesAfterTheMessagesBeforeIt)
{
    using Broadcast = QelMessageDaxBroadcastOutboundAsync;
    const Broadcast whole(1, 1, "them", "x");
    const std::string frame(whole.serialize(), whole.msgLength());
    for (const std::size_t cut : {std::size_t{1}, std::size_t{7}, std::size_t{8}, std::size_t{9}, frame.size() - 1}) {
        SCOPED_TRACE(cut);
        OtherEnd end(GetParam(), [&](LoopbackMessages& messages) {
            messages.receive();
            messages.sendBytes(frame + frame + frame.substr(0, cut));
            stall(messages);
        });
        ConsoleOptions options = consoleOptions(GetParam());
        options.frameTimeout = milliseconds(30);
        Console console(end.takeStream(), options);
        int notices = 0;
        console.onNotice<Broadcast>([&](const auto&) { ++notices; });
        auto first = console.start(Request("1"));
        EXPECT_THAT([&] { first.get(); }, failsWith<DeadlinePassed>("the peer did not answer in time: I/O deadline"));
        EXPECT_EQ(notices, 2);
    }
}

} // namespace

} // namespace qel::test
