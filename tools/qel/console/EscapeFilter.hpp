#pragma once

#include <optional>
#include <string>

namespace qel::tool {

/// Finds what a person types to this program in what they type to the partition, as remote shells do it: at the start
/// of a line, the escape character makes a command of the character behind it.
///
///     ~.    leave            ~^Z   suspend this program
///     ~?    list these       ~~    type one ~
///
/// The escape character before any other character is no command; both are typed. A line starts at the beginning of the
/// session and behind every carriage return or line feed that was typed. A command types nothing, so that behind one
/// the line has still not begun.
///
/// Thread safety: one thread.
class EscapeFilter {
public:
    enum class Command { None, Leave, Help, Suspend };

    /// @param escape  the escape character; none: everything is for the partition
    explicit EscapeFilter(std::optional<char> escape);

    /// Takes typed characters up to the end or to the first command, which is taken too.
    /// @param typed  loses what was taken
    /// @param forPartition  gets what is for the partition appended
    /// @return the command; None: all characters have been taken
    Command take(std::string& typed, std::string& forPartition);

    /// The commands, a line each, without line ends around them: for the person who asks.
    std::string help(const std::string& lineEnd) const;

    /// The characters that cannot be the escape character, because commands are called by them.
    static bool isCommandCharacter(char c);

private:
    Command pTake(char c, std::string& forPartition);
    Command pTakeEscaped(char c, std::string& forPartition);
    void pType(char c, std::string& forPartition);

    std::optional<char> mEscape;
    bool mAtLineStart = true;
    bool mEscaped = false; // the escape character was the last one
};

/// How a character is shown to a person and named on a command line: "^]" for a control character, else itself.
std::string characterName(char c);

} // namespace qel::tool
