#pragma once

#include <chrono>

namespace qel::protocol {

/// What a stream can do at once.
struct Ready {
    bool send = false;    ///< take a whole message, or fail at once
    bool receive = false; ///< give at least one byte, or the end
};

/// What a stream implements that has no descriptor but knows what it can do: poll(2) for such streams.
/// Thread safety: that of the reader and the writer of the stream.
class Readiness {
public:
    /// Waits until the stream can be written to or, if wanted, read from.
    /// @param timeout  negative: no limit
    /// @return neither: not in this time
    virtual Ready awaitReady(bool wantsToReceive, std::chrono::milliseconds timeout) = 0;

    /// Ends the outgoing direction, as shutdown(2) with SHUT_WR: the peer reads what was sent and then the end.
    virtual void endOutput() noexcept = 0;

protected:
    ~Readiness() = default;
};

} // namespace qel::protocol
