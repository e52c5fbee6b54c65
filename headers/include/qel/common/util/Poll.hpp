#pragma once

#include <qel/common/QelExport.hpp>

#include <chrono>
#include <initializer_list>
#include <iosfwd>
#include <poll.h>
#include <type_traits>
#include <vector>

/// @file
/// Waiting on several descriptors at once: poll(2) in five small types. The usual loop of a thread that other threads
/// wake:
///
///     PollSet set{connection.getPollFd(PollEvents::Read), interrupt.getPollFd()};
///     const PollResult result = set.wait();
///     if (result.contains(interrupt.getPollFd())) {
///         interrupt.eoi();   // before handling the reason, so that an interrupt that comes meanwhile is kept
///         ...
///     }

namespace qel {

/// What to wait for, as masks of the bits of poll(2). Every mask includes errors and hang-ups, because poll always
/// reports them.
enum class PollEvents : short {
    Error = POLLERR | POLLHUP | POLLNVAL, ///< an error, a hang-up, or a descriptor that is not open
    Read = POLLIN | Error,                ///< readable
    Write = POLLOUT | Error,              ///< writable
    All = POLLIN | POLLOUT | Error        ///< readable or writable
};

/// One descriptor, the events wanted and the events seen.
/// Ownership: borrows the descriptor. Thread safety: a plain value.
class QEL_EXPORT PollFd {
public:
    /// An entry that poll skips: descriptor -1.
    static const PollFd Ignore;

    /// @param fd      borrowed; poll skips a negative one
    /// @param events  the events wanted
    constexpr PollFd(int fd, PollEvents events) noexcept : mFd{fd, static_cast<short>(events), 0} {}

    /// The record of poll(2). It is the only member: an array of PollFd is an array of these.
    pollfd mFd;
};

inline constexpr PollFd PollFd::Ignore{-1, PollEvents::All};

static_assert(static_cast<short>(PollEvents::Error) == 0x38 && static_cast<short>(PollEvents::Read) == 0x39 &&
                  static_cast<short>(PollEvents::Write) == 0x3C && static_cast<short>(PollEvents::All) == 0x3D,
              "the masks are printed, so their values are part of the interface");
static_assert(std::is_standard_layout<PollFd>::value && sizeof(PollFd) == sizeof(pollfd), "handed to poll unchanged");

/// A point in time of the steady clock, which TimeProvider::steady() reads, or none.
/// Thread safety: a plain value.
class QEL_EXPORT PollDeadline {
public:
    using time_point = std::chrono::steady_clock::time_point;

    /// The deadline that never expires: 1 ns before the epoch of the clock.
    static constexpr time_point Disabled{std::chrono::nanoseconds(-1)};

    /// The disabled deadline.
    constexpr PollDeadline() noexcept : mDeadline(Disabled) {}
    /// @param deadline  a time before the epoch of the clock gives the disabled deadline
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

    /// @return the timeout for PollSet::wait(): -1 ms when disabled, 0 when expired, else the time left, rounded down:
    ///         0 also when less than 1 ms is left
    std::chrono::milliseconds getTimeout(time_point now) const noexcept;

    /// Orders by time; the disabled deadline comes last.
    /// @return -1, 0 or 1: this deadline is earlier than, equal to or later than the other
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

/// The descriptors to wait on, in order; duplicates are allowed.
/// Ownership: borrows the descriptors. Thread safety: a plain value; a wait works on its own copy of the entries.
class QEL_EXPORT PollSet {
public:
    /// The timeout without limit.
    static constexpr std::chrono::milliseconds TIMEOUT_INFINITE{-1};

    /// The empty set.
    PollSet() = default;
    PollSet(const PollFd& fd);
    PollSet(std::initializer_list<PollFd> fds);

    /// Appends one entry, or all entries of a set, which may be this one.
    PollSet& operator+=(const PollFd& fd);
    PollSet& operator+=(const PollSet& other);
    PollSet operator+(const PollFd& fd) const;
    PollSet operator+(const PollSet& other) const;

    /// Removes every entry.
    void clear() noexcept { mFds.clear(); }

    /// Waits until an entry is ready, the time has passed or a signal has come.
    ///
    /// A wait that a signal interrupts (EINTR) is not resumed: to go on, the caller computes the time left with a
    /// PollDeadline and calls again. An empty set returns at once, whatever the timeout.
    /// @param timeout  0: does not wait; negative: no limit. The count is narrowed to an int for poll(2), so 2^31 ms is
    ///                 negative and 2^32 ms is 0.
    /// @return all entries of the set in its order, with the events seen; when none has seen any, the time has passed.
    ///         Empty for an empty set and after a signal.
    /// @throws PosixError  "poll() failed": poll(2) failed for another reason, such as more entries than the process
    ///                     may open descriptors. A descriptor that is not open gives an Error event, not an exception.
    PollResult wait(std::chrono::milliseconds timeout) const;
    /// wait(TIMEOUT_INFINITE)
    PollResult wait() const;
    /// wait(0 ms): does not wait.
    PollResult poll() const;

private:
    friend class PollResult;
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollSet& set);

    std::vector<PollFd> mFds;
};

/// The result of one wait.
/// Thread safety: a plain value.
class QEL_EXPORT PollResult {
public:
    /// The empty result.
    PollResult() = default;
    explicit PollResult(const std::vector<PollFd>& results);

    /// @return whether an entry for the same descriptor has seen one of the events in fd. Every mask includes errors:
    ///         PollFd(s, PollEvents::Read) also matches an error or a hang-up on s.
    bool contains(const PollFd& fd) const noexcept;
    /// @return whether contains() is true for an entry of the set; true for the empty set: a wait on nothing counts as
    ///         satisfied
    bool containsAnyOf(const PollSet& set) const noexcept;
    /// @return whether any entry has seen any event; false after a timeout or a signal
    bool anyReady() const noexcept;
    /// @return the entries, owned by this object
    const std::vector<PollFd>& getResults() const noexcept { return mResults; }

private:
    friend class PollSet;
    friend QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollResult& result);

    std::vector<PollFd> mResults;
};

/// Wakes a thread that waits on a PollSet: an eventfd(2) that any thread can signal.
/// It is pending from interrupt() to the next eoi(), otherwise idle.
/// Ownership: owns its descriptor, which is close-on-exec.
/// Lifetime: must outlive every wait and every interrupt(); it may not be destroyed while a thread uses it.
/// Thread safety: interrupt() may be called from any thread; eoi() belongs to the thread that waits.
class QEL_EXPORT PollInterrupt {
public:
    /// Does not report that the system has no descriptor left: the object then holds -1, which a PollSet skips, and
    /// interrupt() and eoi() throw.
    /// @throws PosixError  "Failed to open eventfd": only for a descriptor below -1, which eventfd(2) does not return
    PollInterrupt();
    /// Closes the descriptor.
    ~PollInterrupt();
    PollInterrupt(const PollInterrupt&) = delete;
    PollInterrupt& operator=(const PollInterrupt&) = delete;

    /// Makes it pending. Has no effect when it already is.
    /// @throws PosixError  "eventfd write failed"
    void interrupt();
    /// End of interrupt: makes it idle, however often interrupt() was called. Has no effect when it already is.
    /// @throws PosixError  "eventfd read failed"
    void eoi();
    /// @return the entry for a PollSet; borrows the descriptor of this object
    PollFd getPollFd() const noexcept { return PollFd(mEventFd, PollEvents::Read); }

private:
    int mEventFd;
};

/// Prints as in (fd=3, mask=0x0039, results=0x0000). Restores the stream's format flags, not its fill character.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollFd& fd);
/// Prints the entries in brackets, separated by ", ".
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollSet& set);
/// Prints the entries in brackets, separated by ", ".
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PollResult& result);

} // namespace qel
