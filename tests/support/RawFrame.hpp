#pragma once

#include <optional>
#include <utility>
#include <vector>

/// @file
/// Frames for tests, built byte by byte without the library, so that a test can break them in any way.

namespace qel::test {

/// The bytes of one frame. Lengths and pad are consistent unless a test sets them.
/// Every field is big-endian; every setter returns the frame, for chaining.
class RawFrame {
public:
    /// A frame with a 32-byte header: version byte 0x20, no pad.
    static RawFrame newForm() { return RawFrame(0x20, 32); }
    /// A frame with a 24-byte header: version byte 0x00, padded up to 40 bytes.
    static RawFrame oldForm() { return RawFrame(0x00, 24); }

    /// The version byte alone; the header keeps its size.
    RawFrame& version(unsigned int value) { return set(mVersion, value); }
    /// The eyecatcher and the version byte are the first four bytes.
    RawFrame& eyecatcher(unsigned int first, unsigned int second, unsigned int third)
    {
        mEyecatcher[0] = first;
        mEyecatcher[1] = second;
        mEyecatcher[2] = third;
        return *this;
    }
    RawFrame& callerId(unsigned int value) { return set(mCallerId, value); }
    RawFrame& function(unsigned int value) { return set(mFunction, value); }
    RawFrame& flags(unsigned int value) { return set(mFlags, value); }
    RawFrame& operation(unsigned int value) { return set(mOperation, value); }
    RawFrame& status(unsigned int value) { return set(mStatus, value); }
    /// Written only to a 32-byte header.
    RawFrame& statusDetail(unsigned int value) { return set(mStatusDetail, value); }
    RawFrame& reserved2(unsigned int value) { return set(mReserved2, value); }
    RawFrame& reserved3(unsigned int value) { return set(mReserved3, value); }
    RawFrame& payload(std::vector<char> value)
    {
        mPayload = std::move(value);
        return *this;
    }
    /// The pad field and as many bytes after the payload.
    RawFrame& pad(unsigned int value)
    {
        mPad = value;
        return *this;
    }
    /// The length fields alone; the bytes stay as they are.
    RawFrame& msgLength(unsigned int value)
    {
        mMsgLength = value;
        return *this;
    }
    RawFrame& dataLength(unsigned int value)
    {
        mDataLength = value;
        return *this;
    }

    std::vector<char> bytes() const
    {
        const unsigned int payloadLength = static_cast<unsigned int>(mPayload.size());
        const unsigned int minimumPad = mHeaderLength == 24 && payloadLength <= 16 ? 16 - payloadLength : 0;
        const unsigned int padLength = mPad.value_or(minimumPad);

        std::vector<char> frame;
        for (const unsigned int byte : mEyecatcher)
            append(frame, 1, byte);
        append(frame, 1, mVersion);
        append(frame, 4, mMsgLength.value_or(mHeaderLength + payloadLength + padLength));
        append(frame, 4, mCallerId);
        append(frame, 2, mFunction);
        append(frame, 1, mFlags);
        append(frame, 1, padLength);
        append(frame, 4, mDataLength.value_or(payloadLength));
        append(frame, 2, mOperation);
        append(frame, 2, mStatus);
        if (mHeaderLength == 32) {
            append(frame, 2, mStatusDetail);
            append(frame, 2, mReserved2);
            append(frame, 4, mReserved3);
        }
        frame.insert(frame.end(), mPayload.begin(), mPayload.end());
        frame.insert(frame.end(), padLength, '\0');
        return frame;
    }

private:
    RawFrame(unsigned int version, unsigned int headerLength) : mVersion(version), mHeaderLength(headerLength) {}

    RawFrame& set(unsigned int& field, unsigned int value)
    {
        field = value;
        return *this;
    }

    static void append(std::vector<char>& frame, unsigned int width, unsigned int value)
    {
        for (unsigned int i = width; i > 0; --i) {
            frame.push_back(static_cast<char>(static_cast<unsigned char>(value >> (8 * (i - 1)))));
        }
    }

    unsigned int mEyecatcher[3] = {0xDE, 0xCA, 0xFF};
    unsigned int mVersion;
    unsigned int mHeaderLength; // bytes
    unsigned int mCallerId = 0;
    unsigned int mFunction = 0;
    unsigned int mFlags = 0;
    unsigned int mOperation = 0;
    unsigned int mStatus = 0;
    unsigned int mStatusDetail = 0;
    unsigned int mReserved2 = 0;
    unsigned int mReserved3 = 0;
    std::vector<char> mPayload;
    std::optional<unsigned int> mPad;
    std::optional<unsigned int> mMsgLength;
    std::optional<unsigned int> mDataLength;
};

} // namespace qel::test
