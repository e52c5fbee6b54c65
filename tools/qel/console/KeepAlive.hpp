#pragma once

#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Console.hpp>

#include "base/Library.hpp"

#include <chrono>
#include <optional>

namespace qel::tool {

/// Notices a server that is gone or stopped although its connection is there: asks for the time of day, which changes
/// nothing, when nothing has come for half of the interval, and reports silence after the whole of it.
/// Lifetime: borrows the console. Thread safety: one thread.
class KeepAlive {
public:
    using TimePoint = PollDeadline::time_point;
    enum class Event {
        None,
        Silent, ///< nothing has come for the interval; reported once
        Back,   ///< something has come after Silent
    };

    /// @param interval  zero: off
    explicit KeepAlive(std::chrono::milliseconds interval) : mInterval(interval) {}

    /// A console begins to be watched. Ends the watch over another one.
    void watch(Console& console, TimePoint now);

    /// A message has come.
    Event noteHeard(TimePoint now);

    /// No message could have been received by now: the silence begins anew.
    void postpone(TimePoint now);

    /// When check() is due.
    PollDeadline deadline() const;

    /// Sends what is due and reports. Does not wait for the connection.
    Event check(TimePoint now);

    /// How long ago something has come.
    std::chrono::milliseconds silence(TimePoint now) const;

    /// How long the last answer took; none: there has been none.
    std::optional<std::chrono::microseconds> roundTrip() const { return mRoundTrip; }

private:
    void pAsk(TimePoint now);
    void pTakeAnswer(TimePoint now);

    const std::chrono::milliseconds mInterval;
    Console* mConsole = nullptr;
    std::optional<PendingResponse<QelMessageGetQelTodRsp>> mQuestion;
    TimePoint mAskedAt{};
    TimePoint mHeardAt{};
    bool mIsAsked = false; // or there was no way to ask, since mHeardAt
    bool mIsSilent = false;
    std::optional<std::chrono::microseconds> mRoundTrip;
};

} // namespace qel::tool
