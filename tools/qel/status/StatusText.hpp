#pragma once

#include "base/Library.hpp"
#include "status/StatusReport.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <ostream>
#include <string>
#include <vector>

namespace qel::tool {

/// Prints a report for a person: a line about the server, warnings, and tables. Safe to print on a terminal.
/// Lines end with a line feed and without blanks.
void printStatus(std::ostream& os, const StatusReport& report);

/// Who types on a partition and who watches it, for a line of text: "alice types, bob watches"; "nobody".
std::string sessionsText(const StatusReport& report, const PartitionState& partition);

/// The name of a console for a person: the common name of its certificate, or what it calls itself; safe to print.
std::string consoleName(const ConnectedConsole& console);

/// "512 B", "1.5 KiB", "2 GiB"
std::string bytesText(std::uint64_t bytes);

/// The two largest units: "45s", "3m 2s", "5h 0m", "12d 4h".
std::string durationText(std::chrono::seconds duration);

} // namespace qel::tool
