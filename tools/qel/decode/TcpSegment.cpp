#include "decode/TcpSegment.hpp"

#include <algorithm>
#include <arpa/inet.h>
#include <array>

namespace qel::tool {

namespace {

enum LinkType : std::uint32_t {
    kNull = 0,
    kEthernet = 1,
    kRawOld = 12,
    kRaw = 101,
    kLoop = 108,
    kLinuxCooked = 113,
    kIPv4 = 228,
    kIPv6 = 229,
    kLinuxCooked2 = 276,
};

constexpr unsigned int kEtherIPv4 = 0x0800;
constexpr unsigned int kEtherIPv6 = 0x86DD;
constexpr unsigned int kEtherVlan = 0x8100;
constexpr unsigned int kEtherVlanOuter = 0x88A8;
constexpr unsigned int kTcp = 6;

/// A packet, read from front to back; beyond its end there are zeros.
class Reader {
public:
    explicit Reader(const std::string& bytes) : mBytes(bytes) {}

    unsigned int byte(std::size_t at) const
    {
        return mBegin + at < mBytes.size() ? static_cast<unsigned char>(mBytes[mBegin + at]) : 0;
    }
    unsigned int two(std::size_t at) const { return byte(at) << 8 | byte(at + 1); }
    std::uint32_t four(std::size_t at) const { return two(at) << 16 | two(at + 2); }
    std::string text(std::size_t at, std::size_t length) const
    {
        return mBegin + at < mBytes.size() ? mBytes.substr(mBegin + at, length) : std::string();
    }
    void skip(std::size_t bytes) { mBegin += bytes; }
    bool has(std::size_t bytes) const { return mBytes.size() >= mBegin && mBytes.size() - mBegin >= bytes; }
    std::size_t rest() const { return mBytes.size() - std::min(mBegin, mBytes.size()); }

private:
    const std::string& mBytes;
    std::size_t mBegin = 0;
};

/// Skips the header of the link. @return the protocol as Ethernet numbers it; 0 for an unknown one
unsigned int skipLink(std::uint32_t linkType, Reader& packet)
{
    unsigned int protocol = 0;
    switch (linkType) {
    case kEthernet: {
        protocol = packet.two(12);
        packet.skip(14);
        while (protocol == kEtherVlan || protocol == kEtherVlanOuter) {
            protocol = packet.two(2);
            packet.skip(4);
        }
        return protocol;
    }
    case kLinuxCooked:
        protocol = packet.two(14);
        packet.skip(16);
        return protocol;
    case kLinuxCooked2:
        protocol = packet.two(0);
        packet.skip(20);
        return protocol;
    case kNull:
    case kLoop:
        packet.skip(4); // the address family, in the numbers of the system that captured; the IP version says enough
        break;
    default:
        break;
    }
    const unsigned int version = packet.byte(0) >> 4;
    if (version == 4) return kEtherIPv4;
    return version == 6 ? kEtherIPv6 : 0;
}

std::string addressText(int family, const std::string& bytes)
{
    std::array<char, INET6_ADDRSTRLEN> text{};
    if (::inet_ntop(family, bytes.data(), text.data(), text.size()) == nullptr) return "?";
    return family == AF_INET6 ? "[" + std::string(text.data()) + "]" : std::string(text.data());
}

struct Network {
    std::string source;
    std::string destination;
    std::size_t payloadBytes = 0;
};

std::optional<Network> skipIPv4(Reader& packet)
{
    constexpr std::size_t kMinHeader = 20;
    const std::size_t header = (packet.byte(0) & 0x0F) * std::size_t{4};
    const std::size_t total = packet.two(2);
    const bool isFragment = (packet.two(6) & 0x3FFF) != 0; // more fragments, or an offset
    if (header < kMinHeader || !packet.has(header) || isFragment || packet.byte(9) != kTcp) return std::nullopt;
    // Segmentation offload leaves the length empty.
    const std::size_t length = total == 0 ? packet.rest() : total;
    if (length < header) return std::nullopt;
    Network network{addressText(AF_INET, packet.text(12, 4)), addressText(AF_INET, packet.text(16, 4)),
                    length - header};
    packet.skip(header);
    return network;
}

std::optional<Network> skipIPv6(Reader& packet)
{
    constexpr std::size_t kHeader = 40;
    if (!packet.has(kHeader)) return std::nullopt;
    std::size_t length = packet.two(4);
    unsigned int next = packet.byte(6);
    const std::string source = addressText(AF_INET6, packet.text(8, 16));
    const std::string destination = addressText(AF_INET6, packet.text(24, 16));
    packet.skip(kHeader);
    if (length == 0) length = packet.rest();
    constexpr unsigned int kHopByHop = 0;
    constexpr unsigned int kRouting = 43;
    constexpr unsigned int kDestination = 60;
    while (next == kHopByHop || next == kRouting || next == kDestination) {
        const std::size_t extension = (packet.byte(1) + std::size_t{1}) * 8;
        if (!packet.has(extension) || length < extension) return std::nullopt;
        next = packet.byte(0);
        packet.skip(extension);
        length -= extension;
    }
    if (next != kTcp) return std::nullopt;
    return Network{source, destination, length};
}

std::optional<TcpSegment> readTcp(const Network& network, Reader& packet)
{
    constexpr std::size_t kMinHeader = 20;
    constexpr unsigned int kSyn = 0x02;
    const std::size_t header = (packet.byte(12) >> 4) * std::size_t{4};
    if (header < kMinHeader || !packet.has(header) || network.payloadBytes < header) return std::nullopt;
    TcpSegment segment;
    segment.stream = network.source + ":" + std::to_string(packet.two(0)) + " > " + network.destination + ":" +
                     std::to_string(packet.two(2));
    segment.begins = (packet.byte(13) & kSyn) != 0;
    segment.sequence = packet.four(4) + (segment.begins ? 1 : 0); // SYN takes a number
    segment.payload = packet.text(header, network.payloadBytes - header);
    return segment;
}

} // namespace

bool isKnownLinkType(std::uint32_t linkType)
{
    constexpr std::array<std::uint32_t, 9> kKnown{kNull,        kEthernet, kRawOld, kRaw,         kLoop,
                                                  kLinuxCooked, kIPv4,     kIPv6,   kLinuxCooked2};
    return std::find(kKnown.begin(), kKnown.end(), linkType) != kKnown.end();
}

std::optional<TcpSegment> tcpSegmentOf(std::uint32_t linkType, const std::string& packet)
{
    Reader reader(packet);
    const unsigned int protocol = skipLink(linkType, reader);
    std::optional<Network> network;
    if (protocol == kEtherIPv4) network = skipIPv4(reader);
    if (protocol == kEtherIPv6) network = skipIPv6(reader);
    return network ? readTcp(*network, reader) : std::nullopt;
}

void TcpStream::take(const TcpSegment& segment, std::string& data)
{
    if (segment.begins && !mNext) mNext = segment.sequence;
    if (segment.payload.empty()) return;
    if (!mNext) mNext = segment.sequence; // the capture began after the connection
    if (!pAppend(segment.sequence, segment.payload, data)) {
        if (mWaitingBytes + segment.payload.size() > kMaxWaiting) return;
        if (mWaiting.emplace(segment.sequence, segment.payload).second) mWaitingBytes += segment.payload.size();
        return;
    }
    for (auto waiting = mWaiting.begin(); waiting != mWaiting.end();) {
        if (!pAppend(waiting->first, waiting->second, data)) {
            ++waiting;
            continue;
        }
        mWaitingBytes -= waiting->second.size();
        mWaiting.erase(waiting);
        waiting = mWaiting.begin(); // the one that follows may come before it in the map
    }
}

/// @return false: there is a gap before the payload
bool TcpStream::pAppend(std::uint32_t sequence, const std::string& payload, std::string& data)
{
    const auto ahead = static_cast<std::int32_t>(sequence - *mNext); // the numbers wrap around
    if (ahead > 0) return false;
    const auto known = static_cast<std::size_t>(-static_cast<std::int64_t>(ahead));
    if (known >= payload.size()) return true; // sent again
    data += payload.substr(known);
    *mNext += static_cast<std::uint32_t>(payload.size() - known);
    return true;
}

} // namespace qel::tool
