#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>

namespace qel {

/// The deadline of one direction of a stream; a concrete stream has one to read and one to write.
///
/// A timeout is pending until the next I/O call, at which its time starts: a program may set it long before there is
/// anything to transfer. From then on one absolute deadline covers all calls until it is changed. The clock is
/// TimeProvider::steady().
///
/// Thread safety: no locks; belongs to the thread that uses its direction of the stream.
class QEL_EXPORT StreamDeadline {
public:
    /// The timeout without limit.
    static constexpr std::chrono::milliseconds Infinite{-1};
    /// The absolute deadline that means none: the largest time point of the steady clock.
    static constexpr std::chrono::steady_clock::time_point NoDeadline = std::chrono::steady_clock::time_point::max();

    /// No deadline.
    StreamDeadline() noexcept = default;

    /// Makes `timeout` pending, unchanged: a negative value other than Infinite gives a deadline that has already
    /// passed when its time starts.
    explicit StreamDeadline(std::chrono::milliseconds timeout) noexcept;

    /// Sets a timeout whose time starts at the next getEffectiveTimeout(). Until then the previous deadline stays in
    /// force.
    /// @param timeout  zero or more; a negative value clears the pending timeout and the deadline in force
    void setDeadline(std::chrono::milliseconds timeout) noexcept;

    /// The same as setDeadline().
    StreamDeadline& operator=(std::chrono::milliseconds timeout) noexcept;

    /// Called by a stream right before each call that blocks.
    ///
    /// The first call after a timeout was set starts its time and returns the timeout itself. Later calls return the
    /// time left, rounded down to milliseconds: 0 with less than a millisecond left and exactly at the deadline. A
    /// timeout beyond the range of the clock sets no deadline.
    /// @return how long to wait: 0 does not wait, Infinite waits without limit
    /// @throws StreamIOException  "I/O deadline": the deadline has passed
    std::chrono::milliseconds getEffectiveTimeout();

private:
    std::chrono::milliseconds mPendingDeadline = Infinite;        // relative, not started; Infinite: none
    std::chrono::steady_clock::time_point mDeadline = NoDeadline; // absolute, in force; NoDeadline: none
};

} // namespace qel
