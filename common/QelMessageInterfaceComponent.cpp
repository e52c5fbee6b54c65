#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "WireChecks.hpp"

#include <algorithm>
#include <cstring>
#include <ostream>
#include <stdexcept>

namespace qel {

namespace {

constexpr const char* kPayloadTooShort = "dataLength smaller than minimum acceptable size";

void copyText(char* field, const std::string& text) { std::copy(text.begin(), text.end(), field); }

// The checked...Length() functions check the arguments of a builder and return its payload length. They are evaluated
// as constructor arguments, so that arguments that are refused allocate no frame and draw no caller id. The other
// checks come later: a frame length above 32 bits is refused after the caller id is drawn, a time that the payload
// cannot hold also after the frame is allocated.

std::uint64_t checkedVersionRequestLength(const std::string& toolId)
{
    using Data = QelMessageGetEnclTypeAndInterfaceVersionReq::Data;
    require(wireLength(toolId) <= sizeof(Data::mToolId), "Tool ID is too long");
    return sizeof(Data);
}

std::uint64_t checkedVersionResponseLength(const std::string& machineType, const std::string& serialNum)
{
    using Data = QelMessageGetEnclTypeAndInterfaceVersionRsp::Data;
    require(serialNum.size() <= sizeof(Data::mSerialNum), "System serial size is too large");
    require(machineType.size() <= sizeof(Data::mSysMachineType), "System machine type is too large");
    return sizeof(Data);
}

std::uint64_t checkedBroadcastLength(std::uint8_t broadcastType, std::uint16_t broadcastMsgLen,
                                     const std::string& toolId, const char* broadcastMsg)
{
    using Data = QelMessageDaxBroadcastReq::Data;
    require(broadcastType != QelMessageDaxBroadcastReq::kUnicast || !toolId.empty(),
            "Unicast message has no valid toolID");
    require(toolId.size() <= sizeof(Data::mToolId), "toolIdLen greater than maximum acceptable size");
    if (broadcastMsg == nullptr && broadcastMsgLen != 0) throw std::invalid_argument("data");
    return std::uint64_t{sizeof(Data)} + broadcastMsgLen;
}

void requireCapabilityLength(std::uint32_t capabilityLen)
{
    require(capabilityLen % 4 == 0, "Given capability length is invalid (length % 4 wasn't 0)");
}

std::uint64_t checkedCapabilityMessageLength(std::size_t fixedLength, std::uint32_t capabilityLen)
{
    requireCapabilityLength(capabilityLen);
    return std::uint64_t{fixedLength} + capabilityLen;
}

// The number of capability bytes of a message that hold bits of a QelCapabilities.
std::size_t knownCapabilityBytes(std::uint32_t capabilityLen)
{
    return std::min<std::size_t>(QelCapabilities::size() / 8, capabilityLen);
}

// The bit of capability 8 * i + j within byte i.
constexpr unsigned int capabilityMask(std::size_t j) { return 0x80U >> j; }

} // namespace

// --- interface version -----------------------------------------------------------------------------------------------

QelMessageGetEnclTypeAndInterfaceVersionReq::QelMessageGetEnclTypeAndInterfaceVersionReq(std::uint32_t interfaceVersion,
                                                                                         std::uint32_t toolType,
                                                                                         std::uint16_t majorVersion,
                                                                                         std::uint16_t minorVersion,
                                                                                         const std::string& toolId)
    : QelMessageMetadata(PayloadLength(checkedVersionRequestLength(toolId)))
{
    Data& data = pPayload<Data>();
    data.mInterfaceVersion = interfaceVersion;
    data.mToolType = toolType;
    data.mToolIdLength = wireLength(toolId);
    data.mMajorVersion = majorVersion;
    data.mMinorVersion = minorVersion;
    std::memcpy(data.mToolId, toolId.data(), wireLength(toolId));
}

QelMessageGetEnclTypeAndInterfaceVersionReq::QelMessageGetEnclTypeAndInterfaceVersionReq(const char* i_buffer,
                                                                                         unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    constexpr unsigned int kFixedLength = offsetof(Data, mToolId);
    require(dataLength() >= kFixedLength, kPayloadTooShort);
    require(pGetToolIdLen() <= sizeof(Data::mToolId) && pGetToolIdLen() <= dataLength() - kFixedLength,
            "Tool ID length is invalid");
}

QelMessageGetEnclTypeAndInterfaceVersionReq::~QelMessageGetEnclTypeAndInterfaceVersionReq() = default;

void QelMessageGetEnclTypeAndInterfaceVersionReq::pDerivedDebug(std::ostream& os) const
{
    os << "  Interface version:      " << hexFormat(getInterfaceVersion()) << "\n";
    os << "  Tool type:              " << hexFormat(getToolType()) << "\n";
    os << "  Major version:          " << hexFormat(getMajorVersion()) << "\n";
    os << "  Minor version:          " << hexFormat(getMinorVersion()) << "\n";
    os << "  Tool ID:                " << getToolId() << "\n";
}

QelMessageGetEnclTypeAndInterfaceVersionRsp::QelMessageGetEnclTypeAndInterfaceVersionRsp(
    std::uint32_t callerId, char interfaceVersionFamily, std::uint16_t majorVersion, std::uint16_t minorVersion,
    const std::string& machineType, const std::string& serialNum)
    : QelMessageMetadata(callerId, PayloadLength(checkedVersionResponseLength(machineType, serialNum)))
{
    Data& data = pPayload<Data>();
    data.mInterfaceVersionFamily = interfaceVersionFamily;
    data.mEnclosureType = kEnclosureType;
    data.mMajorVersion = majorVersion;
    data.mMinorVersion = minorVersion;
    data.mSysMachineTypeLen = wireLength(machineType);
    data.mSysSerialNumLen = wireLength(serialNum);
    copyText(data.mSysMachineType, machineType);
    copyText(data.mSerialNum, serialNum);
}

QelMessageGetEnclTypeAndInterfaceVersionRsp::QelMessageGetEnclTypeAndInterfaceVersionRsp(const char* i_buffer,
                                                                                         unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    constexpr unsigned int kFixedLength = offsetof(Data, mSerialNum);
    require(dataLength() >= kFixedLength, kPayloadTooShort);
    require(pGetSystemMachineTypeLen() <= sizeof(Data::mSysMachineType), "Invalid machine type length");
    require(pGetSystemSerialNumLen() <= sizeof(Data::mSerialNum), "Invalid system serial length");
    require(pGetSystemSerialNumLen() <= dataLength() - kFixedLength,
            "dataLength not long enough to encapsulate final string field");
}

QelMessageGetEnclTypeAndInterfaceVersionRsp::~QelMessageGetEnclTypeAndInterfaceVersionRsp() = default;

void QelMessageGetEnclTypeAndInterfaceVersionRsp::pDerivedDebug(std::ostream& os) const
{
    os << "  IF version family:      " << hexFormat(getInterfaceVersionFamily()) << "\n";
    os << "  Enclosure type:         " << hexFormat(getEnclosureType()) << "\n";
    os << "  Major version:          " << hexFormat(getMajorVersion()) << "\n";
    os << "  Minor version:          " << hexFormat(getMinorVersion()) << "\n";
    os << "  System serial number:   " << getSystemSerialNum() << "\n";
    os << "  System machine type:    " << getSystemMachineType() << "\n";
}

// --- session ---------------------------------------------------------------------------------------------------------

QelMessageInterfaceCmpOpenKrogSessionReq::~QelMessageInterfaceCmpOpenKrogSessionReq() = default;
QelMessageInterfaceCmpOpenKrogSessionRsp::~QelMessageInterfaceCmpOpenKrogSessionRsp() = default;
QelMessageInterfaceCmpCloseKrogSessionReq::~QelMessageInterfaceCmpCloseKrogSessionReq() = default;
QelMessageInterfaceCmpCloseKrogSessionRsp::~QelMessageInterfaceCmpCloseKrogSessionRsp() = default;

// --- capabilities ----------------------------------------------------------------------------------------------------

template <typename Derived, QelMessageClassification::Value Classification>
QelMessageExchIntCapabilitiesBase<Derived, Classification>::QelMessageExchIntCapabilitiesBase(
    std::uint32_t capabilityLen, const QelCapabilities& capabilities)
    : Metadata(QelMessage::PayloadLength(checkedCapabilityMessageLength(sizeof(Data), capabilityLen)))
{
    pStore(capabilityLen, capabilities);
}

template <typename Derived, QelMessageClassification::Value Classification>
QelMessageExchIntCapabilitiesBase<Derived, Classification>::QelMessageExchIntCapabilitiesBase(
    std::uint32_t callerId, std::uint32_t capabilityLen, const QelCapabilities& capabilities)
    : Metadata(callerId, QelMessage::PayloadLength(checkedCapabilityMessageLength(sizeof(Data), capabilityLen)))
{
    pStore(capabilityLen, capabilities);
}

template <typename Derived, QelMessageClassification::Value Classification>
QelMessageExchIntCapabilitiesBase<Derived, Classification>::QelMessageExchIntCapabilitiesBase(const char* i_buffer,
                                                                                              unsigned int i_length)
    : Metadata(i_buffer, i_length)
{
    require(this->dataLength() >= sizeof(Data), kPayloadTooShort);
    requireCapabilityLength(getCapabilityLen());
    require(getCapabilityLen() <= this->dataLength() - sizeof(Data), "capabilityLen larger than acceptable");
}

template <typename Derived, QelMessageClassification::Value Classification>
QelMessageExchIntCapabilitiesBase<Derived, Classification>::~QelMessageExchIntCapabilitiesBase() = default;

template <typename Derived, QelMessageClassification::Value Classification>
void QelMessageExchIntCapabilitiesBase<Derived, Classification>::pStore(std::uint32_t capabilityLen,
                                                                        const QelCapabilities& capabilities)
{
    this->template pPayload<Data>().mCapabilityLen = capabilityLen;
    char* const bytes = this->pGetData() + sizeof(Data);
    for (std::size_t i = 0; i < knownCapabilityBytes(capabilityLen); ++i) {
        unsigned int bits = 0;
        for (std::size_t j = 0; j < 8; ++j) {
            if (capabilities[8 * i + j]) bits |= capabilityMask(j);
        }
        bytes[i] = static_cast<char>(bits);
    }
}

template <typename Derived, QelMessageClassification::Value Classification>
QelCapabilities QelMessageExchIntCapabilitiesBase<Derived, Classification>::getCapabilities() const
{
    QelCapabilities capabilities;
    const char* const bytes = this->getData() + sizeof(Data);
    for (std::size_t i = 0; i < knownCapabilityBytes(getCapabilityLen()); ++i) {
        const unsigned int bits = static_cast<unsigned char>(bytes[i]);
        for (std::size_t j = 0; j < 8; ++j) {
            if ((bits & capabilityMask(j)) != 0) capabilities.set(8 * i + j);
        }
    }
    return capabilities;
}

template <typename Derived, QelMessageClassification::Value Classification>
void QelMessageExchIntCapabilitiesBase<Derived, Classification>::pDerivedDebug(std::ostream& os) const
{
    os << "  mCapabilityLen:         " << decFormat(getCapabilityLen()) << "\n";
    os << "  mSupportedCapabilities: " << getCapabilities() << "\n";
}

QelMessageExchIntCapabilitiesReq::QelMessageExchIntCapabilitiesReq(const QelCapabilities& capabilities)
    : QelMessageExchIntCapabilitiesBase(QelCapabilities::size() / 8, capabilities)
{}

QelMessageExchIntCapabilitiesReq::QelMessageExchIntCapabilitiesReq(const char* i_buffer, unsigned int i_length)
    : QelMessageExchIntCapabilitiesBase(i_buffer, i_length)
{}

QelMessageExchIntCapabilitiesReq::~QelMessageExchIntCapabilitiesReq() = default;

QelMessageExchIntCapabilitiesRsp::QelMessageExchIntCapabilitiesRsp(std::uint32_t capabilityLen,
                                                                   const QelCapabilities& capabilities)
    : QelMessageExchIntCapabilitiesBase(capabilityLen, capabilities)
{}

QelMessageExchIntCapabilitiesRsp::QelMessageExchIntCapabilitiesRsp(std::uint32_t callerId, std::uint32_t capabilityLen,
                                                                   const QelCapabilities& capabilities)
    : QelMessageExchIntCapabilitiesBase(callerId, capabilityLen, capabilities)
{}

QelMessageExchIntCapabilitiesRsp::QelMessageExchIntCapabilitiesRsp(const char* i_buffer, unsigned int i_length)
    : QelMessageExchIntCapabilitiesBase(i_buffer, i_length)
{}

QelMessageExchIntCapabilitiesRsp::~QelMessageExchIntCapabilitiesRsp() = default;

template class QelMessageExchIntCapabilitiesBase<QelMessageExchIntCapabilitiesReq, QelMessageClassification::Request>;
template class QelMessageExchIntCapabilitiesBase<QelMessageExchIntCapabilitiesRsp, QelMessageClassification::Response>;

// --- limits ----------------------------------------------------------------------------------------------------------

QelMessageGetInterfaceLimitsReq::~QelMessageGetInterfaceLimitsReq() = default;

QelMessageGetInterfaceLimitsRsp::QelMessageGetInterfaceLimitsRsp()
    : QelMessageGetInterfaceLimitsRsp(generateNextUint32())
{}

QelMessageGetInterfaceLimitsRsp::QelMessageGetInterfaceLimitsRsp(std::uint32_t callerId)
    : QelMessageMetadata(callerId, PayloadLength(sizeof(Data)))
{
    // The longest frame minus the header and the fixed part of the broadcast that carries the message.
    constexpr std::uint16_t kBroadcastMsgPacketSize = MtuMax - MaxHeaderSize - sizeof(QelMessageDaxBroadcastReq::Data);
    static_assert(kBroadcastMsgPacketSize == 16306, "the protocol fixes this number");

    Data& data = pPayload<Data>();
    data.mMaxCommandSize = MtuMax;
    data.mMaxKrogCommandSize = MtuWexMax;
    data.mBroadcastMsgPacketSize = kBroadcastMsgPacketSize;
    data.mDaxsSupported = DAXS_SUPPORTED;
    data.mNonpersistentLocksSupported = NON_PERSISTENT_LOCKS_SUPPORTED;
    data.mPersistentLocksSupported = PERSISTENT_LOCKS_SUPPORTED;
}

QelMessageGetInterfaceLimitsRsp::~QelMessageGetInterfaceLimitsRsp() = default;

// --- broadcast -------------------------------------------------------------------------------------------------------

QelMessageDaxBroadcastReq::QelMessageDaxBroadcastReq(std::uint8_t broadcastType, std::uint16_t broadcastMsgLen,
                                                     std::uint32_t toolType, const std::string& toolId,
                                                     const char* broadcastMsg)
    : QelMessageMetadata(PayloadLength(checkedBroadcastLength(broadcastType, broadcastMsgLen, toolId, broadcastMsg)))
{
    Data& data = pPayload<Data>();
    data.mOffset = sizeof(Data);
    data.mBroadcastType = broadcastType;
    data.mBroadcastMsgLen = broadcastMsgLen;
    data.mToolType = toolType;
    data.mToolIdLen = wireLength(toolId);
    copyText(data.mToolId, toolId);
    if (broadcastMsgLen != 0) std::memcpy(pGetData() + sizeof(Data), broadcastMsg, broadcastMsgLen);
}

QelMessageDaxBroadcastReq::QelMessageDaxBroadcastReq(const char* i_buffer, unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
    require(pGetDataOffset() >= sizeof(Data), "message offset less than minimum acceptable size");
    require(std::uint64_t{pGetDataOffset()} + getBroadcastMsgLen() <= dataLength(),
            "message greater than maximum acceptable size");
    const std::uint16_t toolIdLength = pPayload<Data>().mToolIdLen;
    require(getBroadcastMode() != kUnicast || toolIdLength != 0, "Unicast message has no valid toolID");
    require(toolIdLength <= sizeof(Data::mToolId), "toolIdLen greater than maximum acceptable size");
}

QelMessageDaxBroadcastReq::~QelMessageDaxBroadcastReq() = default;

void QelMessageDaxBroadcastReq::pDerivedDebug(std::ostream& os) const
{
    os << " mOffset               " << hexFormat(pGetDataOffset()) << "\n";
    os << " mBroadcastType        " << hexFormat(getBroadcastMode()) << "\n";
    os << " mBroadcastMsgLen:     " << hexFormat(getBroadcastMsgLen()) << "\n";
    os << " mToolType:            " << hexFormat(getToolType()) << "\n";
    os << " mToolId:              " << getToolId() << "\n";
}

QelMessageDaxBroadcastRsp::~QelMessageDaxBroadcastRsp() = default;

// --- time of day -----------------------------------------------------------------------------------------------------

QelMessageGetQelTodReq::~QelMessageGetQelTodReq() = default;

QelMessageGetQelTodRsp::QelMessageGetQelTodRsp(const std::time_t& time)
    : QelMessageGetQelTodRsp(generateNextUint32(), time)
{}

QelMessageGetQelTodRsp::QelMessageGetQelTodRsp(std::uint32_t callerId, const std::time_t& time)
    : QelMessageMetadata(callerId, PayloadLength(sizeof(Data)))
{
    std::tm parts{};
    if (::gmtime_r(&time, &parts) == nullptr) throw std::range_error("type cannot be represented in BCD");

    // Unsigned arithmetic: the sums cannot overflow, and a year before 0 becomes a large number, which is refused like
    // a year after 9999.
    const auto number = [](int part) { return static_cast<unsigned int>(part); };
    Data& data = pPayload<Data>();
    data.mYear = number(parts.tm_year) + 1900U;
    data.mMonth = number(parts.tm_mon) + 1U;
    data.mDay = number(parts.tm_mday);
    data.mHour = number(parts.tm_hour);
    data.mMinute = number(parts.tm_min);
    data.mSecond = number(parts.tm_sec);
}

QelMessageGetQelTodRsp::~QelMessageGetQelTodRsp() = default;

void QelMessageGetQelTodRsp::pDerivedDebug(std::ostream& os) const
{
    const Data& data = pPayload<Data>();
    os << " mYear      " << decFormat(data.mYear) << "\n";
    os << " mMonth     " << decFormat(data.mMonth) << "\n";
    os << " mDay       " << decFormat(data.mDay) << "\n";
    os << " mHour      " << decFormat(data.mHour) << "\n";
    os << " mMinute    " << decFormat(data.mMinute) << "\n";
    os << " mSecond    " << decFormat(data.mSecond) << "\n";
}

// --- global mode attribute -------------------------------------------------------------------------------------------

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalModeAttributeBase<Derived, OpType, Classification>::QelMessageGlobalModeAttributeBase(
    std::uint8_t mode, const std::string& mtms)
    : Metadata(QelMessage::PayloadLength(std::uint64_t{sizeof(Data)} + mtms.size()))
{
    pStore(mode, mtms);
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalModeAttributeBase<Derived, OpType, Classification>::QelMessageGlobalModeAttributeBase(
    std::uint32_t callerId, std::uint8_t mode, const std::string& mtms)
    : Metadata(callerId, QelMessage::PayloadLength(std::uint64_t{sizeof(Data)} + mtms.size()))
{
    pStore(mode, mtms);
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalModeAttributeBase<Derived, OpType, Classification>::QelMessageGlobalModeAttributeBase(
    const char* i_buffer, unsigned int i_length)
    : Metadata(i_buffer, i_length)
{
    require(this->dataLength() >= sizeof(Data), kPayloadTooShort);
    require(getMTMSLen() <= this->dataLength() - sizeof(Data), "mtmsLen larger than acceptable");
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalModeAttributeBase<Derived, OpType, Classification>::~QelMessageGlobalModeAttributeBase() = default;

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
void QelMessageGlobalModeAttributeBase<Derived, OpType, Classification>::pStore(std::uint8_t mode,
                                                                                const std::string& mtms)
{
    Data& data = this->template pPayload<Data>();
    data.mMode = mode;
    data.mMTMSLen = wireLength(mtms);
    copyText(this->pGetData() + sizeof(Data), mtms);
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
void QelMessageGlobalModeAttributeBase<Derived, OpType, Classification>::pDerivedDebug(std::ostream& os) const
{
    os << " mMode      " << decFormat(getMode()) << "\n";
    os << " mMTMSLen   " << decFormat(getMTMSLen()) << "\n";
    os << " mMTMS      " << getMTMS() << "\n";
}

QelMessageSetGlobalModeAttributeReq::QelMessageSetGlobalModeAttributeReq(std::uint8_t mode, const std::string& mtms)
    : QelMessageGlobalModeAttributeBase(mode, mtms)
{}

QelMessageSetGlobalModeAttributeReq::QelMessageSetGlobalModeAttributeReq(const char* i_buffer, unsigned int i_length)
    : QelMessageGlobalModeAttributeBase(i_buffer, i_length)
{}

QelMessageSetGlobalModeAttributeReq::~QelMessageSetGlobalModeAttributeReq() = default;

QelMessageGetGlobalModeAttributeReq::~QelMessageGetGlobalModeAttributeReq() = default;

QelMessageGetGlobalModeAttributeRsp::QelMessageGetGlobalModeAttributeRsp(std::uint8_t mode, const std::string& mtms)
    : QelMessageGlobalModeAttributeBase(mode, mtms)
{}

QelMessageGetGlobalModeAttributeRsp::QelMessageGetGlobalModeAttributeRsp(std::uint32_t callerId, std::uint8_t mode,
                                                                         const std::string& mtms)
    : QelMessageGlobalModeAttributeBase(callerId, mode, mtms)
{}

QelMessageGetGlobalModeAttributeRsp::QelMessageGetGlobalModeAttributeRsp(const char* i_buffer, unsigned int i_length)
    : QelMessageGlobalModeAttributeBase(i_buffer, i_length)
{}

QelMessageGetGlobalModeAttributeRsp::~QelMessageGetGlobalModeAttributeRsp() = default;

template class QelMessageGlobalModeAttributeBase<QelMessageSetGlobalModeAttributeReq,
                                                 QelMessageOpSetGlobalModeAttribute, QelMessageClassification::Request>;
template class QelMessageGlobalModeAttributeBase<
    QelMessageGetGlobalModeAttributeRsp, QelMessageOpGetGlobalModeAttribute, QelMessageClassification::Response>;

// --- global save-area metadata ---------------------------------------------------------------------------------------

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalSaveAreaMetadataBase<Derived, OpType, Classification>::QelMessageGlobalSaveAreaMetadataBase(
    const std::string& metadata)
    : Metadata(QelMessage::PayloadLength(std::uint64_t{sizeof(Data)} + metadata.size()))
{
    pStore(metadata);
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalSaveAreaMetadataBase<Derived, OpType, Classification>::QelMessageGlobalSaveAreaMetadataBase(
    std::uint32_t callerId, const std::string& metadata)
    : Metadata(callerId, QelMessage::PayloadLength(std::uint64_t{sizeof(Data)} + metadata.size()))
{
    pStore(metadata);
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalSaveAreaMetadataBase<Derived, OpType, Classification>::QelMessageGlobalSaveAreaMetadataBase(
    const char* i_buffer, unsigned int i_length)
    : Metadata(i_buffer, i_length)
{
    require(this->dataLength() >= sizeof(Data), kPayloadTooShort);
    require(getMetadataLen() <= this->dataLength() - sizeof(Data), "metadataLen larger than acceptable");
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
QelMessageGlobalSaveAreaMetadataBase<Derived, OpType, Classification>::~QelMessageGlobalSaveAreaMetadataBase() =
    default;

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
void QelMessageGlobalSaveAreaMetadataBase<Derived, OpType, Classification>::pStore(const std::string& metadata)
{
    this->template pPayload<Data>().mMetadataLen = wireLength(metadata);
    copyText(this->pGetData() + sizeof(Data), metadata);
}

template <typename Derived, QelMessageOpTypes OpType, QelMessageClassification::Value Classification>
void QelMessageGlobalSaveAreaMetadataBase<Derived, OpType, Classification>::pDerivedDebug(std::ostream& os) const
{
    os << " mMetadataLen " << decFormat(getMetadataLen()) << "\n";
    os << " mMetadata    " << getMetadata() << "\n";
}

QelMessageSetGlobalSaveAreaMetadataReq::QelMessageSetGlobalSaveAreaMetadataReq(const std::string& metadata)
    : QelMessageGlobalSaveAreaMetadataBase(metadata)
{}

QelMessageSetGlobalSaveAreaMetadataReq::QelMessageSetGlobalSaveAreaMetadataReq(const char* i_buffer,
                                                                               unsigned int i_length)
    : QelMessageGlobalSaveAreaMetadataBase(i_buffer, i_length)
{}

QelMessageSetGlobalSaveAreaMetadataReq::~QelMessageSetGlobalSaveAreaMetadataReq() = default;

QelMessageSetGlobalSaveAreaMetadataRsp::~QelMessageSetGlobalSaveAreaMetadataRsp() = default;
QelMessageGetGlobalSaveAreaMetadataReq::~QelMessageGetGlobalSaveAreaMetadataReq() = default;

QelMessageGetGlobalSaveAreaMetadataRsp::QelMessageGetGlobalSaveAreaMetadataRsp(const std::string& metadata)
    : QelMessageGlobalSaveAreaMetadataBase(metadata)
{}

QelMessageGetGlobalSaveAreaMetadataRsp::QelMessageGetGlobalSaveAreaMetadataRsp(std::uint32_t callerId,
                                                                               const std::string& metadata)
    : QelMessageGlobalSaveAreaMetadataBase(callerId, metadata)
{}

QelMessageGetGlobalSaveAreaMetadataRsp::QelMessageGetGlobalSaveAreaMetadataRsp(const char* i_buffer,
                                                                               unsigned int i_length)
    : QelMessageGlobalSaveAreaMetadataBase(i_buffer, i_length)
{}

QelMessageGetGlobalSaveAreaMetadataRsp::~QelMessageGetGlobalSaveAreaMetadataRsp() = default;

template class QelMessageGlobalSaveAreaMetadataBase<
    QelMessageSetGlobalSaveAreaMetadataReq, QelMessageOpSetGlobalSaveAreaMetadata, QelMessageClassification::Request>;
template class QelMessageGlobalSaveAreaMetadataBase<
    QelMessageGetGlobalSaveAreaMetadataRsp, QelMessageOpGetGlobalSaveAreaMetadata, QelMessageClassification::Response>;

} // namespace qel
