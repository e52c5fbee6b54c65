#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/TypeInfo.hpp>

#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/GoldenFrame.hpp"
#include "support/MessageProbe.hpp"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <exception>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <memory>
#include <set>
#include <stdexcept>
#include <string>
#include <tuple>
#include <vector>

/// Broken frames of every kind, each judged twice: by the library, and by a second reading of the wire format that is
/// written down here without any of the library's code. For each of them the two must agree on whether it is a
/// message, of which class, with which values, and otherwise on the reason and on the lines in the log. The bytes lie
/// in heap blocks that end with the last of them, so that the address sanitizer sees every byte read beyond.

namespace qel::test {
namespace {

using testing::StartsWith;

// ------------------------------------------------------------------------------------------ the second reading: frame

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

/// Why some bytes are no frame, and how the line in the log begins; nothing when they are one.
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

// --------------------------------------------------------------------------------------- the second reading: payloads

/// What accessors give, in the order in which both sides ask.
class Reading {
public:
    Reading& number(std::uint64_t value)
    {
        mText += std::to_string(value) + ' ';
        return *this;
    }
    Reading& bytes(const std::string& value)
    {
        mText += hex(value) + ' ';
        return *this;
    }
    Reading& text(const std::string& value)
    {
        mText += value + ' ';
        return *this;
    }
    const std::string& str() const { return mText; }

private:
    std::string mText;
};

/// How a class treats its payload.
struct PayloadRules {
    std::string (*judge)(
        const std::string& payload);                 ///< the phrase it refuses the payload with; nothing if it takes it
    Reading (*expected)(const std::string& payload); ///< the values, from the bytes
    Reading (*actual)(const QelMessage& message);    ///< the values, from the accessors
};

std::uint64_t u8(const std::string& payload, std::size_t offset) { return numberAt(payload, offset, 1); }
std::uint64_t u16(const std::string& payload, std::size_t offset) { return numberAt(payload, offset, 2); }
std::uint64_t u32(const std::string& payload, std::size_t offset) { return numberAt(payload, offset, 4); }

/// @throws std::out_of_range the payload has not so many bytes
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

/// The rules of a class; classes without an entry have no payload and take any.
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

// ------------------------------------------------------------------------------------------------- the two registries

using Identity = std::tuple<std::uint64_t, std::uint64_t, std::uint64_t>; // function, operation, upper two flag bits

/// A registry, and the classes that it is expected to know.
struct Receiver {
    const QelMessageRegistry& registry;
    std::map<Identity, std::string> classes;
};

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

// ---------------------------------------------------------------------------------------------------- what must come
// out

/// What the second reading says about some bytes.
struct Verdict {
    std::string thrown;             ///< the phrase of the exception; nothing when a message comes out
    std::string className;          ///< of the message
    std::string payload;            ///< of the message
    std::vector<std::string> lines; ///< how each line in the log begins
};

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

/// The last part of the dump: sixteen bytes to a line, a blank before every second one.
std::string rawContents(const std::string& frame)
{
    std::string dump = "Current raw message contents:\n";
    for (std::size_t i = 0; i < frame.size(); ++i) {
        if (i != 0 && i % 16 == 0) dump += '\n';
        if (i % 2 == 0) dump += ' ';
        dump += hex(frame.substr(i, 1));
    }
    return dump + "\n\n";
}

bool endsWith(const std::string& text, const std::string& end)
{
    return text.size() >= end.size() && text.compare(text.size() - end.size(), end.size(), end) == 0;
}

void expectHeader(const QelMessage& message, const std::string& frame)
{
    EXPECT_EQ(message.msgLength(), frame.size());
    EXPECT_EQ(message.getCallerId(), numberAt(frame, 8, 4));
    EXPECT_EQ(message.getFunction(), numberAt(frame, 12, 2));
    EXPECT_EQ(message.getFlags(), numberAt(frame, 14, 1));
    EXPECT_EQ(message.dataLength(), numberAt(frame, 16, 4));
    EXPECT_EQ(message.getOperation(), numberAt(frame, 20, 2));
    EXPECT_EQ(message.getStatus(), numberAt(frame, 22, 2));
    EXPECT_EQ(message.getStatusDetail(), headerLength(frame) == 32 ? numberAt(frame, 24, 2) : 0);
    const std::uint64_t upperFlags = numberAt(frame, 14, 1) >> 6;
    const QelMessageClassification::Value expected[] = {
        QelMessageClassification::Async, QelMessageClassification::Response, QelMessageClassification::Request,
        QelMessageClassification::Unknown};
    EXPECT_EQ(message.getClassification(), expected[upperFlags]);
    if (message.getStatus() == 0) {
        EXPECT_NO_THROW(message.checkStatus());
    } else {
        EXPECT_THROW(message.checkStatus(), QelMessageStatusException);
    }
}

/// Asks a message for everything it has.
void expectMessage(const QelMessage& message, const Verdict& verdict, const std::string& bytes)
{
    const std::string frame = bytes.substr(0, numberAt(bytes, 4, 4));
    ASSERT_EQ(frameOf(message), hex(frame));
    ASSERT_EQ(TypeInfo::getTypeName(message), "qel::" + verdict.className);
    expectHeader(message, frame);
    if (verdict.payload.empty()) {
        EXPECT_EQ(message.getData(), nullptr);
    } else {
        EXPECT_EQ(message.getData(), message.serialize() + headerLength(frame));
    }

    const PayloadRules& rules = rulesOf(verdict.className);
    EXPECT_EQ(rules.actual(message).str(), rules.expected(verdict.payload).str());

    const std::string id = "[CID: " + hexNumber(numberAt(frame, 8, 4), 8) + ", FN: ";
    EXPECT_THAT(toString(message.getLogID()), StartsWith(id));
    EXPECT_TRUE(endsWith(toString(message.debug()), rawContents(frame)));

    const std::unique_ptr<QelMessage> clone = message.clone();
    EXPECT_EQ(TypeInfo::getTypeName(*clone), "qel::" + verdict.className);
    EXPECT_EQ(frameOf(*clone), hex(frame));
    EXPECT_EQ(frameOf(QelMessageGeneric(message)), hex(frame));

    if (verdict.className == "QelMessageDaxBroadcastReq") {
        const auto& request = qelMessageCast<QelMessageDaxBroadcastReq>(message);
        const QelMessageDaxBroadcastOutboundAsync outbound(request, "sender", 7);
        EXPECT_EQ(hex(outbound.getDaxPacket(), outbound.getBroadcastMsgLen()),
                  hex(request.getDaxPacket(), request.getBroadcastMsgLen()));
    }
}

void expectLines(const std::vector<std::string>& lines, const std::vector<std::string>& beginnings)
{
    ASSERT_EQ(lines.size(), beginnings.size());
    for (std::size_t i = 0; i < lines.size(); ++i) {
        EXPECT_THAT(lines[i], StartsWith(beginnings[i]));
    }
}

class CorruptFrames : public testing::Test {
protected:
    /// Hands the bytes to the receiver from an even address and from an odd one, and compares what comes out with the
    /// second reading.
    void tryBytes(const Receiver& receiver, const std::string& bytes)
    {
        ++mTried;
        const Verdict verdict = judge(receiver, bytes);
        for (const std::size_t shift : {std::size_t{0}, std::size_t{1}}) {
            const std::string shifted = std::string(shift, '\x55') + bytes;
            const std::unique_ptr<char[]> block = heapCopy(shifted);
            mLog.clear();
            pTryBlock(receiver, block.get() + shift, bytes, verdict);
            EXPECT_EQ(hex(block.get(), shifted.size()), hex(shifted)) << "the input was written to";
            expectLines(mLog.lines(), verdict.lines);
            if (HasFailure()) {
                ADD_FAILURE() << "the bytes, " << (shift == 0 ? "even" : "odd") << " address: " << hex(bytes);
                return;
            }
        }
        ++(verdict.thrown.empty() ? mTaken : mRefused);
    }

    std::size_t mTried = 0;
    std::size_t mTaken = 0;
    std::size_t mRefused = 0;

private:
    static void pTryBlock(const Receiver& receiver, const char* block, const std::string& bytes, const Verdict& verdict)
    {
        std::string thrown;
        try {
            const std::unique_ptr<QelMessage> message =
                receiver.registry.deserialize(block, static_cast<unsigned int>(bytes.size()));
            ASSERT_NE(message, nullptr);
            ASSERT_LE(message->msgLength(), bytes.size());
            if (verdict.thrown.empty()) expectMessage(*message, verdict, bytes);
        } catch (const QelMessageValidationException& failure) {
            thrown = failure.what();
        } catch (const std::exception& failure) {
            FAIL() << "another exception: " << TypeInfo::getTypeName(failure) << " " << failure.what();
        }
        EXPECT_EQ(thrown, verdict.thrown);
    }

    CapturedLog mLog;
};

std::vector<GoldenFrame> goldenFrames()
{
    std::vector<GoldenFrame> frames;
    for (const std::string& name : GoldenFrame::allNames()) {
        frames.push_back(GoldenFrame::load(name));
    }
    return frames;
}

std::string at(const GoldenFrame& golden, std::size_t offset)
{
    return golden.fileName() + " at offset " + std::to_string(offset);
}

// ------------------------------------------------------------------------------------------------------------ the
// tests

TEST_F(CorruptFrames, WholeFramesAreTaken)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        SCOPED_TRACE(golden.fileName());
        tryBytes(publicReceiver(), golden.bytes());
        tryBytes(internalReceiver(), golden.bytes());
        if (HasFailure()) return;
    }
    EXPECT_EQ(mTaken, mTried);
}

TEST_F(CorruptFrames, EveryTruncationIsRefused)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        for (std::size_t length = 0; length < golden.bytes().size(); ++length) {
            SCOPED_TRACE(at(golden, length));
            tryBytes(publicReceiver(), golden.bytes().substr(0, length));
            if (HasFailure()) return;
        }
    }
    EXPECT_EQ(mRefused, mTried);
}

TEST_F(CorruptFrames, BytesBehindAFrameAreIgnored)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        SCOPED_TRACE(golden.fileName());
        tryBytes(publicReceiver(), golden.bytes() + '\xEE');
        tryBytes(publicReceiver(), golden.bytes() + golden.bytes());
        if (HasFailure()) return;
    }
    EXPECT_EQ(mTaken, mTried);
}

/// The values that one byte is replaced with.
std::set<char> replacements(char original)
{
    const auto byte = static_cast<unsigned char>(original);
    std::set<char> values = {'\x00', '\xFF', static_cast<char>(byte ^ 0x01), static_cast<char>(byte ^ 0x80),
                             static_cast<char>(byte + 1)};
    values.erase(original);
    return values;
}

TEST_F(CorruptFrames, EverySingleByteIsReplaced)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        for (std::size_t offset = 0; offset < golden.bytes().size(); ++offset) {
            for (const char value : replacements(golden.bytes()[offset])) {
                SCOPED_TRACE(at(golden, offset));
                std::string bytes = golden.bytes();
                bytes[offset] = value;
                tryBytes(publicReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_GT(mTaken, mRefused) << "most bytes are payload or ids, which a frame is not refused for";
    EXPECT_GT(mRefused, 0U);
}

TEST_F(CorruptFrames, EverySingleByteOfTheHandshakeIsReplaced)
{
    for (const char* const name : {"QelMessageUpgradeConnectionAsync", "QelMessageAbortHandshakeAsync"}) {
        const GoldenFrame golden = GoldenFrame::load(name);
        for (std::size_t offset = 0; offset < golden.bytes().size(); ++offset) {
            for (const char value : replacements(golden.bytes()[offset])) {
                SCOPED_TRACE(at(golden, offset));
                std::string bytes = golden.bytes();
                bytes[offset] = value;
                tryBytes(internalReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_GT(mTaken, 0U);
    EXPECT_GT(mRefused, 0U);
}

bool isLength(const std::string& field)
{
    return endsWith(field, "Len") || endsWith(field, "Length") || endsWith(field, "mOffset");
}

/// The limits themselves and both neighbours of each, as far as a field of that many bytes holds them.
std::set<std::uint64_t> bothSidesOf(const std::vector<std::uint64_t>& limits, std::size_t fieldLength)
{
    const std::uint64_t largest = (std::uint64_t{1} << 8 * fieldLength) - 1;
    std::set<std::uint64_t> values;
    for (const std::uint64_t limit : limits) {
        for (const std::uint64_t value : {limit - 1, limit, limit + 1}) {
            if (value <= largest) values.insert(value);
        }
    }
    return values;
}

/// Where a payload of this length ends for a length field: counted from each offset at which a variable part begins.
std::vector<std::uint64_t> endsOfPayload(std::uint64_t payload)
{
    std::vector<std::uint64_t> ends;
    for (const std::uint64_t begin : {0U, 2U, 4U, 6U, 16U, 32U, 42U, 46U}) {
        if (begin <= payload) ends.push_back(payload - begin);
    }
    return ends;
}

/// Values at both sides of every limit that a length field of this frame can meet, and those at which sums wrap.
std::set<std::uint64_t> boundaries(const GoldenFrame& golden, const GoldenFrame::Place& field)
{
    const std::uint64_t current = numberAt(golden.bytes(), field.offset, field.length);
    std::vector<std::uint64_t> limits = endsOfPayload(numberAt(golden.bytes(), 16, 4));
    limits.insert(limits.end(), {0, 4, 8, 16, 24, 32, 40, 42, 46, 0x80, 0x100, 0x8000, 0x10000, 0x80000000});
    limits.insert(limits.end(), {current, golden.bytes().size()});
    const std::uint64_t largest = (std::uint64_t{1} << 8 * field.length) - 1;
    for (const std::uint64_t below : {0U, 3U, 15U, 23U, 31U, 41U, 45U}) {
        limits.push_back(largest - below);
    }

    std::set<std::uint64_t> values = bothSidesOf(limits, field.length);
    values.erase(current);
    return values;
}

TEST_F(CorruptFrames, EveryLengthFieldIsReplacedWithEveryBoundary)
{
    std::set<std::string> fields;
    for (const GoldenFrame& golden : goldenFrames()) {
        for (const GoldenFrame::Place& field : golden.places()) {
            if (!isLength(field.field)) continue;
            fields.insert(field.field);
            for (const std::uint64_t value : boundaries(golden, field)) {
                SCOPED_TRACE(at(golden, field.offset) + " = " + hexNumber(value, 1));
                std::string bytes = golden.bytes();
                setNumberAt(bytes, field.offset, field.length, value);
                tryBytes(publicReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_THAT(fields, testing::UnorderedElementsAre(
                            "header.mMsgLength", "header.mDataLength", "header.mPadLength", "payload.mBroadcastMsgLen",
                            "payload.mCapabilityLen", "payload.mDataLength", "payload.mMTMSLen", "payload.mMetadataLen",
                            "payload.mOffset", "payload.mSenderToolIdLen", "payload.mSysMachineTypeLen",
                            "payload.mSysSerialNumLen", "payload.mToolIdLen", "payload.mToolIdLength"));
    EXPECT_GT(mTaken, 0U);
    EXPECT_GT(mRefused, 0U);
}

/// Payload length and pad that give the frame length only modulo 2^32.
TEST_F(CorruptFrames, LengthsThatWrapTogetherAreRefused)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::uint64_t header = headerLength(golden.bytes());
        for (const std::uint64_t msgLength : {header, header + 8, std::uint64_t{golden.bytes().size()}}) {
            // The smallest pad with which the payload length still fits its field, and larger ones.
            for (const std::uint64_t pad : {msgLength - header + 1, std::uint64_t{0x80}, std::uint64_t{0xFF}}) {
                if (pad <= msgLength - header || pad > 0xFF) continue;
                SCOPED_TRACE(golden.fileName() + " with " + std::to_string(msgLength) + " bytes and a pad of " +
                             std::to_string(pad));
                std::string bytes = golden.bytes();
                bytes.resize(std::max<std::size_t>(bytes.size(), msgLength));
                setNumberAt(bytes, 4, 4, msgLength);
                setNumberAt(bytes, 15, 1, pad);
                setNumberAt(bytes, 16, 4, (std::uint64_t{1} << 32) + msgLength - header - pad);
                tryBytes(publicReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_EQ(mRefused, mTried);
}

/// The same header with another payload, and with lengths and pad that agree with it.
std::string withPayload(const GoldenFrame& golden, const std::string& payload)
{
    std::string bytes = golden.bytes().substr(0, headerLength(golden.bytes()));
    const bool isOld = bytes.size() == 24;
    std::uint64_t pad = numberAt(bytes, 15, 1);
    if (isOld) pad = payload.size() < 16 ? 16 - payload.size() : 0;
    setNumberAt(bytes, 4, 4, bytes.size() + payload.size() + pad);
    setNumberAt(bytes, 15, 1, pad);
    setNumberAt(bytes, 16, 4, payload.size());
    return bytes + payload + std::string(pad, '\0');
}

TEST_F(CorruptFrames, EveryPayloadIsCutInAWholeFrame)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::string payload =
            golden.bytes().substr(headerLength(golden.bytes()), numberAt(golden.bytes(), 16, 4));
        for (std::size_t length = 0; length <= payload.size(); ++length) {
            SCOPED_TRACE(at(golden, length));
            tryBytes(publicReceiver(), withPayload(golden, payload.substr(0, length)));
            if (HasFailure()) return;
        }
    }
    EXPECT_EQ(mTaken, mTried) << "a frame is not refused for its payload: it comes out as a plain message";
}

TEST_F(CorruptFrames, EveryPayloadIsLongerThanNeeded)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::string payload =
            golden.bytes().substr(headerLength(golden.bytes()), numberAt(golden.bytes(), 16, 4));
        for (const std::size_t more : {1U, 2U, 17U, 300U}) {
            SCOPED_TRACE(at(golden, more));
            const std::string bytes = withPayload(golden, payload + std::string(more, '\xEE'));
            tryBytes(publicReceiver(), bytes);
            const bool isKnown = publicReceiver().classes.count({golden.function(), golden.operation(),
                                                                 golden.number<unsigned char>("header.mFlags")}) != 0;
            EXPECT_EQ(judge(publicReceiver(), bytes).className, isKnown ? golden.className() : "QelMessage");
            if (HasFailure()) return;
        }
    }
    EXPECT_EQ(mTaken, mTried);
}

/// A payload length field next to its limit while the payload itself is cut: the fields that a cut alone leaves too
/// long and a field alone leaves too short.
TEST_F(CorruptFrames, EveryCutPayloadMeetsEveryLengthNextToItsEnd)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::size_t header = headerLength(golden.bytes());
        const std::string whole = golden.bytes().substr(header, numberAt(golden.bytes(), 16, 4));
        if (whole.size() > 64) continue; // one long payload would be most of the work and has no more fields
        for (const GoldenFrame::Place& field : golden.places()) {
            if (!isLength(field.field) || field.offset < header) continue;
            for (std::size_t length = field.offset - header + field.length; length <= whole.size(); ++length) {
                std::vector<std::uint64_t> limits = endsOfPayload(length);
                limits.insert(limits.end(), {0, 16, 32, 42, 46});
                for (const std::uint64_t value : bothSidesOf(limits, field.length)) {
                    SCOPED_TRACE(at(golden, field.offset) + " = " + hexNumber(value, 1) + " in " +
                                 std::to_string(length) + " bytes");
                    std::string payload = whole.substr(0, length);
                    setNumberAt(payload, field.offset - header, field.length, value);
                    tryBytes(publicReceiver(), withPayload(golden, payload));
                    if (HasFailure()) return;
                }
            }
        }
    }
    EXPECT_EQ(mTaken, mTried);
}

TEST_F(CorruptFrames, NothingAtAllIsRefused)
{
    tryBytes(publicReceiver(), "");
    EXPECT_EQ(mRefused, 1U);

    EXPECT_THAT([] { publicReceiver().registry.deserialize(nullptr, 0); },
                testing::ThrowsMessage<QelMessageValidationException>(testing::StrEq("length")));
    EXPECT_THAT([] { publicReceiver().registry.deserialize(nullptr, 40); },
                testing::ThrowsMessage<QelMessageValidationException>(testing::StrEq("i_buffer")));
}

} // namespace
} // namespace qel::test
