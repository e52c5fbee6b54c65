#pragma once

#include <qel/protocol/ConsoleOptions.hpp>

#include <chrono>
#include <random>

namespace qel::protocol {

/// The waits of a Backoff, one after the other. Thread safety: one thread.
class BackoffDelays {
public:
    /// @param seed  of the random part
    BackoffDelays(const Backoff& backoff, unsigned int seed);

    /// The next wait: between half of the nominal one and all of it. The nominal wait begins with `first` and is
    /// multiplied by `factor` each time, up to `longest`.
    std::chrono::milliseconds next();

private:
    double mNominal; // milliseconds
    double mLongest;
    double mFactor;
    std::minstd_rand mRandom;
};

} // namespace qel::protocol
