#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

/// @file
/// Reads configuration files, which are written in TOML. Every value knows where it stands, so that an error can name
/// the line and the column.

namespace qel::tool {

/// Where something stands in a file.
struct TomlPlace {
    std::string file;
    std::size_t line = 1;   ///< from 1
    std::size_t column = 1; ///< from 1, in characters
};

/// "FILE:LINE:COLUMN"
std::string toText(const TomlPlace& place);

struct TomlEntry;

/// A value of a file. A plain value.
struct TomlValue {
    enum class Kind { Text, Integer, Number, Boolean, Time, List, Table };

    /// The entry of a table. @return null: the table does not have the key
    const TomlEntry* find(const std::string& key) const;

    Kind kind = Kind::Table;
    std::string text;               ///< of a value that is neither a list nor a table, as an option takes it: "16"
    std::vector<TomlValue> items;   ///< of a list
    std::vector<TomlEntry> entries; ///< of a table, in the order of the file
    TomlPlace place;
};

/// A key of a table, and its value.
struct TomlEntry {
    std::string key;
    TomlPlace place; ///< of the key
    TomlValue value;
};

/// Reads a file.
/// @return its table
/// @throws CommandFailure  Usage: the file is not TOML, or longer than 1 MiB: "FILE:LINE:COLUMN: ..."
/// @throws FileIOError  it cannot be read: "cannot open FILE: ..."
TomlValue readToml(const std::string& path);

/// Reads a text. @param file  its name, for the places
/// @throws CommandFailure  as readToml()
TomlValue parseToml(const std::string& text, const std::string& file);

/// Reports an error in a file. @throws CommandFailure  Usage: "FILE:LINE:COLUMN: REASON"
[[noreturn]] void failAt(const TomlPlace& place, const std::string& reason);

/// Refuses a key that is not known, and names the nearest one that is.
/// @throws CommandFailure  as failAt(): `unknown key "lisen"; did you mean "listen"?`
void requireKnownKeys(const TomlValue& table, const std::vector<std::string>& known);

// The value of an entry, which must be of the kind that the name says.
// @throws CommandFailure  as failAt(): "KEY takes a text, not an integer"

std::string textOf(const TomlEntry& entry);
bool flagOf(const TomlEntry& entry);
/// @throws CommandFailure  also for a number outside [min, max]
std::uint64_t integerOf(const TomlEntry& entry, std::uint64_t min, std::uint64_t max);
const TomlValue& tableOf(const TomlEntry& entry);
/// The items of a list, or the one value that is not a list. The items may be of any kind.
std::vector<const TomlValue*> itemsOf(const TomlEntry& entry);
/// itemsOf(), each of which must be a text.
std::vector<std::string> textsOf(const TomlEntry& entry);

/// "a text", "an integer" and so on.
const char* kindName(TomlValue::Kind kind);

} // namespace qel::tool
