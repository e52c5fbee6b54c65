#pragma once

#include <qel/common/QelMessageIdentifiers.hpp>

#include <cstddef>
#include <cstdint>

namespace qel::tool {

/// A direction of a proxied connection.
enum class Way { ToServer, ToConsole };

/// "to-server" or "to-console".
inline const char* wayText(Way way) { return way == Way::ToServer ? "to-server" : "to-console"; }

/// The fields of a frame's header, read in place. Only the length of the frame is known to be right: a field that lies
/// beyond its end is 0.
/// Lifetime: borrows the bytes. Thread safety: a plain value.
class FrameView {
public:
    FrameView(const char* bytes, std::size_t length) noexcept : mBytes(bytes), mLength(length) {}

    const char* bytes() const noexcept { return mBytes; }
    std::size_t length() const noexcept { return mLength; }

    std::uint32_t callerId() const noexcept { return number(8, 4); }
    std::uint16_t function() const noexcept { return static_cast<std::uint16_t>(number(12, 2)); }
    std::uint8_t flags() const noexcept { return static_cast<std::uint8_t>(number(14, 1)); }
    std::uint32_t dataLength() const noexcept { return number(16, 4); }
    std::uint16_t operation() const noexcept { return static_cast<std::uint16_t>(number(20, 2)); }
    std::uint16_t status() const noexcept { return static_cast<std::uint16_t>(number(22, 2)); }

    /// Bytes before the payload: 24 with the old header, 32 with any other.
    std::size_t headerLength() const noexcept { return number(3, 1) == 0 ? 24 : 32; }

    QelMessageClassification::Value kind() const noexcept
    {
        return QelMessageClassification::fromFlags(static_cast<QelMessageFlags>(flags()));
    }

    /// A big-endian integer of 1 to 4 bytes; 0 if the frame ends before it does.
    std::uint32_t number(std::size_t at, std::size_t width) const noexcept
    {
        if (at > mLength || width > mLength - at) return 0;
        std::uint32_t value = 0;
        for (std::size_t i = 0; i < width; ++i)
            value = value << 8 | static_cast<unsigned char>(mBytes[at + i]);
        return value;
    }

private:
    const char* mBytes;
    std::size_t mLength;
};

} // namespace qel::tool
