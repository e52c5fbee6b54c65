#pragma once

#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>

namespace qel::protocol {

/// The stream below the messages of one connection. It gives each received frame a limited time from its first byte to
/// its last, and lets the time between two frames be unlimited: a peer that stops within a frame does not keep its
/// place for ever.
///
/// Lifetime: borrows the stream below. Thread safety: that of a Stream. limitFrames() and beginFrame() belong to the
/// reader.
class FrameStream final : public Stream {
public:
    /// @param stream  may read ahead: what it has read before beginFrame() takes no time from a frame
    explicit FrameStream(Stream& stream) : mStream(stream) {}
    ~FrameStream() override;

    /// From the next frame on, each has this time from its first byte to its last. Until then the deadlines of the
    /// stream below are left alone.
    /// @param timeout  more than 0
    void limitFrames(std::chrono::milliseconds timeout);

    /// What is read next is the beginning of a frame. Bytes that were read ahead count as read from here on: a reader
    /// that was held back does not take time from its peer.
    void beginFrame() noexcept
    {
        mInFrame = false;
        mIsTimed = false;
    }

    /// True when a failure of the stream was one within a frame.
    bool isInFrame() const noexcept { return mInFrame; }

    std::size_t read(char* buffer, std::size_t length) override;
    void write(const char* buffer, std::size_t length) override;
    void close() override;
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

private:
    void pLimit();

    Stream& mStream;
    std::chrono::milliseconds mFrameTimeout{0}; // 0: frames have no limit of their own
    bool mInFrame = false;                      // a byte of the current frame has been read
    bool mIsTimed = false;                      // the deadline below is that of the current frame
    bool mHasDeadline = false;                  // the stream below has a deadline
};

} // namespace qel::protocol
