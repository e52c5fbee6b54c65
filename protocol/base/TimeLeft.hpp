#pragma once

#include <chrono>

/// @file
/// Deadlines of calls. TimePoint::max() means none.

namespace qel::protocol {

using TimePoint = std::chrono::steady_clock::time_point;

/// The longest time that is waited for anything at once: poll(2) takes an int.
constexpr std::chrono::milliseconds kLongestWait = std::chrono::hours(20 * 24);

/// The shortest deadline that a stream gets: 0 would mean not to wait at all, even for what is on its way.
constexpr std::chrono::milliseconds kShortestWait{1};

/// The deadline of a call that begins now.
/// @param timeout  negative: no limit
TimePoint deadlineIn(std::chrono::milliseconds timeout);

/// For poll(2) and for the deadlines of streams: rounded up, so that a wait does not end early; 0 at and after the
/// deadline, -1 without one. At most kLongestWait.
std::chrono::milliseconds timeLeft(TimePoint deadline);

/// The same for a step that must be tried even when its time is up: at least kShortestWait.
std::chrono::milliseconds timeToTry(TimePoint deadline);

/// True at and after the deadline.
bool hasPassed(TimePoint deadline);

} // namespace qel::protocol
