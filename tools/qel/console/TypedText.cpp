#include "console/TypedText.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "console/ConsoleTexts.hpp"
#include "console/SessionScript.hpp"

#include <cctype>
#include <stdexcept>

namespace qel::tool {

namespace {

/// @return none for a letter that means nothing
std::optional<char> characterFor(char letter)
{
    switch (letter) {
    case 'r':
        return '\r';
    case 'n':
        return '\n';
    case 't':
        return '\t';
    case 'e':
        return '\x1B';
    case '\\':
        return '\\';
    default:
        return std::nullopt;
    }
}

bool isHexDigit(char c) { return std::isxdigit(static_cast<unsigned char>(c)) != 0; }

} // namespace

std::optional<std::string> parseTypedText(const std::string& text)
{
    constexpr int kHexadecimal = 16;
    std::string parsed;
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '\\') {
            parsed += text[i];
            continue;
        }
        if (++i == text.size()) return std::nullopt;
        if (text[i] == 'x') {
            if (i + 2 >= text.size() || !isHexDigit(text[i + 1]) || !isHexDigit(text[i + 2])) return std::nullopt;
            parsed += static_cast<char>(std::stoi(text.substr(i + 1, 2), nullptr, kHexadecimal));
            i += 2;
            continue;
        }
        const std::optional<char> character = characterFor(text[i]);
        if (!character) return std::nullopt;
        parsed += *character;
    }
    return parsed;
}

std::string checkTypedText(std::string& text)
{
    if (parseTypedText(text)) return {};
    return filled(texts::kNotTypedText, {tool::quoted(text)});
}

std::string checkPattern(std::string& text)
{
    try {
        const SessionScript script({{ScriptStep::Kind::Expect, text}}, std::chrono::milliseconds(0), "");
        return {};
    } catch (const std::invalid_argument& error) {
        return error.what();
    }
}

} // namespace qel::tool
