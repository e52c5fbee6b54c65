#pragma once

namespace qel::tool {

/// How the program ends, for scripts: the same meaning in every subcommand.
enum class ExitStatus : int {
    Done = 0,           ///< it did what was asked
    Refused = 1,        ///< the answer is no: the other end refused, or what was looked at is not in order
    Usage = 2,          ///< the command line cannot be carried out as it stands
    CannotConnect = 3,  ///< the endpoint cannot be connected to, or not listened on
    Failed = 4,         ///< something failed on this machine: no memory, no room for the output
    ProtocolBroken = 5, ///< the other end sent what the protocol does not allow
    DeadlinePassed = 6, ///< the other end did not answer in time
    ClosedByPeer = 7,   ///< the other end closed the connection, or it broke

    CertificateDue = 10,        ///< it is valid, but not for long
    CertificateExpired = 11,    ///< it was valid
    CertificateNotYetValid = 12 ///< it will be valid
};

} // namespace qel::tool
