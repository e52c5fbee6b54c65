#include "console/LineInput.hpp"

#include <algorithm>
#include <cstddef>

namespace qel::tool {

namespace {

constexpr char kInterrupt = 'C' & 0x1F;
constexpr char kBackspace = 'H' & 0x1F;
constexpr char kKill = 'U' & 0x1F;
constexpr char kEscape = 0x1B;
constexpr char kDelete = 0x7F;
constexpr const char* kErase = "\b \b";

/// @return how many bytes at this place are from a cursor or function key; 0: none
std::size_t keyLength(const std::string& typed, std::size_t place)
{
    if (typed[place] != kEscape || place + 1 == typed.size()) return 0;
    const char kind = typed[place + 1];
    if (kind != '[' && kind != 'O') return 0;
    std::size_t end = place + 2;
    while (end < typed.size() && (typed[end] < '@' || typed[end] > '~'))
        ++end;
    return std::min(end + 1, typed.size()) - place;
}

/// True for a byte of UTF-8 that is not the first of its character.
bool continuesCharacter(char c) { return (static_cast<unsigned char>(c) & 0xC0U) == 0x80U; }

} // namespace

std::string LineInput::take(std::string& typed)
{
    std::size_t taken = 0;
    std::string shown;
    while (mState == State::Open && taken < typed.size()) {
        const std::size_t key = keyLength(typed, taken);
        shown += key > 0 ? "\a" : pTake(typed[taken]);
        taken += std::max<std::size_t>(key, 1);
    }
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
        pEraseCharacter();
        return kErase;
    case kKill: {
        std::string erased;
        for (; !mText.empty(); pEraseCharacter())
            erased += kErase;
        return erased;
    }
    default:
        break;
    }
    if (static_cast<unsigned char>(c) < ' ') return "\a";
    mText += c;
    return {c};
}

void LineInput::pEraseCharacter()
{
    while (mText.size() > 1 && continuesCharacter(mText.back()))
        mText.pop_back();
    mText.pop_back();
}

} // namespace qel::tool
