#pragma once

#include <qel/protocol/Console.hpp>

#include "base/Library.hpp"
#include "client/ConnectOptions.hpp"
#include "console/AttentiveStream.hpp"

#include <chrono>

namespace qel::tool {

/// The connection of "qel console": a console, and the stream under it, which keeps the keyboard alive.
/// Thread safety: one thread.
class ConsoleConnection {
public:
    /// Connects as connectConsole() does, with the same exceptions.
    /// @param end  by when it must be connected
    ConsoleConnection(const ConnectOptions& options, std::chrono::steady_clock::time_point end);

    Console& console() noexcept { return mConsole; }

    /// Lives as long as the console.
    AttentiveStream& stream() noexcept { return *mStream; }

private:
    Console pConnect(const ConnectOptions& options, std::chrono::steady_clock::time_point end);

    AttentiveStream* mStream = nullptr; // owned by the console
    Console mConsole;
};

} // namespace qel::tool
