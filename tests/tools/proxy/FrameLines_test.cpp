#include "proxy/FrameLines.hpp"
#include "support/SettableClock.hpp"
#include "tools/proxy/FlowKit.hpp"

#include <gmock/gmock.h>
#include <nlohmann/json.hpp>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;
using tool::FrameLines;
using tool::FrameLinesOptions;
using tool::FrameView;
using tool::Way;
using Json = nlohmann::ordered_json;

class FrameLinesTest : public ::testing::Test {
protected:
    void frame(FrameLines& lines, const std::string& bytes, Way way = Way::ToServer, std::uint64_t number = 1) const
    {
        lines.onFrame({1, way}, number, FrameView(bytes.data(), bytes.size()));
        lines.onIdle();
    }
    FrameLines make(FrameLinesOptions options)
    {
        return FrameLines(std::move(options), [this](const std::string& lines) { output += lines; });
    }
    Json lastJson() const { return Json::parse(output.substr(output.rfind('\n', output.size() - 2) + 1)); }

    SettableClock clock;
    std::string output;
};

TEST_F(FrameLinesTest, ALineForEachKindOfFrame)
{
    FrameLines lines = make({});
    const std::string time = "[2024-01-02T03:04:05.000Z] ";
    frame(lines, frameOf(7));
    EXPECT_EQ(output, time + "1 to-server  frame 1 request  op=GetQelTod id=7 length=32\n");
    output.clear();
    std::string refused = frameOf(7, "", 0x6003, 0x0107, 0x40);
    refused[23] = 4;
    frame(lines, refused, Way::ToConsole, 2);
    EXPECT_EQ(output, time + "1 to-console frame 2 response op=GetQelTod id=7 status=4 InvalidCmdSequence length=32\n");
    output.clear();
    frame(lines, frameOf(9, "x", 0x8001, 0x0B0C, 0));
    EXPECT_EQ(output, time + "1 to-server  frame 1 notice   function=0x8001 op=0x0B0C id=9 length=33\n");
    output.clear();
    frame(lines, frameOf(9, "x", 0x6003, 0x0107, 0xC0));
    EXPECT_THAT(output, StartsWith(time + "1 to-server  frame 1 unknown  op=GetQelTod id=9 length=33"));
}

TEST_F(FrameLinesTest, SaysWhatIsMalformed)
{
    FrameLines lines = make({});
    std::string wrong = frameOf(7, "", 0x6002, 0x0402);
    frame(lines, wrong);
    EXPECT_THAT(output, HasSubstr("op=OpenVirtualSerialSession id=7 length=32 malformed: "));
    output.clear();
    wrong[3] = 1;
    frame(lines, wrong);
    EXPECT_THAT(output, HasSubstr(" malformed: i_buffer bad header version\n"));
    output.clear();
    frame(lines, wrong.substr(0, 9));
    EXPECT_THAT(output, HasSubstr(" function=0x0000 op=0x0000 id=0 length=9 malformed: length\n"));
}

TEST_F(FrameLinesTest, DumpsAreEscaped)
{
    FrameLinesOptions options;
    options.dump = true;
    options.stamps = tool::TimeStamps::Style::Off;
    FrameLines lines = make(options);
    frame(lines, frameOf(7, "\x1B[31m", 0x8001));
    EXPECT_THAT(output, StartsWith("1 to-server  frame 1 request  function=0x8001 op=0x0107 id=7 length=37\n"));
    EXPECT_THAT(output, HasSubstr("DECA FF20"));
    EXPECT_EQ(output.find('\x1B'), std::string::npos);
}

TEST_F(FrameLinesTest, JsonIsOneObjectALine)
{
    FrameLinesOptions options;
    options.json = true;
    FrameLines lines = make(options);
    lines.listening({IPEndpoint("127.0.0.1:9")}, "server:1", 5);
    EXPECT_EQ(
        output,
        R"({"time":"2024-01-02T03:04:05.000Z","event":"listening","address":"127.0.0.1:9","server":"server:1","seed":5})"
        "\n");
    frame(lines, frameOf(7));
    const Json event = lastJson();
    EXPECT_EQ(event["event"], "frame");
    EXPECT_EQ(event["connection"], 1);
    EXPECT_EQ(event["direction"], "to-server");
    EXPECT_EQ(event["number"], 1);
    EXPECT_EQ(event["operation"], 0x0107);
    EXPECT_EQ(event["callerId"], 7);
    EXPECT_EQ(event["classification"], "Request");
    EXPECT_FALSE(event.contains("dump"));
    lines.onFault({1, Way::ToConsole}, 3, rulesOf({"drop"}).front(), "dropped");
    lines.onIdle();
    EXPECT_EQ(
        lastJson().dump(),
        R"({"time":"2024-01-02T03:04:05.000Z","event":"fault","connection":1,"direction":"to-console","number":3,"what":"dropped","rule":"drop"})");
    lines.summary(2);
    EXPECT_EQ(lastJson()["faults"], 1);
    EXPECT_EQ(lastJson()["connections"], 2);
}

TEST_F(FrameLinesTest, QuietAndFilterLeaveFaultsAndConnections)
{
    FrameLinesOptions options;
    options.quiet = true;
    options.stamps = tool::TimeStamps::Style::Off;
    FrameLines quiet = make(options);
    frame(quiet, frameOf(7));
    EXPECT_EQ(output, "");
    quiet.onFault({1, Way::ToServer}, 0, rulesOf({"rate=1k"}).front(), "limited");
    quiet.onRefused(3, "cannot\nconnect");
    quiet.onIdle();
    EXPECT_EQ(output, "1 to-server  fault: limited (\"rate=1k\")\n3 refused: cannot\\x0aconnect\n");
    output.clear();
    options.quiet = false;
    options.filter.add("op=OpenKrogSession");
    FrameLines filtered = make(options);
    frame(filtered, frameOf(7));
    frame(filtered, frameOf(8, "", 0x6003, 0x0102));
    EXPECT_EQ(output, "1 to-server  frame 1 request  op=OpenKrogSession id=8 length=32\n");
}

TEST_F(FrameLinesTest, TheSummaryCountsWhatHasPassed)
{
    FrameLines lines = make({});
    TestFlow up({});
    up.arrive(frameOf(1));
    EXPECT_EQ(up.bytes().size(), 32U);
    TestFlow down({}, Way::ToConsole);
    lines.onClosed(1, "both sides have ended it", up.flow, down.flow);
    lines.onIdle();
    EXPECT_EQ(output, "[2024-01-02T03:04:05.000Z] 1 closed: both sides have ended it; to-server 1 frame, 32 bytes; "
                      "to-console 0 frames, 0 bytes\n");
    output.clear();
    lines.summary(1);
    EXPECT_EQ(output, "1 connection; to-server 1 frame, 32 bytes; to-console 0 frames, 0 bytes; 0 faults\n");
}

} // namespace

} // namespace qel::test
