// Takes the place of TelnetLine.cpp where libtelnet was not found.

#include "lines/TelnetLine.hpp"

namespace qel::tool {

std::unique_ptr<SerialLine> telnetLine(std::unique_ptr<SerialLine> /*connection*/,
                                       std::optional<SerialSettings> /*settings*/)
{
    return nullptr;
}

} // namespace qel::tool
