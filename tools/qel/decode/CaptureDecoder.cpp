#include "decode/CaptureDecoder.hpp"

#include <qel/common/io/QelMessageStream.hpp>

#include "base/Failures.hpp"
#include "decode/PcapReader.hpp"
#include "decode/PcapngReader.hpp"

#include <algorithm>
#include <cstring>
#include <sstream>
#include <utility>

namespace qel::tool {

namespace {

using Prefix = QelMessageStream::MessageHeader;

bool beginsLikeFrame(const std::string& bytes)
{
    constexpr const auto& kEyecatcher = QelMessage::CommonHeader::DaxCmdDesc;
    return std::memcmp(bytes.data(), kEyecatcher, std::min(bytes.size(), sizeof(kEyecatcher))) == 0;
}

/// A TLS record: its type, and the major version 3.
bool beginsLikeTls(const std::string& bytes)
{
    constexpr char kFirstType = 0x14;
    constexpr char kLastType = 0x17;
    return bytes[0] >= kFirstType && bytes[0] <= kLastType && (bytes.size() == 1 || bytes[1] == 3);
}

std::string counted(std::size_t count, const char* what, const char* rest)
{
    return std::to_string(count) + " " + what + (count == 1 ? "" : "s") + rest;
}

void requireKnown(std::uint32_t linkType)
{
    if (isKnownLinkType(linkType)) return;
    throw CommandFailure(ExitStatus::Refused, "the capture has link type " + std::to_string(linkType) +
                                                  ", which is not supported: capture Ethernet, Linux cooked, raw "
                                                  "IP or loopback");
}

} // namespace

CaptureDecoder::CaptureDecoder(std::istream& input, bool isPcapng, Sink sink)
    : mInput(input), mIsPcapng(isPcapng), mSink(std::move(sink))
{}

void CaptureDecoder::run()
{
    if (mIsPcapng) {
        PcapngReader reader(mInput);
        std::uint32_t linkType = 0;
        for (std::string packet; reader.next(linkType, packet);)
            pTakePacket(linkType, packet);
    } else {
        PcapReader reader(mInput);
        requireKnown(reader.linkType());
        for (std::string packet; reader.next(packet);)
            pTakePacket(reader.linkType(), packet);
    }
    for (auto& entry : mDirections)
        pFinish(entry.first, entry.second);
}

std::string CaptureDecoder::skipped() const
{
    const auto count = [this](Content content) {
        return static_cast<std::size_t>(
            std::count_if(mDirections.begin(), mDirections.end(),
                          [content](const auto& entry) { return entry.second.content == content; }));
    };
    std::string text;
    const auto add = [&text](std::size_t number, const char* what, const char* rest) {
        if (number > 0) text += (text.empty() ? "skipped " : ", ") + counted(number, what, rest);
    };
    add(mOtherPackets, "packet", " without TCP");
    add(count(Content::Tls), "stream", " from where TLS begins");
    add(count(Content::Other), "stream", " from where no frame follows");
    return text;
}

void CaptureDecoder::pTakePacket(std::uint32_t linkType, const std::string& packet)
{
    requireKnown(linkType);
    if (const auto segment = tcpSegmentOf(linkType, packet)) {
        pTake(*segment);
    } else {
        ++mOtherPackets;
    }
}

void CaptureDecoder::pTake(const TcpSegment& segment)
{
    Direction& direction = mDirections[segment.stream];
    direction.tcp.take(segment, direction.pending);
    while (!direction.pending.empty() && pDecodeFrame(segment.stream, direction))
        continue;
    if (direction.content != Content::Frames) direction.pending.clear();
}

/// @return false: there is no complete frame yet, or none follows any more
bool CaptureDecoder::pDecodeFrame(const std::string& stream, Direction& direction)
{
    if (direction.content != Content::Frames) return false;
    std::string& pending = direction.pending;
    if (!beginsLikeFrame(pending)) {
        direction.content = beginsLikeTls(pending) ? Content::Tls : Content::Other;
        return false;
    }
    if (pending.size() < sizeof(Prefix)) return false;
    const unsigned int length = reinterpret_cast<const Prefix*>(pending.data())->mMsgLength;
    const bool isLength = length > sizeof(Prefix) && length <= QelMessage::MtuMax;
    if (isLength && pending.size() < length) return false;
    std::istringstream bytes(pending.substr(0, isLength ? length : sizeof(Prefix)));
    FrameDecoder decoder(bytes);
    FrameDecoder::Item item;
    decoder.next(item);
    item.stream = stream;
    item.offset = direction.offset;
    if (item.message != nullptr) ++mFrames;
    mSink(item);
    if (!isLength) {
        direction.content = Content::Other;
        return false;
    }
    pending.erase(0, length);
    direction.offset += length;
    return true;
}

void CaptureDecoder::pFinish(const std::string& stream, Direction& direction)
{
    if (direction.content != Content::Frames) return;
    if (direction.tcp.waitingBytes() > 0) {
        pReport(stream, direction,
                "the capture lacks a segment; " + std::to_string(direction.tcp.waitingBytes()) +
                    " bytes after it are skipped");
    } else if (!direction.pending.empty()) {
        pReport(stream, direction,
                "the capture ends after " + std::to_string(direction.pending.size()) + " bytes of a frame");
    }
}

void CaptureDecoder::pReport(const std::string& stream, const Direction& direction, const std::string& reason)
{
    FrameDecoder::Item item;
    item.stream = stream;
    item.offset = direction.offset;
    item.reason = reason;
    mSink(item);
}

} // namespace qel::tool
