#include "check/Draft.hpp"

#include <utility>

namespace qel::tool::check {

namespace {

constexpr std::size_t kOldHeader = 24;
constexpr std::size_t kOldPayload = 16; // an old frame has 40 bytes at least

std::string byteOf(unsigned int value) { return std::string(1, static_cast<char>(static_cast<unsigned char>(value))); }

} // namespace

std::string bigEndian16(unsigned int value) { return byteOf(value >> 8U) + byteOf(value); }

std::string bigEndian32(std::uint32_t value) { return bigEndian16(value >> 16U) + bigEndian16(value & 0xFFFFU); }

Draft& Draft::old()
{
    mOld = true;
    return *this;
}

Draft& Draft::payload(std::string bytes)
{
    mPayload = std::move(bytes);
    return *this;
}

Draft& Draft::callerId(std::uint32_t id)
{
    mCallerId = id;
    return *this;
}

Draft& Draft::flags(unsigned int flags)
{
    mFlags = flags;
    return *this;
}

Draft& Draft::pad(unsigned int length, char value)
{
    mPad = std::string(length, value);
    return *this;
}

Draft& Draft::padField(unsigned int length)
{
    mPadField = length;
    return *this;
}

Draft& Draft::msgLength(std::uint32_t length)
{
    mMsgLength = length;
    return *this;
}

Draft& Draft::dataLength(std::uint32_t length)
{
    mDataLength = length;
    return *this;
}

Draft& Draft::byte(std::size_t offset, unsigned int value)
{
    mOverlay += static_cast<char>(offset);
    mOverlay += static_cast<char>(static_cast<unsigned char>(value));
    return *this;
}

std::string Draft::bytes() const
{
    const bool needsPad = mOld && mPayload.size() < kOldPayload;
    const std::string pad = mPad.value_or(std::string(needsPad ? kOldPayload - mPayload.size() : 0, '\0'));
    const std::size_t header = mOld ? kOldHeader : 32;
    const auto length = static_cast<std::uint32_t>(header + mPayload.size() + pad.size());

    std::string frame("\xDE\xCA\xFF");
    frame += byteOf(mOld ? 0x00 : 0x20);
    frame += bigEndian32(mMsgLength.value_or(length));
    frame += bigEndian32(mCallerId.value_or(0));
    frame += bigEndian16(mFunction);
    frame += byteOf(mFlags);
    frame += byteOf(mPadField.value_or(static_cast<unsigned int>(pad.size())));
    frame += bigEndian32(mDataLength.value_or(static_cast<std::uint32_t>(mPayload.size())));
    frame += bigEndian16(mOperation);
    frame.resize(header, '\0'); // status, status detail, reserved
    frame += mPayload + pad;
    for (std::size_t i = 0; i + 1 < mOverlay.size(); i += 2)
        frame.at(static_cast<unsigned char>(mOverlay[i])) = mOverlay[i + 1];
    return frame;
}

} // namespace qel::tool::check
