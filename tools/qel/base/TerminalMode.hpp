#pragma once

#include <termios.h>

namespace qel::tool {

/// Puts a terminal into raw mode, in which keys are delivered as typed and output is unprocessed (termios(3)), and
/// restores its mode in restore() or at the latest on destruction.
///
/// Does nothing for a descriptor that is not a terminal. Call restore() before stopping this process; otherwise the
/// terminal stays in raw mode while the process is stopped.
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

    /// Puts the terminal into raw mode, also when it was in raw mode before: another process may have changed it. Keeps
    /// unread input. The first call saves the mode that restore() sets.
    /// @throws PosixError  the terminal's mode cannot be read or changed
    void enterRaw();

    /// Restores the saved mode. Does nothing while another job of the shell is in the foreground, which sets a mode of
    /// its own.
    void restore() noexcept;

private:
    int mDescriptor;
    bool mIsTerminal;
    bool mIsRaw = false;
    bool mIsKnown = false; ///< true when mOriginal is set
    termios mOriginal{};
};

/// The line end for a descriptor: "\r\n" for a terminal without output processing, as in raw mode; "\n" for everything
/// else. Sets errno when the descriptor is not a terminal.
const char* lineEndOf(int descriptor) noexcept;

} // namespace qel::tool
