#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

namespace qel::tool {

/// What one packet carries of a TCP stream.
struct TcpSegment {
    std::string stream;         ///< one direction of a connection: "127.0.0.1:40000 > 127.0.0.1:4711"
    std::uint32_t sequence = 0; ///< of the first byte of the payload
    bool begins = false;        ///< the connection begins with it (SYN)
    std::string payload;
};

/// True for the link types whose packets tcpSegmentOf() reads: Ethernet, Linux cooked (1 and 2), raw IP, loopback.
bool isKnownLinkType(std::uint32_t linkType);

/// Reads a captured packet: IPv4 or IPv6 with TCP.
/// @param linkType  as pcap numbers it
/// @return none for everything else, and for fragments
std::optional<TcpSegment> tcpSegmentOf(std::uint32_t linkType, const std::string& packet);

/// Puts the segments of one stream in order. Thread safety: one thread.
class TcpStream {
public:
    /// @param data  what continues the stream without a gap is appended
    void take(const TcpSegment& segment, std::string& data);

    /// Bytes that wait for a segment before them. Beyond kMaxWaiting they are dropped.
    std::size_t waitingBytes() const noexcept { return mWaitingBytes; }

    static constexpr std::size_t kMaxWaiting = 1024 * 1024;

private:
    bool pAppend(std::uint32_t sequence, const std::string& payload, std::string& data);

    std::optional<std::uint32_t> mNext; // sequence number
    std::map<std::uint32_t, std::string> mWaiting;
    std::size_t mWaitingBytes = 0;
};

} // namespace qel::tool
