#include "bench/BenchReport.hpp"

#include <gtest/gtest.h>
#include <sstream>

namespace qel::test {

namespace {

using nlohmann::json;
using std::chrono::microseconds;
using std::chrono::milliseconds;
using std::chrono::seconds;
using tool::BenchFigures;
using tool::BenchLoad;

/// 1000 messages in two seconds: 900 of 40 us, 99 of 300 us, one of 12.3456 ms.
BenchFigures someFigures()
{
    BenchFigures figures;
    for (int i = 0; i < 900; ++i)
        figures.latency.record(microseconds(40));
    for (int i = 0; i < 99; ++i)
        figures.latency.record(microseconds(300));
    figures.latency.record(std::chrono::nanoseconds(12345600));
    figures.elapsed = seconds(2);
    return figures;
}

BenchLoad someLoad()
{
    BenchLoad load;
    load.pairs = 4;
    load.bytes = 100;
    return load;
}

std::string textOf(const BenchLoad& load, const BenchFigures& figures)
{
    std::ostringstream text;
    tool::printReport(text, "127.0.0.1:4711", load, figures);
    return text.str();
}

TEST(BenchReport, TextForPeople)
{
    EXPECT_EQ(textOf(someLoad(), someFigures()),
              "Broadcasts of 100 bytes between 4 pairs of consoles of 127.0.0.1:4711, flat out\n"
              "Messages:    1000\n"
              "Elapsed:     2.000 s\n"
              "Throughput:  500 m/s (50000 B/s)\n"
              "Latency:\n"
              "  p50:               40.4 us\n"
              "  p90:               40.4 us\n"
              "  p99:              303.1 us\n"
              "  p99.9:            303.1 us\n"
              "  max:            12345.6 us\n"
              "Histogram:\n"
              "  to 50 us            900  ##################################################\n"
              "  to 100 us             0\n"
              "  to 200 us             0\n"
              "  to 500 us            99  #####\n"
              "  to 1 ms               0\n"
              "  to 2 ms               0\n"
              "  to 5 ms               0\n"
              "  to 10 ms              0\n"
              "  to 20 ms              1\n");
}

TEST(BenchReport, WithARateTheTextCountsUnsentMessages)
{
    BenchLoad load = someLoad();
    load.pairs = 1;
    load.rate = 2.5;
    BenchFigures figures;
    figures.unsent = 7;
    figures.interrupted = true;
    EXPECT_EQ(
        textOf(load, figures),
        "Broadcasts of 100 bytes between 1 pair of consoles of 127.0.0.1:4711, 2.5 messages a second; interrupted\n"
        "Messages:    0\n"
        "Unsent:      7\n"
        "Elapsed:     0.000 s\n"
        "Throughput:  0 m/s (0 B/s)\n"
        "Latency:\n"
        "  p50:                0.0 us\n"
        "  p90:                0.0 us\n"
        "  p99:                0.0 us\n"
        "  p99.9:              0.0 us\n"
        "  max:                0.0 us\n");
}

TEST(BenchReport, RowsOfSecondsAndTheOneWithoutEnd)
{
    BenchFigures figures;
    figures.latency.record(seconds(10));
    figures.latency.record(seconds(11));
    const std::string text = textOf(someLoad(), figures);
    EXPECT_NE(text.find("\n  to 10 s               1  ##################################################\n"
                        "  more                  1  ##################################################\n"),
              std::string::npos)
        << text;
}

TEST(BenchReport, JsonForPrograms)
{
    BenchLoad load = someLoad();
    load.rate = 500;
    BenchFigures figures;
    figures.latency.record(microseconds(100));
    figures.latency.record(seconds(20));
    figures.elapsed = milliseconds(2500);
    figures.unsent = 1248;
    figures.interrupted = true;
    json document = json::parse(tool::reportJson("127.0.0.1:4711", load, figures).dump());
    EXPECT_EQ(document["histogram"].size(), 17U);
    EXPECT_EQ(document["histogram"].front(), json::parse(R"({"upToNanoseconds": 100000, "messages": 1})"));
    EXPECT_EQ(document["histogram"].back(), json::parse(R"({"upToNanoseconds": null, "messages": 1})"));
    document.erase("histogram");
    EXPECT_EQ(document, json::parse(R"({
        "endpoint": "127.0.0.1:4711", "connections": 8, "messageBytes": 100, "rate": 500.0, "interrupted": true,
        "messages": 2, "unsent": 1248, "seconds": 2.5, "messagesPerSecond": 1, "bytesPerSecond": 80,
        "latencyNanoseconds": {"p50": 100351, "p90": 20000000000, "p99": 20000000000, "p99.9": 20000000000,
                               "max": 20000000000}})"));
}

TEST(BenchReport, WithoutARateTheRateIsNull)
{
    EXPECT_TRUE(tool::reportJson("x", someLoad(), BenchFigures())["rate"].is_null());
}

} // namespace

} // namespace qel::test
