#pragma once

#include "bench/BenchLoad.hpp"
#include "client/ClientConnection.hpp"
#include "client/ConnectOptions.hpp"

#include <array>
#include <chrono>
#include <cstddef>
#include <memory>
#include <string>

namespace qel::tool {

/// A console of a benchmark, after the version request.
struct BenchConsole {
    IdentityOptions identity; ///< complete
    std::unique_ptr<ClientConnection> connection;
};

/// Two consoles that alternately send each other messages. A message is a broadcast addressed to the other console: the
/// hypervisor sends its payload on as a notice and answers the sender. It changes no state of the hypervisor and
/// reaches no other console. Thread safety: one thread; cut() from any thread.
class BenchPair {
public:
    /// @param bytes  of payload, 1 to kMaxBroadcast
    /// @param timeout  for each message
    BenchPair(BenchConsole first, BenchConsole second, std::size_t bytes, std::chrono::milliseconds timeout);

    /// Sends one message; returns when the sender has the response and the addressee has the message.
    /// @throws RequestRefused  the hypervisor could not send it on
    /// @throws CommandFailure  ClosedByPeer: the hypervisor closes the connection; ProtocolBroken: what arrived is not
    ///         what was sent
    /// @throws StreamIOException, QelMessageValidationException  as ClientConnection does
    void exchange();

    /// Ends both connections gracefully: ClientConnection::leave().
    void leave() noexcept;

    /// Ends both connections at once; an exchange() on another thread throws.
    void cut();

private:
    void pAwait(const BenchConsole& sender, BenchConsole& addressee) const;

    std::array<BenchConsole, 2> mConsoles;
    const std::string mPayload;
    const std::chrono::milliseconds mTimeout;
    unsigned int mSender = 0; // index of the console that sends next
};

} // namespace qel::tool
