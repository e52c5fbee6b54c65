#include "status/StatusScreen.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include <array>
#include <cerrno>
#include <csignal>
#include <sys/ioctl.h>
#include <unistd.h>
#include <vector>

namespace qel::tool {

namespace {

// xterm and all that follow it, such as the consoles of Linux, screen and tmux.
constexpr const char* kBegin = "\x1b[?1049h\x1b[?25l"; // alternate screen, no cursor
constexpr const char* kEnd = "\x1b[?25h\x1b[?1049l";
constexpr const char* kHome = "\x1b[H";
constexpr const char* kClearLine = "\x1b[K";
constexpr const char* kClearBelow = "\x1b[J";

/// For the last bytes, to a terminal that may be halted.
constexpr std::chrono::milliseconds kPatience(200);

// The keys of a terminal in raw mode, in which they cause no signals.
constexpr char kCtrlC = 0x03;
constexpr char kCtrlD = 0x04;
constexpr char kCtrlBackslash = 0x1C;
constexpr char kCtrlZ = 0x1A;

struct Size {
    std::size_t rows = 24;
    std::size_t columns = 80;
};

Size sizeOf(int terminal)
{
    winsize size{};
    if (::ioctl(terminal, TIOCGWINSZ, &size) != 0 || size.ws_row == 0 || size.ws_col == 0) return {};
    return {size.ws_row, size.ws_col};
}

std::vector<std::string> linesOf(const std::string& text)
{
    std::vector<std::string> lines;
    std::size_t begin = 0;
    while (begin < text.size()) {
        const std::size_t end = std::min(text.find('\n', begin), text.size());
        lines.push_back(text.substr(begin, end - begin));
        begin = end + 1;
    }
    return lines;
}

/// Stops this process as SIGTSTP would without the SignalWatch; returns when the process continues.
void stop()
{
    sigset_t signal;
    sigset_t before;
    ::sigemptyset(&signal);
    ::sigaddset(&signal, SIGTSTP);
    static_cast<void>(::kill(0, SIGTSTP)); // the whole job, as the terminal would
    ::pthread_sigmask(SIG_UNBLOCK, &signal, &before);
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

} // namespace

std::string fitScreen(const std::string& text, std::size_t rows, std::size_t columns)
{
    std::vector<std::string> lines = linesOf(text);
    if (lines.size() > rows) {
        const std::size_t left = lines.size() - rows + 1;
        lines.resize(rows);
        lines.back() = "... " + std::to_string(left) + " more lines";
    }
    std::string fitted;
    for (const std::string& line : lines)
        fitted += (fitted.empty() ? "" : "\r\n") + line.substr(0, columns) + kClearLine;
    return fitted;
}

StatusScreen::StatusScreen(int input, int output)
    : mInput(input), mOutputFd(output), mSignals({SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGTSTP, SIGCONT, SIGWINCH}),
      mMode(input), mOutput(output)
{
    pEnter();
}

StatusScreen::~StatusScreen() { pLeave(); }

void StatusScreen::run(const std::function<std::string()>& text, std::chrono::milliseconds interval)
{
    do {
        pDraw(text());
        mIsStale = false;
    } while (pAwaitNext(TimeProvider::steady() + interval));
}

void StatusScreen::pEnter()
{
    mMode.enterRaw();
    mOutput.append(kBegin, std::char_traits<char>::length(kBegin));
    mIsStale = true;
}

/// What the terminal does not take soon is dropped: it is halted, and the user wants to leave.
void StatusScreen::pLeave() noexcept
{
    try {
        mOutput.append(kEnd, std::char_traits<char>::length(kEnd));
        const PollDeadline end(TimeProvider::steady() + kPatience);
        for (auto now = TimeProvider::steady(); !mOutput.isEmpty() && !end.isExpired(now);
             now = TimeProvider::steady()) {
            if (PollSet(mOutput.getPollFd()).wait(end.getTimeout(now)).anyReady()) mOutput.writeSome();
        }
    } catch (const std::exception&) { // NOLINT(bugprone-empty-catch): the terminal is gone
    }
    mOutput.drop();
    mMode.restore();
}

/// Leaves a frame out while the terminal has not taken the last one.
void StatusScreen::pDraw(const std::string& text)
{
    if (mOutput.hasRoom()) {
        const Size size = sizeOf(mOutputFd);
        const std::string frame = kHome + fitScreen(text, size.rows, size.columns) + kClearBelow;
        mOutput.append(frame.data(), frame.size());
    }
    mOutput.writeSome();
}

/// @return false: the user leaves
bool StatusScreen::pAwaitNext(std::chrono::steady_clock::time_point end)
{
    const PollFd input(mInput, PollEvents::Read);
    for (;;) {
        const auto now = TimeProvider::steady();
        if (mIsStale || end <= now) return true;
        PollSet set{mSignals.getPollFd()};
        if (mHasInput) set += input;
        if (!mOutput.isEmpty()) set += mOutput.getPollFd();
        const PollResult ready = set.wait(PollDeadline(end).getTimeout(now) + std::chrono::milliseconds(1));
        if (ready.contains(mSignals.getPollFd()) && !pHandleSignal()) return false;
        if (mHasInput && ready.contains(input) && !pHandleKeys()) return false;
        if (!mOutput.isEmpty() && ready.contains(mOutput.getPollFd())) mOutput.writeSome();
    }
}

/// @return false: the user leaves
bool StatusScreen::pHandleSignal()
{
    switch (mSignals.take()) {
    case SIGTSTP:
        pSuspend();
        return true;
    case SIGCONT: // after a SIGSTOP: the shell may have changed the mode
        pEnter();
        return true;
    case SIGWINCH:
        mIsStale = true;
        return true;
    case 0:
        return true;
    default:
        return false;
    }
}

/// @return false: the user leaves
bool StatusScreen::pHandleKeys()
{
    std::array<char, 64> keys;
    const ssize_t count = ::read(mInput, keys.data(), keys.size());
    if (count < 0) return errno == EINTR || errno == EAGAIN;
    if (count == 0) {
        mHasInput = false; // of a terminal that is gone; of a file this is no reason to leave
        return !mMode.isTerminal();
    }
    for (ssize_t i = 0; i < count; ++i) {
        const char key = keys.at(static_cast<std::size_t>(i));
        if (key == 'q' || key == 'Q' || key == kCtrlD) return false;
        if (key == kCtrlZ && mMode.isTerminal()) pSuspend();
        if (mMode.isTerminal() && (key == kCtrlC || key == kCtrlBackslash)) return false;
    }
    return true;
}

void StatusScreen::pSuspend()
{
    pLeave();
    stop();
    pEnter();
}

} // namespace qel::tool
