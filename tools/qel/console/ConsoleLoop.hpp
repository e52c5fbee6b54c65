#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/SerialSession.hpp>

#include "base/Library.hpp"
#include "base/SignalWatch.hpp"
#include "base/TerminalMode.hpp"
#include "console/AttentiveStream.hpp"
#include "console/ConsoleScreen.hpp"
#include "console/EscapeFilter.hpp"
#include "console/FileSender.hpp"
#include "console/HeldInput.hpp"
#include "console/KeepAlive.hpp"
#include "console/LineInput.hpp"
#include "console/LogFile.hpp"
#include "console/Recording.hpp"
#include "console/SessionScript.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <optional>
#include <string>
#include <vector>

namespace qel::tool {

/// What a console does with its input and its server.
struct InputOptions {
    /// The escape character on a terminal; none: there are no commands.
    std::optional<char> escape = '~';
    /// What the user calls the partition; empty: nothing.
    std::string partitionName;
    /// After how much silence of the server the user is told; 0: never.
    std::chrono::milliseconds keepAlive{0};

    // For input that is not a terminal:

    /// Send an end-of-file character at the end of the input.
    bool sendsEnd = true;
    /// After the end of the input, leave once the partition has sent nothing for this long.
    std::optional<std::chrono::milliseconds> linger;
};

/// What a session is written to, and what leads it. Borrowed.
struct SessionTools {
    std::vector<LogFile*> logs;
    Recording* recording = nullptr;
    SessionScript* script = nullptr; ///< instead of input that is not a terminal
};

/// Connects an open virtual serial session to an input and a screen. Moves bytes in both directions until the session
/// ends, the user leaves, the linger time passes, or a termination signal arrives.
///
/// One thread polls everything, and the directions do not wait for each other: output is read while the session takes
/// no input, and input is sent while the screen takes no output. Each direction buffers a few messages and then stops
/// reading from its source. The keyboard alone is always read, so that an escape command is seen, even while the
/// connection waits for the rest of a message (StreamAttendant): input that finds no room is held (HeldInput).
///
/// A terminal is in raw mode from the first run() to the end of this object, and the escape character introduces
/// commands (EscapeFilter).
///
/// Any other input is sent as it is. At its end the loop sends the end-of-file character, control-D (termios(3): VEOF),
/// as a person would type it. The partition's terminal delivers that character once, to the command that happens to
/// read, and drops it when a command changes the terminal's mode before reading. The end of the input is meant for all
/// commands, so the loop repeats the character after each second without output until the session ends. With a linger
/// time it is sent once, and the linger time ends the session.
///
/// Lifetime: borrows everything it is given. Thread safety: one thread.
class ConsoleLoop : private StreamAttendant {
public:
    enum class ExitReason {
        None,     ///< still running
        Left,     ///< the user left, or the terminal hung up
        Lingered, ///< the linger time passed
        Ended,    ///< the session ended: see SerialSession::getEnd()
        Force,    ///< the user wants the session to be opened again by force
        Signal,   ///< a termination signal arrived
    };
    struct Outcome {
        ExitReason reason = ExitReason::None;
        int signal = 0;             ///< its number for ExitReason::Signal, else 0
        std::size_t thrownAway = 0; ///< bytes of input that were read and not sent
    };

    /// Time without output after which the end-of-file character is repeated.
    static constexpr std::chrono::milliseconds kEndRepeat{1000};

    /// @param input  descriptor to read from
    /// @param mode  the terminal mode of `input`
    /// @param signals  watches the termination signals, SIGTSTP and SIGCONT. Signals that the process inherited as
    ///        ignored stay ignored.
    ConsoleLoop(ConsoleScreen& screen, int input, TerminalMode& mode, SignalWatch& signals, const InputOptions& options,
                SessionTools tools = {});

    /// Restores the terminal.
    ~ConsoleLoop() override;
    ConsoleLoop(const ConsoleLoop&) = delete;
    ConsoleLoop& operator=(const ConsoleLoop&) = delete;

    /// Moves bytes until there is a reason to exit. On return all output has been written. After ExitReason::Left and
    /// Signal some output may be dropped, since these do not wait for the screen.
    /// @param console  that of the session; its notices go to the handlers that it has
    /// @param stream  under the console: the keyboard is read while it waits; null: none
    /// @throws Error  the session failed; output received before the failure has been written
    /// @throws PosixError  reading the input or writing the output failed
    Outcome run(Console& console, SerialSession& session, AttentiveStream* stream = nullptr);

    /// Waits without a session, and reads the keyboard meanwhile; what is typed is thrown away.
    /// @return the reason to exit, if the user or a signal gives one
    Outcome wait(std::chrono::milliseconds duration);

    /// Attends to the keyboard in connections that are made between two sessions.
    StreamAttendant& attendant() { return *this; }

    /// Why run() or wait() ended, or what the user has asked for since.
    const Outcome& outcome() const noexcept { return mOutcome; }

private:
    PollSet attended() const override;
    bool attend(const PollResult& ready) noexcept override;

    void pBegin(Console& console, SerialSession& session);
    std::string pGreeting() const;
    std::string pLeaveHint(const char* text) const;
    bool pIsDone() const;
    bool pIsRunning() const { return mOutcome.reason == ExitReason::None; }
    bool pHasLeft() const { return mOutcome.reason == ExitReason::Left || mOutcome.reason == ExitReason::Signal; }
    bool pWantsInput() const;
    bool pWantsMessages() const;
    bool pWantsToSend() const;
    PollDeadline pEndDeadline() const;
    PollDeadline pDeadline() const;

    void pPollOnce();
    void pHandleSignal();
    void pSuspend();
    void pWriteOutput();
    void pReceive(bool isAnnounced);
    void pSend();
    void pReadInput();
    void pTakeTyped(const char* data, std::size_t length);
    void pHold(const std::string& typed);
    void pShowReceived();
    void pFollowScript();

    // The commands of the user: see ConsoleEscapes.cpp.
    void pExecute(EscapeFilter::Command command);
    void pExecuteInSession(EscapeFilter::Command command);
    void pLeave();
    void pTellAbout();
    void pToggleLogs();
    void pCycleStamps();
    void pToggleReadOnly();
    bool pMayType() const;
    void pSayWhyNot();
    void pTypeWindowSize();
    void pAskForFile();
    void pAnswerPrompt(std::string& typed);
    void pBeginFile(const std::string& typed);
    void pFeedFile();
    void pStopFile();
    void pEndFile(const char* text, std::uint64_t sent);
    void pNoteResize();
    void pReportFailures();

    void pEndInput();
    void pCheckEndTimer();
    void pCheckSilence();
    void pCheckHeld();
    void pReport(KeepAlive::Event event);
    void pExit(ExitReason reason);

    ConsoleScreen& mScreen;
    const int mInput;
    TerminalMode& mMode;
    SignalWatch& mSignals;
    const InputOptions mInputOptions;
    EscapeFilter mEscape;
    KeepAlive mKeepAlive;
    HeldInput mHeld;
    const SessionTools mTools;
    bool mIsReadOnly = false;
    std::optional<LineInput> mPrompt;   // the name of a file is asked for
    std::optional<FileSender> mFile;    // a file is being typed
    PollDeadline::time_point mToldAt{}; // how much of it

    // Of the current run(); null: none.
    Console* mConsole = nullptr;
    SerialSession* mSession = nullptr;
    std::uint64_t mReceived = 0;                         // bytes
    std::optional<PollDeadline::time_point> mLastOutput; // when the partition's last output came

    bool mMayBeTaken = false;               // input may have been read since poll(2) has announced it
    bool mIsAttending = false;              // inside a call of the library: it must not be called again
    bool mInputOpen = true;                 // false after the end of the input
    bool mSendBroken = false;               // sending failed; messages may still be received
    PollDeadline::time_point mQuietSince{}; // last output or input; used after the end of the input
    Outcome mOutcome;
    std::exception_ptr mFailure; // thrown once the output has been written
};

} // namespace qel::tool
