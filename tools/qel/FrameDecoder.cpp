#include "FrameDecoder.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/io/QelMessageStream.hpp>

#include <algorithm>
#include <cstring>
#include <utility>

namespace qel::tool {

namespace {

using Prefix = QelMessageStream::MessageHeader;

/// As a registry's own entry, but says why the class refuses a frame: a registry itself tells only the log.
template <typename T>
std::pair<const QelMessageRegistry::Identifier, QelMessageRegistry::Factory> entry(std::string& refusal)
{
    return {T::getMessageID(), [&refusal](const char* buffer, unsigned int length) -> std::unique_ptr<QelMessage> {
                try {
                    return std::make_unique<T>(buffer, length);
                } catch (const QelMessageValidationException& error) {
                    refusal = error.what();
                    throw;
                }
            }};
}

template <typename... Messages>
QelMessageRegistry registryOf(std::string& refusal)
{
    return {entry<Messages>(refusal)...};
}

/// Every message that can be read from a frame, those of the connection handshake included.
QelMessageRegistry makeRegistry(std::string& refusal)
{
    return registryOf<QelMessageGetEnclTypeAndInterfaceVersionReq, QelMessageGetEnclTypeAndInterfaceVersionRsp,
                      QelMessageInterfaceCmpOpenKrogSessionReq, QelMessageInterfaceCmpOpenKrogSessionRsp,
                      QelMessageInterfaceCmpCloseKrogSessionReq, QelMessageInterfaceCmpCloseKrogSessionRsp,
                      QelMessageExchIntCapabilitiesReq, QelMessageExchIntCapabilitiesRsp, QelMessageDaxBroadcastReq,
                      QelMessageDaxBroadcastRsp, QelMessageGetGlobalModeAttributeReq,
                      QelMessageGetGlobalModeAttributeRsp, QelMessageSetGlobalSaveAreaMetadataReq,
                      QelMessageSetGlobalSaveAreaMetadataRsp, QelMessageGetGlobalSaveAreaMetadataReq,
                      QelMessageGetGlobalSaveAreaMetadataRsp, QelMessageGetInterfaceLimitsReq, QelMessageGetQelTodReq,
                      QelMessageSetGlobalModeAttributeReq,
                      // virtual serial sessions
                      QelMessageVirtualSerialOpenReq, QelMessageVirtualSerialOpenRsp, QelMessageVirtualSerialCloseReq,
                      QelMessageVirtualSerialCloseRsp, QelMessageVirtualSerialGetMaxSessionsReq,
                      QelMessageVirtualSerialGetMaxSessionsRsp, QelMessageVirtualSerialSetupSessionReq,
                      QelMessageVirtualSerialSetupSessionRsp, QelMessageVirtualSerialDataToOsAsync,
                      QelMessageVirtualSerialDataToDaxAsync, QelMessageVirtualSerialSessionClosedAsync,
                      // notices to the console, and the connection handshake
                      QelMessageDaxBroadcastOutboundAsync, QelMessageKrogConnectionClosedAsync,
                      QelMessageUpgradeConnectionAsync, QelMessageAbortHandshakeAsync>(refusal);
}

bool isRefusedResponse(const QelMessage& message)
{
    return message.getClassification() == QelMessageClassification::Response &&
           message.getStatus() != QelMessageStatusNoError;
}

/// Looks at as much of the eyecatcher as there is.
bool beginsLikeFrame(const char* bytes, std::size_t length)
{
    constexpr const auto& kEyecatcher = QelMessage::CommonHeader::DaxCmdDesc;
    return std::memcmp(bytes, kEyecatcher, std::min(length, sizeof(kEyecatcher))) == 0;
}

std::string cutShort(std::size_t there, std::size_t wanted)
{
    return "the input ends after " + std::to_string(there) + " of " + std::to_string(wanted) + " bytes";
}

} // namespace

FrameDecoder::FrameDecoder(std::istream& input) : mInput(input), mRegistry(makeRegistry(mRefusal)) {}

bool FrameDecoder::next(Item& item)
{
    if (mLost || mInput.peek() == std::istream::traits_type::eof()) return false;
    item = Item();
    item.offset = mOffset;
    pDecode(item);
    return true;
}

void FrameDecoder::pDecode(Item& item)
{
    mLost = true; // until the end of this frame is known
    char frame[QelMessage::MtuMax];
    std::size_t there = pTake(frame, sizeof(Prefix));
    if (!beginsLikeFrame(frame, there)) {
        item.reason = "i_buffer bad eyecatcher";
        return;
    }
    if (there < sizeof(Prefix)) {
        item.reason = cutShort(there, sizeof(Prefix)) + " that tell the length of a frame";
        return;
    }
    const unsigned int length = reinterpret_cast<const Prefix*>(frame)->mMsgLength;
    if (length <= sizeof(Prefix) || length > QelMessage::MtuMax) {
        item.reason = "Invalid length " + std::to_string(length);
        return;
    }
    there += pTake(frame + there, length - there);
    if (there < length) {
        item.reason = cutShort(there, length);
        return;
    }
    mLost = false;
    mRefusal.clear();
    try {
        item.message = mRegistry.deserialize(frame, length);
        if (!isRefusedResponse(*item.message)) item.reason = mRefusal;
    } catch (const QelMessageValidationException& error) {
        item.reason = error.what();
    }
}

std::size_t FrameDecoder::pTake(char* buffer, std::size_t length)
{
    mInput.read(buffer, static_cast<std::streamsize>(length));
    const auto count = static_cast<std::size_t>(mInput.gcount());
    mOffset += count;
    return count;
}

} // namespace qel::tool
