#pragma once

#include "base/DescriptorOutput.hpp"
#include "base/Library.hpp"
#include "base/SignalWatch.hpp"
#include "base/TerminalMode.hpp"

#include <chrono>
#include <cstddef>
#include <functional>
#include <string>

namespace qel::tool {

/// The lines of a text that fit a screen, each cut to its width. When there are more, the last line says how many.
/// @param text  without control characters but line feeds
/// @return lines with "\r\n" between them
std::string fitScreen(const std::string& text, std::size_t rows, std::size_t columns);

/// Draws a text on a terminal again and again, as top(1) does: on the alternate screen, so that the terminal shows what
/// it showed before when this object is gone.
///
/// Ends by "q", Ctrl-C and Ctrl-D, and by SIGINT, SIGTERM, SIGHUP and SIGQUIT. Ctrl-Z and SIGTSTP suspend. A terminal
/// that takes no output is not waited for.
/// Thread safety: for single-threaded programs.
class StatusScreen {
public:
    /// @param input, output  borrowed; `output` is a terminal
    StatusScreen(int input, int output);

    /// Restores the terminal.
    ~StatusScreen();

    StatusScreen(const StatusScreen&) = delete;
    StatusScreen& operator=(const StatusScreen&) = delete;

    /// Draws until the user leaves, or the input ends.
    /// @param text  makes what is drawn next; called once for each interval, and when the window has changed
    void run(const std::function<std::string()>& text, std::chrono::milliseconds interval);

private:
    void pEnter();
    void pLeave() noexcept;
    void pDraw(const std::string& text);
    bool pAwaitNext(std::chrono::steady_clock::time_point end);
    bool pHandleSignal();
    bool pHandleKeys();
    void pSuspend();

    const int mInput;
    const int mOutputFd;
    SignalWatch mSignals;
    TerminalMode mMode;
    DescriptorOutput mOutput;
    bool mHasInput = true;
    bool mIsStale = false; ///< to be drawn again before the interval is over
};

} // namespace qel::tool
