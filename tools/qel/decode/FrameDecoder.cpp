#include "decode/FrameDecoder.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/protocol/MessageRegistry.hpp>

#include "base/Library.hpp"

#include <algorithm>
#include <cstring>
#include <typeinfo>

namespace qel::tool {

namespace {

using Prefix = QelMessageStream::MessageHeader;
using FastHeader = QelMessageRegistry::FastHeader;

/// The registry that knows the message; the public one for an unknown message.
const QelMessageRegistry& registryFor(const char* frame, unsigned int length)
{
    const QelMessageRegistry& handshake = QelInternalMessageRegistry::getInstance();
    if (length < sizeof(FastHeader)) return messageRegistry();
    const auto identifier = reinterpret_cast<const FastHeader*>(frame)->getIdentifier();
    return handshake.findFactory(identifier) != nullptr ? handshake : messageRegistry();
}

/// Why the class of a message refuses the frame; empty for an unknown message. The registry only logs the reason.
std::string refusalOf(const QelMessageRegistry& registry, const char* frame, unsigned int length)
{
    const auto* const factory = registry.findFactory(reinterpret_cast<const FastHeader*>(frame)->getIdentifier());
    if (factory == nullptr) return {};
    try {
        static_cast<void>((*factory)(frame, length));
        return {};
    } catch (const QelMessageValidationException& error) {
        return error.what();
    }
}

bool isPlain(const QelMessage& message) { return typeid(message) == typeid(QelMessage); }

bool isRefusedResponse(const QelMessage& message)
{
    return message.getClassification() == QelMessageClassification::Response &&
           message.getStatus() != QelMessageStatusNoError;
}

/// Compares as much of the eyecatcher as there is.
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

FrameDecoder::FrameDecoder(std::istream& input) : mInput(input) {}

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
        item.reason = cutShort(there, sizeof(Prefix)) + " that hold the length of a frame";
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
    decode(frame, length, item);
}

void FrameDecoder::decode(const char* frame, unsigned int length, Item& item)
{
    const QelMessageRegistry& registry = registryFor(frame, length);
    try {
        item.message = registry.deserialize(frame, length);
        const bool mayBeRefused = isPlain(*item.message) && !isRefusedResponse(*item.message);
        if (mayBeRefused) item.reason = refusalOf(registry, frame, length);
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
