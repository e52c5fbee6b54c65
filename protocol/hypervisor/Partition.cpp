#include "hypervisor/Partition.hpp"

#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Logging.hpp>

#include "base/Guard.hpp"

#include <algorithm>
#include <array>
#include <new>
#include <poll.h>
#include <tuple>
#include <utility>

namespace qel::protocol {

namespace {

constexpr CommandEnd kClosedTerminal{CommandEnd::Kind::ClosedTerminal, 0};

/// How long a line has to be up for the next pause to be a short one.
constexpr std::chrono::seconds kSettledCommand(30);
constexpr std::chrono::seconds kSettledConnection(5);

/// Pieces of output that are read at once from a line that is about to be started again.
constexpr int kDrainedPieces = 64;

/// The history holds at least the piece that is on its way to the session that types.
std::size_t historyLimit(const PartitionOptions& options)
{
    return std::max(options.replayBytes, PartitionSessions::kPiece);
}

bool isSuccess(const CommandEnd& end) { return end.kind == CommandEnd::Kind::Exited && end.number == 0; }

} // namespace

Partition::Partition(std::uint16_t id, SerialLine& line, PartitionOptions options, SerialEvents& events)
    : mId(id), mOptions(std::move(options)), mEvents(events), mLine(id, line, !mOptions.keepsSession),
      mOutput(historyLimit(mOptions)), mSessions(id, mOutput),
      mPause(mOptions.keepsSession ? kSettledConnection : kSettledCommand,
             mOptions.keepsSession ? RestartPause::shareOf(id) : std::uint16_t{0})
{
    if (mOptions.keepsSession || mOptions.start == StartLine::Boot) mStartAt = TimeProvider::steady();
}

Partition::~Partition()
{
    if (mState != State::Down) mLine.stop();
}

PartitionState Partition::state() const
{
    return {mId,
            mOptions.name,
            mOptions.description,
            mState,
            mSessions.states(),
            mOutputBytes,
            mInputBytes,
            mStarts,
            mSessions.sentMessages(),
            mInputMessages,
            mSessions.skippedBytes(),
            mDroppedBytes,
            static_cast<std::size_t>(mOutput.end() - mOutput.begin()),
            mInput.size(),
            mOptions.replayBytes};
}

QelMessageStatusCodes Partition::open(ConsoleEntry& console, std::uint16_t number, bool force)
{
    if (mSessions.has(number) && !force) return QelMessageStatusConnectionNotAvailable;
    mEvents.changed = true; // even when the command cannot be started: what is left of an ended one is taken down first
    if (!pBringUp(number == PartitionSessions::kTyping)) return QelMessageStatusCmdFailed;
    mSessions.end(number, CloseReason::CloseReasonForceClose);
    mSessions.open(number, console);
    // A command that has ended waits for this session too, unless it is to be started again.
    if (mState == State::Ended && mGiveUpBy.isDisabled()) mSetUpBy = TimeProvider::steady() + kSetUpTimeout;
    return QelMessageStatusNoError;
}

QelMessageStatusCodes Partition::setUp(ConsoleEntry& console, std::uint16_t number)
{
    if (!mSessions.isOf(number, console)) return QelMessageStatusInvalidCmdSequence;
    mSessions.setUp(number, mOptions.replayBytes);
    mEvents.changed = true;
    return QelMessageStatusNoError;
}

QelMessageStatusCodes Partition::close(ConsoleEntry& console, std::uint16_t number, bool force)
{
    if (mSessions.isOf(number, console)) {
        mSessions.drop(number);
    } else if (mSessions.has(number) && force) {
        mSessions.end(number, CloseReason::CloseReasonForceClose);
    } else {
        return QelMessageStatusConnectionClosureFailure;
    }
    mEvents.changed = true;
    return QelMessageStatusNoError;
}

bool Partition::feed(const ConsoleEntry& console, std::uint16_t number, const char* data, std::size_t length)
{
    if (!mSessions.isOf(number, console) || !mSessions.isSetUp(number)) return false;
    if (length == 0) return true;
    ++mInputMessages;
    const auto waitsFor = [this] {
        return std::make_tuple(pWantsToWrite(), mLine.advanceAt(), mSessions.canDeliver());
    };
    const auto before = waitsFor();
    pFeed(number, data, length);
    // The serial thread is not woken for a key that the line has taken.
    if (waitsFor() != before) mEvents.changed = true;
    return true;
}

void Partition::pFeed(std::uint16_t number, const char* data, std::size_t length)
{
    if (number != PartitionSessions::kTyping) {
        mSessions.refuseInput(number, "watching only, input is not passed on");
    } else if (!mIsLost && (mState == State::Up || mState == State::ComingUp || pIsFirstStartDue())) {
        mInput.append(data, length);
        pPumpInput();
        pNoteRoom();
        return;
    } else if (mIsLost) { // also while it connects: the second half of a line that was typed blindly is worse than none
        mSessions.refuseInput(number, "the line is down, input is dropped");
    } // nothing reads what is typed after the end of a command
    mDroppedBytes += length;
}

/// Whether the line is to be brought up for the first time in a moment, as when a console comes right after the start
/// of the server.
bool Partition::pIsFirstStartDue() const
{
    return mState == State::Down && mOptions.keepsSession && !mIsLost && !mStartAt.isDisabled();
}

void Partition::endSessionsOf(const ConsoleEntry& console, const std::string& why)
{
    if (mSessions.endAllOf(console, why)) mEvents.changed = true;
}

void Partition::release(const ConsoleEntry& console)
{
    if (mSessions.dropAllOf(console)) mEvents.changed = true;
}

bool Partition::mayAddInput(const ConsoleEntry& console) const
{
    return !mIsInputFull || !mSessions.isOf(PartitionSessions::kTyping, console) ||
           !mSessions.isSetUp(PartitionSessions::kTyping);
}

bool Partition::endSession(std::uint16_t number)
{
    if (!mSessions.has(number)) return false;
    mSessions.end(number, CloseReason::CloseReasonForceClose);
    mEvents.changed = true;
    return true;
}

bool Partition::sendBreak()
{
    mEvents.changed = true; // the line may want to be called to end the break
    return mState == State::Up && mLine.sendBreak();
}

void Partition::change(const PartitionOptions& options)
{
    PartitionOptions changed = options;
    changed.keepsSession = mOptions.keepsSession;
    mOutput.setLimit(std::max(historyLimit(changed), mSessions.unseenBytes(PartitionSessions::kTyping)));
    mOptions = std::move(changed);
    mEvents.changed = true;
}

void Partition::retire(CloseReason reason)
{
    mSessions.endAll(reason);
    mIsRetired = true;
    mEvents.changed = true;
    pStopLine();
}

void Partition::remove()
{
    pNote("the partition has been removed");
    mSessions.deliver();
    retire(CloseReason::CloseReasonQelShutdown);
}

std::optional<PollFd> Partition::watch() const
{
    if ((mState != State::Up && mState != State::ComingUp) || mTurns.isPausing()) return std::nullopt;
    const bool isUp = mState == State::Up;
    const bool wantsOutput = !isUp || pWantsOutput();
    const bool wantsToWrite = pWantsToWrite();
    if (!mSessions.isEmpty() && !wantsOutput && !wantsToWrite) return std::nullopt;
    // Without a session nothing may be read, but a hang-up is noticed: poll(2) always reports it.
    PollFd fd(mLine.descriptor(), PollEvents::Error);
    if (wantsToWrite) fd.mFd.events |= static_cast<short>(PollEvents::Write);
    if (wantsOutput) fd.mFd.events |= static_cast<short>(PollEvents::Read);
    // The peer of a connection that is not read may end it without a hang-up. It has to be made again before somebody
    // types into it.
    if (mOptions.keepsSession && mSessions.isEmpty() && !wantsOutput) fd.mFd.events |= POLLRDHUP;
    return fd;
}

PollDeadline Partition::deadline(TimePoint now) const
{
    const PollDeadline next = pNextStep(now);
    return mOwedNote.empty() ? next : std::min(next, PollDeadline(now + kNoteInterval));
}

PollDeadline Partition::pNextStep(TimePoint now) const
{
    if (mSessions.canDeliver()) return now;
    switch (mState) {
    case State::Down:
        return mStartAt;
    case State::ComingUp:
    case State::Up: {
        const PollDeadline look = pMayHoldRestart() ? PollDeadline(now + kStallInterval) : PollDeadline();
        return std::min({mLine.advanceAt(), mTurns.pauseEnd(), look});
    }
    case State::Ended:
        break;
    }
    if (pMayFinishExit(now)) return now + kExitInterval;
    return mSetUpBy.isExpired(now) ? PollDeadline() : mSetUpBy; // room in a link comes with a wake-up
}

std::uint64_t Partition::service()
{
    const std::uint64_t outputBefore = mOutputBytes;
    const auto progress = [this] { return std::make_tuple(mState, mStarts, mOutputBytes, mInputBytes, mInput.size()); };
    const auto before = progress();
    pTakeTurn();
    mTurns.count(progress() != before, TimeProvider::steady());
    return mOutputBytes - outputBefore;
}

void Partition::pTakeTurn()
{
    if (mState != State::Up && mState != State::ComingUp) return;
    if ((mState == State::ComingUp || mLine.wantsToWrite()) && !pAdvance()) return pFail();
    if (mState != State::Up) return;
    if (mSessions.isEmpty() && !pWantsOutput() && (mLine.hasHungUp() || pPeerHasFinished())) mIsDraining = true;
    pPumpInput();
    mSessions.deliver();
    if (mState != State::Up || !pWantsOutput() || pReadOutput() || !mIsDraining) return;
    if (mState != State::Up) return;
    mOptions.keepsSession ? pLoseLine() : pBeginExit(); // it has hung up and has nothing left
}

void Partition::serviceTime(TimePoint now)
{
    mTurns.passTime(now);
    pPayNote();
    mSessions.deliver();
    if (mState == State::Ended) return pFinishExit(now);
    if (mState == State::Down && mStartAt.isExpired(now)) {
        mStartAt = PollDeadline();
        if (!pStart(now)) pFail();
    } else if ((mState == State::Up || mState == State::ComingUp) && mLine.advanceAt().isExpired(now)) {
        if (!pAdvance()) pFail();
    }
    if (mState == State::Up) pCheckStall(now);
}

/// Whether the console on number 0 does not read, so that the end of a command that is to be started again would not be
/// noticed.
bool Partition::pMayHoldRestart() const
{
    constexpr std::uint16_t kTyping = PartitionSessions::kTyping;
    return mState == State::Up && !mOptions.keepsSession && mOptions.restart != RestartLine::Never &&
           mSessions.isSetUp(kTyping) && !mSessions.hasRoom(kTyping);
}

/// A console that does not read, such as a suspended one, must not keep a service down: after a time the rest of the
/// output is read without it, and it is told how much it has missed.
void Partition::pCheckStall(TimePoint now)
{
    if (!pMayHoldRestart() || !mLine.hasHungUp()) {
        mGiveUpBy = PollDeadline();
        return;
    }
    if (mGiveUpBy.isDisabled()) mGiveUpBy = now + kStallTimeout;
    if (mGiveUpBy.isExpired(now)) pDrain();
}

/// Brings the line up for a console that opens a session.
/// @param mayRestart  an ended command is started again; otherwise the session only gets what is left of its output
/// @return false: the line is down
bool Partition::pBringUp(bool mayRestart)
{
    if (mIsRetired) return false;
    if (mOptions.keepsSession) return true; // it comes up by itself
    if (mState == State::ComingUp || (mState != State::Down && !mayRestart)) return true;
    if (mState == State::Up && mLine.hasHungUp()) pDrain();
    if (mState == State::Ended) pEndCommand(mLine.commandEnd().value_or(kClosedTerminal));
    const bool wasUp = mState == State::Up;
    if (wasUp ? mLine.start() : pStart(TimeProvider::steady())) return true;
    // What had ended on the line could not be started again.
    if (!wasUp || mLine.descriptor() < 0) pTakeDown(CloseReason::CloseReasonReadFailure, {});
    return false;
}

/// @return false: the line has failed, and pFail() or pTakeDown() must follow
bool Partition::pStart(TimePoint now)
{
    mStartAt = PollDeadline();
    mState = State::ComingUp; // so that it is taken down even when it fails
    mUpSince = now;
    return mLine.start() && pAdvance();
}

/// @return false: the line has failed
bool Partition::pAdvance()
{
    const GuardedLine::Progress progress = mLine.advance();
    if (progress == GuardedLine::Progress::Up && mState == State::ComingUp) pOnUp();
    return progress != GuardedLine::Progress::Failed;
}

void Partition::pOnUp()
{
    mState = State::Up;
    mEvents.changed = true;
    mUpSince = TimeProvider::steady();
    ++mStarts;
    mSessions.forgetRefusal(PartitionSessions::kTyping);
    if (!std::exchange(mIsLost, false)) return;
    logLine(LogLevel::Info, "partition ", mId, ": line is back");
    pNote("line is back");
}

/// The line has failed otherwise than by reading.
void Partition::pFail()
{
    if (mOptions.keepsSession) return pLoseLine();
    pTakeDown(CloseReason::CloseReasonReadFailure, {});
}

/// Takes a line that keeps its sessions down until the next attempt.
void Partition::pLoseLine()
{
    const auto now = TimeProvider::steady();
    const bool wasUp = mState == State::Up;
    const bool isFirst = !std::exchange(mIsLost, true);
    std::string reason = pLossReason();
    if (isFirst || reason != mLossReason) { // not each attempt
        std::string text = pLossText(wasUp, reason);
        static_cast<void>(
            runGuarded([&] { logLine(LogLevel::Warn, "partition ", mId, ": ", text); }, "partition ", mId));
        if (isFirst) pNote(std::move(text));
    }
    mLossReason.swap(reason);
    pStopLine();
    mStartAt = now + mPause.next(wasUp ? now - mUpSince : RestartPause::Duration(0));
}

/// Without memory for the reason there is none.
std::string Partition::pLossReason() const noexcept
{
    try {
        const std::string reason = mLine.failure();
        return reason.empty() ? "it has ended" : reason;
    } catch (const std::bad_alloc&) {
        return {};
    }
}

std::string Partition::pLossText(bool wasUp, const std::string& reason) const noexcept
{
    const char* const what = wasUp ? "line lost" : "line is down"; // short enough for a string without memory
    if (reason.empty()) return what;
    try {
        return std::string(what) + ": " + reason + "; connecting again";
    } catch (const std::bad_alloc&) {
        return what;
    }
}

/// The line has ended. Its command ends a moment later, unless it has only closed its terminal.
void Partition::pBeginExit()
{
    const auto now = TimeProvider::steady();
    mState = State::Ended;
    mEvents.changed = true;
    mExitBy = now + kExitTimeout;
    if (mGiveUpBy.isDisabled() && mOptions.restart != RestartLine::Never) mGiveUpBy = now + kStallTimeout;
    mSetUpBy = now + kSetUpTimeout;
    pFinishExit(now);
}

/// Whether the sessions have got what they wait for.
bool Partition::pMayFinishExit(TimePoint now) const
{
    if (!mSessions.isCaughtUp(PartitionSessions::kTyping) && !mGiveUpBy.isExpired(now)) return false;
    return mSessions.areAllSetUp() || mSetUpBy.isExpired(now);
}

/// Takes the line of an ended command down, as soon as it is known how the command ended.
void Partition::pFinishExit(TimePoint now)
{
    if (!pMayFinishExit(now)) return;
    std::optional<CommandEnd> end = mLine.commandEnd();
    if (!end) {
        if (!mExitBy.isExpired(now)) return;
        end = kClosedTerminal;
    }
    pEndCommand(*end);
}

/// Takes the line of a command down and tells the consoles, the log and the history how it ended.
void Partition::pEndCommand(const CommandEnd& end)
{
    const bool isAttended = !mSessions.isEmpty();
    pTakeDown(CloseReason::CloseReasonReadFailure, end);
    const std::string text = describe(end);
    logLine(LogLevel::Info, "partition ", mId, ": ", text, isAttended ? "" : ", with no session open");
    pNote(text);
}

/// Ends the sessions and takes the line of a command down. It is brought up again as the options say.
void Partition::pTakeDown(CloseReason reason, const CommandEnd& end)
{
    mSessions.endAll(reason, end);
    const auto now = TimeProvider::steady();
    const bool cameUp = mState == State::Up || mState == State::Ended;
    pStopLine();
    const bool again =
        mOptions.restart == RestartLine::Always || (mOptions.restart == RestartLine::OnFailure && !isSuccess(end));
    if (again) mStartAt = now + mPause.next(cameUp ? now - mUpSince : RestartPause::Duration(0));
}

void Partition::pStopLine()
{
    mState = State::Down;
    mInput.clear();
    const bool hasRoom = pNoteRoom();
    mIsDraining = false;
    mTurns = FruitlessTurns();
    mStartAt = mExitBy = mSetUpBy = mGiveUpBy = PollDeadline();
    mEvents.changed = true;
    mLine.stop();
    if (hasRoom) mSessions.resumeTyping();
}

void Partition::pPumpInput()
{
    if (mInput.empty() || mState != State::Up) return;
    if (mLine.hasHungUp()) mInput.clear(); // nothing is left that reads it
    while (!mInput.empty()) {
        const std::optional<std::size_t> taken = mLine.write(mInput.data(), mInput.size());
        if (!taken) return mOptions.keepsSession ? pLoseLine() : pTakeDown(CloseReason::CloseReasonWriteFailure, {});
        if (*taken == 0) break;
        mInput.erase(0, *taken);
        mInputBytes += *taken;
    }
    if (pNoteRoom()) mSessions.resumeTyping();
}

/// To be called when the input has become more or less. @return whether there is room for more again
bool Partition::pNoteRoom() noexcept
{
    const bool isFull = mInput.size() >= kInputLimit;
    const bool wasFull = std::exchange(mIsInputFull, isFull);
    if (isFull && !wasFull) ++mEvents.fullInputs;
    if (wasFull && !isFull) --mEvents.fullInputs;
    return wasFull && !isFull;
}

/// Reads one piece of output and passes it on. @return false: there was none
bool Partition::pReadOutput()
{
    // Whatever needs memory comes before the reading: what has been read must not be lost.
    pFitHistory(0);
    pReserveOutput();
    if (mOptions.tap != nullptr) mEvents.tapCalls.reserve(mEvents.tapCalls.size() + 1);
    std::string tapped;
    if (mOptions.tap != nullptr) tapped.reserve(PartitionSessions::kPiece);
    std::array<char, PartitionSessions::kPiece> buffer;
    const SerialLine::ReadResult result = mLine.read(buffer.data(), buffer.size());
    switch (result.state) {
    case SerialLine::LineState::Idle:
        return false;
    case SerialLine::LineState::Ended:
        mOptions.keepsSession ? pLoseLine() : pBeginExit();
        return false;
    case SerialLine::LineState::Data:
        break;
    }
    mOutput.append(buffer.data(), result.length);
    mOutputBytes += result.length;
    if (mOptions.tap != nullptr) {
        tapped.assign(buffer.data(), result.length);
        mEvents.tapCalls.push_back({mOptions.tap, mId, true, std::move(tapped)});
    }
    mSessions.deliver();
    return true;
}

/// Makes room for a piece of output. Without memory for a longer history the one that is there does, if no byte that
/// the session that types has not got would go.
void Partition::pReserveOutput()
{
    try {
        mOutput.reserve(PartitionSessions::kPiece);
    } catch (const std::bad_alloc&) {
        if (mOutput.capacity() < mSessions.unseenBytes(PartitionSessions::kTyping) + PartitionSessions::kPiece) throw;
    }
}

/// Reads what is left of the output of a command that has hung up, before it is started again.
void Partition::pDrain()
{
    for (int piece = 0; piece < kDrainedPieces && mState == State::Up; ++piece) {
        if (!pReadOutput()) return;
    }
}

/// Whether the line has to be called when it takes bytes.
bool Partition::pWantsToWrite() const { return (mState == State::Up && !mInput.empty()) || mLine.wantsToWrite(); }

bool Partition::pWantsOutput() const
{
    constexpr std::uint16_t kTyping = PartitionSessions::kTyping;
    if (mSessions.isSetUp(kTyping)) return mSessions.hasRoom(kTyping);
    return mIsDraining || mOptions.unattended == WhenUnattended::Keep || mSessions.isAnySetUp();
}

/// Whether the peer of a connection will send nothing more, although the connection has not hung up.
bool Partition::pPeerHasFinished() const noexcept
{
    if (!mOptions.keepsSession) return false;
    pollfd fd{mLine.descriptor(), POLLRDHUP, 0};
    return ::poll(&fd, 1, 0) > 0 && (fd.revents & POLLRDHUP) != 0;
}

/// Makes the history as large as the options say; larger while that is needed for what the session that types has not
/// got, with more bytes to come.
void Partition::pFitHistory(std::size_t more)
{
    const std::size_t limit = historyLimit(mOptions);
    const std::size_t unseen = mSessions.unseenBytes(PartitionSessions::kTyping);
    if (unseen == 0) return mOutput.setLimit(limit);
    mOutput.setLimit(std::max(limit, std::min(unseen + more, std::max(unseen, limit + kMostExtraHistory))));
}

/// Puts a line of the program's own into the output, and tells the tap. Without memory that is done later.
void Partition::pNote(std::string text) noexcept
{
    pPayNote();
    if (!mOwedNote.empty() || !pTryNote(text)) mOwedNote = std::move(text);
}

/// @return false: there is no memory, and nothing has been done
bool Partition::pTryNote(const std::string& text) noexcept
{
    try {
        const std::string line = "\r\n[qel: " + text + "]\r\n";
        pFitHistory(line.size());
        mOutput.reserve(line.size());
        if (mOptions.tap != nullptr) mEvents.tapCalls.push_back({mOptions.tap, mId, false, text});
        mOutput.append(line.data(), line.size());
        return true;
    } catch (const std::bad_alloc&) {
        return false;
    }
}

void Partition::pPayNote() noexcept
{
    if (!mOwedNote.empty() && pTryNote(mOwedNote)) mOwedNote.clear();
}

} // namespace qel::protocol
