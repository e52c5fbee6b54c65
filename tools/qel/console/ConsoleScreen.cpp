#include "console/ConsoleScreen.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "console/ConsoleTexts.hpp"

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

void ConsoleScreen::pSay(const std::string& text)
{
    const std::string start = mIsOneTerminal && !mOutput.endsLine() ? lineEnd() : "";
    echo(start + text + lineEnd());
}

const char* ConsoleScreen::lineEnd() const { return mErrorsOnTerminal && mMode.isRaw() ? "\r\n" : "\n"; }

std::size_t ConsoleScreen::showOutput(SerialSession& session)
{
    std::array<char, SerialSession::kMaxData> buffer;
    std::size_t total = 0;
    while (const std::size_t count = session.readAvailable(buffer.data(), buffer.size())) {
        total += count;
        for (SessionTap* const tap : mTaps)
            tap->onOutput(buffer.data(), count);
        if (mInstead) continue;
        pShow(buffer.data(), count);
    }
    if (mInstead && total > 0) {
        const std::string text = mInstead();
        mOutput.append(text.data(), text.size());
    }
    return total;
}

void ConsoleScreen::pShow(const char* data, std::size_t length)
{
    if (mStamps.style() == TimeStamps::Style::Off) {
        mStamps.skip(data, length);
        return mOutput.append(data, length);
    }
    std::string stamped;
    mStamps.append(data, length, stamped);
    mOutput.append(stamped.data(), stamped.size());
}

/// Earlier output comes first.
void ConsoleScreen::echo(const std::string& text)
{
    if (mIsOneTerminal) mOutput.append(text.data(), text.size());
    mOutput.writeSome();
    if (!mIsOneTerminal) mErrors << text << std::flush;
}

void ConsoleScreen::showBroadcast(const QelMessageDaxBroadcastOutboundAsync& broadcast)
{
    const std::string text(broadcast.getDaxPacket(), broadcast.getBroadcastMsgLen());
    say(filled(texts::kBroadcast,
               {std::to_string(broadcast.getSenderToolType()), quoted(broadcast.getSenderToolId()), printable(text)}));
}

} // namespace qel::tool
