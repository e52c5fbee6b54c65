#include "decode/PcapngReader.hpp"

#include "base/Failures.hpp"

#include <algorithm>

namespace qel::tool {

namespace {

constexpr std::uint32_t kSection = 0x0A0D0D0A; // the same in both byte orders
constexpr std::uint32_t kInterface = 1;
constexpr std::uint32_t kSimplePacket = 3;
constexpr std::uint32_t kPacket = 6;
constexpr std::size_t kAround = 12; // bytes of a block besides its body
constexpr std::uint32_t kMaxBlock = 16 * 1024 * 1024;

[[noreturn]] void refuse(const std::string& reason) { throw CommandFailure(ExitStatus::Refused, reason); }

std::string readBytes(std::istream& input, std::size_t length)
{
    std::string bytes(length, '\0');
    input.read(bytes.data(), static_cast<std::streamsize>(length));
    bytes.resize(static_cast<std::size_t>(input.gcount()));
    return bytes;
}

} // namespace

bool PcapngReader::next(std::uint32_t& linkType, std::string& packet)
{
    std::uint32_t type = 0;
    std::string body;
    while (pReadBlock(type, body)) {
        if (type == kSection) mLinkTypes.clear();
        if (type == kInterface) mLinkTypes.push_back(pNumber(body, 0, 2));
        const bool isSimple = type == kSimplePacket;
        if (!isSimple && type != kPacket) continue;
        const std::size_t header = isSimple ? 4 : 20;
        const std::size_t stored =
            isSimple ? std::min<std::size_t>(pNumber(body, 0), body.size() - std::min(body.size(), header))
                     : pNumber(body, 12);
        if (body.size() < header || stored > body.size() - header)
            refuse("the capture is damaged: a packet is longer than its block");
        linkType = pLinkType(isSimple ? 0 : pNumber(body, 0));
        packet = body.substr(header, stored);
        return true;
    }
    return false;
}

/// @return false at the end of the file
bool PcapngReader::pReadBlock(std::uint32_t& type, std::string& body)
{
    std::string head = readBytes(mInput, 8);
    if (head.empty()) return false;
    if (head.size() < 8) refuse("the capture ends in the header of a block");
    type = pNumber(head, 0);
    if (type == kSection) {
        // Its body begins with a number that tells the byte order, also of the length before it.
        const std::string order = readBytes(mInput, 4);
        const std::string big("\x1A\x2B\x3C\x4D", 4);
        mIsBigEndian = order == big;
        if (!mIsBigEndian && std::string(order.rbegin(), order.rend()) != big)
            refuse("the capture is damaged: a section without a byte order");
        head += order;
    }
    const std::uint32_t length = pNumber(head, 4);
    if (length < kAround || length % 4 != 0 || length > kMaxBlock || length < head.size() + 4)
        refuse("the capture is damaged: a block of " + std::to_string(length) + " bytes");
    const std::size_t rest = length - head.size();
    body = head.substr(8) + readBytes(mInput, rest);
    if (body.size() < length - 8) refuse("the capture ends within a block");
    body.resize(length - kAround); // without the length at its end
    return true;
}

std::uint32_t PcapngReader::pNumber(const std::string& bytes, std::size_t at, std::size_t width) const
{
    std::uint32_t number = 0;
    for (std::size_t i = 0; i < width; ++i) {
        const std::size_t place = at + (mIsBigEndian ? i : width - 1 - i);
        number = number << 8 | (place < bytes.size() ? static_cast<unsigned char>(bytes[place]) : 0U);
    }
    return number;
}

std::uint32_t PcapngReader::pLinkType(std::uint32_t interface) const
{
    if (interface >= mLinkTypes.size())
        refuse("the capture is damaged: a packet of an interface that it does not have");
    return mLinkTypes[interface];
}

} // namespace qel::tool
