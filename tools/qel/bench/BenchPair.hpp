#pragma once

#include <qel/common/QelMessageDax.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/ConsoleOptions.hpp>

#include "base/Library.hpp"

#include <array>
#include <chrono>
#include <cstddef>
#include <string>

namespace qel::tool {

/// A console of a benchmark, after the version request.
struct BenchConsole {
    Identity identity; ///< complete
    Console console;
};

/// Two consoles that alternately send each other messages. A message is a broadcast addressed to the other console: the
/// hypervisor sends its payload on as a notice and answers the sender. It changes no state of the hypervisor and
/// reaches no other console. Thread safety: one thread; cut() from any thread.
class BenchPair {
public:
    /// @param bytes  of payload, 1 to kMaxBroadcast
    /// @param timeout  for each message
    BenchPair(BenchConsole first, BenchConsole second, std::size_t bytes, std::chrono::milliseconds timeout);
    BenchPair(const BenchPair&) = delete;
    BenchPair& operator=(const BenchPair&) = delete;

    /// Sends one message; returns when the sender has the response and the addressee has the message.
    /// @throws StatusError  the hypervisor could not send it on
    /// @throws CommandFailure  ProtocolBroken: what arrived is not what was sent
    /// @throws Error  as Console::request() does
    void exchange();

    /// Ends both connections gracefully: Console::leave().
    void leave() noexcept;

    /// Ends both connections at once; an exchange() on another thread throws.
    void cut();

private:
    void pAwait(BenchConsole& addressee);
    void pTake(const BenchConsole& sender, const QelMessageDaxBroadcastOutboundAsync& notice);

    std::array<BenchConsole, 2> mConsoles;
    const std::string mPayload;
    const std::chrono::milliseconds mTimeout;
    unsigned int mSender = 0; // index of the console that sends next
    bool mHasArrived = false; // the message on its way
};

} // namespace qel::tool
