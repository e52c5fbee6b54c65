#include <qel/protocol/NameText.hpp>
#include <qel/protocol/Text.hpp>

namespace qel::protocol {

namespace {

bool isPrintable(char c) { return c >= ' ' && c <= '~'; }

std::string escaped(const std::string& value)
{
    std::string text;
    for (const char c : value) {
        if (c == ',' || c == '\\') text += '\\';
        text += isPrintable(c) ? std::string(1, c) : "\\x" + hexDigits(std::string(1, c));
    }
    return text;
}

} // namespace

std::string nameText(const NameFields& fields)
{
    std::string text;
    for (const NameField& field : fields) {
        if (!text.empty()) text += ',';
        text += field.name + '=' + escaped(field.value);
    }
    return text;
}

} // namespace qel::protocol
