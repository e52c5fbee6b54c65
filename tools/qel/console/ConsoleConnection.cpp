#include "console/ConsoleConnection.hpp"

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "base/Failures.hpp"

#include <algorithm>
#include <cerrno>
#include <memory>
#include <string>
#include <sys/socket.h>
#include <utility>

namespace qel::tool {

namespace {

using TimePoint = ConsoleConnection::TimePoint;

/// How long the keyboard may wait for the resolver.
constexpr std::chrono::milliseconds kShortLookup{75};

std::unique_ptr<AttentiveStream> streamOver(Socket socket, const std::string& server)
{
    try {
        return std::make_unique<AttentiveStream>(std::move(socket));
    } catch (const PosixError& error) {
        std::throw_with_nested(CannotConnect("cannot use connection to " + server + ": " + error.what(), server));
    }
}

std::vector<IPEndpoint> resolveQuickly(const ServerAddress& server, const std::vector<IPEndpoint>& known)
{
    try {
        return resolve(server, TimeProvider::steady() + kShortLookup);
    } catch (const DeadlinePassed&) {
        return known;
    }
}

Socket connectAttended(const IPEndpoint& endpoint, TimePoint end, StreamAttendant& attendant)
{
    Socket socket(endpoint.getFamily(), SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    const sockaddr_storage address = endpoint.getSockaddr();
    if (::connect(socket.getFd(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0 &&
        errno != EINPROGRESS)
        throw PosixError(errno, "socket connect failed");
    const PollFd connected = socket.getPollFd(PollEvents::Write);
    for (;;) {
        const PollResult ready = (attendant.attended() + connected).wait(timeLeft(end));
        if (ready.contains(connected)) break;
        if (ready.anyReady() && !attendant.attend(ready)) throw PosixError(ECANCELED, "socket connect given up");
        if (TimeProvider::steady() >= end) throw PosixError(ETIMEDOUT, "socket connect timed out");
    }
    int error = 0;
    std::size_t length = sizeof(error);
    socket.getSocketOption(SOL_SOCKET, SO_ERROR, &error, length);
    if (error != 0) throw PosixError(error, "socket connect failed");
    return socket;
}

/// As connectTo(), which cannot be attended.
Socket connectAttended(const std::string& server, const std::vector<IPEndpoint>& endpoints, TimePoint end,
                       StreamAttendant& attendant)
{
    std::size_t attemptsLeft = endpoints.size();
    for (const IPEndpoint& endpoint : endpoints) {
        const auto share = timeLeft(end) / static_cast<int>(attemptsLeft);
        --attemptsLeft;
        try {
            return connectAttended(endpoint, TimeProvider::steady() + share, attendant);
        } catch (const PosixError& error) {
            if (attemptsLeft != 0 && error.getErrorCode() != ECANCELED) continue;
            std::throw_with_nested(CannotConnect("cannot connect to " + server + ": " + error.what(), server));
        }
    }
    throw CannotConnect("cannot connect to " + server + ": it has no address", server);
}

} // namespace

ConsoleConnection::ConsoleConnection(const ConnectOptions& options, TimePoint end, std::vector<IPEndpoint>& known)
    : mConsole(pConnect(options, end, known, nullptr))
{}

ConsoleConnection::ConsoleConnection(const ConnectOptions& options, TimePoint end, std::vector<IPEndpoint>& known,
                                     StreamAttendant& attendant)
    : mConsole(pConnect(options, end, known, &attendant))
{}

Console ConsoleConnection::pConnect(const ConnectOptions& options, TimePoint end, std::vector<IPEndpoint>& known,
                                    StreamAttendant* attendant)
{
    const ConsoleOptions library = libraryOptions(options);
    const ServerAddress server = ServerAddress::parse(options.server);
    known = attendant == nullptr ? resolve(server, end) : resolveQuickly(server, known);
    const bool isLocal = std::all_of(known.begin(), known.end(),
                                     [](const IPEndpoint& endpoint) { return isLoopback(endpoint.getAddress()); });
    if (library.plain && !isLocal) throw CommandFailure(ExitStatus::Usage, plainRefusal(options.server));
    auto stream = streamOver(attendant == nullptr ? connectTo(server, known, end)
                                                  : connectAttended(options.server, known, end, *attendant),
                             options.server);
    stream->setAttendant(attendant);
    mStream = stream.get();
    return Console(std::move(stream), library, timeLeft(end));
}

} // namespace qel::tool
