#include <qel/common/util/BitmaskEnum.hpp>

#include <gtest/gtest.h>
#include <type_traits>
#include <utility>

namespace qel {

enum class BitmaskTestOption : int { None = 0, First = 1, Second = 2, Third = 4 };
template <>
struct is_bitmask_enum<BitmaskTestOption> : std::true_type {};

enum class BitmaskTestEvents : short { None = 0, Low = 0x01, High = 0x38 };
template <>
struct is_bitmask_enum<BitmaskTestEvents> : std::true_type {};

enum BitmaskTestByte : unsigned char { BitmaskTestByteNone = 0, BitmaskTestByteTop = 0x80, BitmaskTestByteLow = 0x01 };
template <>
struct is_bitmask_enum<BitmaskTestByte> : std::true_type {};

enum class BitmaskTestUnmarked { One = 1, Two = 2 };

namespace {

template <typename T, typename = void>
struct HasOr : std::false_type {};
template <typename T>
struct HasOr<T, decltype(static_cast<void>(std::declval<T>() | std::declval<T>()))> : std::true_type {};

template <typename T, typename = void>
struct HasNot : std::false_type {};
template <typename T>
struct HasNot<T, decltype(static_cast<void>(~std::declval<T>()))> : std::true_type {};

using Option = BitmaskTestOption;

TEST(BitmaskEnum, CombinesValues)
{
    EXPECT_EQ(static_cast<int>(Option::First | Option::Third), 5);
    EXPECT_EQ((Option::First | Option::Third) & Option::Third, Option::Third);
    EXPECT_EQ((Option::First | Option::Third) & Option::Second, Option::None);
    EXPECT_EQ((Option::First | Option::Third) ^ Option::First, Option::Third);
    EXPECT_EQ(static_cast<int>(~Option::First), ~1);
    EXPECT_EQ(~~Option::Second, Option::Second);
}

TEST(BitmaskEnum, CombinesInPlaceAndReturnsTheLeftSide)
{
    Option options = Option::None;
    EXPECT_EQ(&(options |= Option::First), &options);
    options |= Option::Second;
    EXPECT_EQ(options, Option::First | Option::Second);
    EXPECT_EQ(&(options &= ~Option::First), &options);
    EXPECT_EQ(options, Option::Second);
    EXPECT_EQ(&(options ^= Option::First), &options);
    EXPECT_EQ(options, Option::First | Option::Second);
    options ^= Option::Second;
    EXPECT_EQ(options, Option::First);
}

TEST(BitmaskEnum, GivesTheSameType)
{
    EXPECT_TRUE((std::is_same<decltype(Option::First | Option::Second), Option>::value));
    EXPECT_TRUE((std::is_same<decltype(~Option::First), Option>::value));
    EXPECT_TRUE((std::is_same<decltype(BitmaskTestByteTop | BitmaskTestByteLow), BitmaskTestByte>::value));
}

TEST(BitmaskEnum, WorksOnTypesNarrowerThanInt)
{
    EXPECT_EQ(static_cast<short>(BitmaskTestEvents::Low | BitmaskTestEvents::High), 0x39);
    EXPECT_EQ(static_cast<short>(~BitmaskTestEvents::None), -1);
    EXPECT_EQ(static_cast<unsigned char>(~BitmaskTestByteTop), 0x7F);
    EXPECT_EQ(~BitmaskTestByteNone & BitmaskTestByteTop, BitmaskTestByteTop);
}

TEST(BitmaskEnum, WorksAtCompileTime)
{
    constexpr Option both = Option::First | Option::Second;
    static_assert((both & Option::First) == Option::First, "a constant");
    static_assert((both ^ both) == Option::None, "a constant");
    EXPECT_NE(both, Option::None);
}

TEST(BitmaskEnum, LeavesUnmarkedTypesAlone)
{
    EXPECT_TRUE(HasOr<Option>::value);
    EXPECT_TRUE(HasNot<Option>::value);
    EXPECT_FALSE(HasOr<BitmaskTestUnmarked>::value);
    EXPECT_FALSE(HasNot<BitmaskTestUnmarked>::value);
    EXPECT_FALSE(is_bitmask_enum<BitmaskTestUnmarked>::value);
    EXPECT_FALSE(is_bitmask_enum<int>::value);
}

} // namespace
} // namespace qel
