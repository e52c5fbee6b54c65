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
    double rate = 0;                  ///< messages per second, all pairs together; 0: as fast as possible
    std::uint64_t count = 0;          ///< messages, all pairs together; 0: no limit
    std::chrono::nanoseconds time{0}; ///< duration of the run; 0: no limit
};

/// The result of a run.
struct BenchFigures {
    LatencyHistogram latency;            ///< of each completed message
    std::uint64_t unsent = 0;            ///< messages that were due before the end and were not sent
    std::chrono::nanoseconds elapsed{0}; ///< from the first message to the end of the last
    bool interrupted = false;
};

/// The part of a load that one pair of consoles carries: every n-th message.
///
/// With a rate each message has a due time that does not depend on the messages before it. A message that is sent late
/// counts its delay as latency. Otherwise a server that stalls would be charged with one slow message instead of all
/// messages that were due during the stall.
/// Thread safety: one thread.
class BenchShare {
public:
    using TimePoint = std::chrono::steady_clock::time_point;

    /// Sends one message and waits until it is complete.
    using Exchange = std::function<void()>;
    /// Waits until the time. @return false: the run must end now
    using WaitUntil = std::function<bool(TimePoint)>;

    /// @param load  copied @param pair  0 to load.pairs - 1
    BenchShare(const BenchLoad& load, unsigned int pair, TimePoint start);

    /// Runs the share. Reads TimeProvider::steady() once for each message, without a rate twice.
    /// @param figures  of this share, empty at first; updated with each message
    /// @param done  incremented with each message
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
