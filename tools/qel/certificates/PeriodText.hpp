#pragma once

#include <chrono>
#include <string>

namespace qel::tool {

/// Parses a length of time: an integer and a unit, "s", "m" (minutes), "h", "d" or "w"; at most 100 years.
/// @throws std::invalid_argument  anything else
std::chrono::seconds parsePeriod(const std::string& text);

} // namespace qel::tool
