#include "decode/PcapReader.hpp"

#include "base/Failures.hpp"

#include <algorithm>

namespace qel::tool {

namespace {

constexpr std::size_t kFileHeaderBytes = 24;
constexpr std::size_t kLinkTypeAt = 20;
constexpr std::size_t kPacketHeaderBytes = 16;
constexpr std::size_t kStoredLengthAt = 8;
constexpr std::uint32_t kMaxPacketBytes = 1024 * 1024; // files hold 256 KiB at most

// The magic number as a big-endian writer stores it: microseconds, nanoseconds.
const std::string kMicroseconds("\xA1\xB2\xC3\xD4", 4);
const std::string kNanoseconds("\xA1\xB2\x3C\x4D", 4);
const std::string kPcapng("\x0A\x0D\x0D\x0A", 4);

std::string reversed(const std::string& bytes) { return std::string(bytes.rbegin(), bytes.rend()); }

bool isBigEndian(const std::string& magic) { return magic == kMicroseconds || magic == kNanoseconds; }

/// @return fewer bytes at the end of the input
std::string readBytes(std::istream& input, std::size_t length)
{
    std::string bytes(length, '\0');
    input.read(bytes.data(), static_cast<std::streamsize>(length));
    bytes.resize(static_cast<std::size_t>(input.gcount()));
    return bytes;
}

[[noreturn]] void refuse(const std::string& reason) { throw CommandFailure(ExitStatus::Refused, reason); }

} // namespace

bool PcapReader::isPcap(const std::string& magic) { return isBigEndian(magic) || isBigEndian(reversed(magic)); }

bool PcapReader::isPcapng(const std::string& magic) { return magic == kPcapng; }

PcapReader::PcapReader(std::istream& input) : mInput(input)
{
    const std::string header = readBytes(input, kFileHeaderBytes);
    if (header.size() < kFileHeaderBytes) refuse("the capture ends in its header");
    mIsBigEndian = isBigEndian(header.substr(0, kMagicBytes));
    constexpr std::uint32_t kTypeBits = 0x0FFFFFFF; // the upper bits tell about checksums
    mLinkType = pNumber(header, kLinkTypeAt) & kTypeBits;
}

bool PcapReader::next(std::string& packet)
{
    const std::string header = readBytes(mInput, kPacketHeaderBytes);
    if (header.empty()) return false;
    if (header.size() < kPacketHeaderBytes) refuse("the capture ends in the header of a packet");
    const std::uint32_t length = pNumber(header, kStoredLengthAt);
    if (length > kMaxPacketBytes) refuse("the capture is damaged: a packet of " + std::to_string(length) + " bytes");
    packet = readBytes(mInput, length);
    if (packet.size() < length) refuse("the capture ends within a packet");
    return true;
}

std::uint32_t PcapReader::pNumber(const std::string& header, std::size_t at) const
{
    std::uint32_t number = 0;
    for (std::size_t i = 0; i < sizeof(number); ++i) {
        const std::size_t place = mIsBigEndian ? i : sizeof(number) - 1 - i;
        number = number << 8 | static_cast<unsigned char>(header[at + place]);
    }
    return number;
}

} // namespace qel::tool
