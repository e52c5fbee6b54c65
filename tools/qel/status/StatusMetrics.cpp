#include "status/StatusMetrics.hpp"

#include <qel/common/stats/QelMessageLatencyBuckets.hpp>

#include <algorithm>
#include <array>
#include <string>

namespace qel::tool {

namespace {

std::string escaped(const std::string& text)
{
    std::string result;
    for (const char c : text) {
        if (c == '\n') {
            result += "\\n";
        } else if (c == '\\' || c == '"') {
            result += std::string("\\") + c;
        } else {
            result += c;
        }
    }
    return result;
}

std::string label(const char* name, const std::string& value)
{
    return std::string(name) + "=\"" + escaped(value) + "\"";
}

/// The samples of one metric after its help and type.
class Metric {
public:
    Metric(std::ostream& os, const char* name, const char* type, const char* help) : mOs(os), mName(name)
    {
        mOs << "# HELP " << name << ' ' << help << "\n# TYPE " << name << ' ' << type << '\n';
    }

    template <typename Number>
    void add(Number value, const std::string& labels = {})
    {
        mOs << mName;
        if (!labels.empty()) mOs << '{' << labels << '}';
        mOs << ' ' << value << '\n';
    }

private:
    std::ostream& mOs;
    const char* mName;
};

template <typename Number>
void single(std::ostream& os, const char* name, const char* type, const char* help, Number value)
{
    Metric(os, name, type, help).add(value);
}

long long secondsOf(CalendarTime time) { return SSLValidityPeriod::Clock::to_time_t(time); }

void printServer(std::ostream& os, const StatusReport& report)
{
    const auto& consoles = report.server.consoles;
    const auto connected =
        std::count_if(consoles.begin(), consoles.end(), [](const auto& console) { return console.isIdentified; });
    Metric(os, "qel_build_info", "gauge", "The program; always 1.").add(1, label("version", report.version));
    single(os, "qel_start_time_seconds", "gauge", "When the server started, in seconds since 1970.",
           secondsOf(calendarTime(report.server.since)));
    single(os, "qel_uptime_seconds", "gauge", "Seconds since the server started.", report.upTime().count());
    single(os, "qel_consoles", "gauge", "Consoles that are connected.", connected);
    single(os, "qel_consoles_max", "gauge", "Consoles that may be connected.", report.maxConsoles);
    single(os, "qel_handshakes", "gauge", "Connections that are not consoles yet.",
           static_cast<std::ptrdiff_t>(consoles.size()) - connected);
    single(os, "qel_connections_accepted_total", "counter", "Connections, those that were refused included.",
           report.server.accepted);
    Metric refused(os, "qel_connections_refused_total", "counter",
                   "Connections that ended before they were consoles, by reason.");
    for (std::size_t i = 0; i < report.server.refused.size(); ++i) {
        refused.add(report.server.refused[i], label("reason", refusalWord(static_cast<ConnectionRefusal>(i))));
    }
}

void printTraffic(std::ostream& os, const ServerState& server)
{
    const QueueState& queues = server.queues;
    single(os, "qel_messages_received_total", "counter", "Messages from consoles.", server.received.mCount);
    single(os, "qel_bytes_received_total", "counter", "Bytes of messages from consoles.", server.received.mBytes);
    single(os, "qel_messages_sent_total", "counter", "Messages to consoles.", queues.sent.mCount);
    single(os, "qel_bytes_sent_total", "counter", "Bytes of messages to consoles.", queues.sent.mBytes);
    single(os, "qel_messages_dropped_total", "counter", "Broadcasts that found no room.", queues.dropped.mCount);
    single(os, "qel_bytes_dropped_total", "counter", "Bytes of broadcasts that found no room.", queues.dropped.mBytes);
    single(os, "qel_queue_messages", "gauge", "Messages that wait for consoles.", queues.pending.mCount);
    single(os, "qel_queue_bytes", "gauge", "Bytes of messages that wait for consoles.", queues.pending.mBytes);
    single(os, "qel_queue_peak_bytes", "gauge", "The most bytes in the queue of one console so far.", queues.mostBytes);
}

/// The statistics have classes and no sum of the times, so there is no _sum.
void printLatency(std::ostream& os, const QelMessageLatencyBuckets& latency)
{
    constexpr std::array<const char*, 6> kLimits{"0.001", "0.01", "0.1", "1", "10", "+Inf"};
    Metric(os, "qel_queue_latency_seconds", "histogram", "How long messages to consoles were in their queues.");
    std::uint64_t upTo = 0;
    for (std::size_t i = 0; i < kLimits.size(); ++i) {
        upTo += latency.getCounts().at(i);
        os << "qel_queue_latency_seconds_bucket{le=\"" << kLimits.at(i) << "\"} " << upTo << '\n';
    }
    os << "qel_queue_latency_seconds_count " << upTo << '\n';
}

std::string labelsOf(const PartitionState& partition)
{
    return label("partition", std::to_string(partition.id)) + "," + label("name", partition.name);
}

/// One metric for a member of all partitions.
template <typename Number>
void ofPartitions(std::ostream& os, const StatusReport& report, const char* name, const char* type, const char* help,
                  Number PartitionState::*member)
{
    Metric metric(os, name, type, help);
    for (const PartitionState& partition : report.partitions)
        metric.add(partition.*member, labelsOf(partition));
}

void printPartitions(std::ostream& os, const StatusReport& report)
{
    constexpr const char* kCounter = "counter";
    constexpr const char* kGauge = "gauge";
    const auto print = [&](const char* name, const char* type, const char* help, auto member) {
        ofPartitions(os, report, name, type, help, member);
    };
    Metric up(os, "qel_partition_up", kGauge, "1: the line of the partition is up.");
    for (const PartitionState& partition : report.partitions)
        up.add(partition.line == PartitionState::Line::Up ? 1 : 0, labelsOf(partition));
    Metric sessions(os, "qel_partition_sessions", kGauge, "Sessions, by what they may do.");
    for (const PartitionState& partition : report.partitions) {
        const auto typing = std::count_if(partition.sessions.begin(), partition.sessions.end(),
                                          [](const SessionState& session) { return session.number == 0; });
        const auto all = static_cast<std::ptrdiff_t>(partition.sessions.size());
        sessions.add(typing, labelsOf(partition) + "," + label("mode", "type"));
        sessions.add(all - typing, labelsOf(partition) + "," + label("mode", "watch"));
    }
    print("qel_partition_starts_total", kCounter, "How often the line came up.", &PartitionState::starts);
    print("qel_partition_output_bytes_total", kCounter, "Bytes that the line put out.", &PartitionState::outputBytes);
    print("qel_partition_output_messages_total", kCounter, "Messages of serial data to consoles.",
          &PartitionState::outputMessages);
    print("qel_partition_input_bytes_total", kCounter, "Bytes that the line took.", &PartitionState::inputBytes);
    print("qel_partition_input_messages_total", kCounter, "Messages of serial data from consoles.",
          &PartitionState::inputMessages);
    print("qel_partition_skipped_bytes_total", kCounter, "Bytes of output that consoles were too slow for.",
          &PartitionState::skippedBytes);
    print("qel_partition_dropped_bytes_total", kCounter, "Bytes of input of watchers, or while the line was down.",
          &PartitionState::droppedBytes);
    print("qel_partition_replay_bytes", kGauge, "Bytes of output that are kept.", &PartitionState::keptBytes);
    print("qel_partition_replay_max_bytes", kGauge, "Bytes of output that may be kept.", &PartitionState::replayBytes);
    print("qel_partition_waiting_bytes", kGauge, "Bytes of input that wait for the line.",
          &PartitionState::waitingBytes);
}

void printCertificates(std::ostream& os, const StatusReport& report)
{
    const auto labels = [](const CertificateReport& certificate) {
        return label("use", certificate.use) + "," + label("file", certificate.file);
    };
    Metric days(os, "qel_certificate_expiry_days", "gauge", "Days until the certificate expires; negative afterwards.");
    for (const CertificateReport& certificate : report.certificates)
        days.add(certificate.daysLeft(report.now), labels(certificate));
    Metric time(os, "qel_certificate_not_after_seconds", "gauge",
                "When the certificate expires, in seconds since 1970.");
    for (const CertificateReport& certificate : report.certificates)
        time.add(secondsOf(certificate.notAfter), labels(certificate));
}

} // namespace

void printMetrics(std::ostream& os, const StatusReport& report)
{
    printServer(os, report);
    printTraffic(os, report.server);
    printLatency(os, report.server.queues.latency);
    printPartitions(os, report);
    printCertificates(os, report);
}

} // namespace qel::tool
