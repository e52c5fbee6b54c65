#include "bench/BenchLoad.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include <limits>

namespace qel::tool {

BenchShare::BenchShare(const BenchLoad& load, unsigned int pair, TimePoint start)
    : mLoad(load), mPair(pair), mStart(start)
{}

void BenchShare::run(const Exchange& exchange, const WaitUntil& waitUntil, BenchFigures& figures,
                     std::atomic<std::uint64_t>& done) const
{
    const bool paced = mLoad.rate > 0;
    const std::uint64_t messages = pMessages();
    std::uint64_t sent = 0;
    for (; sent < messages; ++sent) {
        const TimePoint due = paced ? pDueTime(sent) : TimeProvider::steady();
        if (pIsOver(due) || pIsOver(mStart + figures.elapsed) || !waitUntil(due)) break;
        try {
            exchange();
        } catch (...) {
            if (paced) figures.unsent = pUnsent(sent + 1); // this one was sent
            throw;
        }
        const TimePoint end = TimeProvider::steady();
        figures.latency.record(end - due);
        figures.elapsed = end - mStart;
        ++done;
    }
    if (paced) figures.unsent = pUnsent(sent);
}

/// The number of messages that are due by now and have not been sent.
std::uint64_t BenchShare::pUnsent(std::uint64_t sent) const
{
    const TimePoint now = TimeProvider::steady();
    const auto wasDue = [&](std::uint64_t message) {
        return message < pMessages() && pDueTime(message) <= now && !pIsOver(pDueTime(message));
    };
    // Binary search for the last one that was due: there may be too many to look at each.
    std::uint64_t step = 1;
    while (wasDue(sent + step - 1))
        step *= 2;
    std::uint64_t unsent = 0;
    for (; step > 0; step /= 2) {
        if (wasDue(sent + unsent + step - 1)) unsent += step;
    }
    return unsent;
}

/// The number of messages of this share: those whose number modulo the number of pairs is the number of this pair.
std::uint64_t BenchShare::pMessages() const
{
    if (mLoad.count == 0) return std::numeric_limits<std::uint64_t>::max();
    if (mLoad.count <= mPair) return 0;
    return (mLoad.count - mPair - 1) / mLoad.pairs + 1;
}

BenchShare::TimePoint BenchShare::pDueTime(std::uint64_t message) const
{
    const double number = static_cast<double>(message) * mLoad.pairs + mPair;
    const std::chrono::duration<double> due(number / mLoad.rate);
    return mStart + std::chrono::duration_cast<std::chrono::nanoseconds>(due);
}

bool BenchShare::pIsOver(TimePoint time) const
{
    return mLoad.time > std::chrono::nanoseconds::zero() && time >= mStart + mLoad.time;
}

} // namespace qel::tool
