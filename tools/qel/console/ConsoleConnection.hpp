#pragma once

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/protocol/Console.hpp>

#include "base/Library.hpp"
#include "client/ConnectOptions.hpp"
#include "console/AttentiveStream.hpp"

#include <chrono>
#include <vector>

namespace qel::tool {

/// The connection of "qel console": a console, and the stream under it, which keeps the keyboard alive.
/// Thread safety: one thread.
class ConsoleConnection {
public:
    using TimePoint = std::chrono::steady_clock::time_point;

    /// Connects as connectConsole() does, with the same exceptions.
    /// @param end  by when it must be connected
    /// @param known  set to the addresses of the server
    ConsoleConnection(const ConnectOptions& options, TimePoint end, std::vector<IPEndpoint>& known);

    /// The same while an attendant reads the keyboard, and goes on doing so: it is that of the stream.
    /// @param known  used when the resolver does not answer at once, since looking up a name cannot be attended
    ConsoleConnection(const ConnectOptions& options, TimePoint end, std::vector<IPEndpoint>& known,
                      StreamAttendant& attendant);

    Console& console() noexcept { return mConsole; }

    /// Lives as long as the console.
    AttentiveStream& stream() noexcept { return *mStream; }

private:
    Console pConnect(const ConnectOptions& options, TimePoint end, std::vector<IPEndpoint>& known,
                     StreamAttendant* attendant);

    AttentiveStream* mStream = nullptr; // owned by the console
    Console mConsole;
};

} // namespace qel::tool
