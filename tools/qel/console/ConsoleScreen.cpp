#include "console/ConsoleScreen.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

#include <unistd.h>

namespace qel::tool {

ConsoleScreen::ConsoleScreen(int output, std::ostream& errors, bool errorsOnTerminal, const TerminalMode& mode)
    : mOutput(output), mErrors(errors), mErrorsOnTerminal(errorsOnTerminal),
      mIsOneTerminal(errorsOnTerminal && ::isatty(output) == 1), mMode(mode)
{}

void ConsoleScreen::say(const std::string& text)
{
    mOutput.writeSome(); // earlier output first
    if (mIsOneTerminal && !mOutput.endsLine()) mErrors << lineEnd();
    mErrors << "qel: " << text << lineEnd() << std::flush;
}

const char* ConsoleScreen::lineEnd() const { return mErrorsOnTerminal && mMode.isRaw() ? "\r\n" : "\n"; }

void ConsoleScreen::onOutput(const char* data, std::size_t length) { mOutput.append(data, length); }

void ConsoleScreen::onBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast)
{
    const std::string text(broadcast.getDaxPacket(), broadcast.getBroadcastMsgLen());
    say("broadcast from tool type " + std::to_string(broadcast.getSenderToolType()) + ", " +
        quoted(broadcast.getSenderToolId()) + ": " + printable(text));
}

} // namespace qel::tool
