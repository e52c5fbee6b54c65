#pragma once

#include "check/CheckRun.hpp"

#include <chrono>
#include <nlohmann/json.hpp>
#include <ostream>
#include <string>
#include <vector>

namespace qel::tool::check {

/// How many cases hold, fail and are skipped.
struct Counts {
    std::size_t holds = 0;
    std::size_t fails = 0;
    std::size_t skipped = 0;
};
Counts countsOf(const std::vector<Outcome>& outcomes);

/// The line of one case: "ok       ID", "FAILED   ID: expected ..., seen ...", "skipped  ID: REASON".
std::string outcomeLine(const Outcome& outcome);

/// Prints all failures, each with what is required, what was sent and what was seen, and the counts at the end.
/// @param hex  with the bytes of each frame
void printFailures(std::ostream& os, const std::vector<Outcome>& outcomes, std::chrono::nanoseconds time, bool hex);

/// The result of a run as a JSON document. @param peer  who was tested: "127.0.0.1:4711"
nlohmann::ordered_json reportJson(const std::string& peer, const std::vector<Outcome>& outcomes,
                                  std::chrono::nanoseconds time);

/// The same in the XML form of JUnit, which most systems for continuous integration read.
/// @param suite  its name: "qel check server"
void printJunit(std::ostream& os, const std::string& suite, const std::vector<Outcome>& outcomes,
                std::chrono::nanoseconds time);

/// Prints the cases: id, level and requirement.
void printList(std::ostream& os, const Cases& cases);
nlohmann::ordered_json listJson(const Cases& cases);
/// A table in Markdown for each family, the first word of the id, for docs/conformance.md.
void printMarkdown(std::ostream& os, const Cases& cases);

} // namespace qel::tool::check
