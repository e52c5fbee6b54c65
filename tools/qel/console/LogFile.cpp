#include "console/LogFile.hpp"

#include "console/ConsoleTexts.hpp"

#include <fcntl.h>
#include <utility>

namespace qel::tool {

LogFile::LogFile(std::string path, Content content, TimeStamps::Style style)
    : mContent(content), mFile(std::move(path), O_APPEND, texts::kCannotLog), mStamps(style)
{}

void LogFile::onOutput(const char* data, std::size_t length)
{
    if (!mIsOn) return;
    if (mContent == Content::Raw) return pWrite(std::string(data, length));
    std::string text;
    mStripper.append(data, length, text);
    std::string stamped;
    mStamps.append(text.data(), text.size(), stamped);
    pWrite(stamped);
}

void LogFile::onGap(const std::string& text)
{
    if (!mIsOn) return;
    const std::string line = (mEndsLine ? "[qel: " : "\n[qel: ") + text + "]\n";
    mStripper = ControlStripper(); // a control sequence that has begun is not continued
    onOutput(line.data(), line.size());
}

void LogFile::pWrite(const std::string& text)
{
    if (!text.empty()) mEndsLine = text.back() == '\n';
    if (!mFile.write(text)) mIsOn = false;
}

} // namespace qel::tool
