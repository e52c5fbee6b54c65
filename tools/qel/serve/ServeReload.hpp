#pragma once

#include <qel/protocol/Server.hpp>

#include "base/Library.hpp"
#include "lines/LineLogs.hpp"
#include "lines/LineText.hpp"
#include "serve/ServeMachine.hpp"
#include "serve/ServePlan.hpp"

#include <cstdint>
#include <functional>
#include <map>
#include <utility>
#include <vector>

namespace qel::tool {

/// Makes a partition of a plan: its line, and all of its options.
/// @throws FileIOError  its log cannot be opened
MadeLine makePartition(std::uint16_t id, const PlannedPartition& partition, const std::string& term, LineLogs& logs);

/// Brings a server to what its configuration file and its credentials say now, without a restart.
///
/// Lifetime: borrows the server, the machine and the logs. Thread safety: one thread.
class ServeReload {
public:
    /// @param inForce  what is in force now
    /// @param hasLoaded  whether the server has loaded its credentials again
    using OnReload = std::function<void(const ServePlan& inForce, bool hasLoaded)>;

    /// @param plan  what the server has been started with
    /// @param onReload  called at the end of each run()
    ServeReload(Server& server, ServeMachine& machine, LineLogs& logs, const ServePlan& plan, OnReload onReload);

    /// Reads the file and the credentials again. Partitions and rules follow the file; a session that is still allowed,
    /// on a line that stays the same, goes on. An error in the file changes nothing of them, and is logged.
    void run();

    /// Warns of own certificates that expire soon.
    void warnOfExpiry() const;

private:
    using MadeLines = std::vector<std::pair<std::uint16_t, MadeLine>>;

    void pApply(const ServePlan& next);
    void pRemovePartitions(const std::map<std::uint16_t, PlannedPartition>& next);
    void pApplyPartitions(const std::map<std::uint16_t, PlannedPartition>& next, MadeLines made);
    void pApplyPartition(std::uint16_t id, MadeLine made);
    std::size_t pEndForbiddenSessions();
    void pLogSettings(const ServePlan& next) const;
    bool pLoadCredentials(const TransportOptions& wanted);

    Server& mServer;
    ServeMachine& mMachine;
    LineLogs& mLogs;
    ServePlan mPlan; ///< in force
    const OnReload mOnReload;
};

/// "1 partition", "2 partitions"
std::string countText(std::size_t count, const char* what);

} // namespace qel::tool
