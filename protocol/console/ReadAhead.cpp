#include "console/ReadAhead.hpp"

#include <qel/common/io/StreamIOException.hpp>

#include "base/StreamFailure.hpp"

#include <algorithm>
#include <cstring>

namespace qel::protocol {

bool ReadAhead::awaitBytes(std::chrono::milliseconds timeout)
{
    if (hasBytes() || mHasEnded) return true;
    mStream->setReadDeadline(timeout);
    try {
        mFirst = 0;
        mLast = mStream->read(mBuffer.data(), mBuffer.size());
        mHasEnded = mLast == 0;
        return true;
    } catch (const StreamIOException& error) {
        mLast = 0;
        if (!isDeadline(error)) throw;
        return false;
    }
}

std::size_t ReadAhead::read(char* buffer, std::size_t length)
{
    if (!hasBytes()) return mHasEnded || !mIsWaiting ? 0 : mStream->read(buffer, length);
    const std::size_t count = std::min(length, mLast - mFirst);
    std::memcpy(buffer, mBuffer.data() + mFirst, count);
    mFirst += count;
    return count;
}

} // namespace qel::protocol
