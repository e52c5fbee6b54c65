#include "console/EscapeFilter.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"
#include "console/ConsoleTexts.hpp"

#include <algorithm>
#include <cstddef>
#include <iterator>

namespace qel::tool {

namespace {

struct Row {
    char key;
    EscapeFilter::Command command;
    const char* help;
};

constexpr Row kRows[] = {
    {'.', EscapeFilter::Command::Leave, texts::kHelpLeave},
    {'?', EscapeFilter::Command::Help, texts::kHelpHelp},
    {'i', EscapeFilter::Command::Info, texts::kHelpInfo},
    {'l', EscapeFilter::Command::Log, texts::kHelpLog},
    {'t', EscapeFilter::Command::Stamps, texts::kHelpStamps},
    {'r', EscapeFilter::Command::ReadOnly, texts::kHelpReadOnly},
    {'f', EscapeFilter::Command::Force, texts::kHelpForce},
    {'b', EscapeFilter::Command::Break, texts::kHelpBreak},
    {'w', EscapeFilter::Command::WindowSize, texts::kHelpWindow},
    {'#', EscapeFilter::Command::SendFile, texts::kHelpFile},
    {'Z' & 0x1F, EscapeFilter::Command::Suspend, texts::kHelpSuspend},
};

constexpr unsigned char kFirstPrintable = 0x20;
constexpr unsigned char kDelete = 0x7F;
constexpr unsigned char kControlBit = 0x40; // differs between a control character and its letter

} // namespace

EscapeFilter::EscapeFilter(std::optional<char> escape) : mEscape(escape) {}

EscapeFilter::Command EscapeFilter::take(std::string& typed, std::string& forPartition)
{
    std::size_t taken = 0;
    Command command = Command::None;
    while (command == Command::None && taken < typed.size())
        command = pTake(typed[taken++], forPartition);
    typed.erase(0, taken);
    return command;
}

void EscapeFilter::startLine() noexcept
{
    mAtLineStart = true;
    mEscaped = false;
}

std::string EscapeFilter::help(const std::string& lineEnd) const
{
    if (!mEscape) return texts::kNoEscape;
    const std::string escape = characterName(*mEscape);
    const std::size_t width = escape.size() + 4;
    const auto row = [width](std::string keys, const std::string& help) {
        keys.resize(width, ' ');
        return "  " + keys + help;
    };
    std::string list = texts::kHelpTitle + lineEnd;
    for (const Row& each : kRows)
        list.append(row(escape + characterName(each.key), each.help)).append(lineEnd);
    return list + row(escape + escape, filled(texts::kHelpEscape, {escape}));
}

bool EscapeFilter::isCommandCharacter(char c)
{
    return c == '\r' || c == '\n' ||
           std::any_of(std::begin(kRows), std::end(kRows), [c](const Row& row) { return row.key == c; });
}

EscapeFilter::Command EscapeFilter::pTake(char c, std::string& forPartition)
{
    if (mEscaped) return pTakeEscaped(c, forPartition);
    if (mAtLineStart && mEscape == c) {
        mEscaped = true;
    } else {
        pType(c, forPartition);
    }
    return Command::None;
}

EscapeFilter::Command EscapeFilter::pTakeEscaped(char c, std::string& forPartition)
{
    mEscaped = false;
    for (const Row& row : kRows) {
        if (row.key == c) return row.command;
    }
    pType(*mEscape, forPartition);
    if (c != *mEscape) pType(c, forPartition);
    return Command::None;
}

void EscapeFilter::pType(char c, std::string& forPartition)
{
    forPartition += c;
    mAtLineStart = c == '\r' || c == '\n';
}

std::string characterName(char c)
{
    const auto byte = static_cast<unsigned char>(c);
    if (byte >= kFirstPrintable && byte != kDelete) return printable(std::string(1, c));
    return {'^', static_cast<char>(byte ^ kControlBit)};
}

} // namespace qel::tool
