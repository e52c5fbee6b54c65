#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace qel::protocol {

/// The environment of a partition's command, one "NAME=value" each: TERM, HOME, PATH, USER, SHELL, LANG and
/// QEL_PARTITION. It does not depend on how the server was started: HOME, USER and SHELL are those of the account that
/// the server runs under, PATH and LANG are fixed.
/// @param term  the value of TERM
/// @throws std::bad_alloc
std::vector<std::string> commandEnvironment(std::uint16_t partition, const std::string& term);

} // namespace qel::protocol
