#pragma once

#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/CommandEnd.hpp>
#include <qel/protocol/PartitionOptions.hpp>
#include <qel/protocol/PartitionState.hpp>

#include "hypervisor/ConsoleEntry.hpp"
#include "hypervisor/FruitlessTurns.hpp"
#include "hypervisor/GuardedLine.hpp"
#include "hypervisor/OutputHistory.hpp"
#include "hypervisor/PartitionSessions.hpp"
#include "hypervisor/RestartPause.hpp"
#include "hypervisor/SerialEvents.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

namespace qel::protocol {

/// One partition: its line, from being brought up to being taken down and up again; its sessions; and the bytes that
/// pass.
///
/// Output is read into the history and goes from there to the sessions. It is read all the time, or only for a console,
/// as the options say; but never further than the session that types has got, so that this one loses nothing. Input
/// that the line does not take is kept; mayAddInput() says when to accept no more of it.
///
/// Ownership: borrows the line, the consoles and the events. Thread safety: none of its own.
class Partition {
public:
    using TimePoint = std::chrono::steady_clock::time_point;
    using CloseReason = PartitionSessions::CloseReason;

    /// Bytes of input kept at which the console that types is not read any further.
    static constexpr std::size_t kInputLimit = 64 * 1024;
    /// How long a command may go on running after the end of its line before the line is taken down.
    static constexpr std::chrono::milliseconds kExitTimeout{1000};
    /// How often to look at a command whose line has ended, which ends at any moment.
    static constexpr std::chrono::milliseconds kExitInterval{5};
    /// How long an ended line waits for sessions that are open and not set up yet: a short command may end in between.
    static constexpr std::chrono::seconds kSetUpTimeout{10};
    /// How long a command that has ended, and is to be started again, waits for the console on number 0 to read.
    static constexpr std::chrono::seconds kStallTimeout{10};
    /// How often to look whether the line of a console that does not read has hung up.
    static constexpr std::chrono::seconds kStallInterval{1};
    /// How much larger than its limit the history may become for what the session that types has not got.
    static constexpr std::size_t kMostExtraHistory = 16 * 1024;
    /// How often to try to tell what there was no memory for.
    static constexpr std::chrono::milliseconds kNoteInterval{1000};

    Partition(std::uint16_t id, SerialLine& line, PartitionOptions options, SerialEvents& events);

    /// Takes the line down.
    ~Partition();

    Partition(const Partition&) = delete;
    Partition& operator=(const Partition&) = delete;

    const PartitionOptions& options() const noexcept { return mOptions; }

    bool isHeldBy(const ConsoleEntry& console, std::uint16_t number) const { return mSessions.isOf(number, console); }

    PartitionState state() const;

    // Requests and input of consoles: see PartitionSet.

    QelMessageStatusCodes open(ConsoleEntry& console, std::uint16_t number, bool force);
    QelMessageStatusCodes setUp(ConsoleEntry& console, std::uint16_t number);
    QelMessageStatusCodes close(ConsoleEntry& console, std::uint16_t number, bool force);
    bool feed(const ConsoleEntry& console, std::uint16_t number, const char* data, std::size_t length);
    void endSessionsOf(const ConsoleEntry& console, const std::string& why);
    void release(const ConsoleEntry& console);
    bool mayAddInput(const ConsoleEntry& console) const;

    /// Ends a session with a notice, for an operator. @return false: it is free
    bool endSession(std::uint16_t number);

    /// Sends a break. @return false: the line is not up, has no break, or could not send it
    bool sendBreak();

    /// Changes the options. keepsSession stays as it is. @throws std::bad_alloc  nothing has changed
    void change(const PartitionOptions& options);

    /// Ends all sessions with a notice and takes the line down for good.
    void retire(CloseReason reason);

    /// Ends all sessions with a line of text in their data, and a notice.
    void remove();

    // The serial thread's side.

    /// What to wait for; empty: nothing, or only deadline(). A line that has hung up and has nothing to do is left out:
    /// it would be reported without end. So is one whose last turns have moved nothing, for a moment.
    std::optional<PollFd> watch() const;

    /// When to call serviceTime() at the latest.
    PollDeadline deadline(TimePoint now) const;

    /// Moves what can be moved, at most one piece of output of the line.
    /// @return the bytes of the output that were read
    std::uint64_t service();

    /// Does what is due: brings the line up or takes it down, and sends what consoles have got room for.
    void serviceTime(TimePoint now);

private:
    using State = PartitionState::Line;

    void pFeed(std::uint16_t number, const char* data, std::size_t length);
    bool pIsFirstStartDue() const;
    bool pBringUp(bool mayRestart);
    bool pStart(TimePoint now);
    bool pAdvance();
    void pOnUp();
    void pFail();
    void pLoseLine();
    void pBeginExit();
    bool pMayFinishExit(TimePoint now) const;
    void pFinishExit(TimePoint now);
    void pEndCommand(const CommandEnd& end);
    void pTakeDown(CloseReason reason, const CommandEnd& end);
    void pStopLine();
    void pScheduleStart(RestartPause::Duration wasUp);
    void pTakeTurn();
    bool pMayHoldRestart() const;
    void pCheckStall(TimePoint now);
    void pPumpInput();
    bool pNoteRoom() noexcept;
    bool pReadOutput();
    void pReserveOutput();
    void pDrain();
    bool pWantsToWrite() const;
    bool pWantsOutput() const;
    bool pPeerHasFinished() const noexcept;
    PollDeadline pNextStep(TimePoint now) const;
    std::string pLossReason() const noexcept;
    std::string pLossText(bool wasUp, const std::string& reason) const noexcept;
    void pFitHistory(std::size_t more);
    void pNote(std::string text) noexcept;
    bool pTryNote(const std::string& text) noexcept;
    void pPayNote() noexcept;

    const std::uint16_t mId;
    PartitionOptions mOptions;
    SerialEvents& mEvents;
    GuardedLine mLine;
    OutputHistory mOutput;
    PartitionSessions mSessions;
    std::string mInput; ///< from consoles, not yet taken by the line
    bool mIsInputFull = false;

    std::uint64_t mOutputBytes = 0;
    std::uint64_t mInputBytes = 0;
    std::uint64_t mStarts = 0;
    std::uint64_t mInputMessages = 0;
    std::uint64_t mDroppedBytes = 0; ///< of input, before it was for the line

    State mState = State::Down;
    bool mIsRetired = false;
    bool mIsLost = false;     ///< of a line that keeps its sessions: they have been told that it is down
    std::string mLossReason;  ///< the newest one that has been logged
    bool mIsDraining = false; ///< the line has hung up: the rest of its output is read whoever looks
    TimePoint mUpSince;       ///< of the start of the line
    std::string mOwedNote;    ///< the newest line of the program's own that there was no memory for
    PollDeadline mStartAt;    ///< when to bring the line up; disabled: nothing is planned
    PollDeadline mExitBy;     ///< of a line that has ended, for its command to end
    PollDeadline mGiveUpBy;   ///< of a line that has hung up, for the console on number 0 to read
    PollDeadline mSetUpBy;    ///< of a line that has ended, for its sessions to be set up
    RestartPause mPause;
    FruitlessTurns mTurns;
};

} // namespace qel::protocol
