#include "decode/HexText.hpp"

#include "base/Failures.hpp"

#include <algorithm>
#include <cctype>
#include <exception>
#include <utility>

namespace qel::tool {

namespace {

constexpr const char* kBlanks = " \t\r\v\f";
constexpr std::size_t kPieceBytes = 4096; // far more than a row of any dump

// The first line of a golden frame, and the one before its rows.
constexpr const char* kGoldenBegin = "name:";
constexpr const char* kGoldenRows = "frame:";

[[noreturn]] void refuse(std::size_t lineNumber, const std::string& reason)
{
    throw CommandFailure(ExitStatus::Refused, "line " + std::to_string(lineNumber) + ": " + reason);
}

bool beginsWith(const std::string& line, const char* text) { return line.rfind(text, 0) == 0; }

} // namespace

HexTextBuffer::HexTextBuffer(std::istream& text) : mText(text) {}

HexTextBuffer::int_type HexTextBuffer::underflow()
{
    mBytes.clear();
    while (mBytes.empty()) {
        if (mRepeats > 0) {
            pRepeatRow();
        } else if (!pNextPiece()) {
            return traits_type::eof();
        }
    }
    setg(mBytes.data(), mBytes.data(), mBytes.data() + mBytes.size());
    return traits_type::to_int_type(mBytes.front());
}

bool HexTextBuffer::pNextPiece()
{
    const bool isNewLine = mEndsLine;
    if (!pReadPiece()) {
        if (mPart == Part::GoldenHead) refuse(mLineNumber, "the line 'frame:' is missing after it");
        return false;
    }
    if (isNewLine) {
        ++mLineNumber;
        pBeginLine();
    }
    if (!mSkipLine) pDecodePiece();
    return true;
}

/// @return false: the end of the text
bool HexTextBuffer::pReadPiece()
{
    const bool isNewLine = mEndsLine;
    mPiece.clear();
    mEndsLine = false;
    while (!mEndsLine && mPiece.size() < kPieceBytes) {
        const int_type c = pReadCharacter();
        if (traits_type::eq_int_type(c, traits_type::eof())) {
            mEndsLine = true;
            return !(mPiece.empty() && isNewLine);
        }
        mEndsLine = traits_type::to_char_type(c) == '\n';
        if (!mEndsLine) mPiece += traits_type::to_char_type(c);
    }
    return true;
}

/// A failure to read sets badbit, as the functions of a stream do.
HexTextBuffer::int_type HexTextBuffer::pReadCharacter()
{
    try {
        return mText.good() ? mText.rdbuf()->sbumpc() : traits_type::eof();
    } catch (const std::exception&) {
        mText.setstate(std::ios::badbit);
        return traits_type::eof();
    }
}

/// Recognizes the kind of the line and removes everything but digits of bytes.
void HexTextBuffer::pBeginLine()
{
    mSkipLine = false;
    mDigits.beginLine(mLineNumber);
    if (beginsWith(mPiece, kGoldenBegin)) mPart = Part::GoldenHead;
    if (mPart == Part::GoldenHead) {
        if (beginsWith(mPiece, kGoldenRows)) mPart = Part::GoldenRows;
        mSkipLine = true;
    } else if (mPart == Part::GoldenRows) {
        pDropFirstWord();
    } else if (mEndsLine && pDecodeDump()) {
        mSkipLine = true;
    } else {
        mRow.reset();
        mSqueezed = false;
        pDropAddress();
    }
}

/// @return false: the line is not part of a dump with a character column
bool HexTextBuffer::pDecodeDump()
{
    if (const auto row = parseXxdRow(mPiece)) {
        mBytes += row->bytes;
        return true;
    }
    if (const auto row = parseHexdumpRow(mPiece)) {
        pSkipTo(row->offset);
        mNextRow = row;
        if (mRepeats == 0) pEndRepeats();
        return true;
    }
    if (!mRow) return false;
    const std::size_t last = mPiece.find_last_not_of(kBlanks);
    if (last == 0 && mPiece[0] == '*') {
        mSqueezed = true;
        return true;
    }
    const auto end = parseHexdumpEnd(mPiece);
    if (!end || (!mSqueezed && *end != mRow->offset + mRow->bytes.size())) return false;
    pSkipTo(*end);
    return true;
}

/// Repeats the row in place of a "*".
void HexTextBuffer::pSkipTo(std::uint64_t offset)
{
    if (!mSqueezed) return;
    mSqueezed = false;
    const std::uint64_t size = mRow->bytes.size();
    const std::uint64_t begin = mRow->offset + size;
    if (offset < begin || (offset - begin) % size != 0) {
        refuse(mLineNumber, "the offset does not fit a repetition of the row before '*'");
    }
    mRepeats = (offset - begin) / size;
}

void HexTextBuffer::pRepeatRow()
{
    for (; mRepeats > 0 && mBytes.size() < kPieceBytes; --mRepeats)
        mBytes += mRow->bytes;
    if (mRepeats == 0) pEndRepeats();
}

/// Goes on with the row after the repeated ones, if there is one.
void HexTextBuffer::pEndRepeats()
{
    if (!mNextRow) return;
    mBytes += mNextRow->bytes;
    mRow = std::move(mNextRow);
    mNextRow.reset();
}

void HexTextBuffer::pDropAddress()
{
    const std::size_t begin = mPiece.find_first_not_of(kBlanks);
    if (begin == std::string::npos) return;
    std::size_t end = begin;
    while (end < mPiece.size() && isHexDigit(mPiece[end]))
        ++end;
    if (end > begin && end < mPiece.size() && mPiece[end] == ':') mPiece.erase(0, end + 1);
}

void HexTextBuffer::pDropFirstWord()
{
    const std::size_t begin = std::min(mPiece.find_first_not_of(kBlanks), mPiece.size());
    if (begin < mPiece.size() && mPiece[begin] == '#') return;
    mPiece.erase(0, std::min(mPiece.find_first_of(" \t\r\v\f#", begin), mPiece.size()));
}

void HexTextBuffer::pDecodePiece()
{
    for (const char c : mPiece)
        mDigits.take(c, mBytes);
    if (mEndsLine) mDigits.endLine();
}

bool looksLikeHexText(std::istream& input)
{
    const auto first = input.peek();
    if (first == std::istream::traits_type::eof()) return false;
    const auto c = static_cast<unsigned char>(std::istream::traits_type::to_char_type(first));
    return (c >= ' ' && c <= '~') || std::isspace(c) != 0;
}

} // namespace qel::tool
