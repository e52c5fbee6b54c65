#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Credentials.hpp>
#include <qel/protocol/Hypervisor.hpp>
#include <qel/protocol/PartitionState.hpp>
#include <qel/protocol/ProtocolExport.hpp>
#include <qel/protocol/ServerOptions.hpp>
#include <qel/protocol/ServerState.hpp>

#include <memory>
#include <ostream>
#include <string>
#include <vector>

namespace qel::protocol {

/// Serves consoles for a hypervisor: listens, admits, answers, moves serial data, and ends in order.
///
///     Hypervisor machine;
///     machine.addPartition(1, commandLine("/bin/sh"));
///     ServerOptions options;
///     options.credentials = Credentials::fromDirectory("/etc/qel", "server");
///     Server server(machine, options);
///     server.run(stop.getPollFd()); // until another thread, or a signal, makes `stop` readable
///     server.finish();
///
/// **Threads.** One for the serial lines of all partitions, and two for each console: one that reads and answers, and
/// one that sends what has to wait for the console. Over TLS, one more for the time of its handshake. commandLine() has
/// one while commands are ending. They take none of the program's signals. run() accepts connections on the thread that
/// calls it. No console waits for another one.
///
/// **Failures.** What concerns one connection is logged, and ends at most that connection. A want of memory,
/// descriptors or threads is logged, and run() tries again.
///
/// **Log.** Lines go to logger(). A peer can cause many: register a LogBackendThrottled.
///
/// A connection that breaks while a message is written must not end the process: ignore SIGPIPE if the log is a pipe.
/// Sockets cause no SIGPIPE.
///
/// Lifetime: borrows the hypervisor, which must outlive this object. Thread safety: one thread owns it (constructor,
/// run(), hasPulse(), dumpStatistics(), finish(), destructor); endpoints(), setCredentials(), serve(), state() and the
/// operations on partitions from any thread.
class QEL_PROTOCOL_EXPORT Server {
public:
    /// Listens. Connections are accepted in run(); until then they wait.
    /// @throws std::invalid_argument  names the option: "listen" (not an endpoint), "credentials" (neither credentials
    ///         nor plain), "plain" (also with credentials, or to listen on an address that is not a loopback address),
    ///         "pins" (with plain), "maxConsoles", "maxHandshakes", "maxHandshakesPerAddress", "queueBytes",
    ///         "handshakeTimeout", "frameTimeout", "keepAlive", "idleTimeout", "linger"
    /// @throws CannotListen  "cannot listen on ENDPOINT: ...", "cannot listen on descriptor N: ..."
    /// @throws SSLException  OpenSSL cannot use the credentials
    /// @throws std::logic_error  another server serves the hypervisor
    /// @throws PosixError, std::system_error  no descriptor or thread is left
    Server(Hypervisor& hypervisor, const ServerOptions& options);

    /// finish()
    ~Server();

    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;

    /// Where it listens, in the order of the options, `sockets` last, with the ports that the system has chosen. They
    /// stay the same after finish(), when nothing listens there any more.
    std::vector<IPEndpoint> endpoints() const;

    /// Accepts connections until `stop` becomes readable. Consoles are served meanwhile and afterwards, until finish().
    /// May be called again. Returns at once after finish().
    void run(const PollFd& stop);

    /// Serves a console on a stream of one's own, such as one of makeMemoryStreams(): with TLS or plain, as the options
    /// say. Needs no run(). The limits on handshakes do not apply. After finish() the stream is destroyed unserved.
    ///
    /// A SocketStream keeps its settings, those of its keep-alive included. That the console of any other stream has
    /// hung up is noticed only by reading and writing, so not while its input or its responses wait for room.
    /// @param stream  connected, not null; closed when the console is done with, and destroyed later
    /// @param address  of the console, for Peer and the log: any text
    /// @throws std::invalid_argument  "stream"
    /// @throws PosixError, SSLException, std::system_error  no descriptor, memory or thread is left
    void serve(std::unique_ptr<Stream> stream, const std::string& address);

    /// Replaces the credentials for new connections; those that exist, also in their handshake, keep theirs.
    /// @throws std::logic_error  connections are plain
    /// @throws SSLException  OpenSSL cannot use them; nothing has changed
    void setCredentials(const Credentials& credentials);

    // The partitions, while consoles are served. These may be called from any thread, but not by an operation of the
    // hypervisor, a line or a tap.

    /// Adds a partition. Consoles can open it from now on; the hypervisor object owns the line.
    /// @throws std::invalid_argument  as Hypervisor::addPartition() does
    /// @throws std::logic_error  after finish()
    void addPartition(std::uint16_t id, std::unique_ptr<SerialLine> line, PartitionOptions options = {});

    /// Changes how a partition is served. Its line and its sessions go on; `keepsSession` stays as it was. A change of
    /// `start` means nothing any more, one of `restart` counts from the next end of the command on.
    /// @return false: there is no such partition
    /// @throws std::invalid_argument  "replayBytes"
    bool changePartition(std::uint16_t id, const PartitionOptions& options);

    /// Removes a partition: its consoles read "[qel: the partition has been removed]" as far as they have room, their
    /// sessions end with reason 3 (shutdown), and the line is taken down and destroyed. That of a command waits until
    /// the command has ended, if it is the last one.
    /// @return false: there is no such partition
    bool removePartition(std::uint16_t id);

    /// What the partitions do at this moment, by id.
    std::vector<PartitionState> partitions() const;

    /// Ends a console's session as a forced close by another console does: with reason 2.
    /// @param number  connection number
    /// @return false: the session is free, or there is no such partition
    bool closeSession(std::uint16_t partition, std::uint16_t number);

    /// Sends a break on a partition's line.
    /// @return false: the line has no break, is not up or could not send it, which is logged; or there is no such
    ///         partition
    bool sendBreak(std::uint16_t partition);

    /// Who is connected, what has passed, and who was refused. From any thread, but not from an operation of the
    /// hypervisor, a line or a tap. Takes each console's lock for a moment.
    ServerState state() const;

    /// Whether the thread of the serial lines is alive: it has made a turn since the last call, or since the start of
    /// the server. Makes it begin another one. A thread that a tap or a line blocks has no pulse. Call it at intervals
    /// that are long for a turn: seconds.
    bool hasPulse();

    /// Prints the statistics of each console's queue, in the order of connecting. docs/connection.md explains them.
    void dumpStatistics(std::ostream& os);

    /// Ends in order: stops listening, sends the notices of the end, gives the consoles ServerOptions::linger to take
    /// what is queued for them, and cuts those that have not. The partitions' lines are taken down. Does nothing the
    /// second time.
    void finish() noexcept;

private:
    struct Impl;
    const std::unique_ptr<Impl> mImpl;
};

} // namespace qel::protocol
