// What ConsoleLoop does at the commands of the user.

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "base/HomePath.hpp"
#include "console/ConsoleLoop.hpp"
#include "console/ConsoleTexts.hpp"

#include <algorithm>
#include <sys/ioctl.h>
#include <utility>

namespace qel::tool {

namespace {

/// How often the progress of a file is told.
constexpr std::chrono::seconds kProgressInterval{1};

std::string secondsText(PollDeadline::time_point::duration duration)
{
    const auto milliseconds = std::chrono::floor<std::chrono::milliseconds>(duration);
    return filled(texts::kSeconds, {numberText(std::chrono::duration<double>(milliseconds).count())});
}

/// @return false: the descriptor has no window, or does not know its size
bool readWindow(int descriptor, winsize& window)
{
    return ::ioctl(descriptor, TIOCGWINSZ, &window) == 0 && window.ws_row > 0 && window.ws_col > 0;
}

} // namespace

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
        return pLeave();
    case EscapeFilter::Command::Log:
        return pToggleLogs();
    case EscapeFilter::Command::Stamps:
        return pCycleStamps();
    default:
        break;
    }
    if (mSession == nullptr) return mScreen.say(texts::kNoSession);
    pExecuteInSession(command);
}

void ConsoleLoop::pExecuteInSession(EscapeFilter::Command command)
{
    const std::string partition = std::to_string(mSession->getPartition());
    switch (command) {
    case EscapeFilter::Command::Info:
        return pTellAbout();
    case EscapeFilter::Command::ReadOnly:
        return pToggleReadOnly();
    case EscapeFilter::Command::Break:
        return mScreen.say(filled(texts::kBreak, {partition}));
    case EscapeFilter::Command::WindowSize:
        return pMayType() ? pTypeWindowSize() : pSayWhyNot();
    case EscapeFilter::Command::SendFile:
        return pMayType() ? pAskForFile() : pSayWhyNot();
    case EscapeFilter::Command::Force:
        mScreen.say(filled(texts::kForcing, {partition}));
        return pExit(ExitReason::Force);
    default:
        return;
    }
}

bool ConsoleLoop::pMayType() const { return !mIsReadOnly && mSession->getConnection() == 0; }

void ConsoleLoop::pSayWhyNot()
{
    const std::string escape = characterName(*mInputOptions.escape);
    mScreen.say(mIsReadOnly ? texts::kReadOnly : filled(texts::kWatchingOnly, {escape}));
}

/// Characters typed before the command still go to the partition if it takes them at once.
void ConsoleLoop::pLeave()
{
    const bool isUsable = mSession != nullptr && pWantsToSend() && !mIsAttending;
    if (isUsable && PollSet(mConsole->getPollFd(PollEvents::Write)).poll().anyReady()) pSend();
    pExit(ExitReason::Left);
}

void ConsoleLoop::pTellAbout()
{
    mScreen.say(pGreeting());
    mScreen.say(filled(texts::kInfoTraffic,
                       {std::to_string(mReceived), std::to_string(mSession->getSent()), std::to_string(mHeld.size())}));
    const auto now = TimeProvider::steady();
    mScreen.say(mLastOutput ? filled(texts::kInfoOutput, {secondsText(now - *mLastOutput)}) : texts::kInfoNoOutput);
    mScreen.say(filled(texts::kInfoHeard, {secondsText(mKeepAlive.silence(now))}));
    if (const auto roundTrip = mKeepAlive.roundTrip()) {
        const double milliseconds = std::chrono::duration<double, std::milli>(*roundTrip).count();
        mScreen.say(filled(texts::kInfoRoundTrip, {numberText(milliseconds)}));
    }
    for (const LogFile* log : mTools.logs)
        mScreen.say(filled(log->isOn() ? texts::kLogOn : texts::kLogOff, {log->path()}));
}

void ConsoleLoop::pToggleLogs()
{
    if (mTools.logs.empty()) mScreen.say(texts::kNoLog);
    for (LogFile* log : mTools.logs) {
        log->toggle();
        mScreen.say(filled(log->isOn() ? texts::kLogOn : texts::kLogOff, {log->path()}));
    }
}

void ConsoleLoop::pCycleStamps()
{
    mScreen.stamps().cycle();
    switch (mScreen.stamps().style()) {
    case TimeStamps::Style::Off:
        return mScreen.say(texts::kStampsOff);
    case TimeStamps::Style::Iso:
        return mScreen.say(texts::kStampsIso);
    case TimeStamps::Style::Delta:
        return mScreen.say(texts::kStampsDelta);
    }
}

void ConsoleLoop::pToggleReadOnly()
{
    mIsReadOnly = !mIsReadOnly;
    mScreen.say(mIsReadOnly ? texts::kReadOnly : texts::kReadWrite);
}

void ConsoleLoop::pTypeWindowSize()
{
    winsize window{};
    if (!readWindow(mInput, window)) return mScreen.say(texts::kNoWindow);
    pHold("stty rows " + std::to_string(window.ws_row) + " cols " + std::to_string(window.ws_col) + "\r");
}

void ConsoleLoop::pAskForFile()
{
    mPrompt.emplace();
    mScreen.echo((mScreen.output().endsLine() ? "" : mScreen.lineEnd()) + std::string(texts::kFilePrompt));
}

void ConsoleLoop::pAnswerPrompt(std::string& typed)
{
    mScreen.echo(mPrompt->take(typed));
    if (mPrompt->state() == LineInput::State::Open) return;
    const bool isGiven = mPrompt->state() == LineInput::State::Done && !mPrompt->text().empty();
    const std::string path = mPrompt->text();
    mPrompt.reset();
    if (!isGiven) return mScreen.say(texts::kFileCancelled);
    pBeginFile(path);
}

void ConsoleLoop::pBeginFile(const std::string& typed)
{
    const std::string path = expandHome(typed);
    try {
        mFile.emplace(path);
    } catch (const FileIOError& error) {
        return mScreen.say(error.what());
    }
    mToldAt = TimeProvider::steady();
    mScreen.say(filled(texts::kFileBegins, {path, std::to_string(mFile->size())}));
}

/// Types the next piece of the file once the one before it has been sent.
void ConsoleLoop::pFeedFile()
{
    if (!mFile || !pIsRunning() || mSendBroken || !mHeld.isEmpty()) return;
    const auto now = TimeProvider::steady();
    try {
        const std::string piece = mFile->next();
        if (piece.empty()) return pEndFile(texts::kFileDone, mFile->sent());
        mHeld.add(piece, now);
    } catch (const FileIOError& error) {
        mFile.reset();
        return mScreen.say(error.what());
    }
    if (now - mToldAt < kProgressInterval) return;
    mToldAt = now;
    mScreen.say(filled(texts::kFileProgress, {std::to_string(mFile->sent()), std::to_string(mFile->size())}));
}

/// Throws away the piece that is held, which has been read and not been typed.
void ConsoleLoop::pStopFile()
{
    const std::uint64_t held = std::min<std::uint64_t>(mHeld.size(), mFile->sent());
    mHeld.clear();
    pEndFile(texts::kFileStopped, mFile->sent() - held);
}

void ConsoleLoop::pEndFile(const char* text, std::uint64_t sent)
{
    mFile.reset();
    mScreen.say(filled(text, {std::to_string(sent)}));
}

void ConsoleLoop::pNoteResize()
{
    winsize window{};
    if (mTools.recording != nullptr && readWindow(mInput, window))
        mTools.recording->onResize({window.ws_col, window.ws_row});
}

void ConsoleLoop::pReportFailures()
{
    for (LogFile* log : mTools.logs) {
        const std::string failure = log->takeFailure();
        if (!failure.empty()) mScreen.say(failure);
    }
    if (mTools.recording == nullptr) return;
    const std::string failure = mTools.recording->takeFailure();
    if (!failure.empty()) mScreen.say(failure);
}

} // namespace qel::tool
