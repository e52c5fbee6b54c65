#include "server/HandshakePlaces.hpp"

#include <gtest/gtest.h>
#include <utility>
#include <vector>

namespace qel::test {

namespace {

using protocol::HandshakePlaces;
using protocol::sourceOf;

TEST(HandshakePlaces, TakesAsManyAsInAllAndRefusesOneMore)
{
    HandshakePlaces places(2, 2);
    const auto first = places.take("a");
    const auto second = places.take("b");
    EXPECT_TRUE(first && second);
    const auto third = places.take("c");
    EXPECT_FALSE(third);
    EXPECT_STREQ(third.getRefusal(), "too many connections are in their handshake");
}

TEST(HandshakePlaces, TakesAsManyFromOneSourceAndRefusesOneMoreOfItOnly)
{
    HandshakePlaces places(10, 2);
    const auto first = places.take("a");
    const auto second = places.take("a");
    EXPECT_TRUE(first && second);
    const auto third = places.take("a");
    EXPECT_FALSE(third);
    EXPECT_STREQ(third.getRefusal(), "too many connections from its address are in their handshake");
    EXPECT_TRUE(places.take("b"));
}

TEST(HandshakePlaces, APlaceIsGivenBackOnce)
{
    HandshakePlaces places(2, 1);
    auto first = places.take("a");
    const auto other = places.take("b");
    first.release();
    first.release();
    EXPECT_FALSE(first);
    const auto again = places.take("a");
    EXPECT_TRUE(again);
    EXPECT_FALSE(places.take("c"));
}

TEST(HandshakePlaces, ADestroyedPlaceIsFree)
{
    HandshakePlaces places(1, 1);
    static_cast<void>(places.take("a"));
    EXPECT_TRUE(places.take("a"));
}

TEST(HandshakePlaces, AMovedPlaceIsGivenBackByItsNewOwner)
{
    HandshakePlaces places(1, 1);
    auto first = places.take("a");
    {
        const HandshakePlaces::Place second(std::move(first));
        EXPECT_TRUE(second);
        EXPECT_FALSE(places.take("b"));
    }
    HandshakePlaces::Place third = places.take("b");
    EXPECT_TRUE(third);
    third = HandshakePlaces::Place();
    EXPECT_TRUE(places.take("c"));
}

TEST(HandshakePlaces, ARefusedPlaceGivesNothingBack)
{
    HandshakePlaces places(1, 1);
    const auto first = places.take("a");
    static_cast<void>(places.take("a"));
    EXPECT_FALSE(places.take("a"));
}

TEST(SourceOf, AnIPv4AddressCountsByItself)
{
    EXPECT_EQ(sourceOf(IPv4Address::parse("192.0.2.7")), "192.0.2.7");
    EXPECT_EQ(sourceOf(IPv6Address::parse("::ffff:192.0.2.7")), "192.0.2.7");
}

TEST(SourceOf, OfAnIPv6AddressTheNetworkCounts)
{
    EXPECT_EQ(sourceOf(IPv6Address::parse("2001:db8:1:2:3:4:5:6")), "2001:db8:1:2::/64");
    EXPECT_EQ(sourceOf(IPv6Address::parse("2001:db8:1:2:ffff::")), "2001:db8:1:2::/64");
    EXPECT_EQ(sourceOf(IPv6Address::parse("2001:db8:1:3::6")), "2001:db8:1:3::/64");
    EXPECT_EQ(sourceOf(IPv6Address::parse("::1")), "::/64");
}

} // namespace

} // namespace qel::test
