#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/ServerAddress.hpp>

#include "base/Library.hpp"
#include "check/Case.hpp"
#include "check/Messages.hpp"
#include "check/Transcript.hpp"
#include "check/Wire.hpp"

#include <chrono>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace qel::tool::check {

/// The server that is tested, and what is known about it. Shared by all cases; it does not change during a run.
struct Target {
    explicit Target(ServerAddress server);

    ServerAddress address;
    std::vector<IPEndpoint> endpoints;         ///< of the address
    std::shared_ptr<SSLClientContext> context; ///< null: plain connections
    SSLCredentials credentials;                ///< those of the context
    PeerPins pins;
    std::chrono::milliseconds timeout{2000}; ///< for each thing that the peer has to do
    std::uint32_t toolType = 1;
    std::string toolIdPrefix = "qel-check"; ///< at most 20 bytes; numbers follow
    std::uint64_t run;                      ///< a random number: what this run types differs from that of all others

    std::optional<std::uint16_t> partition;            ///< may be opened, written to, and taken by force
    std::optional<std::uint16_t> echoPartition;        ///< its line sends back all it gets
    std::optional<std::uint16_t> endingPartition;      ///< its command ends with exit status 3 when it gets a line
    std::uint16_t absentPartition = 0xFFFF;            ///< does not exist
    std::optional<std::chrono::milliseconds> deadline; ///< of the peer: for the handshake, and for each frame

    bool isProtected() const noexcept { return context != nullptr; }
};

/// Why a case cannot be tried on this target; empty: it can.
std::string missingFor(const Case& aCase, const Target& target);

/// A case while it runs: its connections, and what has to be put back when it is over.
///
/// Lifetime: borrows the target. Thread safety: one thread.
class Trial {
public:
    /// @param number  of the case within the run; tool ids and texts of the case contain it
    Trial(const Target& target, unsigned int number);
    /// Ends the connections at once, without putting anything back.
    ~Trial();
    Trial(const Trial&) = delete;
    Trial& operator=(const Trial&) = delete;

    const Target& target() const noexcept { return mTarget; }
    const Transcript& transcript() const noexcept { return mTranscript; }

    // Connections. Each belongs to the trial.

    /// TCP alone.
    Wire& connectTcp();
    /// TCP, and the steps to TLS if the target is protected: ready for the version request.
    Wire& connect();
    /// Takes the steps to TLS over a stream of one's own. @param descriptor  of its socket
    Wire& protect(std::unique_ptr<Stream> stream, int descriptor, SSLClientContext& context);
    /// A TCP stream for protect(), after the request for TLS has been granted.
    std::unique_ptr<Stream> upgraded(int& descriptor);
    /// connect(), and a version request that must be granted, under a new identity.
    Wire& console();
    /// console(), and the session.
    Wire& session();
    /// session(), and the serial session of a partition, not set up yet.
    Wire& serial(std::uint16_t partition, unsigned int number = 0);

    /// A tool id that no other console has.
    std::string newToolId();
    /// The tool id of the newest console().
    const std::string& toolId() const noexcept { return mToolId; }
    std::uint32_t toolType() const noexcept { return mTarget.toolType; }

    /// A text that occurs nowhere else, not even in another run: a partition repeats its output.
    std::string newText();

    /// The partitions; a case that calls them has the need.
    std::uint16_t partition() const { return mTarget.partition.value(); }
    std::uint16_t echoPartition() const { return mTarget.echoPartition.value(); }
    std::uint16_t endingPartition() const { return mTarget.endingPartition.value(); }

    /// Does something when the case is over, whatever came of it; the newest first. For what the case changes on the
    /// peer and puts back.
    void atEnd(std::function<void()> work);

    /// @throws Failure  the condition is false
    static void require(bool condition, const std::string& expected, const std::string& seen);
    static void requireEqual(const std::string& what, std::uint32_t expected, std::uint32_t seen);

    /// Puts back and leaves the connections politely, so that the next case finds the peer as this one did.
    /// @return what could not be put back; empty: all was
    std::string finish() noexcept;

private:
    std::unique_ptr<Stream> pOpen(int& descriptor);
    Wire& pAdd(std::unique_ptr<Stream> stream, int descriptor);

    const Target& mTarget;
    const std::string mPrefix; // of the tool ids of this case
    Transcript mTranscript;
    std::list<Wire> mWires;
    std::vector<std::function<void()>> mAtEnd;
    std::string mToolId;
    unsigned int mTools = 0;
    unsigned int mTexts = 0;
};

} // namespace qel::tool::check
