// Requests and their responses, notices, and what is wrong with a peer: on one thread, against a fake hypervisor end.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>

#include "protocol/console/ConsoleFixture.hpp"
#include "support/Errors.hpp"
#include "support/SettableClock.hpp"

#include <cerrno>
#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <unistd.h>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using namespace protocol;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using ::testing::StrEq;
using ::testing::ThrowsMessage;

constexpr const char* kNotSent = "the peer broke the protocol: a response to a request that was not sent";
constexpr const char* kOtherKind = "the peer broke the protocol: a response of another kind than its request";

class ConsoleRequests : public ConsoleTestBase {};

// Introduction.

TEST(ConsoleIntroduction, SendsTheIdentityAndKeepsTheResponse)
{
    ConsoleOptions options = FakeHypervisorEnd::plainOptions();
    options.identity.toolType = 0x01020304;
    options.identity.toolId = "me";
    auto owned = std::make_unique<FakeHypervisorEnd>();
    FakeHypervisorEnd& end = *owned;
    const Console console(std::move(owned), options);
    ASSERT_EQ(end.received.size(), 1U);
    const auto& version = dynamic_cast<const QelMessageGetEnclTypeAndInterfaceVersionReq&>(*end.received[0]);
    EXPECT_EQ(version.getToolType(), 0x01020304U);
    EXPECT_EQ(version.getToolId(), "me");
    EXPECT_EQ(version.getInterfaceVersion(), 1U);
    EXPECT_EQ(version.getMajorVersion(), 1U);
    EXPECT_EQ(version.getMinorVersion(), 0U);
    EXPECT_EQ(console.version().getSystemMachineType(), "type");
    EXPECT_EQ(console.version().getSystemSerialNum(), "serial");
    EXPECT_EQ(console.getServer(), "fake:1");
    EXPECT_FALSE(console.isProtected());
    EXPECT_EQ(console.peer().commonName, "");
    EXPECT_EQ(console.peer().fingerprint, "");
}

TEST(ConsoleIntroduction, TheToolIdDefaultsToTheProcessId)
{
    Identity identity;
    EXPECT_EQ(completeIdentity(identity).toolId, "qel-" + std::to_string(::getpid()));
    identity.toolId = "mine";
    identity.toolType = 9;
    EXPECT_EQ(completeIdentity(identity).toolId, "mine");
    EXPECT_EQ(completeIdentity(identity).toolType, 9U);
}

TEST(ConsoleIntroduction, ARefusalCarriesTheResponse)
{
    auto owned = std::make_unique<FakeHypervisorEnd>();
    owned->onMessage = [&end = *owned](const QelMessage& message) {
        end.respond(message, QelMessageStatusDaxAlreadyConnected);
    };
    try {
        const Console console(std::move(owned), FakeHypervisorEnd::plainOptions());
        ADD_FAILURE() << "introduced";
    } catch (const StatusError& error) {
        EXPECT_EQ(error.getStatus(), QelMessageStatusDaxAlreadyConnected);
        EXPECT_EQ(error.getResponse().getOperation(), 0x0101U);
        EXPECT_EQ(error.getPeer(), "fake:1");
    }
}

TEST(ConsoleIntroduction, AResponseWithoutItsPayloadBreaksTheProtocolForWhoeverReadsIt)
{
    auto owned = std::make_unique<FakeHypervisorEnd>();
    owned->onMessage = [&end = *owned](const QelMessage& message) { end.respond(message, QelMessageStatusNoError); };
    const Console console(std::move(owned), FakeHypervisorEnd::plainOptions());
    EXPECT_THAT([&] { console.version(); },
                failsWith<ProtocolBroken>(StartsWith("the peer broke the protocol: Failed to cast message [CID: ")));
}

TEST(ConsoleIntroduction, TheAbortNoticeSaysThatTheServerAcceptsOnlyTls)
{
    auto owned = std::make_unique<FakeHypervisorEnd>();
    owned->onMessage = [&end = *owned](const QelMessage&) { end.push(QelMessageAbortHandshakeAsync()); };
    EXPECT_THAT([&] { Console(std::move(owned), FakeHypervisorEnd::plainOptions()); },
                failsWith<TurnedAway>("the server refused the connection: it accepts only TLS"));
}

TEST(ConsoleIntroduction, TheEndOfAPlainConnectionIsNotTakenForACertificateThatIsNotAccepted)
{
    auto owned = std::make_unique<FakeHypervisorEnd>();
    owned->onMessage = [&end = *owned](const QelMessage&) { end.end(); };
    EXPECT_THAT([&] { Console(std::move(owned), FakeHypervisorEnd::plainOptions()); },
                failsWith<ClosedByPeer>("connection lost: EOF"));
}

TEST(ConsoleIntroduction, NoStreamIsAnInvalidArgument)
{
    EXPECT_THAT([] { Console(nullptr, FakeHypervisorEnd::plainOptions()); },
                ThrowsMessage<std::invalid_argument>(StrEq("stream: null")));
}

// Requests.

TEST_F(ConsoleRequests, TheClassOfTheRequestDeterminesThatOfTheResponse)
{
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1709618828});
    const auto response = console.request(request);
    static_assert(std::is_same<decltype(response), const std::unique_ptr<QelMessageGetQelTodRsp>>::value, "");
    EXPECT_EQ(timeOf(*response), 1709618828);
    EXPECT_EQ(response->getCallerId(), request.getCallerId());
    ASSERT_EQ(end->received.size(), 1U);
    EXPECT_EQ(std::string(end->received[0]->serialize(), end->received[0]->msgLength()),
              std::string(request.serialize(), request.msgLength()));
}

TEST_F(ConsoleRequests, ARequestThatIsNotGrantedThrowsTheResponse)
{
    end->onMessage = [this](const QelMessage& message) {
        QelMessageGeneric response(message.getCallerId(), message.getFunction(), message.getOperation(), MsgResponse);
        response.setStatus(QelMessageStatusInvalidData, 0xAB);
        end->push(response);
    };
    try {
        console.request(request);
        ADD_FAILURE() << "granted";
    } catch (const StatusError& error) {
        EXPECT_EQ(error.getStatus(), QelMessageStatusInvalidData);
        EXPECT_EQ(error.getResponse().getStatusDetail(), 0xABU);
        EXPECT_EQ(error.getResponse().getCallerId(), request.getCallerId());
    }
    EXPECT_NO_THROW(console.exchange(request)) << "the connection is still usable";
}

TEST_F(ConsoleRequests, AnExchangeReturnsTheResponseWhateverItsStatus)
{
    answerWithStatus(QelMessageStatusInvalidData);
    EXPECT_EQ(console.exchange(request)->getStatus(), QelMessageStatusInvalidData);
}

TEST_F(ConsoleRequests, AResponseThatIsMalformedBreaksTheProtocol)
{
    answerWithStatus(QelMessageStatusNoError); // no payload
    EXPECT_THAT([&] { console.request(QelMessageGetGlobalModeAttributeReq()); },
                failsWith<ProtocolBroken>(
                    ::testing::AllOf(StartsWith("the peer broke the protocol: Failed to cast message [CID: "),
                                     HasSubstr("qel::QelMessageGetGlobalModeAttributeRsp"))));
    EXPECT_THAT([&] { console.request(request); },
                failsWith<ProtocolBroken>("the peer broke the protocol: the response is too short"));
}

TEST_F(ConsoleRequests, WhatIsNotARequestIsRefused)
{
    EXPECT_THAT([&] { console.exchange(QelMessageKrogConnectionClosedAsync()); },
                ThrowsMessage<std::invalid_argument>(StrEq("request: the message is not a request")));
    EXPECT_THAT([&] { console.exchange(QelMessageGetQelTodRsp(1, std::time_t{0})); },
                ThrowsMessage<std::invalid_argument>(StrEq("request: the message is not a request")));
    EXPECT_THAT([&] { console.send(request); },
                ThrowsMessage<std::invalid_argument>(StrEq("notice: the message is not a notice")));
    EXPECT_THAT([&] { console.send(QelMessageGetQelTodRsp(1, std::time_t{0})); },
                ThrowsMessage<std::invalid_argument>(StrEq("notice: the message is not a notice")));
    EXPECT_THAT(end->received, IsEmpty());
}

TEST_F(ConsoleRequests, AMessageLongerThanAFrameIsRefused)
{
    answerNothing();
    EXPECT_THAT([&] { console.start(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16351, 'x'))); },
                ThrowsMessage<std::invalid_argument>(StrEq("request: longer than a frame may be")));
    EXPECT_NO_THROW(console.start(QelMessageSetGlobalSaveAreaMetadataReq(std::string(16350, 'x'))));
    EXPECT_THAT(operations(), ElementsAre(0x010AU));
}

TEST_F(ConsoleRequests, ANoticeIsSentAsItIs)
{
    console.send(QelMessageVirtualSerialDataToOsAsync(7, 3, 2, "ls"));
    EXPECT_THAT(operations(), ElementsAre(0x0405U));
}

// Several requests under way.

TEST_F(ConsoleRequests, ResponsesFindTheirRequestsInAnyOrder)
{
    answerNothing();
    auto time = console.start(request);
    auto mode = console.start(QelMessageGetGlobalModeAttributeReq());
    auto metadata = console.start(QelMessageGetGlobalSaveAreaMetadataReq());
    EXPECT_FALSE(console.process());
    EXPECT_EQ(end->writes, 1U) << "they go out together";
    ASSERT_EQ(end->received.size(), 3U);
    EXPECT_FALSE(time.isReady());
    end->push(QelMessageGetGlobalSaveAreaMetadataRsp(end->received[2]->getCallerId(), "third"));
    end->push(QelMessageGetQelTodRsp(end->received[0]->getCallerId(), std::time_t{1}));
    end->push(QelMessageGetGlobalModeAttributeRsp(end->received[1]->getCallerId(), 2, "second"));
    EXPECT_EQ(mode.get()->getMTMS(), "second");
    EXPECT_TRUE(time.isReady());
    EXPECT_TRUE(metadata.isReady());
    EXPECT_EQ(metadata.get()->getMetadata(), "third");
    EXPECT_EQ(timeOf(*time.get()), 1);
}

TEST_F(ConsoleRequests, AResponseCanBeTakenOnce)
{
    answerWith<QelMessageGetQelTodRsp>(std::time_t{1});
    auto pending = console.start(request);
    EXPECT_NE(pending.get(), nullptr);
    EXPECT_TRUE(pending.isReady());
    EXPECT_THAT([&] { pending.get(); }, ThrowsMessage<std::logic_error>(StrEq("the response has been taken")));
}

TEST_F(ConsoleRequests, APendingRequestThatIsNotGrantedThrowsTheResponse)
{
    answerWithStatus(QelMessageStatusCmdFailed);
    auto pending = console.start(request);
    try {
        pending.get();
        ADD_FAILURE() << "granted";
    } catch (const StatusError& error) {
        EXPECT_EQ(error.getStatus(), QelMessageStatusCmdFailed);
    }
}

TEST_F(ConsoleRequests, AResponseThatDoesNotComeInTimeCanBeAwaitedFurther)
{
    answerNothing();
    auto pending = console.start(request);
    EXPECT_THAT([&] { pending.get(std::chrono::milliseconds(10)); },
                failsWith<DeadlinePassed>("the peer did not answer in time: no response to request 0x6003/0x0107"));
    EXPECT_FALSE(pending.isReady());
    end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{5}));
    EXPECT_EQ(timeOf(*pending.get()), 5);
}

TEST_F(ConsoleRequests, AResponseThatComesTooLateIsDropped)
{
    answerNothing();
    EXPECT_THAT([&] { console.request(request); },
                failsWith<DeadlinePassed>("the peer did not answer in time: no response to request 0x6003/0x0107"));
    end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{1}));
    end->onMessage = [this](const QelMessage& message) {
        end->push(QelMessageGetQelTodRsp(message.getCallerId(), std::time_t{2}));
    };
    EXPECT_EQ(timeOf(*console.request(QelMessageGetQelTodReq())), 2);
}

TEST_F(ConsoleRequests, OfTwoRequestsWithOneCallerIdTheFirstGetsTheFirstResponse)
{
    answerNothing();
    EXPECT_THAT([&] { console.request(request); }, failsWith<DeadlinePassed>(HasSubstr("in time")));
    end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{1})); // too late
    answerWith<QelMessageGetQelTodRsp>(std::time_t{2});
    EXPECT_EQ(timeOf(*console.request(request)), 2);
}

TEST_F(ConsoleRequests, TheResponseToAnAbandonedRequestIsDropped)
{
    answerNothing();
    {
        const auto pending = console.start(request);
    }
    end->push(QelMessageGetQelTodRsp(request.getCallerId(), std::time_t{1}));
    EXPECT_TRUE(console.process());
    EXPECT_FALSE(console.process());
}

TEST_F(ConsoleRequests, AssigningToAPendingResponseAbandonsItsRequest)
{
    answerNothing();
    auto pending = console.start(request);
    pending = console.start(QelMessageGetQelTodReq());
    EXPECT_FALSE(console.process());
    end->push(QelMessageGetQelTodRsp(end->received[0]->getCallerId(), std::time_t{1}));
    end->push(QelMessageGetQelTodRsp(end->received[1]->getCallerId(), std::time_t{2}));
    EXPECT_EQ(timeOf(*pending.get()), 2);
}

TEST_F(ConsoleRequests, AtMost4096RequestsAreUnderWay)
{
    answerNothing();
    std::vector<PendingResponse<QelMessageGetQelTodRsp>> pending;
    for (int i = 0; i < 4096; ++i)
        pending.push_back(console.start(QelMessageGetQelTodReq()));
    EXPECT_THAT([&] { console.start(QelMessageGetQelTodReq()); },
                failsWith<Error>("too many requests are under way without a response"));
    end->push(QelMessageGetQelTodRsp(end->received[77]->getCallerId(), std::time_t{1}));
    EXPECT_TRUE(console.process());
    EXPECT_NO_THROW(console.start(QelMessageGetQelTodReq()));
}

// Responses that are wrong.

TEST_F(ConsoleRequests, AResponseToARequestThatWasNotSentBreaksTheProtocol)
{
    end->onMessage = [this](const QelMessage&) { end->push(QelMessageGetQelTodRsp(1, std::time_t{0})); };
    EXPECT_THAT([&] { console.request(request); }, failsWith<ProtocolBroken>(kNotSent));
}

TEST_F(ConsoleRequests, ASecondResponseBreaksTheProtocol)
{
    end->onMessage = [this](const QelMessage& message) {
        end->push(QelMessageGetQelTodRsp(message.getCallerId(), std::time_t{0}));
        end->push(QelMessageGetQelTodRsp(message.getCallerId(), std::time_t{0}));
    };
    EXPECT_NO_THROW(console.request(request));
    EXPECT_THAT([&] { console.process(); }, failsWith<ProtocolBroken>(kNotSent));
}

TEST_F(ConsoleRequests, AResponseOfAnotherKindBreaksTheProtocol)
{
    for (const auto& identity : {std::make_pair(0x6003U, 0x0105U), std::make_pair(0x6002U, 0x0107U)}) {
        SCOPED_TRACE(identity.second);
        Console other = FakeHypervisorEnd::makeConsole(end);
        end->onMessage = [this, identity](const QelMessage& message) {
            end->push(QelMessageGeneric(message.getCallerId(), static_cast<unsigned short>(identity.first),
                                        static_cast<unsigned short>(identity.second), MsgResponse));
        };
        EXPECT_THAT([&] { other.request(request); }, failsWith<ProtocolBroken>(kOtherKind));
    }
}

TEST_F(ConsoleRequests, AWrongResponseToAnAbandonedRequestBreaksTheProtocolToo)
{
    answerNothing();
    EXPECT_THAT([&] { console.request(request); }, failsWith<DeadlinePassed>(HasSubstr("in time")));
    end->push(QelMessageGeneric(request.getCallerId(), 0x6003, 0x0105, MsgResponse));
    EXPECT_THAT([&] { console.process(); }, failsWith<ProtocolBroken>(kOtherKind));
}

} // namespace

} // namespace qel::test
