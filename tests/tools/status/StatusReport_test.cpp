#include "status/StatusReport.hpp"
#include "tools/status/FakeReport.hpp"

#include <functional>
#include <gtest/gtest.h>
#include <stdexcept>
#include <string>
#include <utility>

namespace qel::test {

namespace {

using Json = nlohmann::ordered_json;

TEST(StatusReport, HasADocumentedFormAsJson)
{
    const Json json = tool::toJson(fakeReport());
    EXPECT_EQ(json.at("partitions").at(0).dump(),
              R"({"id":1,"name":"web1","description":"rack 4","line":"up","starts":2,"sessions":[)"
              R"({"connection":0,"console":7,"setUp":true},{"connection":3,"console":9,"setUp":true},)"
              R"({"connection":15,"console":8,"setUp":false}],"output":{"messages":31,"bytes":1572864},)"
              R"("input":{"messages":32,"bytes":33},"skippedBytes":34,"droppedBytes":35,"keptBytes":36,)"
              R"("replayBytes":65536,"waitingBytes":37})");
    EXPECT_EQ(
        json.at("consoles").at(0).dump(),
        R"({"id":7,"connected":true,"name":"alice","fingerprint":"0C:7B","address":"192.0.2.7:40312","tls":"1.3",)"
        R"("toolType":1,"toolId":"ops-1","since":"2026-10-14T20:46:40Z","received":{"messages":11,"bytes":1100},)"
        R"("sent":{"messages":13,"bytes":13000},"queued":{"messages":2,"bytes":2048},"mostQueuedBytes":4096,)"
        R"("dropped":{"messages":3,"bytes":300},"latency":[12,0,0,0,1,0]})");
    EXPECT_EQ(json.at("connections").at("refused").dump(),
              R"({"handshakes":0,"address":1,"consoles":0,"deadline":2,"malformed":0,"certificate":3,"pin":0,)"
              R"("request":0,"left":0,"other":4})");
    EXPECT_EQ(json.at("certificates").at(0).dump(),
              R"({"use":"own","file":"/etc/qel/server.crt","notAfter":"2026-10-24T01:11:47Z","daysLeft":9,)"
              R"("state":"due"})");
    EXPECT_EQ(json.at("since"), "2026-10-14T17:46:40Z");
    EXPECT_EQ(json.at("time"), "2026-10-14T21:11:47Z");
    EXPECT_TRUE(json.at("consoles").at(1).at("tls").is_null());
}

TEST(StatusReport, SurvivesTheWayThroughJson)
{
    const Json json = tool::toJson(fakeReport());
    EXPECT_EQ(tool::toJson(tool::statusReportOf(json)), json);
    Json newer = json;
    newer["later"] = "something new";
    EXPECT_EQ(tool::toJson(tool::statusReportOf(newer)), json);
}

TEST(StatusReport, RefusesWhatIsNoReport)
{
    const std::pair<const char*, std::function<void(Json&)>> cases[] = {
        {"no version", [](Json& json) { json.erase("version"); }},
        {"a text for a number", [](Json& json) { json["pid"] = "x"; }},
        {"no time", [](Json& json) { json["time"] = "yesterday"; }},
        {"rubbish after a time", [](Json& json) { json["time"] = "2026-10-14T21:11:47Z!"; }},
        {"a state that does not exist", [](Json& json) { json["partitions"][0]["line"] = "sideways"; }},
        {"too few classes",
         [](Json& json) {
             json["connections"]["latency"] = {1, 2};
         }},
        {"a list for an object", [](Json& json) { json["connections"] = Json::array(); }},
        {"an object for a list",
         [](Json& json) {
             json["consoles"] = {{"a", 1}};
         }},
        {"nothing", [](Json& json) { json = Json(); }},
    };
    for (const auto& row : cases) {
        SCOPED_TRACE(row.first);
        Json json = tool::toJson(fakeReport());
        row.second(json);
        EXPECT_THROW(tool::statusReportOf(json), std::exception);
    }
}

TEST(CertificateReport, CountsFullDays)
{
    using std::chrono::seconds;
    const tool::CalendarTime now(seconds(1792000000));
    const auto daysLeft = [&](seconds left) {
        return tool::CertificateReport{"own", "f", now + left, protocol::CertificateState::Fine}.daysLeft(now);
    };
    EXPECT_EQ(daysLeft(seconds(0)), 0);
    EXPECT_EQ(daysLeft(seconds(86399)), 0);
    EXPECT_EQ(daysLeft(seconds(86400)), 1);
    EXPECT_EQ(daysLeft(seconds(-1)), -1);
    EXPECT_EQ(daysLeft(seconds(-86400)), -1);
    EXPECT_EQ(daysLeft(seconds(-86401)), -2);
}

} // namespace

} // namespace qel::test
