#pragma once

#include <cstddef>
#include <string>

namespace qel::tool {

/// Removes from a terminal's output what is not text: control sequences (ECMA-48: CSI, OSC and other strings, escape
/// sequences) and control characters other than the line feed and the tab. Bytes above 0x7F are text, as in UTF-8.
/// The output comes in pieces; a sequence may be split between them.
/// Thread safety: one thread.
class ControlStripper {
public:
    /// Appends the text in these bytes to `out`.
    void append(const char* data, std::size_t length, std::string& out);

private:
    enum class State {
        Text,
        Escape,      // after ESC
        Sequence,    // after ESC [
        String,      // after ESC ] and the like, up to BEL or ESC backslash
        StringEscape // ESC within a string
    };

    void pTake(char c, std::string& out);
    static State pAfterEscape(unsigned char byte);

    State mState = State::Text;
};

} // namespace qel::tool
