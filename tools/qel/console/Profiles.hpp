#pragma once

#include "base/TomlFile.hpp"

#include <CLI/CLI.hpp>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

/// @file
/// The servers that a user has given names to, in ~/.config/qel/config.toml:
///
///     [profile.lab]
///     connect = "hypervisor.example:4711"    # the options of "qel console", without their dashes
///     credentials = "/etc/qel/authority"
///     name = "operator"
///     partitions = { web1 = 1, db = 2 }      # names for partition ids
///
/// "qel console lab/web1" then stands for all of it, and "qel console lab/7" for a partition without a name.

namespace qel::tool {

/// A server with a name.
struct Profile {
    std::string name;
    TomlValue options; ///< a table
    std::vector<std::pair<std::string, std::uint16_t>> partitions;

    /// The text of an option; empty: it is not given. For lists.
    std::string option(const std::string& key) const;
};

/// Where the profiles of this user are: below $XDG_CONFIG_HOME, or ~/.config. Empty: neither is known.
std::string profilesPath();

/// Reads the profiles of a file; none when it does not exist.
/// @throws CommandFailure  Usage: the file is wrong; names the place
/// @throws FileIOError  it cannot be read
std::vector<Profile> readProfiles(const std::string& path);

/// True for "PROFILE/PARTITION".
bool namesProfile(const std::string& target);

/// Sets the options of a command from a profile, except those that the command line gives, and finds the partition.
/// "~/" at the beginning of a value is the home directory.
/// @param target  "PROFILE/PARTITION"
/// @param command  whose options the profile sets; all long names except --help, --version, --send, --expect and --exec
/// @return the partition id
/// @throws CommandFailure  Usage: there is no such profile or partition, with the nearest name; or an option of the
///         profile is unknown or has a wrong value, with its place
std::uint16_t applyProfile(const std::string& target, const std::vector<Profile>& profiles, CLI::App& command);

/// Refuses a word that is neither a partition id nor "PROFILE/PARTITION".
/// @throws CommandFailure  Usage: with the nearest name
[[noreturn]] void failNoPartition(const std::string& word, const std::vector<Profile>& profiles);

} // namespace qel::tool
