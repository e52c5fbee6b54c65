#include "status/StatusText.hpp"

#include <qel/common/stats/QelMessageLatencyBuckets.hpp>
#include <qel/protocol/Text.hpp>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <iterator>
#include <numeric>

namespace qel::tool {

namespace {

using Row = std::vector<std::string>;

/// The columns of a table are as wide as what is in them; the last one may be long.
void printTable(std::ostream& os, const std::vector<Row>& rows)
{
    std::vector<std::size_t> widths(rows.front().size());
    for (const Row& row : rows) {
        for (std::size_t i = 0; i < row.size(); ++i)
            widths[i] = std::max(widths[i], row[i].size());
    }
    for (const Row& row : rows) {
        std::string line;
        for (std::size_t i = 0; i < row.size(); ++i)
            line += "  " + row[i] + std::string(widths[i] - row[i].size(), ' ');
        line.erase(line.find_last_not_of(' ') + 1);
        os << line << '\n';
    }
}

std::string countText(const QelMessageCount& count)
{
    return std::to_string(count.mCount) + " (" + bytesText(count.mBytes) + ")";
}

std::string messagesText(const QelMessageCount& count)
{
    return std::to_string(count.mCount) + (count.mCount == 1 ? " message (" : " messages (") + bytesText(count.mBytes) +
           ")";
}

std::string orDash(const std::string& text) { return text.empty() ? "-" : text; }

void printConsoles(std::ostream& os, const StatusReport& report)
{
    const auto& all = report.server.consoles;
    const auto connected =
        std::count_if(all.begin(), all.end(), [](const auto& console) { return console.isIdentified; });
    os << "\nConsoles: " << connected << " of at most " << report.maxConsoles << '\n';
    if (all.empty()) return;
    std::vector<Row> rows{{"ID", "NAME", "ADDRESS", "SINCE", "TLS", "RECEIVED", "SENT", "QUEUE", "FINGERPRINT"}};
    for (const ConnectedConsole& console : all) {
        rows.push_back({console.peer.id == 0 ? "-" : "#" + std::to_string(console.peer.id),
                        console.isIdentified ? consoleName(console) : "(handshake)", printable(console.peer.address),
                        durationText(report.ageOf(console.since)), console.peer.isProtected ? "1.3" : "-",
                        countText(console.received), countText(console.queue.sent),
                        bytesText(console.queue.pending.mBytes), orDash(printable(console.peer.fingerprint))});
    }
    printTable(os, rows);
}

/// The names of those who hold a session on connection 0, or on another one.
std::string holders(const StatusReport& report, const PartitionState& partition, bool types)
{
    std::string text;
    for (const SessionState& session : partition.sessions) {
        if ((session.number == 0) != types) continue;
        const ConnectedConsole* const console = report.consoleOf(session);
        text += text.empty() ? "" : ", ";
        text += console == nullptr ? "?" : consoleName(*console);
        text += " #" + std::to_string(session.console);
    }
    return text;
}

void printPartitions(std::ostream& os, const StatusReport& report)
{
    os << "\nPartitions: " << report.partitions.size() << '\n';
    if (report.partitions.empty()) return;
    std::vector<Row> rows{
        {"ID", "NAME", "LINE", "TYPES", "WATCH", "OUTPUT", "INPUT", "REPLAY", "STARTS", "DESCRIPTION"}};
    for (const PartitionState& partition : report.partitions) {
        rows.push_back({std::to_string(partition.id), orDash(printable(partition.name)), lineWord(partition.line),
                        orDash(holders(report, partition, true)), orDash(holders(report, partition, false)),
                        countText({partition.outputMessages, partition.outputBytes}),
                        countText({partition.inputMessages, partition.inputBytes}),
                        bytesText(partition.keptBytes) + " of " + bytesText(partition.replayBytes),
                        std::to_string(partition.starts), printable(partition.description)});
    }
    printTable(os, rows);
    for (const PartitionState& partition : report.partitions) {
        const std::string begin = "  partition " + std::to_string(partition.id) + ": ";
        if (partition.waitingBytes > 0) {
            os << begin << bytesText(partition.waitingBytes) << " of input wait for its line\n";
        }
        if (partition.skippedBytes > 0) {
            os << begin << bytesText(partition.skippedBytes)
               << " of output did not reach consoles that were too slow\n";
        }
        if (partition.droppedBytes > 0) {
            os << begin << bytesText(partition.droppedBytes)
               << " of input dropped, of watchers or while its line was down\n";
        }
    }
}

std::string refusedText(const ServerState& server)
{
    const auto all = std::accumulate(server.refused.begin(), server.refused.end(), std::uint64_t{0});
    std::string text;
    for (std::size_t i = 0; i < server.refused.size(); ++i) {
        if (server.refused[i] == 0) continue;
        text += (text.empty() ? " (" : ", ") + std::string(refusalWord(static_cast<ConnectionRefusal>(i))) + " " +
                std::to_string(server.refused[i]);
    }
    return std::to_string(all) + " refused" + (text.empty() ? "" : text + ")");
}

std::string latencyText(const QelMessageLatencyBuckets& latency)
{
    constexpr std::array<const char*, 6> kNames{
        "to 1 ms: ", ", to 10 ms: ", ", to 100 ms: ", ", to 1 s: ", ", to 10 s: ", ", longer: "};
    std::string text;
    for (std::size_t i = 0; i < kNames.size(); ++i)
        text += kNames.at(i) + std::to_string(latency.getCounts().at(i));
    return text;
}

void printTotals(std::ostream& os, const ServerState& server)
{
    os << "\nSince the start\n"
       << "  Connections:  " << server.accepted << " accepted, " << refusedText(server) << '\n'
       << "  Received:     " << messagesText(server.received) << '\n'
       << "  Sent:         " << messagesText(server.queues.sent) << ", dropped " << messagesText(server.queues.dropped)
       << '\n'
       << "  Queued:       " << messagesText(server.queues.pending) << " now, at most "
       << bytesText(server.queues.mostBytes) << " for one console\n"
       << "  In queues:    " << latencyText(server.queues.latency) << '\n';
}

} // namespace

void printStatus(std::ostream& os, const StatusReport& report)
{
    os << "qel serve " << printable(report.version) << ", process " << report.pid << ", up "
       << durationText(report.upTime());
    for (const std::string& endpoint : report.listen)
        os << (&endpoint == &report.listen.front() ? ", on " : " and ") << printable(endpoint);
    os << '\n';
    for (const CertificateReport& certificate : report.certificates) {
        os << (certificate.state == CertificateState::Fine ? "" : "WARNING: ")
           << printable(expiryText(certificate, report.now)) << '\n';
    }
    printConsoles(os, report);
    printPartitions(os, report);
    printTotals(os, report.server);
}

std::string sessionsText(const StatusReport& report, const PartitionState& partition)
{
    const std::string typing = holders(report, partition, true);
    const std::string watching = holders(report, partition, false);
    if (typing.empty() && watching.empty()) return "nobody";
    if (watching.empty()) return typing + " types";
    const char* const watch = watching.find(", ") == std::string::npos ? " watches" : " watch";
    return (typing.empty() ? "" : typing + " types, ") + watching + watch;
}

std::string consoleName(const ConnectedConsole& console)
{
    const std::string& name = console.peer.commonName.empty() ? console.peer.toolId : console.peer.commonName;
    return orDash(printable(name));
}

std::string bytesText(std::uint64_t bytes)
{
    constexpr std::array<const char*, 4> kUnits{"KiB", "MiB", "GiB", "TiB"};
    if (bytes < 1024) return std::to_string(bytes) + " B";
    double value = static_cast<double>(bytes) / 1024;
    std::size_t unit = 0;
    for (; value >= 1023.95 && unit + 1 < kUnits.size(); ++unit)
        value /= 1024;
    std::array<char, 32> text{};
    const bool isWhole = std::lround(value * 10) % 10 == 0;
    std::snprintf(text.data(), text.size(), isWhole ? "%.0f %s" : "%.1f %s", value, kUnits.at(unit));
    return text.data();
}

std::string durationText(std::chrono::seconds duration)
{
    const auto seconds = std::max<std::int64_t>(duration.count(), 0);
    constexpr std::int64_t kMinute = 60;
    constexpr std::int64_t kHour = 60 * kMinute;
    constexpr std::int64_t kDay = 24 * kHour;
    const auto two = [seconds](std::int64_t large, const char* first, std::int64_t small, const char* second) {
        return std::to_string(seconds / large) + first + " " + std::to_string(seconds % large / small) + second;
    };
    if (seconds < kMinute) return std::to_string(seconds) + "s";
    if (seconds < kHour) return two(kMinute, "m", 1, "s");
    if (seconds < kDay) return two(kHour, "h", kMinute, "m");
    return two(kDay, "d", kHour, "h");
}

} // namespace qel::tool
