#pragma once

namespace qel::tool {

/// The exit statuses of the program. Each has the same meaning in every subcommand.
enum class ExitStatus : int {
    Done = 0,           ///< success
    Refused = 1,        ///< the peer refused a request, or what was checked, an input or a peer, is not right
    Usage = 2,          ///< the command line is wrong
    CannotConnect = 3,  ///< connecting to the endpoint, or listening on it, failed
    Failed = 4,         ///< a failure on this machine: no memory, no room for the output
    ProtocolBroken = 5, ///< the peer violated the protocol
    DeadlinePassed = 6, ///< the peer did not answer in time
    ClosedByPeer = 7,   ///< the peer closed the connection, or the connection broke
    CommandFailed = 8,  ///< a command of a partition failed

    CertificateDue = 10, ///< valid, but expires soon
    CertificateExpired = 11,
    CertificateNotYetValid = 12
};

} // namespace qel::tool
