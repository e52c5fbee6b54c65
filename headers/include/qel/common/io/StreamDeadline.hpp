#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>

namespace qel {

/// The deadline of one direction of a stream: a value that a concrete stream holds twice, once to read and once to
/// write.
///
/// A timeout that is set stays pending until the first I/O call asks for it; only then does its time start to run, so
/// that a program may set it long before there is anything to do. From then on one absolute deadline covers all calls
/// until it is changed. The clock is TimeProvider::steady().
///
/// Thread safety: none of its own; belongs to the thread that uses its direction of the stream.
class QEL_EXPORT StreamDeadline {
public:
    /// The timeout that never ends.
    static constexpr std::chrono::milliseconds Infinite{-1};
    /// The absolute deadline of a direction that has none: the largest time point of the steady clock.
    static constexpr std::chrono::steady_clock::time_point NoDeadline = std::chrono::steady_clock::time_point::max();

    /// No deadline.
    StreamDeadline() noexcept = default;

    /// As if `timeout` had been set, except that the value is stored as it is: negative values other than Infinite
    /// stand for a deadline that has already passed when its time starts to run.
    explicit StreamDeadline(std::chrono::milliseconds timeout) noexcept;

    /// Sets a timeout that starts to run at the next getEffectiveTimeout(); until then a deadline already in force
    /// stays.
    /// @param timeout  zero or more; any negative value clears the pending timeout and the deadline in force
    void setDeadline(std::chrono::milliseconds timeout) noexcept;

    /// The same as setDeadline().
    StreamDeadline& operator=(std::chrono::milliseconds timeout) noexcept;

    /// How long the I/O call that is about to wait may wait; a stream calls it right before each blocking call.
    ///
    /// The first call after a timeout was set starts its time and returns the timeout itself; later calls return what
    /// is left of it, in whole milliseconds, cut off: 0 with less than a millisecond to go and at the very moment of
    /// the deadline. A timeout that reaches beyond the range of the clock sets no deadline.
    /// @return milliseconds, 0 for no wait at all, Infinite for a wait without limit
    /// @throws StreamIOException  "I/O deadline": the deadline is over, do not wait
    std::chrono::milliseconds getEffectiveTimeout();

private:
    std::chrono::milliseconds mPendingDeadline = Infinite;        // relative, not started yet; Infinite: none
    std::chrono::steady_clock::time_point mDeadline = NoDeadline; // absolute, in force; NoDeadline: none
};

} // namespace qel
