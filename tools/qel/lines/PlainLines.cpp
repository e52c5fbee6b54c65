#include "lines/PlainLines.hpp"

#include <cstring>
#include <utility>

namespace qel::tool {

namespace {

constexpr char kBell = '\x07';
constexpr char kCancel = '\x18';
constexpr char kSubstitute = '\x1A';
constexpr char kEscape = '\x1B';
constexpr char kDelete = '\x7F';

bool isIn(char byte, char first, char last) { return byte >= first && byte <= last; }

} // namespace

PlainLines::PlainLines(std::function<void(const std::string& line)> onLine) : mOnLine(std::move(onLine)) {}

void PlainLines::feed(const char* data, std::size_t length, const std::function<void()>& onBegin)
{
    for (std::size_t i = 0; i < length; ++i)
        mState = pNext(data[i], onBegin);
}

void PlainLines::flush()
{
    mState = State::Text;
    if (!std::exchange(mHasBegun, false)) return;
    mOnLine(mLine);
    mLine.clear();
}

/// Sources: ECMA-48.
PlainLines::State PlainLines::pNext(char byte, const std::function<void()>& onBegin)
{
    if (byte == kCancel || byte == kSubstitute) return State::Text; // both end any sequence
    switch (mState) {
    case State::Text:
        if (byte == kEscape) return State::Escape;
        pText(byte, onBegin);
        return State::Text;
    case State::Escape:
        return pAfterEscape(byte);
    case State::Intermediate:
        return isIn(byte, ' ', '/') ? State::Intermediate : State::Text;
    case State::Control:
        if (byte == kEscape) return State::Escape;
        if (byte == '\n') pText(byte, onBegin); // a line must not vanish in a torn sequence
        return isIn(byte, '@', '~') || byte == '\n' ? State::Text : State::Control;
    case State::String:
        if (byte == '\n') pText(byte, onBegin);
        if (byte == kEscape) return State::StringEscape;
        return byte == kBell || byte == '\n' ? State::Text : State::String;
    case State::StringEscape:
        return byte == '\\' ? State::Text : pAfterEscape(byte);
    }
    return State::Text;
}

PlainLines::State PlainLines::pAfterEscape(char byte) const
{
    if (byte == kEscape) return State::Escape;
    if (byte == '[') return State::Control;
    if (byte != '\0' && std::strchr("]PX^_", byte) != nullptr) return State::String;
    return isIn(byte, ' ', '/') ? State::Intermediate : State::Text;
}

void PlainLines::pText(char byte, const std::function<void()>& onBegin)
{
    const bool endedByReturn = std::exchange(mEndedByReturn, false);
    if (byte == '\r') {
        mEndedByReturn = mHasBegun || endedByReturn;
        return flush();
    }
    if (byte == '\n' && endedByReturn) return; // of the same line end
    const bool isControl = (byte >= '\0' && byte < ' ' && byte != '\t' && byte != '\n') || byte == kDelete;
    if (isControl) return;
    if (!std::exchange(mHasBegun, true)) onBegin();
    if (byte == '\n') return flush();
    mLine += byte;
    if (mLine.size() == kLongest) flush();
}

} // namespace qel::tool
