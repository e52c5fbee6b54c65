#include "console/ConsoleScreen.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

#include <array>
#include <cstddef>
#include <unistd.h>

namespace qel::tool {

ConsoleScreen::ConsoleScreen(int output, std::ostream& errors, bool errorsOnTerminal, const TerminalMode& mode)
    : mOutput(output), mErrors(errors), mErrorsOnTerminal(errorsOnTerminal),
      mIsOneTerminal(errorsOnTerminal && ::isatty(output) == 1), mMode(mode)
{}

void ConsoleScreen::say(const std::string& text) { pSay("qel: " + text); }

void ConsoleScreen::sayLoudly(const std::string& text) { pSay((mErrorsOnTerminal ? "\aqel: " : "qel: ") + text); }

/// Earlier output comes first.
void ConsoleScreen::pSay(const std::string& text)
{
    const std::string start = mIsOneTerminal && !mOutput.endsLine() ? lineEnd() : "";
    const std::string line = start + text + lineEnd();
    if (mIsOneTerminal) mOutput.append(line.data(), line.size());
    mOutput.writeSome();
    if (!mIsOneTerminal) mErrors << line << std::flush;
}

const char* ConsoleScreen::lineEnd() const { return mErrorsOnTerminal && mMode.isRaw() ? "\r\n" : "\n"; }

void ConsoleScreen::showOutput(SerialSession& session)
{
    std::array<char, SerialSession::kMaxData> buffer;
    while (const std::size_t count = session.readAvailable(buffer.data(), buffer.size()))
        mOutput.append(buffer.data(), count);
}

void ConsoleScreen::showBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast)
{
    const std::string text(broadcast.getDaxPacket(), broadcast.getBroadcastMsgLen());
    say("broadcast from tool type " + std::to_string(broadcast.getSenderToolType()) + ", " +
        quoted(broadcast.getSenderToolId()) + ": " + printable(text));
}

} // namespace qel::tool
