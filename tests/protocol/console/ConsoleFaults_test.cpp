// Every operation of a console against a peer that closes, stalls or lies at each step, in memory, plain and over TLS.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/OtherEnd.hpp"
#include "support/CapturedLog.hpp"

#include <array>
#include <chrono>
#include <exception>
#include <functional>
#include <future>
#include <gmock/gmock.h>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using std::chrono::milliseconds;

constexpr milliseconds kTimeout(150);

/// What a call threw: the class and the text.
struct Thrown {
    std::string type;
    std::string text;
};

template <typename T>
bool isA(const std::exception& error)
{
    return dynamic_cast<const T*>(&error) != nullptr;
}

std::string typeOf(const std::exception& error)
{
    if (isA<TurnedAway>(error)) return "TurnedAway";
    if (isA<DeadlinePassed>(error)) return "DeadlinePassed";
    if (isA<ClosedByPeer>(error)) return "ClosedByPeer";
    if (isA<ProtocolBroken>(error)) return "ProtocolBroken";
    return isA<Error>(error) ? "Error" : "another exception";
}

Thrown thrownBy(const std::function<void()>& work)
{
    try {
        work();
    } catch (const std::exception& error) {
        return {typeOf(error), error.what()};
    }
    return {"nothing", ""};
}

// What goes wrong. The peer has received the request that it would answer now.

using Messages = LoopbackMessages;

std::string beginningOf(const QelMessage& message) { return std::string(message.serialize(), 12); }

struct Fault {
    const char* name;
    std::function<void(Messages&, const QelMessage&)> act;
    const char* type;
    std::string text;
    bool isStall = false;
    std::string tlsText = {}; ///< instead of text, over TLS
};

void PrintTo(const Fault& fault, std::ostream* os) { *os << fault.name; }

QelMessageGeneric answerTo(const QelMessage& request)
{
    return QelMessageGeneric(request.getCallerId(), request.getFunction(), request.getOperation(), MsgResponse);
}

const std::vector<Fault>& faults()
{
    static const std::string broken = "the peer broke the protocol: ";
    static const std::vector<Fault> all{
        {"Closes", [](Messages&, const QelMessage&) {}, "ClosedByPeer", "connection lost: EOF"},
        {"ClosesWithinAMessage",
         [](Messages& messages, const QelMessage& request) { messages.sendBytes(beginningOf(answerTo(request))); },
         "ClosedByPeer", "connection lost: EOF"},
        {"SaysThatItCloses",
         [](Messages& messages, const QelMessage&) { messages.send(QelMessageKrogConnectionClosedAsync()); },
         "ClosedByPeer", "the server closed the connection"},
        {"TurnsAway", [](Messages& messages, const QelMessage&) { messages.send(QelMessageAbortHandshakeAsync()); },
         "TurnedAway", "the server refused the connection: it accepts only TLS", false,
         "the server turned this console away inside TLS"},
        {"SendsGarbage", [](Messages& messages, const QelMessage&) { messages.sendBytes(std::string(100, 'x')); },
         "ProtocolBroken", broken + "Invalid length"},
        {"SendsAFrameWithAWrongEyecatcher",
         [](Messages& messages, const QelMessage& request) {
             const QelMessageGeneric answer = answerTo(request);
             messages.sendBytes("\xBA\xAD\xFF" + std::string(answer.serialize() + 3, answer.msgLength() - 3));
         },
         "ProtocolBroken", broken + "i_buffer bad eyecatcher"},
        {"SendsAFrameThatIsTooLong",
         [](Messages& messages, const QelMessage&) {
             messages.sendBytes(std::string("\xDE\xCA\xFF\x20\x00\x00\x40\x01", 8));
         },
         "ProtocolBroken", broken + "Invalid length"},
        {"AnswersAnotherRequest",
         [](Messages& messages, const QelMessage& request) {
             messages.send(QelMessageGeneric(request.getCallerId() + 1000, request.getFunction(),
                                             request.getOperation(), MsgResponse));
         },
         "ProtocolBroken", broken + "a response to a request that was not sent"},
        {"Stalls", [](Messages& messages, const QelMessage&) { stall(messages); }, "DeadlinePassed", "", true},
        {"StallsWithinAMessage",
         [](Messages& messages, const QelMessage& request) {
             messages.sendBytes(beginningOf(answerTo(request)));
             stall(messages);
         },
         "DeadlinePassed", "the peer did not answer in time: I/O deadline"},
    };
    return all;
}

// What the console does.

struct Operation {
    const char* name;
    unsigned int goodAnswers; ///< that the peer gives before it goes wrong
    bool isAsked;             ///< whether it goes wrong at the next request; otherwise at once
    std::function<void(Console&, std::optional<SerialSession>&)> prepare;
    std::function<void(Console&, std::optional<SerialSession>&)> run;
    std::string stallText; ///< what is thrown when the peer stalls
};

void PrintTo(const Operation& operation, std::ostream* os) { *os << operation.name; }

void nothing(Console&, std::optional<SerialSession>&) {}

void openSerial(Console& console, std::optional<SerialSession>& session) { session.emplace(console.openSerial(1)); }

/// Each answer that comes has a time of its own, so that a busy machine does not make an earlier one late.
template <int kAnswers>
void openImpatiently(Console& console, std::optional<SerialSession>& session)
{
    session.emplace(console.openSerial(1, {}, (1 + kAnswers) * kTimeout));
}

const std::vector<Operation>& operations()
{
    static const std::string late = "the peer did not answer in time: no response to request ";
    static const std::vector<Operation> all{
        {"Request", 0, true, nothing,
         [](Console& console, auto&) { console.request(QelMessageGetGlobalModeAttributeReq(), kTimeout); },
         late + "0x6003/0x0109"},
        {"Exchange", 0, true, nothing,
         [](Console& console, auto&) { console.exchange(QelMessageGetQelTodReq(), kTimeout); }, late + "0x6003/0x0107"},
        {"PendingResponse", 0, true, nothing,
         [](Console& console, auto&) { console.start(QelMessageGetQelTodReq()).get(kTimeout); },
         late + "0x6003/0x0107"},
        {"OpenSession", 0, true, nothing, [](Console& console, auto&) { console.openSession(kTimeout); },
         late + "0x6003/0x0102"},
        {"CloseSession", 1, true, [](Console& console, auto&) { console.openSession(); },
         [](Console& console, auto&) { console.closeSession(kTimeout); }, late + "0x6003/0x0103"},
        {"OpenSerialFirstStep", 0, true, nothing, openImpatiently<0>, late + "0x6003/0x0102"},
        {"OpenSerialSecondStep", 1, true, nothing, openImpatiently<1>, late + "0x6002/0x0402"},
        {"OpenSerialThirdStep", 2, true, nothing, openImpatiently<2>, late + "0x6002/0x0406"},
        {"CloseSerial", 3, true, openSerial, [](Console&, auto& session) { session->close(kTimeout); },
         late + "0x6002/0x0403"},
        {"Read", 3, false, openSerial,
         [](Console&, auto& session) {
             std::array<char, 10> buffer;
             session->read(buffer.data(), buffer.size(), kTimeout);
             if (session->getEnd() == SessionEnd::ConnectionClosed)
                 throw ClosedByPeer("the server closed the connection");
         },
         "partition 1 sent nothing in time"},
        {"Process", 0, false, nothing,
         [](Console& console, auto&) {
             if (!console.process(kTimeout)) throw DeadlinePassed("nothing began");
         },
         "nothing began"},
    };
    return all;
}

class ConsoleFaults : public ::testing::TestWithParam<std::tuple<Cover, Operation, Fault>> {};

TEST_P(ConsoleFaults, EndInTheRightError)
{
    const CapturedLog log(LogLevel::Warn);
    const auto& [cover, operation, fault] = GetParam();
    OtherEnd end(cover, [operation = operation, fault = fault](Messages& messages) {
        for (unsigned int i = 0; i < operation.goodAnswers; ++i)
            messages.send(answerTo(*messages.receive()));
        const auto request =
            operation.isAsked ? messages.receive() : std::make_unique<QelMessageGeneric>(1, 0x6003, 0x0107, NoFlagSet);
        fault.act(messages, *request);
    });
    ConsoleOptions options = consoleOptions(cover);
    options.frameTimeout = kTimeout;
    Console console(end.takeStream(), options);
    std::optional<SerialSession> session;
    operation.prepare(console, session);
    const Thrown first = thrownBy([&, run = operation.run] { run(console, session); });
    EXPECT_EQ(first.type, fault.type);
    const std::string text = cover == Cover::Tls && !fault.tlsText.empty() ? fault.tlsText : fault.text;
    EXPECT_EQ(first.text, fault.isStall ? operation.stallText : text);
    if (fault.isStall) return;
    const Thrown second = thrownBy([&] { console.request(QelMessageGetQelTodReq()); });
    EXPECT_EQ(second.type, first.type) << "the same again";
    EXPECT_EQ(second.text, first.text);
}

INSTANTIATE_TEST_SUITE_P(Each, ConsoleFaults,
                         ::testing::Combine(::testing::Values(Cover::Plain, Cover::Tls),
                                            ::testing::ValuesIn(operations()), ::testing::ValuesIn(faults())),
                         [](const auto& row) {
                             return std::string(std::get<0>(row.param) == Cover::Tls ? "Tls" : "Plain") +
                                    std::get<1>(row.param).name + std::get<2>(row.param).name;
                         });

// Responses that are wrong in themselves.

class ConsoleLies : public ::testing::TestWithParam<Cover> {};

INSTANTIATE_TEST_SUITE_P(Over, ConsoleLies, ::testing::Values(Cover::Plain, Cover::Tls),
                         ::testing::PrintToStringParamName());

TEST_P(ConsoleLies, AnAnswerOfAnotherKindBreaksTheProtocol)
{
    OtherEnd end(GetParam(), [](Messages& messages) {
        const auto request = messages.receive();
        messages.send(QelMessageGeneric(request->getCallerId(), 0x6003, 0x0105, MsgResponse));
        stall(messages);
    });
    Console console(end.takeStream(), consoleOptions(GetParam()));
    const Thrown thrown = thrownBy([&] { console.request(QelMessageGetQelTodReq()); });
    EXPECT_EQ(thrown.type, "ProtocolBroken");
    EXPECT_EQ(thrown.text, "the peer broke the protocol: a response of another kind than its request");
}

TEST_P(ConsoleLies, AMalformedAnswerLeavesTheConnectionUsable)
{
    OtherEnd end(GetParam(), [](Messages& messages) {
        messages.send(answerTo(*messages.receive())); // without the payload
        messages.send(QelMessageGetQelTodRsp(messages.receive()->getCallerId(), std::time_t{5}));
        stall(messages);
    });
    Console console(end.takeStream(), consoleOptions(GetParam()));
    EXPECT_EQ(thrownBy([&] { console.request(QelMessageGetQelTodReq()); }).type, "ProtocolBroken");
    EXPECT_EQ(timeOf(*console.request(QelMessageGetQelTodReq())), 5);
}

TEST_P(ConsoleLies, NoticesDoNotExtendATimeout)
{
    OtherEnd end(GetParam(), [](Messages& messages) {
        for (;;)
            messages.send(QelMessageDaxBroadcastOutboundAsync(1, 1, "x", "x"));
    });
    Console console(end.takeStream(), consoleOptions(GetParam()));
    EXPECT_EQ(thrownBy([&] { console.request(QelMessageGetQelTodReq(), milliseconds(20)); }).type, "DeadlinePassed");
}

TEST_P(ConsoleLies, ADeadlineBeforeAMessageLeavesTheConnectionUsable)
{
    OtherEnd end(GetParam(), [](Messages& messages) {
        const auto first = messages.receive();
        const auto second = messages.receive();
        messages.send(QelMessageGetQelTodRsp(first->getCallerId(), std::time_t{1}));
        messages.send(QelMessageGetQelTodRsp(second->getCallerId(), std::time_t{2}));
        stall(messages);
    });
    Console console(end.takeStream(), consoleOptions(GetParam()));
    EXPECT_EQ(thrownBy([&] { console.request(QelMessageGetQelTodReq(), milliseconds(5)); }).type, "DeadlinePassed");
    EXPECT_FALSE(console.process());
    EXPECT_EQ(timeOf(*console.request(QelMessageGetQelTodReq())), 2);
}

TEST_P(ConsoleLies, AMessageInPiecesIsWhole)
{
    OtherEnd end(GetParam(), [](Messages& messages) {
        const QelMessageGetGlobalSaveAreaMetadataRsp answer(messages.receive()->getCallerId(), "in pieces");
        const std::string frame(answer.serialize(), answer.msgLength());
        for (const char byte : frame)
            messages.sendBytes(std::string(1, byte));
        stall(messages);
    });
    Console console(end.takeStream(), consoleOptions(GetParam()));
    EXPECT_EQ(console.request(QelMessageGetGlobalSaveAreaMetadataReq())->getMetadata(), "in pieces");
}

TEST_P(ConsoleLies, AWriteToAPeerThatClosesEndsInAClosedConnection)
{
    OtherEnd end(GetParam(), [](Messages& messages) {
        for (int i = 0; i < 3; ++i)
            messages.send(answerTo(*messages.receive()));
        messages.receive();
    });
    Console console(end.takeStream(), consoleOptions(GetParam()));
    SerialSession session = console.openSerial(1);
    const Thrown thrown = thrownBy([&] {
        for (;;)
            session.write(std::string(10000, 'x'));
    });
    EXPECT_EQ(thrown.type, "ClosedByPeer");
    EXPECT_EQ(thrown.text, "connection lost: EOF");
    const Thrown next = thrownBy([&] { console.process(); }); // over TLS the same again; plain: what receiving meets
    EXPECT_EQ(next.type, "ClosedByPeer");
    EXPECT_EQ(next.text, "connection lost: EOF");
}

TEST_P(ConsoleLies, AWriteThatIsNotTakenEndsInADeadline)
{
    std::promise<void> isOver;
    OtherEnd end(GetParam(), [&](Messages& messages) {
        for (int i = 0; i < 3; ++i)
            messages.send(answerTo(*messages.receive()));
        isOver.get_future().wait();
    });
    ConsoleOptions options = consoleOptions(GetParam());
    options.requestTimeout = kTimeout;
    Console console(end.takeStream(), options);
    SerialSession session = console.openSerial(1, {}, std::chrono::seconds(10));
    EXPECT_LT(session.write(std::string(200000, 'x')), 200000U);
    const Thrown thrown = thrownBy([&] { session.write(std::string(200000, 'x')); });
    isOver.set_value();
    EXPECT_EQ(thrown.type, "DeadlinePassed");
    EXPECT_EQ(thrown.text, "the peer did not take a message in time");
}

TEST_P(ConsoleLies, WritingDoesNotBlockBothSidesWhenThePeerEchoes)
{
    OtherEnd end(GetParam(), [](Messages& messages) {
        for (;;) {
            const auto message = messages.receive();
            const auto* const data = dynamic_cast<const QelMessageVirtualSerialDataToOsAsync*>(message.get());
            if (data == nullptr) {
                messages.send(answerTo(*message));
            } else {
                messages.send(
                    QelMessageVirtualSerialDataToDaxAsync(1, 0, data->getSerialDataLength(), data->getSerialData()));
            }
        }
    });
    ConsoleOptions options = consoleOptions(GetParam());
    Console console(end.takeStream(), options);
    SerialSession session = console.openSerial(1);
    EXPECT_EQ(session.write(std::string(1 << 20, 'x')), 1U << 20);
    EXPECT_NO_THROW(console.exchange(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16000, 'x'))));
    EXPECT_EQ(session.getAvailable(), 1U << 20);
}

TEST_P(ConsoleLies, DroppingASessionDoesNoHarmWhenThePeerTakesNothing)
{
    std::promise<void> mayTake;
    OtherEnd end(GetParam(), [&](Messages& messages) {
        for (int i = 0; i < 3; ++i)
            messages.send(answerTo(*messages.receive()));
        mayTake.get_future().wait();
        for (;;) {
            const auto message = messages.receive();
            if (message->getClassification() == QelMessageClassification::Request) messages.send(answerTo(*message));
        }
    });
    ConsoleOptions options = consoleOptions(GetParam());
    options.requestTimeout = kTimeout;
    Console console(end.takeStream(), options);
    {
        SerialSession session = console.openSerial(1, {}, std::chrono::seconds(10));
        EXPECT_LT(session.write(std::string(200000, 'x')), 200000U);
    }
    mayTake.set_value();
    EXPECT_NO_THROW(console.exchange(QelMessageGetQelTodReq(), std::chrono::seconds(10)));
}

TEST_P(ConsoleLies, CloseEndsACallThatWaitsOnAnotherThread)
{
    std::function<void()> closeConsole;
    OtherEnd end(GetParam(), [&](Messages& messages) {
        messages.receive();
        closeConsole();
        stall(messages);
    });
    Console console(end.takeStream(), consoleOptions(GetParam()));
    closeConsole = [&] { console.close(); };
    const Thrown thrown = thrownBy([&] { console.request(QelMessageGetQelTodReq(), milliseconds(-1)); });
    EXPECT_EQ(thrown.type, "Error");
    EXPECT_EQ(thrown.text, "this console is closed");
}

TEST_P(ConsoleLies, LeavingEndsTheConnection)
{
    bool hasEnded = false;
    {
        OtherEnd end(GetParam(), [&](Messages& messages) { hasEnded = messages.isClosed(); });
        Console console(end.takeStream(), consoleOptions(GetParam()));
        console.leave();
    }
    EXPECT_TRUE(hasEnded);
}

} // namespace

} // namespace qel::test
