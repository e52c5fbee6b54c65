#include "console/EscapeFilter.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

namespace qel::tool {

namespace {

constexpr char kLeave = '.';
constexpr char kHelp = '?';
constexpr char kSuspend = 'Z' & 0x1F; // control-Z

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

std::string EscapeFilter::help(const std::string& lineEnd) const
{
    if (!mEscape) return "no escape character is set";
    const std::string escape = characterName(*mEscape);
    return "at the start of a line:" + lineEnd +                  //
           "  " + escape + ".   leave" + lineEnd +                //
           "  " + escape + "^Z  suspend this program" + lineEnd + //
           "  " + escape + "?   this list" + lineEnd +            //
           "  " + escape + escape + "   type " + escape;
}

bool EscapeFilter::isCommandCharacter(char c)
{
    return c == kLeave || c == kHelp || c == kSuspend || c == '\r' || c == '\n';
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
    if (c == kLeave) return Command::Leave;
    if (c == kHelp) return Command::Help;
    if (c == kSuspend) return Command::Suspend;
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
