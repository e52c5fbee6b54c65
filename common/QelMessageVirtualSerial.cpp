#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "WireChecks.hpp"

#include <cstring>
#include <ostream>
#include <stdexcept>

namespace qel {

namespace {

constexpr const char* kPayloadTooShort = "dataLength shorter than actual data size";

// Checks the arguments of a data message and returns its payload length. Evaluated as a constructor argument, so that
// arguments that are refused allocate no frame and draw no caller id.
std::uint64_t checkedDataMessageLength(std::size_t fixedLength, std::uint16_t dataLength, const char* data)
{
    if (data == nullptr && dataLength != 0) throw std::invalid_argument("data");
    return std::uint64_t{fixedLength} + dataLength;
}

// The first lines of every payload with a session address.
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
    : QelMessageVirtualSerialAddressed(lpId, vssConnectionNumber, PayloadLength(sizeof(Data)))
{
    if (forceOpen) pPayload<Data>().mFlags = kForceOpen;
}

QelMessageVirtualSerialOpenReq::QelMessageVirtualSerialOpenReq(const char* i_buffer, unsigned int i_length)
    : QelMessageVirtualSerialAddressed(i_buffer, i_length)
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
    : QelMessageVirtualSerialAddressed(callerId, lpId, vssConnectionNumber, PayloadLength(sizeof(Data)))
{}

QelMessageVirtualSerialOpenRsp::QelMessageVirtualSerialOpenRsp(const char* i_buffer, unsigned int i_length)
    : QelMessageVirtualSerialAddressed(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialOpenRsp::~QelMessageVirtualSerialOpenRsp() = default;

void QelMessageVirtualSerialOpenRsp::pDerivedDebug(std::ostream& os) const { printAddress(os, *this); }

// --- close -----------------------------------------------------------------------------------------------------------

QelMessageVirtualSerialCloseReq::QelMessageVirtualSerialCloseReq(std::uint16_t lpId, std::uint16_t vssConnectionNumber,
                                                                 bool forceClose)
    : QelMessageVirtualSerialAddressed(lpId, vssConnectionNumber, PayloadLength(sizeof(Data)))
{
    if (forceClose) pPayload<Data>().mForceClose = kForceClose;
}

QelMessageVirtualSerialCloseReq::QelMessageVirtualSerialCloseReq(const char* i_buffer, unsigned int i_length)
    : QelMessageVirtualSerialAddressed(i_buffer, i_length)
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
    : Addressed(lpId, vssConnectionNumber,
                QelMessage::PayloadLength(checkedDataMessageLength(sizeof(Data), dataLength, data)))
{
    this->template pPayload<Data>().mDataLength = dataLength;
    if (dataLength != 0) std::memcpy(this->pGetData() + sizeof(Data), data, dataLength);
}

template <typename Derived, QelMessageFunctionCodes FunctionCode, QelMessageOpTypes OpType>
QelMessageVirtualSerialDataAsync<Derived, FunctionCode, OpType>::QelMessageVirtualSerialDataAsync(const char* i_buffer,
                                                                                                  unsigned int i_length)
    : Addressed(i_buffer, i_length)
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
    : QelMessageVirtualSerialAddressed(lpId, vssConnectionNumber, PayloadLength(sizeof(Data)))
{}

QelMessageVirtualSerialSetupSessionReq::QelMessageVirtualSerialSetupSessionReq(const char* i_buffer,
                                                                               unsigned int i_length)
    : QelMessageVirtualSerialAddressed(i_buffer, i_length)
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
    : QelMessageVirtualSerialAddressed(lpId, vssConnectionNumber, PayloadLength(sizeof(Data)))
{
    pPayload<Data>().mCloseReason = static_cast<std::uint32_t>(reason);
}

QelMessageVirtualSerialSessionClosedAsync::QelMessageVirtualSerialSessionClosedAsync(const char* i_buffer,
                                                                                     unsigned int i_length)
    : QelMessageVirtualSerialAddressed(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), kPayloadTooShort);
}

QelMessageVirtualSerialSessionClosedAsync::~QelMessageVirtualSerialSessionClosedAsync() = default;

void QelMessageVirtualSerialSessionClosedAsync::pDerivedDebug(std::ostream& os) const
{
    printAddress(os, *this);
    // The stored number, not getCloseReason(): a dump must show an undefined number that a peer sent.
    os << "      Close reason:       " << decFormat(pPayload<Data>().mCloseReason) << "\n";
}

} // namespace qel
