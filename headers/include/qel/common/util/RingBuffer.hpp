#pragma once

#include <array>
#include <cstddef>
#include <iterator>
#include <optional>
#include <utility>

namespace qel {

/// A history of the last N elements: when it is full, a new element replaces the oldest one. Iteration goes from the
/// newest element to the oldest.
///
/// Ownership: owns its elements, in place, and destroys an element when a newer one replaces it. A copy copies them.
/// T needs no default constructor.
/// Thread safety: that of a standard container: several threads may read, or one may write.
template <typename T, std::size_t N>
class RingBuffer {
    static_assert(N > 0, "a history holds at least one element");

public:
    /// Goes from the newest element to the oldest. Valid until the next push() and as long as the ring lives.
    class ConstIterator {
    public:
        using iterator_category = std::forward_iterator_tag;
        using value_type = T;
        using difference_type = std::ptrdiff_t;
        using pointer = const T*;
        using reference = const T&;

        /// Does not belong to a ring; it may only be assigned to and compared.
        ConstIterator() noexcept : mBuffer(nullptr), mOffset(0) {}

        reference operator*() const { return mBuffer->pAt(mOffset); }
        pointer operator->() const { return &mBuffer->pAt(mOffset); }

        ConstIterator& operator++() noexcept
        {
            ++mOffset;
            return *this;
        }

        ConstIterator operator++(int) noexcept
        {
            const ConstIterator before(*this);
            ++mOffset;
            return before;
        }

        friend bool operator==(const ConstIterator& left, const ConstIterator& right) noexcept
        {
            return left.mBuffer == right.mBuffer && left.mOffset == right.mOffset;
        }

        friend bool operator!=(const ConstIterator& left, const ConstIterator& right) noexcept
        {
            return !(left == right);
        }

    private:
        friend class RingBuffer;
        ConstIterator(const RingBuffer* buffer, std::size_t offset) noexcept : mBuffer(buffer), mOffset(offset) {}

        const RingBuffer* mBuffer; // borrowed
        std::size_t mOffset;       // 0 is the newest element
    };

    /// Constructs a new newest element in place; in a full ring it replaces the oldest one.
    /// @param arguments for the constructor of T; they must not refer to the element that is replaced, which is
    ///                  destroyed first
    /// @return the new element, valid until it is replaced
    /// @throws what the constructor of T throws; the ring then holds the elements it held, without the oldest if it was
    ///         full
    template <typename... Arguments>
    T& push(Arguments&&... arguments)
    {
        const std::size_t next = (mHead + 1) % N;
        if (mLength == N) --mLength; // before the element is destroyed, in case the constructor throws
        T& newest = mEntries[next].emplace(std::forward<Arguments>(arguments)...);
        mHead = next;
        ++mLength;
        return newest;
    }

    /// @return the newest element, valid until it is replaced; the ring must not be empty
    T& head() { return *mEntries[mHead]; }
    const T& head() const { return *mEntries[mHead]; }

    bool empty() const noexcept { return mLength == 0; }

    /// @return the number of elements, at most N
    std::size_t size() const noexcept { return mLength; }

    ConstIterator begin() const noexcept { return ConstIterator(this, 0); }
    ConstIterator end() const noexcept { return ConstIterator(this, mLength); }

private:
    /// @param offset the distance of the element from the newest one; below mLength
    const T& pAt(std::size_t offset) const { return *mEntries[(mHead + N - offset) % N]; }

    std::size_t mHead = 0;   // index of the newest element, if there is one
    std::size_t mLength = 0; // number of elements
    std::array<std::optional<T>, N> mEntries;
};

} // namespace qel
