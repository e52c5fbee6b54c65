#include "console/ConsoleConnection.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "base/Failures.hpp"

#include <algorithm>
#include <memory>
#include <utility>
#include <vector>

namespace qel::tool {

namespace {

std::unique_ptr<AttentiveStream> streamOver(Socket socket, const std::string& server)
{
    try {
        return std::make_unique<AttentiveStream>(std::move(socket));
    } catch (const PosixError& error) {
        std::throw_with_nested(CannotConnect("cannot use connection to " + server + ": " + error.what(), server));
    }
}

} // namespace

ConsoleConnection::ConsoleConnection(const ConnectOptions& options, std::chrono::steady_clock::time_point end)
    : mConsole(pConnect(options, end))
{}

Console ConsoleConnection::pConnect(const ConnectOptions& options, std::chrono::steady_clock::time_point end)
{
    const ConsoleOptions library = libraryOptions(options);
    const ServerAddress server = ServerAddress::parse(options.server);
    const std::vector<IPEndpoint> endpoints = resolve(server, end);
    const bool isLocal = std::all_of(endpoints.begin(), endpoints.end(),
                                     [](const IPEndpoint& endpoint) { return isLoopback(endpoint.getAddress()); });
    if (library.plain && !isLocal) throw CommandFailure(ExitStatus::Usage, plainRefusal(options.server));
    auto stream = streamOver(connectTo(server, endpoints, end), options.server);
    mStream = stream.get();
    return Console(std::move(stream), library, timeLeft(end));
}

} // namespace qel::tool
