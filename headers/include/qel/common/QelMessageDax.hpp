#pragma once

#include <qel/common/EndianExtensions.hpp>
#include <qel/common/QelExport.hpp>
#include <qel/common/QelMessageMetadata.hpp>

#include <cstddef>
#include <cstdint>
#include <iosfwd>
#include <string>

/// @file
/// Asynchronous messages to the console, function code 0x7000: another console's broadcast, and the end of the
/// connection to the hypervisor. Those of virtual serial sessions are in QelMessageVirtualSerial.hpp.
///
/// Ownership: a message owns its frame; pointers into it live as long as the message. Thread safety: as QelMessage, one
/// thread at a time.

namespace qel {

class QelMessageDaxBroadcastReq;

/// A console's broadcast for another console, with the identity of its sender.
class QEL_EXPORT QelMessageDaxBroadcastOutboundAsync
    : public QelMessageMetadata<QelMessageDaxBroadcastOutboundAsync, QelMessageFunctionDax,
                                QelMessageOpOutboundBroadcastAsync, QelMessageClassification::Async> {
public:
    /// The fixed part of the payload as it lies in the frame: offsets from the first payload byte, integers big-endian.
    struct Data {
        be_uint16_t mOffset;          //  0  offset of the message in the payload: 42 when built, or more
        be_uint16_t mBroadcastMsgLen; //  2  bytes of the message
        be_uint32_t mSenderToolType;  //  4  tool type of the sender
        be_uint16_t mSenderToolIdLen; //  8  meaningful bytes of mSenderToolId, at most 32
        char mSenderToolId[32];       // 10  tool id of the sender, zero after its length
        /* bytes of a later protocol level, skipped; then the message, mBroadcastMsgLen bytes at mOffset */
    };
    static_assert(sizeof(Data) == 42 && alignof(Data) == 1, "overlays the frame buffer");
    static_assert(offsetof(Data, mBroadcastMsgLen) == 2 && offsetof(Data, mSenderToolType) == 4 &&
                      offsetof(Data, mSenderToolIdLen) == 8 && offsetof(Data, mSenderToolId) == 10,
                  "overlays the frame buffer");

    /// Builds a message with a new caller id. Type and id are in the opposite order of the next builder.
    /// @param broadcastMsgLen bytes of the message
    /// @param senderToolType tool type of the sender
    /// @param senderToolId at most 32 bytes, may be empty. Its length is taken modulo 65536, and only that many bytes
    ///        are sent.
    /// @param broadcastMsg `broadcastMsgLen` bytes, copied; may be null when that is 0
    /// @throws QelMessageValidationException "toolIdLen greater than maximum acceptable size"
    /// @throws std::invalid_argument "data", after that check: null with a length other than 0
    QelMessageDaxBroadcastOutboundAsync(std::uint16_t broadcastMsgLen, std::uint32_t senderToolType,
                                        const std::string& senderToolId, const char* broadcastMsg);

    /// Builds the message that relays a broadcast: the message bytes of the request, unchanged, and the given sender.
    /// The tool type and id in the request are those of the addressee and are not copied.
    /// @throws QelMessageValidationException as the other builder does
    QelMessageDaxBroadcastOutboundAsync(const QelMessageDaxBroadcastReq& request, const std::string& senderToolId,
                                        std::uint32_t senderToolType);

    /// Parses a received frame: checks the frame, then its identity, then the payload, and keeps a copy. A payload
    /// longer than needed is accepted.
    /// @param i_buffer at least `i_length` readable bytes; not kept
    /// @param i_length bytes
    /// @throws QelMessageValidationException as QelMessageMetadata does; then "dataLength smaller than minimum
    ///         acceptable size" (below 42 bytes), "message offset less than minimum acceptable size" (below 42),
    ///         "message greater than maximum acceptable size" (ends past the payload), "toolIdLen greater than maximum
    ///         acceptable size" (above 32)
    QelMessageDaxBroadcastOutboundAsync(const char* i_buffer, unsigned int i_length);

    ~QelMessageDaxBroadcastOutboundAsync() override;

    std::uint16_t getBroadcastMsgLen() const { return pPayload<Data>().mBroadcastMsgLen; }
    std::uint32_t getSenderToolType() const { return pPayload<Data>().mSenderToolType; }
    std::string getSenderToolId() const { return std::string(pPayload<Data>().mSenderToolId, pGetSenderToolIdLen()); }

    /// The message, getBroadcastMsgLen() bytes, in place. Never null, but not to be read when the length is 0.
    const char* getDaxPacket() const { return getData() + pGetDataOffset(); }

protected:
    void pDerivedDebug(std::ostream& os) const override;

private:
    std::uint16_t pGetSenderToolIdLen() const { return pPayload<Data>().mSenderToolIdLen; }
    std::uint16_t pGetDataOffset() const { return pPayload<Data>().mOffset; }
};

/// Reports that the connection to the hypervisor closed. No payload.
class QEL_EXPORT QelMessageKrogConnectionClosedAsync
    : public QelMessageMetadata<QelMessageKrogConnectionClosedAsync, QelMessageFunctionDax,
                                QelMessageOpSendKrogConnectionClosed, QelMessageClassification::Async> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~QelMessageKrogConnectionClosedAsync() override;
};

} // namespace qel
