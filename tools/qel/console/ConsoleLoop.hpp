#pragma once

#include <qel/common/util/Poll.hpp>

#include "base/SignalWatch.hpp"
#include "base/TerminalMode.hpp"
#include "console/ConsoleScreen.hpp"
#include "console/ConsoleSession.hpp"
#include "console/EscapeFilter.hpp"

#include <chrono>
#include <exception>
#include <optional>
#include <string>

namespace qel::tool {

/// How a console treats its input.
struct ConsoleManners {
    /// For a terminal: the escape character, if there is one.
    std::optional<char> escape = '~';

    // For anything else:

    /// The partition is told when the input has ended.
    bool tellsEnd = true;
    /// The session is left when the partition has been silent for this long after the end of the input.
    std::optional<std::chrono::milliseconds> linger;
};

/// Joins an open virtual serial session to an input and a screen: moves bytes in both directions until the session
/// ends, the person leaves, the input has ended and nothing more is to be expected, or a signal asks this process to
/// end.
///
/// One thread waits on everything at once, and neither direction waits for the other: the session is read while it
/// takes no input, and written to while the screen takes no output. In each direction no more is kept than fits some
/// messages, so that whoever is too fast is slowed down instead.
///
/// A terminal is in raw mode meanwhile, and an escape character types commands to this program (EscapeFilter).
///
/// Any other input is sent as it is. Where it ends, the partition is told as a person would tell it: by the end-of-file
/// character, control-D (termios(3): VEOF). A terminal hands that character to whichever command happens to read, once;
/// and one that is typed ahead of a command which changes the terminal's mode is lost. An input that has ended has
/// ended for all commands, so the character is sent again after every second in which the partition put nothing out,
/// until the session ends. With a linger time it is sent once: then the time ends the session.
///
/// Lifetime: borrows everything it is given. Thread safety: one thread.
class ConsoleLoop {
public:
    enum class Departure {
        None,     ///< still there
        Left,     ///< the person left, or the terminal is gone
        Lingered, ///< the linger time has passed
        Ended,    ///< the session ended: see ConsoleSession::getEnd()
        Signal,   ///< a signal asked this process to end
    };
    struct Outcome {
        Departure departure = Departure::None;
        int signal = 0; ///< which one; 0 unless it was a signal
    };

    /// How long the partition must be silent before it is told again that the input has ended.
    static constexpr std::chrono::milliseconds kTellAgain{1000};

    /// @param input  a descriptor to read from
    /// @param mode  that of the input
    /// @param signals  watches those that ask this process to end, SIGTSTP and SIGCONT. What the process was started to
    ///        ignore is ignored.
    ConsoleLoop(ConsoleSession& session, ConsoleScreen& screen, int input, TerminalMode& mode, SignalWatch& signals,
                const ConsoleManners& manners);

    /// Moves bytes until there is a reason to depart. Then the terminal is in its own mode again, and everything the
    /// partition put out has been written, except when the person left or a signal came: those do not wait for an
    /// output that takes nothing.
    /// @throws CommandFailure, StreamIOException, QelMessageValidationException  the session broke; what came before
    /// has
    ///         been written
    /// @throws PosixError  reading the input or writing the output failed
    Outcome run();

private:
    bool pIsDone() const;
    bool pWantsInput() const;
    bool pWantsMessages() const;
    bool pWantsToSend() const;
    PollDeadline pDeadline() const;

    void pTurn();
    void pHandleSignal();
    void pSuspend();
    void pWriteOutput();
    void pReceive();
    void pSend();
    void pReadInput();
    void pTakeTyped(const char* data, std::size_t length);
    void pObey(EscapeFilter::Command command);
    void pEndInput();
    void pLookAtTime();
    void pDepart(Departure departure);

    ConsoleSession& mSession;
    ConsoleScreen& mScreen;
    const int mInput;
    TerminalMode& mMode;
    SignalWatch& mSignals;
    const ConsoleManners mManners;
    EscapeFilter mEscape;

    std::string mPending;     // input, to be sent
    bool mInputOpen = true;   // more may come
    bool mSendBroken = false; // the connection takes nothing any more; what it still holds for us may be read
    PollDeadline::time_point mQuietSince{}; // of the partition, and of us; meaningful once the input has ended
    Outcome mOutcome;
    std::exception_ptr mFailure; // why the session broke, until the output has been written
};

} // namespace qel::tool
