#pragma once

#include <string>
#include <vector>

namespace qel::protocol {

/// The environment of a command, one "NAME=value" each: TERM, HOME, PATH, USER, SHELL, LANG, and the given ones, which
/// replace those of the same name. It does not depend on how the server was started: HOME, USER and SHELL are those of
/// the account that the server runs under, PATH and LANG are fixed.
/// @param term  the value of TERM
/// @param more  one "NAME=value" each; the last one counts
/// @throws std::bad_alloc
std::vector<std::string> commandEnvironment(const std::string& term, const std::vector<std::string>& more = {});

/// Sets one variable of an environment. @param variable  "NAME=value"
void setVariable(std::vector<std::string>& environment, const std::string& variable);

} // namespace qel::protocol
