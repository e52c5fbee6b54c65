#include "console/ConsoleTexts.hpp"

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

} // namespace qel::tool
