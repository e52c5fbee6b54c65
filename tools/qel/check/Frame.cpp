#include "check/Frame.hpp"

#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Library.hpp"
#include "check/Case.hpp"
#include "decode/FrameDecoder.hpp"

#include <cstdio>
#include <sstream>
#include <utility>

namespace qel::tool::check {

namespace {

constexpr std::size_t kNewHeader = 32;
constexpr std::size_t kOldHeader = 24;
constexpr std::size_t kOldFrame = 40; // at least

std::uint32_t number(const std::string& bytes, std::size_t offset, std::size_t width)
{
    std::uint32_t value = 0;
    for (std::size_t i = 0; i < width; ++i) {
        const std::size_t at = offset + i;
        value = value << 8U | (at < bytes.size() ? static_cast<unsigned char>(bytes[at]) : 0U);
    }
    return value;
}

/// What is wrong with a frame; empty: nothing.
std::string faultOf(const std::string& bytes)
{
    if (bytes.size() < kOldHeader) return "it is shorter than a header";
    if (bytes.compare(0, 3, "\xDE\xCA\xFF") != 0) return "its eyecatcher is wrong";
    const std::uint32_t version = number(bytes, 3, 1);
    if (version != 0x20 && version != 0x00) return "its header version is " + hexNumber(version, 2);
    const std::size_t header = version == 0x20 ? kNewHeader : kOldHeader;
    const std::uint64_t pad = number(bytes, 15, 1);
    const std::uint64_t data = number(bytes, 16, 4);
    if (number(bytes, 4, 4) != bytes.size() || header + data + pad != bytes.size()) return "its lengths contradict";
    if (version == 0x00 && bytes.size() < kOldFrame) return "its pad is too short for the old header";
    return {};
}

FrameDecoder::Item decode(const std::string& bytes)
{
    std::istringstream input(bytes);
    FrameDecoder decoder(input);
    FrameDecoder::Item item;
    decoder.next(item);
    return item;
}

const char* kindName(unsigned int flags)
{
    switch (flags & 0xC0U) {
    case 0x80:
        return "request ";
    case 0x40:
        return "response ";
    case 0x00:
        return "notice ";
    default:
        return "request and response ";
    }
}

constexpr std::size_t kShownBytes = 16; // of what is not a frame

std::string describeBytes(const std::string& bytes)
{
    const std::string shown = hexDigits(bytes.substr(0, kShownBytes));
    return std::to_string(bytes.size()) + (bytes.size() == 1 ? " byte: " : " bytes: ") + shown +
           (bytes.size() > kShownBytes ? "..." : "");
}

} // namespace

unsigned int Frame::byteAt(std::size_t offset) const { return number(payload, offset, 1); }
unsigned int Frame::u16At(std::size_t offset) const { return number(payload, offset, 2); }
std::uint32_t Frame::u32At(std::size_t offset) const { return number(payload, offset, 4); }

Frame parseFrame(const std::string& bytes)
{
    const std::string fault = faultOf(bytes);
    if (!fault.empty()) throw Failure("a well-formed frame", describeBytes(bytes) + ": " + fault);
    Frame frame;
    frame.bytes = bytes;
    frame.version = number(bytes, 3, 1);
    frame.callerId = number(bytes, 8, 4);
    frame.function = number(bytes, 12, 2);
    frame.flags = number(bytes, 14, 1);
    frame.padLength = number(bytes, 15, 1);
    frame.operation = number(bytes, 20, 2);
    frame.status = number(bytes, 22, 2);
    const bool isNew = frame.version == 0x20;
    if (isNew) frame.statusDetail = number(bytes, 24, 2);
    frame.payload = bytes.substr(isNew ? kNewHeader : kOldHeader, number(bytes, 16, 4));
    return frame;
}

std::string describeFrame(const std::string& bytes)
{
    if (bytes.size() < kOldHeader || bytes.compare(0, 3, "\xDE\xCA\xFF") != 0) return describeBytes(bytes);
    const std::uint32_t flags = number(bytes, 14, 1);
    std::string text = kindName(flags) + messageName(number(bytes, 12, 2), number(bytes, 20, 2));
    text += ", id " + hexNumber(number(bytes, 8, 4), 8);
    if ((flags & 0xC0U) == 0x40) text += ", status " + std::to_string(number(bytes, 22, 2));
    if (number(bytes, 3, 1) == 0) text += ", old header";
    text += ", " + std::to_string(bytes.size()) + " bytes";
    const std::string reason = decode(bytes).reason;
    return reason.empty() ? text : text + ": " + reason;
}

std::vector<std::string> frameDetails(const std::string& bytes)
{
    const FrameDecoder::Item item = decode(bytes);
    std::vector<std::string> lines;
    if (item.message == nullptr) return lines;
    std::istringstream dump(printableLines(toString(item.message->debug())));
    bool isDetail = false;
    for (std::string line; std::getline(dump, line);) {
        if (line.find("Current raw message contents") == 0) break;
        const std::size_t first = line.find_first_not_of(' ');
        const bool isField = isDetail && first != std::string::npos && line.back() != ':' && line[first] != '<';
        if (isField) lines.push_back(line.substr(first));
        if (line.find("Additional message details") == 0) isDetail = true;
    }
    return lines;
}

std::string messageName(unsigned int function, unsigned int operation)
{
    std::string numbers = hexNumber(function, 4) + "/" + hexNumber(operation, 4);
    const std::string text = toString(
        std::make_pair(static_cast<QelMessageFunctionCodes>(function), static_cast<QelMessageOpTypes>(operation)));
    static const std::string kPrefix = "(QelMessageOp";
    const std::size_t begin = text.find(kPrefix);
    if (begin == std::string::npos || text.back() != ')') return numbers;
    const std::size_t name = begin + kPrefix.size();
    return numbers + " " + text.substr(name, text.size() - name - 1);
}

std::string statusText(unsigned int status)
{
    return std::to_string(status) + " (" + statusName(static_cast<QelMessageStatusCodes>(status)) + ")";
}

std::string hexNumber(std::uint32_t value, int width)
{
    char text[16];
    static_cast<void>(std::snprintf(text, sizeof(text), "0x%0*X", width, value));
    return text;
}

} // namespace qel::tool::check
