#include "lines/LineText.hpp"

#include <qel/protocol/DeviceLine.hpp>
#include <qel/protocol/SocketLine.hpp>

#include <cstddef>
#include <optional>
#include <stdexcept>
#include <utility>

namespace qel::tool {

namespace {

/// "WHAT,SETTINGS", of which the second may be missing.
struct WithSettings {
    std::string what;
    std::optional<SerialSettings> settings;
};

WithSettings splitSettings(const std::string& text)
{
    const std::size_t comma = text.find(',');
    if (comma == std::string::npos) return {text, std::nullopt};
    return {text.substr(0, comma), SerialSettings::parse(text.substr(comma + 1))};
}

void requireContent(const std::string& text, const char* what)
{
    if (text.empty()) throw std::invalid_argument(std::string("line: it takes ") + what);
}

MadeLine lasting(std::unique_ptr<SerialLine> line)
{
    MadeLine made{std::move(line), {}};
    made.options.keepsSession = true;
    return made;
}

MadeLine makeUnix(const std::string& path)
{
    requireContent(path, "a path, as in unix:/run/vm1.sock");
    return lasting(protocol::unixLine(path));
}

MadeLine makeTcp(const std::string& address)
{
    requireContent(address, "HOST:PORT, as in tcp:terminals.example:4001");
    return lasting(protocol::tcpLine(address));
}

MadeLine makeTelnet(const std::string& text, TelnetFactory factory)
{
    const WithSettings parts = splitSettings(text);
    requireContent(parts.what, "HOST:PORT, as in telnet:terminals.example:4001");
    MadeLine made = lasting(factory(protocol::tcpLine(parts.what), parts.settings));
    if (made.line == nullptr) {
        throw std::invalid_argument("line: this build has no telnet lines (libtelnet was not found)");
    }
    return made;
}

MadeLine makeTty(const std::string& text)
{
    const WithSettings parts = splitSettings(text);
    requireContent(parts.what, "a device, as in tty:/dev/ttyS0,115200n8");
    return lasting(protocol::deviceLine(parts.what, parts.settings.value_or(SerialSettings())));
}

MadeLine makeCommand(const std::string& command, const CommandLineOptions& options)
{
    requireContent(command, "a command");
    return {protocol::commandLine(command, options), {}};
}

MadeLine makeKind(const std::string& text, const CommandLineOptions& command, TelnetFactory telnet)
{
    const std::size_t colon = text.find(':');
    const std::string kind = text.substr(0, colon);
    const std::string rest = colon == std::string::npos ? "" : text.substr(colon + 1);
    if (colon == std::string::npos) return makeCommand(text, command);
    if (kind == "pty") return makeCommand(rest, command);
    if (kind == "unix") return makeUnix(rest);
    if (kind == "tcp") return makeTcp(rest);
    if (kind == "telnet") return makeTelnet(rest, telnet);
    if (kind == "tty") return makeTty(rest);
    return makeCommand(text, command);
}

} // namespace

MadeLine makeLine(const std::string& text, const CommandLineOptions& command, TelnetFactory telnet)
{
    try {
        return makeKind(text, command, telnet);
    } catch (const std::invalid_argument& error) {
        // The library names the argument first, which people do not know: "server: ...".
        const std::string reason = error.what();
        const std::size_t colon = reason.find(": ");
        throw std::invalid_argument("line \"" + text +
                                    "\": " + (colon == std::string::npos ? reason : reason.substr(colon + 2)));
    }
}

} // namespace qel::tool
