#include "console/BackoffDelays.hpp"

#include "base/TimeLeft.hpp"

#include <algorithm>
#include <cmath>

namespace qel::protocol {

BackoffDelays::BackoffDelays(const Backoff& backoff, unsigned int seed)
    : mNominal(static_cast<double>(backoff.first.count())),
      mLongest(static_cast<double>(std::min(backoff.longest, kLongestWait).count())), mFactor(backoff.factor),
      mRandom(seed)
{}

std::chrono::milliseconds BackoffDelays::next()
{
    mNominal = std::min(mNominal, mLongest);
    const double wait = std::uniform_real_distribution<double>(mNominal / 2, mNominal)(mRandom);
    mNominal *= mFactor;
    return std::chrono::milliseconds(std::llround(wait));
}

} // namespace qel::protocol
