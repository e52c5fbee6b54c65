#pragma once

#include "bench/BenchLoad.hpp"

#include <nlohmann/json.hpp>
#include <ostream>
#include <string>

namespace qel::tool {

/// Prints the outcome of a run for people: what was measured, throughput, percentiles, and the histogram.
/// @param endpoint  of the server
void printReport(std::ostream& os, const std::string& endpoint, const BenchLoad& load, const BenchFigures& figures);

/// The same as a document for programs.
nlohmann::ordered_json reportJson(const std::string& endpoint, const BenchLoad& load, const BenchFigures& figures);

} // namespace qel::tool
