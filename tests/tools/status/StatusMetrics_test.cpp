#include "status/StatusMetrics.hpp"
#include "support/Process.hpp"
#include "tools/status/FakeReport.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>
#include <sstream>
#include <string>

namespace qel::test {

namespace {

using testing::HasSubstr;
using testing::Not;

std::string metricsOf(const tool::StatusReport& report)
{
    std::ostringstream os;
    tool::printMetrics(os, report);
    return os.str();
}

/// Reads metrics with a parser that is not ours, and prints "NAME{sorted labels} VALUE" for each sample, after "TYPE
/// NAME TYPE" for its metric.
constexpr const char* kParser = R"(
import sys
from prometheus_client.parser import text_string_to_metric_families
for family in text_string_to_metric_families(sys.stdin.read()):
    print("TYPE", family.name, family.type)
    assert family.documentation
    for sample in family.samples:
        labels = ",".join("%s=%s" % item for item in sorted(sample.labels.items()))
        print("%s{%s} %s" % (sample.name, labels, sample.value))
)";

/// Empty: there is no such parser.
std::string parsed(const std::string& metrics)
{
    Process python({"/usr/bin/python3", "-c", kParser});
    python.writeInput(metrics);
    python.closeInput();
    const Process::Result result = python.wait();
    if (result.errors.find("No module named") != std::string::npos || result.exitStatus == 127) return {};
    EXPECT_EQ(result.exitStatus, 0) << result.errors;
    return result.output;
}

TEST(StatusMetrics, AreWhatAParserOfPrometheusReads)
{
    const std::string read = parsed(metricsOf(fakeReport()));
    if (read.empty()) GTEST_SKIP() << "there is no python3-prometheus-client";
    for (const char* line : {"qel_build_info{version=1.2.3} 1.0",
                             "TYPE qel_connections_accepted counter",
                             "qel_connections_accepted_total{} 21.0",
                             "qel_connections_refused_total{reason=certificate} 3.0",
                             "qel_connections_refused_total{reason=other} 4.0",
                             "qel_consoles{} 2.0",
                             "qel_handshakes{} 1.0",
                             "qel_uptime_seconds{} 12307.0",
                             "qel_start_time_seconds{} 1792000000.0",
                             "TYPE qel_queue_latency_seconds histogram",
                             "qel_queue_latency_seconds_bucket{le=0.001} 12.0",
                             "qel_queue_latency_seconds_bucket{le=1} 12.0",
                             "qel_queue_latency_seconds_bucket{le=10} 13.0",
                             "qel_queue_latency_seconds_bucket{le=+Inf} 13.0",
                             "qel_queue_latency_seconds_count{} 13.0",
                             "qel_messages_sent_total{} 13.0",
                             "qel_bytes_dropped_total{} 300.0",
                             "qel_queue_bytes{} 2048.0",
                             "TYPE qel_partition_output_bytes counter",
                             "qel_partition_output_bytes_total{name=web1,partition=1} 1572864.0",
                             "qel_partition_output_messages_total{name=web1,partition=1} 31.0",
                             "qel_partition_input_bytes_total{name=web1,partition=1} 33.0",
                             "qel_partition_sessions{mode=type,name=web1,partition=1} 1.0",
                             "qel_partition_sessions{mode=watch,name=web1,partition=1} 2.0",
                             "qel_partition_up{name=web1,partition=1} 1.0",
                             "qel_partition_up{name=,partition=300} 0.0",
                             "qel_partition_skipped_bytes_total{name=web1,partition=1} 34.0",
                             "qel_certificate_expiry_days{file=/etc/qel/server.crt,use=own} 9.0",
                             "qel_certificate_expiry_days{file=/etc/qel/root.crt,use=root} 1000.0"}) {
        EXPECT_THAT("\n" + read, HasSubstr(std::string("\n") + line + "\n"));
    }
}

TEST(StatusMetrics, LabelsMayHoldAnyCharacter)
{
    tool::StatusReport report = fakeReport();
    report.certificates.front().file = "a\"b\\c\nd";
    const std::string metrics = metricsOf(report);
    EXPECT_THAT(metrics, HasSubstr(R"(qel_certificate_expiry_days{use="own",file="a\"b\\c\nd"} 9)"));
    const std::string read = parsed(metrics);
    if (read.empty()) GTEST_SKIP() << "there is no python3-prometheus-client";
    EXPECT_THAT(read, HasSubstr("qel_certificate_expiry_days{file=a\"b\\c\nd,use=own} 9.0\n"));
}

TEST(StatusMetrics, EachNameHasItsHelpAndItsTypeOnce)
{
    std::istringstream lines(metricsOf(fakeReport()));
    std::set<std::string> types;
    std::string last;
    for (std::string line; std::getline(lines, line);) {
        if (line.rfind("# TYPE ", 0) == 0) {
            EXPECT_TRUE(types.insert(line).second) << line;
            const std::string name = line.substr(7, line.find(' ', 7) - 7);
            EXPECT_EQ(last.rfind("# HELP " + name + " ", 0), 0U) << line;
        }
        last = line;
    }
    EXPECT_GT(types.size(), 30U);
}

} // namespace

} // namespace qel::test
