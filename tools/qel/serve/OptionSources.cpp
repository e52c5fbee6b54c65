#include "serve/OptionSources.hpp"

#include <qel/protocol/Text.hpp>

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <utility>

namespace qel::tool {

namespace {

bool isFlag(const CLI::Option& option) { return option.get_expected_max() == 0; }

bool isList(const CLI::Option& option) { return option.get_items_expected_max() > 1; }

/// Whether the values of an option are numbers, by what its help says.
bool isNumber(const CLI::Option& option)
{
    const std::string type = option.get_type_name();
    const auto begins = [&type](const char* word) { return type.rfind(word, 0) == 0; };
    return begins("UINT") || begins("INT") || begins("FLOAT") || begins("BYTES") || begins("SECONDS") || begins("DAYS");
}

/// What CLI11 says about a value, without the name of the option.
std::string reasonOf(const CLI::Option& option, const CLI::ParseError& error)
{
    const std::string prefix = option.get_name() + ": ";
    const std::string text = error.what();
    return text.compare(0, prefix.size(), prefix) == 0 ? text.substr(prefix.size()) : text;
}

bool isFalse(const std::string& text) { return text == "false" || text == "0" || text == "off" || text == "no"; }

/// As if the command line had the values.
void give(CLI::Option& option, const std::vector<std::string>& values)
{
    for (const std::string& value : values)
        option.add_result(value);
    option.run_callback();
}

std::string valueText(const CLI::Option& option, const std::string& value)
{
    return isNumber(option) ? value : tomlQuoted(value);
}

std::string settingText(const CLI::Option& option)
{
    if (isFlag(option)) return option.count() > 0 && !isFalse(option.results().front()) ? "true" : "false";
    const std::vector<std::string>& given = option.results();
    if (!isList(option)) {
        const std::string value = given.empty() ? option.get_default_str() : given.back();
        return given.empty() && value.empty() ? std::string() : valueText(option, value);
    }
    std::vector<std::string> values = given;
    if (values.empty() && !option.get_default_str().empty()) values.push_back(option.get_default_str());
    std::string text;
    for (const std::string& value : values)
        text += (text.empty() ? "" : ", ") + valueText(option, value);
    return "[" + text + "]";
}

} // namespace

OptionSources::OptionSources(CLI::App& command, std::set<std::string> others)
    : mCommand(command), mOthers(std::move(others))
{}

void OptionSources::apply(const TomlValue* file)
{
    for (CLI::Option* option : pOptions()) {
        const std::string key = keyOf(*option);
        const std::string variable = variableOf(key);
        const char* const value = std::getenv(variable.c_str());
        const TomlEntry* const entry = file == nullptr ? nullptr : file->find(key);
        if (option->count() > 0) {
            mOrigins[option] = "option";
        } else if (value != nullptr && *value != '\0') {
            pApplyVariable(*option, variable, value);
        } else if (entry != nullptr) {
            mOrigins[option] = entry->place.file + ":" + std::to_string(entry->place.line);
            applyEntry(*option, *entry);
        }
    }
}

std::vector<std::string> OptionSources::keys() const
{
    std::vector<std::string> keys;
    for (const CLI::Option* option : pOptions())
        keys.push_back(keyOf(*option));
    return keys;
}

std::vector<Setting> OptionSources::settings() const
{
    std::vector<Setting> settings;
    for (const CLI::Option* option : pOptions()) {
        const auto origin = mOrigins.find(option);
        settings.push_back(
            {keyOf(*option), settingText(*option), origin == mOrigins.end() ? "default" : origin->second});
    }
    return settings;
}

std::vector<std::string> OptionSources::words() const
{
    std::vector<std::string> words;
    for (const CLI::Option* option : mCommand.get_options()) {
        const std::string key = keyOf(*option);
        const auto origin = mOrigins.find(option);
        const bool isGiven = mOthers.count(key) != 0 || (origin != mOrigins.end() && origin->second == "option");
        if (!isGiven) continue;
        for (const std::string& value : option->results()) {
            if (!value.empty()) words.push_back(std::string("--").append(key).append("=").append(value));
        }
    }
    return words;
}

/// Those that the environment and a file may set.
std::vector<CLI::Option*> OptionSources::pOptions() const
{
    std::vector<CLI::Option*> options;
    for (CLI::Option* option : mCommand.get_options()) {
        const std::string key = keyOf(*option);
        if (!key.empty() && key != "help" && key != "version" && mOthers.count(key) == 0) options.push_back(option);
    }
    return options;
}

void OptionSources::pApplyVariable(CLI::Option& option, const std::string& variable, const std::string& value)
{
    mOrigins[&option] = "environment " + variable;
    // A flag that is given counts for the requirements of other options, even if it is false.
    if (isFlag(option) && isFalse(value)) return;
    try {
        give(option, {value});
    } catch (const CLI::ParseError& error) {
        throw CLI::ValidationError("the variable " + variable, reasonOf(option, error));
    }
}

void applyEntry(CLI::Option& option, const TomlEntry& entry)
{
    if (isFlag(option)) {
        if (flagOf(entry)) give(option, {"true"});
        return;
    }
    if (!isList(option) && entry.value.kind == TomlValue::Kind::List) {
        failAt(entry.value.place, entry.key + " takes one value, not a list");
    }
    // It would count as the default, which is not what it looks like.
    if (itemsOf(entry).empty() && !option.get_default_str().empty()) {
        failAt(entry.value.place, entry.key + ": the list is empty; leave the key out");
    }
    for (const TomlValue* item : itemsOf(entry)) {
        const bool isScalar = item->kind == TomlValue::Kind::Text || item->kind == TomlValue::Kind::Integer ||
                              item->kind == TomlValue::Kind::Number;
        if (!isScalar) failAt(item->place, entry.key + " takes a text or a number, not " + kindName(item->kind));
        if (item->text.find('\0') != std::string::npos) failAt(item->place, entry.key + ": has a null character");
        try {
            // Values are checked one by one, so that an error names the right one.
            option.add_result(item->text);
            option.run_callback();
        } catch (const CLI::ParseError& error) {
            failAt(item->place, entry.key + ": " + reasonOf(option, error));
        }
    }
}

std::string keyOf(const CLI::Option& option)
{
    return option.get_lnames().empty() ? std::string() : option.get_lnames().front();
}

std::string variableOf(const std::string& key)
{
    std::string variable = "QEL_";
    for (const char c : key)
        variable += c == '-' ? '_' : static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    return variable;
}

std::string tomlQuoted(const std::string& text)
{
    std::string toml = "\"";
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (c == '"' || c == '\\') {
            toml += std::string("\\") + c;
        } else if (byte < 0x20 || byte == 0x7F) {
            std::array<char, 8> escape{};
            std::snprintf(escape.data(), escape.size(), "\\u%04X", static_cast<unsigned int>(byte));
            toml += escape.data();
        } else {
            toml += c;
        }
    }
    return toml + "\"";
}

std::string tomlText(const TomlValue& value)
{
    std::string text;
    switch (value.kind) {
    case TomlValue::Kind::Text:
        return tomlQuoted(value.text);
    case TomlValue::Kind::List:
        for (const TomlValue& item : value.items)
            text += (text.empty() ? "" : ", ") + tomlText(item);
        return "[" + text + "]";
    case TomlValue::Kind::Table:
        for (const TomlEntry& entry : value.entries)
            text += (text.empty() ? "" : ", ") + entry.key + " = " + tomlText(entry.value);
        return "{" + text + "}";
    default:
        return value.text;
    }
}

void printSettings(std::ostream& os, const std::vector<Setting>& settings)
{
    std::size_t width = 0;
    for (const Setting& setting : settings)
        width = std::max(width, setting.key.size() + 3 + setting.value.size());
    for (const Setting& setting : settings) {
        if (setting.value.empty()) {
            os << "# " << setting.key << ": not set\n";
            continue;
        }
        const std::string line = setting.key + " = " + setting.value;
        os << line << std::string(width - line.size() + 2, ' ') << "# " << setting.origin << '\n';
    }
}

} // namespace qel::tool
