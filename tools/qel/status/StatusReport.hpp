#pragma once

#include <qel/common/security/SSLValidityPeriod.hpp>
#include <qel/protocol/CertificateState.hpp>
#include <qel/protocol/PartitionState.hpp>
#include <qel/protocol/ServerState.hpp>

#include "base/Library.hpp"

#include <chrono>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

namespace qel::tool {

/// In full seconds, as certificates have them.
using CalendarTime = SSLValidityPeriod::Clock::time_point;

CalendarTime calendarTime(std::chrono::system_clock::time_point time);

/// A certificate that the server uses.
struct CertificateReport {
    std::string use;  ///< "own" or "root"
    std::string file; ///< it was read from
    CalendarTime notAfter;
    CertificateState state = CertificateState::Fine; ///< at the time of the report

    /// Full days from a time until it expires; less than 0 afterwards.
    long long daysLeft(CalendarTime now) const;
};

/// What a server says about itself over its status socket. docs/serve.md has its form as JSON.
/// Thread safety: a plain value.
struct StatusReport {
    std::string version; ///< of the program
    std::int64_t pid = 0;
    CalendarTime now;                ///< the time of the report
    std::vector<std::string> listen; ///< endpoints
    unsigned int maxConsoles = 0;
    ServerState server;
    std::vector<PartitionState> partitions;
    std::vector<CertificateReport> certificates; ///< none on plain connections

    /// The console that holds a session. @return null: it has just left
    const ConnectedConsole* consoleOf(const SessionState& session) const;
    std::chrono::seconds upTime() const { return ageOf(server.since); }
    /// The time from then to the report.
    std::chrono::seconds ageOf(std::chrono::system_clock::time_point since) const { return now - calendarTime(since); }
};

/// The words for the state of a line: "down", "coming up", "up" or "ended".
const char* lineWord(PartitionState::Line line);

/// The certificate for a person: "own certificate FILE expires at TIME, in 9 days", with what is to be done if it is
/// not fine.
std::string expiryText(const CertificateReport& certificate, CalendarTime now);

nlohmann::ordered_json toJson(const StatusReport& report);

/// @param document  from a server, perhaps of another version: unknown members are ignored
/// @throws nlohmann::json::exception, std::invalid_argument  a member is missing or is not what it should be
StatusReport statusReportOf(const nlohmann::ordered_json& document);

} // namespace qel::tool
