#include "hypervisor/OutputHistory.hpp"

#include <algorithm>
#include <cstring>

namespace qel::protocol {

namespace {

/// The first memory that a history takes.
constexpr std::size_t kFirstCapacity = 4096;

} // namespace

void OutputHistory::reserve(std::size_t length)
{
    const std::size_t wanted = length > mLimit - std::min(mSize, mLimit) ? mLimit : mSize + length;
    if (wanted <= mRing.size()) return;
    pResize(std::min(mLimit, std::max({wanted, 2 * mRing.size(), kFirstCapacity})));
}

void OutputHistory::append(const char* data, std::size_t length) noexcept
{
    const std::size_t kept = std::min(length, mRing.size());
    pWrite(data + (length - kept), kept);
    mEnd += length;
    mSize = kept < length ? kept : std::min(mSize + length, mRing.size());
}

OutputHistory::Piece OutputHistory::piece(std::uint64_t from, std::size_t most) const noexcept
{
    if (from >= mEnd) return {nullptr, 0};
    const std::size_t index = pIndex(from);
    const std::size_t left = std::min(static_cast<std::size_t>(mEnd - from), mRing.size() - index);
    return {mRing.data() + index, std::min(left, most)};
}

void OutputHistory::setLimit(std::size_t limit)
{
    if (limit < mRing.size()) pResize(limit);
    mLimit = limit;
}

/// Takes memory anew, with the newest bytes that fit. @param capacity  more than 0
void OutputHistory::pResize(std::size_t capacity)
{
    std::vector<char> ring(capacity);
    const std::size_t size = std::min(mSize, capacity);
    std::size_t copied = 0;
    while (copied < size) {
        const Piece next = piece(mEnd - size + copied, size - copied);
        std::memcpy(ring.data() + copied, next.data, next.length);
        copied += next.length;
    }
    mRing.swap(ring);
    mSize = size;
    mNext = size % capacity;
}

void OutputHistory::pWrite(const char* data, std::size_t length) noexcept
{
    if (length == 0) return;
    const std::size_t first = std::min(length, mRing.size() - mNext);
    std::memcpy(mRing.data() + mNext, data, first);
    std::memcpy(mRing.data(), data + first, length - first);
    mNext = (mNext + length) % mRing.size();
}

/// @param offset  of a byte that is kept
std::size_t OutputHistory::pIndex(std::uint64_t offset) const noexcept
{
    const auto back = static_cast<std::size_t>(mEnd - offset); // in [1, mSize]
    return (mNext + mRing.size() - back) % mRing.size();
}

} // namespace qel::protocol
