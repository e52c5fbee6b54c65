// Prints what the library reads in frames, one line for each, in the form in which wire.py says what the document of
// the wire format makes of them. script/second-opinion compares the two.
//
// Input: frames one after the other, each as a length (4 bytes, big-endian) and so many bytes.

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelDebug.hpp>
#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/TypeInfo.hpp>

#include <cstddef>
#include <exception>
#include <iostream>
#include <memory>
#include <string>
#include <typeindex>
#include <unordered_map>
#include <utility>
#include <vector>

namespace {

using namespace qel;

std::string hex(const char* bytes, std::size_t length)
{
    static const char kDigits[] = "0123456789abcdef";
    std::string text;
    for (std::size_t i = 0; i < length; ++i) {
        const auto byte = static_cast<unsigned char>(bytes[i]);
        text += kDigits[byte >> 4];
        text += kDigits[byte & 0x0F];
    }
    return text;
}

std::string hex(const std::string& bytes) { return hex(bytes.data(), bytes.size()); }

std::string field(const char* name, unsigned int value)
{
    return std::string(" ") + name + "=" + std::to_string(value);
}

std::string field(const char* name, const std::string& bytes) { return std::string(" ") + name + "=" + hex(bytes); }

template <typename T>
std::string address(const T& message)
{
    return field("mLparId", message.getLpId()) + field("mVssConnectionNumber", message.getVssConnectionNumber());
}

template <typename T>
std::string serialData(const T& message)
{
    const char* data = message.getSerialData();
    const std::string bytes = data == nullptr ? "" : std::string(data, message.getSerialDataLength());
    return address(message) + field("mDataLength", message.getSerialDataLength()) + field("data", bytes);
}

template <typename T>
std::string capabilities(const T& message)
{
    return field("mCapabilityLen", message.getCapabilityLen()) +
           " mSupportedCapabilities=" + message.getCapabilities().to_string();
}

template <typename T>
std::string mode(const T& message)
{
    return field("mMode", message.getMode()) + field("mMTMSLen", message.getMTMSLen()) +
           field("mMTMS", message.getMTMS());
}

template <typename T>
std::string metadata(const T& message)
{
    return field("mMetadataLen", message.getMetadataLen()) + field("mMetadata", message.getMetadata());
}

std::string versionRequest(const QelMessageGetEnclTypeAndInterfaceVersionReq& message)
{
    return field("mInterfaceVersion", message.getInterfaceVersion()) + field("mToolType", message.getToolType()) +
           field("mMajorVersion", message.getMajorVersion()) + field("mMinorVersion", message.getMinorVersion()) +
           field("mToolId", message.getToolId());
}

std::string versionResponse(const QelMessageGetEnclTypeAndInterfaceVersionRsp& message)
{
    return field("mInterfaceVersionFamily", static_cast<unsigned char>(message.getInterfaceVersionFamily())) +
           field("mEnclosureType", message.getEnclosureType()) + field("mMajorVersion", message.getMajorVersion()) +
           field("mMinorVersion", message.getMinorVersion()) +
           field("mSysMachineType", message.getSystemMachineType()) + field("mSerialNum", message.getSystemSerialNum());
}

std::string broadcast(const QelMessageDaxBroadcastReq& message)
{
    return field("mBroadcastType", message.getBroadcastMode()) + field("mToolType", message.getToolType()) +
           field("mToolId", message.getToolId()) +
           field("message", std::string(message.getDaxPacket(), message.getBroadcastMsgLen()));
}

std::string outboundBroadcast(const QelMessageDaxBroadcastOutboundAsync& message)
{
    return field("mSenderToolType", message.getSenderToolType()) + field("mSenderToolId", message.getSenderToolId()) +
           field("message", std::string(message.getDaxPacket(), message.getBroadcastMsgLen()));
}

std::string open(const QelMessageVirtualSerialOpenReq& message)
{
    return address(message) + field("force", message.isForceOpen() ? 1 : 0);
}

std::string close(const QelMessageVirtualSerialCloseReq& message)
{
    return address(message) + field("force", message.isForceClose() ? 1 : 0);
}

std::string maxSessions(const QelMessageVirtualSerialGetMaxSessionsRsp& message)
{
    return field("mMaxCec", message.getMaxCec()) + field("mMaxLpar", message.getMaxLpar());
}

std::string closed(const QelMessageVirtualSerialSessionClosedAsync& message)
{
    return address(message) + field("mCloseReason", static_cast<unsigned int>(message.getCloseReason()));
}

using Printer = std::string (*)(const QelMessage&);

template <typename T, std::string (*print)(const T&)>
std::pair<const std::type_index, Printer> entry()
{
    return {typeid(T), [](const QelMessage& message) { return print(static_cast<const T&>(message)); }};
}

// The classes with a payload. All others have none.
const std::unordered_map<std::type_index, Printer>& printers()
{
    static const std::unordered_map<std::type_index, Printer> table = {
        entry<QelMessageGetEnclTypeAndInterfaceVersionReq, versionRequest>(),
        entry<QelMessageGetEnclTypeAndInterfaceVersionRsp, versionResponse>(),
        entry<QelMessageExchIntCapabilitiesReq, capabilities>(),
        entry<QelMessageExchIntCapabilitiesRsp, capabilities>(),
        entry<QelMessageDaxBroadcastReq, broadcast>(),
        entry<QelMessageDaxBroadcastOutboundAsync, outboundBroadcast>(),
        entry<QelMessageSetGlobalModeAttributeReq, mode>(),
        entry<QelMessageGetGlobalModeAttributeRsp, mode>(),
        entry<QelMessageSetGlobalSaveAreaMetadataReq, metadata>(),
        entry<QelMessageGetGlobalSaveAreaMetadataRsp, metadata>(),
        entry<QelMessageVirtualSerialOpenReq, open>(),
        entry<QelMessageVirtualSerialOpenRsp, address>(),
        entry<QelMessageVirtualSerialCloseReq, close>(),
        entry<QelMessageVirtualSerialGetMaxSessionsRsp, maxSessions>(),
        entry<QelMessageVirtualSerialDataToOsAsync, serialData>(),
        entry<QelMessageVirtualSerialDataToDaxAsync, serialData>(),
        entry<QelMessageVirtualSerialSetupSessionReq, address>(),
        entry<QelMessageVirtualSerialSessionClosedAsync, closed>(),
    };
    return table;
}

// Why the class of a known identity refused the frame; "unknown" for an unknown identity.
std::string refusal(const QelMessageRegistry& registry, const QelMessage& message)
{
    const auto* const factory =
        registry.findFactory({message.getFunction(), message.getOperation(), message.getClassification()});
    if (factory == nullptr) return "unknown";
    try {
        (*factory)(message.serialize(), message.msgLength());
    } catch (const QelMessageValidationException& refused) {
        return refused.what();
    }
    return "none";
}

std::string verdict(const QelMessageRegistry& registry, const std::vector<char>& frame)
{
    std::unique_ptr<QelMessage> message;
    try {
        message = registry.deserialize(frame.data(), static_cast<unsigned int>(frame.size()));
    } catch (const QelMessageValidationException& refused) {
        return std::string("malformed: ") + refused.what();
    }

    const QelMessage& found = *message;
    const bool isTyped = typeid(found) != typeid(QelMessage);
    std::string text = isTyped ? TypeInfo::getTypeName(found).substr(sizeof("qel::") - 1) : "untyped";
    text += field("caller", found.getCallerId()) + field("function", found.getFunction()) +
            field("operation", found.getOperation()) + field("flags", found.getFlags()) +
            field("status", found.getStatus()) + field("detail", found.getStatusDetail()) +
            field("length", found.msgLength()) + " payload=" + hex(found.getData(), found.dataLength());
    if (!isTyped) return text + " because: " + refusal(registry, found);
    const auto printer = printers().find(typeid(found));
    return printer == printers().end() ? text : text + printer->second(found);
}

} // namespace

int main()
{
    std::ios::sync_with_stdio(false);
    const QelMessageRegistry messages;
    const QelMessageRegistry& handshake = QelInternalMessageRegistry::getInstance();

    be_uint32_t length;
    std::vector<char> frame;
    while (std::cin.read(reinterpret_cast<char*>(&length), sizeof(length))) {
        frame.resize(length.value());
        if (!std::cin.read(frame.data(), static_cast<std::streamsize>(frame.size()))) return 2;
        std::cout << verdict(messages, frame) << '\n' << verdict(handshake, frame) << '\n';
    }
    return std::cout.flush() ? 0 : 1;
}
