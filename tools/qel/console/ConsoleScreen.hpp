#pragma once

#include "base/DescriptorOutput.hpp"
#include "base/TerminalMode.hpp"
#include "console/ConsoleSession.hpp"

#include <ostream>
#include <string>

namespace qel::tool {

/// What the person at a console sees: the partition's output as it is, and between it, a line each, what this program
/// has to say.
/// Thread safety: one thread.
class ConsoleScreen final : public ConsoleSession::Receiver {
public:
    /// @param output  a descriptor for the partition's output
    /// @param errors  for the lines of this program
    /// @param errorsOnTerminal  these go to the terminal, which `mode` may have put into raw mode
    /// Borrows all of them.
    ConsoleScreen(int output, std::ostream& errors, bool errorsOnTerminal, const TerminalMode& mode);

    /// Prints "qel: " and the text on a line of its own.
    void say(const std::string& text);

    /// What ends such a line in the present mode of the terminal.
    const char* lineEnd() const;

    /// The partition's output on its way out.
    DescriptorOutput& output() noexcept { return mOutput; }

    /// Keeps the data for output().
    void onOutput(const char* data, std::size_t length) override;

    /// Says who sent which text; nothing in it can do anything to the terminal.
    void onBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast) override;

private:
    DescriptorOutput mOutput;
    std::ostream& mErrors;
    const bool mErrorsOnTerminal;
    const bool mIsOneTerminal; ///< both are seen there
    const TerminalMode& mMode;
};

} // namespace qel::tool
