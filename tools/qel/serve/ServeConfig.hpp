#pragma once

#include "base/TomlFile.hpp"
#include "serve/AccessRules.hpp"

#include <cstdint>
#include <ostream>
#include <string>
#include <vector>

namespace qel::tool {

/// A table [partition.NAME] of a configuration file.
struct PartitionConfig {
    std::string name; ///< a letter, then letters, digits, '_' and '-'; at most 64
    std::uint16_t id = 0;
    std::string line;
    std::string description;
    TomlEntry entry; ///< all of it, with its places, and with the keys for how the partition is served
};

/// What a configuration file says besides the options: the partitions, and who may do what.
struct ServeConfig {
    std::vector<PartitionConfig> partitions; ///< in the order of the file; each id and name once
    std::vector<AccessRule> rules;           ///< the tables [[rule]], then one for each `access` of a partition
    std::vector<TomlValue> ruleTables;       ///< the tables [[rule]] themselves
};

/// Reads partitions and rules. The keys of the options are left to others, but must be known.
/// @param optionKeys  those of the options
/// @throws CommandFailure  Usage: "FILE:LINE:COLUMN: ..."
ServeConfig readServeConfig(const TomlValue& file, const std::vector<std::string>& optionKeys);

/// Prints the partitions and the rules as TOML, each value with its place as a comment.
void printServeConfig(std::ostream& os, const ServeConfig& config);

} // namespace qel::tool
