#pragma once

#include <qel/common/util/Poll.hpp>

#include <chrono>
#include <cstddef>
#include <string>

namespace qel::tool {

/// Input that has been read and not been sent yet. The keyboard is always read, so that an escape command is seen;
/// what the connection does not take is held here, up to a limit. The caller tells the user what take() and isLate()
/// report.
/// Thread safety: one thread.
class HeldInput {
public:
    /// The most bytes that are held.
    static constexpr std::size_t kLimit = 1024 * 1024;
    /// How long input may be held before the user is told.
    static constexpr std::chrono::milliseconds kPatience{1000};

    using TimePoint = PollDeadline::time_point;

    /// Takes input; drops what exceeds the limit. @return the number of bytes dropped
    std::size_t add(const std::string& input, TimePoint now);

    bool isEmpty() const noexcept { return mInput.empty(); }
    std::size_t size() const noexcept { return mInput.size(); }

    /// The input, from which a sender removes what it has sent; call noteSent() afterwards.
    std::string& input() noexcept { return mInput; }

    /// Some of the input has been sent.
    /// @return true when nothing is held any more and the user had been told that something is
    bool noteSent(TimePoint now);

    /// When isLate() has to be asked; disabled when there is nothing to tell.
    PollDeadline deadline() const;

    /// True once when the connection has taken nothing for kPatience: the user is to be told.
    bool isLate(TimePoint now);

    /// The bytes dropped since the input was last sent completely.
    std::size_t dropped() const noexcept { return mDropped; }

    void clear();

private:
    std::string mInput;
    std::size_t mDropped = 0;
    bool mIsTold = false;
    TimePoint mSince{}; // the last time that something was sent, or when input came that could be sent
};

} // namespace qel::tool
