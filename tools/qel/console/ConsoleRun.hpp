#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/SerialSession.hpp>

#include "base/ExitStatus.hpp"
#include "base/Library.hpp"
#include "base/TerminalMode.hpp"
#include "base/TimeStamps.hpp"
#include "client/ConnectOptions.hpp"
#include "console/ConsoleConnection.hpp"
#include "console/ConsoleLoop.hpp"
#include "console/ConsoleScreen.hpp"
#include "console/LogFile.hpp"
#include "console/MessageStream.hpp"
#include "console/Recording.hpp"
#include "console/SessionScript.hpp"

#include <chrono>
#include <exception>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace qel::tool {

/// What "qel console" is to do.
struct ConsoleRunOptions {
    ConnectOptions connect;
    std::uint16_t partition = 0;
    std::string name; ///< of the partition, for its user; empty: none
    SerialOptions serial;
    bool watch = false;     ///< with the first connection number from 1 on that is free
    bool reconnect = false; ///< when the connection is lost
    InputOptions input;
    TimeStamps::Style stamps = TimeStamps::Style::Off;
    std::string log;      ///< path; empty: none, here and below
    std::string logStrip; ///< path
    std::string record;   ///< path
    std::vector<ScriptStep> steps;
};

/// One run of "qel console", from the first connection to the end.
/// Thread safety: one thread.
class ConsoleRun {
public:
    /// Opens the files. @throws FileIOError  one cannot be written
    explicit ConsoleRun(const ConsoleRunOptions& options);

    /// Connects, opens the session, moves data, and leaves.
    /// @throws CommandFailure, and what connectConsole() throws
    ExitStatus run();

    /// With --exec: the exit status of the first command that failed, or 0; none: no command has ended.
    std::optional<int> commandStatus() const { return mScript ? mScript->commandStatus() : std::nullopt; }

private:
    using TimePoint = std::chrono::steady_clock::time_point;

    SessionTools pAttachTools();
    void pUse(ConsoleConnection&& connection);
    void pOpen(TimePoint end);
    SerialSession pOpenFirstFree(TimePoint end);
    void pOpenAgain(ConsoleLoop& loop);
    bool pTypesTexts() const;
    void pAwaitReplay();
    ConsoleLoop::Outcome pRunLoop(const SessionTools& tools);
    bool pRunOnce(ConsoleLoop& loop, ConsoleLoop::Outcome& outcome);
    bool pReconnect(ConsoleLoop& loop, const std::string& reason);
    bool pTryToReconnect(ConsoleLoop& loop, std::chrono::milliseconds& delay);
    void pMarkGap(const std::string& text);
    void pClose();
    void pLeave() noexcept;
    ExitStatus pConclude(const ConsoleLoop::Outcome& outcome, SessionEnd end, const std::string& endText);
    ExitStatus pStatusOf(SessionEnd end) const;
    std::string pRefusalText(const StatusError& refusal) const;
    std::string pLeftText(const ConsoleLoop::Outcome& outcome) const;
    std::string pThrownAwayText(const ConsoleLoop::Outcome& outcome) const;
    void pTellThrownAway(const ConsoleLoop::Outcome& outcome);

    const ConsoleRunOptions mOptions;
    TerminalMode mMode;
    MessageStream mMessages;
    ConsoleScreen mScreen;
    std::optional<LogFile> mLog;
    std::optional<LogFile> mStrippedLog;
    std::optional<Recording> mRecording;
    std::optional<SessionScript> mScript;
    SerialOptions mSerial; // of the session that is open
    std::vector<IPEndpoint> mKnown;
    std::optional<ConsoleConnection> mConnection;
    std::optional<SerialSession> mSession; // after the connection: it uses it
};

} // namespace qel::tool
