#include "console/BackoffDelays.hpp"

#include <gtest/gtest.h>
#include <set>

namespace qel::test {

namespace {

using protocol::Backoff;
using protocol::BackoffDelays;
using std::chrono::milliseconds;

TEST(BackoffDelays, GrowByTheFactorUpToTheLongestAndLoseAtMostHalf)
{
    Backoff backoff;
    backoff.first = milliseconds(100);
    backoff.longest = milliseconds(1000);
    backoff.factor = 3;
    const milliseconds nominal[] = {milliseconds(100), milliseconds(300), milliseconds(900), milliseconds(1000),
                                    milliseconds(1000)};
    for (unsigned int seed = 1; seed <= 100; ++seed) {
        SCOPED_TRACE(seed);
        BackoffDelays delays(backoff, seed);
        for (const milliseconds most : nominal) {
            const milliseconds delay = delays.next();
            EXPECT_GE(delay, most / 2);
            EXPECT_LE(delay, most);
        }
    }
}

TEST(BackoffDelays, DifferBetweenConsoles)
{
    std::set<milliseconds> delays;
    for (unsigned int seed = 1; seed <= 100; ++seed)
        delays.insert(BackoffDelays(Backoff(), seed).next());
    EXPECT_GT(delays.size(), 50U);
}

TEST(BackoffDelays, StayZero)
{
    Backoff backoff;
    backoff.first = milliseconds(0);
    BackoffDelays delays(backoff, 1);
    for (int i = 0; i < 3; ++i)
        EXPECT_EQ(delays.next(), milliseconds(0));
}

TEST(BackoffDelays, DoNotOverflow)
{
    Backoff backoff;
    backoff.factor = 1e300;
    BackoffDelays delays(backoff, 1);
    for (int i = 0; i < 5; ++i)
        EXPECT_LE(delays.next(), backoff.longest);
}

} // namespace

} // namespace qel::test
