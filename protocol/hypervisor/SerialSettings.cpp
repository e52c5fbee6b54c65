#include <qel/protocol/SerialSettings.hpp>

#include "hypervisor/SerialSpeed.hpp"

#include <algorithm>
#include <cctype>
#include <stdexcept>

namespace qel::protocol {

namespace {

const std::string kFlowControl = ",rtscts";

[[noreturn]] void refuse(const std::string& text, const std::string& reason)
{
    throw std::invalid_argument("settings: \"" + text + "\" " + reason);
}

std::string lowerCase(std::string text)
{
    for (char& c : text)
        c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return text;
}

bool endsWith(const std::string& text, const std::string& end)
{
    return text.size() >= end.size() && text.compare(text.size() - end.size(), end.size(), end) == 0;
}

std::uint32_t parseSpeed(const std::string& digits, const std::string& text)
{
    constexpr std::size_t kMaxDigits = 7;
    const unsigned long speed = digits.size() > kMaxDigits ? 0 : std::stoul(digits);
    if (!toSpeedCode(static_cast<std::uint32_t>(speed))) refuse(text, "has a speed that serial ports do not have");
    return static_cast<std::uint32_t>(speed);
}

/// @param format  such as "n8" or "e72" @return false: it is not a format
bool parseFormat(const std::string& format, SerialSettings& settings)
{
    if (format.size() < 2 || format.size() > 3) return false;
    const std::size_t parity = std::string("noe").find(format[0]);
    if (parity == std::string::npos || format[1] < '5' || format[1] > '8') return false;
    settings.parity = static_cast<SerialSettings::Parity>(parity);
    settings.dataBits = static_cast<std::uint8_t>(format[1] - '0');
    if (format.size() == 2) return true;
    if (format[2] != '1' && format[2] != '2') return false;
    settings.stopBits = static_cast<std::uint8_t>(format[2] - '0');
    return true;
}

} // namespace

SerialSettings SerialSettings::parse(const std::string& text)
{
    SerialSettings settings;
    std::string rest = lowerCase(text);
    if (endsWith(rest, kFlowControl)) {
        settings.hardwareFlowControl = true;
        rest.resize(rest.size() - kFlowControl.size());
    }
    const std::size_t digits = std::min(rest.find_first_not_of("0123456789"), rest.size());
    const bool hasFormat = digits < rest.size();
    if (digits == 0 || (hasFormat && !parseFormat(rest.substr(digits), settings))) {
        refuse(text, "is not a speed and a format such as 115200n8, with \",rtscts\" for hardware flow control");
    }
    settings.speed = parseSpeed(rest.substr(0, digits), text);
    return settings;
}

std::string SerialSettings::str() const
{
    std::string text = std::to_string(speed) + "noe"[static_cast<std::size_t>(parity)] + std::to_string(dataBits);
    if (stopBits != 1) text += std::to_string(stopBits);
    return hardwareFlowControl ? text + kFlowControl : text;
}

} // namespace qel::protocol
