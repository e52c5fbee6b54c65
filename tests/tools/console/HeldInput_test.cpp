#include "console/HeldInput.hpp"

#include <gtest/gtest.h>
#include <string>

namespace qel::test {

namespace {

using std::chrono::milliseconds;
using tool::HeldInput;

constexpr PollDeadline::time_point kStart{std::chrono::seconds(1000)};

TEST(HeldInput, HoldsUpToItsLimitAndDropsTheRest)
{
    HeldInput held;
    EXPECT_EQ(held.add(std::string(HeldInput::kLimit - 1, 'a'), kStart), 0U);
    EXPECT_EQ(held.add("b", kStart), 0U);
    EXPECT_EQ(held.size(), HeldInput::kLimit);
    EXPECT_EQ(held.add("cd", kStart), 2U);
    EXPECT_EQ(held.size(), HeldInput::kLimit);
    EXPECT_EQ(held.input().back(), 'b');
    EXPECT_EQ(held.dropped(), 2U);
}

TEST(HeldInput, APieceBeyondTheLimitIsTakenInPart)
{
    HeldInput held;
    EXPECT_EQ(held.add(std::string(HeldInput::kLimit + 5, 'a'), kStart), 5U);
    EXPECT_EQ(held.size(), HeldInput::kLimit);
}

TEST(HeldInput, IsLateOnceWhenNothingIsTakenInTime)
{
    HeldInput held;
    held.add("x", kStart);
    EXPECT_EQ(held.deadline(), PollDeadline(kStart + HeldInput::kPatience));
    EXPECT_FALSE(held.isLate(kStart + HeldInput::kPatience - milliseconds(1)));
    EXPECT_TRUE(held.isLate(kStart + HeldInput::kPatience));
    EXPECT_FALSE(held.isLate(kStart + HeldInput::kPatience));
    EXPECT_TRUE(held.deadline().isDisabled());
}

TEST(HeldInput, TypingMoreDoesNotPostponeIt)
{
    HeldInput held;
    held.add("x", kStart);
    held.add("y", kStart + milliseconds(999));
    EXPECT_TRUE(held.isLate(kStart + HeldInput::kPatience));
}

TEST(HeldInput, SendingPostponesIt)
{
    HeldInput held;
    held.add("xy", kStart);
    held.input().erase(0, 1);
    EXPECT_FALSE(held.noteSent(kStart + milliseconds(500)));
    EXPECT_FALSE(held.isLate(kStart + HeldInput::kPatience));
    EXPECT_TRUE(held.isLate(kStart + milliseconds(500) + HeldInput::kPatience));
}

TEST(HeldInput, TellsWhenEverythingHasBeenSentIfTheUserHadBeenTold)
{
    HeldInput held;
    held.add("xy", kStart);
    ASSERT_TRUE(held.isLate(kStart + HeldInput::kPatience));
    held.input().erase(0, 1);
    EXPECT_FALSE(held.noteSent(kStart));
    held.input().clear();
    EXPECT_TRUE(held.noteSent(kStart));
    held.add("z", kStart);
    held.input().clear();
    EXPECT_FALSE(held.noteSent(kStart)) << "not told about this";
}

TEST(HeldInput, TellsWhenEverythingHasBeenSentIfSomeWasDropped)
{
    HeldInput held;
    held.add(std::string(HeldInput::kLimit + 1, 'a'), kStart);
    held.input().clear();
    EXPECT_TRUE(held.noteSent(kStart));
    EXPECT_EQ(held.dropped(), 0U);
}

TEST(HeldInput, WithoutInputNothingIsLate)
{
    HeldInput held;
    EXPECT_TRUE(held.deadline().isDisabled());
    EXPECT_FALSE(held.isLate(kStart + std::chrono::hours(1)));
}

} // namespace

} // namespace qel::test
