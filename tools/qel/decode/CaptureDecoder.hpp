#pragma once

#include "decode/FrameDecoder.hpp"
#include "decode/TcpSegment.hpp"

#include <cstddef>
#include <functional>
#include <istream>
#include <map>
#include <string>

namespace qel::tool {

/// Finds the frames in a capture of network traffic (pcap, pcapng). The TCP payload of each direction of each
/// connection is put in order; its frames are decoded until TLS begins.
///
/// Memory: an incomplete frame and TcpStream::kMaxWaiting bytes for each direction.
/// Lifetime: borrows the input. Thread safety: one thread.
class CaptureDecoder {
public:
    /// Takes a frame, or what is wrong with one.
    using Sink = std::function<void(const FrameDecoder::Item&)>;

    /// @param isPcapng  the form of the capture; else it is pcap
    CaptureDecoder(std::istream& input, bool isPcapng, Sink sink);

    /// Reads the capture to its end.
    /// @throws CommandFailure  Refused: the capture is damaged, or of a kind of link that is not known
    void run();

    /// What was skipped, in one sentence; empty: nothing.
    std::string skipped() const;

    std::size_t frameCount() const noexcept { return mFrames; }

private:
    enum class Content { Frames, Tls, Other };

    struct Direction {
        TcpStream tcp;
        Content content = Content::Frames;
        std::uint64_t offset = 0; ///< of the first byte of `pending` within the stream
        std::string pending;      ///< the beginning of a frame
    };

    void pTakePacket(std::uint32_t linkType, const std::string& packet);
    void pTake(const TcpSegment& segment);
    bool pDecodeFrame(const std::string& stream, Direction& direction);
    void pFinish(const std::string& stream, Direction& direction);
    void pReport(const std::string& stream, const Direction& direction, const std::string& reason);

    std::istream& mInput;
    const bool mIsPcapng;
    Sink mSink;
    std::map<std::string, Direction> mDirections;
    std::size_t mFrames = 0;
    std::size_t mOtherPackets = 0;
};

} // namespace qel::tool
