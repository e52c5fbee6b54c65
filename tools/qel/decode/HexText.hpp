#pragma once

#include "decode/DumpRow.hpp"
#include "decode/HexDigits.hpp"

#include <cstddef>
#include <cstdint>
#include <istream>
#include <optional>
#include <streambuf>
#include <string>

namespace qel::tool {

/// Reads hexadecimal text as the bytes it stands for. Memory use does not depend on the length of a line.
///
/// Two digits are a byte, upper or lower case. Blanks, tabs and line ends may separate bytes; a word may begin with
/// "0x"; "#" begins a comment that ends with the line; digits before ":" at the start of a line are an address.
///
/// Rows of `xxd` and `hexdump -C` are read without their offset and character columns. A "*" of `hexdump -C` repeats
/// the row before it up to the next offset.
///
/// Golden frames (vectors/README.md describes the form) are read too, one or several: the lines from "name:" through
/// "frame:" are skipped, and each line after that begins with an address.
///
/// Lifetime: borrows the text, which must outlive this object.
/// Reading throws CommandFailure (Refused) for any other character, for half a byte, and for a golden frame without
/// "frame:". A stream over this buffer passes exceptions on only when its exceptions() include std::ios::badbit.
class HexTextBuffer : public std::streambuf {
public:
    explicit HexTextBuffer(std::istream& text);

protected:
    int_type underflow() override;

private:
    enum class Part { Plain, GoldenHead, GoldenRows };

    bool pNextPiece();
    bool pReadPiece();
    int_type pReadCharacter();
    void pBeginLine();
    bool pDecodeDump();
    void pSkipTo(std::uint64_t offset);
    void pRepeatRow();
    void pEndRepeats();
    void pDropAddress();
    void pDropFirstWord();
    void pDecodePiece();

    std::istream& mText;
    Part mPart = Part::Plain;
    std::string mPiece;     // of a line: all of it unless the line is long
    bool mEndsLine = true;  // the piece does
    bool mSkipLine = false; // the rest of the line has no bytes
    std::size_t mLineNumber = 0;
    HexDigits mDigits;
    std::string mBytes; // decoded from the piece

    std::optional<DumpRow> mRow;     // the last one of hexdump -C; none: other text came after it
    bool mSqueezed = false;          // a "*" came after it
    std::uint64_t mRepeats = 0;      // of mRow that are still to come
    std::optional<DumpRow> mNextRow; // comes after them
};

/// True when the stream holds text rather than raw frames, whose first byte is not text.
/// Looks at the first character without removing it.
bool looksLikeHexText(std::istream& input);

} // namespace qel::tool
