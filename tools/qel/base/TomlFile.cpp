#include "base/TomlFile.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/UniqueFd.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/OptionChecks.hpp"
#include "base/UsageErrors.hpp"

#include <algorithm>
#include <array>
#include <cctype>
#include <cerrno>
#include <fcntl.h>
#include <iomanip>
#include <limits>
#include <sstream>
#include <tuple>
#include <unistd.h>
#include <utility>

// The parser takes long to compile, so no other file includes it. All of it is compiled here: linking its library would
// save little and need it at run time.
#define TOML_HEADER_ONLY 1
#define TOML_ENABLE_FORMATTERS 0
#include <toml++/toml.h>

namespace qel::tool {

namespace {

constexpr std::size_t kMaxFileBytes = 1024 * 1024;

TomlPlace placeOf(const toml::source_region& region, const std::string& file)
{
    return {file, std::max<std::size_t>(region.begin.line, 1), std::max<std::size_t>(region.begin.column, 1)};
}

/// As a person writes it: 0.5, 1000000.
std::string plainNumber(double number)
{
    std::ostringstream text;
    text << std::setprecision(std::numeric_limits<double>::digits10) << number;
    return text.str();
}

template <typename T>
std::string printed(const T& value)
{
    std::ostringstream text;
    text << value;
    return text.str();
}

TomlValue convert(const toml::node& node, const std::string& file);

TomlValue convertTable(const toml::table& table, const std::string& file)
{
    TomlValue value;
    for (const auto& entry : table) {
        value.entries.push_back(
            {std::string(entry.first.str()), placeOf(entry.first.source(), file), convert(entry.second, file)});
    }
    std::sort(value.entries.begin(), value.entries.end(), [](const TomlEntry& left, const TomlEntry& right) {
        return std::tie(left.place.line, left.place.column) < std::tie(right.place.line, right.place.column);
    });
    return value;
}

TomlValue convert(const toml::node& node, const std::string& file)
{
    TomlValue value;
    if (const auto* table = node.as_table()) {
        value = convertTable(*table, file);
    } else if (const auto* list = node.as_array()) {
        value.kind = TomlValue::Kind::List;
        for (const toml::node& item : *list)
            value.items.push_back(convert(item, file));
    } else if (const auto* text = node.as_string()) {
        value.kind = TomlValue::Kind::Text;
        value.text = text->get();
    } else if (const auto* integer = node.as_integer()) {
        value.kind = TomlValue::Kind::Integer;
        value.text = std::to_string(integer->get());
    } else if (const auto* number = node.as_floating_point()) {
        value.kind = TomlValue::Kind::Number;
        value.text = plainNumber(number->get());
    } else if (const auto* flag = node.as_boolean()) {
        value.kind = TomlValue::Kind::Boolean;
        value.text = flag->get() ? "true" : "false";
    } else {
        value.kind = TomlValue::Kind::Time;
    }
    value.place = placeOf(node.source(), file);
    return value;
}

/// The parser's reason as a part of a line: "error while parsing string: ...".
std::string reasonOf(const toml::parse_error& error)
{
    std::string reason = printable(std::string(error.description()));
    if (!reason.empty()) {
        reason.front() = static_cast<char>(std::tolower(static_cast<unsigned char>(reason.front())));
    }
    return reason;
}

std::string readLimited(const std::string& path)
{
    const UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    const PosixErrorCode openError = errno;
    if (file.get() < 0) throw FileIOError(openError, "cannot open " + path);
    std::string text;
    std::array<char, 4096> buffer;
    while (text.size() <= kMaxFileBytes) {
        const ssize_t count = ::read(file.get(), buffer.data(), buffer.size());
        const PosixErrorCode error = errno;
        if (count < 0 && error == EINTR) continue;
        if (count < 0) throw FileIOError(error, "cannot read " + path);
        if (count == 0) return text;
        text.append(buffer.data(), static_cast<std::size_t>(count));
    }
    failAt({path, 1, 1}, "longer than 1 MiB");
}

/// A text of a file that is part of a reason may have any characters, but the reason is one line.
std::string withoutControls(const std::string& text)
{
    std::string safe;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        safe += byte < 0x20 || byte == 0x7F ? printable(std::string(1, c)) : std::string(1, c);
    }
    return safe;
}

[[noreturn]] void failKind(const std::string& key, const TomlValue& value, const char* expected)
{
    failAt(value.place, key + " takes " + expected + ", not " + kindName(value.kind));
}

void requireKind(const TomlEntry& entry, TomlValue::Kind kind)
{
    if (entry.value.kind != kind) failKind(entry.key, entry.value, kindName(kind));
}

std::string joined(const std::vector<std::string>& words)
{
    std::string text;
    for (const std::string& word : words)
        text += (text.empty() ? "" : ", ") + word;
    return text;
}

} // namespace

std::string toText(const TomlPlace& place)
{
    return place.file + ":" + std::to_string(place.line) + ":" + std::to_string(place.column);
}

const TomlEntry* TomlValue::find(const std::string& key) const
{
    const auto found =
        std::find_if(entries.begin(), entries.end(), [&key](const TomlEntry& entry) { return entry.key == key; });
    return found == entries.end() ? nullptr : &*found;
}

TomlValue readToml(const std::string& path) { return parseToml(readLimited(path), path); }

TomlValue parseToml(const std::string& text, const std::string& file)
{
    try {
        TomlValue value = convertTable(toml::parse(std::string_view(text), std::string_view(file)), file);
        value.place = {file, 1, 1};
        return value;
    } catch (const toml::parse_error& error) {
        failAt(placeOf(error.source(), file), reasonOf(error));
    }
}

void failAt(const TomlPlace& place, const std::string& reason)
{
    throw CommandFailure(ExitStatus::Usage, toText(place) + ": " + withoutControls(reason));
}

void requireKnownKeys(const TomlValue& table, const std::vector<std::string>& known)
{
    for (const TomlEntry& entry : table.entries) {
        if (std::find(known.begin(), known.end(), entry.key) != known.end()) continue;
        const std::string guess = nearestWord(entry.key, known);
        const std::string hint =
            guess.empty() ? "; known keys are " + joined(known) : "; did you mean " + quoted(guess) + "?";
        failAt(entry.place, "unknown key " + quoted(entry.key) + hint);
    }
}

std::string textOf(const TomlEntry& entry)
{
    requireKind(entry, TomlValue::Kind::Text);
    return entry.value.text;
}

bool flagOf(const TomlEntry& entry)
{
    requireKind(entry, TomlValue::Kind::Boolean);
    return entry.value.text == "true";
}

std::uint64_t integerOf(const TomlEntry& entry, std::uint64_t min, std::uint64_t max)
{
    requireKind(entry, TomlValue::Kind::Integer);
    const auto number = parseInteger(entry.value.text);
    if (number && *number >= min && *number <= max) return *number;
    failAt(entry.value.place, entry.key + ": " + notAnIntegerIn(entry.value.text, min, max));
}

const TomlValue& tableOf(const TomlEntry& entry)
{
    requireKind(entry, TomlValue::Kind::Table);
    return entry.value;
}

std::vector<const TomlValue*> itemsOf(const TomlEntry& entry)
{
    if (entry.value.kind != TomlValue::Kind::List) return {&entry.value};
    std::vector<const TomlValue*> items;
    for (const TomlValue& item : entry.value.items)
        items.push_back(&item);
    return items;
}

std::vector<std::string> textsOf(const TomlEntry& entry)
{
    std::vector<std::string> texts;
    for (const TomlValue* item : itemsOf(entry)) {
        if (item->kind != TomlValue::Kind::Text) failKind(entry.key, *item, "texts");
        texts.push_back(item->text);
    }
    return texts;
}

const char* kindName(TomlValue::Kind kind)
{
    switch (kind) {
    case TomlValue::Kind::Text:
        return "a text";
    case TomlValue::Kind::Integer:
        return "an integer";
    case TomlValue::Kind::Number:
        return "a number";
    case TomlValue::Kind::Boolean:
        return "true or false";
    case TomlValue::Kind::Time:
        return "a time";
    case TomlValue::Kind::List:
        return "a list";
    case TomlValue::Kind::Table:
        return "a table";
    }
    return "a value";
}

} // namespace qel::tool
