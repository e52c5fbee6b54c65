#pragma once

#include <qel/common/QelMessage.hpp>

#include <cstdint>
#include <istream>
#include <memory>
#include <string>

namespace qel::tool {

/// Takes frames that lie back to back out of a stream of bytes, one after the other, and says what is wrong with those
/// that are none.
///
/// Lifetime: borrows the input, which must outlive this object. Thread safety: one thread.
class FrameDecoder {
public:
    /// One frame, or what stands in the place of one.
    struct Item {
        std::uint64_t offset = 0;            ///< of its first byte within the input
        std::unique_ptr<QelMessage> message; ///< null: it is no frame
        std::string reason;                  ///< what is wrong with it; empty: nothing
    };

    explicit FrameDecoder(std::istream& input);
    FrameDecoder(const FrameDecoder&) = delete;
    FrameDecoder& operator=(const FrameDecoder&) = delete;

    /// Takes the next one. After one whose length cannot be believed there is no next one: where the frame behind it
    /// begins is not known.
    ///
    /// A frame of a known message whose payload is not what that message must have is a plain QelMessage, and the
    /// reason says why. A response that carries a status may leave its payload out; nothing is wrong with that.
    /// @return false at the end of the input
    bool next(Item& item);

    /// Bytes taken so far.
    std::uint64_t offset() const noexcept { return mOffset; }

private:
    std::size_t pTake(char* buffer, std::size_t length);
    void pDecode(Item& item);

    std::istream& mInput;
    std::uint64_t mOffset = 0;
    bool mLost = false; // the boundaries of the frames
};

} // namespace qel::tool
