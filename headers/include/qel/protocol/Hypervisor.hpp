#pragma once

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/protocol/DisconnectReason.hpp>
#include <qel/protocol/PartitionOptions.hpp>
#include <qel/protocol/Peer.hpp>
#include <qel/protocol/ProtocolExport.hpp>
#include <qel/protocol/SerialLine.hpp>

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

namespace qel::protocol {

/// What a hypervisor says about itself in the response to the version request.
struct MachineInfo {
    char interfaceFamily = 'Q';
    std::uint16_t majorVersion = 1;
    std::uint16_t minorVersion = 0;
    std::string machineType = "QEL";      ///< at most 16 bytes
    std::string serialNumber = "0000001"; ///< at most 16 bytes
};

/// The global mode attribute, which all consoles share.
struct GlobalMode {
    std::uint8_t mode = 0;
    std::string mtms; ///< machine type, model and serial number; at most 16348 bytes
};

/// What is specific to one hypervisor: what it is, its attributes, its partitions, and which console may do what. A
/// Server does the rest: connections, sessions, the order of messages, flow control, and everything that can be refused
/// without knowing the machine.
///
/// Every operation has a default, so this class as it is serves consoles; override what should be different.
///
/// The server calls the operations with its lock held, one at a time, from several threads. They must not block: no
/// console is served meanwhile. They must not call the server. Whatever an operation throws is logged at Error, and the
/// request that needed it is answered with status 6 (command failed); the connection goes on.
/// Thread safety: addPartition() before a server serves this object; the defaults of the operations from any thread.
/// Lifetime: must outlive the server. One server at a time.
class QEL_PROTOCOL_EXPORT Hypervisor {
public:
    /// @param machine  what machine() returns
    /// @param capabilities  what capabilities() returns; none by default
    explicit Hypervisor(MachineInfo machine = MachineInfo(), const QelCapabilities& capabilities = QelCapabilities());

    /// Takes the partitions' lines down and destroys them; those of commands wait until the commands have ended.
    virtual ~Hypervisor();

    Hypervisor(const Hypervisor&) = delete;
    Hypervisor& operator=(const Hypervisor&) = delete;

    /// Adds a partition. Consoles see the number of partitions, at most 255.
    /// @param line  not null; started when a console opens the partition's session, or as the options say
    /// @throws std::invalid_argument  "partition": the id is taken; "line": null; "replayBytes": above
    ///         PartitionOptions::kMaxReplayBytes
    /// @throws std::logic_error  a server serves this object: use Server::addPartition()
    void addPartition(std::uint16_t id, std::unique_ptr<SerialLine> line, PartitionOptions options = {});

    // Decisions.

    /// Whether a console's request is served. Asked for each request that is known and comes in the right order, after
    /// its payload has been parsed, so a cast to the class of the request says what is asked for. The version request
    /// is one of them, and the first.
    ///
    /// What a console may not use best does not exist for it: return QelMessageStatusInvalidOperation (1). A console
    /// that is not welcome at all gets QelMessageStatusTooManyConnections (18) for its version request, which closes
    /// the connection; with any other status it may try again until its time is over. The default allows everything.
    /// @param peer  the console; its certificate's name and fingerprint are known
    /// @return QelMessageStatusNoError: the request is served; any other status: the response carries it
    virtual QelMessageStatusCodes mayRequest(const Peer& peer, const QelMessage& request);

    /// Whether a console may use a partition: open its session, or set up or close one that it does not hold. Asked
    /// after mayRequest(), for partitions that exist. For a console that may not, the partition does not exist:
    /// status 21. A session that is open is not ended by a change of mind. The default allows it.
    virtual bool mayOpen(const Peer& peer, std::uint16_t partition);

    // What the requests ask for.

    /// What the response to the version request says. The default returns the constructor's argument.
    virtual MachineInfo machine();

    /// What this hypervisor can do. Consoles get those of them that they can do as well. The default returns the
    /// constructor's argument.
    virtual QelCapabilities capabilities();

    /// The time of day. The default asks TimeProvider.
    virtual std::chrono::system_clock::time_point currentTime();

    /// The mode that was set last. The default keeps it in memory; 0 and empty at first.
    virtual GlobalMode getMode();

    /// A console sets the mode.
    virtual void setMode(const Peer& peer, const GlobalMode& mode);

    /// The metadata that were set last: any bytes, at most 16350. The default keeps them in memory; empty at first.
    virtual std::string getMetadata();

    /// A console sets the metadata.
    virtual void setMetadata(const Peer& peer, const std::string& metadata);

    // Events. The defaults do nothing.

    /// A console's version request has been granted.
    virtual void onConnected(const Peer& peer);

    /// A request of a console has been answered. What it asked for has been done, or has been refused, by this object
    /// or by the server. Called for every request, the version request included, before onConnected().
    /// @param status  of the response
    virtual void onAnswered(const Peer& peer, const QelMessage& request, QelMessageStatusCodes status);

    /// The connection of a console that onConnected() was called for has ended. Its sessions are free.
    virtual void onDisconnected(const Peer& peer, DisconnectReason why);

private:
    friend class HypervisorEngine;
    struct Impl;
    const std::unique_ptr<Impl> mImpl;
};

} // namespace qel::protocol
