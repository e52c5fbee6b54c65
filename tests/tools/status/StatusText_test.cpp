#include "status/StatusText.hpp"
#include "tools/status/FakeReport.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <string>

namespace qel::test {

namespace {

using testing::HasSubstr;

std::string textOf(const tool::StatusReport& report)
{
    std::ostringstream os;
    tool::printStatus(os, report);
    return os.str();
}

TEST(StatusText, ShowsEverythingInTables)
{
    EXPECT_EQ(textOf(fakeReport()), R"(qel serve 1.2.3, process 4711, up 3h 25m, on 127.0.0.1:4717 and [::1]:4717
WARNING: own certificate /etc/qel/server.crt expires at 2026-10-24T01:11:47Z, in 9 days: replace it
root certificate /etc/qel/root.crt expires at 2029-07-10T21:11:47Z, in 1000 days

Consoles: 2 of at most 16
  ID  NAME         ADDRESS          SINCE   TLS  RECEIVED      SENT           QUEUE  FINGERPRINT
  #7  alice        192.0.2.7:40312  25m 7s  1.3  11 (1.1 KiB)  13 (12.7 KiB)  2 KiB  0C:7B
  #9  evil\x1b[2J  127.0.0.1:5      7s      -    11 (1.1 KiB)  13 (12.7 KiB)  2 KiB  -
  -   (handshake)  192.0.2.9:1      2s      -    0 (0 B)       0 (0 B)        0 B    -

Partitions: 2
  ID   NAME  LINE       TYPES     WATCH                 OUTPUT        INPUT      REPLAY          STARTS  DESCRIPTION
  1    web1  up         alice #7  evil\x1b[2J #9, ? #8  31 (1.5 MiB)  32 (33 B)  36 B of 64 KiB  2       rack 4
  300  -     coming up  -         -                     0 (0 B)       0 (0 B)    0 B of 0 B      0
  partition 1: 37 B of input wait for its line
  partition 1: 34 B of output did not reach consoles that were too slow
  partition 1: 35 B of input dropped, of watchers or while its line was down

Since the start
  Connections:  21 accepted, 10 refused (address 1, deadline 2, certificate 3, other 4)
  Received:     22 messages (2.1 KiB)
  Sent:         13 messages (12.7 KiB), dropped 3 messages (300 B)
  Queued:       2 messages (2 KiB) now, at most 4 KiB for one console
  In queues:    to 1 ms: 12, to 10 ms: 0, to 100 ms: 0, to 1 s: 0, to 10 s: 1, longer: 0
)");
}

TEST(StatusText, AServerWithoutAnythingHasNoTables)
{
    tool::StatusReport report;
    report.version = "1.2.3";
    report.listen = {"127.0.0.1:1"};
    EXPECT_EQ(textOf(report), R"(qel serve 1.2.3, process 0, up 0s, on 127.0.0.1:1

Consoles: 0 of at most 0

Partitions: 0

Since the start
  Connections:  0 accepted, 0 refused
  Received:     0 messages (0 B)
  Sent:         0 messages (0 B), dropped 0 messages (0 B)
  Queued:       0 messages (0 B) now, at most 0 B for one console
  In queues:    to 1 ms: 0, to 10 ms: 0, to 100 ms: 0, to 1 s: 0, to 10 s: 0, longer: 0
)");
}

TEST(StatusText, WarnsOfACertificateThatHasExpired)
{
    tool::StatusReport report = fakeReport();
    report.certificates.front().state = protocol::CertificateState::Expired;
    EXPECT_THAT(textOf(report), HasSubstr("\nWARNING: own certificate /etc/qel/server.crt has expired at "
                                          "2026-10-24T01:11:47Z: replace it\n"));
}

TEST(StatusText, SaysWhoIsOnAPartition)
{
    tool::StatusReport report = fakeReport();
    protocol::PartitionState& web = report.partitions.front();
    EXPECT_EQ(sessionsText(report, web), "alice #7 types, evil\\x1b[2J #9, ? #8 watch");
    web.sessions.pop_back();
    EXPECT_EQ(sessionsText(report, web), "alice #7 types, evil\\x1b[2J #9 watches");
    web.sessions.pop_back();
    EXPECT_EQ(sessionsText(report, web), "alice #7 types");
    web.sessions.clear();
    EXPECT_EQ(sessionsText(report, web), "nobody");
}

TEST(StatusText, BytesHaveTheUnitThatSuitsThem)
{
    EXPECT_EQ(tool::bytesText(0), "0 B");
    EXPECT_EQ(tool::bytesText(1023), "1023 B");
    EXPECT_EQ(tool::bytesText(1024), "1 KiB");
    EXPECT_EQ(tool::bytesText(1536), "1.5 KiB");
    EXPECT_EQ(tool::bytesText(1024 * 1024 - 1), "1 MiB");
    EXPECT_EQ(tool::bytesText(std::uint64_t{3} << 30), "3 GiB");
    EXPECT_EQ(tool::bytesText(std::uint64_t{1} << 60), "1048576 TiB");
}

TEST(StatusText, DurationsHaveTheirTwoLargestUnits)
{
    using std::chrono::seconds;
    EXPECT_EQ(tool::durationText(seconds(-1)), "0s"); // the clock has been set
    EXPECT_EQ(tool::durationText(seconds(59)), "59s");
    EXPECT_EQ(tool::durationText(seconds(60)), "1m 0s");
    EXPECT_EQ(tool::durationText(seconds(3599)), "59m 59s");
    EXPECT_EQ(tool::durationText(seconds(3600)), "1h 0m");
    EXPECT_EQ(tool::durationText(seconds(86399)), "23h 59m");
    EXPECT_EQ(tool::durationText(seconds(86400)), "1d 0h");
    EXPECT_EQ(tool::durationText(seconds(100L * 86400)), "100d 0h");
}

} // namespace

} // namespace qel::test
