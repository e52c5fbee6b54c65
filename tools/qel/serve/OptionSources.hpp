#pragma once

#include "base/Library.hpp"
#include "base/TomlFile.hpp"

#include <CLI/CLI.hpp>
#include <map>
#include <ostream>
#include <set>
#include <string>
#include <vector>

namespace qel::tool {

/// The value of an option, and where it comes from.
struct Setting {
    std::string key;    ///< the name of the option without its dashes: "max-consoles"
    std::string value;  ///< in TOML; empty: it has none
    std::string origin; ///< "option", "environment QEL_MAX_CONSOLES", "FILE:LINE" or "default"
};

/// Gives the options of a command the values that the command line leaves open: first from the environment, then from a
/// file. An option --max-consoles is the variable QEL_MAX_CONSOLES, and the key max-consoles of the file.
///
/// CLI11 would read variables for the options of all subcommands, also of those that are not used, and has no places in
/// files. The checks of the options apply to all values.
///
/// Lifetime: borrows the command. Thread safety: one thread.
class OptionSources {
public:
    /// @param command  to be parsed later
    /// @param others  options that are given on the command line alone, without dashes
    OptionSources(CLI::App& command, std::set<std::string> others);

    /// Sets the options that the command line has not set. Call it while the command line is being parsed: after its
    /// words have been read, before the requirements of the options among each other are checked.
    /// @param file  null: none
    /// @throws CLI::ValidationError  a variable has a wrong value; names it
    /// @throws CommandFailure  Usage: the file has, "FILE:LINE:COLUMN: ..."
    void apply(const TomlValue* file);

    /// The keys that a file may have.
    std::vector<std::string> keys() const;

    /// All values, in the order of the options. Call it after apply().
    std::vector<Setting> settings() const;

    /// The command line that gave the options that were given there: "--name=VALUE" for each.
    std::vector<std::string> words() const;

private:
    std::vector<CLI::Option*> pOptions() const;
    void pApplyVariable(CLI::Option& option, const std::string& variable, const std::string& value);

    CLI::App& mCommand;
    const std::set<std::string> mOthers;
    std::map<const CLI::Option*, std::string> mOrigins; ///< of the options that apply() has set or found set
};

/// Gives an option the value of an entry of a file.
/// @throws CommandFailure  Usage: the value is wrong, "FILE:LINE:COLUMN: ..."
void applyEntry(CLI::Option& option, const TomlEntry& entry);

/// The key of an option in a file: its long name without dashes.
std::string keyOf(const CLI::Option& option);

/// The variable of an option: "QEL_MAX_CONSOLES" for "max-consoles".
std::string variableOf(const std::string& key);

/// A text as a TOML string, in double quotes.
std::string tomlQuoted(const std::string& text);

/// A value as TOML; tables in braces.
std::string tomlText(const TomlValue& value);

/// Prints "key = value  # origin" for each; the comments are aligned.
void printSettings(std::ostream& os, const std::vector<Setting>& settings);

} // namespace qel::tool
