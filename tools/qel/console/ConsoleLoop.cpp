#include "console/ConsoleLoop.hpp"

#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "base/Failures.hpp"

#include <array>
#include <cerrno>
#include <csignal>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr char kEndOfFile = 'D' & 0x1F; // control-D

/// Raw mode for as long as it lives.
class RawMode {
public:
    explicit RawMode(TerminalMode& mode) : mMode(mode) { mMode.enterRaw(); }
    ~RawMode() { mMode.restore(); }
    RawMode(const RawMode&) = delete;
    RawMode& operator=(const RawMode&) = delete;

private:
    TerminalMode& mMode;
};

/// Signals that are ignored come to a SignalWatch all the same, because it blocks them. Whoever started this process
/// with one of them ignored, as nohup(1) does, does not want it to end by that.
bool isIgnored(int signal)
{
    struct sigaction action = {};
    return ::sigaction(signal, nullptr, &action) == 0 && action.sa_handler == SIG_IGN;
}

/// Stops this process as the signal would have done had it not been watched for; returns when it has been continued.
/// The system does not stop it when nobody could continue it.
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

ConsoleLoop::ConsoleLoop(ConsoleSession& session, ConsoleScreen& screen, int input, TerminalMode& mode,
                         SignalWatch& signals, const ConsoleManners& manners)
    : mSession(session), mScreen(screen), mInput(input), mMode(mode), mSignals(signals), mManners(manners),
      mEscape(manners.escape)
{}

ConsoleLoop::Outcome ConsoleLoop::run()
{
    const RawMode raw(mMode);
    if (mMode.isTerminal() && mManners.escape) {
        mScreen.say("connected; " + characterName(*mManners.escape) + "? at the start of a line lists the commands");
    }
    while (!pIsDone())
        pTurn();
    if (mFailure && mOutcome.departure == Departure::Ended) std::rethrow_exception(mFailure);
    return mOutcome;
}

bool ConsoleLoop::pIsDone() const
{
    switch (mOutcome.departure) {
    case Departure::None:
        return false;
    case Departure::Left:
    case Departure::Signal:
        return true;
    default:
        return mScreen.output().isEmpty();
    }
}

bool ConsoleLoop::pWantsInput() const
{
    return mOutcome.departure == Departure::None && mInputOpen && mPending.empty();
}

bool ConsoleLoop::pWantsMessages() const { return mOutcome.departure == Departure::None && mScreen.output().hasRoom(); }

bool ConsoleLoop::pWantsToSend() const { return mOutcome.departure == Departure::None && !mPending.empty(); }

/// When pLookAtTime() will have something to do if nothing else happens.
PollDeadline ConsoleLoop::pDeadline() const
{
    const bool isWaiting = mOutcome.departure == Departure::None && !mInputOpen && !mSendBroken && mPending.empty() &&
                           mScreen.output().isEmpty();
    if (!isWaiting) return PollDeadline();
    if (mManners.linger) return mQuietSince + *mManners.linger;
    return mManners.tellsEnd ? PollDeadline(mQuietSince + kTellAgain) : PollDeadline();
}

void ConsoleLoop::pTurn()
{
    const PollFd input(mInput, PollEvents::Read);
    const PollFd messages = mSession.getPollFd(PollEvents::Read);
    const PollFd sending = mSession.getPollFd(PollEvents::Write);
    const PollFd output = mScreen.output().getPollFd();

    // Nothing is waited for that would not be acted upon: what is ready and stays so would be reported without end.
    PollSet set(mSignals.getPollFd());
    if (pWantsInput()) set += input;
    if (pWantsMessages()) set += messages;
    if (pWantsToSend()) set += sending;
    if (!mScreen.output().isEmpty()) set += output;
    // What TLS has taken from the socket is there to be received although the socket has nothing.
    const bool isPending = pWantsMessages() && mSession.hasPending();
    const auto timeout = pDeadline().getTimeout(TimeProvider::steady());
    const PollResult ready = isPending ? set.poll() : set.wait(timeout);

    if (ready.contains(mSignals.getPollFd())) pHandleSignal();
    if (ready.contains(output)) pWriteOutput();
    if (pWantsMessages() && (isPending || ready.contains(messages))) pReceive();
    if (pWantsToSend() && ready.contains(sending)) pSend();
    if (pWantsInput() && ready.contains(input)) pReadInput();
    if (!ready.anyReady() && !isPending) pLookAtTime();
}

void ConsoleLoop::pHandleSignal()
{
    const int signal = mSignals.take();
    if (signal == 0 || isIgnored(signal)) return;
    if (signal == SIGTSTP) return pSuspend();
    if (signal == SIGCONT) return mMode.enterRaw();
    mOutcome.signal = signal;
    pDepart(Departure::Signal);
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
        mSession.receive();
    } catch (...) {
        mFailure = std::current_exception();
        pDepart(Departure::Ended);
    }
    if (mSession.getEnd() != SessionEnd::None) pDepart(Departure::Ended);
}

/// The connection is ready to be written to, which Linux reports once a third of its send buffer is free. That buffer
/// is four times as large as the longest message, so that this does not wait; would it wait all the same, then not
/// without limit.
void ConsoleLoop::pSend()
{
    try {
        mQuietSince = TimeProvider::steady();
        mSession.send(mPending);
    } catch (const StreamIOException& error) {
        // A hypervisor that closes the connection may have said why: that is still to be read, unless by TLS.
        mPending.clear();
        mInputOpen = false;
        mSendBroken = true;
        if (exitStatusOf(error) != ExitStatus::DeadlinePassed && mSession.outlivesFailedSend()) return;
        mFailure = std::current_exception();
        pDepart(Departure::Ended);
    }
}

void ConsoleLoop::pReadInput()
{
    std::array<char, ConsoleSession::kMostData> buffer;
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
    while (!typed.empty() && mOutcome.departure == Departure::None)
        pObey(mEscape.take(typed, mPending));
}

void ConsoleLoop::pObey(EscapeFilter::Command command)
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
    // What was typed before is meant for the partition, if it takes it.
    if (!mPending.empty() && PollSet(mSession.getPollFd(PollEvents::Write)).poll().anyReady()) pSend();
    pDepart(Departure::Left);
}

void ConsoleLoop::pEndInput()
{
    if (mMode.isTerminal()) return pDepart(Departure::Left); // it is gone: in raw mode there is no other end
    mInputOpen = false;
    mQuietSince = TimeProvider::steady();
    if (mManners.tellsEnd) mPending += kEndOfFile;
}

void ConsoleLoop::pLookAtTime()
{
    if (!pDeadline().isExpired(TimeProvider::steady())) return;
    if (mManners.linger) return pDepart(Departure::Lingered);
    mPending += kEndOfFile;
}

void ConsoleLoop::pDepart(Departure departure)
{
    if (mOutcome.departure != Departure::Signal) mOutcome.departure = departure;
    mPending.clear();
}

} // namespace qel::tool
