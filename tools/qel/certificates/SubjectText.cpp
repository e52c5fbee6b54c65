#include "certificates/SubjectText.hpp"

#include <qel/common/Utilities.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

#include <algorithm>
#include <stdexcept>
#include <vector>

namespace qel::tool {

namespace {

[[noreturn]] void refuse(const std::string& reason) { throw std::invalid_argument(reason); }

bool isPrintable(char c) { return c >= ' ' && c <= '~'; }

bool beginsEscape(const std::string& text, std::size_t position)
{
    return position + 1 < text.size() && (text[position + 1] == ',' || text[position + 1] == '\\');
}

/// Cuts a text into fields at its commas, and takes the escapes out of them.
std::vector<std::string> splitFields(const std::string& text)
{
    std::vector<std::string> fields(1);
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (text[i] == ',') {
            fields.emplace_back();
            continue;
        }
        if (text[i] == '\\') {
            if (!beginsEscape(text, i)) refuse("a backslash may only precede a comma or another backslash");
            ++i;
        }
        fields.back() += text[i];
    }
    return fields;
}

void addField(SSLSubject& subject, const std::string& field)
{
    const std::size_t equals = field.find('=');
    if (equals == std::string::npos) refuse(quoted(field) + " is not a field: a subject is NAME=VALUE,NAME=VALUE,...");
    const std::string given = Utilities::strip(field.substr(0, equals), " ");
    const std::string value = Utilities::strip(field.substr(equals + 1), " ");
    const std::string name = attributeName(given);
    if (name.empty()) refuse(quoted(given) + " is not an attribute of a name, such as CN, O, OU, C, ST or L");
    if (isExtension(given)) {
        refuse(quoted(given) +
               " is an extension, not an attribute of a name: certificates from here have no extensions");
    }
    if (value.empty()) refuse(name + " has no value");
    if (!std::all_of(value.begin(), value.end(), isPrintable))
        refuse("the value of " + name + " is not printable ASCII");
    const std::string objection = objectionTo(name, value);
    if (!objection.empty()) refuse(quoted(value) + " is not a value for " + name + ": " + objection);
    if (!subject.emplace(name, value).second) refuse(name + " is given twice");
}

} // namespace

SSLSubject parseSubject(const std::string& text)
{
    SSLSubject subject;
    for (const std::string& field : splitFields(text))
        addField(subject, field);
    return subject;
}

} // namespace qel::tool
