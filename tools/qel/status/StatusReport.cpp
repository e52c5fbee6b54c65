#include "status/StatusReport.hpp"

#include <algorithm>
#include <array>
#include <cstdio>
#include <ctime>
#include <iterator>
#include <stdexcept>

namespace qel::tool {

namespace {

using Json = nlohmann::ordered_json;
using Buckets = QelMessageLatencyBuckets;

constexpr std::array<PartitionState::Line, 4> kLines{PartitionState::Line::Down, PartitionState::Line::ComingUp,
                                                     PartitionState::Line::Up, PartitionState::Line::Ended};
constexpr std::array<CertificateState, 4> kStates{CertificateState::Fine, CertificateState::Due,
                                                  CertificateState::Expired, CertificateState::NotYetValid};

/// @param text  as isoTime() writes it. @throws std::invalid_argument
CalendarTime timeOf(const std::string& text)
{
    std::tm fields{};
    int end = 0;
    const int found = std::sscanf(text.c_str(), "%4d-%2d-%2dT%2d:%2d:%2dZ%n", &fields.tm_year, &fields.tm_mon,
                                  &fields.tm_mday, &fields.tm_hour, &fields.tm_min, &fields.tm_sec, &end);
    if (found != 6 || static_cast<std::size_t>(end) != text.size()) throw std::invalid_argument("not a time: " + text);
    fields.tm_year -= 1900;
    fields.tm_mon -= 1;
    return SSLValidityPeriod::Clock::from_time_t(::timegm(&fields));
}

std::chrono::system_clock::time_point systemTimeOf(const std::string& text)
{
    return std::chrono::system_clock::from_time_t(SSLValidityPeriod::Clock::to_time_t(timeOf(text)));
}

/// The value that has a word. @throws std::invalid_argument
template <typename Value, std::size_t count, typename Word>
Value byWord(const std::array<Value, count>& values, const std::string& text, Word word)
{
    const auto found = std::find_if(values.begin(), values.end(), [&](Value value) { return text == word(value); });
    if (found == values.end()) throw std::invalid_argument("not a state: " + text);
    return *found;
}

Json countJson(const QelMessageCount& count) { return {{"messages", count.mCount}, {"bytes", count.mBytes}}; }

QelMessageCount countOf(const Json& json)
{
    QelMessageCount count;
    json.at("messages").get_to(count.mCount);
    json.at("bytes").get_to(count.mBytes);
    return count;
}

/// Adds the members of a queue to an object.
void addQueue(Json& json, const QueueState& queue)
{
    json["sent"] = countJson(queue.sent);
    json["queued"] = countJson(queue.pending);
    json["mostQueuedBytes"] = queue.mostBytes;
    json["dropped"] = countJson(queue.dropped);
    json["latency"] = queue.latency.getCounts();
}

QueueState queueOf(const Json& json)
{
    QueueState queue;
    queue.sent = countOf(json.at("sent"));
    queue.pending = countOf(json.at("queued"));
    json.at("mostQueuedBytes").get_to(queue.mostBytes);
    queue.dropped = countOf(json.at("dropped"));
    const auto counts = json.at("latency").get<std::array<std::uint64_t, 6>>();
    for (std::size_t i = 0; i < std::size(Buckets::LIMITS); ++i)
        queue.latency.increment(Buckets::LIMITS[i], counts.at(i));
    queue.latency.increment(std::chrono::hours(1), counts.back());
    return queue;
}

Json consoleJson(const ConnectedConsole& console)
{
    Json json;
    json["id"] = console.peer.id;
    json["connected"] = console.isIdentified;
    json["name"] = console.peer.commonName;
    json["fingerprint"] = console.peer.fingerprint;
    json["address"] = console.peer.address;
    json["tls"] = console.peer.isProtected ? Json("1.3") : Json(); // the library accepts no other version
    json["toolType"] = console.peer.toolType;
    json["toolId"] = console.peer.toolId;
    json["since"] = isoTime(calendarTime(console.since));
    json["received"] = countJson(console.received);
    addQueue(json, console.queue);
    return json;
}

ConnectedConsole consoleFrom(const Json& json)
{
    ConnectedConsole console;
    json.at("id").get_to(console.peer.id);
    json.at("connected").get_to(console.isIdentified);
    json.at("name").get_to(console.peer.commonName);
    json.at("fingerprint").get_to(console.peer.fingerprint);
    json.at("address").get_to(console.peer.address);
    console.peer.isProtected = !json.at("tls").is_null();
    json.at("toolType").get_to(console.peer.toolType);
    json.at("toolId").get_to(console.peer.toolId);
    console.since = systemTimeOf(json.at("since").get<std::string>());
    console.received = countOf(json.at("received"));
    console.queue = queueOf(json);
    return console;
}

Json partitionJson(const PartitionState& partition)
{
    auto sessions = Json::array();
    for (const SessionState& session : partition.sessions)
        sessions.push_back({{"connection", session.number}, {"console", session.console}, {"setUp", session.isSetUp}});
    Json json;
    json["id"] = partition.id;
    json["name"] = partition.name;
    json["description"] = partition.description;
    json["line"] = lineWord(partition.line);
    json["starts"] = partition.starts;
    json["sessions"] = std::move(sessions);
    json["output"] = {{"messages", partition.outputMessages}, {"bytes", partition.outputBytes}};
    json["input"] = {{"messages", partition.inputMessages}, {"bytes", partition.inputBytes}};
    json["skippedBytes"] = partition.skippedBytes;
    json["droppedBytes"] = partition.droppedBytes;
    json["keptBytes"] = partition.keptBytes;
    json["replayBytes"] = partition.replayBytes;
    json["waitingBytes"] = partition.waitingBytes;
    return json;
}

PartitionState partitionFrom(const Json& json)
{
    PartitionState partition{};
    json.at("id").get_to(partition.id);
    json.at("name").get_to(partition.name);
    json.at("description").get_to(partition.description);
    partition.line = byWord(kLines, json.at("line").get<std::string>(), lineWord);
    json.at("starts").get_to(partition.starts);
    for (const Json& session : json.at("sessions")) {
        partition.sessions.push_back({session.at("connection").get<std::uint16_t>(),
                                      session.at("console").get<std::uint64_t>(), session.at("setUp").get<bool>()});
    }
    const QelMessageCount output = countOf(json.at("output"));
    const QelMessageCount input = countOf(json.at("input"));
    partition.outputMessages = output.mCount;
    partition.outputBytes = output.mBytes;
    partition.inputMessages = input.mCount;
    partition.inputBytes = input.mBytes;
    json.at("skippedBytes").get_to(partition.skippedBytes);
    json.at("droppedBytes").get_to(partition.droppedBytes);
    json.at("keptBytes").get_to(partition.keptBytes);
    json.at("replayBytes").get_to(partition.replayBytes);
    json.at("waitingBytes").get_to(partition.waitingBytes);
    return partition;
}

Json refusedJson(const ServerState& server)
{
    auto json = Json::object();
    for (std::size_t i = 0; i < server.refused.size(); ++i)
        json[refusalWord(static_cast<ConnectionRefusal>(i))] = server.refused[i];
    return json;
}

Json serverJson(const ServerState& server)
{
    Json json;
    json["accepted"] = server.accepted;
    json["refused"] = refusedJson(server);
    json["received"] = countJson(server.received);
    addQueue(json, server.queues);
    return json;
}

ServerState serverFrom(const Json& json)
{
    ServerState server;
    json.at("accepted").get_to(server.accepted);
    for (std::size_t i = 0; i < server.refused.size(); ++i)
        json.at("refused").at(refusalWord(static_cast<ConnectionRefusal>(i))).get_to(server.refused.at(i));
    server.received = countOf(json.at("received"));
    server.queues = queueOf(json);
    return server;
}

} // namespace

CalendarTime calendarTime(std::chrono::system_clock::time_point time)
{
    return SSLValidityPeriod::Clock::from_time_t(std::chrono::system_clock::to_time_t(time));
}

long long CertificateReport::daysLeft(CalendarTime now) const
{
    constexpr long long kDay = 24LL * 60 * 60;
    const long long seconds = (notAfter - now).count();
    return seconds >= 0 ? seconds / kDay : -((-seconds + kDay - 1) / kDay);
}

const ConnectedConsole* StatusReport::consoleOf(const SessionState& session) const
{
    const auto found = std::find_if(server.consoles.begin(), server.consoles.end(),
                                    [&](const auto& console) { return console.peer.id == session.console; });
    return found == server.consoles.end() ? nullptr : &*found;
}

const char* lineWord(PartitionState::Line line)
{
    switch (line) {
    case PartitionState::Line::ComingUp:
        return "coming up";
    case PartitionState::Line::Up:
        return "up";
    case PartitionState::Line::Ended:
        return "ended";
    default:
        return "down";
    }
}

std::string expiryText(const CertificateReport& certificate, CalendarTime now)
{
    const long long days = certificate.daysLeft(now);
    const std::string time = isoTime(certificate.notAfter);
    std::string text = certificate.use + " certificate " + certificate.file;
    switch (certificate.state) {
    case CertificateState::Expired:
        return text + " has expired at " + time + ": replace it";
    case CertificateState::NotYetValid:
        return text + " is not valid yet";
    default:
        break;
    }
    text += " expires at " + time + ", in " + std::to_string(days) + (days == 1 ? " day" : " days");
    return certificate.state == CertificateState::Due ? text + ": replace it" : text;
}

Json toJson(const StatusReport& report)
{
    Json json;
    json["version"] = report.version;
    json["pid"] = report.pid;
    json["time"] = isoTime(report.now);
    json["since"] = isoTime(calendarTime(report.server.since));
    json["listen"] = report.listen;
    json["maxConsoles"] = report.maxConsoles;
    json["certificates"] = Json::array();
    for (const CertificateReport& certificate : report.certificates) {
        json["certificates"].push_back({{"use", certificate.use},
                                        {"file", certificate.file},
                                        {"notAfter", isoTime(certificate.notAfter)},
                                        {"daysLeft", certificate.daysLeft(report.now)},
                                        {"state", stateName(certificate.state)}});
    }
    json["consoles"] = Json::array();
    for (const ConnectedConsole& console : report.server.consoles)
        json["consoles"].push_back(consoleJson(console));
    json["partitions"] = Json::array();
    for (const PartitionState& partition : report.partitions)
        json["partitions"].push_back(partitionJson(partition));
    json["connections"] = serverJson(report.server);
    return json;
}

StatusReport statusReportOf(const Json& document)
{
    StatusReport report;
    document.at("version").get_to(report.version);
    document.at("pid").get_to(report.pid);
    report.now = timeOf(document.at("time").get<std::string>());
    document.at("listen").get_to(report.listen);
    document.at("maxConsoles").get_to(report.maxConsoles);
    for (const Json& certificate : document.at("certificates")) {
        report.certificates.push_back({certificate.at("use").get<std::string>(),
                                       certificate.at("file").get<std::string>(),
                                       timeOf(certificate.at("notAfter").get<std::string>()),
                                       byWord(kStates, certificate.at("state").get<std::string>(), stateName)});
    }
    report.server = serverFrom(document.at("connections"));
    report.server.since = systemTimeOf(document.at("since").get<std::string>());
    for (const Json& console : document.at("consoles"))
        report.server.consoles.push_back(consoleFrom(console));
    for (const Json& partition : document.at("partitions"))
        report.partitions.push_back(partitionFrom(partition));
    return report;
}

} // namespace qel::tool
