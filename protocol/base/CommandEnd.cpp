#include <qel/common/StreamFormatters.hpp>
#include <qel/protocol/CommandEnd.hpp>

#include <sstream>

namespace qel::protocol {

std::uint16_t toStatusDetail(const CommandEnd& end) noexcept
{
    if (end.kind == CommandEnd::Kind::Unknown) return 0;
    return static_cast<std::uint16_t>(static_cast<unsigned int>(end.kind) << 8 | end.number);
}

CommandEnd commandEndFrom(std::uint16_t statusDetail) noexcept
{
    CommandEnd end;
    end.kind = static_cast<CommandEnd::Kind>(statusDetail >> 8);
    end.number = static_cast<std::uint8_t>(statusDetail);
    switch (end.kind) {
    case CommandEnd::Kind::Exited:
        return end;
    case CommandEnd::Kind::Killed:
        if (end.number != 0) return end;
        break;
    case CommandEnd::Kind::ClosedTerminal:
        if (end.number == 0) return end;
        break;
    case CommandEnd::Kind::Unknown:
        break;
    }
    return {};
}

std::string describe(const CommandEnd& end)
{
    std::ostringstream text;
    switch (end.kind) {
    case CommandEnd::Kind::Exited:
        text << "the command exited with status " << static_cast<unsigned int>(end.number);
        break;
    case CommandEnd::Kind::Killed:
        text << "the command was killed by signal " << SignalFormatter(end.number);
        break;
    case CommandEnd::Kind::ClosedTerminal:
        text << "the command closed its terminal";
        break;
    case CommandEnd::Kind::Unknown:
        text << "the command ended";
        break;
    }
    return text.str();
}

} // namespace qel::protocol
