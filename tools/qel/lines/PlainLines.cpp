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

/// Bytes that follow the first one of a character in UTF-8; 0: it is not one, or has none.
int bytesToFollow(unsigned char byte)
{
    if (byte >= 0xC2 && byte <= 0xDF) return 1;
    if (byte >= 0xE0 && byte <= 0xEF) return 2;
    return byte >= 0xF0 && byte <= 0xF4 ? 3 : 0;
}

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

/// Whether a byte is one of the upper control characters, U+0080 to U+009F, which terminals obey as well: alone, or as
/// the second byte of one in UTF-8. The first byte of that is taken back.
bool PlainLines::pIsUpperControl(unsigned char byte)
{
    const bool isUpper = byte >= 0x80 && byte <= 0x9F;
    if (byte < 0x80 || byte > 0xBF) {
        mToFollow = bytesToFollow(byte);
        mFirst = byte;
        return false;
    }
    if (mToFollow == 0) return isUpper;
    --mToFollow;
    const bool isControl = isUpper && std::exchange(mFirst, 0) == 0xC2;
    if (isControl && !mLine.empty()) mLine.pop_back();
    return isControl;
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
    if (isControl || pIsUpperControl(static_cast<unsigned char>(byte))) return;
    if (!std::exchange(mHasBegun, true)) onBegin();
    if (byte == '\n') return flush();
    mLine += byte;
    if (mLine.size() == kLongest) flush();
}

} // namespace qel::tool
