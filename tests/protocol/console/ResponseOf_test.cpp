#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/ResponseOf.hpp>

#include "support/Errors.hpp"

#include <gmock/gmock.h>
#include <memory>
#include <string>
#include <tuple>
#include <type_traits>

namespace qel::test {

namespace {

using namespace protocol;
using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::StartsWith;

/// What a console makes of the bytes of a message.
std::unique_ptr<QelMessage> received(const QelMessage& message)
{
    static const QelMessageRegistry registry;
    return registry.deserialize(message.serialize(), message.msgLength());
}

std::unique_ptr<QelMessage> response(unsigned short operation, const std::string& payload)
{
    QelMessageGeneric message(99, QelMessageFunctionQelInterfaceCmp, operation, MsgResponse);
    message.setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return received(message);
}

/// The identity of the response that belongs to a request.
template <typename Request>
std::tuple<unsigned short, unsigned short, QelMessageClassification::Value> identityFor()
{
    return {std::get<0>(Request::getMessageID()), std::get<1>(Request::getMessageID()),
            QelMessageClassification::Response};
}

template <typename Request>
void expectMatchingIdentity()
{
    EXPECT_EQ(ResponseTo<Request>::getMessageID(), identityFor<Request>()) << typeid(Request).name();
}

TEST(ResponseOf, HasTheFunctionAndOperationOfTheRequest)
{
    expectMatchingIdentity<QelMessageGetEnclTypeAndInterfaceVersionReq>();
    expectMatchingIdentity<QelMessageInterfaceCmpOpenKrogSessionReq>();
    expectMatchingIdentity<QelMessageInterfaceCmpCloseKrogSessionReq>();
    expectMatchingIdentity<QelMessageExchIntCapabilitiesReq>();
    expectMatchingIdentity<QelMessageGetInterfaceLimitsReq>();
    expectMatchingIdentity<QelMessageDaxBroadcastReq>();
    expectMatchingIdentity<QelMessageGetQelTodReq>();
    expectMatchingIdentity<QelMessageGetGlobalModeAttributeReq>();
    expectMatchingIdentity<QelMessageSetGlobalSaveAreaMetadataReq>();
    expectMatchingIdentity<QelMessageGetGlobalSaveAreaMetadataReq>();
    expectMatchingIdentity<QelMessageVirtualSerialOpenReq>();
    expectMatchingIdentity<QelMessageVirtualSerialCloseReq>();
    expectMatchingIdentity<QelMessageVirtualSerialGetMaxSessionsReq>();
    expectMatchingIdentity<QelMessageVirtualSerialSetupSessionReq>();
    static_assert(std::is_same<ResponseTo<QelMessageSetGlobalModeAttributeReq>, QelMessage>::value,
                  "the response has no class");
}

TEST(ReadResponse, ReturnsTheSameObject)
{
    auto message = received(QelMessageGetGlobalModeAttributeRsp(99, 7, "text"));
    const QelMessage* const before = message.get();
    const auto typed = readResponse<QelMessageGetGlobalModeAttributeRsp>(std::move(message));
    EXPECT_EQ(typed.get(), before);
    EXPECT_EQ(typed->getMTMS(), "text");
    auto plain = response(QelMessageOpSetGlobalModeAttribute, "");
    const QelMessage* const other = plain.get();
    EXPECT_EQ(readResponse<QelMessage>(std::move(plain)).get(), other);
}

TEST(ReadResponse, AMessageOfAnotherClassBreaksTheProtocol)
{
    try {
        readResponse<QelMessageGetGlobalModeAttributeRsp>(response(QelMessageOpGetGlobalModeAttribute, "x"), "there:1");
        ADD_FAILURE() << "read";
    } catch (const ProtocolBroken& error) {
        EXPECT_THAT(error.what(), AllOf(StartsWith("the peer broke the protocol: Failed to cast message [CID: "),
                                        HasSubstr("] to type qel::QelMessageGetGlobalModeAttributeRsp")));
        EXPECT_EQ(error.getPeer(), "there:1");
        EXPECT_THROW(std::rethrow_if_nested(error), QelMessageCastException);
    }
}

// The two responses that the common library only builds.

TEST(TimeResponse, KeepsTheFrameThatWasReceived)
{
    QelMessageGeneric frame{QelMessageGetQelTodRsp(99, std::time_t{1709618828})};
    frame.setStatus(QelMessageStatusNoError, 0x1234);
    const auto typed = readResponse<QelMessageGetQelTodRsp>(received(frame));
    EXPECT_EQ(std::string(typed->serialize(), typed->msgLength()), std::string(frame.serialize(), frame.msgLength()));
    EXPECT_EQ(typed->getStatusDetail(), 0x1234U);
    EXPECT_EQ(timeOf(*typed), 1709618828);
    EXPECT_EQ(typed->clone()->getCallerId(), 99U);
}

TEST(TimeResponse, EveryTruncationIsTooShort)
{
    for (std::size_t length = 0; length < 8; ++length) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { readResponse<QelMessageGetQelTodRsp>(response(0x0107, std::string(length, '\x11'))); },
                    failsWith<ProtocolBroken>("the peer broke the protocol: the response is too short"));
    }
    EXPECT_NO_THROW(readResponse<QelMessageGetQelTodRsp>(response(0x0107, std::string(9, '\x11'))));
}

TEST(TimeResponse, ADigitAbove9BreaksTheProtocol)
{
    const std::string good("\x20\x24\x03\x05\x06\x07\x08\xFF", 8); // the last byte is reserved
    EXPECT_EQ(timeOf(*readResponse<QelMessageGetQelTodRsp>(response(0x0107, good))), 1709618828);
    for (std::size_t digit = 0; digit < 14; ++digit) {
        SCOPED_TRACE(digit);
        std::string bad = good;
        char& byte = bad[digit / 2];
        byte = static_cast<char>(digit % 2 == 0 ? 0xA0 | (byte & 0x0F) : (byte & 0xF0) | 0x0A);
        EXPECT_THAT([&] { readResponse<QelMessageGetQelTodRsp>(response(0x0107, bad)); },
                    failsWith<ProtocolBroken>(StartsWith("the peer broke the protocol: the time of day has digits "
                                                         "above 9: ")));
    }
}

TEST(TimeResponse, ATimeThatDoesNotExistIsNotATime)
{
    struct Row {
        std::string digits;
        std::time_t time; // -1: there is none
    };
    const Row rows[] = {
        {std::string("\x19\x70\x01\x01\x00\x00\x00", 7), 0},
        {std::string("\x20\x24\x02\x29\x23\x59\x59", 7), 1709251199},
        {std::string("\x20\x24\x02\x29\x23\x59\x60", 7), 1709251200}, // a leap second is the next second
        {std::string("\x20\x24\x02\x29\x23\x59\x61", 7), -1},
        {std::string("\x20\x23\x02\x29\x00\x00\x00", 7), -1},
        {std::string("\x20\x24\x00\x01\x00\x00\x00", 7), -1},
        {std::string("\x20\x24\x13\x01\x00\x00\x00", 7), -1},
        {std::string("\x20\x24\x01\x00\x00\x00\x00", 7), -1},
        {std::string("\x20\x24\x01\x32\x00\x00\x00", 7), -1},
        {std::string("\x20\x24\x01\x01\x24\x00\x00", 7), -1},
        {std::string("\x20\x24\x01\x01\x00\x60\x00", 7), -1},
    };
    for (const Row& row : rows) {
        const auto typed = readResponse<QelMessageGetQelTodRsp>(response(0x0107, row.digits + '\0'));
        if (row.time >= 0) {
            EXPECT_EQ(timeOf(*typed), row.time);
        } else {
            EXPECT_THAT([&] { timeOf(*typed); },
                        failsWith<ProtocolBroken>(StartsWith("the peer broke the protocol: the time of day is not a "
                                                             "time: 20")));
        }
    }
}

TEST(TimeResponse, AResponseToAnotherRequestBreaksTheProtocol)
{
    EXPECT_THAT([] { readResponse<QelMessageGetQelTodRsp>(response(0x0105, std::string(16, '\0'))); },
                failsWith<ProtocolBroken>(HasSubstr("] to type qel::QelMessageGetQelTodRsp")));
    EXPECT_THAT([] { readResponse<QelMessageGetInterfaceLimitsRsp>(response(0x0107, std::string(16, '\0'))); },
                failsWith<ProtocolBroken>(HasSubstr("] to type qel::QelMessageGetInterfaceLimitsRsp")));
}

TEST(LimitsResponse, HasTheValuesThatWereReceived)
{
    const std::string distinct("\x01\x02\x03\x04\x05\x06\xFF\xFF\x07\xFF\xFF\xFF\x08\x09\x0A\x0B", 16);
    const InterfaceLimits limits = limitsOf(*readResponse<QelMessageGetInterfaceLimitsRsp>(response(0x0105, distinct)));
    EXPECT_EQ(limits.largestCommand, 0x0102U);
    EXPECT_EQ(limits.largestHypervisorCommand, 0x0304U);
    EXPECT_EQ(limits.largestBroadcast, 0x0506U);
    EXPECT_EQ(limits.consoles, 7U);
    EXPECT_EQ(limits.nonpersistentLocks, 0x0809U);
    EXPECT_EQ(limits.persistentLocks, 0x0A0BU);
}

TEST(LimitsResponse, EveryTruncationIsTooShort)
{
    for (std::size_t length = 0; length < 16; ++length) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { readResponse<QelMessageGetInterfaceLimitsRsp>(response(0x0105, std::string(length, '\0'))); },
                    failsWith<ProtocolBroken>("the peer broke the protocol: the response is too short"));
    }
}

} // namespace

} // namespace qel::test
