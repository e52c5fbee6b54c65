#include "server/FrameStream.hpp"

namespace qel::protocol {

FrameStream::~FrameStream() = default;

void FrameStream::limitFrames(std::chrono::milliseconds timeout)
{
    mFrameTimeout = timeout;
    mHasDeadline = true; // that of the stream below: the next frame begins without
}

std::size_t FrameStream::read(char* buffer, std::size_t length)
{
    if (length == 0) return 0;
    if (mFrameTimeout > std::chrono::milliseconds::zero()) pLimit();
    const std::size_t count = mStream.read(buffer, length);
    if (count > 0) mInFrame = true;
    return count;
}

void FrameStream::write(const char* buffer, std::size_t length) { mStream.write(buffer, length); }

void FrameStream::close() { mStream.close(); }

void FrameStream::setReadDeadline(std::chrono::milliseconds timeout) { mStream.setReadDeadline(timeout); }

void FrameStream::setWriteDeadline(std::chrono::milliseconds timeout) { mStream.setWriteDeadline(timeout); }

/// The next read has the deadline of the frame, or none. It costs nothing yet: see WireStream.
void FrameStream::pLimit()
{
    if (mInFrame && !mIsTimed) {
        mStream.setReadDeadline(mFrameTimeout);
        mIsTimed = true;
        mHasDeadline = true;
    } else if (!mInFrame && mHasDeadline) {
        mStream.clearReadDeadline();
        mHasDeadline = false;
    }
}

} // namespace qel::protocol
