#pragma once

#include <qel/common/QelMessageDax.hpp>
#include <qel/protocol/SerialSession.hpp>

#include "base/DescriptorOutput.hpp"
#include "base/Library.hpp"
#include "base/TerminalMode.hpp"
#include "base/TimeStamps.hpp"
#include "console/SessionTap.hpp"

#include <cstddef>
#include <functional>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

/// What the user of a console sees: the partition's output unchanged, and the messages of this program, each on a line
/// of its own. Where both go to one terminal, they appear there in the order in which they were made.
/// Thread safety: one thread.
class ConsoleScreen {
public:
    /// Borrows its arguments.
    /// @param output  descriptor for the partition's output
    /// @param errors  for the messages of this program
    /// @param errorsOnTerminal  true when `errors` is the terminal that `mode` controls
    ConsoleScreen(int output, std::ostream& errors, bool errorsOnTerminal, const TerminalMode& mode);

    /// Prints "qel: " and the text on a line of its own.
    void say(const std::string& text);

    /// The same with the bell, where messages go to a terminal.
    void sayLoudly(const std::string& text);

    /// The line end of a message: "\r\n" while the terminal is in raw mode.
    const char* lineEnd() const;

    /// The buffer of the partition's output.
    DescriptorOutput& output() noexcept { return mOutput; }

    /// Appends to output() what the session has received, stamped; the taps get it as it came.
    /// @return the number of bytes received
    std::size_t showOutput(SerialSession& session);

    /// @param tap  gets all that follows; borrowed
    void addTap(SessionTap& tap) { mTaps.push_back(&tap); }
    const std::vector<SessionTap*>& taps() const noexcept { return mTaps; }

    /// Shows only what this returns, asked after each piece of output, instead of the output.
    void showInstead(std::function<std::string()> source) { mInstead = std::move(source); }

    /// The time in front of each line.
    TimeStamps& stamps() noexcept { return mStamps; }

    /// Shows text of this program as it is, such as a prompt.
    void echo(const std::string& text);

    /// Prints sender and text of a broadcast of another console, with control characters escaped.
    void showBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast);

private:
    void pSay(const std::string& text);
    void pShow(const char* data, std::size_t length);

    DescriptorOutput mOutput;
    std::ostream& mErrors;
    const bool mErrorsOnTerminal;
    const bool mIsOneTerminal; ///< output and messages share a terminal
    const TerminalMode& mMode;
    TimeStamps mStamps;
    std::vector<SessionTap*> mTaps;
    std::function<std::string()> mInstead;
};

} // namespace qel::tool
