#pragma once

#include <cstdint>
#include <istream>
#include <string>

namespace qel::tool {

/// Reads the packets of a pcap file: both byte orders, microseconds and nanoseconds.
/// Lifetime: borrows the input. Thread safety: one thread.
class PcapReader {
public:
    /// Bytes at the beginning of a file that tell what it is.
    static constexpr std::size_t kMagicBytes = 4;

    static bool isPcap(const std::string& magic);
    static bool isPcapng(const std::string& magic);

    /// Reads the header of the file.
    /// @throws CommandFailure  Refused: it is cut short
    explicit PcapReader(std::istream& input);

    std::uint32_t linkType() const noexcept { return mLinkType; }

    /// @return false at the end of the file
    /// @throws CommandFailure  Refused: the file is cut short, or a packet is longer than any that a file may hold
    bool next(std::string& packet);

private:
    std::uint32_t pNumber(const std::string& header, std::size_t at) const;

    std::istream& mInput;
    bool mIsBigEndian = false;
    std::uint32_t mLinkType = 0;
};

} // namespace qel::tool
