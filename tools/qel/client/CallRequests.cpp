#include "client/CallRequests.hpp"

#include <qel/common/BCDExtensions.hpp>
#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <cstring>

namespace qel::tool {

namespace {

// The payloads of the two responses for which the registry has no class. Offsets are from the first payload byte.

struct LimitsPayload {
    be_uint16_t maxCommandSize;     //  0  bytes
    be_uint16_t maxKrogCommandSize; //  2  bytes
    be_uint16_t broadcastSize;      //  4  bytes
    char reserved1[2];              //  6
    unsigned char daxsSupported;    //  8
    char reserved2[3];              //  9
    be_uint16_t nonpersistentLocks; // 12
    be_uint16_t persistentLocks;    // 14
};
static_assert(sizeof(LimitsPayload) == 16 && alignof(LimitsPayload) == 1, "copied from the frame buffer");

struct TimePayload {
    bcd_uint16_t year;    // 0
    bcd_uint8_t month;    // 2
    bcd_uint8_t day;      // 3
    bcd_uint8_t hour;     // 4
    bcd_uint8_t minute;   // 5
    bcd_uint8_t second;   // 6
    bcd_uint8_t reserved; // 7
};
static_assert(sizeof(TimePayload) == 8 && alignof(TimePayload) == 1, "copied from the frame buffer");

template <typename Payload>
Payload payloadOf(const QelMessage& message)
{
    if (message.dataLength() < sizeof(Payload)) {
        throw QelMessageValidationException("the response is too short");
    }
    Payload payload;
    std::memcpy(&payload, message.getData(), sizeof(payload));
    return payload;
}

Answer describeVersion(const QelMessage& message)
{
    const auto& response = qelMessageCast<QelMessageGetEnclTypeAndInterfaceVersionRsp>(message);
    Answer answer;
    answer.addText("family", "Interface family", std::string(1, response.getInterfaceVersionFamily()));
    answer.add("majorVersion", "Major version", response.getMajorVersion());
    answer.add("minorVersion", "Minor version", response.getMinorVersion());
    answer.add("enclosureType", "Enclosure type", response.getEnclosureType());
    answer.addText("machineType", "Machine type", response.getSystemMachineType());
    answer.addText("serialNumber", "Serial number", response.getSystemSerialNum());
    return answer;
}

Answer describeCapabilities(const QelMessage& message)
{
    const auto& response = qelMessageCast<QelMessageExchIntCapabilitiesRsp>(message);
    Answer answer;
    answer.add("capabilities", "Common capabilities", response.getCapabilities().to_string());
    return answer;
}

Answer describeLimits(const QelMessage& message)
{
    const auto limits = payloadOf<LimitsPayload>(message);
    Answer answer;
    answer.add("maxCommandSize", "Largest command (bytes)", limits.maxCommandSize.value());
    answer.add("maxHypervisorCommandSize", "Largest hypervisor command (bytes)", limits.maxKrogCommandSize.value());
    answer.add("broadcastPacketSize", "Largest broadcast (bytes)", limits.broadcastSize.value());
    answer.add("consolesSupported", "Consoles supported", limits.daxsSupported);
    answer.add("nonpersistentLocksSupported", "Nonpersistent locks supported", limits.nonpersistentLocks.value());
    answer.add("persistentLocksSupported", "Persistent locks supported", limits.persistentLocks.value());
    return answer;
}

/// BCD has a decimal digit in each half byte.
void requireDecimalDigits(const QelMessage& message)
{
    constexpr std::size_t kDigitBytes = offsetof(TimePayload, reserved);
    const char* const bytes = message.getData();
    const bool isDecimal = std::all_of(bytes, bytes + kDigitBytes, [](char c) {
        const auto byte = static_cast<unsigned char>(c);
        return (byte >> 4) <= 9 && (byte & 0x0F) <= 9;
    });
    if (!isDecimal) {
        const std::string hex = hexDigits(std::string(bytes, kDigitBytes));
        throw QelMessageValidationException("the time of day has digits above 9: " + hex);
    }
}

Answer describeTime(const QelMessage& message)
{
    const auto time = payloadOf<TimePayload>(message);
    requireDecimalDigits(message);
    char text[64];
    std::snprintf(text, sizeof(text), "%04u-%02u-%02uT%02u:%02u:%02uZ", static_cast<unsigned>(time.year.value()),
                  static_cast<unsigned>(time.month.value()), static_cast<unsigned>(time.day.value()),
                  static_cast<unsigned>(time.hour.value()), static_cast<unsigned>(time.minute.value()),
                  static_cast<unsigned>(time.second.value()));
    Answer answer;
    answer.add("time", "Time of day (UTC)", text);
    return answer;
}

Answer describeMaxSessions(const QelMessage& message)
{
    const auto& response = qelMessageCast<QelMessageVirtualSerialGetMaxSessionsRsp>(message);
    Answer answer;
    answer.add("maxSystems", "Systems", response.getMaxCec());
    answer.add("maxPartitions", "Partitions", response.getMaxLpar());
    return answer;
}

Answer describeMode(const QelMessage& message)
{
    const auto& response = qelMessageCast<QelMessageGetGlobalModeAttributeRsp>(message);
    Answer answer;
    answer.add("mode", "Mode", response.getMode());
    answer.addText("mtms", "Machine type, model, serial", response.getMTMS());
    answer.addForPrograms("mtmsHex", hexDigits(response.getMTMS()));
    return answer;
}

Answer describeMetadata(const QelMessage& message)
{
    const auto& response = qelMessageCast<QelMessageGetGlobalSaveAreaMetadataRsp>(message);
    Answer answer;
    answer.addText("metadata", "Metadata", response.getMetadata());
    answer.addForPrograms("metadataHex", hexDigits(response.getMetadata()));
    return answer;
}

/// For responses without a payload.
Answer describeDone(const QelMessage&) { return Answer(); }

} // namespace

CallRequest versionRequest() { return {"version", nullptr, false, describeVersion}; }

CallRequest capabilitiesRequest(const QelCapabilities& offered)
{
    return {"capabilities", std::make_unique<QelMessageExchIntCapabilitiesReq>(offered), false, describeCapabilities};
}

CallRequest limitsRequest()
{
    return {"limits", std::make_unique<QelMessageGetInterfaceLimitsReq>(), false, describeLimits};
}

CallRequest timeRequest() { return {"time", std::make_unique<QelMessageGetQelTodReq>(), false, describeTime}; }

CallRequest maxSessionsRequest()
{
    return {"max-sessions", std::make_unique<QelMessageVirtualSerialGetMaxSessionsReq>(), true, describeMaxSessions};
}

CallRequest getModeRequest()
{
    return {"get-mode", std::make_unique<QelMessageGetGlobalModeAttributeReq>(), false, describeMode};
}

CallRequest setModeRequest(std::uint8_t mode, const std::string& mtms)
{
    return {"set-mode", std::make_unique<QelMessageSetGlobalModeAttributeReq>(mode, mtms), false, describeDone};
}

CallRequest getMetadataRequest()
{
    return {"get-metadata", std::make_unique<QelMessageGetGlobalSaveAreaMetadataReq>(), false, describeMetadata};
}

CallRequest setMetadataRequest(const std::string& metadata)
{
    return {"set-metadata", std::make_unique<QelMessageSetGlobalSaveAreaMetadataReq>(metadata), false, describeDone};
}

CallRequest broadcastRequest(const BroadcastAddress& address, const std::string& text)
{
    return {"broadcast",
            std::make_unique<QelMessageDaxBroadcastReq>(address.type, static_cast<std::uint16_t>(text.size()),
                                                        address.toolType, address.toolId, text.data()),
            false, describeDone};
}

} // namespace qel::tool
