#include "proxy/FrameFlow.hpp"
#include "tools/proxy/FlowKit.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using Ending = tool::FrameFlow::Ending;

const std::string kOne = frameOf(1, "one");
const std::string kTwo = frameOf(2, "two, longer");
const std::string kThree = frameOf(3);

std::string hexOf(const std::string& bytes, std::size_t at, std::size_t length)
{
    std::string text;
    for (const char c : bytes.substr(at, length)) {
        const char* const digits = "0123456789abcdef";
        text += digits[static_cast<unsigned char>(c) >> 4];
        text += digits[static_cast<unsigned char>(c) & 0xF];
    }
    return text;
}

TEST(FrameFlow, PassesBytesOnAsTheyArriveWithoutARule)
{
    TestFlow flow({});
    flow.arrive(kOne.substr(0, 5));
    EXPECT_EQ(flow.bytes(), kOne.substr(0, 5));
    EXPECT_THAT(flow.notes.frames, IsEmpty());
    flow.arrive(kOne.substr(5) + kTwo.substr(0, 1));
    EXPECT_EQ(flow.bytes(), kOne.substr(5) + kTwo.substr(0, 1));
    flow.arrive(kTwo.substr(1));
    EXPECT_EQ(flow.bytes(), kTwo.substr(1));
    EXPECT_THAT(flow.notes.frames, ElementsAre("1:1", "2:2"));
    EXPECT_EQ(flow.flow.ending(), Ending::None);
}

TEST(FrameFlow, SendsAWholeFrameWhenARuleMayActOnIt)
{
    TestFlow flow({"frame=9 drop"});
    flow.arrive(kOne.substr(0, 34));
    EXPECT_EQ(flow.bytes(), "");
    flow.arrive(kOne.substr(34) + kTwo);
    EXPECT_EQ(flow.bytes(), kOne + kTwo);
}

TEST(FrameFlow, EveryDivisionOfTheInputGivesTheSameOutput)
{
    const std::string all = kOne + kTwo + kThree;
    for (const char* rule : {"frame=2 drop", "frame=9 drop", "frame=1 rate=1M"}) {
        if (std::string(rule).find("rate") != std::string::npos) continue;
        for (std::size_t first = 1; first < all.size(); ++first) {
            SCOPED_TRACE(std::string(rule) + " " + std::to_string(first));
            TestFlow flow({rule});
            flow.arrive(all.substr(0, first));
            std::string out = flow.bytes();
            flow.arrive(all.substr(first));
            out += flow.bytes();
            EXPECT_EQ(out, std::string(rule) == "frame=2 drop" ? kOne + kThree : all);
        }
    }
}

TEST(FrameFlow, BytesThatAreNoFramesPassAndAreNamedOnce)
{
    const std::string tls("\x16\x03\x01\x02\x00 handshake", 15);
    for (const char* rule : {"", "op=0x0001 drop"}) {
        SCOPED_TRACE(rule);
        TestFlow flow(*rule == '\0' ? std::vector<std::string>() : std::vector<std::string>{rule});
        flow.arrive(kOne + tls);
        flow.arrive(tls);
        EXPECT_EQ(flow.bytes(), kOne + tls + tls);
        EXPECT_THAT(flow.notes.notes, ElementsAre("TLS begins: bytes pass unchanged from here on and are not shown"));
        EXPECT_THAT(flow.notes.frames, SizeIs(1));
    }
    TestFlow other({});
    other.arrive("GET / HTTP/1.1\r\n");
    EXPECT_EQ(other.bytes(), "GET / HTTP/1.1\r\n");
    EXPECT_THAT(other.notes.notes,
                ElementsAre("what follows does not begin like a frame: bytes pass unchanged from here on"));
}

TEST(FrameFlow, AnImpossibleLengthEndsTheFramesAndLosesNothing)
{
    for (const unsigned int length : {0U, 8U, 16385U}) {
        SCOPED_TRACE(length);
        TestFlow flow({"frame=7 drop"});
        const std::vector<char> raw = RawFrame::newForm().msgLength(length).bytes();
        const std::string bytes(raw.begin(), raw.end());
        flow.arrive(bytes + kOne);
        EXPECT_EQ(flow.bytes(), bytes + kOne);
        EXPECT_THAT(flow.notes.notes, ElementsAre("a frame gives " + std::to_string(length) +
                                                  " as its length: bytes pass unchanged from here on"));
    }
    TestFlow shortest({});
    const std::vector<char> raw = RawFrame::newForm().msgLength(9).bytes();
    shortest.arrive(std::string(raw.begin(), raw.begin() + 9));
    EXPECT_THAT(shortest.notes.frames, ElementsAre("1:0"));
}

TEST(FrameFlow, AnIncompleteFrameLeavesBeforeTheEnd)
{
    for (const char* rule : {"frame=9 drop", "rate=1M"}) {
        TestFlow flow({rule});
        flow.arrive(kOne + kTwo.substr(0, 20));
        flow.end();
        EXPECT_EQ(flow.bytes(), kOne + kTwo.substr(0, 20));
        EXPECT_EQ(flow.flow.ending(), Ending::HalfClose);
        EXPECT_TRUE(flow.flow.isOver());
        EXPECT_THAT(flow.notes.notes, ElementsAre("ends after 20 bytes of a frame"));
    }
}

TEST(FrameFlow, StopsReadingWhileTheReceiverTakesNothing)
{
    const std::string frame = frameOf(1, std::string(16000, 'x'));
    for (const char* rule : {"", "frame=9999 drop"}) {
        SCOPED_TRACE(rule);
        TestFlow flow(*rule == '\0' ? std::vector<std::string>() : std::vector<std::string>{rule});
        std::size_t frames = 0;
        for (; flow.flow.wantsInput(TestFlow::time(0)) && frames < 1000; ++frames)
            flow.arrive(frame);
        EXPECT_LE(frames * frame.size(), 384U * 1024);
        EXPECT_EQ(flow.bytes().size(), frames * frame.size());
        EXPECT_TRUE(flow.flow.wantsInput(TestFlow::time(0)));
    }
}

TEST(FrameFlow, DelayHoldsAFrameAndThoseAfterItInTheirOrder)
{
    TestFlow flow({"frame=1 delay=20ms"});
    flow.arrive(kOne, 0);
    flow.arrive(kTwo, 5);
    EXPECT_THAT(flow.leave(19), IsEmpty());
    EXPECT_EQ(flow.wakeAt(19), 20);
    EXPECT_EQ(flow.bytes(20), kOne + kTwo);
    flow.arrive(kThree, 21);
    EXPECT_EQ(flow.bytes(21), kThree);
    EXPECT_THAT(flow.notes.faults, ElementsAre("1 delayed by 20.000 ms"));
}

TEST(FrameFlow, DelaysOfSeveralFramesRunSideBySide)
{
    TestFlow flow({"delay=20ms"});
    flow.arrive(kOne, 0);
    flow.arrive(kTwo, 10);
    EXPECT_EQ(flow.bytes(20), kOne);
    EXPECT_EQ(flow.wakeAt(20), 30);
    EXPECT_EQ(flow.bytes(30), kTwo);
}

TEST(FrameFlow, ARangeOfDelaysStaysWithinIt)
{
    TestFlow flow({"delay=10-50ms"});
    for (int i = 0; i < 200; ++i)
        flow.arrive(kThree);
    ASSERT_THAT(flow.notes.faults, SizeIs(200));
    double least = 100;
    double most = 0;
    for (const std::string& fault : flow.notes.faults) {
        const double delay = std::stod(fault.substr(fault.rfind("by ") + 3));
        least = std::min(least, delay);
        most = std::max(most, delay);
    }
    EXPECT_GE(least, 10);
    EXPECT_LE(most, 50);
    EXPECT_GT(most - least, 20); // not always the same
}

TEST(FrameFlow, SplitWritesTheGivenPieces)
{
    TestFlow flow({"frame=1 split=3,9"});
    flow.arrive(kOne + kTwo);
    EXPECT_THAT(flow.leave(), ElementsAre(kOne.substr(0, 3), kOne.substr(3, 6), kOne.substr(9), kTwo));
    EXPECT_THAT(flow.notes.faults, ElementsAre("1 split into 3, 6 and 26 bytes"));
}

TEST(FrameFlow, SplitBeyondTheEndLeavesTheRestWhole)
{
    TestFlow flow({"split=3,35,90"});
    flow.arrive(kOne);
    EXPECT_THAT(flow.leave(), ElementsAre(kOne.substr(0, 3), kOne.substr(3)));
}

TEST(FrameFlow, SplitAtEachByteWritesSingleBytes)
{
    TestFlow flow({"split=each-byte"});
    flow.arrive(kOne);
    const TestFlow::Writes writes = flow.leave();
    ASSERT_THAT(writes, SizeIs(kOne.size()));
    for (std::size_t i = 0; i < kOne.size(); ++i)
        EXPECT_EQ(writes[i], kOne.substr(i, 1));
}

TEST(FrameFlow, SplitPausesBetweenThePieces)
{
    TestFlow flow({"split=3,9 pause=5ms"});
    flow.arrive(kOne, 0);
    EXPECT_EQ(flow.bytes(0), kOne.substr(0, 3));
    EXPECT_THAT(flow.leave(4), IsEmpty());
    EXPECT_EQ(flow.bytes(5), kOne.substr(3, 6));
    EXPECT_EQ(flow.bytes(10), kOne.substr(9));
}

TEST(FrameFlow, JoinWritesSeveralFramesAtOnce)
{
    TestFlow flow({"join=2"});
    flow.arrive(kOne, 0);
    EXPECT_THAT(flow.leave(0), IsEmpty());
    flow.arrive(kTwo + kThree, 1);
    EXPECT_THAT(flow.leave(1), ElementsAre(kOne + kTwo));
    EXPECT_EQ(flow.wakeAt(1), 101);
    EXPECT_THAT(flow.leave(101), ElementsAre(kThree));
    EXPECT_THAT(flow.notes.faults, ElementsAre("1 joined with the 1 that followed into one write of 78 bytes",
                                               "3 not joined: no frame followed in time"));
}

TEST(FrameFlow, AFrameThatIsNotJoinedDoesNotOvertake)
{
    TestFlow flow({"frame=1 join=3"});
    flow.arrive(kOne + kTwo);
    EXPECT_THAT(flow.leave(), ElementsAre(kOne, kTwo));
}

TEST(FrameFlow, DropAndDuplicate)
{
    TestFlow flow({"frame=1 drop", "frame=2 duplicate", "frame=3 duplicate=2"});
    flow.arrive(kOne + kTwo + kThree);
    EXPECT_EQ(flow.bytes(), kTwo + kTwo + kThree + kThree + kThree);
    EXPECT_THAT(flow.notes.faults, ElementsAre("1 dropped", "2 sent 2 times", "3 sent 3 times"));
}

TEST(FrameFlow, ReorderSwapsAFrameWithTheNext)
{
    TestFlow flow({"frame=1 reorder"});
    flow.arrive(kOne);
    EXPECT_THAT(flow.leave(), IsEmpty());
    flow.arrive(kTwo + kThree);
    EXPECT_EQ(flow.bytes(), kTwo + kOne + kThree);
    EXPECT_THAT(flow.notes.faults, ElementsAre("1 sent after frame 2"));
}

TEST(FrameFlow, ReorderGivesUpWhenNoFrameFollows)
{
    TestFlow flow({"frame=1 reorder within=30ms"});
    flow.arrive(kOne, 0);
    EXPECT_EQ(flow.wakeAt(0), 30);
    EXPECT_EQ(flow.bytes(29), "");
    EXPECT_EQ(flow.bytes(30), kOne);
    EXPECT_THAT(flow.notes.faults, ElementsAre("1 not reordered: no frame followed in time"));
}

TEST(FrameFlow, WhatIsHeldLeavesBeforeTheEnd)
{
    for (const char* rule : {"reorder", "join=5"}) {
        SCOPED_TRACE(rule);
        TestFlow flow({rule});
        flow.arrive(kOne);
        EXPECT_EQ(flow.flow.ending(), Ending::None);
        flow.end();
        EXPECT_EQ(flow.flow.ending(), Ending::None);
        EXPECT_EQ(flow.bytes(), kOne);
        EXPECT_EQ(flow.flow.ending(), Ending::HalfClose);
    }
}

TEST(FrameFlow, CorruptSetsAFieldOrAByte)
{
    TestFlow flow({"frame=1 corrupt=mStatus value=0x25", "frame=1 corrupt=3 value=0", "frame=2 corrupt=-1 value=0x7F",
                   "frame=2 corrupt=payload+1 value=0x2A"});
    flow.arrive(kOne + kTwo);
    std::string one = kOne;
    one[23] = '\x25';
    one[3] = '\0';
    std::string two = kTwo;
    two.back() = '\x7F';
    two[33] = '*';
    EXPECT_EQ(flow.bytes(), one + two);
    EXPECT_THAT(flow.notes.faults, ElementsAre("1 mStatus changed from 0000 to 0025", "1 byte 3 changed from 20 to 00",
                                               "2 byte 42 changed from 72 to 7f", "2 byte 33 changed from 77 to 2a"));
}

TEST(FrameFlow, CorruptWithoutAValueAlwaysChangesTheFieldAndNothingElse)
{
    for (const char* rule : {"corrupt=mCallerId", "corrupt=14", "corrupt=any"}) {
        for (std::uint64_t seed = 0; seed < 50; ++seed) {
            SCOPED_TRACE(std::string(rule) + " " + std::to_string(seed));
            TestFlow flow({rule}, tool::Way::ToServer, seed);
            flow.arrive(kOne);
            const std::string out = flow.bytes();
            ASSERT_EQ(out.size(), kOne.size());
            std::size_t changed = 0;
            for (std::size_t i = 0; i < out.size(); ++i) {
                if (out[i] == kOne[i]) continue;
                ++changed;
                if (std::string(rule) == "corrupt=mCallerId") {
                    EXPECT_TRUE(i >= 8 && i < 12);
                }
                if (std::string(rule) == "corrupt=14") {
                    EXPECT_EQ(i, 14U);
                }
            }
            EXPECT_GE(changed, 1U);
        }
    }
}

TEST(FrameFlow, CorruptBeyondTheFrameChangesNothingAndSaysSo)
{
    TestFlow flow({"corrupt=35 value=1", "corrupt=34 value=1"});
    flow.arrive(kOne);
    std::string changed = kOne;
    changed[34] = 1;
    EXPECT_EQ(flow.bytes(), changed);
    EXPECT_THAT(flow.notes.faults,
                ElementsAre("1 not changed: 35 lies beyond its 35 bytes", "1 byte 34 changed from 65 to 01"));
}

TEST(FrameFlow, CutAfterFramesSendsThemFirst)
{
    TestFlow flow({"cut after frames=2"});
    flow.arrive(kOne + kTwo + kThree);
    EXPECT_EQ(flow.bytes(), kOne + kTwo);
    EXPECT_EQ(flow.flow.ending(), Ending::Cut);
    EXPECT_TRUE(flow.flow.isOver());
    EXPECT_FALSE(flow.flow.wantsInput(TestFlow::time(0)));
    EXPECT_THAT(flow.notes.faults, ElementsAre("2 the connection is cut: both sides see its end"));
}

TEST(FrameFlow, CutAtAFrameDoesNotSendIt)
{
    TestFlow flow({"frame=2 cut"});
    flow.arrive(kOne + kTwo);
    EXPECT_EQ(flow.bytes(), kOne);
    EXPECT_EQ(flow.flow.ending(), Ending::Cut);
}

TEST(FrameFlow, CutAfterBytesSendsExactlyThese)
{
    for (const std::size_t bytes : {std::size_t{1}, kOne.size(), kOne.size() + 1, kOne.size() + kTwo.size()}) {
        SCOPED_TRACE(bytes);
        TestFlow flow({"cut after bytes=" + std::to_string(bytes)});
        flow.arrive(kOne + kTwo);
        EXPECT_EQ(flow.bytes(), (kOne + kTwo).substr(0, bytes));
        EXPECT_EQ(flow.flow.ending(), Ending::Cut);
    }
    TestFlow more({"cut after bytes=" + std::to_string(kOne.size() + 1)});
    more.arrive(kOne);
    EXPECT_EQ(more.bytes(), kOne);
    EXPECT_EQ(more.flow.ending(), Ending::None);
}

TEST(FrameFlow, ResetAfterAFrame)
{
    TestFlow flow({"op=GetQelTod reset after frames=1"});
    flow.arrive(frameOf(7, "x", 0x6003, 0x0101) + kOne + kTwo);
    EXPECT_EQ(flow.bytes(), frameOf(7, "x", 0x6003, 0x0101) + kOne);
    EXPECT_EQ(flow.flow.ending(), Ending::Reset);
}

TEST(FrameFlow, HalfCloseEndsTheDirectionAndDropsWhatFollows)
{
    TestFlow flow({"half-close after frames=1"});
    flow.arrive(kOne + kTwo);
    EXPECT_EQ(flow.bytes(), kOne);
    EXPECT_EQ(flow.flow.ending(), Ending::HalfClose);
    EXPECT_FALSE(flow.flow.isOver());
    EXPECT_TRUE(flow.flow.wantsInput(TestFlow::time(0)));
    flow.arrive(kThree);
    EXPECT_EQ(flow.bytes(), "");
    flow.end();
    EXPECT_TRUE(flow.flow.isOver());
    EXPECT_EQ(flow.flow.sentBytes(), kOne.size());
}

TEST(FrameFlow, StopReadingKeepsTheFrameBack)
{
    TestFlow flow({"frame=2 stop-reading for=50ms"});
    flow.arrive(kOne + kTwo + kThree);
    EXPECT_EQ(flow.bytes(0), kOne);
    EXPECT_FALSE(flow.flow.wantsInput(TestFlow::time(49)));
    EXPECT_EQ(flow.wakeAt(1), 50);
    EXPECT_EQ(flow.bytes(49), "");
    EXPECT_EQ(flow.bytes(50), kTwo + kThree);
    EXPECT_TRUE(flow.flow.wantsInput(TestFlow::time(50)));
}

TEST(FrameFlow, StopReadingForEver)
{
    TestFlow flow({"stop-reading after bytes=40"});
    flow.arrive(kOne + kTwo);
    EXPECT_EQ(flow.bytes(0), (kOne + kTwo).substr(0, 40));
    EXPECT_FALSE(flow.flow.wantsInput(TestFlow::time(1000000)));
    EXPECT_EQ(flow.bytes(1000000), "");
    EXPECT_EQ(flow.wakeAt(0), -1);
}

TEST(FrameFlow, RateLimitsBytesOverTime)
{
    TestFlow flow({"rate=64k"});
    const std::string frame = frameOf(1, std::string(3168, 'x')); // 3200 bytes: 50 ms
    flow.arrive(frame);
    EXPECT_EQ(flow.bytes(0).size(), 640U);
    EXPECT_EQ(flow.wakeAt(0), 10);
    EXPECT_EQ(flow.bytes(9).size(), 0U);
    std::size_t sent = 640;
    for (int at = 10; at <= 40; at += 10)
        sent += flow.bytes(at).size();
    EXPECT_EQ(sent, 3200U);
    EXPECT_THAT(flow.notes.faults, ElementsAre("0 limited to 64000 bytes a second"));
}

TEST(FrameFlow, AFrameMayMeetSeveralRules)
{
    TestFlow flow({"frame=1 corrupt=mStatus value=1", "frame=1 split=4", "frame=1 delay=10ms"});
    flow.arrive(kOne);
    std::string changed = kOne;
    changed[23] = 1;
    EXPECT_THAT(flow.leave(9), IsEmpty());
    EXPECT_THAT(flow.leave(10), ElementsAre(changed.substr(0, 4), changed.substr(4)));
}

TEST(FrameFlow, RulesOfTheOtherDirectionOrConnectionDoNotApply)
{
    TestFlow other({"to-console drop", "connection=2 drop"});
    other.arrive(kOne);
    EXPECT_EQ(other.bytes(), kOne);
    TestFlow own({"connection=2 drop"}, tool::Way::ToServer, 1, 2);
    own.arrive(kOne);
    EXPECT_EQ(own.bytes(), "");
}

TEST(FrameFlow, TimesLimitsARule)
{
    TestFlow flow({"drop times=2"});
    flow.arrive(kOne + kTwo + kThree);
    EXPECT_EQ(flow.bytes(), kThree);
}

TEST(FrameFlow, TheSameSeedMakesTheSameFaults)
{
    const auto run = [](std::uint64_t seed, std::uint64_t connection) {
        TestFlow flow({"drop p=0.3", "corrupt=any p=0.5", "delay=1-90ms p=0.5"}, tool::Way::ToConsole, seed,
                      connection);
        for (unsigned int i = 1; i <= 100; ++i)
            flow.arrive(frameOf(i));
        flow.notes.faults.push_back(hexOf(flow.bytes(1000000), 0, 100000));
        return flow.notes.faults;
    };
    EXPECT_EQ(run(7, 1), run(7, 1));
    EXPECT_NE(run(7, 1), run(8, 1));
    EXPECT_NE(run(7, 1), run(7, 2));
}

TEST(FrameFlow, AProbabilityIsMetOnAverage)
{
    TestFlow flow({"drop p=0.1"});
    for (unsigned int i = 1; i <= 2000; ++i)
        flow.arrive(frameOf(i));
    EXPECT_GT(flow.notes.faults.size(), 140U); // 200, and more than four standard deviations
    EXPECT_LT(flow.notes.faults.size(), 260U);
}

} // namespace

} // namespace qel::test
