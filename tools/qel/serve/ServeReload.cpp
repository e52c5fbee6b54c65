#include "serve/ServeReload.hpp"

#include <qel/common/security/SSLValidityPeriod.hpp>
#include <qel/protocol/Logging.hpp>

#include "base/Failures.hpp"
#include "transport/CertificateNotes.hpp"

#include <algorithm>
#include <array>
#include <exception>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

/// The options that are about partitions alone: they count at once, for the partitions without a key of their own.
bool isOfPartitions(const std::string& key)
{
    constexpr std::array<const char*, 4> kKeys{"replay", "when-unattended", "start", "restart"};
    return std::find(kKeys.begin(), kKeys.end(), key) != kKeys.end();
}

} // namespace

MadeLine makePartition(std::uint16_t id, const PlannedPartition& partition, const std::string& term, LineLogs& logs)
{
    MadeLine made = makeLine(partition.line, {term, {}});
    const bool keepsSession = made.options.keepsSession;
    made.options = partition.options;
    made.options.keepsSession = keepsSession;
    made.options.tap = logs.open(id, made.options.name);
    return made;
}

ServeReload::ServeReload(Server& server, ServeMachine& machine, LineLogs& logs, const ServePlan& plan)
    : mServer(server), mMachine(machine), mLogs(logs), mPlan(plan)
{}

void ServeReload::run()
{
    try {
        if (!mPlan.file.empty()) pApply(planAgain(mPlan.words));
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "SIGHUP: the configuration stays as it was: ", userMessage(error));
    }
    pLoadCredentials();
    warnOfExpiry();
}

void ServeReload::warnOfExpiry() const
{
    if (mPlan.transport.plain) return;
    const auto now = SSLValidityPeriod::Clock::now();
    for (const std::string& note : expiryNotes(mPlan.transport.paths(), now, mPlan.warnExpiry))
        logLine(LogLevel::Warn, note);
}

void ServeReload::pApply(const ServePlan& next)
{
    pLogSettings(next);
    pApplyPartitions(next.partitions);
    mPlan.partitions = next.partitions;
    mMachine.setRules(next.rules);
    mPlan.rules = next.rules;
    logLine(LogLevel::Info, "SIGHUP: read ", mPlan.file, ": ", countText(next.partitions.size(), "partition"), ", ",
            countText(next.rules.size(), "rule"), ", ", countText(pEndForbiddenSessions(), "session"), " ended");
}

/// A partition whose line has changed is removed and added. What may fail comes first.
void ServeReload::pApplyPartitions(const std::map<std::uint16_t, PlannedPartition>& next)
{
    std::vector<std::pair<std::uint16_t, MadeLine>> made;
    for (const auto& entry : next)
        made.emplace_back(entry.first, makePartition(entry.first, entry.second, mPlan.term, mLogs));
    for (const auto& entry : mPlan.partitions) {
        const auto kept = next.find(entry.first);
        if (kept != next.end() && kept->second.line == entry.second.line) continue;
        if (mServer.removePartition(entry.first)) logLine(LogLevel::Info, "partition ", entry.first, ": removed");
    }
    for (auto& entry : made) {
        if (pHasLine(entry.first, next.at(entry.first).line)) {
            static_cast<void>(mServer.changePartition(entry.first, entry.second.options));
            continue;
        }
        mServer.addPartition(entry.first, std::move(entry.second.line), entry.second.options);
        logLine(LogLevel::Info, "partition ", entry.first, ": added");
    }
}

/// @return how many sessions were ended
std::size_t ServeReload::pEndForbiddenSessions()
{
    std::size_t ended = 0;
    for (const ServeMachine::SessionPlace& place : mMachine.sessionsToEnd()) {
        if (!mServer.closeSession(place.first, place.second)) continue;
        ++ended;
        logLine(LogLevel::Info, "partition ", place.first, ": the session on connection ", place.second,
                " is ended, the rules do not allow it any more");
    }
    return ended;
}

/// Says which options have changed and are not read again.
void ServeReload::pLogSettings(const ServePlan& next) const
{
    std::string keys;
    for (std::size_t i = 0; i < next.settings.size(); ++i) {
        const Setting& setting = next.settings[i];
        if (setting.value == mPlan.settings.at(i).value || isOfPartitions(setting.key)) continue;
        keys += (keys.empty() ? "" : ", ") + setting.key;
    }
    if (!keys.empty()) logLine(LogLevel::Warn, "SIGHUP: these need a restart: ", keys);
}

void ServeReload::pLoadCredentials()
{
    if (mPlan.transport.plain)
        return logLine(LogLevel::Info, "SIGHUP: connections are plain, there is nothing to load");
    try {
        mServer.setCredentials(*loadCredentials(mPlan.transport));
        logLine(LogLevel::Info, "SIGHUP: loaded ", mPlan.transport.paths().certificate, " for new connections");
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "SIGHUP: the credentials stay as they were: ", userMessage(error));
    }
}

/// Whether a partition is served on a line of this text.
bool ServeReload::pHasLine(std::uint16_t id, const std::string& line) const
{
    const auto found = mPlan.partitions.find(id);
    return found != mPlan.partitions.end() && found->second.line == line;
}

std::string countText(std::size_t count, const char* what)
{
    return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

} // namespace qel::tool
