#pragma once

#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>
#include <memory>

namespace qel::protocol {

/// The stream below the messages of one connection. It gives each received frame a limited time from its first byte to
/// its last, and lets the time between two frames be unlimited: a peer that stops within a frame does not keep its
/// place for ever.
///
/// Lifetime: borrows the stream below. Thread safety: that of a Stream. limitFrames() and beginFrame() belong to the
/// reader.
class FrameStream final : public Stream {
public:
    /// Whether to read as much as has arrived, instead of what is asked for.
    enum class ReadAhead {
        No,  ///< for TLS, which reads ahead by itself, and whose failure within what is read drops all of it
        Yes, ///< for everything else: a frame costs one system call instead of two, and one for its deadline
    };

    FrameStream(Stream& stream, ReadAhead readAhead);
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
    void pGrow();
    std::size_t pReceive(char* buffer, std::size_t length);
    std::size_t pTake(char* buffer, std::size_t length);

    Stream& mStream;
    std::unique_ptr<char[]> mAhead;
    std::size_t mAheadSize;   // 0: no reading ahead
    bool mIsTooSmall = false; // a frame did not fit
    std::size_t mAheadBegin = 0;
    std::size_t mAheadEnd = 0;
    std::chrono::milliseconds mFrameTimeout{0}; // 0: frames have no limit of their own
    bool mInFrame = false;                      // a byte of the current frame has been read
    bool mIsTimed = false;                      // the deadline below is that of the current frame
    bool mHasDeadline = false;                  // the stream below has a deadline
};

} // namespace qel::protocol
