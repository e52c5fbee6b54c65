#pragma once

#include <qel/common/util/Poll.hpp>

#include "console/SessionTap.hpp"

#include <chrono>
#include <cstddef>
#include <deque>
#include <memory>
#include <optional>
#include <regex.h>
#include <string>
#include <vector>

namespace qel::tool {

/// What to do in a session without a person: type texts, wait for output, run a command.
struct ScriptStep {
    enum class Kind {
        Send,   ///< types the text as it is
        Expect, ///< waits for output that matches the text, a POSIX extended regular expression
        Exec,   ///< runs the text as a command of the partition's shell and waits for its exit status
    };
    Kind kind = Kind::Send;
    std::string text;
};

/// Follows the steps of a script in a session. Each step begins when the one before it is done; output that came before
/// a step that expects some counts too, unless an earlier step has used it, or it came before the first text was typed.
///
/// A command runs as `sh -c COMMAND` between two marks that the shell prints. The marks are composed by the shell, so
/// that the echo of the typed line does not contain them.
/// Thread safety: one thread.
class SessionScript : public SessionTap {
public:
    /// The most bytes that a match may span; older output is forgotten.
    static constexpr std::size_t kWindow = 8192;

    using TimePoint = PollDeadline::time_point;

    /// @param timeout  for each step that waits
    /// @param mark  makes the marks of commands unique
    /// @throws std::invalid_argument  a regular expression is wrong: its text and the reason
    SessionScript(const std::vector<ScriptStep>& steps, std::chrono::milliseconds timeout, std::string mark);
    ~SessionScript() override;
    SessionScript(const SessionScript&) = delete;
    SessionScript& operator=(const SessionScript&) = delete;

    /// What has to be typed now.
    std::string takeInput(TimePoint now);

    void onOutput(const char* data, std::size_t length) override;

    bool isDone() const noexcept { return mSteps.empty(); }

    /// When the step that waits is late; disabled when none waits.
    PollDeadline deadline() const { return mDeadline; }

    std::chrono::milliseconds timeout() const noexcept { return mTimeout; }

    /// The step that waits, in words: `output that matches "login:"`.
    std::string waitsFor() const;

    /// The exit status of the first command that failed, or 0; none: no command has ended.
    std::optional<int> commandStatus() const noexcept { return mStatus; }

    /// What the commands have put out since the last call, without the marks, and with the line ends of the command
    /// instead of those of a terminal.
    std::string takeCommandOutput();

private:
    struct Pattern;
    struct Step {
        ScriptStep step;
        std::shared_ptr<Pattern> pattern; // of Expect
        bool hasBegun = false;
    };

    std::string pBegin(Step& step, TimePoint now);
    void pMatch();
    bool pMatchPattern(const Pattern& pattern);
    bool pMatchCommand();
    void pKeepCommandOutput(std::size_t end);
    void pFinish();

    const std::chrono::milliseconds mTimeout;
    const std::string mMark;
    std::deque<Step> mSteps;
    std::string mUnused; // output that no step has used
    PollDeadline mDeadline;
    bool mHasTyped = false;    // a text
    bool mIsInCommand = false; // its first mark has come
    std::string mCommandOutput;
    std::optional<int> mStatus;
};

/// The line that runs a command and prints the marks; without the return at its end.
std::string commandLineWithMarks(const std::string& command, const std::string& mark);

} // namespace qel::tool
