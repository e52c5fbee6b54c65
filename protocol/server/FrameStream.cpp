#include "server/FrameStream.hpp"

#include <qel/common/QelMessage.hpp>

#include <algorithm>
#include <cstring>
#include <new>

namespace qel::protocol {

namespace {

/// Most frames fit and are read with one system call. Every console keeps this memory.
constexpr std::size_t kSmallAhead = 2048;

/// The longest frame fits. Only consoles that have sent a longer one than above keep this memory.
constexpr std::size_t kLargeAhead = QelMessage::MtuMax;

} // namespace

FrameStream::FrameStream(Stream& stream, ReadAhead readAhead)
    : mStream(stream), mAhead(readAhead == ReadAhead::Yes ? new char[kSmallAhead] : nullptr),
      mAheadSize(readAhead == ReadAhead::Yes ? kSmallAhead : 0)
{}

FrameStream::~FrameStream() = default;

void FrameStream::limitFrames(std::chrono::milliseconds timeout)
{
    mFrameTimeout = timeout;
    mHasDeadline = true; // that of the stream below: the next frame begins without
}

std::size_t FrameStream::read(char* buffer, std::size_t length)
{
    if (length == 0) return 0;
    if (mAheadBegin == mAheadEnd) {
        if (mIsTooSmall && length < mAheadSize) pGrow();
        if (length >= mAheadSize) {
            mIsTooSmall = mAheadSize == kSmallAhead;
            return pReceive(buffer, length);
        }
        mAheadBegin = 0;
        mAheadEnd = 0;
        mAheadEnd = pReceive(mAhead.get(), mAheadSize);
    }
    return pTake(buffer, length);
}

void FrameStream::write(const char* buffer, std::size_t length) { mStream.write(buffer, length); }

void FrameStream::close() { mStream.close(); }

void FrameStream::setReadDeadline(std::chrono::milliseconds timeout) { mStream.setReadDeadline(timeout); }

void FrameStream::setWriteDeadline(std::chrono::milliseconds timeout) { mStream.setWriteDeadline(timeout); }

/// Reads from the stream below, with the deadline of the frame or without one. Changing a deadline may cost a system
/// call, so it is changed only when there is something to wait for.
std::size_t FrameStream::pReceive(char* buffer, std::size_t length)
{
    if (mFrameTimeout > std::chrono::milliseconds::zero()) {
        if (mInFrame && !mIsTimed) {
            mStream.setReadDeadline(mFrameTimeout);
            mIsTimed = true;
            mHasDeadline = true;
        } else if (!mInFrame && mHasDeadline) {
            mStream.clearReadDeadline();
            mHasDeadline = false;
        }
    }
    const std::size_t count = mStream.read(buffer, length);
    if (count > 0) mInFrame = true;
    return count;
}

/// Without memory, nothing is read ahead any more.
void FrameStream::pGrow()
{
    mIsTooSmall = false;
    mAhead.reset(new (std::nothrow) char[kLargeAhead]);
    mAheadSize = mAhead != nullptr ? kLargeAhead : 0;
}

/// Copies what was read ahead. The copy is cheaper than the system calls that it saves.
std::size_t FrameStream::pTake(char* buffer, std::size_t length)
{
    const std::size_t count = std::min(length, mAheadEnd - mAheadBegin);
    if (count == 0) return 0;
    std::memcpy(buffer, mAhead.get() + mAheadBegin, count);
    mAheadBegin += count;
    mInFrame = true;
    return count;
}

} // namespace qel::protocol
