#include "console/LineInput.hpp"

#include <cstddef>

namespace qel::tool {

namespace {

constexpr char kInterrupt = 'C' & 0x1F;
constexpr char kBackspace = 'H' & 0x1F;
constexpr char kKill = 'U' & 0x1F;
constexpr char kEscape = 0x1B;
constexpr char kDelete = 0x7F;
constexpr const char* kErase = "\b \b";

} // namespace

std::string LineInput::take(std::string& typed)
{
    std::size_t taken = 0;
    std::string shown;
    while (mState == State::Open && taken < typed.size())
        shown += pTake(typed[taken++]);
    typed.erase(0, taken);
    return shown;
}

std::string LineInput::pTake(char c)
{
    switch (c) {
    case '\r':
    case '\n':
        mState = State::Done;
        return "\r\n";
    case kInterrupt:
    case kEscape:
        mState = State::Cancelled;
        return "\r\n";
    case kBackspace:
    case kDelete:
        if (mText.empty()) return "\a";
        mText.pop_back();
        return kErase;
    case kKill: {
        std::string erased;
        for (std::size_t i = 0; i < mText.size(); ++i)
            erased += kErase;
        mText.clear();
        return erased;
    }
    default:
        break;
    }
    if (static_cast<unsigned char>(c) < ' ') return "\a";
    mText += c;
    return {c};
}

} // namespace qel::tool
