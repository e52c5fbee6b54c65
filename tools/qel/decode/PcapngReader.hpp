#pragma once

#include <cstdint>
#include <istream>
#include <string>
#include <vector>

namespace qel::tool {

/// Reads the packets of a pcapng file: both byte orders, several sections and interfaces. Blocks of other kinds are
/// skipped.
/// Lifetime: borrows the input. Thread safety: one thread.
class PcapngReader {
public:
    explicit PcapngReader(std::istream& input) : mInput(input) {}

    /// @param linkType  set to that of the packet's interface
    /// @return false at the end of the file
    /// @throws CommandFailure  Refused: the file is cut short or damaged
    bool next(std::uint32_t& linkType, std::string& packet);

private:
    bool pReadBlock(std::uint32_t& type, std::string& body);
    std::uint32_t pNumber(const std::string& bytes, std::size_t at, std::size_t width = 4) const;
    std::uint32_t pLinkType(std::uint32_t interface) const;

    std::istream& mInput;
    bool mIsBigEndian = false;
    std::vector<std::uint32_t> mLinkTypes; // of the interfaces of the section
};

} // namespace qel::tool
