#include "proxy/FaultRule.hpp"
#include "proxy/FrameNames.hpp"
#include "tools/proxy/FlowKit.hpp"

#include <fstream>
#include <gmock/gmock.h>
#include <sstream>
#include <stdexcept>

namespace qel::test {

namespace {

using ::testing::AllOf;
using ::testing::Contains;
using ::testing::Eq;
using ::testing::HasSubstr;
using ::testing::SizeIs;
using ::testing::ThrowsMessage;
using tool::Fault;
using tool::FaultRule;
using tool::FrameMatch;
using tool::FrameView;
using Value = QelMessageClassification::Value;

FaultRule rule(const std::string& text) { return tool::parseFaultRule({text, "--fault"}); }

std::string refusal(const std::string& text)
{
    try {
        static_cast<void>(rule(text));
    } catch (const std::invalid_argument& error) {
        return error.what();
    }
    return "accepted";
}

TEST(FaultRule, ReadsWhatItSelects)
{
    const FaultRule all = rule("drop");
    EXPECT_FALSE(all.match.way);
    EXPECT_FALSE(all.match.needsFrame());
    const FaultRule some =
        rule("to-console connection=2 frame=3..7 every=2 kind=response op=GetQelTod drop p=0.25 times=4");
    EXPECT_EQ(some.match.way, tool::Way::ToConsole);
    EXPECT_TRUE(some.match.matchesFlow(tool::Way::ToConsole, 2));
    EXPECT_FALSE(some.match.matchesFlow(tool::Way::ToConsole, 3));
    EXPECT_FALSE(some.match.matchesFlow(tool::Way::ToServer, 2));
    EXPECT_EQ(some.match.function, 0x6003);
    EXPECT_EQ(some.match.operation, 0x0107);
    EXPECT_EQ(some.match.kind, Value::Response);
    EXPECT_EQ(some.probability, 0.25);
    EXPECT_EQ(some.times, 4U);
    const std::string frame = frameOf(1, "", 0x6003, 0x0107, 0x40);
    const auto matches = [&](std::uint64_t number) {
        return some.match.matchesFrame(FrameView(frame.data(), frame.size()), number);
    };
    EXPECT_FALSE(matches(2));
    EXPECT_TRUE(matches(3));
    EXPECT_FALSE(matches(4));
    EXPECT_TRUE(matches(5));
    EXPECT_TRUE(matches(7));
    EXPECT_FALSE(matches(9));
}

TEST(FaultRule, EveryConditionMustHold)
{
    const struct {
        const char* match;
        bool holds;
    } rows[] = {
        {"function=0x6003 drop", true},
        {"function=QelInterfaceCmp drop", true},
        {"function=QelMessageFunctionQelInterfaceCmp drop", true},
        {"function=qelinterfacecmp drop", true},
        {"function=VirtualSerial drop", false},
        {"op=0x0107 drop", true},
        {"op=263 drop", true},
        {"operation=QelMessageOpGetQelTod drop", true},
        {"op=OpenKrogSession drop", false},
        {"kind=request drop", true},
        {"kind=notice drop", false},
        {"frame=..5 drop", true},
        {"frame=6.. drop", false},
        {"op=GetQelTod kind=response drop", false},
    };
    const std::string frame = frameOf(1);
    for (const auto& row : rows) {
        SCOPED_TRACE(row.match);
        EXPECT_EQ(rule(row.match).match.matchesFrame(FrameView(frame.data(), frame.size()), 5), row.holds);
    }
}

TEST(FaultRule, AnOperationOfTwoFunctionsIsMeantInItsOwn)
{
    // 0x0001 is the request for TLS, and two operations of the hypervisor.
    const FaultRule upgrade = rule("op=UpgradeConnection drop");
    EXPECT_EQ(upgrade.match.function, 0x6001);
    EXPECT_FALSE(rule("op=1 drop").match.function);
}

TEST(FaultRule, ReadsTheDetailsOfEachFault)
{
    using std::chrono::milliseconds;
    const FaultRule delay = rule("delay=10-50ms");
    EXPECT_EQ(delay.fault, Fault::Delay);
    EXPECT_EQ(delay.shortest, milliseconds(10));
    EXPECT_EQ(delay.longest, milliseconds(50));
    EXPECT_EQ(rule("delay=1.5s").shortest, milliseconds(1500));
    EXPECT_EQ(rule("delay=500us").longest, std::chrono::microseconds(500));
    EXPECT_EQ(rule("delay=500us-2ms").longest, milliseconds(2));
    EXPECT_THAT(rule("split=3,9").cuts, ::testing::ElementsAre(3, 9));
    EXPECT_TRUE(rule("split=each-byte").cuts.empty());
    EXPECT_EQ(rule("join=4").count, 4U);
    EXPECT_EQ(rule("join=4").within, milliseconds(100));
    EXPECT_EQ(rule("reorder within=2s").within, milliseconds(2000));
    EXPECT_EQ(rule("duplicate").count, 1U);
    EXPECT_EQ(rule("cut after frames=3").afterFrames, 3U);
    EXPECT_EQ(rule("reset after bytes=3").afterBytes, 3U);
    EXPECT_EQ(rule("stop-reading for=2s").pause, milliseconds(2000));
    EXPECT_EQ(rule("rate=64k").bytesPerSecond, 64000U);
    EXPECT_EQ(rule("rate=2M").bytesPerSecond, 2000000U);
    EXPECT_EQ(rule("rate=500").bytesPerSecond, 500U);
    EXPECT_EQ(rule("corrupt=mMsgLength value=0xFFFFFFFF").value, 0xFFFFFFFFU);
    EXPECT_EQ(rule("corrupt=mMsgLength").target.width, 4U);
}

TEST(FaultRule, ARefusalNamesThePlaceAndTheNearestWord)
{
    const struct {
        const char* text;
        const char* refusal;
    } rows[] = {
        {"to-server dropp", R"(--fault: unknown word "dropp"; did you mean "drop"? (column 11 of "to-server dropp"))"},
        {"to-sever drop",
         R"(--fault: unknown word "to-sever"; did you mean "to-server"? (column 1 of "to-sever drop"))"},
        {"op=GetQelTdo drop",
         R"(--fault: unknown operation "GetQelTdo"; did you mean "GetQelTod"? (column 1 of "op=GetQelTdo drop"))"},
        {"function=VirtualSeral drop",
         R"(--fault: unknown function "VirtualSeral"; did you mean "VirtualSerial"? (column 1 of "function=VirtualSeral drop"))"},
        {"kind=reply drop",
         R"(--fault: unknown kind "reply": request, response or notice (column 1 of "kind=reply drop"))"},
        {"corrupt=mStaus",
         R"(--fault: corrupt: "mStaus" is neither an offset such as 22 or -1, nor payload+2, nor any, nor a field; did you mean "mStatus"? (column 1 of "corrupt=mStaus"))"},
        {"frame=3",
         R"(--fault: no fault is named in "frame=3": delay, split, join, drop, duplicate, reorder, corrupt, cut, half-close, reset, stop-reading, rate)"},
        {"drop reset",
         R"(--fault: a rule has one fault, and this one has drop: write two rules (column 6 of "drop reset"))"},
        {"cut frames=3",
         R"(--fault: frames= follows "after"; to select frames, write frame= (column 5 of "cut frames=3"))"},
        {"cut after", R"(--fault: after what? Write after frames=3 or after bytes=100 (column 5 of "cut after"))"},
        {"cut after frames=0",
         R"(--fault: frames: "0" is not an integer of at least 1 (column 11 of "cut after frames=0"))"},
        {"drop after frames=3", R"(--fault: drop has no "after" (column 6 of "drop after frames=3"))"},
        {"drop=3", R"(--fault: drop takes no value (column 1 of "drop=3"))"},
        {"drop p=0", R"(--fault: p: "0" is not a probability above 0, 1 at most (column 6 of "drop p=0"))"},
        {"drop p=1.1", R"(--fault: p: "1.1" is not a probability above 0, 1 at most (column 6 of "drop p=1.1"))"},
        {"drop times=0", R"(--fault: times: "0" is not an integer of at least 1 (column 6 of "drop times=0"))"},
        {"frame=0 drop",
         R"(--fault: frame: "0" is none of 3, 3..7, 3.. and ..7, counted from 1 (column 1 of "frame=0 drop"))"},
        {"frame=7..3 drop",
         R"(--fault: frame: "7..3" is none of 3, 3..7, 3.. and ..7, counted from 1 (column 1 of "frame=7..3 drop"))"},
        {"frame= drop", R"(--fault: frame needs a value (column 1 of "frame= drop"))"},
        {"delay", R"(--fault: delay needs a value (column 1 of "delay"))"},
        {"delay=5",
         R"(--fault: delay: "5" is not a time such as 10ms, 2s or 500us, a day at most (column 1 of "delay=5"))"},
        {"delay=50-10ms", R"(--fault: delay: the longest time is the second one (column 1 of "delay=50-10ms"))"},
        {"delay=2d",
         R"(--fault: delay: "2d" is not a time such as 10ms, 2s or 500us, a day at most (column 1 of "delay=2d"))"},
        {"split=9,3",
         R"(--fault: split: "9,3" is neither each-byte nor a rising list such as 3,9 (column 1 of "split=9,3"))"},
        {"split=each-bite",
         R"(--fault: split: "each-bite" is neither each-byte nor a rising list such as 3,9; did you mean "each-byte"? (column 1 of "split=each-bite"))"},
        {"join=1", R"(--fault: join: "1" is not an integer in [2, 64] (column 1 of "join=1"))"},
        {"join=65", R"(--fault: join: "65" is not an integer in [2, 64] (column 1 of "join=65"))"},
        {"rate=64K",
         R"(--fault: rate: "64K" is not a number of bytes a second such as 500, 64k or 2M, 1000M at most (column 1 of "rate=64K"))"},
        {"rate=0",
         R"(--fault: rate: "0" is not a number of bytes a second such as 500, 64k or 2M, 1000M at most (column 1 of "rate=0"))"},
        {"frame=3 rate=1k",
         R"(--fault: "frame=3 rate=1k" counts bytes, so only a direction and a connection can select)"},
        {"rate=1k p=0.5", "--fault: rate has neither p= nor times="},
        {"corrupt=3 value=256",
         R"(--fault: value: "256" is not an integer in [0, 255] (column 11 of "corrupt=3 value=256"))"},
        {"corrupt=-0", R"(--fault: corrupt: the last byte is -1 (column 1 of "corrupt=-0"))"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_EQ(refusal(row.text), row.refusal);
    }
}

TEST(FaultRule, ReadsAFileLineByLine)
{
    std::istringstream text("# the lossy line\n\n  drop p=0.1   # now and then\nto-server delay=5ms\r\n");
    const std::vector<FaultRule> rules = tool::readFaultRules(text, "lossy.txt");
    ASSERT_THAT(rules, SizeIs(2));
    EXPECT_EQ(rules[0].fault, Fault::Drop);
    EXPECT_EQ(rules[1].text, "to-server delay=5ms");
}

TEST(FaultRule, AFileIsRefusedWithTheNumberOfTheLine)
{
    std::istringstream text("drop\n\nto-server delai=5ms\n");
    EXPECT_THAT(
        [&] { tool::readFaultRules(text, "lossy.txt"); },
        ThrowsMessage<std::invalid_argument>(
            Eq(R"(lossy.txt:3: unknown word "delai"; did you mean "delay"? (column 11 of "to-server delai=5ms"))")));
}

TEST(FaultRule, TheDiceAreTheSameOnEveryMachine)
{
    tool::FaultDice dice(1, 1, tool::Way::ToServer);
    const std::uint64_t first = dice.next();
    const std::uint64_t second = dice.next();
    tool::FaultDice again(1, 1, tool::Way::ToServer);
    EXPECT_EQ(again.next(), first);
    EXPECT_EQ(again.next(), second);
    EXPECT_EQ(first, 17726990778372864297U);
    EXPECT_EQ(second, 15287607234741920061U);
    EXPECT_NE(first, tool::FaultDice(1, 1, tool::Way::ToConsole).next());
    EXPECT_NE(first, tool::FaultDice(1, 2, tool::Way::ToServer).next());
}

TEST(FrameNames, AreThoseOfTheWireFormat)
{
    std::ifstream document(std::string(QEL_SOURCE_DIR) + "/docs/wire-format.md");
    std::string line;
    std::size_t operations = 0;
    while (std::getline(document, line)) {
        std::istringstream cells(line);
        std::string bar;
        std::string function;
        std::string operation;
        std::string name;
        if (!(cells >> bar >> function >> bar >> operation >> bar >> name)) continue;
        if (function.compare(0, 2, "0x") != 0 || name.compare(0, 13, "`QelMessageOp") != 0) continue;
        ++operations;
        EXPECT_EQ(tool::operationName(static_cast<std::uint16_t>(std::stoul(function, nullptr, 16)),
                                      static_cast<std::uint16_t>(std::stoul(operation, nullptr, 16))),
                  name.substr(13, name.size() - 14));
    }
    EXPECT_EQ(operations, tool::namedOperations().size());
    EXPECT_EQ(operations, 42U);
    EXPECT_EQ(tool::shortStatusName(37), "DaxAlreadyConnected");
    EXPECT_EQ(tool::shortStatusName(0x8006), "HypervisorGenericError");
    EXPECT_EQ(tool::shortStatusName(5), "");
    EXPECT_EQ(tool::operationName(0x6003, 1), "");
}

TEST(FrameFilter, ShowsWhatOneOfItsTextsDescribes)
{
    tool::FrameFilter filter;
    const std::string time = frameOf(1);
    const std::string open = frameOf(1, "", 0x6003, 0x0102);
    const auto shows = [&](const std::string& frame, tool::Way way) {
        return filter.shows(FrameView(frame.data(), frame.size()), way, 1, 1);
    };
    EXPECT_TRUE(shows(open, tool::Way::ToServer));
    filter.add("to-server op=GetQelTod");
    filter.add("to-console function=0x6003");
    EXPECT_TRUE(shows(time, tool::Way::ToServer));
    EXPECT_FALSE(shows(open, tool::Way::ToServer));
    EXPECT_TRUE(shows(open, tool::Way::ToConsole));
    EXPECT_THAT([&] { filter.add("to-servr"); },
                ThrowsMessage<std::invalid_argument>(
                    Eq(R"(--filter: unknown word "to-servr"; did you mean "to-server"? (column 1 of "to-servr"))")));
    EXPECT_THAT([&] { filter.add("  "); }, ThrowsMessage<std::invalid_argument>(Eq("--filter: it says nothing")));
}

} // namespace

} // namespace qel::test
