#include "server/RecordStream.hpp"

#include <algorithm>
#include <utility>

namespace qel::protocol {

namespace {

constexpr std::size_t kHeaderBytes = 5;
constexpr std::size_t kLengthOffset = 3; // two bytes, big-endian

} // namespace

RecordStream::RecordStream(std::unique_ptr<Stream> stream) : mStream(std::move(stream)) {}

RecordStream::~RecordStream() = default;

std::size_t RecordStream::read(char* buffer, std::size_t length)
{
    pLimit();
    const std::size_t count = mStream->read(buffer, length);
    pFollow(buffer, count);
    return count;
}

void RecordStream::write(const char* buffer, std::size_t length) { mStream->write(buffer, length); }

void RecordStream::close() { mStream->close(); }

void RecordStream::setReadDeadline(std::chrono::milliseconds timeout)
{
    mHasDeadline = timeout >= std::chrono::milliseconds::zero();
    mIsTimed = false;
    mStream->setReadDeadline(timeout);
}

void RecordStream::setWriteDeadline(std::chrono::milliseconds timeout) { mStream->setWriteDeadline(timeout); }

/// Before a read, which may have to wait.
void RecordStream::pLimit()
{
    if (mTimeout <= std::chrono::milliseconds::zero() || mHasDeadline || mIsTimed == pIsInRecord()) return;
    mIsTimed = pIsInRecord();
    if (mIsTimed) {
        mStream->setReadDeadline(mTimeout);
    } else {
        mStream->clearReadDeadline();
    }
}

void RecordStream::pFollow(const char* bytes, std::size_t length) noexcept
{
    while (length > 0) {
        if (mHeaderBytes == kHeaderBytes) {
            const std::size_t taken = std::min(length, mBodyBytes);
            bytes += taken;
            length -= taken;
            mBodyBytes -= taken;
        } else {
            if (mHeaderBytes == 0) mBodyBytes = 0;
            if (mHeaderBytes >= kLengthOffset) mBodyBytes = mBodyBytes << 8U | static_cast<unsigned char>(*bytes);
            ++mHeaderBytes;
            ++bytes;
            --length;
        }
        if (mHeaderBytes == kHeaderBytes && mBodyBytes == 0) mHeaderBytes = 0;
    }
}

} // namespace qel::protocol
