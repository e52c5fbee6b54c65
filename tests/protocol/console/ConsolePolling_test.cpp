// A console in a poll loop, and back-pressure in both directions: over sockets, plain and over TLS.

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/OtherEnd.hpp"
#include "support/CapturedLog.hpp"
#include "support/Errors.hpp"
#include "support/LoopbackEnds.hpp"

#include <algorithm>
#include <array>
#include <chrono>
#include <cstddef>
#include <exception>
#include <functional>
#include <future>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;

constexpr std::size_t kChunk = 4096;

/// A console over a socket, and the hypervisor end on a thread of its own. The dialogue begins after the introduction.
class ConsoleOverSocket : public ::testing::TestWithParam<Cover> {
protected:
    ~ConsoleOverSocket() override
    {
        if (console) console->close();
        if (mThread.joinable()) mThread.join();
    }

    void start(std::function<void(LoopbackMessages&)> dialogue, const ConsoleOptions& options)
    {
        mThread = std::thread([this, dialogue = std::move(dialogue)] {
            try {
                const int descriptor = mLoopback.far->getSocket().getFd();
                const auto stream = takeCover(GetParam(), std::move(mLoopback.far), descriptor);
                LoopbackMessages messages(*stream);
                welcome(messages);
                dialogue(messages);
            } catch (const std::exception&) { // the console has gone
            }
        });
        console.emplace(std::move(mLoopback.near), options);
    }
    void start(std::function<void(LoopbackMessages&)> dialogue)
    {
        start(std::move(dialogue), consoleOptions(GetParam()));
    }

    /// Waits as a program would that has other descriptors too.
    void poll(PollEvents events = PollEvents::Read)
    {
        if (console->hasPending()) return;
        ASSERT_TRUE(PollSet(console->getPollFd(events)).wait(Loopback::kDeadline).anyReady());
    }

    const CapturedLog mLog{LogLevel::Warn};
    std::promise<void> isOver; ///< for a dialogue to wait for
    std::optional<Console> console;

private:
    Loopback mLoopback;
    std::thread mThread;
};

INSTANTIATE_TEST_SUITE_P(Over, ConsoleOverSocket, ::testing::Values(Cover::Plain, Cover::Tls),
                         ::testing::PrintToStringParamName());

QelMessageGeneric answerTo(const QelMessage& request)
{
    return QelMessageGeneric(request.getCallerId(), request.getFunction(), request.getOperation(), MsgResponse);
}

/// Grants everything until the console has gone; hands other messages on.
void grant(LoopbackMessages& messages, const std::function<void(const QelMessage&)>& onOther)
{
    for (;;) {
        const auto message = messages.receive();
        if (message->getClassification() == QelMessageClassification::Request) {
            messages.send(answerTo(*message));
        } else {
            onOther(*message);
        }
    }
}

QelMessageVirtualSerialDataToDaxAsync output(const std::string& text)
{
    return QelMessageVirtualSerialDataToDaxAsync(1, 0, static_cast<std::uint16_t>(text.size()), text.data());
}

std::string patternOf(std::size_t length)
{
    std::string text(length, '\0');
    for (std::size_t i = 0; i < length; ++i)
        text[i] = static_cast<char>('a' + i % 23 + i / 4096 % 3);
    return text;
}

void sendOutput(LoopbackMessages& messages, const std::string& text)
{
    for (std::size_t at = 0; at < text.size(); at += kChunk)
        messages.send(output(text.substr(at, kChunk)));
}

std::string readExactly(SerialSession& session, std::size_t length)
{
    std::string text(length, '\0');
    for (std::size_t there = 0; there < length;) {
        const std::size_t count = session.read(text.data() + there, length - there, Loopback::kDeadline);
        if (count == 0) return text.substr(0, there);
        there += count;
    }
    return text;
}

TEST_P(ConsoleOverSocket, SeveralRequestsAreAnsweredOutOfOrderInAPollLoop)
{
    constexpr std::size_t kRequests = 20;
    start([](LoopbackMessages& messages) {
        std::vector<std::unique_ptr<QelMessage>> requests;
        while (requests.size() < kRequests)
            requests.push_back(messages.receive());
        messages.send(QelMessageDaxBroadcastOutboundAsync(1, 1, "them", "x"));
        std::swap(requests[3], requests[11]);
        std::reverse(requests.begin(), requests.end());
        for (const auto& request : requests) {
            const auto& mode = dynamic_cast<const QelMessageSetGlobalSaveAreaMetadataReq&>(*request);
            // Of the class of another response: what counts is the request that it answers.
            QelMessageGeneric answer = answerTo(*request);
            answer.setData(mode.getMetadata().data(), static_cast<unsigned int>(mode.getMetadata().size()));
            messages.send(answer);
        }
        stall(messages);
    });
    int broadcasts = 0;
    console->onNotice<QelMessageDaxBroadcastOutboundAsync>([&](const auto&) { ++broadcasts; });
    std::vector<PendingResponse<QelMessageSetGlobalSaveAreaMetadataRsp>> pending;
    for (std::size_t i = 0; i < kRequests; ++i)
        pending.push_back(console->start(QelMessageSetGlobalSaveAreaMetadataReq("number " + std::to_string(i))));
    const auto isReady = [](const auto& response) { return response.isReady(); };
    while (!std::all_of(pending.begin(), pending.end(), isReady)) {
        poll();
        console->process();
    }
    for (std::size_t i = 0; i < kRequests; ++i) {
        const auto response = pending[i].get();
        EXPECT_EQ(std::string(response->getData(), response->dataLength()), "number " + std::to_string(i));
    }
    EXPECT_EQ(broadcasts, 1);
    EXPECT_FALSE(console->process()) << "nothing is left";
    EXPECT_FALSE(console->hasPending());
}

TEST_P(ConsoleOverSocket, ManySmallMessagesAreAllSeenByAPollLoop)
{
    constexpr int kMessages = 3000;
    start([](LoopbackMessages& messages) {
        for (int i = 0; i < kMessages; ++i)
            messages.send(QelMessageDaxBroadcastOutboundAsync(1, static_cast<std::uint32_t>(i), "them", "x"));
        stall(messages);
    });
    std::uint32_t next = 0;
    console->onNotice<QelMessageDaxBroadcastOutboundAsync>([&](const auto& notice) {
        EXPECT_EQ(notice.getSenderToolType(), next);
        ++next;
    });
    while (next < kMessages) {
        poll();
        console->process(); // over TLS there may be a part of a record only
    }
}

TEST_P(ConsoleOverSocket, ASessionIsServedByAPollLoop)
{
    const std::string input = patternOf(300000);
    start([](LoopbackMessages& messages) {
        grant(messages, [&](const QelMessage& message) {
            const auto& data = dynamic_cast<const QelMessageVirtualSerialDataToOsAsync&>(message);
            messages.send(output(std::string(data.getSerialData(), data.getSerialDataLength())));
        });
    });
    SerialSession session = console->openSerial(1);
    std::string unsent = input;
    std::string echo;
    while (echo.size() < input.size()) {
        PollSet set(console->getPollFd(PollEvents::Read));
        if (!unsent.empty()) set += console->getPollFd(PollEvents::Write);
        const bool isPending = console->hasPending();
        const PollResult ready = isPending ? set.poll() : set.wait(Loopback::kDeadline);
        if (isPending || ready.contains(console->getPollFd(PollEvents::Read))) console->process();
        std::array<char, 5000> buffer;
        while (const std::size_t count = session.readAvailable(buffer.data(), buffer.size()))
            echo.append(buffer.data(), count);
        if (!unsent.empty() && ready.contains(console->getPollFd(PollEvents::Write))) session.writeSome(unsent);
    }
    EXPECT_TRUE(echo == input);
}

// Back-pressure.

TEST_P(ConsoleOverSocket, WritingGoesOnWhileThePeerSendsFirst)
{
    const std::string text = patternOf(1 << 20);
    const auto received = std::make_shared<std::promise<std::string>>();
    start([text, received](LoopbackMessages& messages) {
        for (int i = 0; i < 3; ++i)
            messages.send(answerTo(*messages.receive()));
        sendOutput(messages, text); // takes nothing until all of it has gone
        std::string input;
        while (input.size() < text.size()) {
            const auto data = messages.receive<QelMessageVirtualSerialDataToOsAsync>();
            input.append(data->getSerialData(), data->getSerialDataLength());
        }
        received->set_value(input);
        stall(messages);
    });
    SerialSession session = console->openSerial(1);
    EXPECT_EQ(session.write(text), text.size());
    EXPECT_TRUE(readExactly(session, text.size()) == text);
    EXPECT_TRUE(received->get_future().get() == text);
}

TEST_P(ConsoleOverSocket, WritingEndsInADeadlineWhenNobodyReadsTheOutput)
{
    const std::string text = patternOf(1 << 20);
    const auto received = std::make_shared<std::promise<std::size_t>>();
    ConsoleOptions options = consoleOptions(GetParam());
    options.requestTimeout = milliseconds(300);
    start(
        [text, received](LoopbackMessages& messages) {
            for (int i = 0; i < 3; ++i)
                messages.send(answerTo(*messages.receive()));
            sendOutput(messages, text);
            std::size_t bytes = 0;
            while (bytes < text.size())
                bytes += messages.receive<QelMessageVirtualSerialDataToOsAsync>()->getSerialDataLength();
            received->set_value(bytes);
            stall(messages);
        },
        options);
    SerialOptions serial;
    serial.maxUnread = 10000;
    SerialSession session = console->openSerial(1, serial, std::chrono::seconds(10));
    std::size_t sent = 0;
    try {
        while (sent < text.size())
            sent += session.write(text.data() + sent, std::min<std::size_t>(10000, text.size() - sent));
        ADD_FAILURE() << "all was taken";
    } catch (const DeadlinePassed& error) {
        EXPECT_STREQ(error.what(), "the peer did not take a message in time");
    }
    EXPECT_GE(session.getAvailable(), 10000U);
    EXPECT_LT(session.getAvailable(), 10000U + kChunk);
    // The connection is as good as before.
    EXPECT_TRUE(readExactly(session, text.size()) == text);
    while (sent < text.size())
        sent += session.write(text.data() + sent, std::min<std::size_t>(10000, text.size() - sent));
    EXPECT_EQ(received->get_future().get(), text.size());
}

TEST_P(ConsoleOverSocket, StartingManyRequestsDoesNotBlockBothSides)
{
    constexpr std::size_t kRequests = 300;
    const std::string large(16000, 'x');
    start([large](LoopbackMessages& messages) {
        // Answers each request with a long message before it takes the next one.
        for (;;) {
            QelMessageGeneric answer = answerTo(*messages.receive());
            answer.setData(large.data(), static_cast<unsigned int>(large.size()));
            messages.send(answer);
        }
    });
    std::vector<PendingResponse<QelMessageSetGlobalSaveAreaMetadataRsp>> pending;
    for (std::size_t i = 0; i < kRequests; ++i)
        pending.push_back(console->start(QelMessageSetGlobalSaveAreaMetadataReq(large)));
    for (auto& response : pending)
        EXPECT_EQ(response.get()->dataLength(), large.size());
}

TEST_P(ConsoleOverSocket, WritingEndsWithTheSession)
{
    start([](LoopbackMessages& messages) {
        for (int i = 0; i < 3; ++i)
            messages.send(answerTo(*messages.receive()));
        messages.send(QelMessageVirtualSerialSessionClosedAsync(
            1, 0, QelMessageVirtualSerialSessionClosedAsync::CloseReasonForceClose));
        stall(messages); // takes what comes
    });
    SerialSession session = console->openSerial(1);
    EXPECT_TRUE(console->process(std::chrono::seconds(10)));
    EXPECT_EQ(session.write(std::string(1000000, 'x')), 0U);
    EXPECT_EQ(session.getEnd(), SessionEnd::Taken);
}

TEST_P(ConsoleOverSocket, AWriteThatMeetsTheEndOfTheConnectionIsShort)
{
    const std::string text = patternOf(1 << 20);
    start([this](LoopbackMessages& messages) {
        for (int i = 0; i < 3; ++i)
            messages.send(answerTo(*messages.receive()));
        messages.send(QelMessageKrogConnectionClosedAsync());
        isOver.get_future().wait(); // takes nothing
    });
    SerialSession session = console->openSerial(1);
    const std::size_t sent = session.write(text);
    isOver.set_value();
    EXPECT_LT(sent, text.size());
    EXPECT_EQ(session.getEnd(), SessionEnd::ConnectionClosed);
    EXPECT_THAT([&] { console->process(); }, failsWith<ClosedByPeer>("the server closed the connection"));
}

TEST_P(ConsoleOverSocket, DestroyingASessionDoesNotWaitForAPeerThatTakesNothing)
{
    start([this](LoopbackMessages& messages) {
        for (int i = 0; i < 3; ++i)
            messages.send(answerTo(*messages.receive()));
        isOver.get_future().wait();
    });
    {
        SerialSession session = console->openSerial(1);
        while (PollSet(console->getPollFd(PollEvents::Write)).poll().anyReady()) {
            std::string piece(10000, 'x');
            session.writeSome(piece);
        }
        const auto before = std::chrono::steady_clock::now();
        SerialSession(std::move(session));
        EXPECT_LT(std::chrono::steady_clock::now() - before, std::chrono::seconds(5));
    }
    isOver.set_value();
}

TEST_P(ConsoleOverSocket, LeavingWaitsForThePeerToTakeItsLeave)
{
    const auto hasSeenTheEnd = std::make_shared<std::promise<bool>>();
    start([hasSeenTheEnd](LoopbackMessages& messages) {
        // Bytes that nobody reads any more must not hinder it.
        messages.sendBytes(std::string(50000, 'x'));
        hasSeenTheEnd->set_value(messages.isClosed());
    });
    console->leave();
    EXPECT_TRUE(hasSeenTheEnd->get_future().get());
}

} // namespace

} // namespace qel::test
