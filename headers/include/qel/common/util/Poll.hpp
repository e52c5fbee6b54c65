#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>
#include <initializer_list>
#include <iosfwd>
#include <poll.h>
#include <type_traits>
#include <vector>

/// @file
/// Waiting on several descriptors at once: poll(2) in five small types. The usual cycle of a thread that others must be
/// able to wake:
///
///     PollSet set{connection.getPollFd(PollEvents::Read), interrupt.getPollFd()};
///     const PollResult result = set.wait();
///     if (result.contains(interrupt.getPollFd())) {
///         interrupt.eoi();   // before looking at the reason, so that an interrupt that comes meanwhile is not lost
///         ...
///     }

namespace qel {

/// What to wait for, as masks of the bits of poll(2). Errors and hang-ups are in every mask, because poll reports them
/// whatever was asked for.
enum class PollEvents : short {
    Error = POLLERR | POLLHUP | POLLNVAL, ///< an error, a hang-up, or a descriptor that is not open
    Read = POLLIN | Error,                ///< something can be read
    Write = POLLOUT | Error,              ///< something can be written
    All = POLLIN | POLLOUT | Error        ///< either of the two
};

/// One descriptor, the events wanted and the events seen.
/// Ownership: borrows the descriptor. Thread safety: a plain value.
class QEL_EXPORT PollFd {
public:
    /// An entry that poll skips: descriptor -1.
    static const PollFd Ignore;

    /// @param fd      a descriptor; poll skips negative ones
    /// @param events  the events wanted; none are seen yet
    constexpr PollFd(int fd, PollEvents events) noexcept : mFd{fd, static_cast<short>(events), 0} {}

    /// The record of poll(2), and nothing but it: an array of PollFd is an array of these.
    pollfd mFd;
};

inline constexpr PollFd PollFd::Ignore{-1, PollEvents::All};

static_assert(static_cast<short>(PollEvents::Error) == 0x38 && static_cast<short>(PollEvents::Read) == 0x39 &&
                  static_cast<short>(PollEvents::Write) == 0x3C && static_cast<short>(PollEvents::All) == 0x3D,
              "the masks are printed, so their values are part of the interface");
static_assert(std::is_standard_layout<PollFd>::value && sizeof(PollFd) == sizeof(pollfd), "handed to poll unchanged");

/// A point of the steady clock, or none at all. Times of TimeProvider::steady() belong to the same clock.
/// Thread safety: a plain value.
class QEL_EXPORT PollDeadline {
public:
    using time_point = std::chrono::steady_clock::time_point;

    /// The deadline that never expires: the point 1 ns before the epoch of the clock.
    static constexpr time_point Disabled{std::chrono::nanoseconds(-1)};

    /// The disabled deadline.
    constexpr PollDeadline() noexcept : mDeadline(Disabled) {}
    /// @param deadline  the point; one before the epoch of the clock gives the disabled deadline
    PollDeadline(time_point deadline) noexcept : mDeadline(pNormalise(deadline)) {}
    PollDeadline& operator=(time_point deadline) noexcept
    {
        mDeadline = pNormalise(deadline);
        return *this;
    }

    operator time_point() const noexcept { return mDeadline; }

    bool isDisabled() const noexcept { return mDeadline == Disabled; }

    /// @return true when the deadline is enabled and not later than now
    bool isExpired(time_point now) const noexcept { return !isDisabled() && mDeadline <= now; }

    /// @return the time to give to PollSet::wait: -1 ms when disabled, 0 when expired, else the time left in whole
    ///         milliseconds, cut: 0 when less than one is left, although the deadline is not expired yet
    std::chrono::milliseconds getTimeout(time_point now) const noexcept;

    /// Orders by time; the disabled deadline comes after every enabled one.
    /// @return -1, 0 or 1: this deadline is before, equal to or behind the other
    int compare(const PollDeadline& other) const noexcept;

    friend bool operator==(const PollDeadline& a, const PollDeadline& b) noexcept { return a.mDeadline == b.mDeadline; }
    friend bool operator!=(const PollDeadline& a, const PollDeadline& b) noexcept { return a.mDeadline != b.mDeadline; }
    friend bool operator<(const PollDeadline& a, const PollDeadline& b) noexcept { return a.compare(b) < 0; }
    friend bool operator>(const PollDeadline& a, const PollDeadline& b) noexcept { return a.compare(b) > 0; }
    friend bool operator<=(const PollDeadline& a, const PollDeadline& b) noexcept { return a.compare(b) <= 0; }
    friend bool operator>=(const PollDeadline& a, const PollDeadline& b) noexcept { return a.compare(b) >= 0; }

private:
    static constexpr time_point pNormalise(time_point deadline) noexcept
    {
        return deadline < time_point() ? Disabled : deadline;
    }

    time_point mDeadline;
};

class PollResult;

/// The descriptors to wait on, in order; the same one may be in it several times.
/// Ownership: borrows the descriptors. Thread safety: a plain value; a wait works on its own copy of the entries.
class QEL_EXPORT PollSet {
public:
    /// Wait without limit.
    static constexpr std::chrono::milliseconds TIMEOUT_INFINITE{-1};

    /// The empty set.
    PollSet() = default;
    PollSet(const PollFd& fd);
    PollSet(std::initializer_list<PollFd> fds);

    /// Appends one entry, or every entry of another set in its order; the set itself may be the other.
    PollSet& operator+=(const PollFd& fd);
    PollSet& operator+=(const PollSet& other);
    PollSet operator+(const PollFd& fd) const;
    PollSet operator+(const PollSet& other) const;

    /// Removes every entry.
    void clear() noexcept { mFds.clear(); }

    /// Waits until an entry is ready, the time has passed or a signal has come.
    ///
    /// A wait that a signal cuts short (EINTR) is not resumed: a caller that wants to wait on computes the time left
    /// with a PollDeadline and calls again. A wait on an empty set returns at once, whatever the time-out.
    /// @param timeout  0 only looks; negative waits without limit. The count is narrowed to an int, as poll(2) takes
    ///                 it: 2^31 ms is negative and 2^32 ms is 0.
    /// @return every entry of the set in its order with the events seen; the time has passed when none of them has
    ///         any. Empty when the set is empty or a signal came.
    /// @throws PosixError  "poll() failed": poll(2) failed for another reason, such as more entries than the process
    ///                     may have descriptors. A descriptor that is not open is no failure but an Error event.
    PollResult wait(std::chrono::milliseconds timeout) const;
    /// wait(TIMEOUT_INFINITE)
    PollResult wait() const;
    /// wait(0 ms): looks without waiting.
    PollResult poll() const;

private:
    friend class PollResult;
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollSet& set);

    std::vector<PollFd> mFds;
};

/// What one wait has seen.
/// Thread safety: a plain value.
class QEL_EXPORT PollResult {
public:
    /// The empty result.
    PollResult() = default;
    explicit PollResult(const std::vector<PollFd>& results);

    /// @return true when an entry of the same descriptor has seen one of the events that fd asks for. As errors are in
    ///         every mask, PollFd(s, PollEvents::Read) also finds an error or a hang-up on s.
    bool contains(const PollFd& fd) const noexcept;
    /// @return true when contains() holds for one entry of the set, and for the empty set: a wait on nothing counts as
    ///         satisfied
    bool containsAnyOf(const PollSet& set) const noexcept;
    /// @return true when any entry has seen any event; false after a time-out or a signal
    bool anyReady() const noexcept;
    /// @return the entries; owned by this object
    const std::vector<PollFd>& getResults() const noexcept { return mResults; }

private:
    friend class PollSet;
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollResult& result);

    std::vector<PollFd> mResults;
};

/// Wakes a thread that waits on a PollSet: an eventfd(2) that any thread can signal.
/// It is idle until interrupt() and pending from then until eoi().
/// Ownership: owns its descriptor, which does not survive an exec.
/// Thread safety: interrupt() may be called from any thread; eoi() belongs to the thread that waits.
class QEL_EXPORT PollInterrupt {
public:
    /// When no descriptor is to be had this does not fail: the object then holds the descriptor -1, which a PollSet
    /// skips, and interrupt() and eoi() throw.
    PollInterrupt();
    /// Closes the descriptor.
    ~PollInterrupt();
    PollInterrupt(const PollInterrupt&) = delete;
    PollInterrupt& operator=(const PollInterrupt&) = delete;

    /// Makes it pending; does nothing more when it already is.
    /// @throws PosixError  "eventfd write failed"
    void interrupt();
    /// End of interrupt: makes it idle, however often it was interrupted; does nothing when it already is.
    /// @throws PosixError  "eventfd read failed"
    void eoi();
    /// @return the entry for a PollSet; borrows the descriptor of this object
    PollFd getPollFd() const noexcept { return PollFd(mEventFd, PollEvents::Read); }

private:
    int mEventFd;
};

/// Prints as in (fd=3, mask=0x0039, results=0x0000); the format flags of the stream stay as they were.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollFd& fd);
/// Prints the entries in brackets with ", " between them.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollSet& set);
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollResult& result);

} // namespace qel
