#pragma once

#include <qel/common/QelMessage.hpp>

#include <nlohmann/json.hpp>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

/// What a response says, as named values in a fixed order: printed as one line each for people, or as one JSON
/// document. Thread safety: a plain value.
class Answer {
public:
    Answer() = default;

    /// Adds a value. @param key  in JSON  @param label  for people
    void add(const std::string& key, const std::string& label, nlohmann::ordered_json value);

    /// Adds bytes that the other end chose: text for people with everything unprintable escaped; in JSON the text with
    /// what is not UTF-8 replaced.
    void addText(const std::string& key, const std::string& label, const std::string& bytes);

    /// Adds a value that only programs want.
    void addForPrograms(const std::string& key, nlohmann::ordered_json value);

    /// The values as a JSON object.
    const nlohmann::ordered_json& json() const noexcept { return mJson; }

    /// One line for each value: label, colon, padding, value.
    void print(std::ostream& os) const;

private:
    nlohmann::ordered_json mJson = nlohmann::ordered_json::object();
    std::vector<std::pair<std::string, std::string>> mLines; // label, value as text
};

/// The members that every JSON document of a call begins with: "request", "status", "statusName", "statusDetail".
nlohmann::ordered_json jsonHead(const std::string& request, QelMessageStatusCodes status, unsigned short statusDetail);

/// The name of a status alone, such as "QelMessageStatusInvalidData".
std::string statusName(QelMessageStatusCodes status);

/// Prints a document as people indent it, with a line end. Bytes that are no UTF-8 are replaced.
void printJson(std::ostream& os, const nlohmann::ordered_json& document);

} // namespace qel::tool
