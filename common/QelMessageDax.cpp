#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "WireChecks.hpp"

#include <cstring>
#include <ostream>
#include <stdexcept>

namespace qel {

namespace {

using OutboundData = QelMessageDaxBroadcastOutboundAsync::Data;

// Checks the arguments of the builder and returns the payload length. Evaluated as a constructor argument, so that
// arguments that are refused allocate no frame and draw no caller id.
std::uint64_t checkedOutboundLength(std::uint16_t broadcastMsgLen, const std::string& senderToolId,
                                    const char* broadcastMsg)
{
    require(wireLength(senderToolId) <= sizeof(OutboundData::mSenderToolId),
            "toolIdLen greater than maximum acceptable size");
    if (broadcastMsg == nullptr && broadcastMsgLen != 0) throw std::invalid_argument("data");
    return std::uint64_t{sizeof(OutboundData)} + broadcastMsgLen;
}

} // namespace

QelMessageDaxBroadcastOutboundAsync::QelMessageDaxBroadcastOutboundAsync(std::uint16_t broadcastMsgLen,
                                                                         std::uint32_t senderToolType,
                                                                         const std::string& senderToolId,
                                                                         const char* broadcastMsg)
    : QelMessageMetadata(PayloadLength(checkedOutboundLength(broadcastMsgLen, senderToolId, broadcastMsg)))
{
    Data& data = pPayload<Data>();
    data.mOffset = sizeof(Data);
    data.mBroadcastMsgLen = broadcastMsgLen;
    data.mSenderToolType = senderToolType;
    data.mSenderToolIdLen = wireLength(senderToolId);
    std::memcpy(data.mSenderToolId, senderToolId.data(), wireLength(senderToolId));
    if (broadcastMsgLen != 0) std::memcpy(pGetData() + sizeof(Data), broadcastMsg, broadcastMsgLen);
}

QelMessageDaxBroadcastOutboundAsync::QelMessageDaxBroadcastOutboundAsync(const QelMessageDaxBroadcastReq& request,
                                                                         const std::string& senderToolId,
                                                                         std::uint32_t senderToolType)
    : QelMessageDaxBroadcastOutboundAsync(request.getBroadcastMsgLen(), senderToolType, senderToolId,
                                          request.getDaxPacket())
{}

QelMessageDaxBroadcastOutboundAsync::QelMessageDaxBroadcastOutboundAsync(const char* i_buffer, unsigned int i_length)
    : QelMessageMetadata(i_buffer, i_length)
{
    require(dataLength() >= sizeof(Data), "dataLength smaller than minimum acceptable size");
    require(pGetDataOffset() >= sizeof(Data), "message offset less than minimum acceptable size");
    require(std::uint64_t{pGetDataOffset()} + getBroadcastMsgLen() <= dataLength(),
            "message greater than maximum acceptable size");
    require(pGetSenderToolIdLen() <= sizeof(Data::mSenderToolId), "toolIdLen greater than maximum acceptable size");
}

QelMessageDaxBroadcastOutboundAsync::~QelMessageDaxBroadcastOutboundAsync() = default;

void QelMessageDaxBroadcastOutboundAsync::pDerivedDebug(std::ostream& os) const
{
    os << " mOffset               " << hexFormat(pGetDataOffset()) << "\n";
    os << " mBroadcastMsgLen:     " << hexFormat(getBroadcastMsgLen()) << "\n";
    os << " mSenderToolType:      " << hexFormat(getSenderToolType()) << "\n";
    os << " mSenderToolId:        " << getSenderToolId() << "\n";
}

QelMessageKrogConnectionClosedAsync::~QelMessageKrogConnectionClosedAsync() = default;

} // namespace qel
