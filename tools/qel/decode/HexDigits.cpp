#include "decode/HexDigits.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"

#include <cctype>

namespace qel::tool {

namespace {

constexpr std::size_t kMaxShown = 40;

int valueOf(char digit)
{
    if (digit >= '0' && digit <= '9') return digit - '0';
    return std::tolower(static_cast<unsigned char>(digit)) - 'a' + 10;
}

bool isBlank(char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; }

[[noreturn]] void refuse(std::size_t lineNumber, const std::string& reason)
{
    throw CommandFailure(ExitStatus::Refused, "line " + std::to_string(lineNumber) + ": " + reason);
}

} // namespace

bool isHexDigit(char c) { return std::isxdigit(static_cast<unsigned char>(c)) != 0; }

char byteOf(char high, char low) { return static_cast<char>(valueOf(high) * 16 + valueOf(low)); }

void HexDigits::beginLine(std::size_t number)
{
    *this = HexDigits();
    mLineNumber = number;
}

void HexDigits::take(char c, std::string& bytes)
{
    if (mInComment) return;
    if (isBlank(c)) return pEndWord();
    if (c == '#') {
        pEndWord();
        mInComment = true;
        return;
    }
    const bool isPrefix = !mHasPrefix && mDigits == 1 && mHigh == '0' && (c == 'x' || c == 'X');
    if (isPrefix) {
        mHasPrefix = true;
        mPrefix = c;
        mDigits = 0;
        mShown.clear();
        return;
    }
    if (!isHexDigit(c)) pRefuse(mHasPrefix && mDigits == 0 ? mPrefix : c);
    if (mShown.size() < kMaxShown) mShown += c;
    if (++mDigits % 2 == 0) {
        bytes += byteOf(mHigh, c);
    } else {
        mHigh = c;
    }
}

void HexDigits::endLine() { pEndWord(); }

void HexDigits::pEndWord()
{
    if (mHasPrefix && mDigits == 0) pRefuse(mPrefix);
    if (mDigits % 2 != 0) {
        const std::string word = mShown + (mDigits > kMaxShown ? "..." : "");
        refuse(mLineNumber, "'" + word + "' is half a byte: write two digits for each");
    }
    mHasPrefix = false;
    mDigits = 0;
    mShown.clear();
}

void HexDigits::pRefuse(char c) const
{
    refuse(mLineNumber, "'" + printable(std::string(1, c)) + "' is not a hexadecimal digit");
}

} // namespace qel::tool
