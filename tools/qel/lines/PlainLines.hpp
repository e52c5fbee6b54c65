#pragma once

#include <cstddef>
#include <functional>
#include <string>

namespace qel::tool {

/// Turns the output of a terminal line into lines of plain text: control sequences and control characters are left out,
/// tabs stay. A line ends with a line feed, with a carriage return that follows text, with both, or when it is kLongest
/// bytes long. Bytes above 0x7F pass, so text in UTF-8 does; but not the control characters U+0080 to U+009F, as bytes
/// or in UTF-8.
/// Thread safety: none of its own.
class PlainLines {
public:
    static constexpr std::size_t kLongest = 4096;

    /// @param onLine  gets each line without its end
    explicit PlainLines(std::function<void(const std::string& line)> onLine);

    /// @param onBegin  called before the first byte of a line is kept: the time of the line
    void feed(const char* data, std::size_t length, const std::function<void()>& onBegin);

    /// Ends the line that has begun, if any.
    void flush();

private:
    enum class State {
        Text,
        Escape,       ///< after ESC
        Intermediate, ///< after ESC and an intermediate byte
        Control,      ///< in a control sequence: ESC [
        String,       ///< in a string: ESC ], P, X, ^ or _; it ends with BEL or ESC backslash
        StringEscape  ///< after ESC in a string
    };

    void pText(char byte, const std::function<void()>& onBegin);
    State pAfterEscape(char byte) const;
    bool pIsUpperControl(unsigned char byte);
    State pNext(char byte, const std::function<void()>& onBegin);

    const std::function<void(const std::string&)> mOnLine;
    State mState = State::Text;
    std::string mLine;
    bool mHasBegun = false;      ///< a byte of the line has come
    bool mEndedByReturn = false; ///< a carriage return has just ended a line
    int mToFollow = 0;           ///< bytes of a character in UTF-8 that are missing
    unsigned char mFirst = 0;    ///< the byte before, if a character in UTF-8 may begin with it
};

} // namespace qel::tool
