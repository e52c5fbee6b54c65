#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "WireChecks.hpp"

#include <cstring>
#include <ostream>
#include <stdexcept>

namespace qel {

namespace {

constexpr const char* kPayloadTooShort = "dataLength shorter than actual data size";

// The check of a data message's arguments gives the payload length: it runs before there is a frame, and before a
// caller id is taken.
std::uint64_t dataMessageLength(std::size_t fixedLength, std::uint16_t dataLength, const char* data)
{
    if (data == nullptr && dataLength != 0) throw std::invalid_argument("data");
    return std::uint64_t{fixedLength} + dataLength;
}

// Every payload with a session address begins its lines with it.
template <typename Message>
void printAddress(std::ostream& os, const Message& message)
{
    os << "  Data:\n";
    os << "      LPID:               " << decFormat(message.getLpId()) << "\n";
    os << "      VSS connection num: " << decFormat(message.getVssConnectionNumber()) << "\n";
}

const char* toText(bool value) { return value ? "True" : "False"; }

} // namespace

// --- open ------------------------------------------------------------------------------------------------------------

QelMessageVirtualSerialOpenReq::QelMessageVirtualSerialOpenReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                                               bool forceOpen)
    : QelMessageMetadata(PayloadLength(sizeof(Data)))
{
    Data& data = pPayload<Data>();
    data.mLparId = lpId;
    data.mVssConnectionNumber = vssConnectionNumber;
    if (forceOpen) data.mFlags = kForceOpen;
}

QelMessageVirtualSerialOpenReq::QelMessageVirtualSerialOpenReq(const char* i_buffer, unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialOpenReq::~QelMessageVirtualSerialOpenReq() = default;

void QelMessageVirtualSerialOpenReq::pDerivedDebug(std::ostream& os) const
{
    printAddress(os, *this);
    os << "      Is force open:      " << toText(isForceOpen()) << "\n";
}

QelMessageVirtualSerialOpenRsp::QelMessageVirtualSerialOpenRsp(std::uint32_t callerId, std::uint16_t lpId,
                                                               std::uint16_t vssConnectionNumber)
    : QelMessageMetadata(callerId, PayloadLength(sizeof(Data)))
{
    Data& data = pPayload<Data>();
    data.mLparId = lpId;
    data.mVssConnectionNumber = vssConnectionNumber;
}

QelMessageVirtualSerialOpenRsp::QelMessageVirtualSerialOpenRsp(const char* i_buffer, unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialOpenRsp::~QelMessageVirtualSerialOpenRsp() = default;

void QelMessageVirtualSerialOpenRsp::pDerivedDebug(std::ostream& os) const { printAddress(os, *this); }

// --- close -----------------------------------------------------------------------------------------------------------

QelMessageVirtualSerialCloseReq::QelMessageVirtualSerialCloseReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                                                 bool forceClose)
    : QelMessageMetadata(PayloadLength(sizeof(Data)))
{
    Data& data = pPayload<Data>();
    data.mLparId = lpId;
    data.mVssConnectionNumber = vssConnectionNumber;
    if (forceClose) data.mForceClose = kForceClose;
}

QelMessageVirtualSerialCloseReq::QelMessageVirtualSerialCloseReq(const char* i_buffer, unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialCloseReq::~QelMessageVirtualSerialCloseReq() = default;

void QelMessageVirtualSerialCloseReq::pDerivedDebug(std::ostream& os) const
{
    printAddress(os, *this);
    os << "      Is force close:     " << toText(isForceClose()) << "\n";
}

QelMessageVirtualSerialCloseRsp::~QelMessageVirtualSerialCloseRsp() = default;

// --- maximum of sessions ---------------------------------------------------------------------------------------------

QelMessageVirtualSerialGetMaxSessionsReq::~QelMessageVirtualSerialGetMaxSessionsReq() = default;

QelMessageVirtualSerialGetMaxSessionsRsp::QelMessageVirtualSerialGetMaxSessionsRsp(std::uint32_t callerId,
                                                                                   std::uint16_t maxCec,
                                                                                   std::uint8_t maxLpar)
    : QelMessageMetadata(callerId, PayloadLength(sizeof(Data)))
{
    Data& data = pPayload<Data>();
    data.mMaxCec = maxCec;
    data.mMaxLpar = maxLpar;
}

QelMessageVirtualSerialGetMaxSessionsRsp::QelMessageVirtualSerialGetMaxSessionsRsp(const char* i_buffer,
                                                                                   unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialGetMaxSessionsRsp::~QelMessageVirtualSerialGetMaxSessionsRsp() = default;

void QelMessageVirtualSerialGetMaxSessionsRsp::pDerivedDebug(std::ostream& os) const
{
    os << "  Data:\n";
    os << "      Max CEC:            " << decFormat(getMaxCec()) << "\n";
    os << "      Max LPAR:           " << decFormat(getMaxLpar()) << "\n";
}

// --- serial data -----------------------------------------------------------------------------------------------------

template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType>
QelMessageVirtualSerialDataAsync<Derived, FunctionCode, OpType>::QelMessageVirtualSerialDataAsync(
    std::uint16_t lpId, std::uint16_t vssConnectionNumber, std::uint16_t dataLength, const char* data)
    : Metadata(QelMessage::PayloadLength(dataMessageLength(sizeof(Data), dataLength, data)))
{
    Data& payload = this->template pPayload<Data>();
    payload.mLparId = lpId;
    payload.mVssConnectionNumber = vssConnectionNumber;
    payload.mDataLength = dataLength;
    if (dataLength != 0) std::memcpy(this->pGetData() + sizeof(Data), data, dataLength);
}

template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType>
QelMessageVirtualSerialDataAsync<Derived, FunctionCode, OpType>::QelMessageVirtualSerialDataAsync(const char* i_buffer,
                                                                                                  unsigned int i_length)
    : Metadata(i_buffer, i_length)
{
    require(this->dataLength() >= sizeof(Data), kPayloadTooShort);
    require(getSerialDataLength() <= this->dataLength() - sizeof(Data), kPayloadTooShort);
}

template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType>
QelMessageVirtualSerialDataAsync<Derived, FunctionCode, OpType>::~QelMessageVirtualSerialDataAsync() = default;

template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType>
void QelMessageVirtualSerialDataAsync<Derived, FunctionCode, OpType>::pDerivedDebug(std::ostream& os) const
{
    printAddress(os, *this);
    os << "      Serial data length: " << decFormat(getSerialDataLength()) << "\n";
}

QelMessageVirtualSerialDataToOsAsync::QelMessageVirtualSerialDataToOsAsync(std::uint16_t lpId,
                                                                           std::uint16_t vssConnectionNumber,
                                                                           std::uint16_t dataLength, const char* data)
    : QelMessageVirtualSerialDataAsync(lpId, vssConnectionNumber, dataLength, data)
{}

QelMessageVirtualSerialDataToOsAsync::QelMessageVirtualSerialDataToOsAsync(const char* i_buffer, unsigned int i_length)
    : QelMessageVirtualSerialDataAsync(i_buffer, i_length)
{}

QelMessageVirtualSerialDataToOsAsync::~QelMessageVirtualSerialDataToOsAsync() = default;

QelMessageVirtualSerialDataToDaxAsync::QelMessageVirtualSerialDataToDaxAsync(std::uint16_t lpId,
                                                                             std::uint16_t vssConnectionNumber,
                                                                             std::uint16_t dataLength, const char* data)
    : QelMessageVirtualSerialDataAsync(lpId, vssConnectionNumber, dataLength, data)
{}

QelMessageVirtualSerialDataToDaxAsync::QelMessageVirtualSerialDataToDaxAsync(const char* i_buffer,
                                                                             unsigned int i_length)
    : QelMessageVirtualSerialDataAsync(i_buffer, i_length)
{}

QelMessageVirtualSerialDataToDaxAsync::~QelMessageVirtualSerialDataToDaxAsync() = default;

template class QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToOsAsync, QelMessageFunctionVirtualSerial,
                                                QelMessageOpSendVirtualSerialDataToOs>;
template class QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToDaxAsync, QelMessageFunctionDax,
                                                QelMessageOpSendVirtualSerialDataToMc>;

// --- setup -----------------------------------------------------------------------------------------------------------

QelMessageVirtualSerialSetupSessionReq::QelMessageVirtualSerialSetupSessionReq(std::uint16_t lpId,
                                                                               std::uint16_t vssConnectionNumber)
    : QelMessageMetadata(PayloadLength(sizeof(Data)))
{
    Data& data = pPayload<Data>();
    data.mLparId = lpId;
    data.mVssConnectionNumber = vssConnectionNumber;
}

QelMessageVirtualSerialSetupSessionReq::QelMessageVirtualSerialSetupSessionReq(const char* i_buffer,
                                                                               unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialSetupSessionReq::~QelMessageVirtualSerialSetupSessionReq() = default;

void QelMessageVirtualSerialSetupSessionReq::pDerivedDebug(std::ostream& os) const { printAddress(os, *this); }

QelMessageVirtualSerialSetupSessionRsp::~QelMessageVirtualSerialSetupSessionRsp() = default;

// --- session closed --------------------------------------------------------------------------------------------------

QelMessageVirtualSerialSessionClosedAsync::QelMessageVirtualSerialSessionClosedAsync(std::uint16_t lpId,
                                                                                     std::uint16_t vssConnectionNumber,
                                                                                     CloseReason reason)
    : QelMessageMetadata(PayloadLength(sizeof(Data)))
{
    Data& data = pPayload<Data>();
    data.mLparId = lpId;
    data.mVssConnectionNumber = vssConnectionNumber;
    data.mCloseReason = static_cast<std::uint32_t>(reason);
}

QelMessageVirtualSerialSessionClosedAsync::QelMessageVirtualSerialSessionClosedAsync(const char* i_buffer,
                                                                                     unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialSessionClosedAsync::~QelMessageVirtualSerialSessionClosedAsync() = default;

void QelMessageVirtualSerialSessionClosedAsync::pDerivedDebug(std::ostream& os) const
{
    printAddress(os, *this);
    // As it came, not as getCloseReason() reads it: the dump is where a peer's odd number should be seen.
    os << "      Close reason:       " << decFormat(pPayload<Data>().mCloseReason) << "\n";
}

} // namespace qel
