#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <exception>
#include <memory>
#include <stdexcept>
#include <string>

/// @file
/// What the library throws: one base class, and a class for each thing that a caller decides on.
///
/// what() is a complete sentence in one line, the cause included: "cannot connect to 127.0.0.1:4711: Connection
/// refused". Where another exception caused the error, it is nested too (std::rethrow_if_nested).
///
/// Wrong arguments and options throw std::invalid_argument, which names them. Files that cannot be read throw
/// qel::FileIOError. std::bad_alloc passes unchanged.

namespace qel::protocol {

/// The base of all errors. Thread safety: that of a plain value.
class QEL_PROTOCOL_EXPORT Error : public std::runtime_error {
public:
    /// @param what  one line for a person
    /// @param peer  with whom: the name or the address of the peer; empty: no peer is involved
    explicit Error(const std::string& what, std::string peer = {});
    Error(const Error&) = default;
    Error& operator=(const Error&) = default;
    ~Error() override;

    /// The peer as it was named to connect to it, or its address; empty when no peer is involved.
    const std::string& getPeer() const noexcept { return mPeer; }

    /// Puts what was attempted in front of what(), as in "no protected connection to x:1: " + what().
    /// @param peer  replaces getPeer()
    void addContext(const std::string& attempt, const std::string& peer);

private:
    std::string mPeer;
};

/// The name of the server has no address, the system's resolver failed, or there was no thread to ask it.
class QEL_PROTOCOL_EXPORT NameNotResolved : public Error {
public:
    using Error::Error;
    ~NameNotResolved() override;
};

/// No connection came about: refused, unreachable, or not within the deadline. Nested: PosixError of the last attempt.
class QEL_PROTOCOL_EXPORT CannotConnect : public Error {
public:
    using Error::Error;
    ~CannotConnect() override;
};

/// An endpoint cannot be listened on. Nested: PosixError.
class QEL_PROTOCOL_EXPORT CannotListen : public Error {
public:
    using Error::Error;
    ~CannotListen() override;
};

/// The hypervisor answered the request for TLS with the abort message: it takes no more consoles, is stopping, or does
/// not use TLS. Or it sent this message later: it accepts only TLS and the request came without, or it turned the
/// console away inside TLS.
class QEL_PROTOCOL_EXPORT TurnedAway : public Error {
public:
    using Error::Error;
    ~TurnedAway() override;
};

/// This end's own credentials cannot be used: a file does not hold what it should, others may read the key, certificate
/// and key do not belong together, or a certificate is expired or not yet valid.
class QEL_PROTOCOL_EXPORT CredentialsUnusable : public Error {
public:
    enum class Reason {
        Content,     ///< a file does not hold what it should, or certificate and key cannot be used together
        Permissions, ///< the key belongs to another user, or others may read or write its file
        Validity,    ///< a certificate is expired or not yet valid
    };

    explicit CredentialsUnusable(const std::string& what, Reason reason = Reason::Content);
    ~CredentialsUnusable() override;

    Reason getReason() const noexcept { return mReason; }

private:
    Reason mReason;
};

/// A certificate was not accepted.
class QEL_PROTOCOL_EXPORT CertificateRejected : public Error {
public:
    /// Whose certificate, and why.
    enum class Reason {
        OursByThem,     ///< the peer said with a TLS alert that it does not accept this end's certificate
        TheirsByUs,     ///< the root did not issue the peer's certificate, or it is not valid now
        NamePin,        ///< the peer's name is none of the pinned ones
        FingerprintPin, ///< the fingerprint of the peer's certificate is none of the pinned ones
    };

    CertificateRejected(Reason reason, const std::string& what, std::string peer = {});
    ~CertificateRejected() override;

    Reason getReason() const noexcept { return mReason; }

private:
    Reason mReason;
};

/// A deadline passed. what() says what was waited for. Over TLS the connection is closed if part of a message had
/// been transferred.
class QEL_PROTOCOL_EXPORT DeadlinePassed : public Error {
public:
    using Error::Error;
    ~DeadlinePassed() override;
};

/// The peer closed the connection, or the connection broke. A server of this library that refuses a console's
/// certificate closes the connection and says nothing, so a console sees that in the same way.
class QEL_PROTOCOL_EXPORT ClosedByPeer : public Error {
public:
    using Error::Error;
    ~ClosedByPeer() override;
};

/// The peer sent something that the protocol does not allow: a malformed message, or one that it must not send now.
class QEL_PROTOCOL_EXPORT ProtocolBroken : public Error {
public:
    using Error::Error;
    ~ProtocolBroken() override;
};

/// A limit of this library: too many requests are under way, or a session holds as much unread output as it may. The
/// connection is as good as before; go on when there is room again.
class QEL_PROTOCOL_EXPORT LimitReached : public Error {
public:
    using Error::Error;
    ~LimitReached() override;
};

/// A request was answered with a status other than zero.
class QEL_PROTOCOL_EXPORT StatusError : public Error {
public:
    /// @param response  whose status is not zero; copied
    StatusError(const QelMessage& response, std::string peer = {});
    ~StatusError() override;

    /// The response. Valid as long as a copy of this exception exists.
    const QelMessage& getResponse() const noexcept { return *mResponse; }
    QelMessageStatusCodes getStatus() const noexcept { return mResponse->getStatus(); }

private:
    std::shared_ptr<const QelMessage> mResponse;
};

/// The exception and its nested causes in one line, "outer: inner". For exceptions of any kind; what() of an Error is
/// complete by itself, so its causes are not repeated.
/// Thread safety: any thread. @throws std::bad_alloc
QEL_PROTOCOL_EXPORT std::string explain(const std::exception& error);

} // namespace qel::protocol
