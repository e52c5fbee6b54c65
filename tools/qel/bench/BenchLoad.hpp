#pragma once

#include "bench/LatencyHistogram.hpp"

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>

namespace qel::tool {

/// The load to put on a server.
struct BenchLoad {
    unsigned int pairs = 1;           ///< of consoles
    std::size_t bytes = 256;          ///< of payload in a message
    double rate = 0;                  ///< messages a second, of all pairs together; 0: flat out
    std::uint64_t count = 0;          ///< messages, of all pairs together; 0: no limit
    std::chrono::nanoseconds time{0}; ///< that the run takes; 0: no limit
};

/// What came out.
struct BenchFigures {
    LatencyHistogram latency;            ///< of each message that was done
    std::uint64_t unsent = 0;            ///< messages that were due before the end and not sent any more
    std::chrono::nanoseconds elapsed{0}; ///< from the first message to the end of the last
    bool interrupted = false;
};

/// The part of a load that one pair of consoles carries: every n-th message.
///
/// With a rate each message has its time, which does not depend on how long the ones before it take; when they take too
/// long, it is sent late, and the delay counts as its latency. Otherwise a server that stops for a while would be
/// charged with one slow message instead of all those that should have come meanwhile.
/// Thread safety: one thread.
class BenchShare {
public:
    using TimePoint = std::chrono::steady_clock::time_point;

    /// Sends one message and waits for it to be done.
    using Exchange = std::function<void()>;
    /// Waits until then. @return false: the run is to end now
    using WaitUntil = std::function<bool(TimePoint)>;

    /// @param load  copied @param pair  0 to load.pairs - 1
    BenchShare(const BenchLoad& load, unsigned int pair, TimePoint start);

    /// Carries it. Reads TimeProvider::steady() once for each message, and flat out twice.
    /// @param figures  those of this share, empty at first; kept up to date with each message
    /// @param done  counted up with each message
    /// @throws what `exchange` throws
    void run(const Exchange& exchange, const WaitUntil& waitUntil, BenchFigures& figures,
             std::atomic<std::uint64_t>& done) const;

private:
    std::uint64_t pMessages() const;
    std::uint64_t pUnsent(std::uint64_t sent) const;
    TimePoint pDueTime(std::uint64_t message) const;
    bool pIsOver(TimePoint time) const;

    const BenchLoad mLoad;
    const unsigned int mPair;
    const TimePoint mStart;
};

} // namespace qel::tool
