#include "console/ConsoleLoop.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>

#include <array>
#include <cerrno>
#include <csignal>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr char kEndOfFile = 'D' & 0x1F; // control-D

/// Raw mode from construction to destruction.
class RawMode {
public:
    explicit RawMode(TerminalMode& mode) : mMode(mode) { mMode.enterRaw(); }
    ~RawMode() { mMode.restore(); }
    RawMode(const RawMode&) = delete;
    RawMode& operator=(const RawMode&) = delete;

private:
    TerminalMode& mMode;
};

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

} // namespace

ConsoleLoop::ConsoleLoop(Console& console, SerialSession& session, ConsoleScreen& screen, int input, TerminalMode& mode,
                         SignalWatch& signals, const InputOptions& options)
    : mConsole(console), mSession(session), mScreen(screen), mInput(input), mMode(mode), mSignals(signals),
      mInputOptions(options), mEscape(options.escape)
{}

ConsoleLoop::Outcome ConsoleLoop::run()
{
    const RawMode raw(mMode);
    if (mMode.isTerminal() && mInputOptions.escape) {
        mScreen.say("connected; " + characterName(*mInputOptions.escape) +
                    "? at the start of a line lists the commands");
    }
    mScreen.showOutput(mSession);
    while (!pIsDone())
        pPollOnce();
    if (mFailure && mOutcome.reason == ExitReason::Ended) std::rethrow_exception(mFailure);
    return mOutcome;
}

bool ConsoleLoop::pIsDone() const
{
    switch (mOutcome.reason) {
    case ExitReason::None:
        return false;
    case ExitReason::Left:
    case ExitReason::Signal:
        return true;
    default:
        return mScreen.output().isEmpty();
    }
}

bool ConsoleLoop::pWantsInput() const { return mOutcome.reason == ExitReason::None && mInputOpen && mPending.empty(); }

bool ConsoleLoop::pWantsMessages() const { return mOutcome.reason == ExitReason::None && mScreen.output().hasRoom(); }

bool ConsoleLoop::pWantsToSend() const { return mOutcome.reason == ExitReason::None && !mPending.empty(); }

/// When pCheckTimers() is due; disabled while data is in flight.
PollDeadline ConsoleLoop::pDeadline() const
{
    const bool isWaiting = mOutcome.reason == ExitReason::None && !mInputOpen && !mSendBroken && mPending.empty() &&
                           mScreen.output().isEmpty();
    if (!isWaiting) return PollDeadline();
    if (mInputOptions.linger) return mQuietSince + *mInputOptions.linger;
    return mInputOptions.sendsEnd ? PollDeadline(mQuietSince + kEndRepeat) : PollDeadline();
}

void ConsoleLoop::pPollOnce()
{
    const PollFd input(mInput, PollEvents::Read);
    const PollFd messages = mConsole.getPollFd(PollEvents::Read);
    const PollFd sending = mConsole.getPollFd(PollEvents::Write);
    const PollFd output = mScreen.output().getPollFd();

    // Poll only for events that are handled now. An event that is left unhandled would make this a busy loop.
    PollSet set(mSignals.getPollFd());
    if (pWantsInput()) set += input;
    if (pWantsMessages()) set += messages;
    if (pWantsToSend()) set += sending;
    if (!mScreen.output().isEmpty()) set += output;
    // TLS may hold received bytes while the socket has none.
    const bool isPending = pWantsMessages() && mConsole.hasPending();
    const auto timeout = pDeadline().getTimeout(TimeProvider::steady());
    const PollResult ready = isPending ? set.poll() : set.wait(timeout);

    if (ready.contains(mSignals.getPollFd())) pHandleSignal();
    if (ready.contains(output)) pWriteOutput();
    if (pWantsMessages() && (isPending || ready.contains(messages))) pReceive();
    if (pWantsToSend() && ready.contains(sending)) pSend();
    if (pWantsInput() && ready.contains(input)) pReadInput();
    if (!ready.anyReady() && !isPending) pCheckTimers();
}

void ConsoleLoop::pHandleSignal()
{
    const int signal = mSignals.take();
    if (signal == 0 || isIgnored(signal)) return;
    if (signal == SIGTSTP) return pSuspend();
    if (signal == SIGCONT) return mMode.enterRaw();
    mOutcome.signal = signal;
    pExit(ExitReason::Signal);
}

void ConsoleLoop::pSuspend()
{
    mMode.restore();
    stop();
    mMode.enterRaw();
}

void ConsoleLoop::pWriteOutput()
{
    mQuietSince = TimeProvider::steady();
    mScreen.output().writeSome();
}

void ConsoleLoop::pReceive()
{
    try {
        static_cast<void>(mConsole.process());
    } catch (...) {
        if (mSession.getEnd() == SessionEnd::None) mFailure = std::current_exception();
        pExit(ExitReason::Ended);
    }
    mScreen.showOutput(mSession);
    if (mSession.getEnd() != SessionEnd::None) pExit(ExitReason::Ended);
}

/// Called when the connection is writable: on Linux that means a third of the send buffer is free, which is more than
/// the longest message. The send therefore does not block; if it does, the session's timeout limits it.
void ConsoleLoop::pSend()
{
    try {
        mQuietSince = TimeProvider::steady();
        mSession.writeSome(mPending);
    } catch (const Error& error) {
        // A hypervisor that closes the connection may have sent the reason. Without TLS it can still be read.
        mPending.clear();
        mInputOpen = false;
        mSendBroken = true;
        if (dynamic_cast<const DeadlinePassed*>(&error) == nullptr && !mConsole.isProtected()) return;
        mFailure = std::current_exception();
        pExit(ExitReason::Ended);
    }
}

void ConsoleLoop::pReadInput()
{
    std::array<char, SerialSession::kMaxData> buffer;
    const ssize_t count = ::read(mInput, buffer.data(), buffer.size());
    const int error = errno;
    if (count > 0) return pTakeTyped(buffer.data(), static_cast<std::size_t>(count));
    if (count == 0) return pEndInput();
    if (error != EAGAIN && error != EINTR) throw PosixError(error, "cannot read standard input");
}

void ConsoleLoop::pTakeTyped(const char* data, std::size_t length)
{
    if (!mMode.isTerminal()) {
        mPending.append(data, length);
        return;
    }
    std::string typed(data, length);
    while (!typed.empty() && mOutcome.reason == ExitReason::None)
        pExecute(mEscape.take(typed, mPending));
}

void ConsoleLoop::pExecute(EscapeFilter::Command command)
{
    switch (command) {
    case EscapeFilter::Command::None:
        return;
    case EscapeFilter::Command::Help:
        return mScreen.say(mEscape.help(mScreen.lineEnd()));
    case EscapeFilter::Command::Suspend:
        return pSuspend();
    case EscapeFilter::Command::Leave:
        break;
    }
    // Characters typed before the command still go to the partition if it takes them at once.
    if (!mPending.empty() && PollSet(mConsole.getPollFd(PollEvents::Write)).poll().anyReady()) pSend();
    pExit(ExitReason::Left);
}

void ConsoleLoop::pEndInput()
{
    if (mMode.isTerminal()) return pExit(ExitReason::Left); // in raw mode this means that the terminal hung up
    mInputOpen = false;
    mQuietSince = TimeProvider::steady();
    if (mInputOptions.sendsEnd) mPending += kEndOfFile;
}

void ConsoleLoop::pCheckTimers()
{
    if (!pDeadline().isExpired(TimeProvider::steady())) return;
    if (mInputOptions.linger) return pExit(ExitReason::Lingered);
    mPending += kEndOfFile;
}

void ConsoleLoop::pExit(ExitReason reason)
{
    if (mOutcome.reason != ExitReason::Signal) mOutcome.reason = reason;
    mPending.clear();
}

} // namespace qel::tool
