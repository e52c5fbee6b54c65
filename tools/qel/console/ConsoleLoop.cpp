#include "console/ConsoleLoop.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "console/ConsoleTexts.hpp"

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <unistd.h>
#include <utility>

namespace qel::tool {

namespace {

constexpr char kEndOfFile = 'D' & 0x1F; // control-D

/// For messages that poll(2) has announced: it spares the console the question whether there are any.
constexpr std::chrono::milliseconds kAnnounced(1);

/// A SignalWatch blocks its signals, so it receives ignored ones too. A signal that was ignored when this process
/// started, as nohup(1) does it, must not end the process.
bool isIgnored(int signal)
{
    struct sigaction action = {};
    return ::sigaction(signal, nullptr, &action) == 0 && action.sa_handler == SIG_IGN;
}

/// Stops this process as SIGTSTP would without the SignalWatch; returns when the process continues. The system does not
/// stop a process in an orphaned process group.
void stop()
{
    sigset_t signal;
    sigset_t before;
    ::sigemptyset(&signal);
    ::sigaddset(&signal, SIGTSTP);
    static_cast<void>(::raise(SIGTSTP));
    ::pthread_sigmask(SIG_UNBLOCK, &signal, &before);
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

/// Lets a stream attend to the keyboard for the time of a call.
class Attending {
public:
    Attending(AttentiveStream* stream, StreamAttendant* attendant) : mStream(stream)
    {
        if (mStream != nullptr) mStream->setAttendant(attendant);
    }
    ~Attending()
    {
        if (mStream != nullptr) mStream->setAttendant(nullptr);
    }
    Attending(const Attending&) = delete;
    Attending& operator=(const Attending&) = delete;

private:
    AttentiveStream* mStream;
};

} // namespace

ConsoleLoop::ConsoleLoop(ConsoleScreen& screen, int input, TerminalMode& mode, SignalWatch& signals,
                         const InputOptions& options, SessionTools tools)
    : mScreen(screen), mInput(input), mMode(mode), mSignals(signals), mInputOptions(options), mEscape(options.escape),
      mKeepAlive(options.keepAlive), mTools(std::move(tools))
{}

ConsoleLoop::~ConsoleLoop() { mMode.restore(); }

ConsoleLoop::Outcome ConsoleLoop::run(Console& console, SerialSession& session, AttentiveStream* stream)
{
    pBegin(console, session);
    const Attending attending(mMode.isTerminal() ? stream : nullptr, this);
    pShowReceived();
    if (mSession->getEnd() != SessionEnd::None) pExit(ExitReason::Ended); // in an earlier call; nothing more comes
    while (!pIsDone())
        pPollOnce();
    mConsole = nullptr;
    mSession = nullptr;
    mPrompt.reset();
    mEscape.startLine(); // what was typed of a line has gone with the session
    if (mFailure && mOutcome.reason == ExitReason::Ended) std::rethrow_exception(mFailure);
    return mOutcome;
}

ConsoleLoop::Outcome ConsoleLoop::wait(std::chrono::milliseconds duration)
{
    mOutcome = Outcome();
    mFailure = nullptr;
    const PollDeadline end(TimeProvider::steady() + duration);
    while (pIsRunning()) {
        const auto now = TimeProvider::steady();
        if (end.isExpired(now)) break;
        PollSet set = attended();
        if (!mScreen.output().isEmpty()) set += mScreen.output().getPollFd();
        const PollResult ready = set.wait(end.getTimeout(now));
        if (ready.contains(mScreen.output().getPollFd())) mScreen.output().writeSome();
        if (ready.anyReady()) attend(ready);
    }
    if (mFailure) std::rethrow_exception(mFailure);
    return mOutcome;
}

void ConsoleLoop::pBegin(Console& console, SerialSession& session)
{
    mConsole = &console;
    mSession = &session;
    mOutcome = Outcome();
    mFailure = nullptr;
    mSendBroken = false;
    mReceived = 0;
    mLastOutput.reset();
    mKeepAlive.watch(console, TimeProvider::steady());
    mMode.enterRaw();
    if (mMode.isTerminal()) mScreen.say(pGreeting());
    pFollowScript();
}

std::string ConsoleLoop::pGreeting() const
{
    const std::string peer =
        mConsole->isProtected() ? filled(texts::kProtected, {quoted(mConsole->peer().commonName)}) : texts::kPlain;
    const std::string escapes = mInputOptions.escape ? filled(texts::kEscapes, {characterName(*mInputOptions.escape)})
                                                     : std::string(texts::kNoEscape);
    std::string partition = std::to_string(mSession->getPartition());
    if (!mInputOptions.partitionName.empty())
        partition = filled(texts::kNamed, {partition, printable(mInputOptions.partitionName)});
    const char* const text = mSession->getConnection() == 0 ? texts::kConnected : texts::kWatching;
    return filled(text, {partition, mConsole->getServer(), peer, escapes});
}

bool ConsoleLoop::pIsDone() const
{
    switch (mOutcome.reason) {
    case ExitReason::None:
        return false;
    case ExitReason::Left:
    case ExitReason::Force:
    case ExitReason::Signal:
        return true;
    default:
        return mScreen.output().isEmpty();
    }
}

/// A terminal is read at all times, also while the last output is written. Other input waits where it is until it can
/// be sent, also while there is no session.
bool ConsoleLoop::pWantsInput() const
{
    if (!mInputOpen || pHasLeft()) return false;
    return mMode.isTerminal() || (pIsRunning() && mSession != nullptr && mHeld.isEmpty() && mTools.script == nullptr);
}

/// Output waits while the user answers a prompt, so that it does not run into the answer.
bool ConsoleLoop::pWantsMessages() const { return pIsRunning() && mScreen.output().hasRoom() && !mPrompt; }

bool ConsoleLoop::pWantsToSend() const { return pIsRunning() && !mSendBroken && !mHeld.isEmpty(); }

/// When pCheckEndTimer() is due; disabled while data is in flight.
PollDeadline ConsoleLoop::pEndDeadline() const
{
    const bool isWaiting = pIsRunning() && !mInputOpen && !mSendBroken && mHeld.isEmpty() && mScreen.output().isEmpty();
    if (!isWaiting) return PollDeadline();
    if (mInputOptions.linger) return mQuietSince + *mInputOptions.linger;
    return mInputOptions.sendsEnd ? PollDeadline(mQuietSince + kEndRepeat) : PollDeadline();
}

PollDeadline ConsoleLoop::pDeadline() const
{
    PollDeadline deadline = pEndDeadline();
    if (pWantsToSend()) deadline = std::min(deadline, mHeld.deadline());
    if (pWantsMessages()) deadline = std::min(deadline, mKeepAlive.deadline());
    if (pIsRunning() && mTools.script != nullptr) deadline = std::min(deadline, mTools.script->deadline());
    return deadline;
}

void ConsoleLoop::pPollOnce()
{
    pFeedFile();
    const PollFd input(mInput, PollEvents::Read);
    const PollFd messages = mConsole->getPollFd(PollEvents::Read);
    const PollFd sending = mConsole->getPollFd(PollEvents::Write);
    const PollFd output = mScreen.output().getPollFd();

    // Poll only for events that are handled now. An event that is left unhandled would make this a busy loop.
    PollSet set(mSignals.getPollFd());
    if (pWantsInput()) set += input;
    if (pWantsMessages()) set += messages;
    if (pWantsToSend()) set += sending;
    if (!mScreen.output().isEmpty()) set += output;
    // TLS may hold received bytes while the socket has none.
    const bool isPending = pWantsMessages() && mConsole->hasPending();
    const auto timeout = pDeadline().getTimeout(TimeProvider::steady());
    mMayBeTaken = false;
    const PollResult ready = isPending ? set.poll() : set.wait(timeout);

    if (ready.contains(mSignals.getPollFd())) pHandleSignal();
    if (ready.contains(output)) pWriteOutput();
    if (pWantsMessages() && (isPending || ready.contains(messages))) pReceive(ready.contains(messages));
    if (pWantsToSend() && ready.contains(sending)) pSend();
    if (pWantsInput() && ready.contains(input)) {
        pReadInput();
        // A key goes out now, and not after all the others have been asked again.
        if (pWantsToSend() && PollSet(sending).poll().contains(sending)) pSend();
    }
    if (!ready.anyReady() && !isPending) pCheckEndTimer();
    pCheckHeld();
    pCheckSilence();
    pFollowScript();
}

PollSet ConsoleLoop::attended() const
{
    PollSet set(mSignals.getPollFd());
    if (pWantsInput()) set += PollFd(mInput, PollEvents::Read);
    return set;
}

bool ConsoleLoop::attend(const PollResult& ready) noexcept
{
    mIsAttending = true;
    try {
        if (ready.contains(mSignals.getPollFd())) pHandleSignal();
        if (pWantsInput() && ready.contains(PollFd(mInput, PollEvents::Read))) pReadInput();
    } catch (...) {
        mFailure = std::current_exception();
        pExit(ExitReason::Ended);
    }
    mIsAttending = false;
    return pIsRunning();
}

void ConsoleLoop::pHandleSignal()
{
    const int signal = mSignals.take();
    if (signal == 0 || isIgnored(signal)) return;
    if (signal == SIGTSTP) return pSuspend();
    if (signal == SIGCONT) {
        mKeepAlive.postpone(TimeProvider::steady());
        return mMode.enterRaw();
    }
    if (signal == SIGWINCH) return pNoteResize();
    mOutcome.signal = signal;
    pExit(ExitReason::Signal);
}

void ConsoleLoop::pSuspend()
{
    mMode.restore();
    mMayBeTaken = true; // by a shell
    stop();
    mMode.enterRaw();
    mKeepAlive.postpone(TimeProvider::steady());
}

void ConsoleLoop::pWriteOutput()
{
    mQuietSince = TimeProvider::steady();
    mScreen.output().writeSome();
}

/// @param isAnnounced  the connection is readable
void ConsoleLoop::pReceive(bool isAnnounced)
{
    mMayBeTaken = true; // while a stream waits (attend())
    try {
        if (mConsole->process(isAnnounced ? kAnnounced : std::chrono::milliseconds::zero()))
            pReport(mKeepAlive.noteHeard(TimeProvider::steady()));
    } catch (...) {
        // When the user leaves while a message is received, the connection breaks.
        if (pIsRunning() && mSession->getEnd() == SessionEnd::None) mFailure = std::current_exception();
        pExit(ExitReason::Ended);
    }
    pShowReceived();
    if (mSession->getEnd() != SessionEnd::None) pExit(ExitReason::Ended);
    // The echo of a key is written now; with more to come, all is written together.
    if (!mScreen.output().isEmpty() && !mConsole->hasPending()) pWriteOutput();
}

void ConsoleLoop::pShowReceived()
{
    const std::size_t count = mScreen.showOutput(*mSession);
    if (count == 0) return;
    mReceived += count;
    mLastOutput = TimeProvider::steady();
    pReportFailures();
}

/// Called when the connection is writable: on Linux that means a third of the send buffer is free, which is more than
/// the longest message. The send therefore does not block; if it does, the session's timeout limits it.
void ConsoleLoop::pSend()
{
    mMayBeTaken = true; // as in pReceive()
    try {
        const auto now = TimeProvider::steady();
        mQuietSince = now;
        mSession->writeSome(mHeld.input());
        const std::size_t dropped = mHeld.dropped();
        if (mHeld.noteSent(now))
            mScreen.say(dropped == 0 ? texts::kSent : filled(texts::kSentSome, {std::to_string(dropped)}));
    } catch (const Error& error) {
        if (!pIsRunning()) return; // the user left meanwhile
        // A hypervisor that closes the connection may have sent the reason. Without TLS it can still be read.
        mHeld.clear();
        if (!mMode.isTerminal()) mInputOpen = false;
        mSendBroken = true;
        if (dynamic_cast<const DeadlinePassed*>(&error) == nullptr && !mConsole->isProtected()) return;
        mFailure = std::current_exception();
        pExit(ExitReason::Ended);
    }
}

void ConsoleLoop::pReadInput()
{
    if (mMayBeTaken && !PollSet(PollFd(mInput, PollEvents::Read)).poll().anyReady()) return;
    mMayBeTaken = true;
    std::array<char, SerialSession::kMaxData> buffer;
    const ssize_t count = ::read(mInput, buffer.data(), buffer.size());
    const int error = errno;
    if (count > 0) return pTakeTyped(buffer.data(), static_cast<std::size_t>(count));
    if (count == 0) return pEndInput();
    if (error == EIO && mMode.isTerminal()) return pEndInput(); // it hung up
    if (error != EAGAIN && error != EINTR) throw PosixError(error, texts::kCannotReadInput);
}

void ConsoleLoop::pTakeTyped(const char* data, std::size_t length)
{
    constexpr char kInterrupt = 'C' & 0x1F;
    std::string typed(data, length);
    if (!mMode.isTerminal()) return pHold(typed);
    while (!typed.empty() && !pHasLeft()) {
        if (mPrompt) {
            pAnswerPrompt(typed);
            continue;
        }
        if (mFile && typed.find(kInterrupt) != std::string::npos) {
            return pStopFile();
        }
        std::string forPartition;
        const EscapeFilter::Command command = mEscape.take(typed, forPartition);
        pHold(forPartition);
        pExecute(command);
    }
}

void ConsoleLoop::pHold(const std::string& typed)
{
    if (typed.empty() || !pIsRunning() || mSendBroken) return;
    if (mIsReadOnly || mSession == nullptr) return mScreen.echo("\a");
    const bool wasDropping = mHeld.dropped() > 0;
    if (mHeld.add(typed, TimeProvider::steady()) == 0 || wasDropping) return;
    mScreen.sayLoudly(texts::kDropped + pLeaveHint(texts::kHeldLeave));
}

void ConsoleLoop::pEndInput()
{
    if (mMode.isTerminal()) return pExit(ExitReason::Left); // in raw mode this means that the terminal hung up
    mInputOpen = false;
    mQuietSince = TimeProvider::steady();
    if (mInputOptions.sendsEnd) pHold({kEndOfFile});
}

void ConsoleLoop::pCheckEndTimer()
{
    if (!pEndDeadline().isExpired(TimeProvider::steady())) return;
    if (mInputOptions.linger) return pExit(ExitReason::Lingered);
    pHold({kEndOfFile});
}

/// Types what the script says, and ends when it is done or late.
void ConsoleLoop::pFollowScript()
{
    SessionScript* const script = mTools.script;
    if (script == nullptr || !pIsRunning()) return;
    const auto now = TimeProvider::steady();
    const std::string input = script->takeInput(now);
    if (!input.empty()) mHeld.add(input, now);
    if (!script->isDone()) {
        if (!script->deadline().isExpired(now)) return;
        const auto seconds = std::chrono::duration<double>(script->timeout()).count();
        mFailure = std::make_exception_ptr(CommandFailure(
            ExitStatus::DeadlinePassed, filled(texts::kStepLate, {numberText(seconds), script->waitsFor()})));
        return pExit(ExitReason::Ended);
    }
    if (!mHeld.isEmpty()) return;
    if (!mInputOptions.linger) return pExit(ExitReason::Lingered);
    if (mInputOpen) mQuietSince = now;
    mInputOpen = false; // the linger time runs
}

void ConsoleLoop::pCheckSilence()
{
    if (mInputOptions.keepAlive == std::chrono::milliseconds::zero()) return;
    const auto now = TimeProvider::steady();
    if (!pWantsMessages()) return mKeepAlive.postpone(now);
    pReport(mKeepAlive.check(now));
}

void ConsoleLoop::pCheckHeld()
{
    if (!mMode.isTerminal() || !pWantsToSend() || !mHeld.isLate(TimeProvider::steady())) return;
    mScreen.say(filled(texts::kHeld, {std::to_string(mHeld.size())}) + pLeaveHint(texts::kHeldLeave));
}

void ConsoleLoop::pReport(KeepAlive::Event event)
{
    if (event == KeepAlive::Event::None) return;
    if (event == KeepAlive::Event::Back) return mScreen.say(texts::kBack);
    const auto seconds = std::chrono::duration<double>(mInputOptions.keepAlive).count();
    const char* const text = mHeld.isEmpty() ? texts::kSilent : texts::kSilentHeld;
    mScreen.say(filled(text, {numberText(seconds)}) + pLeaveHint(texts::kSilentChoice));
}

/// What a person at a terminal can do about it; empty for others.
std::string ConsoleLoop::pLeaveHint(const char* text) const
{
    if (!mMode.isTerminal() || !mInputOptions.escape) return {};
    return filled(text, {characterName(*mInputOptions.escape)});
}

/// A later reason replaces an earlier one only when it waits for less.
void ConsoleLoop::pExit(ExitReason reason)
{
    const bool isLater = reason == ExitReason::Signal || (reason == ExitReason::Left && !pHasLeft());
    if (pIsRunning() || isLater) mOutcome.reason = reason;
    if (mFile) pStopFile();
    mOutcome.thrownAway += mHeld.size() + mHeld.dropped();
    mHeld.clear();
}

} // namespace qel::tool
