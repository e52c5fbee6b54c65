#include "base/TimeStamps.hpp"
#include "support/SettableClock.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel::test {

namespace {

using std::chrono::milliseconds;
using tool::TimeStamps;
using Style = TimeStamps::Style;

std::string stamped(TimeStamps& stamps, const std::string& text)
{
    std::string out;
    stamps.append(text.data(), text.size(), out);
    return out;
}

TEST(TimeStamps, OffChangesNothing)
{
    TimeStamps stamps;
    EXPECT_EQ(stamped(stamps, "one\r\ntwo"), "one\r\ntwo");
}

TEST(TimeStamps, IsoPutsTheTimeInFrontOfEachLine)
{
    SettableClock clock; // 2024-01-02 03:04:05
    clock.advance(milliseconds(7));
    TimeStamps stamps(Style::Iso);
    EXPECT_EQ(stamped(stamps, "one\r\n\ntwo"),
              "[2024-01-02T03:04:05.007Z] one\r\n[2024-01-02T03:04:05.007Z] \n[2024-01-02T03:04:05.007Z] two");
}

TEST(TimeStamps, ALineThatComesInPiecesIsStampedOnce)
{
    SettableClock clock;
    TimeStamps stamps(Style::Iso);
    EXPECT_EQ(stamped(stamps, "on"), "[2024-01-02T03:04:05.000Z] on");
    clock.advance(milliseconds(1500));
    EXPECT_EQ(stamped(stamps, "e\n"), "e\n");
    EXPECT_EQ(stamped(stamps, ""), "") << "the time is that of the first byte";
    EXPECT_EQ(stamped(stamps, "two"), "[2024-01-02T03:04:06.500Z] two");
}

TEST(TimeStamps, DeltaCountsFromTheLineBefore)
{
    SettableClock clock;
    TimeStamps stamps(Style::Delta);
    EXPECT_EQ(stamped(stamps, "one\n"), "[+0.000] one\n");
    clock.advance(milliseconds(1234));
    EXPECT_EQ(stamped(stamps, "two\n"), "[+1.234] two\n");
    EXPECT_EQ(stamped(stamps, "three\n"), "[+0.000] three\n");
}

TEST(TimeStamps, CyclesThroughTheStyles)
{
    TimeStamps stamps;
    stamps.cycle();
    EXPECT_EQ(stamps.style(), Style::Iso);
    stamps.cycle();
    EXPECT_EQ(stamps.style(), Style::Delta);
    stamps.cycle();
    EXPECT_EQ(stamps.style(), Style::Off);
}

TEST(TimeStamps, ALineThatHasBegunWithoutStampGetsNone)
{
    SettableClock clock;
    TimeStamps stamps;
    stamps.skip("$ ", 2);
    stamps.cycle();
    EXPECT_EQ(stamped(stamps, "ls\nx"), "ls\n[2024-01-02T03:04:05.000Z] x");
}

} // namespace

} // namespace qel::test
