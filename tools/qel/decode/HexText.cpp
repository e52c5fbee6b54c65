#include "decode/HexText.hpp"

#include "base/Failures.hpp"
#include "base/Text.hpp"

#include <algorithm>
#include <cctype>
#include <string>

namespace qel::tool {

namespace {

constexpr const char* kBlanks = " \t\r\v\f";

// The first line of a golden frame, and the one before its rows.
constexpr const char* kGoldenBegin = "name:";
constexpr const char* kGoldenRows = "frame:";

bool isHexDigit(char c) { return std::isxdigit(static_cast<unsigned char>(c)) != 0; }

int valueOf(char digit)
{
    if (digit >= '0' && digit <= '9') return digit - '0';
    return std::tolower(static_cast<unsigned char>(digit)) - 'a' + 10;
}

[[noreturn]] void refuse(std::size_t lineNumber, const std::string& reason)
{
    throw CommandFailure(ExitStatus::Refused, "line " + std::to_string(lineNumber) + ": " + reason);
}

std::string shortened(const std::string& text)
{
    constexpr std::size_t kLongest = 40;
    return text.size() <= kLongest ? text : text.substr(0, kLongest) + "...";
}

/// Takes the address off the front of the line, if it begins with one.
void dropAddress(std::string& line)
{
    const std::size_t begin = line.find_first_not_of(kBlanks);
    if (begin == std::string::npos) return;
    std::size_t end = begin;
    while (end < line.size() && isHexDigit(line[end]))
        ++end;
    if (end > begin && end < line.size() && line[end] == ':') line.erase(0, end + 1);
}

/// Takes the first word off the line: the address of a row that ends it with a blank alone.
void dropFirstWord(std::string& line)
{
    const std::size_t begin = std::min(line.find_first_not_of(kBlanks), line.size());
    line.erase(0, line.find_first_of(kBlanks, begin));
}

bool beginsWith(const std::string& line, const char* text) { return line.rfind(text, 0) == 0; }

/// The digits of one word, without the "0x" it may begin with.
std::string digitsOf(const std::string& word, std::size_t lineNumber)
{
    const bool prefixed = word.size() > 2 && word[0] == '0' && (word[1] == 'x' || word[1] == 'X');
    const std::string digits = prefixed ? word.substr(2) : word;
    for (const char c : digits) {
        if (!isHexDigit(c)) refuse(lineNumber, "'" + printable(std::string(1, c)) + "' is no hexadecimal digit");
    }
    if (digits.size() % 2 != 0) refuse(lineNumber, "'" + shortened(digits) + "' is not a whole number of bytes");
    return digits;
}

} // namespace

HexTextBuffer::HexTextBuffer(std::istream& text) : mText(text) {}

HexTextBuffer::int_type HexTextBuffer::underflow()
{
    do {
        if (!pNextLine()) return traits_type::eof();
        pDecodeLine();
    } while (mBytes.empty());
    setg(mBytes.data(), mBytes.data(), mBytes.data() + mBytes.size());
    return traits_type::to_int_type(mBytes.front());
}

bool HexTextBuffer::pNextLine()
{
    if (!std::getline(mText, mLine)) {
        if (mPart == Part::GoldenHead) refuse(mLineNumber, "the line 'frame:' is missing behind it");
        return false;
    }
    ++mLineNumber;
    pPassOver();
    return true;
}

/// Takes everything off the line that stands for no bytes.
void HexTextBuffer::pPassOver()
{
    if (beginsWith(mLine, kGoldenBegin)) mPart = Part::GoldenHead;
    if (mPart == Part::GoldenHead) {
        if (beginsWith(mLine, kGoldenRows)) mPart = Part::GoldenRows;
        mLine.clear();
        return;
    }
    mLine.erase(std::min(mLine.find('#'), mLine.size()));
    if (mPart == Part::GoldenRows) {
        dropFirstWord(mLine);
    } else {
        dropAddress(mLine);
    }
}

void HexTextBuffer::pDecodeLine()
{
    mBytes.clear();
    std::size_t begin = mLine.find_first_not_of(kBlanks);
    while (begin != std::string::npos) {
        const std::size_t end = std::min(mLine.find_first_of(kBlanks, begin), mLine.size());
        const std::string digits = digitsOf(mLine.substr(begin, end - begin), mLineNumber);
        for (std::size_t i = 0; i < digits.size(); i += 2) {
            mBytes += static_cast<char>(valueOf(digits[i]) * 16 + valueOf(digits[i + 1]));
        }
        begin = mLine.find_first_not_of(kBlanks, end);
    }
}

bool looksLikeHexText(std::istream& input)
{
    const auto first = input.peek();
    if (first == std::istream::traits_type::eof()) return false;
    const auto c = static_cast<unsigned char>(std::istream::traits_type::to_char_type(first));
    return (c >= ' ' && c <= '~') || std::isspace(c) != 0;
}

} // namespace qel::tool
