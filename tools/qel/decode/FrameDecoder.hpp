#pragma once

#include <qel/common/QelMessage.hpp>

#include <cstdint>
#include <istream>
#include <memory>
#include <string>

namespace qel::tool {

/// Reads consecutive frames from a stream of bytes and reports the malformed ones.
///
/// Lifetime: borrows the input, which must outlive this object. Thread safety: one thread.
class FrameDecoder {
public:
    /// A frame, or a malformed one.
    struct Item {
        std::string stream;                  ///< of a capture: "127.0.0.1:40000 > 127.0.0.1:4711"; else empty
        std::uint64_t offset = 0;            ///< of its first byte within the input, or within the stream
        std::unique_ptr<QelMessage> message; ///< null: the frame is malformed
        std::string reason;                  ///< what is wrong with it; empty: nothing
    };

    explicit FrameDecoder(std::istream& input);
    FrameDecoder(const FrameDecoder&) = delete;
    FrameDecoder& operator=(const FrameDecoder&) = delete;

    /// Reads the next frame. After a malformed length there is no next frame, since its beginning is unknown.
    ///
    /// A known message with a malformed payload becomes a plain QelMessage with a reason. A response with a status
    /// other than zero may omit its payload.
    /// @return false at the end of the input, and after a malformed length
    bool next(Item& item);

    /// Decodes one frame that is in memory: sets the message and the reason, as next() does.
    /// @param length  bytes of the frame, which its header gives too
    static void decode(const char* frame, unsigned int length, Item& item);

    /// Bytes read so far.
    std::uint64_t offset() const noexcept { return mOffset; }

private:
    std::size_t pTake(char* buffer, std::size_t length);
    void pDecode(Item& item);

    std::istream& mInput;
    std::uint64_t mOffset = 0;
    bool mLost = false; // where the next frame begins is unknown
};

} // namespace qel::tool
