#pragma once

#include <optional>
#include <string>

namespace qel::tool {

/// A line that a person types at a terminal in raw mode, with the keys to correct it: backspace, control-U; return
/// ends it, control-C and escape cancel it. Other control characters ring the bell, and so do cursor and function keys,
/// which send several bytes at once that begin with escape.
/// Thread safety: one thread.
class LineInput {
public:
    enum class State { Open, Done, Cancelled };

    /// Takes typed bytes up to the end of the line; the bytes that were taken are removed.
    /// @return what to show for them on the terminal
    std::string take(std::string& typed);

    State state() const noexcept { return mState; }
    const std::string& text() const noexcept { return mText; }

private:
    std::string pTake(char c);
    void pEraseCharacter();

    std::string mText;
    State mState = State::Open;
};

} // namespace qel::tool
