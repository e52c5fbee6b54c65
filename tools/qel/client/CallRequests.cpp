#include "client/CallRequests.hpp"

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/ResponseOf.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

#include <cstdio>
#include <cstring>

namespace qel::tool {

namespace {

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
    const auto response = readResponse<QelMessageGetInterfaceLimitsRsp>(message.clone());
    const InterfaceLimits limits = limitsOf(*response);
    Answer answer;
    answer.add("maxCommandSize", "Largest command (bytes)", limits.largestCommand);
    answer.add("maxHypervisorCommandSize", "Largest hypervisor command (bytes)", limits.largestHypervisorCommand);
    answer.add("broadcastPacketSize", "Largest broadcast (bytes)", limits.largestBroadcast);
    answer.add("consolesSupported", "Consoles supported", limits.consoles);
    answer.add("nonpersistentLocksSupported", "Nonpersistent locks supported", limits.nonpersistentLocks);
    answer.add("persistentLocksSupported", "Persistent locks supported", limits.persistentLocks);
    return answer;
}

/// Prints what the server says, leap seconds included, so it does not go through a time_t.
Answer describeTime(const QelMessage& message)
{
    const auto response = readResponse<QelMessageGetQelTodRsp>(message.clone());
    QelMessageGetQelTodRsp::Data time;
    std::memcpy(&time, response->getData(), sizeof(time));
    char text[64];
    std::snprintf(text, sizeof(text), "%04u-%02u-%02uT%02u:%02u:%02uZ", static_cast<unsigned>(time.mYear.value()),
                  static_cast<unsigned>(time.mMonth.value()), static_cast<unsigned>(time.mDay.value()),
                  static_cast<unsigned>(time.mHour.value()), static_cast<unsigned>(time.mMinute.value()),
                  static_cast<unsigned>(time.mSecond.value()));
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
