#include "console/ConsoleTexts.hpp"

#include <sstream>

namespace qel::tool {

std::string filled(const char* text, std::initializer_list<std::string> values)
{
    std::string result;
    for (const char* at = text; *at != '\0'; ++at) {
        if (*at == '$') {
            result += values.begin()[*++at - '1'];
        } else {
            result += *at;
        }
    }
    return result;
}

std::string numberText(double number)
{
    std::ostringstream text;
    text << number;
    return text.str();
}

} // namespace qel::tool
