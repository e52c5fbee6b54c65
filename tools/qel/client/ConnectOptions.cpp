#include "client/ConnectOptions.hpp"

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "base/Failures.hpp"
#include "base/OptionChecks.hpp"
#include "transport/CertificateNotes.hpp"

#include <cstring>
#include <iostream>
#include <limits>
#include <mutex>
#include <stdexcept>

namespace qel::tool {

namespace {

constexpr double kMinTimeout = 0.001;
constexpr double kMaxTimeout = 24 * 60 * 60;

/// True when the host has to be looked up.
bool isHostName(const std::string& server)
{
    try {
        static_cast<void>(IPEndpoint(server));
        return false;
    } catch (const std::exception&) {
        return true;
    }
}

/// Notes for the user, once in a process: "qel bench" connects many times.
void sayOnce(const TransportOptions& options)
{
    static std::once_flag said;
    std::call_once(said, [&options] {
        for (const std::string& note : clientNotes(options, SSLValidityPeriod::Clock::now()))
            std::cerr << "qel: note: " << note << std::endl;
    });
}

} // namespace

std::chrono::milliseconds ConnectOptions::timeout() const
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(timeoutSeconds));
}

void addConnectOptions(CLI::App& app, ConnectOptions& options)
{
    app.add_option("--connect", options.server,
                   "Server to connect to: NAME:PORT, 127.0.0.1:PORT or [::1]:PORT; port " +
                       std::to_string(kDefaultPort) + " if there is none")
        ->required()
        ->type_name("SERVER")
        ->transform(defaultPort())
        ->check(serverValidator());
    addTransportOptions(app, options.transport);
    app.add_option("--timeout", options.timeoutSeconds, "Timeout in seconds for connecting and all responses together")
        ->type_name("SECONDS")
        ->check(numberIn(kMinTimeout, kMaxTimeout))
        ->capture_default_str();
    app.add_option("--tool-type", options.identity.toolType, "Tool type of this console")
        ->transform(integerIn(0, std::numeric_limits<std::uint32_t>::max()))
        ->capture_default_str();
    app.add_option("--tool-id", options.identity.toolId,
                   "Tool id of this console, at most 32 bytes (default: qel-<process id>)")
        ->check(textUpTo(Identity::kMaxToolIdBytes));
}

void checkConnect(const ConnectOptions& options)
{
    if (options.server.empty()) throw CLI::RequiredError("--connect");
    checkCredentials(options.transport);
    if (!isHostName(options.server)) checkPlain(options.transport, options.server);
}

std::chrono::milliseconds timeLeft(std::chrono::steady_clock::time_point end)
{
    return PollDeadline(end).getTimeout(TimeProvider::steady());
}

ConsoleOptions libraryOptions(const ConnectOptions& options)
{
    ConsoleOptions library(options.server);
    library.credentials = loadCredentials(options.transport);
    library.plain = options.transport.plain;
    library.pins = options.transport.pins;
    library.identity = options.identity;
    library.handshakeTimeout = options.transport.handshakeTimeout();
    library.requestTimeout = options.timeout();
    library.frameTimeout = options.timeout();
    sayOnce(options.transport); // the credentials can be used
    return library;
}

Console connectConsole(const ConnectOptions& options)
{
    const ConsoleOptions library = libraryOptions(options);
    try {
        return Console(library, options.timeout());
    } catch (const std::invalid_argument& error) {
        // The one mistake that the parser cannot see: the name means an address of another machine.
        if (std::strncmp(error.what(), "plain:", std::strlen("plain:")) != 0) throw;
        throw CommandFailure(ExitStatus::Usage, plainRefusal(options.server));
    }
}

} // namespace qel::tool
