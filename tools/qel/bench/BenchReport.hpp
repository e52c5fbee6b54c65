#pragma once

#include "bench/BenchLoad.hpp"

#include <nlohmann/json.hpp>
#include <ostream>
#include <string>

namespace qel::tool {

/// Prints the result of a run as text: load, throughput, percentiles and histogram.
/// @param endpoint  of the server
void printReport(std::ostream& os, const std::string& endpoint, const BenchLoad& load, const BenchFigures& figures);

/// The same as a JSON document.
nlohmann::ordered_json reportJson(const std::string& endpoint, const BenchLoad& load, const BenchFigures& figures);

} // namespace qel::tool
