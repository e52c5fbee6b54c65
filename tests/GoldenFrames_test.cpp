#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/GoldenFrame.hpp"
#include "support/MessageProbe.hpp"

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iterator>
#include <memory>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <tuple>
#include <typeinfo>
#include <utility>
#include <vector>

namespace qel::test {
namespace {

using testing::HasSubstr;
using testing::StrEq;
using testing::ThrowsMessage;
using testing::UnorderedElementsAreArray;

// -------------------------------------------------------------------- how each class is held against its golden frame

/// Compares the values that a message reads back with those of its golden frame, and fails for each value of the frame
/// that nobody asked about.
class PayloadCheck {
public:
    explicit PayloadCheck(const GoldenFrame& golden) : mGolden(golden)
    {
        const std::vector<std::string> keys = golden.payloadKeys();
        mUnread.insert(keys.begin(), keys.end());
    }
    PayloadCheck(const PayloadCheck&) = delete;
    PayloadCheck& operator=(const PayloadCheck&) = delete;
    ~PayloadCheck()
    {
        for (const std::string& key : mUnread) {
            ADD_FAILURE() << "no accessor was compared with " << key;
        }
    }

    template <typename T>
    void number(const char* field, T actual)
    {
        EXPECT_EQ(actual, mGolden.number<T>(pRead(field))) << field;
    }

    void text(const char* field, const std::string& actual)
    {
        EXPECT_EQ(hex(actual), hex(mGolden.text(pRead(field)))) << field;
    }

    void bytes(const char* field, const char* actual, std::size_t length) { text(field, std::string(actual, length)); }

    void address(std::uint16_t lpId, std::uint16_t connection)
    {
        number("mLparId", lpId);
        number("mVssConnectionNumber", connection);
    }

private:
    std::string pRead(const char* field)
    {
        const std::string key = std::string("payload.") + field;
        mUnread.erase(key);
        return key;
    }

    const GoldenFrame& mGolden;
    std::set<std::string> mUnread;
};

/// The value of a field, for the arguments of a builder.
template <typename T>
T number(const GoldenFrame& golden, const char* field)
{
    return golden.number<T>(std::string("payload.") + field);
}

const std::string& text(const GoldenFrame& golden, const char* field)
{
    return golden.text(std::string("payload.") + field);
}

unsigned int callerId(const GoldenFrame& golden) { return golden.number<unsigned int>("header.mCallerId"); }

std::uint16_t lpId(const GoldenFrame& golden) { return number<std::uint16_t>(golden, "mLparId"); }
std::uint16_t connection(const GoldenFrame& golden) { return number<std::uint16_t>(golden, "mVssConnectionNumber"); }

QelCapabilities capabilities(const GoldenFrame& golden)
{
    QelCapabilities result;
    for (const unsigned int index : golden.capabilities()) {
        result.set(index);
    }
    return result;
}

template <typename T>
using Built = std::unique_ptr<T>;

/// The two sides of one message class. `check` compares the payload of a parsed message with the golden values;
/// `build` makes the message from the golden values, responses with the golden caller id.
/// This is the one for classes without payload; those with one follow.
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

/// Never parsed by its class: the receiver reads the payload of a plain message.
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

/// Never parsed by its class: the receiver reads the payload of a plain message.
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
    /// The decimal reading of a field, digit by digit as hexadecimal: 2031 gives 0x2031. That is how the golden frame
    /// writes it.
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
        // A reason from outside the list reads as unknown; the number that was sent is in the dump.
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

// ------------------------------------------------------------------------------------------------ the list of classes

/// Which parser gives the class.
enum class Home { Public, Internal, None };

struct MessageClass {
    std::string name;
    std::tuple<unsigned short, unsigned short, QelMessageClassification::Value> identity;
    Home home;
    const std::type_info* parsedAs;
    void (*check)(const QelMessage&, PayloadCheck&);
    std::unique_ptr<QelMessage> (*build)(const GoldenFrame&);
    QelCapabilities (*capabilities)(const QelMessage&); // null for classes without
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

std::unique_ptr<QelMessage> parse(const QelMessageRegistry& registry, const GoldenFrame& golden)
{
    const auto copy = heapCopy(golden.bytes());
    return registry.deserialize(copy.get(), static_cast<unsigned int>(golden.bytes().size()));
}

// ------------------------------------------------------------------------------------------------------ the two ways

class GoldenFrames : public testing::TestWithParam<std::string> {
protected:
    const GoldenFrame mGolden = GoldenFrame::load(GetParam());
    const MessageClass& mClass = classOf(mGolden);
};

INSTANTIATE_TEST_SUITE_P(Vectors, GoldenFrames, testing::ValuesIn(GoldenFrame::allNames()), [](const auto& test) {
    std::string name = test.param;
    for (char& c : name) {
        if (c == '-') c = '_';
    }
    return name;
});

TEST_P(GoldenFrames, ParseToTheirClassAndValues)
{
    const QelMessageRegistry publicRegistry;
    const bool isInternal = mClass.home == Home::Internal;
    const QelMessageRegistry& registry = isInternal ? QelInternalMessageRegistry::getInstance() : publicRegistry;
    const std::unique_ptr<QelMessage> message = parse(registry, mGolden);

    const QelMessage& received = *message;
    EXPECT_STREQ(typeid(received).name(), mClass.parsedAs->name());

    EXPECT_EQ(message->getFunction(), mGolden.function());
    EXPECT_EQ(message->getOperation(), mGolden.operation());
    EXPECT_EQ(message->getClassification(), mGolden.classification());
    EXPECT_EQ(message->getFlags(), mGolden.number<unsigned char>("header.mFlags"));
    EXPECT_EQ(message->getCallerId(), callerId(mGolden));
    EXPECT_EQ(message->msgLength(), mGolden.number<unsigned int>("header.mMsgLength"));
    EXPECT_EQ(message->dataLength(), mGolden.number<unsigned int>("header.mDataLength"));
    EXPECT_EQ(message->getStatus(), mGolden.number<unsigned short>("header.mStatus"));
    const bool isNewForm = mGolden.number<unsigned char>("header.mHeaderVersion") == 0x20;
    EXPECT_EQ(mGolden.has("header.mStatusDetail"), isNewForm);
    EXPECT_EQ(message->getStatusDetail(), isNewForm ? mGolden.number<unsigned short>("header.mStatusDetail") : 0);
    EXPECT_EQ(MessageProbe(*message).pGetHeader()->mPadLength, mGolden.number<unsigned char>("header.mPadLength"));

    {
        PayloadCheck payload(mGolden);
        mClass.check(*message, payload);
    }
    if (mClass.capabilities != nullptr) {
        EXPECT_EQ(mClass.capabilities(*message).to_string(), capabilities(mGolden).to_string());
    }
    EXPECT_EQ(frameOf(*message), hex(mGolden.bytes()));
}

/// Gives a freshly built message the status and the header form of the golden frame; builders make neither.
QelMessageGeneric inTheFormOf(const GoldenFrame& golden, const QelMessage& built)
{
    MessageProbe probe(built);
    if (golden.number<unsigned char>("header.mHeaderVersion") == 0x00) {
        const std::string payload(built.getData() == nullptr ? "" : built.getData(), built.dataLength());
        probe.pGetHeader()->mHeaderVersion = QelMessage::CommonHeader::MessageVersion24;
        probe.pSetData(payload.data(), static_cast<unsigned int>(payload.size()));
    }
    QelMessageGeneric result(probe);
    const auto status = static_cast<QelMessageStatusCodes>(golden.number<unsigned short>("header.mStatus"));
    if (status != QelMessageStatusNoError) {
        const bool hasDetail = golden.has("header.mStatusDetail");
        result.setStatus(status, hasDetail ? golden.number<unsigned short>("header.mStatusDetail") : 0);
    }
    return result;
}

TEST_P(GoldenFrames, AreBuiltFromTheirValues)
{
    // The next message that takes a new caller id gets the golden one.
    const CallerIdScope nextId(callerId(mGolden) - 1);
    const std::unique_ptr<QelMessage> built = mClass.build(mGolden);
    const QelMessageGeneric message = inTheFormOf(mGolden, *built);

    if (mGolden.isBuilt()) {
        EXPECT_EQ(frameOf(message), hex(mGolden.bytes()));
    } else {
        EXPECT_NE(frameOf(message), hex(mGolden.bytes())) << "the file says that this frame is never built";
    }
}

// ---------------------------------------------------------------------------------------------------------- stories

TEST(GoldenFrameStory, EveryIdentityIsThatOfItsClass)
{
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame golden = GoldenFrame::load(name);
        EXPECT_EQ(classOf(golden).identity,
                  std::make_tuple(golden.function(), golden.operation(), golden.classification()))
            << name;
    }
}

TEST(GoldenFrameStory, EveryFrameArrivesAsAPlainMessageWhereItsClassIsNotKnown)
{
    const QelMessageRegistry publicRegistry;
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame golden = GoldenFrame::load(name);
        const bool isInternal = classOf(golden).home == Home::Internal;
        const QelMessageRegistry& other = isInternal ? publicRegistry : QelInternalMessageRegistry::getInstance();
        const std::unique_ptr<QelMessage> message = parse(other, golden);

        const QelMessage& received = *message;
        EXPECT_STREQ(typeid(received).name(), typeid(QelMessage).name()) << name;
        EXPECT_EQ(frameOf(received), hex(golden.bytes())) << name;
    }
}

TEST(GoldenFrameStory, ABroadcastIsPassedOnWithTheIdentityOfItsSender)
{
    const GoldenFrame request = GoldenFrame::load("QelMessageDaxBroadcastReq");
    const GoldenFrame outbound = GoldenFrame::load("QelMessageDaxBroadcastOutboundAsync");
    const std::unique_ptr<QelMessage> received = parse(QelMessageRegistry(), request);

    const CallerIdScope nextId(callerId(outbound) - 1);
    const QelMessageDaxBroadcastOutboundAsync message(qelMessageCast<QelMessageDaxBroadcastReq>(*received),
                                                      text(outbound, "mSenderToolId"),
                                                      number<std::uint32_t>(outbound, "mSenderToolType"));

    EXPECT_EQ(frameOf(message), hex(outbound.bytes()));
}

TEST(GoldenFrameStory, AStatusIsReportedOnlyWhenAsked)
{
    const std::unique_ptr<QelMessage> message =
        parse(QelMessageRegistry(), GoldenFrame::load("QelMessageVirtualSerialOpenRsp-status"));

    EXPECT_THAT([&] { message->checkStatus(); },
                ThrowsMessage<QelMessageStatusException>(
                    StrEq("QEL message [CID: 0x1B2C3D4E, FN: 0x6002, OP: 0x0402, FL: 0x40, DL: 8, "
                          "ST: 0x00000013:1234] contains a bad status code")));
}

TEST(GoldenFrameStory, AnOldHeaderShowsNoStatusDetail)
{
    const std::unique_ptr<QelMessage> message =
        parse(QelMessageRegistry(), GoldenFrame::load("QelMessageVirtualSerialGetMaxSessionsRsp-old-header"));

    EXPECT_EQ(toString(message->getLogID()), "[CID: 0x5E6F8091, FN: 0x6002, OP: 0x0404, FL: 0x40, DL: 3, "
                                             "ST: 0x00008006]");
}

// --------------------------------------------------------------------------------------------- the set of the files

TEST(GoldenFrameFiles, EveryMessageClassHasOneOfItsOwnName)
{
    std::vector<std::string> plainCases;
    for (const std::string& name : GoldenFrame::allNames()) {
        if (name.find('-') == std::string::npos) plainCases.push_back(name);
    }
    std::vector<std::string> classes;
    for (const MessageClass& known : messageClasses()) {
        classes.push_back(known.name);
    }

    EXPECT_EQ(classes.size(), 36U);
    EXPECT_THAT(plainCases, UnorderedElementsAreArray(classes));
}

TEST(GoldenFrameFiles, AreThoseOfTheListAndNoOthers)
{
    std::vector<std::string> files;
    for (const auto& entry : std::filesystem::directory_iterator(QEL_SOURCE_DIR "/vectors")) {
        if (entry.path().filename() != "README.md") files.push_back(entry.path().filename().string());
    }
    std::vector<std::string> expected;
    for (const std::string& name : GoldenFrame::allNames()) {
        expected.push_back(name + ".txt");
    }

    EXPECT_THAT(files, UnorderedElementsAreArray(expected));
}

TEST(GoldenFrameFiles, HaveACallerIdEach)
{
    std::set<unsigned int> ids;
    for (const std::string& name : GoldenFrame::allNames()) {
        EXPECT_TRUE(ids.insert(callerId(GoldenFrame::load(name))).second) << name;
    }
}

TEST(GoldenFrameFiles, HaveANameInWordsEach)
{
    std::set<std::string> names;
    for (const std::string& name : GoldenFrame::allNames()) {
        EXPECT_TRUE(names.insert(GoldenFrame::load(name).name()).second) << name;
    }
}

// ------------------------------------------------------------------------------------------ the wire format document

std::string wireFormatDocument()
{
    std::ifstream in(QEL_SOURCE_DIR "/docs/wire-format.md", std::ios::binary);
    if (!in) throw std::runtime_error("docs/wire-format.md cannot be read");
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

std::size_t countOf(const std::string& what, const std::string& where)
{
    std::size_t count = 0;
    for (std::size_t at = where.find(what); at != std::string::npos; at = where.find(what, at + what.size())) {
        ++count;
    }
    return count;
}

TEST(WireFormatDocument, ShowsEveryGoldenFrameInTheSectionOfItsClass)
{
    const std::string document = wireFormatDocument();
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame golden = GoldenFrame::load(name);
        const std::size_t begin = document.find("\n#### " + golden.className() + "\n");
        if (begin == std::string::npos) {
            ADD_FAILURE() << "no section for " << golden.className();
            continue;
        }
        const std::size_t nextSection = document.find("\n#", begin + 1);
        const std::string section = document.substr(begin, nextSection - begin);
        EXPECT_THAT(section, HasSubstr("```text\n" + golden.frameText() + "```\n")) << name;
    }
}

TEST(WireFormatDocument, HasNoFramesAndSectionsBesides)
{
    const std::string document = wireFormatDocument();
    EXPECT_EQ(countOf("```text\n", document), GoldenFrame::allNames().size());
    EXPECT_EQ(countOf("  # mDesc", document), GoldenFrame::allNames().size());
    EXPECT_EQ(countOf("\n#### ", document), messageClasses().size());
}

/// The lines of the document that sscanf takes whole.
template <typename Take>
unsigned int forEachLine(Take take)
{
    unsigned int taken = 0;
    std::istringstream in(wireFormatDocument());
    for (std::string line; std::getline(in, line);) {
        if (take(line.c_str())) ++taken;
    }
    return taken;
}

TEST(WireFormatDocument, NamesTheFunctionsAsTheyPrint)
{
    const unsigned int count = forEachLine([](const char* line) {
        unsigned int function = 0;
        char name[64];
        if (std::sscanf(line, "| 0x%4x | `%63[A-Za-z0-9]` |", &function, name) != 2) return false;
        if (std::string(name).find("QelMessageFunction") != 0) return false;
        EXPECT_THAT(toString(static_cast<QelMessageFunctionCodes>(function)), HasSubstr(std::string("(") + name + ")"));
        return true;
    });
    EXPECT_EQ(count, 16U);
}

TEST(WireFormatDocument, NamesTheOperationsAsTheyPrint)
{
    const unsigned int count = forEachLine([](const char* line) {
        unsigned int function = 0;
        unsigned int operation = 0;
        char name[64];
        if (std::sscanf(line, "| 0x%4x | 0x%4x | `%63[A-Za-z0-9]` |", &function, &operation, name) != 3) return false;
        const auto pair =
            std::make_pair(static_cast<QelMessageFunctionCodes>(function), static_cast<QelMessageOpTypes>(operation));
        EXPECT_THAT(toString(pair), HasSubstr(std::string("(") + name + ")"));
        return true;
    });
    EXPECT_EQ(count, 42U);
}

TEST(WireFormatDocument, NamesTheStatusCodesAsTheyPrint)
{
    const unsigned int count = forEachLine([](const char* line) {
        unsigned int decimal = 0;
        unsigned int hexadecimal = 0;
        char name[64];
        if (std::sscanf(line, "| %5u (0x%4x) | `%63[A-Za-z0-9]` |", &decimal, &hexadecimal, name) != 3) return false;
        EXPECT_EQ(decimal, hexadecimal) << line;
        EXPECT_THAT(toString(static_cast<QelMessageStatusCodes>(decimal)), HasSubstr(std::string("(") + name + ")"));
        return true;
    });
    EXPECT_EQ(count, 18U);
}

} // namespace
} // namespace qel::test
