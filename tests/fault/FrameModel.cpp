#include "fault/FrameModel.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "support/Bytes.hpp"
#include "support/GoldenFrame.hpp"

#include <cstdio>
#include <set>
#include <stdexcept>

namespace qel::test {

// --- frame -----------------------------------------------------------------------------------------------------------

std::uint64_t numberAt(const std::string& bytes, std::size_t offset, std::size_t length)
{
    std::uint64_t number = 0;
    for (std::size_t i = offset; i < offset + length; ++i) {
        number = number << 8 | static_cast<unsigned char>(bytes.at(i));
    }
    return number;
}

void setNumberAt(std::string& bytes, std::size_t offset, std::size_t length, std::uint64_t number)
{
    for (std::size_t i = 0; i < length; ++i) {
        bytes.at(offset + length - 1 - i) = static_cast<char>(static_cast<unsigned char>(number >> (8 * i)));
    }
}

std::string hexNumber(std::uint64_t number, int digits)
{
    char text[32];
    std::snprintf(text, sizeof(text), "0x%0*llX", digits, static_cast<unsigned long long>(number));
    return text;
}

std::size_t headerLength(const std::string& bytes) { return numberAt(bytes, 3, 1) == 0 ? 24 : 32; }

namespace {

/// Why bytes are not a valid frame, and how the line in the log begins; both empty when they are one.
struct Fault {
    std::string phrase;
    std::string logLine;
};

Fault judgeFrame(const std::string& bytes)
{
    const std::size_t length = bytes.size();
    if (length < 24) return {"i_length shorter than old header", "bad length = " + hexNumber(length, 8)};
    if (bytes.compare(0, 3, "\xDE\xCA\xFF") != 0) {
        return {"i_buffer bad eyecatcher", "bad eyecatcher = 0x" + hex(bytes.substr(0, 3))};
    }
    const std::uint64_t version = numberAt(bytes, 3, 1);
    if (length < 32 && version != 0) {
        return {"i_length shorter than new header", "bad length = " + hexNumber(length, 8)};
    }
    const std::uint64_t msgLength = numberAt(bytes, 4, 4);
    if (msgLength > length) {
        return {"i_length shorter than total message length", "i_length shorter than message length field in header"};
    }
    if (version != 0x00 && version != 0x20) {
        return {"i_buffer bad header version", "bad header version = " + hexNumber(version, 2)};
    }
    const std::uint64_t dataLength = numberAt(bytes, 16, 4);
    const std::uint64_t pad = numberAt(bytes, 15, 1);
    const std::uint64_t leastPad = version == 0 && dataLength < 16 ? 16 - dataLength : 0;
    if (pad < leastPad) {
        return {"i_buffer bad header pad length",
                "bad header pad length (old) = " + hexNumber(pad, 2) + " < expected 0x"};
    }
    if (msgLength != headerLength(bytes) + dataLength + pad) {
        return {"i_buffer bad MsgLength in header", "bad header MsgLength = " + hexNumber(msgLength, 8)};
    }
    return {};
}

} // namespace

// --- payloads --------------------------------------------------------------------------------------------------------

Reading& Reading::bytes(const std::string& value)
{
    mText += hex(value) + ' ';
    return *this;
}

namespace {

std::uint64_t u8(const std::string& payload, std::size_t offset) { return numberAt(payload, offset, 1); }
std::uint64_t u16(const std::string& payload, std::size_t offset) { return numberAt(payload, offset, 2); }
std::uint64_t u32(const std::string& payload, std::size_t offset) { return numberAt(payload, offset, 4); }

/// @throws std::out_of_range the payload is shorter
std::string part(const std::string& payload, std::uint64_t offset, std::uint64_t length)
{
    if (offset + length > payload.size()) throw std::out_of_range("part");
    return payload.substr(offset, length);
}

std::string takeAll(const std::string&) { return ""; }
Reading readNothing(const std::string&) { return {}; }
Reading readNothing(const QelMessage&) { return {}; }

constexpr char kTooSmall[] = "dataLength smaller than minimum acceptable size";

template <std::size_t Length>
std::string atLeast(const std::string& payload)
{
    return payload.size() < Length ? "dataLength shorter than actual data size" : "";
}

std::string judgeVersionRequest(const std::string& payload)
{
    if (payload.size() < 16) return kTooSmall;
    if (u16(payload, 8) > 32 || payload.size() < 16 + u16(payload, 8)) return "Tool ID length is invalid";
    return "";
}

Reading readVersionRequest(const std::string& payload)
{
    return Reading()
        .number(u32(payload, 0))
        .number(u32(payload, 4))
        .number(u16(payload, 10))
        .number(u16(payload, 12))
        .bytes(part(payload, 16, u16(payload, 8)));
}

Reading askVersionRequest(const QelMessage& message)
{
    const auto& typed = qelMessageCast<QelMessageGetEnclTypeAndInterfaceVersionReq>(message);
    return Reading()
        .number(typed.getInterfaceVersion())
        .number(typed.getToolType())
        .number(typed.getMajorVersion())
        .number(typed.getMinorVersion())
        .bytes(typed.getToolId());
}

std::string judgeVersionResponse(const std::string& payload)
{
    if (payload.size() < 32) return kTooSmall;
    if (u16(payload, 12) > 16) return "Invalid machine type length";
    if (u16(payload, 14) > 16) return "Invalid system serial length";
    if (payload.size() < 32 + u16(payload, 14)) return "dataLength not long enough to encapsulate final string field";
    return "";
}

Reading readVersionResponse(const std::string& payload)
{
    return Reading()
        .number(u8(payload, 0))
        .number(u8(payload, 1))
        .number(u16(payload, 2))
        .number(u16(payload, 4))
        .bytes(part(payload, 16, u16(payload, 12)))
        .bytes(part(payload, 32, u16(payload, 14)));
}

Reading askVersionResponse(const QelMessage& message)
{
    const auto& typed = qelMessageCast<QelMessageGetEnclTypeAndInterfaceVersionRsp>(message);
    return Reading()
        .number(static_cast<unsigned char>(typed.getInterfaceVersionFamily()))
        .number(typed.getEnclosureType())
        .number(typed.getMajorVersion())
        .number(typed.getMinorVersion())
        .bytes(typed.getSystemMachineType())
        .bytes(typed.getSystemSerialNum());
}

std::string judgeCapabilities(const std::string& payload)
{
    if (payload.size() < 4) return kTooSmall;
    if (u32(payload, 0) % 4 != 0) return "Given capability length is invalid (length % 4 wasn't 0)";
    if (payload.size() < 4 + u32(payload, 0)) return "capabilityLen larger than acceptable";
    return "";
}

Reading readCapabilities(const std::string& payload)
{
    std::string bits;
    for (std::size_t i = 0; i < 32; ++i) {
        const bool isCarried = i / 8 < u32(payload, 0);
        bits += isCarried && (u8(payload, 4 + i / 8) & 0x80U >> i % 8) != 0 ? '1' : '0';
    }
    return Reading().number(u32(payload, 0)).text(bits);
}

template <typename T>
Reading askCapabilities(const QelMessage& message)
{
    const auto& typed = qelMessageCast<T>(message);
    return Reading().number(typed.getCapabilityLen()).text(typed.getCapabilities().to_string());
}

std::string judgeBroadcastRequest(const std::string& payload)
{
    if (payload.size() < 46) return kTooSmall;
    if (u16(payload, 0) < 46) return "message offset less than minimum acceptable size";
    if (u16(payload, 0) + u16(payload, 4) > payload.size()) return "message greater than maximum acceptable size";
    if (u8(payload, 2) == 1 && u16(payload, 12) == 0) return "Unicast message has no valid toolID";
    if (u16(payload, 12) > 32) return "toolIdLen greater than maximum acceptable size";
    return "";
}

Reading readBroadcastRequest(const std::string& payload)
{
    return Reading()
        .number(u16(payload, 0))
        .number(u8(payload, 2))
        .number(u32(payload, 8))
        .number(u16(payload, 4))
        .bytes(part(payload, 14, u16(payload, 12)))
        .bytes(part(payload, u16(payload, 0), u16(payload, 4)));
}

Reading askBroadcastRequest(const QelMessage& message)
{
    const auto& typed = qelMessageCast<QelMessageDaxBroadcastReq>(message);
    return Reading()
        .number(static_cast<std::uint64_t>(typed.getDaxPacket() - typed.getData()))
        .number(typed.getBroadcastMode())
        .number(typed.getToolType())
        .number(typed.getBroadcastMsgLen())
        .bytes(typed.getToolId())
        .bytes(std::string(typed.getDaxPacket(), typed.getBroadcastMsgLen()));
}

std::string judgeOutboundBroadcast(const std::string& payload)
{
    if (payload.size() < 42) return kTooSmall;
    if (u16(payload, 0) < 42) return "message offset less than minimum acceptable size";
    if (u16(payload, 0) + u16(payload, 2) > payload.size()) return "message greater than maximum acceptable size";
    if (u16(payload, 8) > 32) return "toolIdLen greater than maximum acceptable size";
    return "";
}

Reading readOutboundBroadcast(const std::string& payload)
{
    return Reading()
        .number(u16(payload, 0))
        .number(u32(payload, 4))
        .number(u16(payload, 2))
        .bytes(part(payload, 10, u16(payload, 8)))
        .bytes(part(payload, u16(payload, 0), u16(payload, 2)));
}

Reading askOutboundBroadcast(const QelMessage& message)
{
    const auto& typed = qelMessageCast<QelMessageDaxBroadcastOutboundAsync>(message);
    return Reading()
        .number(static_cast<std::uint64_t>(typed.getDaxPacket() - typed.getData()))
        .number(typed.getSenderToolType())
        .number(typed.getBroadcastMsgLen())
        .bytes(typed.getSenderToolId())
        .bytes(std::string(typed.getDaxPacket(), typed.getBroadcastMsgLen()));
}

std::string judgeMode(const std::string& payload)
{
    if (payload.size() < 4) return kTooSmall;
    return payload.size() < 4 + u16(payload, 2) ? "mtmsLen larger than acceptable" : "";
}

Reading readMode(const std::string& payload)
{
    return Reading().number(u8(payload, 0)).number(u16(payload, 2)).bytes(part(payload, 4, u16(payload, 2)));
}

template <typename T>
Reading askMode(const QelMessage& message)
{
    const auto& typed = qelMessageCast<T>(message);
    return Reading().number(typed.getMode()).number(typed.getMTMSLen()).bytes(typed.getMTMS());
}

std::string judgeMetadata(const std::string& payload)
{
    if (payload.size() < 2) return kTooSmall;
    return payload.size() < 2 + u16(payload, 0) ? "metadataLen larger than acceptable" : "";
}

Reading readMetadata(const std::string& payload)
{
    return Reading().number(u16(payload, 0)).bytes(part(payload, 2, u16(payload, 0)));
}

template <typename T>
Reading askMetadata(const QelMessage& message)
{
    const auto& typed = qelMessageCast<T>(message);
    return Reading().number(typed.getMetadataLen()).bytes(typed.getMetadata());
}

/// Partition and connection number.
Reading readAddress(const std::string& payload) { return Reading().number(u16(payload, 0)).number(u16(payload, 2)); }

template <typename T>
Reading askAddress(const QelMessage& message)
{
    const auto& typed = qelMessageCast<T>(message);
    return Reading().number(typed.getLpId()).number(typed.getVssConnectionNumber());
}

Reading readOpen(const std::string& payload) { return readAddress(payload).number(u16(payload, 4) >> 15); }

Reading askOpen(const QelMessage& message)
{
    using T = QelMessageVirtualSerialOpenReq;
    return askAddress<T>(message).number(qelMessageCast<T>(message).isForceOpen() ? 1 : 0);
}

Reading readClose(const std::string& payload) { return readAddress(payload).number(u8(payload, 4) == 0xFF ? 1 : 0); }

Reading askClose(const QelMessage& message)
{
    using T = QelMessageVirtualSerialCloseReq;
    return askAddress<T>(message).number(qelMessageCast<T>(message).isForceClose() ? 1 : 0);
}

Reading readMaxSessions(const std::string& payload) { return Reading().number(u16(payload, 0)).number(u8(payload, 2)); }

Reading askMaxSessions(const QelMessage& message)
{
    const auto& typed = qelMessageCast<QelMessageVirtualSerialGetMaxSessionsRsp>(message);
    return Reading().number(typed.getMaxCec()).number(typed.getMaxLpar());
}

Reading readSessionClosed(const std::string& payload)
{
    const std::uint64_t reason = u32(payload, 4);
    return readAddress(payload).number(reason >= 1 && reason <= 5 ? reason : 1);
}

Reading askSessionClosed(const QelMessage& message)
{
    using T = QelMessageVirtualSerialSessionClosedAsync;
    return askAddress<T>(message).number(qelMessageCast<T>(message).getCloseReason());
}

std::string judgeSerialData(const std::string& payload)
{
    if (payload.size() < 6 || payload.size() < 6 + u16(payload, 4)) return "dataLength shorter than actual data size";
    return "";
}

Reading readSerialData(const std::string& payload)
{
    const Reading fixed = readAddress(payload).number(u16(payload, 4));
    if (u16(payload, 4) == 0) return Reading(fixed).text("null");
    return Reading(fixed).bytes(part(payload, 6, u16(payload, 4)));
}

template <typename T>
Reading askSerialData(const QelMessage& message)
{
    const auto& typed = qelMessageCast<T>(message);
    const Reading fixed = askAddress<T>(message).number(typed.getSerialDataLength());
    if (typed.getSerialData() == nullptr) return Reading(fixed).text("null");
    return Reading(fixed).bytes(std::string(typed.getSerialData(), typed.getSerialDataLength()));
}

} // namespace

const PayloadRules& rulesOf(const std::string& className)
{
    static const PayloadRules kNone = {&takeAll, &readNothing, &readNothing};
    static const std::map<std::string, PayloadRules> kRules = {
        {"QelMessageGetEnclTypeAndInterfaceVersionReq",
         {&judgeVersionRequest, &readVersionRequest, &askVersionRequest}},
        {"QelMessageGetEnclTypeAndInterfaceVersionRsp",
         {&judgeVersionResponse, &readVersionResponse, &askVersionResponse}},
        {"QelMessageExchIntCapabilitiesReq",
         {&judgeCapabilities, &readCapabilities, &askCapabilities<QelMessageExchIntCapabilitiesReq>}},
        {"QelMessageExchIntCapabilitiesRsp",
         {&judgeCapabilities, &readCapabilities, &askCapabilities<QelMessageExchIntCapabilitiesRsp>}},
        {"QelMessageDaxBroadcastReq", {&judgeBroadcastRequest, &readBroadcastRequest, &askBroadcastRequest}},
        {"QelMessageDaxBroadcastOutboundAsync",
         {&judgeOutboundBroadcast, &readOutboundBroadcast, &askOutboundBroadcast}},
        {"QelMessageSetGlobalModeAttributeReq", {&judgeMode, &readMode, &askMode<QelMessageSetGlobalModeAttributeReq>}},
        {"QelMessageGetGlobalModeAttributeRsp", {&judgeMode, &readMode, &askMode<QelMessageGetGlobalModeAttributeRsp>}},
        {"QelMessageSetGlobalSaveAreaMetadataReq",
         {&judgeMetadata, &readMetadata, &askMetadata<QelMessageSetGlobalSaveAreaMetadataReq>}},
        {"QelMessageGetGlobalSaveAreaMetadataRsp",
         {&judgeMetadata, &readMetadata, &askMetadata<QelMessageGetGlobalSaveAreaMetadataRsp>}},
        {"QelMessageVirtualSerialOpenReq", {&atLeast<8>, &readOpen, &askOpen}},
        {"QelMessageVirtualSerialOpenRsp", {&atLeast<8>, &readAddress, &askAddress<QelMessageVirtualSerialOpenRsp>}},
        {"QelMessageVirtualSerialCloseReq", {&atLeast<5>, &readClose, &askClose}},
        {"QelMessageVirtualSerialGetMaxSessionsRsp", {&atLeast<3>, &readMaxSessions, &askMaxSessions}},
        {"QelMessageVirtualSerialSetupSessionReq",
         {&atLeast<4>, &readAddress, &askAddress<QelMessageVirtualSerialSetupSessionReq>}},
        {"QelMessageVirtualSerialSessionClosedAsync", {&atLeast<8>, &readSessionClosed, &askSessionClosed}},
        {"QelMessageVirtualSerialDataToOsAsync",
         {&judgeSerialData, &readSerialData, &askSerialData<QelMessageVirtualSerialDataToOsAsync>}},
        {"QelMessageVirtualSerialDataToDaxAsync",
         {&judgeSerialData, &readSerialData, &askSerialData<QelMessageVirtualSerialDataToDaxAsync>}},
    };
    const auto found = kRules.find(className);
    return found == kRules.end() ? kNone : found->second;
}

// --- registries ------------------------------------------------------------------------------------------------------

namespace {

Receiver receiver(const QelMessageRegistry& registry, bool isInternal)
{
    const std::set<std::string> neverParsed = {"QelMessageGetInterfaceLimitsRsp", "QelMessageGetQelTodRsp"};
    Receiver result{registry, {}};
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame golden = GoldenFrame::load(name);
        if (neverParsed.count(golden.className()) != 0 || (golden.function() == 0x6001) != isInternal) continue;
        const std::uint64_t flags = golden.number<unsigned char>("header.mFlags");
        result.classes[{golden.function(), golden.operation(), flags}] = golden.className();
    }
    return result;
}

} // namespace

const Receiver& publicReceiver()
{
    static const QelMessageRegistry kRegistry;
    static const Receiver kReceiver = receiver(kRegistry, false);
    return kReceiver;
}

const Receiver& internalReceiver()
{
    static const Receiver kReceiver = receiver(QelInternalMessageRegistry::getInstance(), true);
    return kReceiver;
}

Verdict judge(const Receiver& receiver, const std::string& bytes)
{
    if (bytes.size() < 22) return {"length", "", "", {"E: Encountered message with invalid length"}};

    const std::uint64_t flags = numberAt(bytes, 14, 1);
    const std::string fastHeader = "[FN=" + hexNumber(numberAt(bytes, 12, 2), 4) +
                                   " OP=" + hexNumber(numberAt(bytes, 20, 2), 4) + " FL=" + hexNumber(flags, 2) + "]";
    const auto known = receiver.classes.find({numberAt(bytes, 12, 2), numberAt(bytes, 20, 2), flags & 0xC0});
    const bool isKnown = known != receiver.classes.end();
    const std::string refused = "D: Failed to deserialize message " + fastHeader + ": ";

    const Fault fault = judgeFrame(bytes);
    if (!fault.phrase.empty()) {
        Verdict verdict{fault.phrase, "", "", {}};
        if (isKnown) verdict.lines = {"E: " + fault.logLine, refused + fault.phrase};
        verdict.lines.push_back("E: " + fault.logLine);
        verdict.lines.push_back("E: Default message deserialization failed " + fastHeader + ": " + fault.phrase);
        return verdict;
    }

    const std::string payload = bytes.substr(headerLength(bytes), numberAt(bytes, 16, 4));
    if (!isKnown) return {"", "QelMessage", payload, {}};
    const std::string phrase = rulesOf(known->second).judge(payload);
    if (!phrase.empty()) return {"", "QelMessage", payload, {refused + phrase}};
    return {"", known->second, payload, {}};
}

} // namespace qel::test
