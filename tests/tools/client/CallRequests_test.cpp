#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "client/CallRequests.hpp"
#include "support/Errors.hpp"

#include <functional>
#include <gmock/gmock.h>
#include <sstream>

namespace qel::test {

namespace {

using ::testing::StartsWith;
using tool::Answer;
using tool::CallRequest;

/// What a receiver makes of the message.
std::unique_ptr<QelMessage> received(const QelMessage& message)
{
    static const QelMessageRegistry registry;
    return registry.deserialize(message.serialize(), message.msgLength());
}

std::string asJson(const CallRequest& request, const QelMessage& response)
{
    return request.describe(*received(response)).json().dump();
}

std::string asText(const CallRequest& request, const QelMessage& response)
{
    std::ostringstream os;
    request.describe(*received(response)).print(os);
    return os.str();
}

QelMessageGeneric response(unsigned short function, unsigned short operation, const std::string& payload)
{
    QelMessageGeneric message(1, function, operation, MsgResponse);
    message.setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return message;
}

TEST(CallRequests, EachRequestSendsItsMessage)
{
    struct Case {
        CallRequest request;
        unsigned int function;
        unsigned int operation;
        bool needsSession;
    };
    std::vector<Case> cases;
    cases.push_back({tool::capabilitiesRequest(QelCapabilities("1")), 0x6003, 0x0104, false});
    cases.push_back({tool::limitsRequest(), 0x6003, 0x0105, false});
    cases.push_back({tool::broadcastRequest({}, "x"), 0x6003, 0x0106, false});
    cases.push_back({tool::timeRequest(), 0x6003, 0x0107, false});
    cases.push_back({tool::setModeRequest(1, ""), 0x6003, 0x0108, false});
    cases.push_back({tool::getModeRequest(), 0x6003, 0x0109, false});
    cases.push_back({tool::setMetadataRequest("x"), 0x6003, 0x010A, false});
    cases.push_back({tool::getMetadataRequest(), 0x6003, 0x010B, false});
    cases.push_back({tool::maxSessionsRequest(), 0x6002, 0x0404, true});
    for (const Case& entry : cases) {
        SCOPED_TRACE(entry.request.name);
        ASSERT_NE(entry.request.message, nullptr);
        EXPECT_EQ(entry.request.message->getFunction(), entry.function);
        EXPECT_EQ(entry.request.message->getOperation(), entry.operation);
        EXPECT_EQ(entry.request.message->getFlags(), MsgResponseExpected);
        EXPECT_EQ(entry.request.needsSession, entry.needsSession);
    }
}

TEST(CallRequests, VersionIsReadFromTheFirstResponse)
{
    EXPECT_EQ(tool::versionRequest().message, nullptr);
    const QelMessageGetEnclTypeAndInterfaceVersionRsp answer(1, 'Q', 2, 3, "type", "serial");
    EXPECT_EQ(asJson(tool::versionRequest(), answer),
              R"({"family":"Q","majorVersion":2,"minorVersion":3,"enclosureType":2,"machineType":"type",)"
              R"("serialNumber":"serial"})");
    EXPECT_EQ(asText(tool::versionRequest(), answer), "Interface family: Q\n"
                                                      "Major version:    2\n"
                                                      "Minor version:    3\n"
                                                      "Enclosure type:   2\n"
                                                      "Machine type:     type\n"
                                                      "Serial number:    serial\n");
}

TEST(CallRequests, CapabilitiesAreSentAndRead)
{
    const CallRequest request = tool::capabilitiesRequest(QelCapabilities("101"));
    EXPECT_EQ(qelMessageCast<QelMessageExchIntCapabilitiesReq>(*request.message).getCapabilities(),
              QelCapabilities("101"));
    EXPECT_EQ(asJson(request, QelMessageExchIntCapabilitiesRsp(1, 4, QelCapabilities("01"))),
              R"({"capabilities":"01000000000000000000000000000000"})");
}

TEST(CallRequests, LimitsAreReadFromAPlainMessage)
{
    EXPECT_EQ(asJson(tool::limitsRequest(), QelMessageGetInterfaceLimitsRsp(1)),
              R"({"maxCommandSize":16384,"maxHypervisorCommandSize":4096,"broadcastPacketSize":16306,)"
              R"("consolesSupported":2,"nonpersistentLocksSupported":0,"persistentLocksSupported":0})");
    const std::string distinct("\x01\x02\x03\x04\x05\x06\xFF\xFF\x07\xFF\xFF\xFF\x08\x09\x0A\x0B", 16);
    EXPECT_EQ(asJson(tool::limitsRequest(), response(0x6003, 0x0105, distinct)),
              R"({"maxCommandSize":258,"maxHypervisorCommandSize":772,"broadcastPacketSize":1286,)"
              R"("consolesSupported":7,"nonpersistentLocksSupported":2057,"persistentLocksSupported":2571})");
}

TEST(CallRequests, ShortLimitsAreABrokenProtocol)
{
    for (const std::size_t length : {0U, 1U, 15U}) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { asJson(tool::limitsRequest(), response(0x6003, 0x0105, std::string(length, '\0'))); },
                    failsWith<tool::ProtocolBroken>("the peer broke the protocol: the response is too short"));
    }
    EXPECT_NO_THROW(asJson(tool::limitsRequest(), response(0x6003, 0x0105, std::string(17, '\0'))));
}

TEST(CallRequests, TimeIsReadFromAPlainMessage)
{
    EXPECT_EQ(asJson(tool::timeRequest(), QelMessageGetQelTodRsp(1, std::time_t{1709618828})),
              R"({"time":"2024-03-05T06:07:08Z"})");
    EXPECT_EQ(asText(tool::timeRequest(), QelMessageGetQelTodRsp(1, std::time_t{0})),
              "Time of day (UTC): 1970-01-01T00:00:00Z\n");
}

TEST(CallRequests, AShortTimeIsABrokenProtocol)
{
    for (const std::size_t length : {0U, 7U}) {
        SCOPED_TRACE(length);
        EXPECT_THAT([&] { asJson(tool::timeRequest(), response(0x6003, 0x0107, std::string(length, '\0'))); },
                    failsWith<tool::ProtocolBroken>("the peer broke the protocol: the response is too short"));
    }
    EXPECT_NO_THROW(asJson(tool::timeRequest(), response(0x6003, 0x0107, std::string(9, '\0'))));
}

TEST(CallRequests, ATimeWithADigitAbove9IsABrokenProtocol)
{
    const std::string good("\x20\x24\x03\x05\x06\x07\x08\xFF", 8); // the last byte is reserved
    EXPECT_EQ(asJson(tool::timeRequest(), response(0x6003, 0x0107, good)), R"({"time":"2024-03-05T06:07:08Z"})");
    for (std::size_t digit = 0; digit < 14; ++digit) {
        SCOPED_TRACE(digit);
        std::string bad = good;
        char& byte = bad[digit / 2];
        byte = static_cast<char>(digit % 2 == 0 ? 0xA0 | (byte & 0x0F) : (byte & 0xF0) | 0x0A);
        EXPECT_THAT([&] { asJson(tool::timeRequest(), response(0x6003, 0x0107, bad)); },
                    failsWith<tool::ProtocolBroken>(
                        StartsWith("the peer broke the protocol: the time of day has digits above 9: ")));
    }
}

TEST(CallRequests, TheMaximumOfSessionsIsRead)
{
    EXPECT_EQ(asJson(tool::maxSessionsRequest(), QelMessageVirtualSerialGetMaxSessionsRsp(1, 300, 255)),
              R"({"maxSystems":300,"maxPartitions":255})");
}

TEST(CallRequests, TheModeIsSentAndRead)
{
    const CallRequest set = tool::setModeRequest(200, "type*serial");
    const auto& message = qelMessageCast<QelMessageSetGlobalModeAttributeReq>(*set.message);
    EXPECT_EQ(message.getMode(), 200U);
    EXPECT_EQ(message.getMTMS(), "type*serial");
    EXPECT_EQ(asJson(set, response(0x6003, 0x0108, "")), "{}");
    EXPECT_EQ(asJson(tool::getModeRequest(), QelMessageGetGlobalModeAttributeRsp(1, 200, "type")),
              R"({"mode":200,"mtms":"type","mtmsHex":"74797065"})");
    const std::string bytes("a\0\xFF", 3);
    EXPECT_EQ(tool::getModeRequest().describe(QelMessageGetGlobalModeAttributeRsp(1, 0, bytes)).json()["mtmsHex"],
              "6100ff")
        << "bytes that are no UTF-8 are lost in the text";
}

TEST(CallRequests, MetadataAreBytes)
{
    const std::string bytes("a\0\xFF", 3);
    const CallRequest set = tool::setMetadataRequest(bytes);
    EXPECT_EQ(qelMessageCast<QelMessageSetGlobalSaveAreaMetadataReq>(*set.message).getMetadata(), bytes);
    const QelMessageGetGlobalSaveAreaMetadataRsp answer(1, bytes);
    EXPECT_EQ(asText(tool::getMetadataRequest(), answer), "Metadata: a\\x00\\xff\n");
    EXPECT_EQ(tool::getMetadataRequest().describe(answer).json()["metadataHex"], "6100ff");
}

TEST(CallRequests, ABroadcastIsAddressed)
{
    tool::BroadcastAddress address;
    address.type = 1;
    address.toolType = 9;
    address.toolId = "them";
    const CallRequest request = tool::broadcastRequest(address, "hello");
    const auto& message = qelMessageCast<QelMessageDaxBroadcastReq>(*request.message);
    EXPECT_EQ(message.getBroadcastMode(), 1U);
    EXPECT_EQ(message.getToolType(), 9U);
    EXPECT_EQ(message.getToolId(), "them");
    EXPECT_EQ(std::string(message.getDaxPacket(), message.getBroadcastMsgLen()), "hello");
}

TEST(CallRequests, TheFrameLimitsJustFitAFrame)
{
    EXPECT_EQ(tool::setModeRequest(0, std::string(tool::kMaxMtms, 'x')).message->msgLength(), 16384U);
    EXPECT_EQ(tool::setMetadataRequest(std::string(tool::kMaxMetadata, 'x')).message->msgLength(), 16384U);
    EXPECT_EQ(tool::broadcastRequest({}, std::string(tool::kMaxBroadcast, 'x')).message->msgLength(), 16384U);
}

TEST(CallRequests, AResponseThatDidNotParseIsABrokenProtocol)
{
    struct Case {
        CallRequest request;
        unsigned short function;
        unsigned short operation;
    };
    std::vector<Case> cases;
    cases.push_back({tool::versionRequest(), 0x6003, 0x0101});
    cases.push_back({tool::capabilitiesRequest({}), 0x6003, 0x0104});
    cases.push_back({tool::getModeRequest(), 0x6003, 0x0109});
    cases.push_back({tool::getMetadataRequest(), 0x6003, 0x010B});
    cases.push_back({tool::maxSessionsRequest(), 0x6002, 0x0404});
    for (const Case& entry : cases) {
        SCOPED_TRACE(entry.request.name);
        EXPECT_THROW(asJson(entry.request, response(entry.function, entry.operation, "x")), QelMessageCastException);
    }
}

} // namespace

} // namespace qel::test
