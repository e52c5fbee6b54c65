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

/// A console of a benchmark: its connection, introduced.
struct BenchConsole {
    IdentityOptions identity; ///< complete
    std::unique_ptr<ClientConnection> connection;
};

/// Two consoles that send each other messages in turn. A message is a broadcast that the one addresses to the other:
/// its payload goes up to the hypervisor and comes down to the addressee, and the sender gets an answer. It changes
/// nothing at the hypervisor and bothers no other console. Thread safety: one thread; cut() from any.
class BenchPair {
public:
    /// @param bytes  of payload, 1 to kMaxBroadcast
    /// @param timeout  for each message
    BenchPair(BenchConsole first, BenchConsole second, std::size_t bytes, std::chrono::milliseconds timeout);

    /// Sends one message; returns when the sender has its answer and the addressee the message.
    /// @throws RequestRefused  the hypervisor could not pass it on
    /// @throws CommandFailure  ClosedByPeer: the hypervisor closes the connection; ProtocolBroken: what arrived is not
    ///         what was sent
    /// @throws StreamIOException, QelMessageValidationException  as ClientConnection does
    void exchange();

    /// Ends both connections politely.
    void leave() noexcept;

    /// Ends both at once: an exchange() on another thread fails.
    void cut();

private:
    void pAwait(const BenchConsole& sender, BenchConsole& addressee) const;

    std::array<BenchConsole, 2> mConsoles;
    const std::string mPayload;
    const std::chrono::milliseconds mTimeout;
    unsigned int mTurn = 0; // whose it is to send
};

} // namespace qel::tool
