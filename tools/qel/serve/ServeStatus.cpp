#include "serve/ServeStatus.hpp"

#include <qel/common/QelVersion.hpp>
#include <qel/common/Utilities.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Logging.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/OptionChecks.hpp"
#include "serve/AuditLog.hpp"
#include "status/StatusSocket.hpp"

#include <algorithm>
#include <exception>
#include <optional>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

using Json = nlohmann::ordered_json;

/// What cannot be done, for whoever asked.
[[noreturn]] void refuse(const std::string& reason) { throw CommandFailure(ExitStatus::Refused, reason); }

std::vector<std::string> textsOf(const std::vector<IPEndpoint>& endpoints)
{
    std::vector<std::string> texts(endpoints.size());
    std::transform(endpoints.begin(), endpoints.end(), texts.begin(),
                   [](const IPEndpoint& endpoint) { return endpoint.str(); });
    return texts;
}

void addCertificate(std::vector<CertificateReport>& certificates, const char* use, const std::string& path)
{
    try {
        const auto validity = SSLCertificate(Utilities::readFile(path)).getValidityPeriod();
        certificates.push_back({use, path, validity.getNotAfter(), CertificateState::Fine});
    } catch (const std::exception& error) {
        logLine(LogLevel::Warn, "status: cannot say when ", path, " expires: ", explain(error));
    }
}

/// The partition with a number or a name. @return null: there is none
const PartitionState* findPartition(const std::vector<PartitionState>& partitions, const std::string& target)
{
    const auto number = parseInteger(target);
    const auto found = std::find_if(partitions.begin(), partitions.end(), [&](const PartitionState& partition) {
        return number ? partition.id == *number : !target.empty() && partition.name == target;
    });
    return found == partitions.end() ? nullptr : &*found;
}

using Place = std::pair<std::uint16_t, std::uint16_t>;

/// The sessions of all consoles that a test is true for.
template <typename Test>
std::vector<Place> placesOf(const StatusReport& report, Test test)
{
    std::vector<Place> places;
    for (const PartitionState& partition : report.partitions) {
        for (const SessionState& session : partition.sessions) {
            const ConnectedConsole* const console = report.consoleOf(session);
            if (console != nullptr && test(console->peer)) places.emplace_back(partition.id, session.number);
        }
    }
    return places;
}

/// "PARTITION/CONNECTION". @return none: the target is not of this form, or there is no such partition
std::optional<Place> placeOf(const StatusReport& report, const std::string& target)
{
    const std::size_t slash = target.find('/');
    const PartitionState* const partition = findPartition(report.partitions, target.substr(0, slash));
    if (partition == nullptr) return std::nullopt;
    if (slash == std::string::npos) return Place(partition->id, std::uint16_t{0});
    const auto number = parseInteger(target.substr(slash + 1));
    if (!number || *number > 15) refuse("\"" + target.substr(slash + 1) + "\" is not a connection number, 0 to 15");
    return Place(partition->id, static_cast<std::uint16_t>(*number));
}

/// The sessions that "close" is about.
/// @throws CommandFailure  Refused: there are none, or it is not clear which
std::vector<Place> placesToClose(const StatusReport& report, const std::string& target)
{
    const bool isConsoleId = !target.empty() && target.front() == '#';
    const auto id = isConsoleId ? parseInteger(target.substr(1)) : std::nullopt;
    const auto isMeant = [&](const Peer& peer) {
        return isConsoleId ? id && peer.id == *id : !target.empty() && peer.commonName == target;
    };
    const auto& consoles = report.server.consoles;
    const bool isConsole = std::any_of(consoles.begin(), consoles.end(), [&](const auto& console) {
        return console.isIdentified && isMeant(console.peer);
    });
    const std::optional<Place> place = isConsoleId ? std::nullopt : placeOf(report, target);
    if (place && isConsole) refuse(target + " is a partition and a console: give the number of one, such as 1 or #1");
    if (place) return {*place};
    if (!isConsole) refuse("there is no partition and no console " + target);
    std::vector<Place> places = placesOf(report, isMeant);
    if (places.empty()) refuse("console " + target + " has no session");
    return places;
}

std::string placeText(const Place& place)
{
    return "partition " + std::to_string(place.first) + ", connection " + std::to_string(place.second);
}

/// The peer that holds a session, for the audit log.
Peer holderOf(const StatusReport& report, const Place& place)
{
    for (const PartitionState& partition : report.partitions) {
        if (partition.id != place.first) continue;
        for (const SessionState& session : partition.sessions) {
            const ConnectedConsole* const console = report.consoleOf(session);
            if (session.number == place.second && console != nullptr) return console->peer;
        }
    }
    return {};
}

} // namespace

ServeStatus::ServeStatus(Server& server, const ServePlan& plan)
    : mServer(server), mMaxConsoles(plan.server.maxConsoles), mListen(textsOf(server.endpoints()))
{
    note(plan, true);
}

void ServeStatus::note(const ServePlan& plan, bool hasLoaded)
{
    std::vector<CertificateReport> certificates;
    if (hasLoaded && !plan.transport.plain) {
        addCertificate(certificates, "own", plan.transport.paths().certificate);
        addCertificate(certificates, "root", plan.transport.paths().root);
    }
    const MutexLock lock(mMutex);
    mWarnExpiry = plan.warnExpiry;
    if (hasLoaded) mCertificates.swap(certificates);
}

StatusReport ServeStatus::report() const
{
    StatusReport report;
    report.version = QEL_VERSION_STRING;
    report.pid = ::getpid();
    report.now = SSLValidityPeriod::Clock::now();
    report.listen = mListen;
    report.maxConsoles = mMaxConsoles;
    report.partitions = mServer.partitions();
    report.server = mServer.state();
    const auto place = [](const ConnectedConsole& console) {
        return console.peer.id - 1;
    }; // 0, the unknown, comes last
    std::stable_sort(report.server.consoles.begin(), report.server.consoles.end(),
                     [&](const auto& left, const auto& right) { return place(left) < place(right); });
    std::chrono::hours warnExpiry;
    {
        const MutexLock lock(mMutex);
        report.certificates = mCertificates;
        warnExpiry = mWarnExpiry;
    }
    for (CertificateReport& certificate : report.certificates) {
        const SSLValidityPeriod validity(SSLValidityPeriod::Clock::time_point(), certificate.notAfter);
        certificate.state = stateAt(validity, report.now, warnExpiry);
    }
    return report;
}

std::string ServeStatus::answer(const std::string& line, uid_t user)
{
    Json answer;
    try {
        answer = pAnswer(line, user);
    } catch (const std::exception& error) {
        answer = {{"ok", false}, {"error", userMessage(error)}};
    }
    return answer.dump(-1, ' ', false, Json::error_handler_t::replace);
}

Json ServeStatus::pAnswer(const std::string& line, uid_t user)
{
    const std::string text = line.substr(0, line.find('\r'));
    const std::size_t blank = text.find(' ');
    const std::string word = text.substr(0, blank);
    const std::string target = blank == std::string::npos ? std::string() : text.substr(blank + 1);
    if (word == "status" && target.empty()) return {{"ok", true}, {"status", toJson(report())}};
    if (word == "close" && !target.empty()) return pClose(target, user);
    if (word == "break" && !target.empty()) return pBreak(target, user);
    refuse("the requests are: status, close CONSOLE|PARTITION[/CONNECTION], break PARTITION");
}

Json ServeStatus::pClose(const std::string& target, uid_t user)
{
    const StatusReport before = report();
    auto closed = Json::array();
    for (const Place& place : placesToClose(before, target)) {
        if (!mServer.closeSession(place.first, place.second)) continue;
        const Peer peer = holderOf(before, place);
        logLine(LogLevel::Info, auditEnded(peer, place.first, place.second, user));
        closed.push_back({{"partition", place.first},
                          {"connection", place.second},
                          {"console", peer.id},
                          {"name", peer.commonName.empty() ? peer.toolId : peer.commonName}});
    }
    if (closed.empty()) {
        const std::vector<Place> places = placesToClose(before, target);
        refuse(placeText(places.front()) + ": there is no session");
    }
    return {{"ok", true}, {"closed", std::move(closed)}};
}

Json ServeStatus::pBreak(const std::string& target, uid_t user)
{
    const std::vector<PartitionState> partitions = mServer.partitions();
    const PartitionState* const partition = findPartition(partitions, target);
    if (partition == nullptr) refuse("there is no partition " + target);
    const std::string text = "partition " + std::to_string(partition->id);
    if (partition->line != PartitionState::Line::Up) refuse(text + ": its line is " + lineWord(partition->line));
    if (!mServer.sendBreak(partition->id)) {
        refuse(text + ": its line has no break, or could not send it; the server's log says so then");
    }
    logLine(LogLevel::Info, auditBreak(partition->id, user));
    return {{"ok", true}, {"partition", partition->id}};
}

std::unique_ptr<StatusServer> startStatus(ServeStatus& status, const ServePlan& plan)
{
    if (plan.statusSocket == "none") return nullptr;
    const bool isDefault = plan.statusSocket.empty();
    const std::string path = isDefault ? defaultStatusSocket() : plan.statusSocket;
    if (path.empty()) return nullptr;
    try {
        auto server = std::make_unique<StatusServer>(
            path, [&status](const std::string& line, uid_t user) { return status.answer(line, user); });
        logLine(LogLevel::Info, "qel status: ", path);
        return server;
    } catch (const CommandFailure& failure) {
        if (!isDefault) throw;
        logLine(LogLevel::Info, "no status socket: ", failure.what(), "; --status-socket names another one");
        return nullptr;
    }
}

} // namespace qel::tool
