#include "console/ControlStripper.hpp"

namespace qel::tool {

namespace {

constexpr char kEscape = 0x1B;
constexpr char kBell = 0x07;
constexpr char kCancel = 0x18;
constexpr char kSubstitute = 0x1A;
constexpr unsigned char kFirstPrintable = 0x20;
constexpr unsigned char kFirstFinal = 0x40; // ends a control sequence, as the bytes after it to 0x7E
constexpr unsigned char kDelete = 0x7F;

bool isText(unsigned char byte) { return (byte >= kFirstPrintable && byte != kDelete) || byte == '\n' || byte == '\t'; }

} // namespace

void ControlStripper::append(const char* data, std::size_t length, std::string& out)
{
    for (std::size_t i = 0; i < length; ++i)
        pTake(data[i], out);
}

void ControlStripper::pTake(char c, std::string& out)
{
    const auto byte = static_cast<unsigned char>(c);
    if (c == kCancel || c == kSubstitute) { // end any sequence
        mState = State::Text;
        return;
    }
    switch (mState) {
    case State::Text:
        if (c == kEscape) {
            mState = State::Escape;
        } else if (isText(byte)) {
            out += c;
        }
        return;
    case State::Escape:
        mState = pAfterEscape(byte);
        return;
    case State::Sequence:
        if (c == kEscape) {
            mState = State::Escape;
        } else if (byte >= kFirstFinal) {
            mState = State::Text;
        }
        return;
    case State::String:
        if (c == kBell) mState = State::Text;
        if (c == kEscape) mState = State::StringEscape;
        return;
    case State::StringEscape:
        mState = c == '\\' ? State::Text : pAfterEscape(byte);
        return;
    }
}

ControlStripper::State ControlStripper::pAfterEscape(unsigned char byte)
{
    constexpr unsigned char kFirstPlainFinal = 0x30;
    switch (byte) {
    case '[':
        return State::Sequence;
    case ']':
    case 'P':
    case 'X':
    case '^':
    case '_':
        return State::String;
    case kEscape:
        return State::Escape;
    default: // further bytes below 0x30 belong to the sequence
        return byte < kFirstPlainFinal ? State::Escape : State::Text;
    }
}

} // namespace qel::tool
