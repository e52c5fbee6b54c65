#include <qel/protocol/Text.hpp>

namespace qel::protocol {

namespace {

constexpr char kDigits[] = "0123456789abcdef";

void appendHex(std::string& text, unsigned char byte)
{
    text += kDigits[byte >> 4];
    text += kDigits[byte & 0x0F];
}

void appendPrintable(std::string& text, char c)
{
    const auto byte = static_cast<unsigned char>(c);
    if (byte == '\\') {
        text += "\\\\";
    } else if (byte >= 0x20 && byte < 0x7F) {
        text += c;
    } else {
        text += "\\x";
        appendHex(text, byte);
    }
}

} // namespace

std::string printable(const std::string& bytes)
{
    std::string text;
    for (const char c : bytes)
        appendPrintable(text, c);
    return text;
}

std::string quoted(const std::string& bytes)
{
    std::string text = "\"";
    for (const char c : bytes) {
        if (c == '"') text += '\\';
        appendPrintable(text, c);
    }
    return text + '"';
}

std::string printableLines(const std::string& bytes)
{
    std::string text;
    for (const char c : bytes) {
        if (c == '\n') {
            text += c;
        } else {
            appendPrintable(text, c);
        }
    }
    return text;
}

std::string hexDigits(const std::string& bytes)
{
    std::string text;
    for (const char c : bytes)
        appendHex(text, static_cast<unsigned char>(c));
    return text;
}

} // namespace qel::protocol
