#pragma once

#include <string>

namespace qel::tool {

/// The value of an environment variable; empty: it is not set.
std::string environmentValue(const char* name);

/// A path as a shell reads it where no shell has read it: "~/" at its beginning is the home directory, if that is
/// known.
std::string expandHome(const std::string& path);

} // namespace qel::tool
