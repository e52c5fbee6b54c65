#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace qel::tool::check {

/// A frame of the peer, taken apart by the tables of docs/wire-format.md, without the message classes of the library.
/// Thread safety: that of a plain value.
struct Frame {
    std::string bytes;
    unsigned int version = 0; ///< mHeaderVersion
    std::uint32_t callerId = 0;
    unsigned int function = 0;
    unsigned int operation = 0;
    unsigned int flags = 0;
    unsigned int padLength = 0;
    unsigned int status = 0;
    unsigned int statusDetail = 0;
    std::string payload;

    bool isResponse() const noexcept { return (flags & 0xC0U) == 0x40; }
    bool isNotice() const noexcept { return (flags & 0xC0U) == 0; }
    bool is(unsigned int aFunction, unsigned int anOperation) const noexcept
    {
        return function == aFunction && operation == anOperation;
    }

    /// Integers of the payload; 0 beyond its end.
    unsigned int byteAt(std::size_t offset) const;
    unsigned int u16At(std::size_t offset) const;
    std::uint32_t u32At(std::size_t offset) const;
};

/// Takes a frame apart. @param bytes  all of it
/// @throws Failure  it breaks the rules of docs/wire-format.md#frame
Frame parseFrame(const std::string& bytes);

/// What a frame is, in one line: "response 0x6003/0x0107 GetQelTod, id 0x00000005, status 0, 40 bytes", or what is
/// wrong with it.
std::string describeFrame(const std::string& bytes);

/// What the message of a frame holds, one line for each field, as "qel decode" prints it. Empty for a message without
/// fields and for a malformed frame.
std::vector<std::string> frameDetails(const std::string& bytes);

/// "0x6003/0x0107 GetQelTod"
std::string messageName(unsigned int function, unsigned int operation);

/// "23 (QelMessageStatusKrogSessionAlreadyOpen)"
std::string statusText(unsigned int status);

/// "0x" and digits. @param width  of the digits
std::string hexNumber(std::uint32_t value, int width);

} // namespace qel::tool::check
