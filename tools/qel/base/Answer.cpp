#include "base/Answer.hpp"

#include <qel/common/StreamFormatters.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

#include <algorithm>
#include <array>
#include <cstdio>

namespace qel::tool {

namespace {

std::string asText(const nlohmann::ordered_json& value)
{
    return value.is_string() ? value.get<std::string>() : value.dump();
}

std::string unicodeEscape(unsigned char codePoint)
{
    std::array<char, 8> text{};
    std::snprintf(text.data(), text.size(), "\\u%04x", static_cast<unsigned int>(codePoint));
    return text.data();
}

/// JSON leaves U+007F to U+009F as they are, and a terminal obeys the latter like escape sequences.
/// @param json  a document in UTF-8
std::string withControlsEscaped(const std::string& json)
{
    constexpr unsigned char kDelete = 0x7F;
    constexpr unsigned char kLead = 0xC2; // of U+0080 to U+00BF
    std::string escaped;
    for (std::size_t i = 0; i < json.size(); ++i) {
        const auto byte = static_cast<unsigned char>(json[i]);
        const auto next = static_cast<unsigned char>(i + 1 < json.size() ? json[i + 1] : 0);
        if (byte == kDelete) {
            escaped += unicodeEscape(byte);
        } else if (byte == kLead && next >= 0x80 && next <= 0x9F) {
            escaped += unicodeEscape(next);
            ++i;
        } else {
            escaped += json[i];
        }
    }
    return escaped;
}

} // namespace

void Answer::add(const std::string& key, const std::string& label, nlohmann::ordered_json value)
{
    mLines.emplace_back(label, asText(value));
    mJson[key] = std::move(value);
}

void Answer::addText(const std::string& key, const std::string& label, const std::string& bytes)
{
    mLines.emplace_back(label, printable(bytes));
    mJson[key] = bytes;
}

void Answer::addForPrograms(const std::string& key, nlohmann::ordered_json value) { mJson[key] = std::move(value); }

void Answer::print(std::ostream& os) const
{
    std::size_t width = 0;
    for (const auto& line : mLines)
        width = std::max(width, line.first.size());
    for (const auto& line : mLines) {
        os << line.first << ":" << std::string(width - line.first.size() + 1, ' ') << line.second << "\n";
    }
}

nlohmann::ordered_json jsonHead(const std::string& request, QelMessageStatusCodes status, unsigned short statusDetail)
{
    nlohmann::ordered_json head;
    head["request"] = request;
    head["status"] = static_cast<unsigned int>(status);
    head["statusName"] = statusName(status);
    head["statusDetail"] = statusDetail;
    return head;
}

std::string statusName(QelMessageStatusCodes status)
{
    // The library prints a status as "0x00000004 (name)".
    std::string text = toString(status);
    const std::size_t open = text.find('(');
    const std::size_t close = text.rfind(')');
    if (open == std::string::npos || close == std::string::npos || close < open) return text;
    return text.substr(open + 1, close - open - 1);
}

void printJson(std::ostream& os, const nlohmann::ordered_json& document)
{
    constexpr int kIndent = 2;
    const std::string text = document.dump(kIndent, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    os << withControlsEscaped(text) << "\n";
}

std::string jsonLine(const nlohmann::ordered_json& document)
{
    constexpr int kOneLine = -1;
    return withControlsEscaped(document.dump(kOneLine, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
}

} // namespace qel::tool
