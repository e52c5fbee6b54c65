#include "support/GoldenClasses.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <sstream>
#include <stdexcept>

namespace qel::test {

const std::string& text(const GoldenFrame& golden, const char* field)
{
    return golden.text(std::string("payload.") + field);
}

unsigned int callerId(const GoldenFrame& golden) { return golden.number<unsigned int>("header.mCallerId"); }

QelCapabilities capabilities(const GoldenFrame& golden)
{
    QelCapabilities result;
    for (const unsigned int index : golden.capabilities()) {
        result.set(index);
    }
    return result;
}

namespace {

std::uint16_t lpId(const GoldenFrame& golden) { return number<std::uint16_t>(golden, "mLparId"); }
std::uint16_t connection(const GoldenFrame& golden) { return number<std::uint16_t>(golden, "mVssConnectionNumber"); }

template <typename T>
using Built = std::unique_ptr<T>;

/// The two sides of one message class. `check` compares the payload of a parsed message with the golden values;
/// `build` makes the message from the golden values, responses with the golden caller id.
/// This template is for classes without payload; specialisations for the others follow.
template <typename T>
struct Sides {
    static void check(const T& message, PayloadCheck&) { EXPECT_EQ(message.getData(), nullptr); }

    static Built<T> build(const GoldenFrame& golden)
    {
        const bool isResponse = golden.classification() == QelMessageClassification::Response;
        return isResponse ? std::make_unique<T>(callerId(golden)) : std::make_unique<T>();
    }
};

template <>
struct Sides<QelMessageGetEnclTypeAndInterfaceVersionReq> {
    using T = QelMessageGetEnclTypeAndInterfaceVersionReq;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.number("mInterfaceVersion", message.getInterfaceVersion());
        payload.number("mToolType", message.getToolType());
        payload.number("mToolIdLength", message.getToolId().size());
        payload.number("mMajorVersion", message.getMajorVersion());
        payload.number("mMinorVersion", message.getMinorVersion());
        payload.text("mToolId", message.getToolId());
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(number<std::uint32_t>(golden, "mInterfaceVersion"),
                                   number<std::uint32_t>(golden, "mToolType"),
                                   number<std::uint16_t>(golden, "mMajorVersion"),
                                   number<std::uint16_t>(golden, "mMinorVersion"), text(golden, "mToolId"));
    }
};

template <>
struct Sides<QelMessageGetEnclTypeAndInterfaceVersionRsp> {
    using T = QelMessageGetEnclTypeAndInterfaceVersionRsp;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.number("mInterfaceVersionFamily", static_cast<unsigned char>(message.getInterfaceVersionFamily()));
        payload.number("mEnclosureType", message.getEnclosureType());
        payload.number("mMajorVersion", message.getMajorVersion());
        payload.number("mMinorVersion", message.getMinorVersion());
        payload.number("mSysMachineTypeLen", message.getSystemMachineType().size());
        payload.number("mSysSerialNumLen", message.getSystemSerialNum().size());
        payload.text("mSysMachineType", message.getSystemMachineType());
        payload.text("mSerialNum", message.getSystemSerialNum());
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(
            callerId(golden), static_cast<char>(number<unsigned char>(golden, "mInterfaceVersionFamily")),
            number<std::uint16_t>(golden, "mMajorVersion"), number<std::uint16_t>(golden, "mMinorVersion"),
            text(golden, "mSysMachineType"), text(golden, "mSerialNum"));
    }
};

template <typename T>
void checkCapabilities(const T& message, PayloadCheck& payload)
{
    payload.number("mCapabilityLen", message.getCapabilityLen());
    payload.bytes("mSupportedCapabilities", message.getData() + 4, message.getCapabilityLen());
}

template <>
struct Sides<QelMessageExchIntCapabilitiesReq> {
    using T = QelMessageExchIntCapabilitiesReq;

    static void check(const T& message, PayloadCheck& payload) { checkCapabilities(message, payload); }
    static Built<T> build(const GoldenFrame& golden) { return std::make_unique<T>(capabilities(golden)); }
};

template <>
struct Sides<QelMessageExchIntCapabilitiesRsp> {
    using T = QelMessageExchIntCapabilitiesRsp;

    static void check(const T& message, PayloadCheck& payload) { checkCapabilities(message, payload); }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(callerId(golden), number<std::uint32_t>(golden, "mCapabilityLen"),
                                   capabilities(golden));
    }
};

template <>
struct Sides<QelMessageDaxBroadcastReq> {
    using T = QelMessageDaxBroadcastReq;

    static void check(const T& message, PayloadCheck& payload)
    {
        const auto offset = static_cast<std::size_t>(message.getDaxPacket() - message.getData());
        payload.number("mOffset", offset);
        payload.number("mBroadcastType", message.getBroadcastMode());
        payload.number("mBroadcastMsgLen", message.getBroadcastMsgLen());
        payload.number("mToolType", message.getToolType());
        payload.number("mToolIdLen", message.getToolId().size());
        payload.text("mToolId", message.getToolId());
        if (offset != 46) payload.bytes("skipped", message.getData() + 46, offset - 46);
        payload.bytes("broadcastMessage", message.getDaxPacket(), message.getBroadcastMsgLen());
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(number<std::uint8_t>(golden, "mBroadcastType"),
                                   number<std::uint16_t>(golden, "mBroadcastMsgLen"),
                                   number<std::uint32_t>(golden, "mToolType"), text(golden, "mToolId"),
                                   text(golden, "broadcastMessage").data());
    }
};

template <>
struct Sides<QelMessageDaxBroadcastOutboundAsync> {
    using T = QelMessageDaxBroadcastOutboundAsync;

    static void check(const T& message, PayloadCheck& payload)
    {
        const auto offset = static_cast<std::size_t>(message.getDaxPacket() - message.getData());
        payload.number("mOffset", offset);
        payload.number("mBroadcastMsgLen", message.getBroadcastMsgLen());
        payload.number("mSenderToolType", message.getSenderToolType());
        payload.number("mSenderToolIdLen", message.getSenderToolId().size());
        payload.text("mSenderToolId", message.getSenderToolId());
        if (offset != 42) payload.bytes("skipped", message.getData() + 42, offset - 42);
        payload.bytes("broadcastMessage", message.getDaxPacket(), message.getBroadcastMsgLen());
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(number<std::uint16_t>(golden, "mBroadcastMsgLen"),
                                   number<std::uint32_t>(golden, "mSenderToolType"), text(golden, "mSenderToolId"),
                                   text(golden, "broadcastMessage").data());
    }
};

/// Never parsed to its class: the receiver reads the payload of a plain message.
template <>
struct Sides<QelMessageGetInterfaceLimitsRsp> {
    using T = QelMessageGetInterfaceLimitsRsp;

    static void check(const QelMessage& message, PayloadCheck& payload)
    {
        ASSERT_EQ(message.dataLength(), sizeof(T::Data));
        const auto& data = *reinterpret_cast<const T::Data*>(message.getData());
        payload.number("mMaxCommandSize", data.mMaxCommandSize.value());
        payload.number("mMaxKrogCommandSize", data.mMaxKrogCommandSize.value());
        payload.number("mBroadcastMsgPacketSize", data.mBroadcastMsgPacketSize.value());
        payload.number("mDaxsSupported", data.mDaxsSupported);
        payload.number("mNonpersistentLocksSupported", data.mNonpersistentLocksSupported.value());
        payload.number("mPersistentLocksSupported", data.mPersistentLocksSupported.value());
    }

    static Built<T> build(const GoldenFrame& golden) { return std::make_unique<T>(callerId(golden)); }
};

/// Never parsed to its class: the receiver reads the payload of a plain message.
template <>
struct Sides<QelMessageGetQelTodRsp> {
    using T = QelMessageGetQelTodRsp;

    static void check(const QelMessage& message, PayloadCheck& payload)
    {
        ASSERT_EQ(message.dataLength(), sizeof(T::Data));
        const auto& data = *reinterpret_cast<const T::Data*>(message.getData());
        payload.number("mYear", pDigits(data.mYear));
        payload.number("mMonth", pDigits(data.mMonth));
        payload.number("mDay", pDigits(data.mDay));
        payload.number("mHour", pDigits(data.mHour));
        payload.number("mMinute", pDigits(data.mMinute));
        payload.number("mSecond", pDigits(data.mSecond));
        EXPECT_EQ(data.mRsvd.value(), 0);
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        std::tm broken = {};
        broken.tm_year = pField(golden, "mYear") - 1900;
        broken.tm_mon = pField(golden, "mMonth") - 1;
        broken.tm_mday = pField(golden, "mDay");
        broken.tm_hour = pField(golden, "mHour");
        broken.tm_min = pField(golden, "mMinute");
        broken.tm_sec = pField(golden, "mSecond");
        return std::make_unique<T>(callerId(golden), ::timegm(&broken));
    }

private:
    /// The decimal digits of a field as hexadecimal digits, as the golden frame writes them: 0x2031 for 2031.
    template <typename T>
    static unsigned int pDigits(const bcd_uint<T>& field)
    {
        return static_cast<unsigned int>(std::stoul(std::to_string(field.value()), nullptr, 16));
    }

    static int pField(const GoldenFrame& golden, const char* field)
    {
        std::ostringstream digits;
        digits << std::hex << number<unsigned int>(golden, field);
        return std::stoi(digits.str());
    }
};

template <typename T>
void checkModeAttribute(const T& message, PayloadCheck& payload)
{
    payload.number("mMode", message.getMode());
    payload.number("mMTMSLen", message.getMTMSLen());
    payload.text("mMTMS", message.getMTMS());
}

template <>
struct Sides<QelMessageSetGlobalModeAttributeReq> {
    using T = QelMessageSetGlobalModeAttributeReq;

    static void check(const T& message, PayloadCheck& payload) { checkModeAttribute(message, payload); }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(number<std::uint8_t>(golden, "mMode"), text(golden, "mMTMS"));
    }
};

template <>
struct Sides<QelMessageGetGlobalModeAttributeRsp> {
    using T = QelMessageGetGlobalModeAttributeRsp;

    static void check(const T& message, PayloadCheck& payload) { checkModeAttribute(message, payload); }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(callerId(golden), number<std::uint8_t>(golden, "mMode"), text(golden, "mMTMS"));
    }
};

template <typename T>
void checkMetadata(const T& message, PayloadCheck& payload)
{
    payload.number("mMetadataLen", message.getMetadataLen());
    payload.text("mMetadata", message.getMetadata());
}

template <>
struct Sides<QelMessageSetGlobalSaveAreaMetadataReq> {
    using T = QelMessageSetGlobalSaveAreaMetadataReq;

    static void check(const T& message, PayloadCheck& payload) { checkMetadata(message, payload); }
    static Built<T> build(const GoldenFrame& golden) { return std::make_unique<T>(text(golden, "mMetadata")); }
};

template <>
struct Sides<QelMessageGetGlobalSaveAreaMetadataRsp> {
    using T = QelMessageGetGlobalSaveAreaMetadataRsp;

    static void check(const T& message, PayloadCheck& payload) { checkMetadata(message, payload); }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(callerId(golden), text(golden, "mMetadata"));
    }
};

template <>
struct Sides<QelMessageVirtualSerialOpenReq> {
    using T = QelMessageVirtualSerialOpenReq;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.address(message.getLpId(), message.getVssConnectionNumber());
        payload.number("mFlags", message.isForceOpen() ? 0x8000U : 0U);
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(lpId(golden), connection(golden), number<std::uint16_t>(golden, "mFlags") == 0x8000);
    }
};

template <>
struct Sides<QelMessageVirtualSerialOpenRsp> {
    using T = QelMessageVirtualSerialOpenRsp;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.address(message.getLpId(), message.getVssConnectionNumber());
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(callerId(golden), lpId(golden), connection(golden));
    }
};

template <>
struct Sides<QelMessageVirtualSerialCloseReq> {
    using T = QelMessageVirtualSerialCloseReq;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.address(message.getLpId(), message.getVssConnectionNumber());
        payload.number("mForceClose", message.isForceClose() ? 0xFFU : 0U);
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(lpId(golden), connection(golden),
                                   number<std::uint8_t>(golden, "mForceClose") == 0xFF);
    }
};

template <>
struct Sides<QelMessageVirtualSerialGetMaxSessionsRsp> {
    using T = QelMessageVirtualSerialGetMaxSessionsRsp;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.number("mMaxCec", message.getMaxCec());
        payload.number("mMaxLpar", message.getMaxLpar());
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(callerId(golden), number<std::uint16_t>(golden, "mMaxCec"),
                                   number<std::uint8_t>(golden, "mMaxLpar"));
    }
};

template <typename T>
struct SerialDataSides {
    static void check(const T& message, PayloadCheck& payload)
    {
        payload.address(message.getLpId(), message.getVssConnectionNumber());
        payload.number("mDataLength", message.getSerialDataLength());
        payload.bytes("serialData", message.getSerialData(), message.getSerialDataLength());
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(lpId(golden), connection(golden), number<std::uint16_t>(golden, "mDataLength"),
                                   text(golden, "serialData").data());
    }
};

template <>
struct Sides<QelMessageVirtualSerialDataToOsAsync> : SerialDataSides<QelMessageVirtualSerialDataToOsAsync> {};
template <>
struct Sides<QelMessageVirtualSerialDataToDaxAsync> : SerialDataSides<QelMessageVirtualSerialDataToDaxAsync> {};

template <>
struct Sides<QelMessageVirtualSerialSetupSessionReq> {
    using T = QelMessageVirtualSerialSetupSessionReq;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.address(message.getLpId(), message.getVssConnectionNumber());
    }

    static Built<T> build(const GoldenFrame& golden) { return std::make_unique<T>(lpId(golden), connection(golden)); }
};

template <>
struct Sides<QelMessageVirtualSerialSessionClosedAsync> {
    using T = QelMessageVirtualSerialSessionClosedAsync;

    static void check(const T& message, PayloadCheck& payload)
    {
        payload.address(message.getLpId(), message.getVssConnectionNumber());
        // An undefined reason reads as unknown; the dump has the number that was sent.
        const std::string line = "      Close reason:       ";
        const std::string dump = toString(message.debug());
        const std::size_t at = dump.find(line);
        ASSERT_NE(at, std::string::npos);
        const unsigned long stored = std::stoul(dump.substr(at + line.size()));
        payload.number("mCloseReason", stored);
        const bool isListed = stored >= T::CloseReasonMin && stored <= T::CloseReasonMax;
        EXPECT_EQ(message.getCloseReason(), isListed ? static_cast<T::CloseReason>(stored) : T::CloseReasonUnknown);
    }

    static Built<T> build(const GoldenFrame& golden)
    {
        return std::make_unique<T>(lpId(golden), connection(golden),
                                   static_cast<T::CloseReason>(number<std::uint32_t>(golden, "mCloseReason")));
    }
};

template <typename T>
void checkAs(const QelMessage& message, PayloadCheck& payload)
{
    Sides<T>::check(qelMessageCast<T>(message), payload);
}

template <typename T>
void checkPlain(const QelMessage& message, PayloadCheck& payload)
{
    Sides<T>::check(message, payload);
}

template <typename T>
std::unique_ptr<QelMessage> buildAs(const GoldenFrame& golden)
{
    return Sides<T>::build(golden);
}

template <typename T>
QelCapabilities capabilitiesOf(const QelMessage& message)
{
    return qelMessageCast<T>(message).getCapabilities();
}

template <typename T>
MessageClass parsed(const char* name, Home home = Home::Public)
{
    return {name, T::getMessageID(), home, &typeid(T), &checkAs<T>, &buildAs<T>, nullptr};
}

template <typename T>
MessageClass withCapabilities(const char* name)
{
    MessageClass result = parsed<T>(name);
    result.capabilities = &capabilitiesOf<T>;
    return result;
}

template <typename T>
MessageClass neverParsed(const char* name)
{
    return {name, T::getMessageID(), Home::None, &typeid(QelMessage), &checkPlain<T>, &buildAs<T>, nullptr};
}

} // namespace

const std::vector<MessageClass>& messageClasses()
{
    static const std::vector<MessageClass> kClasses = {
        parsed<QelMessageUpgradeConnectionAsync>("QelMessageUpgradeConnectionAsync", Home::Internal),
        parsed<QelMessageAbortHandshakeAsync>("QelMessageAbortHandshakeAsync", Home::Internal),
        parsed<QelMessageGetEnclTypeAndInterfaceVersionReq>("QelMessageGetEnclTypeAndInterfaceVersionReq"),
        parsed<QelMessageGetEnclTypeAndInterfaceVersionRsp>("QelMessageGetEnclTypeAndInterfaceVersionRsp"),
        parsed<QelMessageInterfaceCmpOpenKrogSessionReq>("QelMessageInterfaceCmpOpenKrogSessionReq"),
        parsed<QelMessageInterfaceCmpOpenKrogSessionRsp>("QelMessageInterfaceCmpOpenKrogSessionRsp"),
        parsed<QelMessageInterfaceCmpCloseKrogSessionReq>("QelMessageInterfaceCmpCloseKrogSessionReq"),
        parsed<QelMessageInterfaceCmpCloseKrogSessionRsp>("QelMessageInterfaceCmpCloseKrogSessionRsp"),
        withCapabilities<QelMessageExchIntCapabilitiesReq>("QelMessageExchIntCapabilitiesReq"),
        withCapabilities<QelMessageExchIntCapabilitiesRsp>("QelMessageExchIntCapabilitiesRsp"),
        parsed<QelMessageGetInterfaceLimitsReq>("QelMessageGetInterfaceLimitsReq"),
        neverParsed<QelMessageGetInterfaceLimitsRsp>("QelMessageGetInterfaceLimitsRsp"),
        parsed<QelMessageDaxBroadcastReq>("QelMessageDaxBroadcastReq"),
        parsed<QelMessageDaxBroadcastRsp>("QelMessageDaxBroadcastRsp"),
        parsed<QelMessageGetQelTodReq>("QelMessageGetQelTodReq"),
        neverParsed<QelMessageGetQelTodRsp>("QelMessageGetQelTodRsp"),
        parsed<QelMessageSetGlobalModeAttributeReq>("QelMessageSetGlobalModeAttributeReq"),
        parsed<QelMessageGetGlobalModeAttributeReq>("QelMessageGetGlobalModeAttributeReq"),
        parsed<QelMessageGetGlobalModeAttributeRsp>("QelMessageGetGlobalModeAttributeRsp"),
        parsed<QelMessageSetGlobalSaveAreaMetadataReq>("QelMessageSetGlobalSaveAreaMetadataReq"),
        parsed<QelMessageSetGlobalSaveAreaMetadataRsp>("QelMessageSetGlobalSaveAreaMetadataRsp"),
        parsed<QelMessageGetGlobalSaveAreaMetadataReq>("QelMessageGetGlobalSaveAreaMetadataReq"),
        parsed<QelMessageGetGlobalSaveAreaMetadataRsp>("QelMessageGetGlobalSaveAreaMetadataRsp"),
        parsed<QelMessageVirtualSerialOpenReq>("QelMessageVirtualSerialOpenReq"),
        parsed<QelMessageVirtualSerialOpenRsp>("QelMessageVirtualSerialOpenRsp"),
        parsed<QelMessageVirtualSerialCloseReq>("QelMessageVirtualSerialCloseReq"),
        parsed<QelMessageVirtualSerialCloseRsp>("QelMessageVirtualSerialCloseRsp"),
        parsed<QelMessageVirtualSerialGetMaxSessionsReq>("QelMessageVirtualSerialGetMaxSessionsReq"),
        parsed<QelMessageVirtualSerialGetMaxSessionsRsp>("QelMessageVirtualSerialGetMaxSessionsRsp"),
        parsed<QelMessageVirtualSerialDataToOsAsync>("QelMessageVirtualSerialDataToOsAsync"),
        parsed<QelMessageVirtualSerialSetupSessionReq>("QelMessageVirtualSerialSetupSessionReq"),
        parsed<QelMessageVirtualSerialSetupSessionRsp>("QelMessageVirtualSerialSetupSessionRsp"),
        parsed<QelMessageVirtualSerialDataToDaxAsync>("QelMessageVirtualSerialDataToDaxAsync"),
        parsed<QelMessageVirtualSerialSessionClosedAsync>("QelMessageVirtualSerialSessionClosedAsync"),
        parsed<QelMessageKrogConnectionClosedAsync>("QelMessageKrogConnectionClosedAsync"),
        parsed<QelMessageDaxBroadcastOutboundAsync>("QelMessageDaxBroadcastOutboundAsync"),
    };
    return kClasses;
}

const MessageClass& classOf(const GoldenFrame& golden)
{
    for (const MessageClass& candidate : messageClasses()) {
        if (candidate.name == golden.className()) return candidate;
    }
    throw std::runtime_error("no such class: " + golden.className());
}

} // namespace qel::test
