#pragma once

#include <cstddef>
#include <istream>
#include <streambuf>
#include <string>

namespace qel::tool {

/// Reads hexadecimal text as the bytes it stands for, so that whatever reads bytes from a stream can read a dump.
///
/// Two digits are a byte, upper or lower case. Blanks, tabs and line ends may stand between digits, "0x" before them;
/// "#" begins a comment that goes to the end of the line; digits that end in ":" are an address and are passed over.
///
/// The files of golden frames are such text, too (vectors/README.md has their form), one or several behind each other:
/// a line that begins with "name:" and all others up to "frame:" are passed over, and what the lines behind that begin
/// with is an address.
///
/// Lifetime: borrows the text, which must outlive this object.
/// Reading throws CommandFailure (Refused) for any other character, for a byte of which the second digit is missing,
/// and for a golden frame without its "frame:"; a stream over this buffer passes it on only when its exceptions are
/// switched on for std::ios::badbit.
class HexTextBuffer : public std::streambuf {
public:
    explicit HexTextBuffer(std::istream& text);

protected:
    int_type underflow() override;

private:
    enum class Part { Plain, GoldenHead, GoldenRows };

    bool pNextLine();
    void pPassOver();
    void pDecodeLine();

    std::istream& mText;
    Part mPart = Part::Plain;
    std::string mLine;
    std::size_t mLineNumber = 0;
    std::string mBytes; // what the current line stands for
};

/// True when the stream holds text rather than raw frames, which begin with a byte that is no text.
/// Looks at the first character and takes nothing.
bool looksLikeHexText(std::istream& input);

} // namespace qel::tool
