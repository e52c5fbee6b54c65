#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace qel::protocol {

/// The newest output of a partition: a ring of bytes that grows as they come, up to a limit; then the oldest go. A byte
/// is named by its offset in all output since the partition was added, so that a reader who falls behind knows how much
/// it has missed.
/// Thread safety: none of its own.
class OutputHistory {
public:
    /// A part of the history in one piece. Valid until the history changes.
    struct Piece {
        const char* data;
        std::size_t length; ///< 0: there is none
    };

    /// @param limit  bytes; more than 0
    explicit OutputHistory(std::size_t limit) : mLimit(limit) {}

    /// The offset of the oldest byte that is kept.
    std::uint64_t begin() const noexcept { return mEnd - mSize; }
    /// The offset after the newest byte.
    std::uint64_t end() const noexcept { return mEnd; }
    /// Bytes of memory taken.
    std::size_t capacity() const noexcept { return mRing.size(); }

    /// Makes append() keep the next `length` bytes, and as many of the older ones as the limit allows.
    /// @throws std::bad_alloc  nothing has changed
    void reserve(std::size_t length);

    /// Adds bytes. Without a reserve() before it, older bytes, and what exceeds the memory taken, may be lost: never
    /// the count of them.
    void append(const char* data, std::size_t length) noexcept;

    /// @param from  in [begin(), end()]
    /// @param most  bytes of the piece
    Piece piece(std::uint64_t from, std::size_t most) const noexcept;

    /// Changes the limit; the newest bytes stay. @param limit  more than 0 @throws std::bad_alloc  nothing has changed
    void setLimit(std::size_t limit);

private:
    void pResize(std::size_t capacity);
    void pWrite(const char* data, std::size_t length) noexcept;
    std::size_t pIndex(std::uint64_t offset) const noexcept;

    std::size_t mLimit;
    std::vector<char> mRing;
    std::size_t mNext = 0;  ///< index in the ring of the next byte; 0 while the ring is empty
    std::size_t mSize = 0;  ///< bytes kept
    std::uint64_t mEnd = 0; ///< offset of the next byte
};

} // namespace qel::protocol
