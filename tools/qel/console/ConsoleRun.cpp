#include "console/ConsoleRun.hpp"

#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>

#include "base/Failures.hpp"
#include "base/Logging.hpp"
#include "base/RefusalReason.hpp"
#include "base/SignalWatch.hpp"
#include "console/ConsoleTexts.hpp"

#include <algorithm>
#include <csignal>
#include <initializer_list>
#include <random>
#include <sys/ioctl.h>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

using std::chrono::milliseconds;

/// How long a person waits for the server when leaving: a tenth of a second, less what the rest of leaving takes.
constexpr milliseconds kFarewell{75};

/// How long output from before may take to come, and how long a pause in it may be.
constexpr milliseconds kReplayPatience{1000};
constexpr milliseconds kReplayPause{100};

/// A script reads no keyboard, and control-C ends it.
constexpr int kNoTerminal = -1;

constexpr milliseconds kFirstWait{1000}; // before connecting again
constexpr milliseconds kLongestWait{30000};

/// The connection numbers of those who watch.
constexpr std::uint16_t kFirstWatcher = 1;
constexpr std::uint16_t kLastWatcher = 15;

/// Termination, suspension, continuation and a new size of the window.
constexpr std::initializer_list<int> kSignals{SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGTSTP, SIGCONT, SIGWINCH};

void addHandlers(Console& console, ConsoleScreen& screen)
{
    console.onNotice<QelMessageDaxBroadcastOutboundAsync>(
        [&screen](const QelMessageDaxBroadcastOutboundAsync& broadcast) { screen.showBroadcast(broadcast); });
    console.onOtherNotice([](const QelMessage& notice) { logLine(LogLevel::Warn, "ignored ", notice.getLogID()); });
}

/// Ends this process by the signal that SignalWatch held back, so that its parent sees the signal as the reason.
[[noreturn]] void endBy(int signal)
{
    static_cast<void>(::raise(signal));
    throw CommandFailure(ExitStatus::Failed, filled(texts::kSignalIgnored, {std::to_string(signal)}));
}

/// True when the next attempt to connect may succeed.
bool isTemporary(const Error& error, bool isPlain)
{
    if (const auto* refusal = dynamic_cast<const StatusError*>(&error)) {
        // The server may not have noticed yet that the connection before this one has ended.
        return refusal->getStatus() == QelMessageStatusTooManyConnections ||
               refusal->getStatus() == QelMessageStatusDaxAlreadyConnected ||
               refusal->getStatus() == QelMessageStatusConnectionNotAvailable;
    }
    if (dynamic_cast<const TurnedAway*>(&error) != nullptr) return !isPlain;
    return dynamic_cast<const NameNotResolved*>(&error) != nullptr ||
           dynamic_cast<const CannotConnect*>(&error) != nullptr ||
           dynamic_cast<const ClosedByPeer*>(&error) != nullptr ||
           dynamic_cast<const DeadlinePassed*>(&error) != nullptr;
}

bool isLoss(SessionEnd end) { return end == SessionEnd::ShutDown || end == SessionEnd::ConnectionClosed; }

std::string randomMark()
{
    std::random_device random;
    return std::to_string(random()) + "-" + std::to_string(::getpid());
}

Recording::Size windowSize(int descriptor)
{
    winsize window{};
    if (::ioctl(descriptor, TIOCGWINSZ, &window) != 0 || window.ws_row == 0 || window.ws_col == 0) return {};
    return {window.ws_col, window.ws_row};
}

} // namespace

ConsoleRun::ConsoleRun(const ConsoleRunOptions& options)
    : mOptions(options), mMode(options.steps.empty() ? STDIN_FILENO : kNoTerminal), mMessages(STDERR_FILENO),
      mScreen(STDOUT_FILENO, mMessages, ::isatty(STDERR_FILENO) == 1, mMode), mSerial(options.serial)
{
    if (!options.log.empty()) mLog.emplace(options.log, LogFile::Content::Raw);
    if (!options.logStrip.empty()) mStrippedLog.emplace(options.logStrip, LogFile::Content::Stripped, options.stamps);
    if (!options.record.empty()) {
        const std::string title =
            filled(texts::kRecordingTitle, {std::to_string(options.partition), options.connect.server});
        mRecording.emplace(options.record, title, windowSize(STDOUT_FILENO));
    }
    if (!options.steps.empty()) mScript.emplace(options.steps, options.connect.timeout(), randomMark());
    mScreen.stamps() = TimeStamps(options.stamps);
}

ExitStatus ConsoleRun::run()
{
    const TimePoint end = TimeProvider::steady() + mOptions.connect.timeout();
    try {
        pUse(ConsoleConnection(mOptions.connect, end, mKnown));
        pOpen(end);
        const SessionTools tools = pAttachTools();
        if (pTypesTexts()) pAwaitReplay();
        const ConsoleLoop::Outcome outcome = pRunLoop(tools);
        const SessionEnd sessionEnd = mSession ? mSession->getEnd() : SessionEnd::ConnectionClosed;
        const std::string endText = mSession ? mSession->describeEnd() : std::string();
        if (outcome.reason == ConsoleLoop::ExitReason::Signal) {
            pLeave(); // without further requests; the hypervisor closes the sessions
        } else {
            pClose();
        }
        return pConclude(outcome, sessionEnd, endText);
    } catch (const StatusError& refusal) {
        pLeave();
        throw CommandFailure(ExitStatus::Refused, pRefusalText(refusal));
    } catch (const DeadlinePassed& error) {
        pLeave();
        if (!mConnection) throw;
        throw CommandFailure(ExitStatus::DeadlinePassed,
                             filled(texts::kTimedOut, {numberText(mOptions.connect.timeoutSeconds), error.what()}));
    } catch (...) {
        pLeave();
        throw;
    }
}

std::string ConsoleRun::pRefusalText(const StatusError& refusal) const
{
    return refusalText(refusal.getResponse(), filled(texts::kPartition, {std::to_string(mOptions.partition)}));
}

/// Lets the files and the script see what comes.
SessionTools ConsoleRun::pAttachTools()
{
    SessionTools tools;
    if (mLog) tools.logs.push_back(&*mLog);
    if (mStrippedLog) tools.logs.push_back(&*mStrippedLog);
    if (mRecording) tools.recording = &*mRecording;
    if (mScript) tools.script = &*mScript;
    for (LogFile* log : tools.logs)
        mScreen.addTap(*log);
    if (mRecording) mScreen.addTap(*mRecording);
    if (mScript) mScreen.addTap(*mScript);
    const bool showsCommand = std::any_of(mOptions.steps.begin(), mOptions.steps.end(),
                                          [](const ScriptStep& step) { return step.kind == ScriptStep::Kind::Exec; });
    if (showsCommand) mScreen.showInstead([this] { return mScript->takeCommandOutput(); });
    return tools;
}

void ConsoleRun::pUse(ConsoleConnection&& connection)
{
    mConnection.emplace(std::move(connection));
    addHandlers(mConnection->console(), mScreen);
}

void ConsoleRun::pOpen(TimePoint end)
{
    if (mOptions.watch && mSerial.connection == 0 && !mSerial.force) {
        mSession.emplace(pOpenFirstFree(end));
    } else {
        mSession.emplace(mConnection->console().openSerial(mOptions.partition, mSerial, timeLeft(end)));
    }
}

SerialSession ConsoleRun::pOpenFirstFree(TimePoint end)
{
    SerialOptions options = mSerial;
    for (options.connection = kFirstWatcher;; ++options.connection) {
        try {
            return mConnection->console().openSerial(mOptions.partition, options, timeLeft(end));
        } catch (const StatusError& refusal) {
            const std::string partition = std::to_string(mOptions.partition);
            if (refusal.getStatus() == QelMessageStatusInvalidConnectionNumber)
                throw CommandFailure(ExitStatus::Refused, filled(texts::kNoWatching, {partition}));
            if (refusal.getStatus() != QelMessageStatusConnectionNotAvailable) throw;
            if (options.connection == kLastWatcher)
                throw CommandFailure(ExitStatus::Refused, filled(texts::kWatchersFull, {partition}));
        }
    }
}

bool ConsoleRun::pTypesTexts() const
{
    return std::any_of(mOptions.steps.begin(), mOptions.steps.end(),
                       [](const ScriptStep& step) { return step.kind == ScriptStep::Kind::Send; });
}

/// Takes the output that the server has kept from before, so that a script does not take it for the answer to what it
/// types. Nothing marks its end, so the server is asked for something else, and then has a moment, until no output has
/// come meanwhile. A partition that never pauses ends that in time.
void ConsoleRun::pAwaitReplay()
{
    const TimePoint end = TimeProvider::steady() + kReplayPatience;
    bool hasReceived = false;
    do {
        Console& console = mConnection->console();
        try {
            console.request(QelMessageGetQelTodReq());
        } catch (const StatusError&) {  // an answer as well
        } catch (const LimitReached&) { // there is room when it has been shown
        }
        hasReceived = mScreen.showOutput(*mSession) > 0;
        if (!hasReceived && PollSet(console.getPollFd(PollEvents::Read)).wait(kReplayPause).anyReady()) {
            console.process();
            mScreen.showOutput(*mSession);
            hasReceived = true;
        }
        mScreen.output().writeSome();
    } while (hasReceived && mSession->getEnd() == SessionEnd::None && TimeProvider::steady() < end);
}

ConsoleLoop::Outcome ConsoleRun::pRunLoop(const SessionTools& tools)
{
    // Signals are watched only while the terminal may have to be restored. At all other times they end this process at
    // once.
    SignalWatch signals(kSignals);
    ConsoleLoop loop(mScreen, STDIN_FILENO, mMode, signals, mOptions.input, tools);
    ConsoleLoop::Outcome outcome;
    while (pRunOnce(loop, outcome))
        continue;
    if (mConnection) mConnection->stream().setAttendant(nullptr); // the loop, which ends here
    return outcome;
}

/// @return true: there is another session to run
bool ConsoleRun::pRunOnce(ConsoleLoop& loop, ConsoleLoop::Outcome& outcome)
{
    std::string reason;
    try {
        outcome = loop.run(mConnection->console(), *mSession, &mConnection->stream());
        if (outcome.reason == ConsoleLoop::ExitReason::Force) {
            pOpenAgain(loop);
            outcome = loop.outcome();
            return outcome.reason == ConsoleLoop::ExitReason::Force;
        }
        pTellThrownAway(outcome);
        const bool isLost = outcome.reason == ConsoleLoop::ExitReason::Ended && isLoss(mSession->getEnd());
        if (!mOptions.reconnect || !isLost) return false;
        reason = mSession->describeEnd();
    } catch (const Error& error) {
        outcome = loop.outcome();
        const bool isWanted = outcome.reason == ConsoleLoop::ExitReason::Left ||
                              outcome.reason == ConsoleLoop::ExitReason::Signal; // and ended a wait
        if (isWanted) return false;
        pTellThrownAway(outcome);
        if (!mOptions.reconnect || !isTemporary(error, mOptions.connect.transport.plain)) throw;
        reason = error.what();
    }
    const bool isBack = pReconnect(loop, reason);
    outcome = loop.outcome();
    return isBack;
}

/// Input that was held when the session ended. Who leaves is told in the line about that.
void ConsoleRun::pTellThrownAway(const ConsoleLoop::Outcome& outcome)
{
    const std::string text = pThrownAwayText(outcome);
    if (outcome.reason == ConsoleLoop::ExitReason::Ended && !text.empty()) mScreen.say(text);
}

/// Opens the session to type, by force, on the same connection.
void ConsoleRun::pOpenAgain(ConsoleLoop& loop)
{
    mConnection->stream().setAttendant(&loop.attendant());
    mSession->close();
    const SerialOptions before = mSerial;
    mSerial.connection = 0;
    mSerial.force = true;
    const TimePoint end = TimeProvider::steady() + mOptions.connect.timeout();
    try {
        pOpen(end);
    } catch (const StatusError& refusal) { // by the rules of the server
        mScreen.say(pRefusalText(refusal));
        mSerial = before;
        pOpen(end);
    }
}

/// @return false: the user left, or a signal came
bool ConsoleRun::pReconnect(ConsoleLoop& loop, const std::string& reason)
{
    const TimePoint lostAt = TimeProvider::steady();
    mSession.reset();
    mConnection.reset();
    mScreen.say(filled(texts::kLost, {reason}));
    pMarkGap(reason);
    milliseconds delay = kFirstWait;
    while (loop.wait(delay).reason == ConsoleLoop::ExitReason::None) {
        if (pTryToReconnect(loop, delay)) {
            const auto gap = std::chrono::duration_cast<std::chrono::seconds>(TimeProvider::steady() - lostAt);
            const std::string text = filled(texts::kBackAgain, {std::to_string(gap.count())});
            mScreen.say(text);
            pMarkGap(text);
            return true;
        }
        if (loop.outcome().reason != ConsoleLoop::ExitReason::None) return false;
    }
    return false;
}

bool ConsoleRun::pTryToReconnect(ConsoleLoop& loop, milliseconds& delay)
{
    const TimePoint end = TimeProvider::steady() + mOptions.connect.timeout();
    try {
        pUse(ConsoleConnection(mOptions.connect, end, mKnown, loop.attendant()));
        pOpen(end);
        return true;
    } catch (const Error& error) {
        mConnection.reset();
        const bool isWanted = loop.outcome().reason == ConsoleLoop::ExitReason::None;
        if (isWanted && !isTemporary(error, mOptions.connect.transport.plain)) throw;
        delay = std::min(2 * delay, kLongestWait);
        const double seconds = std::chrono::duration<double>(delay).count();
        if (isWanted) mScreen.say(filled(texts::kNextAttempt, {error.what(), numberText(seconds)}));
        return false;
    }
}

void ConsoleRun::pMarkGap(const std::string& text)
{
    for (SessionTap* const tap : mScreen.taps())
        tap->onGap(text);
}

/// Closes the serial session and the hypervisor session, as far as they are open, and the connection. A person at a
/// terminal does not wait for a server that does not answer.
void ConsoleRun::pClose()
{
    if (!mConnection || !mSession) return pLeave();
    const bool isPerson = mMode.isTerminal();
    const milliseconds requestTimeout = mOptions.connect.timeout();
    const TimePoint end = TimeProvider::steady() + (isPerson ? kFarewell : requestTimeout);
    if (isPerson) mConnection->stream().cutAt(end);
    try {
        mSession->close(timeLeft(end));
        mScreen.showOutput(*mSession);
        if (!isLoss(mSession->getEnd())) mConnection->console().closeSession(isPerson ? timeLeft(end) : requestTimeout);
    } catch (const std::exception& error) {
        if (!isPerson) throw;
        logLine(LogLevel::Debug, "while leaving: ", explain(error));
    }
    mConnection->stream().throwAwayUnsent();
    mConnection->console().leave();
}

void ConsoleRun::pLeave() noexcept
{
    if (!mConnection) return;
    mConnection->stream().cutAt(TimeProvider::steady() + kFarewell);
    mConnection->stream().setAttendant(nullptr);
    mConnection->stream().throwAwayUnsent();
    mConnection->console().leave();
}

ExitStatus ConsoleRun::pConclude(const ConsoleLoop::Outcome& outcome, SessionEnd end, const std::string& endText)
{
    switch (outcome.reason) {
    case ConsoleLoop::ExitReason::Signal:
        endBy(outcome.signal);
    case ConsoleLoop::ExitReason::Left:
        mScreen.output().writeSome();
        mScreen.output().drop(); // nobody waits for the screen
        if (mMode.isTerminal()) mScreen.say(pLeftText(outcome));
        return ExitStatus::Done;
    case ConsoleLoop::ExitReason::Ended:
        if (mScript && !mScript->isDone()) {
            throw CommandFailure(ExitStatus::CommandFailed,
                                 filled(texts::kStepUnfinished, {mScript->waitsFor(), endText}));
        }
        mScreen.say(endText);
        return pStatusOf(end);
    default:
        mScreen.output().flush();
        if (commandStatus().value_or(0) != 0)
            mScreen.say(filled(texts::kCommandStatus, {std::to_string(*commandStatus())}));
        return ExitStatus::Done;
    }
}

/// The exit status when the session ended this way.
ExitStatus ConsoleRun::pStatusOf(SessionEnd end) const
{
    switch (end) {
    case SessionEnd::None:
    case SessionEnd::Closed:
        return ExitStatus::Done;
    case SessionEnd::CommandEnded: {
        const CommandEnd command = mSession->getCommandEnd();
        const bool hasFailed = command.kind == CommandEnd::Kind::Killed ||
                               (command.kind == CommandEnd::Kind::Exited && command.number != 0);
        return hasFailed ? ExitStatus::CommandFailed : ExitStatus::Done;
    }
    case SessionEnd::Taken:
        return ExitStatus::Refused;
    default:
        return ExitStatus::ClosedByPeer;
    }
}

std::string ConsoleRun::pLeftText(const ConsoleLoop::Outcome& outcome) const
{
    const std::string text = filled(texts::kLeft, {std::to_string(mOptions.partition)});
    const std::string lost = pThrownAwayText(outcome);
    return lost.empty() ? text : text + "; " + lost;
}

/// Empty: nothing was thrown away.
std::string ConsoleRun::pThrownAwayText(const ConsoleLoop::Outcome& outcome) const
{
    if (outcome.thrownAway == 0) return {};
    return filled(texts::kThrownAway, {std::to_string(outcome.thrownAway)});
}

} // namespace qel::tool
