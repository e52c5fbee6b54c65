#pragma once

#include "base/DescriptorOutput.hpp"
#include "base/TerminalMode.hpp"
#include "console/ConsoleSession.hpp"

#include <ostream>
#include <string>

namespace qel::tool {

/// What the user of a console sees: the partition's output unchanged, and the messages of this program, each on a line
/// of its own.
/// Thread safety: one thread.
class ConsoleScreen final : public ConsoleSession::Receiver {
public:
    /// Borrows its arguments.
    /// @param output  descriptor for the partition's output
    /// @param errors  for the messages of this program
    /// @param errorsOnTerminal  true when `errors` is the terminal that `mode` controls
    ConsoleScreen(int output, std::ostream& errors, bool errorsOnTerminal, const TerminalMode& mode);

    /// Prints "qel: " and the text on a line of its own.
    void say(const std::string& text);

    /// The line end of a message: "\r\n" while the terminal is in raw mode.
    const char* lineEnd() const;

    /// The buffer of the partition's output.
    DescriptorOutput& output() noexcept { return mOutput; }

    /// Appends the data to output().
    void onOutput(const char* data, std::size_t length) override;

    /// Prints sender and text, with control characters escaped.
    void onBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast) override;

private:
    DescriptorOutput mOutput;
    std::ostream& mErrors;
    const bool mErrorsOnTerminal;
    const bool mIsOneTerminal; ///< output and messages share a terminal
    const TerminalMode& mMode;
};

} // namespace qel::tool
