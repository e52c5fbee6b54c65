#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLStream.hpp>
#include <qel/protocol/ProtocolExport.hpp>

#include <chrono>

/// @file
/// The steps from a TCP connection to a protected one. The console sends the upgrade message; the hypervisor end
/// answers with the same message, and both start TLS, or it answers with the abort message and closes.
///
/// Only these two messages travel in the clear. Messages in the clear are read one at a time and never ahead, so no
/// byte of TLS, or of what follows, is lost.
///
/// For programs with a loop of their own; Console and Server take these steps by themselves.
///
/// All functions throw DeadlinePassed when the stream's deadline passes, ClosedByPeer when the peer closes the
/// connection, ProtocolBroken when it sends anything else, and what is noted below. The caller closes the stream then.
///
/// Thread safety: one thread for each stream.

namespace qel::protocol {

/// Sets both deadlines of a stream to the time left until `end`, at least a millisecond. The time of a direction runs
/// from its next use, so call this right before.
QEL_PROTOCOL_EXPORT void limitTo(Stream& stream, std::chrono::steady_clock::time_point end);

/// The console's first step: asks for TLS and waits for the answer.
/// @param stream  not yet protected, with deadlines
/// @param descriptor  of the stream's socket; -1: a stream without a socket
/// @throws TurnedAway  the hypervisor end answers with the abort message
QEL_PROTOCOL_EXPORT void requestUpgrade(Stream& stream, int descriptor);

/// The hypervisor end's first step: waits for the console to ask for TLS. Answers any other message with the abort
/// message.
/// @param stream, descriptor  as for requestUpgrade()
QEL_PROTOCOL_EXPORT void awaitUpgrade(Stream& stream, int descriptor);

/// The hypervisor end's answers.
QEL_PROTOCOL_EXPORT void grantUpgrade(Stream& stream);
QEL_PROTOCOL_EXPORT void abortHandshake(Stream& stream);

/// Performs the TLS handshake.
/// @throws CertificateRejected  TheirsByUs: the peer's certificate is not accepted
QEL_PROTOCOL_EXPORT void startTls(SSLStream& stream);

} // namespace qel::protocol
