#pragma once

#include <termios.h>

namespace qel::tool {

/// Puts a terminal into raw mode, in which every key goes through as it is typed and nothing is done to what is
/// printed, and puts it back as it was: when told, and in any case when this object goes.
///
/// For a descriptor that is no terminal nothing is ever done. Whoever stops this process in between stops it in raw
/// mode unless restore() came first. Sources: termios(3), tty_ioctl(4).
///
/// Ownership: borrows the descriptor. Thread safety: one thread.
class TerminalMode {
public:
    /// Changes nothing yet.
    explicit TerminalMode(int descriptor) noexcept;

    /// restore()
    ~TerminalMode();

    TerminalMode(const TerminalMode&) = delete;
    TerminalMode& operator=(const TerminalMode&) = delete;

    bool isTerminal() const noexcept { return mIsTerminal; }

    /// True from enterRaw() to restore(): a line end must be written as "\r\n".
    bool isRaw() const noexcept { return mIsRaw; }

    /// Puts the terminal into raw mode, again if need be: somebody else may have changed it. What restore() goes back
    /// to is what was found the first time. Typed characters that nobody has read yet are kept.
    /// @throws PosixError  the terminal's mode cannot be changed
    void enterRaw();

    /// Puts the terminal back. Leaves it alone while it serves another job of the shell, which has its own idea of it.
    void restore() noexcept;

private:
    int mDescriptor;
    bool mIsTerminal;
    bool mIsRaw = false;
    bool mIsKnown = false; ///< mOriginal is set
    termios mOriginal{};
};

/// What ends a line that is written to a descriptor: "\r\n" for a terminal that does nothing to what is printed, as one
/// in raw mode, whoever put it there; "\n" for everything else. Sets errno for what is no terminal.
const char* lineEndOf(int descriptor) noexcept;

} // namespace qel::tool
