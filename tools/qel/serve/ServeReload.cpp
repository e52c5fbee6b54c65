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

namespace qel::tool {

namespace {

/// Whether a change of an option counts at once.
bool isReadAgain(const std::string& key)
{
    constexpr std::array<const char*, 13> kKeys{"replay",        "when-unattended",
                                                "start",         "restart",
                                                "line-log", // for partitions without a key of their own
                                                "no-broadcasts", "max-consoles-per-certificate",
                                                "warn-expiry",   "credentials",
                                                "name",          "cert",
                                                "key",           "root"};
    return std::find(kKeys.begin(), kKeys.end(), key) != kKeys.end();
}

} // namespace

MadeLine makePartition(std::uint16_t id, const PlannedPartition& partition, const std::string& term, LineLogs& logs)
{
    MadeLine made = makeLine(partition.line, {term, {}});
    const bool keepsSession = made.options.keepsSession;
    made.options = partition.options;
    made.options.keepsSession = keepsSession;
    made.options.tap = logs.open(id, made.options.name, partition.logDirectory);
    return made;
}

ServeReload::ServeReload(Server& server, ServeMachine& machine, LineLogs& logs, const ServePlan& plan,
                         OnReload onReload)
    : mServer(server), mMachine(machine), mLogs(logs), mPlan(plan), mOnReload(std::move(onReload))
{}

void ServeReload::run()
{
    TransportOptions wanted = mPlan.transport;
    try {
        if (!mPlan.file.empty()) {
            const ServePlan next = planAgain(mPlan.words);
            pApply(next);
            if (!next.transport.plain) wanted = next.transport;
        }
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "SIGHUP: the configuration stays as it was: ", userMessage(error));
    }
    const bool hasLoaded = pLoadCredentials(wanted);
    warnOfExpiry();
    mOnReload(mPlan, hasLoaded);
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
    MadeLines made; // what may fail comes first
    for (const auto& entry : next.partitions)
        made.emplace_back(entry.first, makePartition(entry.first, entry.second, mPlan.term, mLogs));
    pLogSettings(next);
    // Before the rules: they are for the lines of the file, and would open the old line of a partition to those who may
    // use the new one.
    pRemovePartitions(next.partitions);
    // Before the other partitions: whatever happens to them, nobody may do what the file no longer allows. And changing
    // them takes the server's lock: what it was about to allow by the old rules is known to the machine when sessions
    // are ended.
    mMachine.setPolicy(next.policy);
    mPlan.policy = next.policy;
    mPlan.warnExpiry = next.warnExpiry;
    pApplyPartitions(next.partitions, std::move(made));
    logLine(LogLevel::Info, "SIGHUP: read ", mPlan.file, ": ", countText(next.partitions.size(), "partition"), ", ",
            countText(next.policy.rules.size(), "rule"), ", ", countText(pEndForbiddenSessions(), "session"), " ended");
}

/// One whose line has changed is removed too, and added later.
void ServeReload::pRemovePartitions(const std::map<std::uint16_t, PlannedPartition>& next)
{
    const std::map<std::uint16_t, PlannedPartition> before = mPlan.partitions;
    for (const auto& entry : before) {
        const auto kept = next.find(entry.first);
        if (kept != next.end() && kept->second.line == entry.second.line) continue;
        mServer.removePartition(entry.first);
        mPlan.partitions.erase(entry.first);
    }
}

/// One that fails is logged, and the others are applied; the next SIGHUP tries it again.
void ServeReload::pApplyPartitions(const std::map<std::uint16_t, PlannedPartition>& next, MadeLines made)
{
    for (auto& entry : made) {
        try {
            pApplyPartition(entry.first, std::move(entry.second));
            mPlan.partitions.insert_or_assign(entry.first, next.at(entry.first));
        } catch (const std::exception& error) {
            logLine(LogLevel::Error, "partition ", entry.first, ": cannot be changed: ", userMessage(error));
        }
    }
}

/// A partition that is still there has the same line.
void ServeReload::pApplyPartition(std::uint16_t id, MadeLine made)
{
    if (mPlan.partitions.count(id) != 0) return static_cast<void>(mServer.changePartition(id, made.options));
    mServer.addPartition(id, std::move(made.line), made.options);
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
        if (setting.value == mPlan.settings.at(i).value || isReadAgain(setting.key)) continue;
        keys += (keys.empty() ? "" : ", ") + setting.key;
    }
    if (!keys.empty()) logLine(LogLevel::Warn, "SIGHUP: these need a restart: ", keys);
}

/// @param wanted  where the credentials are now
/// @return false: the server has those that it had
bool ServeReload::pLoadCredentials(const TransportOptions& wanted)
{
    if (mPlan.transport.plain) {
        logLine(LogLevel::Info, "SIGHUP: connections are plain, there is nothing to load");
        return false;
    }
    try {
        mServer.setCredentials(*loadCredentials(wanted));
        mPlan.transport = wanted;
        logLine(LogLevel::Info, "SIGHUP: loaded ", mPlan.transport.paths().certificate, " for new connections");
        return true;
    } catch (const std::exception& error) {
        logLine(LogLevel::Error, "SIGHUP: the credentials stay as they were: ", userMessage(error));
        return false;
    }
}

std::string countText(std::size_t count, const char* what)
{
    return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

} // namespace qel::tool
