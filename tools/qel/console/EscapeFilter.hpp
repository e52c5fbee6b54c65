#pragma once

#include <optional>
#include <string>

namespace qel::tool {

/// Separates commands to this program from input for the partition. As in remote shells, the escape character at the
/// start of a line makes a command of the character after it; help() lists them.
///
/// The escape character before any other character is not a command; both characters are input. A line starts at the
/// beginning of the session and after every carriage return or line feed in the input. A command is not input, so
/// another one may follow it.
///
/// Thread safety: one thread.
class EscapeFilter {
public:
    enum class Command { None, Leave, Help, Suspend, Info, Log, Stamps, ReadOnly, Force, Break, WindowSize, SendFile };

    /// @param escape  the escape character; none: everything is input
    explicit EscapeFilter(std::optional<char> escape);

    /// Reads typed characters up to the end or through the first command.
    /// @param typed  the characters that were read are removed
    /// @param forPartition  input for the partition is appended
    /// @return the command; None: all characters have been read
    Command take(std::string& typed, std::string& forPartition);

    /// What is typed next begins a line.
    void startLine() noexcept;

    /// The list of commands, with `lineEnd` between the lines.
    std::string help(const std::string& lineEnd) const;

    /// True for the characters that name commands; they cannot be the escape character.
    static bool isCommandCharacter(char c);

private:
    Command pTake(char c, std::string& forPartition);
    Command pTakeEscaped(char c, std::string& forPartition);
    void pType(char c, std::string& forPartition);

    std::optional<char> mEscape;
    bool mAtLineStart = true;
    bool mEscaped = false; // the last character was the escape character
};

/// A character as it is printed and given on a command line: a control character in caret notation, "^]".
std::string characterName(char c);

} // namespace qel::tool
