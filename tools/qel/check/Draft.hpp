#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace qel::tool::check {

/// Big-endian bytes of an integer.
std::string bigEndian16(unsigned int value);
std::string bigEndian32(std::uint32_t value);

/// A frame to be sent, right or wrong on purpose. Built byte by byte, without the message classes of the library, so
/// that a mistake in them does not hide one of the peer. Lengths and pad are consistent unless a case sets them.
/// Thread safety: that of a plain value.
class Draft {
public:
    static constexpr unsigned int kRequest = 0x80;  ///< mFlags
    static constexpr unsigned int kResponse = 0x40; ///< mFlags
    static constexpr unsigned int kNotice = 0x00;   ///< mFlags

    /// A frame with the new header, of 32 bytes.
    static Draft request(unsigned int function, unsigned int operation) { return Draft(function, operation, kRequest); }
    static Draft response(unsigned int function, unsigned int operation)
    {
        return Draft(function, operation, kResponse);
    }
    static Draft notice(unsigned int function, unsigned int operation) { return Draft(function, operation, kNotice); }

    // Every setter returns the frame, for chaining.

    /// The old header, of 24 bytes, with the pad that it needs.
    Draft& old();
    Draft& payload(std::string bytes);
    Draft& callerId(std::uint32_t id);
    Draft& flags(unsigned int flags);
    /// The pad field, and as many bytes of this value after the payload.
    Draft& pad(unsigned int length, char value = '\0');
    /// The pad field alone.
    Draft& padField(unsigned int length);
    /// The length fields alone; the bytes stay as they are.
    Draft& msgLength(std::uint32_t length);
    Draft& dataLength(std::uint32_t length);
    /// Any of the first 256 bytes of the frame, after everything else.
    /// @throws std::out_of_range  from bytes(): the frame is shorter
    Draft& byte(std::size_t offset, unsigned int value);

    unsigned int getFunction() const noexcept { return mFunction; }
    unsigned int getOperation() const noexcept { return mOperation; }
    std::optional<std::uint32_t> getCallerId() const noexcept { return mCallerId; }

    /// The frame; the caller id is 0 if none is set.
    std::string bytes() const;

private:
    Draft(unsigned int function, unsigned int operation, unsigned int flags)
        : mFunction(function), mOperation(operation), mFlags(flags)
    {}

    unsigned int mFunction;
    unsigned int mOperation;
    unsigned int mFlags;
    bool mOld = false;
    std::string mPayload;
    std::optional<std::uint32_t> mCallerId;
    std::optional<std::string> mPad;
    std::optional<unsigned int> mPadField;
    std::optional<std::uint32_t> mMsgLength;
    std::optional<std::uint32_t> mDataLength;
    std::string mOverlay; // pairs of offset and value
};

} // namespace qel::tool::check
