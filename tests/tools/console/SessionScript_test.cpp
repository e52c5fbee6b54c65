#include "console/SessionScript.hpp"
#include "console/TypedText.hpp"
#include "support/Process.hpp"

#include <gmock/gmock.h>
#include <stdexcept>
#include <string>

namespace qel::test {

namespace {

using std::chrono::seconds;
using ::testing::HasSubstr;
using tool::ScriptStep;
using tool::SessionScript;
using Kind = ScriptStep::Kind;

constexpr PollDeadline::time_point kStart{seconds(1000)};

void show(SessionScript& script, const std::string& text) { script.onOutput(text.data(), text.size()); }

TEST(SessionScript, TypesTextsUpToTheFirstStepThatWaits)
{
    SessionScript script({{Kind::Send, "a"}, {Kind::Send, "b"}, {Kind::Expect, "x"}, {Kind::Send, "c"}}, seconds(5),
                         "m");
    EXPECT_EQ(script.takeInput(kStart), "ab");
    EXPECT_EQ(script.takeInput(kStart), "");
    EXPECT_EQ(script.waitsFor(), "output that matches \"x\"");
    EXPECT_EQ(script.deadline(), PollDeadline(kStart + seconds(5)));
    show(script, "..x");
    EXPECT_TRUE(script.deadline().isDisabled());
    EXPECT_EQ(script.takeInput(kStart), "c");
    EXPECT_TRUE(script.isDone());
    EXPECT_EQ(script.waitsFor(), "");
}

TEST(SessionScript, OutputIsMatchedAcrossPieces)
{
    SessionScript script({{Kind::Expect, "log(in|on): $"}}, seconds(5), "m");
    script.takeInput(kStart);
    show(script, "last lo");
    show(script, "gin: Monday\r\nlogi");
    EXPECT_FALSE(script.isDone());
    show(script, "n: ");
    EXPECT_TRUE(script.isDone());
}

TEST(SessionScript, OutputBeforeTheStepCountsUnlessItHasBeenUsed)
{
    SessionScript script({{Kind::Expect, "a"}, {Kind::Expect, "a"}, {Kind::Expect, "b"}}, seconds(5), "m");
    show(script, "a b");
    script.takeInput(kStart);
    EXPECT_EQ(script.waitsFor(), "output that matches \"a\"") << "the second one";
    EXPECT_FALSE(script.isDone());
    show(script, "a");
    script.takeInput(kStart);
    EXPECT_FALSE(script.isDone()) << "the b came before the second a";
    show(script, "b");
    script.takeInput(kStart);
    EXPECT_TRUE(script.isDone());
}

TEST(SessionScript, ZeroBytesInTheOutputDoNotEndIt)
{
    SessionScript script({{Kind::Expect, "ready"}}, seconds(5), "m");
    script.takeInput(kStart);
    show(script, std::string("\0\0ready", 7));
    EXPECT_TRUE(script.isDone());
}

TEST(SessionScript, OldOutputIsForgotten)
{
    SessionScript script({{Kind::Expect, "first.*last"}}, seconds(5), "m");
    script.takeInput(kStart);
    show(script, "first" + std::string(SessionScript::kWindow, 'x'));
    show(script, "last");
    EXPECT_FALSE(script.isDone());
    show(script, "first last");
    EXPECT_TRUE(script.isDone());
}

TEST(SessionScript, AWrongExpressionIsNamed)
{
    EXPECT_THROW(SessionScript({{Kind::Expect, "a("}}, seconds(5), "m"), std::invalid_argument);
    std::string wrong = "a(";
    EXPECT_THAT(tool::checkPattern(wrong), HasSubstr("\"a(\" is not a regular expression: "));
    std::string right = "^a[0-9]+$";
    EXPECT_EQ(tool::checkPattern(right), "");
}

TEST(SessionScript, ACommandIsRunBetweenMarks)
{
    SessionScript script({{Kind::Exec, "uname"}}, seconds(5), "77");
    const std::string line = script.takeInput(kStart);
    EXPECT_EQ(line, "printf '%s%s\\n' qel-begin- 77; sh -c 'uname' </dev/null; printf '%s%s:%d\\n' qel-end- 77 $?\r");
    EXPECT_EQ(script.waitsFor(), "the end of \"uname\"");
    show(script, "$ " + line + "\n"); // the echo
    EXPECT_EQ(script.takeCommandOutput(), "");
    show(script, "qel-begin-77\r\nLin");
    show(script, "ux\r\nqel-en");
    show(script, "d-77:3");
    EXPECT_FALSE(script.isDone());
    show(script, "\r\n$ ");
    EXPECT_TRUE(script.isDone());
    EXPECT_EQ(script.takeCommandOutput(), "Linux\n");
    EXPECT_EQ(script.commandStatus(), 3);
}

TEST(SessionScript, TheOutputOfACommandComesAsItIsMade)
{
    SessionScript script({{Kind::Exec, "x"}}, seconds(5), "77");
    script.takeInput(kStart);
    show(script, "qel-begin-77\r\nline one\r\nand this is long enough\r");
    const std::string first = script.takeCommandOutput();
    EXPECT_THAT(first, HasSubstr("line one\nand this"));
    show(script, "\nqel-end-77:0\r\n");
    EXPECT_EQ(first + script.takeCommandOutput(), "line one\nand this is long enough\n");
    EXPECT_EQ(script.commandStatus(), 0);
}

TEST(SessionScript, OutputWithoutALineEndIsComplete)
{
    SessionScript script({{Kind::Exec, "x"}}, seconds(5), "77");
    script.takeInput(kStart);
    show(script, "qel-begin-77\r\nno endqel-end-77:0\r\n");
    EXPECT_EQ(script.takeCommandOutput(), "no end");
    EXPECT_TRUE(script.isDone());
}

TEST(SessionScript, AShellRunsTheLineWhateverTheCommand)
{
    for (const char* const command :
         {"echo \"it's $((6 * 7))\"; exit 3", "cat; exit 3", "echo 'a' | tr a b; (exit 3)"}) {
        const auto result = run({"/bin/sh", "-c", tool::commandLineWithMarks(command, "9")});
        SessionScript script({{Kind::Exec, command}}, seconds(5), "9");
        script.takeInput(kStart);
        show(script, result.output);
        EXPECT_TRUE(script.isDone()) << result.output;
        EXPECT_EQ(script.commandStatus(), 3);
    }
    const auto broken = run({"/bin/sh", "-c", tool::commandLineWithMarks("if then (", "9")});
    EXPECT_THAT(broken.output, HasSubstr("qel-end-9:2\n")) << "a mistake in the command";
}

TEST(TypedText, BackslashesStandForCharacters)
{
    EXPECT_EQ(tool::parseTypedText("a\\r\\n\\t\\e\\\\\\x41\\x7fz"), "a\r\n\t\x1B\\A\x7Fz");
    EXPECT_EQ(tool::parseTypedText(""), "");
    for (const char* const wrong : {"\\", "a\\q", "\\x4", "\\xg1", "\\x"})
        EXPECT_EQ(tool::parseTypedText(wrong), std::nullopt) << wrong;
}

TEST(SessionScript, TheStatusIsThatOfTheFirstCommandThatFails)
{
    SessionScript script({{Kind::Exec, "a"}, {Kind::Exec, "b"}, {Kind::Exec, "c"}, {Kind::Exec, "d"}}, seconds(5), "7");
    for (const char* const status : {"0", "3", "4", "0"}) {
        script.takeInput(kStart);
        show(script, std::string("qel-begin-7\r\nqel-end-7:") + status + "\r\n");
    }
    EXPECT_TRUE(script.isDone());
    EXPECT_EQ(script.commandStatus(), 3);
}

TEST(SessionScript, ControlCharactersOfACommandAreNotTyped)
{
    const std::string command = "printf %s 'a\tb\\c\x7F' | tr '\t' -\necho \"'\x01'\"\n(exit 3)";
    const std::string line = tool::commandLineWithMarks(command, "9");
    EXPECT_EQ(line.find_first_of("\t\n\x01\x7F"), std::string::npos) << line;
    const auto result = run({"/bin/sh", "-c", line});
    EXPECT_EQ(result.output, "qel-begin-9\na-b\\c\x7F'\x01'\nqel-end-9:3\n");
}

} // namespace

} // namespace qel::test
