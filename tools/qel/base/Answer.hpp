#pragma once

#include <qel/common/QelMessage.hpp>

#include <nlohmann/json.hpp>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

/// The contents of a response: named values in a fixed order, to be printed as text, one line each, or as JSON.
/// Thread safety: a plain value.
class Answer {
public:
    Answer() = default;

    /// Adds a value. @param key  its name in JSON  @param label  its name in text
    void add(const std::string& key, const std::string& label, nlohmann::ordered_json value);

    /// Adds untrusted bytes. In text everything but printable ASCII is escaped; JSON replaces what is not UTF-8.
    void addText(const std::string& key, const std::string& label, const std::string& bytes);

    /// Adds a value to the JSON document alone.
    void addForPrograms(const std::string& key, nlohmann::ordered_json value);

    /// The values as a JSON object.
    const nlohmann::ordered_json& json() const noexcept { return mJson; }

    /// Prints one line for each value: label, colon, padding, value.
    void print(std::ostream& os) const;

private:
    nlohmann::ordered_json mJson = nlohmann::ordered_json::object();
    std::vector<std::pair<std::string, std::string>> mLines; // label, value as text
};

/// The first members of every JSON document of a call: "request", "status", "statusName", "statusDetail".
nlohmann::ordered_json jsonHead(const std::string& request, QelMessageStatusCodes status, unsigned short statusDetail);

/// The name of a status alone, such as "QelMessageStatusInvalidData".
std::string statusName(QelMessageStatusCodes status);

/// Prints a document with indentation and a line end. Bytes that are not UTF-8 are replaced, and control characters
/// (U+0000 to U+001F and U+007F to U+009F) are escaped, so that printing it on a terminal is safe.
void printJson(std::ostream& os, const nlohmann::ordered_json& document);

/// A document in one line, without a line end; else as printJson().
std::string jsonLine(const nlohmann::ordered_json& document);

} // namespace qel::tool
