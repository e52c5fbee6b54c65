#include "console/SessionScript.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "console/ConsoleTexts.hpp"

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstdlib>
#include <stdexcept>
#include <utility>

namespace qel::tool {

namespace {

constexpr const char* kBegin = "qel-begin-";
constexpr const char* kEnd = "qel-end-";
constexpr char kDelete = 0x7F;

/// In single quotes for a shell.
std::string shellQuoted(const std::string& text)
{
    std::string quoted = "'";
    for (const char c : text)
        quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return quoted + "'";
}

/// What sh -c runs. Control characters, which a terminal or the editor of a shell would act on, are made by printf.
std::string shellText(const std::string& command)
{
    const auto isControl = [](char c) { return static_cast<unsigned char>(c) < ' ' || c == kDelete; };
    if (std::none_of(command.begin(), command.end(), isControl)) return shellQuoted(command);
    std::string text;
    for (const char c : command) {
        std::array<char, 8> octal{};
        std::snprintf(octal.data(), octal.size(), "\\0%03o", static_cast<unsigned int>(c));
        text += c == '\\' ? "\\\\" : isControl(c) ? octal.data() : std::string(1, c);
    }
    return "\"$(printf %b " + shellQuoted(text) + ")\"";
}

} // namespace

/// A compiled regular expression. That of POSIX does not recurse, as std::regex does, so that no output can exhaust the
/// stack.
struct SessionScript::Pattern {
    explicit Pattern(const std::string& text)
    {
        const int error = ::regcomp(&regex, text.c_str(), REG_EXTENDED | REG_NEWLINE);
        if (error == 0) return;
        std::array<char, 256> reason{};
        ::regerror(error, &regex, reason.data(), reason.size());
        throw std::invalid_argument(filled(texts::kNotARegex, {quoted(text), reason.data()}));
    }
    ~Pattern() { ::regfree(&regex); }
    Pattern(const Pattern&) = delete;
    Pattern& operator=(const Pattern&) = delete;

    regex_t regex{};
};

std::string commandLineWithMarks(const std::string& command, const std::string& mark)
{
    return std::string("printf '%s%s\\n' ") + kBegin + " " + mark + "; sh -c " + shellText(command) +
           " </dev/null; printf '%s%s:%d\\n' " + kEnd + " " + mark + " $?";
}

SessionScript::SessionScript(const std::vector<ScriptStep>& steps, std::chrono::milliseconds timeout, std::string mark)
    : mTimeout(timeout), mMark(std::move(mark))
{
    for (const ScriptStep& step : steps) {
        const bool isExpect = step.kind == ScriptStep::Kind::Expect;
        mSteps.push_back({step, isExpect ? std::make_shared<Pattern>(step.text) : nullptr});
    }
}

SessionScript::~SessionScript() = default;

std::string SessionScript::takeInput(TimePoint now)
{
    std::string input;
    while (!mSteps.empty() && !mSteps.front().hasBegun)
        input += pBegin(mSteps.front(), now);
    return input;
}

/// @return what it types
std::string SessionScript::pBegin(Step& step, TimePoint now)
{
    if (step.step.kind == ScriptStep::Kind::Send) {
        if (!mHasTyped) mUnused.clear(); // from before the session
        mHasTyped = true;
        std::string text = std::move(step.step.text);
        mSteps.pop_front();
        return text;
    }
    step.hasBegun = true;
    mDeadline = now + mTimeout;
    if (step.step.kind == ScriptStep::Kind::Exec) return commandLineWithMarks(step.step.text, mMark) + "\r";
    pMatch();
    return {};
}

void SessionScript::onOutput(const char* data, std::size_t length)
{
    mUnused.append(data, length);
    pMatch();
    if (mUnused.size() > kWindow) mUnused.erase(0, mUnused.size() - kWindow);
}

/// Finishes the step that waits if its output has come.
void SessionScript::pMatch()
{
    if (mSteps.empty() || !mSteps.front().hasBegun) return;
    const Step& step = mSteps.front();
    if (step.pattern != nullptr ? pMatchPattern(*step.pattern) : pMatchCommand()) pFinish();
}

bool SessionScript::pMatchPattern(const Pattern& pattern)
{
    regmatch_t match{};
    match.rm_eo = static_cast<regoff_t>(mUnused.size());
    if (::regexec(&pattern.regex, mUnused.data(), 1, &match, REG_STARTEND) != 0) return false;
    mUnused.erase(0, static_cast<std::size_t>(match.rm_eo));
    return true;
}

bool SessionScript::pMatchCommand()
{
    if (!mIsInCommand) {
        const std::string begin = kBegin + mMark;
        const std::size_t place = mUnused.find(begin);
        const std::size_t lineEnd = place == std::string::npos ? place : mUnused.find('\n', place);
        if (lineEnd == std::string::npos) return false;
        mUnused.erase(0, lineEnd + 1);
        mIsInCommand = true;
    }
    const std::string end = kEnd + mMark + ":";
    const std::size_t place = mUnused.find(end);
    const std::size_t lineEnd = place == std::string::npos ? place : mUnused.find('\n', place);
    if (lineEnd == std::string::npos) {
        // All but what may be the beginning of the mark.
        const std::size_t held =
            std::min(mUnused.size(), place == std::string::npos ? end.size() : mUnused.size() - place);
        pKeepCommandOutput(mUnused.size() - held);
        return false;
    }
    const int status = std::atoi(mUnused.c_str() + place + end.size());
    if (mStatus.value_or(0) == 0) mStatus = status;
    pKeepCommandOutput(place);
    mUnused.erase(0, mUnused.find('\n') + 1);
    mIsInCommand = false;
    return true;
}

/// Moves the first bytes to the output of the command.
void SessionScript::pKeepCommandOutput(std::size_t end)
{
    mCommandOutput.append(mUnused, 0, end);
    mUnused.erase(0, end);
}

void SessionScript::pFinish()
{
    mSteps.pop_front();
    mDeadline = PollDeadline();
}

std::string SessionScript::waitsFor() const
{
    if (mSteps.empty()) return {};
    const ScriptStep& step = mSteps.front().step;
    const bool isExpect = step.kind == ScriptStep::Kind::Expect;
    return filled(isExpect ? texts::kWaitsForOutput : texts::kWaitsForCommand, {quoted(step.text)});
}

std::string SessionScript::takeCommandOutput()
{
    std::string all = std::exchange(mCommandOutput, {});
    // A return whose line feed has not come yet waits for it.
    if (!mSteps.empty() && !all.empty() && all.back() == '\r') {
        mCommandOutput = "\r";
        all.pop_back();
    }
    std::string text;
    for (std::size_t i = 0; i < all.size(); ++i) {
        const bool isLineEnd = all[i] == '\r' && i + 1 < all.size() && all[i + 1] == '\n';
        if (!isLineEnd) text += all[i];
    }
    return text;
}

} // namespace qel::tool
