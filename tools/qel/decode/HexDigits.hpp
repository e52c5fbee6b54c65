#pragma once

#include <cstddef>
#include <string>

namespace qel::tool {

bool isHexDigit(char c);

/// The byte that two hexadecimal digits stand for.
char byteOf(char high, char low);

/// Reads words of hexadecimal digits character by character, in constant memory: two digits are a byte, blanks separate
/// words, a word may begin with "0x", and "#" begins a comment.
/// Thread safety: one thread.
class HexDigits {
public:
    /// Starts a line. @param number  for messages
    void beginLine(std::size_t number);

    /// @param bytes  a complete byte is appended
    /// @throws CommandFailure  Refused: not a hexadecimal digit, or half a byte
    void take(char c, std::string& bytes);

    /// @throws CommandFailure  Refused: half a byte
    void endLine();

private:
    void pEndWord();
    [[noreturn]] void pRefuse(char c) const;

    std::size_t mLineNumber = 0;
    bool mInComment = false;
    bool mHasPrefix = false; // the word begins with "0x"
    char mPrefix = 'x';      // or 'X'
    std::size_t mDigits = 0; // of the word
    char mHigh = '0';        // the first digit of a byte
    std::string mShown;      // the beginning of the word, for messages
};

} // namespace qel::tool
