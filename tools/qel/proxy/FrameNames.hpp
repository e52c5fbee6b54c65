#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

/// The functions and operations that have a name, without the prefixes that the library prints: "QelInterfaceCmp",
/// "GetQelTod".
struct NamedOperation {
    std::uint16_t function;
    std::uint16_t operation;
    std::string name;
};

/// All functions, as pairs of number and name. Thread safety: any thread.
const std::vector<std::pair<std::uint16_t, std::string>>& namedFunctions();

/// All operations. Thread safety: any thread.
const std::vector<NamedOperation>& namedOperations();

/// "GetQelTod", or an empty text for an operation without a name. Thread safety: any thread.
const std::string& operationName(std::uint16_t function, std::uint16_t operation);

/// The name of a status without its prefix, such as "InvalidData"; empty for one without a name.
/// Thread safety: any thread.
const std::string& shortStatusName(std::uint16_t status);

} // namespace qel::tool
