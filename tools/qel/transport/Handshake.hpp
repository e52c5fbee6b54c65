#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/security/SSLStream.hpp>

#include <chrono>

/// @file
/// The steps between a TCP connection and a protected one. The console asks for TLS with the upgrade message; the
/// hypervisor end answers with the same message, and then both start TLS; or it answers with the abort message and
/// closes. There is no other way on.
///
/// These two messages go in the clear, and nothing else does. What arrives in the clear is read message by message and
/// never ahead, so that none of it is left over for TLS or for what comes after it.
///
/// All of it throws CommandFailure with a text for people: DeadlinePassed when the stream's deadline passes,
/// ClosedByPeer when the other end goes, ProtocolBroken for what has no place here, Refused as said below. The caller
/// closes the stream then.

namespace qel::tool {

/// Gives both directions of a stream what is left of the time, a millisecond at least. The time of a direction runs
/// from its next use: call it right before.
void limitTo(Stream& stream, std::chrono::steady_clock::time_point end);

/// The console's first step: asks for TLS, and waits for the answer.
/// @param stream  in the clear, with deadlines
/// @param descriptor  of the stream's socket
/// @throws CommandFailure  Refused: the hypervisor end aborts
void requestUpgrade(Stream& stream, int descriptor);

/// The hypervisor end's first step: waits for the console to ask for TLS. Any other message is answered with the abort
/// message.
/// @param stream, descriptor  as for requestUpgrade()
void awaitUpgrade(Stream& stream, int descriptor);

/// The hypervisor end's answers.
void grantUpgrade(Stream& stream);
void abortHandshake(Stream& stream);

/// Does the TLS handshake.
/// @throws CommandFailure  Refused: the other end's certificate is not accepted
void startTls(SSLStream& stream);

} // namespace qel::tool
