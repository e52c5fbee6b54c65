#pragma once

#include <qel/common/QelMessageDax.hpp>
#include <qel/protocol/SerialSession.hpp>

#include "base/DescriptorOutput.hpp"
#include "base/Library.hpp"
#include "base/TerminalMode.hpp"

#include <ostream>
#include <string>

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

    /// Appends to output() what the session has received.
    void showOutput(SerialSession& session);

    /// Prints sender and text of a broadcast of another console, with control characters escaped.
    void showBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast);

private:
    void pSay(const std::string& text);

    DescriptorOutput mOutput;
    std::ostream& mErrors;
    const bool mErrorsOnTerminal;
    const bool mIsOneTerminal; ///< output and messages share a terminal
    const TerminalMode& mMode;
};

} // namespace qel::tool
